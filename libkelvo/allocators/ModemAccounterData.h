#pragma once

#include <binder/Parcel.h>
#include <stdint.h>

#include <limits>

#include "allocators/AccounterData.h"

namespace kelvo {

// Usage of the modem traffic allocator. The power description of a batch is
// int64 E (the data scenario's energy of the last block), int64 X (the
// interface's tx + rx packets); a batch entry carries, after name and
// foreground flag, int64 c1 (tx packets), c2 (rx packets), c3 (tx bytes),
// c4 (rx bytes). An application's energy is E * (c1 + c2) / X, 0 when X is
// below 1 or its traffic is negative or above X.
// Recorded per bucket: int64 c1, c2, c3, c4.
struct modem_accounter_data {
    int64_t counters[4] = {};
    int64_t dataEnergy = 0;
    int64_t totalTraffic = 0;

    int32_t fillContent(const android::Parcel& power) {
        return power.readInt64(&dataEnergy) == android::NO_ERROR &&
                       power.readInt64(&totalTraffic) == android::NO_ERROR
                   ? 0
                   : -1;
    }

    int32_t calculateEnergy(const android::Parcel& action, int64_t* energy) {
        *energy = 0;
        for (int64_t& counter : counters) {
            if (action.readInt64(&counter) != android::NO_ERROR) {
                return -1;
            }
        }
        const int64_t traffic = addSaturated(counters[0], counters[1]);
        if (totalTraffic >= 1 && traffic >= 0 && traffic <= totalTraffic) {
            // traffic <= X, so the quotient is at most E.
            *energy =
                static_cast<int64_t>(static_cast<__int128>(dataEnergy) * traffic / totalTraffic);
        }
        return 0;
    }

    modem_accounter_data& operator+=(const modem_accounter_data& other) {
        for (int32_t i = 0; i < 4; ++i) {
            counters[i] = addSaturated(counters[i], other.counters[i]);
        }
        return *this;
    }

    void writeToParcel(android::Parcel& out) const {
        for (int64_t counter : counters) {
            out.writeInt64(counter);
        }
    }
};

}  // namespace kelvo
