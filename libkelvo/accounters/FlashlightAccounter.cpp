#include "accounters/FlashlightAccounter.h"

#include <vector>

#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SoleAllocator.h"

namespace kelvo {

FlashlightAccounter::FlashlightAccounter() : mPower(0) {
    std::vector<int32_t> values;
    if (PowerProfile::readSimple(PROFILE_FLASHLIGHT, &values) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    mPower = values[0];
}

std::unique_ptr<BaseAllocator> FlashlightAccounter::createAllocators(int32_t key) {
    auto allocator = std::make_unique<SoleAllocator<accounter_data>>(this);
    PowerProfile::setFixedPower(allocator.get(), mPower);
    return allocator;
}

} // namespace kelvo
