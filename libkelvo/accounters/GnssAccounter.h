#pragma once

#include <stdint.h>

#include <memory>

#include "accounters/DataAccounter.h"

namespace kelvo {

// GNSS: every application with a running request is charged the whole time
// and an equal share of the receiver's power.
// Activate and Deactivate name the application (no allocator key fields);
// the power is the profile's one value, fixed.
class GnssAccounter : public DataAccounter {
public:
    GnssAccounter();

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;

private:
    int32_t mPower;
};

} // namespace kelvo
