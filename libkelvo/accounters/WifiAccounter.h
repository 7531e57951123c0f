#pragma once

#include <binder/Parcel.h>
#include <stdint.h>

#include <memory>

#include "accounters/DataAccounter.h"
#include "allocators/WifiAccounterData.h"

namespace kelvo {

// Wi-Fi, charged two ways: the hotspot holds the radio at a fixed power
// (allocator key 0, one element), and applications are charged per batch of
// traffic or scans (allocator key 1), the traffic weighted by the time the
// link spent at each signal level on the current band. Every action carries
// a Wi-Fi subtype (WifiSubtype) after its code.
//
// Between batches the accounter keeps the band, the interface totals and the
// level times; the totals and level times add up over the readings until a
// traffic batch consumes them, so a reading without package traffic loses
// nothing. The band, totals, level times and charger state never go through
// an allocator.
//
// Records open with the key of their allocator: 0 for the hotspot, 1 (then a
// count) for the applications.
class WifiAccounter : public DataAccounter {
public:
    static constexpr int32_t kHotspotKey = 0;
    static constexpr int32_t kTrafficKey = 1;

    WifiAccounter();

    void prepareReply(android::Parcel& reply) override;

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t getAllocatorKey(const android::Parcel& action) override;
    int32_t onActionDeactivateAll(const android::Parcel& action) override;
    int32_t onActionSetValue(const android::Parcel& action) override;

private:
    void readProfile();
    // The key a subtype names; -1 for an unknown subtype, the remembered key
    // for subtypes that name none.
    int32_t keyOfSubtype(int32_t subtype) const;
    int32_t addTotals(const android::Parcel& action);
    int32_t setBand(const android::Parcel& action);
    int32_t addLevelTimes(const android::Parcel& action);
    int32_t setBatch(int32_t subtype, const android::Parcel& action);

    // The key of the last Activate or Deactivate, -1 before the first.
    int32_t mReplyKey;
    int32_t mBand;                     // 0 or 1
    int64_t mTotals[2];                // tx and rx packets of the interface
    int64_t mLevelTimes[kWifiLevels];  // ms at each signal level

    int32_t mHotspotPower;             // P0
    int32_t mScanPower;                // P3
    int32_t mBandPower[2];             // P4 by band
    int32_t mTxPower[2][kWifiLevels];  // P1 by band and level
    int32_t mRxPower[2][kWifiLevels];  // P2 by band and level
};

}  // namespace kelvo
