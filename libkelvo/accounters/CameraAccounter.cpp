#include "accounters/CameraAccounter.h"

#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SoleAllocator.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

namespace {

// int32 camera index, int32 a, int32 b.
constexpr size_t kEntrySize = 3 * sizeof(int32_t);

struct camera_entry {
    int32_t camera;
    int32_t a;
    int32_t b;
};

} // namespace

CameraAccounter::CameraAccounter() : mLastCamera(0) {
    std::vector<config_parameter> parameters;
    if (PowerProfile::readGrouped(PROFILE_CAMERA, -1, true, &parameters) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    for (const config_parameter& parameter : parameters) {
        std::map<int64_t, int32_t> sizes;
        for (const config_value& value : parameter.values) {
            sizes.emplace(value.key, value.value); // the first of a key stays
        }
        mCameras.push_back(std::move(sizes));
    }
}

void CameraAccounter::prepareReply(Parcel& reply) {
    reply.writeInt32(mLastCamera);
}

int32_t CameraAccounter::getBalanceKey(int32_t key) const {
    return mLastCamera;
}

std::unique_ptr<BaseAllocator> CameraAccounter::createAllocators(int32_t key) {
    auto allocator = std::make_unique<SoleAllocator<accounter_data>>(this);
    PowerProfile::setFixedPower(allocator.get(), 0);
    return allocator;
}

int32_t CameraAccounter::getPowerValue(int32_t key, const Parcel& action, Parcel& power) {
    int64_t timestamp = 0;
    int32_t count = 0;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readInt32(&count) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (count < 0 || static_cast<size_t>(count) > action.dataAvail() / kEntrySize) {
        LLOGE("Invalid camera count: %d, data left: %zu", count, action.dataAvail());
        return -1;
    }
    std::vector<camera_entry> entries(count);
    for (camera_entry& entry : entries) {
        if (action.readInt32(&entry.camera) != NO_ERROR || action.readInt32(&entry.a) != NO_ERROR ||
            action.readInt32(&entry.b) != NO_ERROR) {
            return -1;
        }
    }
    int64_t total = 0;
    for (const camera_entry& entry : entries) {
        // A camera the profile does not list draws nothing.
        if (entry.camera < 0 || static_cast<size_t>(entry.camera) >= mCameras.size()) {
            continue;
        }
        bool exact = false;
        const int64_t size = static_cast<int64_t>(entry.a) * entry.b;
        total += PowerProfile::nearestPower(mCameras[entry.camera], size, &exact);
    }
    if (!entries.empty()) {
        mLastCamera = entries.back().camera;
    }
    power.writeInt64(timestamp);
    power.writeInt32(PowerProfile::clampPower(total));
    return 0;
}

} // namespace kelvo
