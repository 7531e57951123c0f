#pragma once

#include <binder/Parcel.h>
#include <stdint.h>

#include <map>
#include <memory>

#include "accounters/DataAccounter.h"

namespace kelvo {

// The modem, charged from measured residencies: the time each module spent
// at each signal or transmit level, per scenario (idle, voice, data), times
// the power of that level gives the energy of the module in the scenario.
// The residencies add up until a balance reports them as the modem's
// component record. The data scenario's energy is split among applications
// by their packets through a traffic allocator (key 0).
//
// Every action after SetValue carries a modem subtype (ModemSubtype).
//
// Component record: bool charger online, then per scenario idle, voice,
// data: int32 code (1, 0, 2: the subtype that fed it), int32 module count,
// per module in ascending order int64 start, int64 end, int32 module, int64
// usage, int64 energy.
class ModemAccounter : public DataAccounter {
public:
    static constexpr int32_t kTrafficKey = 0;
    // Power modes, tables per mode (by key) and powers per table.
    static constexpr int32_t kModes = 6;
    static constexpr int32_t kTables = 3;
    static constexpr int32_t kLevels = 10;
    // Most levels one residency may carry.
    static constexpr int32_t kMaxLevelCount = 9;
    static constexpr int32_t kMaxModule = 11;
    static constexpr int32_t kScenarios = 3;

    ModemAccounter();

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t onActionBalance(const android::Parcel& action) override;
    // Modem values carry no time: they belong to the block being read.
    int32_t onActionSetValue(const android::Parcel& action) override;

private:
    struct residency {
        int64_t usage = 0;
        int64_t energy = 0;
    };

    void readProfile();
    int32_t accountModule(int32_t scenario, const android::Parcel& action);
    int32_t setInterfaceTraffic(const android::Parcel& action);
    int32_t setBatch(const android::Parcel& action);
    void writeComponentRecord(android::Parcel& reply, int64_t end) const;

    int64_t mLastBalance;
    int64_t mTotalTraffic;  // X
    int64_t mDataEnergy;    // E
    std::map<int32_t, residency> mResidency[kScenarios];

    // Powers by mode, table key and level; a level past the configured
    // powers has 0.
    int32_t mPower[kModes][kTables][kLevels];
    int32_t mSpecialPower;  // Px, every level of module 11
};

}  // namespace kelvo
