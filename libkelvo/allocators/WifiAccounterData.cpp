#include "allocators/WifiAccounterData.h"

#include <string.h>

#include <algorithm>
#include <limits>

#include "HealthCounters.h"
#include "allocators/AccounterData.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

namespace {

constexpr int64_t kInt64Max = std::numeric_limits<int64_t>::max();
constexpr int64_t kInt64Min = std::numeric_limits<int64_t>::min();

int64_t clampToInt64(__int128 value) {
    if (value > kInt64Max || value < kInt64Min) {
        HealthCounters::add(Health::ValuesSaturated);
        return value > 0 ? kInt64Max : kInt64Min;
    }
    return static_cast<int64_t>(value);
}

// Truncated toward zero; values beyond int64 are kept at its bounds.
int64_t truncateToInt64(double value) {
    // 2^63 is exactly representable; anything at or above it does not fit.
    constexpr double kLimit = 9223372036854775808.0;
    if (value >= kLimit || value < -kLimit) {
        HealthCounters::add(Health::ValuesSaturated);
        return value > 0 ? kInt64Max : kInt64Min;
    }
    return static_cast<int64_t>(value);
}

// Σ wi × (a × Pa[i] + b × Pb[i]) with wi = Li / (L × 1000) in single
// precision; the running sum is truncated after each level. `exact` gets
// the same sum untruncated.
int64_t weightedEnergy(const wifi_power_description& d, int64_t levelTotal, int64_t a, int64_t b,
                       double* exact) {
    const float scale = static_cast<float>(levelTotal) * 1000.0f;
    int64_t sum = 0;
    double whole = 0;
    for (int32_t i = 0; i < kWifiLevels; ++i) {
        const float weight = static_cast<float>(d.levelTime[i]) / scale;
        const double packets =
            static_cast<double>(a) * d.txPower[i] + static_cast<double>(b) * d.rxPower[i];
        sum = truncateToInt64(static_cast<double>(sum) + static_cast<double>(weight) * packets);
        whole += static_cast<double>(weight) * packets;
    }
    *exact = whole;
    return sum;
}

// The description of the batch being read, with what follows from it alone.
// A batch runs on its accounter's thread from its first entry to its last.
struct batch_description {
    uint8_t bytes[128] = {};
    size_t size = 0;
    bool valid = false;
    wifi_power_description d;
    int64_t levelTotal = 0;    // L, each level at least 0
    double totalExact = 0;     // Et, not truncated
    int64_t totalPackets = 0;  // T1 + T2
};

thread_local batch_description tBatch;

}  // namespace

int32_t wifi_power_description::readFrom(const Parcel& power) {
    if (power.readInt32(&subtype) != NO_ERROR) {
        return -1;
    }
    if (subtype == WIFI_SCANS) {
        return power.readInt32(&scanPower) == NO_ERROR ? 0 : -1;
    }
    if (subtype != WIFI_PACKAGE_TRAFFIC) {
        return -1;
    }
    if (power.readInt64(&totals[0]) != NO_ERROR || power.readInt64(&totals[1]) != NO_ERROR ||
        power.readInt32(&bandPower) != NO_ERROR) {
        return -1;
    }
    for (int32_t i = 0; i < kWifiLevels; ++i) {
        if (power.readInt32(&txPower[i]) != NO_ERROR || power.readInt32(&rxPower[i]) != NO_ERROR ||
            power.readInt64(&levelTime[i]) != NO_ERROR) {
            return -1;
        }
    }
    return 0;
}

int32_t wifi_accounter_data::fillContent(const Parcel& power) {
    batch_description& b = tBatch;
    const size_t size = power.dataSize();
    // Every entry of a batch brings the same description: read it once.
    if (b.valid && size == b.size && memcmp(power.data(), b.bytes, size) == 0) {
        return 0;
    }
    b.valid = false;
    b.d = wifi_power_description();
    if (size > sizeof(b.bytes) || b.d.readFrom(power) < 0) {
        return -1;
    }
    memcpy(b.bytes, power.data(), size);
    b.size = size;
    b.levelTotal = 0;
    for (int64_t time : b.d.levelTime) {
        b.levelTotal = addSaturated(b.levelTotal, std::max<int64_t>(time, 0));
    }
    b.totalExact = 0;
    if (b.levelTotal >= 1 && b.levelTotal <= kWifiMaxLevelTime) {
        weightedEnergy(b.d, b.levelTotal, b.d.totals[0], b.d.totals[1], &b.totalExact);
    }
    b.totalPackets =
        addSaturated(std::max<int64_t>(b.d.totals[0], 0), std::max<int64_t>(b.d.totals[1], 0));
    b.valid = true;
    return 0;
}

int32_t wifi_accounter_data::calculateEnergy(const Parcel& action, int64_t* energy) {
    *energy = 0;
    const batch_description& b = tBatch;
    if (!b.valid) {
        return -1;
    }
    if (b.d.subtype == WIFI_SCANS) {
        int32_t count = 0;
        if (action.readInt32(&count) != NO_ERROR) {
            return -1;
        }
        if (count >= 1) {
            *energy = static_cast<int64_t>(b.d.scanPower) * count;
        }
        return 0;
    }
    int64_t x = 0;
    int64_t y = 0;
    if (action.readInt64(&x) != NO_ERROR || action.readInt64(&y) != NO_ERROR ||
        action.readInt64(&txBytes) != NO_ERROR || action.readInt64(&rxBytes) != NO_ERROR) {
        return -1;
    }
    *energy = trafficEnergy(x, y);
    return 0;
}

int64_t wifi_accounter_data::trafficEnergy(int64_t x, int64_t y) {
    const batch_description& b = tBatch;
    const wifi_power_description& d = b.d;
    share = 0;
    // Counters never run backwards; a negative one carries no traffic.
    x = std::max<int64_t>(x, 0);
    y = std::max<int64_t>(y, 0);
    const int64_t levelTotal = b.levelTotal;
    if (levelTotal < 1 || levelTotal > kWifiMaxLevelTime) {
        // No usable level times: the weakest level's powers, per hundred.
        const __int128 sum = static_cast<__int128>(x) * d.txPower[kWifiLevels - 1] +
                             static_cast<__int128>(y) * d.rxPower[kWifiLevels - 1];
        return clampToInt64(sum / 100);
    }
    double exact = 0;
    int64_t energy = weightedEnergy(d, levelTotal, x, y, &exact);
    if (b.totalExact > 0) {
        // The band's fixed power in proportion to the application's part of
        // the interface's traffic energy; a part read a little after the
        // totals is held at the whole. The parts are taken before the
        // traffic energies are truncated to whole units: otherwise light
        // users (below one unit) would get nothing and the fixed power of a
        // quiet poll would be lost altogether.
        const double part = std::min(std::max(exact, 0.0), b.totalExact);
        const double fixed = static_cast<double>(levelTotal) * d.bandPower / 1000.0 * part /
                             b.totalExact;
        energy = clampToInt64(static_cast<__int128>(energy) + truncateToInt64(fixed));
    }
    if (b.totalPackets >= 1) {
        const int64_t packets = std::min(addSaturated(x, y), b.totalPackets);
        share = static_cast<int32_t>(static_cast<__int128>(levelTotal) * packets / b.totalPackets);
    }
    return energy;
}

wifi_accounter_data& wifi_accounter_data::operator+=(const wifi_accounter_data& other) {
    share = addSaturated(share, other.share);
    txBytes = addSaturated(txBytes, other.txBytes);
    rxBytes = addSaturated(rxBytes, other.rxBytes);
    return *this;
}

void wifi_accounter_data::writeToParcel(Parcel& out) const {
    out.writeInt32(share);
    out.writeInt64(txBytes);
    out.writeInt64(rxBytes);
}

}  // namespace kelvo
