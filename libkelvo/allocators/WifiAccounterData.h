#pragma once

#include <binder/Parcel.h>
#include <stdint.h>

#include "AccounterTypes.h"

namespace kelvo {

// Signal levels weighted in a traffic batch.
constexpr int32_t kWifiLevels = 4;
// Most level time (ms) a batch is weighted by; with more, or none, the
// batch is charged at the weakest level's powers.
constexpr int64_t kWifiMaxLevelTime = 660000;

// The power description of a Wi-Fi batch, one of:
//   traffic  int32 1, int64 T1 (tx packets of the interface), int64 T2 (rx
//            packets), int32 P4 (the band's fixed power), then per level i
//            in 0..3: int32 P1[i] (per tx packet), int32 P2[i] (per rx
//            packet), int64 Li (time at that level, ms)
//   scans    int32 3, int32 P3 (per scan)
struct wifi_power_description {
    int32_t subtype = 0;
    int64_t totals[2] = {};
    int32_t bandPower = 0;
    int32_t txPower[kWifiLevels] = {};
    int32_t rxPower[kWifiLevels] = {};
    int64_t levelTime[kWifiLevels] = {};
    int32_t scanPower = 0;

    int32_t readFrom(const android::Parcel& power);
};

// Usage of the Wi-Fi traffic allocator. Batch entries carry, after name and
// foreground flag:
//   traffic  int64 x (tx packets), int64 y (rx packets), int64 A (tx bytes),
//            int64 B (rx bytes)
//   scans    int32 count
// Recorded per bucket: int32 share of the level time, int64 A, int64 B.
//
// The allocator hands every entry of a batch the same description; it is
// read once per batch into a slot of the accounter's thread, so the records
// (5000 applications of six buckets each) hold only their counters.
struct wifi_accounter_data {
    int32_t share = 0;
    int64_t txBytes = 0;
    int64_t rxBytes = 0;

    int32_t fillContent(const android::Parcel& power);
    int32_t calculateEnergy(const android::Parcel& action, int64_t* energy);
    wifi_accounter_data& operator+=(const wifi_accounter_data& other);
    void writeToParcel(android::Parcel& out) const;

    // The energy of x tx and y rx packets under the batch's traffic
    // description; sets the share of the level time.
    int64_t trafficEnergy(int64_t x, int64_t y);
};

}  // namespace kelvo
