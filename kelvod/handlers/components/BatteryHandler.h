#pragma once

#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/String8.h>

#include "core/KelvoOperator.h"

namespace kelvo {

// What the battery really delivered, beside what the accounters estimate. At
// every change of charger, screen and level (and at the hour, the day, a
// clock change, a forced balance and shut-down) it samples the fuel gauge and
// closes the span since the last sample: charge (mAh) and level (%) used
// while discharging or gained while charging, screen on or off. The hour's
// discharge is the measured side of the energy compensation; level and
// capacity drops go to the abnormality routine.
//
// The power-supply files come in two layouts: "Battery" in mAh and mA with a
// brand, or "battery" in µAh and µA without one, whose remaining charge is
// derived from the level. A value that cannot be read keeps the last good
// one: an error code never enters a span, a sum or an upload.
class BatteryHandler : public KelvoOperator {
public:
    static constexpr uint32_t kElector = 0x40;
    static constexpr const char* kUpperPath = "/sys/class/power_supply/Battery";
    static constexpr const char* kLowerPath = "/sys/class/power_supply/battery";
    // Requests to the abnormality routine.
    static constexpr int32_t kCapacityDecrease = 0;
    static constexpr int32_t kLevelDecrease = 1;
    // The daily miscellaneous record of the system handler.
    static constexpr int32_t kSystemMiscData = 2;
    static constexpr const char* kUnknownBrand = "Unknown";

    enum candidate : int32_t {
        CANDIDATE_HOURLY_TICK = 1,
        CANDIDATE_COMPONENT_ACCOUNTING = 3,
        CANDIDATE_HOURLY_UPLOAD = 4,
        CANDIDATE_DAILY_TICK = 5,
        CANDIDATE_DAILY_UPLOAD = 6,
        CANDIDATE_DIFF_DAY_REBOOT = 7,
        CANDIDATE_DAWN_UPLOAD = 8,
    };

    struct battery_state {
        int64_t timestamp;
        int32_t gasGauge;  // mAh
        int32_t level;     // %
        int32_t voltage;
        int32_t temperature;
        bool charge;
        bool screen;
    };

    BatteryHandler();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    int32_t checkEnable() override;
    void setupListeners(android::Parcel& out) override;
    void setCandidateElector() override;
    void dump(android::String8& out) override;
    int32_t onChargerOnlineChanged(const android::Parcel& data) override;
    int32_t onBatteryLevelChanged(const android::Parcel& data) override;
    int32_t onScreenStateChanged(const android::Parcel& data) override;
    int32_t onHourlyTick(const android::Parcel& data) override;
    int32_t onDailyTick(const android::Parcel& data) override;
    int32_t onTimeChanged(const android::Parcel& data) override;
    int32_t onForceBalance(const android::Parcel& data) override;
    int32_t onShutDown(const android::Parcel& data) override;
    int32_t onDiffDayReboot(const android::Parcel& data) override;
    int32_t onHourlyUploading(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t onDawnUploading(const android::Parcel& data) override;
    int32_t logComponentAccounting(int64_t time) override;

private:
    // The gas gauge tolerance of a full capacity: a discharging span whose
    // charge rose by less than this much is noise.
    static int32_t toleranceOf(int32_t fullCapacity);

    // One power-supply value: 0, -2 (no number) or -14 (no file, no line).
    int32_t readValue(const char* file, int32_t* out) const;
    // Refreshes the full capacity and the tolerance; on failure both keep
    // their last good values. The capacity, or a negative code.
    int32_t refreshFullCapacity();
    // The remaining charge in mAh, or a negative code.
    int32_t readGasGauge(int32_t* out);
    int32_t readLevel(int32_t* out) const;
    void refreshChargeCount();
    // The current (mA); the last good one when it cannot be read.
    int32_t readCurrent();
    android::String8 readBrand() const;
    // Counts a value that could not be read (its last good value stays).
    void readFailed(const char* what, int32_t ret) const;

    // A new state: the previous one with the gauge read now, at time t.
    battery_state begin(int64_t t);
    // Records the span to the new state (once the platform has reported the
    // battery) and makes it the previous one.
    void commit(const battery_state& next);
    void recordSpan(const battery_state& from, const battery_state& to);
    void checkCapacity(int32_t level, int32_t temperature);
    void checkLevel(int32_t level, int32_t voltage, int32_t temperature);
    int32_t sendDailyMisc(int64_t time);
    int32_t uploadTotals(uint32_t event, int64_t end, int64_t window);
    int32_t uploadDailyStatistics(int64_t end, int64_t window);
    int32_t onRefresh(int64_t time, int32_t candidate);
    int32_t onPeriodUploading(const android::Parcel& data, uint32_t event, int64_t window,
                              int32_t candidate, const char* what);

    battery_state mPrevious;
    android::String8 mPath;
    int32_t mUnit;
    int32_t mTolerance;
    int32_t mFullCapacity;
    int32_t mChargeCount;
    int32_t mLastCurrent;
    // The capacity seen at the previous full charge.
    int32_t mLastFullCapacity;
};

}  // namespace kelvo
