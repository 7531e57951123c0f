#pragma once

#include <stdint.h>

#include <binder/Parcel.h>

#include "allocators/AccounterData.h"
#include "allocators/BaseAllocator.h"

namespace kelvo {

// Splits the CPU's energy among applications by their CPU time. It keeps no
// elements; each SetValue brings the component's usage and energy and the
// applications' CPU times of one interval.
class WeightAllocator : public BaseAllocator {
public:
    explicit WeightAllocator(DataAccounter* owner);

    // power: bool has data; with data int64 start, int64 end, int32 total
    // usage, int64 total energy. action: the application batch, int64 total
    // application usage, then per application int32 uid, String8 name, int32
    // usage until the end of the parcel. Sends the component record (event 1)
    // and then the application records (event 0).
    int32_t setPowerValue(const android::Parcel& action, const android::Parcel& power) override;

private:
    // Fills the application reply and the foreground sums. -1 on a batch
    // that cannot be split; 1 when it ended inside an application (the
    // applications before it are in the reply); 0 otherwise.
    int32_t getApplicationData(const android::Parcel& action, int64_t start, int64_t end,
                               int64_t totalEnergy, android::Parcel& reply);

    int32_t mForegroundUsage;
    int64_t mForegroundEnergy;
    int32_t mTotalUsage;
    int64_t mTotalEnergy;
};

} // namespace kelvo
