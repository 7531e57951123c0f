#include "accounters/BluetoothAccounter.h"

#include <vector>

#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SharedAllocator.h"
#include "allocators/SoleAllocator.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

BluetoothAccounter::BluetoothAccounter() : mReplyKey(0) {
    std::vector<config_parameter> parameters;
    if (PowerProfile::readGrouped(PROFILE_BLUETOOTH, -1, false, &parameters) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    for (const config_parameter& parameter : parameters) {
        if (!parameter.values.empty()) {
            mPowers.emplace(parameter.id, parameter.values[0].value);
        }
    }
}

void BluetoothAccounter::prepareReply(Parcel& reply) {
    reply.writeInt32(mReplyKey);
}

std::unique_ptr<BaseAllocator> BluetoothAccounter::createAllocators(int32_t key) {
    if (mAllocators.size() >= kMaxKeys) {
        LLOGE("Too many bluetooth kinds: %zu, refused: %d", mAllocators.size(), key);
        HealthCounters::add(Health::AccounterStateCapped);
        return nullptr;
    }
    int32_t power = 0;
    auto it = mPowers.find(key);
    if (it != mPowers.end()) {
        power = it->second;
    } else {
        LLOGE("Get power profile failed");
    }
    std::unique_ptr<BaseAllocator> allocator;
    if (key == kSharedKey) {
        allocator = std::make_unique<SharedAllocator<accounter_data>>(this);
    } else {
        allocator = std::make_unique<SoleAllocator<accounter_data>>(this);
    }
    PowerProfile::setFixedPower(allocator.get(), power);
    return allocator;
}

int32_t BluetoothAccounter::getAllocatorKey(const Parcel& action) {
    int32_t key = -1;
    if (action.readInt32(&key) != NO_ERROR) {
        return -1;
    }
    mReplyKey = key;
    return key;
}

// Every activity's records carry that activity's key.
int32_t BluetoothAccounter::onActionDeactivateAll(const Parcel& action) {
    int64_t timestamp = 0;
    if (action.readInt64(&timestamp) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    const int32_t lastKey = mReplyKey;
    for (auto& entry : mAllocators) {
        mReplyKey = entry.first;
        if (entry.second->removeAllElements(timestamp) < 0) {
            LLOGE("Failed to remove all elements");
        }
    }
    mReplyKey = lastKey;
    return 0;
}

} // namespace kelvo
