#pragma once

#include <binder/Parcel.h>
#include <stdint.h>

#include <array>
#include <map>

#include "accounters/DataAccounter.h"

namespace kelvo {

// The system-on-chip's IP blocks, from the power monitor's per-block times.
// Each block's energy is linear in its four times (off, busy, busy at low
// voltage, idle) with the profile's four coefficients of the block:
// (m1 x C1 + m2 x C2 + m3 x C3 + m4 x C4) / 1000. No allocators: every
// SetValue is answered at once with the component record.
//
// SetValue: int64 start, int64 end, bool charging, int32 count, then per
// block int32 id and the four int64 times. The component record: int32
// count, then per block int64 start, int64 end, int32 id, the four times,
// int64 discharge energy, int64 charge energy (the one not spent is 0).
class DpmAccounter : public DataAccounter {
public:
    DpmAccounter();

    // 0 for a block without coefficients; a product or sum past int64 is
    // clamped (and counted).
    int64_t blockEnergy(int32_t id, const std::array<int64_t, 4>& times) const;

protected:
    int32_t onActionSetValue(const android::Parcel& action) override;

private:
    std::map<int32_t, std::array<int64_t, 4>> mCoefficients;
};

}  // namespace kelvo
