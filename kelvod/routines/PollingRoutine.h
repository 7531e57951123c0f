#pragma once

#include <stdint.h>

#include <atomic>

#include <binder/Parcel.h>
#include <utils/StrongPointer.h>

#include "core/KelvoOperator.h"
#include "routines/PollingPayload.h"
#include "utils/TimerCallback.h"

namespace kelvo {

// Decides when every operator reads its polled counters: it sends the
// data-polling notification periodically, on battery-level changes, at each
// hourly tick, on clock changes, thermal abnormalities, forced balances,
// charger changes and at shut-down. Periodic and battery-level polls are left
// out close to the full hour and when the previous poll is too recent. Every
// poll is recorded in debug_data_polling.
class PollingRoutine : public KelvoOperator {
public:
    static constexpr int64_t kDefaultPeriodMs = 600000;
    static constexpr int64_t kDefaultMinIntervalMs = 300000;
    // The settings are accepted within [floor, kMaxSettingMs]; the floor is
    // kSettingFloorMs unless a test shortened it.
    static constexpr int64_t kSettingFloorMs = 60000;
    static constexpr int64_t kMaxSettingMs = 86400000;
    // Polls closer than this to the hourly tick (either side) are left out.
    static constexpr int64_t kNearHourMs = 60000;
    // The id of the polling timer's MESSAGE_TIMER messages.
    static constexpr int32_t kPollingTimerId = 0;
    // Request code of the hourly routine: int64 last tick, int64 ms until its
    // timer fires.
    static constexpr int32_t kHourlyOffsetRequest = 2;

    static constexpr const char* kPeriodProperty = "persist.polling.timer.duration";
    static constexpr const char* kMinIntervalProperty = "persist.polling.interval.min";

    // Reads the settings; the timer starts with initialize().
    PollingRoutine();
    // Removes its timer: the manager keeps a timer until told.
    ~PollingRoutine() override;

    int64_t getPeriodMs() const { return mPeriodMs; }
    int64_t getMinIntervalMs() const { return mMinIntervalMs; }
    // The polling timer (dump and tests).
    const android::sp<TimerCallback>& getTimer() const { return mTimer; }

    // Lowers the settings' floor so a test can run short periods; 0 or less
    // restores kSettingFloorMs. Read when a routine is made.
    static void setSettingFloorForTest(int64_t ms);

    void onFirstRef() override;
    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void dump(android::String8& out) override;

    int32_t lateInitialize() override;
    void setupListeners(android::Parcel& out) override;
    int32_t onChargerOnlineChanged(const android::Parcel& data) override;
    int32_t onBatteryLevelChanged(const android::Parcel& data) override;
    int32_t onHourlyTick(const android::Parcel& data) override;
    int32_t onTimeChanged(const android::Parcel& data) override;
    int32_t onAbnormalityThermal(const android::Parcel& data) override;
    int32_t onForceBalance(const android::Parcel& data) override;
    int32_t onShutDown(const android::Parcel& data) override;
    int32_t handleTimerExpired(int32_t id) override;
    int32_t handleTimerRearm(int32_t id) override;

private:
    // A setting from its property, or the default (with an error line) when
    // the value is not a whole number within the accepted range.
    static int64_t readSetting(const char* property, int64_t defaultMs);

    // Polls of reasons 0 and 1 go only when t is not near the hour and more
    // than the minimum interval after the last poll.
    bool shouldPoll(int64_t t);
    // Asks the hourly routine for its last tick and the time left until its
    // next one; a failed request or an unusable answer is not near.
    bool isNearHour(int64_t t);
    int32_t notifyPolling(const PollingPayload& payload, bool restartTimer);
    // Polls with the reason and the notification's leading time.
    int32_t pollAt(const android::Parcel& data, int32_t reason, bool restartTimer);

    static std::atomic<int64_t> sSettingFloorMs;

    const int64_t mPeriodMs;
    const int64_t mMinIntervalMs;
    // Written on the routine's thread, read by dump.
    std::atomic<int64_t> mLastPoll{0};
    // Made when the routine is first held, then never replaced.
    android::sp<TimerCallback> mTimer;
};

} // namespace kelvo
