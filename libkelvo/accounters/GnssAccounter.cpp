#include "accounters/GnssAccounter.h"

#include <vector>

#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SharedAllocator.h"

namespace kelvo {

GnssAccounter::GnssAccounter() : mPower(0) {
    std::vector<int32_t> values;
    if (PowerProfile::readSimple(PROFILE_GNSS, &values) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    mPower = values[0];
}

std::unique_ptr<BaseAllocator> GnssAccounter::createAllocators(int32_t key) {
    auto allocator = std::make_unique<SharedAllocator<accounter_data>>(this);
    PowerProfile::setFixedPower(allocator.get(), mPower);
    return allocator;
}

} // namespace kelvo
