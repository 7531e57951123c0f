#include "accounters/BrightnessAccounter.h"

#include <vector>

#include "KelvoLibEntry.h"
#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SoleAllocator.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

namespace {

constexpr int32_t kPolicyUnset = -1;
constexpr int32_t kBacklightKey = 0;

} // namespace

BrightnessAccounter::BrightnessAccounter()
    : mSlope(0), mIntercept(0), mConfiguredPolicy(kPolicyPercent),
      mEffectivePolicy(kPolicyUnset) {
    loadConfiguration();
}

void BrightnessAccounter::loadConfiguration() {
    std::vector<int32_t> values;
    if (PowerProfile::readSimple(PROFILE_SCREEN_BRIGHTNESS, &values) < 0 || values.size() < 2) {
        LLOGE("Failed to get power config");
    } else {
        mSlope = values[0];
        mIntercept = values[1];
    }
    int32_t policy = 0;
    if (PowerProfile::readPolicy(POLICY_DISPLAY, &policy) < 0) {
        LLOGE("Failed to get energy accounting policy");
    } else if (policy == kPolicyPercent || policy == kPolicyPerTenThousand) {
        mConfiguredPolicy = policy;
    } else {
        LLOGE("Unknown policy: %d", policy);
    }
}

int32_t BrightnessAccounter::setEffectivePolicy(int32_t policy) {
    if (policy != kPolicyPercent && policy != kPolicyPerTenThousand) {
        LLOGE("Unknown policy: %d", policy);
        return -1;
    }
    mEffectivePolicy.store(policy);
    return 0;
}

int64_t BrightnessAccounter::factor() const {
    int32_t policy = mEffectivePolicy.load();
    if (policy == kPolicyUnset) {
        policy = mConfiguredPolicy;
    }
    return policy == kPolicyPerTenThousand ? 10000 : 100;
}

int32_t BrightnessAccounter::levelPower(int32_t level) const {
    if (level == 0) {
        return 0;
    }
    return PowerProfile::clampPower((mIntercept + mSlope * level) / factor());
}

std::unique_ptr<BaseAllocator> BrightnessAccounter::createAllocators(int32_t key) {
    auto allocator = std::make_unique<SoleAllocator<accounter_data>>(this);
    PowerProfile::setFixedPower(allocator.get(), levelPower(kInitialLevel));
    return allocator;
}

int32_t BrightnessAccounter::getPowerValue(int32_t key, const Parcel& action, Parcel& power) {
    int64_t timestamp = 0;
    int32_t level = 0;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readInt32(&level) != NO_ERROR ||
        level < 0) {
        LLOGE("Invalid parameter");
        return -1;
    }
    power.writeInt64(timestamp);
    power.writeInt32(levelPower(level));
    return 0;
}

int32_t BrightnessAccounter::onActionForeground(const Parcel& action) {
    return moveForegroundElement(kBacklightKey, action);
}

} // namespace kelvo
