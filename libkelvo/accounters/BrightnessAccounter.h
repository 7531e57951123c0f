#pragma once

#include <stdint.h>

#include <atomic>
#include <memory>

#include <binder/Parcel.h>

#include "accounters/DataAccounter.h"

namespace kelvo {

// The backlight, charged to the foreground application: its one allocator
// (key 0) always holds the application in front. SetValue carries int64
// time, int32 level; the power of a level above 0 is (intercept + slope x
// level) / factor, where the factor is 100, or 10000 under the display's
// accounting policy 2. The policy the display handler actually runs with
// decides; until it says, the configured one does.
class BrightnessAccounter : public DataAccounter {
public:
    // The level assumed until the first SetValue.
    static constexpr int32_t kInitialLevel = 128;
    static constexpr int32_t kPolicyPercent = 1;
    static constexpr int32_t kPolicyPerTenThousand = 2;

    BrightnessAccounter();

    // The display handler's effective policy (1 or 2); it applies to the
    // powers computed from now on. -1 for any other policy.
    int32_t setEffectivePolicy(int32_t policy);

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t getPowerValue(int32_t key, const android::Parcel& action,
                          android::Parcel& power) override;
    int32_t onActionForeground(const android::Parcel& action) override;

private:
    void loadConfiguration();
    int64_t factor() const;
    int32_t levelPower(int32_t level) const;

    int64_t mSlope;
    int64_t mIntercept;
    int32_t mConfiguredPolicy;
    // -1 until the display handler sets it.
    std::atomic<int32_t> mEffectivePolicy;
};

} // namespace kelvo
