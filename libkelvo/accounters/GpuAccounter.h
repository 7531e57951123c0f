#pragma once

#include <stdint.h>

#include <map>
#include <memory>

#include <binder/Parcel.h>

#include "accounters/DataAccounter.h"

namespace kelvo {

// The GPU, charged to the foreground application: its one allocator (key 0)
// always holds the application in front. SetValue carries a reading: int64
// time, bool charger online, int32 count, then per frequency step int64
// frequency (Hz), int64 busy ms, int64 idle ms. Each step's power comes from
// the profile's frequency table (MHz, the nearest frequency when it is not
// listed), and the reading is charged once, at the next accounting step at
// its time (see gpu_accounter_data).
class GpuAccounter : public DataAccounter {
public:
    GpuAccounter();

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t getPowerValue(int32_t key, const android::Parcel& action,
                          android::Parcel& power) override;
    int32_t onActionForeground(const android::Parcel& action) override;

private:
    int32_t frequencyPower(int64_t hertz) const;

    // By frequency in MHz.
    std::map<int64_t, int32_t> mPowers;
};

} // namespace kelvo
