#pragma once

#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/String8.h>

#include <atomic>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "core/KelvoOperator.h"
#include "utils/TimerCallback.h"

namespace kelvo {

// Looks for abnormal energy use and reports it at once: as events, as rows of
// its debug_abnormal_ tables and, for wakelocks and CPU, as power-log lines.
// Every 30 minutes (a timer on the boot-time clock) it examines the raw rows
// written since the previous check: battery drops, wake-ups, modem wake-ups,
// alarms, kernel and partial wakelocks, sensor-hub wake-ups, location
// requests, freeze failures, restarts and screen-off drain. Each window starts
// where the previous one ended, so a row is looked at once. Once an hour the
// hourly routine asks it to rank the applications' energy of the past hour;
// abnormality records of the power-management application
// (KELVO_TAG_PM_POWER_CONTROL) and reports of the CPU and battery handlers
// are handled as they come. The limits are the configured abnormality
// thresholds: without them no check runs.
//
// Power-management records are "key=value" items, "type=T" first:
//   types 4, 15, 16, 17: "type=T package=P count=N reason=R"
//   type 20:             "type=20 package=P usage=U time=MS energy=E"
//   type 21:             "type=21 package=P reason=TAG#... count=MS"
// (the reason runs to the end of the text, or to " count=" for type 21).
class AbnormalityRoutine : public KelvoOperator {
public:
    enum request_code : int32_t {
        // int32 severity, four int32, String8 version (battery handler).
        REQUEST_BATTERY_CAPACITY = 0,
        REQUEST_BATTERY_LEVEL = 1,
        // int64 hour (hourly routine).
        REQUEST_HOURLY_APPLICATIONS = 2,
        // Records to the end: int32 uid, String8 name, float usage in
        // percent, int32, int64 (CPU handler).
        REQUEST_CPU_REPORT = 3,
    };
    enum threshold_key : int32_t {
        KEY_APPLICATIONS = 0,
        KEY_FREEZE_FAILED = 1,
        KEY_BATTERY_CAPACITY = 2,
        KEY_BATTERY_LEVEL = 3,
        KEY_WAKEUP = 4,
        KEY_ALARM = 5,
        KEY_WAKELOCK = 6,
        KEY_SENSORHUB = 7,
        KEY_MODEM = 8,
        KEY_LOCATION = 9,
    };

    static constexpr int32_t kCheckTimerId = 0;
    static constexpr int32_t kPelmoraTag = 0;
    static constexpr int64_t kCheckPeriodMs = 1800000;
    // Immediate reports of one kind a day.
    static constexpr int32_t kDailyReportLimit = 100;
    static constexpr int32_t kMaxCpuRecords = 30;
    static constexpr int32_t kPowerLogWakelock = 207;
    static constexpr int32_t kPowerLogCpu = 185;

    AbnormalityRoutine();
    // Removes its timer: the manager keeps a timer until told.
    ~AbnormalityRoutine() override;

    // Shortens the check period (tests); 0 or less restores it. Read when
    // the timer is armed.
    static void setCheckPeriodMs(int64_t ms);

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    int32_t setConfiguration() override;
    void setupListeners(android::Parcel& out) override;
    void registerDispatcherTag() override;
    int32_t lateInitialize() override;
    int32_t handleTimerExpired(int32_t id) override;
    int32_t handleTimerRearm(int32_t id) override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t onHourlyTick(const android::Parcel& data) override;
    int32_t onDailyTick(const android::Parcel& data) override;

private:
    struct battery_report {
        int32_t first;
        int32_t values[4];
        std::string version;
    };
    struct pelmora_report {
        std::string name;
        std::string reason;
        int32_t count;
    };
    // One kind of immediate report: packages reported lately, today's count.
    struct recent_reports {
        std::set<std::string> packages;
        int32_t today;
    };
    struct window {
        int64_t start;
        int64_t end;
    };

    int32_t readThresholds();
    // The check's limit (the last value of its key); false with a debug line
    // when the key is missing.
    bool threshold(int32_t key, int32_t& value) const;
    int32_t armTimer();

    void onAbnormalityCheck(int64_t now);
    void checkBattery(const window& w, bool capacity);
    void checkWakeup(const window& w, android::Parcel& p);
    void checkModem(const window& w, android::Parcel& p);
    void checkAlarm(const window& w, android::Parcel& p);
    void checkKernelWakelock(const window& w, android::Parcel& p, std::string& push);
    void checkPartialWakelock(const window& w, android::Parcel& p, std::string& push);
    void checkSensorhub(const window& w, android::Parcel& p);
    void checkLocation(const window& w, android::Parcel& p);
    void checkScreenOffDrain(const window& w);
    void checkPelmoraList(const window& w, int32_t type, uint32_t param, uint32_t classId,
                          android::Parcel& p);
    void checkFreezeFailedProcess(const window& w, android::Parcel& p);
    int32_t queryPelmoraAbnormality(const window& w, int32_t type, android::Parcel* reply,
                                    int32_t& rows);
    // A wakelock element with its row.
    void uploadWakelock(const window& w, const std::string& app, const std::string& version,
                        const std::string& tag, int64_t duration, android::Parcel& p);
    void sendWindowEvent(uint32_t event, const window& w, android::Parcel& p);

    int32_t onPelmoraMessage(int64_t time, const char* text);
    int32_t parsePelmoraAbnormality(const char* text, pelmora_report& out);
    int32_t onCpuAbnormality(int64_t time, const char* text);
    int32_t onWakelockAbnormality(int64_t time, const char* text);
    bool takeReport(recent_reports& kind, const std::string& package);
    void reportGnss(const window& w, const pelmora_report& report);
    void reportCpu(const window& w, const std::string& package, int32_t usage, int64_t cpuTime,
                   int64_t energy);

    int32_t onBatteryReport(const android::Parcel& data, battery_report& stored);
    int32_t onHourlyApplications(const android::Parcel& data);
    int32_t queryApplicationParts(const window& w, const android::String8& name, bool total,
                                  android::Parcel& element);
    int32_t onCpuHandlerReport(const android::Parcel& data);
    void sendPowerpush(std::string text, int32_t code);
    void refused();

    std::map<int32_t, std::vector<int32_t>> mThresholds;
    int32_t mFilter;
    bool mThresholdsRead;
    android::sp<TimerCallback> mTimer;
    // Wall-clock end of the last checked window; 0 before the first check.
    int64_t mLastCheck;
    battery_report mCapacity;
    battery_report mLevel;
    recent_reports mCpu;
    recent_reports mGnss;
    recent_reports mWakelock;
    int32_t mHourlyTicks;
    android::Parcel mPendingApps;

    static std::atomic<int64_t> sCheckPeriodMs;
};

}  // namespace kelvo
