#pragma once

#include <stdint.h>

#include <map>
#include <vector>

#include "allocators/BaseAllocator.h"
#include "utils/XmlParser.h"

namespace kelvo {

// The accounters' reads of the configuration: their part of the power
// profile and the policies that change how a power is scaled. A failed read
// leaves the output empty (or untouched) and returns -1; the accounter then
// works with powers of 0 and its defaults.
class PowerProfile {
public:
    // The values of a simple profile component, in document order.
    static int32_t readSimple(int32_t component, std::vector<int32_t>* values);
    // The parameters of a grouped profile component: every parameter when
    // parameter is -1, else that one alone.
    static int32_t readGrouped(int32_t component, int32_t parameter, bool keyed,
                               std::vector<config_parameter>* parameters);
    // The first value of a component policy.
    static int32_t readPolicy(int32_t component, int32_t* policy);

    // A power computed in 64 bits, kept as the int32 the descriptions carry;
    // a clamped value is counted.
    static int32_t clampPower(int64_t power);
    // The power of the key nearest to key (the smaller key on a tie); 0 for
    // an empty table. exact tells whether the key itself was there.
    static int32_t nearestPower(const std::map<int64_t, int32_t>& table, int64_t key,
                                bool* exact);
    // Gives an allocator a power that never changes: the description int64
    // 0, int32 power.
    static int32_t setFixedPower(BaseAllocator* allocator, int32_t power);
};

} // namespace kelvo
