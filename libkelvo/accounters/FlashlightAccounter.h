#pragma once

#include <stdint.h>

#include <memory>

#include "accounters/DataAccounter.h"

namespace kelvo {

// The flashlight: one user at a time is charged the torch's power.
// Activate and Deactivate name the application (no allocator key fields);
// the power is the profile's one value, fixed.
class FlashlightAccounter : public DataAccounter {
public:
    FlashlightAccounter();

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;

private:
    int32_t mPower;
};

} // namespace kelvo
