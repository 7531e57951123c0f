#pragma once

#include <stdint.h>
#include <utils/String8.h>

#include <deque>
#include <string>
#include <vector>

#include "core/KelvoOperator.h"
#include "handlers/DdrFrequencyReader.h"
#include "handlers/KernelWakelockReader.h"
#include "handlers/PartialWakelockTracker.h"
#include "handlers/SystemRecords.h"
#include "storage/TableAttribute.h"

namespace kelvo {

// What the device as a whole does: suspend and resume, what woke it (alarm
// batches charged to an RTC wake-up), time changes, packages and uids, boot
// and shut-down, phone state, memory and kernel wakelocks, and the records
// other processes push. It has no accounter and votes under elector bits of
// its own, one per kind of record it accounts.
class SystemHandler : public KelvoOperator {
public:
    // Tag indexes.
    enum system_tag : int32_t {
        TAG_TIME_CHANGED = 0,
        TAG_KERNEL_SUSPEND = 1,
        TAG_KERNEL_RESUME = 2,
        TAG_KERNEL_WAKEUP = 3,
        TAG_ALARM_TRIGGER = 4,
        TAG_ALARM_WORKSOURCE = 5,
        TAG_PACKAGE_REMOVED = 6,
        TAG_PACKAGE_ADDED = 7,
        TAG_UID_REMOVED = 8,
        TAG_BOOT_COMPLETED = 9,
        TAG_SHUTDOWN = 10,
        TAG_PHONE_STATE = 11,
        TAG_RESET_BATTERY_STAT = 12,
        TAG_WAKE_STATUS = 13,
        TAG_FREEZING_FAILED = 14,
        TAG_MODEM_WAKEUP_SOURCE = 15,
        TAG_AP_WAKE_IRQ = 16,
        TAG_WAKEUP_PACKET = 17,
        TAG_SENSORHUB_WAKE = 18,
        TAG_WIFI_WAKE_IPV4 = 19,
        TAG_CLOUD_UPDATE = 20,
        TAG_PM_STRATEGY = 21,
        TAG_PM_SCENE = 22,
        TAG_LOCATION_COUNTER = 23,
        TAG_APP_WAKEUP = 24,
        TAG_APP_TYPE = 25,
        TAG_COUNT = 26,
    };
    // Customized messages.
    enum system_message : int32_t {
        MESSAGE_ALARM_WAKEUP_CHECK = 0,  // int64 wake time
        MESSAGE_ALARM_TIMEOUT = 1,
        MESSAGE_MISC_DATA = 2,  // int64 time, String8 name, String8 value
        MESSAGE_ERROR_LOG = 3,  // int64 time, String8 line
        MESSAGE_FLUSH_ALL = 4,
        MESSAGE_WIFI_WAKE_CHECK = 5,  // int64 wake time
    };
    // Elector bits.
    static constexpr uint32_t kElectorWakelock = 0x2000;
    static constexpr uint32_t kElectorAlarm = 0x8;
    static constexpr uint32_t kElectorComponent = 0x10;
    static constexpr uint32_t kElectorComponentUpload = 0x20;
    static constexpr uint32_t kElectorMemory = 0x400;
    static constexpr uint32_t kElectorDailyStatistics = 0x200;
    static constexpr uint32_t kElectorMobilePhone = 0x100000;
    static constexpr uint32_t kElectorDdr = 0x400000;
    static constexpr uint32_t kElectorDailyRecord = 0x1000000;
    // Declared only for the log user types that collect kernel statistics.
    static constexpr uint32_t kElectorKworker = 0x80000;
    static constexpr uint32_t kElectorUevent = 0x800000;
    static constexpr uint32_t kElectorBinderStats = 0x2000000;
    // Buffered-log entry types.
    enum buffered_type : int32_t {
        SERVICE_DAILY_STATISTICS = 0,
        SERVICE_MOBILE_PHONE = 1,
        SERVICE_PACKAGE_VERSIONS = 2,
        DRIVER_KWORKER = 1,
        DRIVER_UEVENT = 2,
        DRIVER_BINDER_STATS = 3,
    };
    static constexpr int32_t kMaxRowsPerInsert = 5000;
    // The votes of the accounting steps and of the uploads.
    static constexpr uint32_t kApplicationsVote = 0x2008;
    static constexpr uint32_t kComponentVote = 0x30;
    static constexpr uint32_t kPeriodUploadVote = 0x2018;
    static constexpr uint32_t kDailyUploadVote = 0x1502638 & ~0x80000u & ~0x2000000u;

    static constexpr int64_t kAlarmTimeoutMs = 3000;
    static constexpr int64_t kAlarmWakeWindowMs = 1500;
    static constexpr int64_t kRtcCheckDelayMs = 1500;
    static constexpr int64_t kWifiCheckDelayMs = 100;
    static constexpr int64_t kShutDownFlushDelayMs = 2000;
    // Alarm lists kept waiting for their RTC wake-up.
    static constexpr size_t kMaxAlarmHistory = 32;
    // A time change beyond this is no clock adjustment but a broken record.
    static constexpr int64_t kMaxTimeDeltaMs = 100LL * 366 * 24 * 3600 * 1000;
    static constexpr size_t kNameSize = 64;
    // Names in one strategy, location-counter or application-type record.
    static constexpr int32_t kMaxStrategyNames = 256;
    static constexpr const char* kMemInfoPath = "/proc/meminfo";
    static constexpr const char* kDdrPath = "/sys/class/devfreq/ddrfreq/trans_stat";
    // Kernel up this long when the daemon starts: a restart, whose first
    // readings only set the baselines.
    static constexpr int64_t kRestartUptimeMs = 10 * 60 * 1000;

    struct alarm_record {
        int64_t time = 0;
        int32_t type = 0;
        int32_t worksource = 0;
        std::string name;
        std::string tag;
    };

    SystemHandler();

    static const table_attribute* const* tables(int32_t* count);
    // Range id of a memory size in kB (0..5), or -1 for a size of 0 or less.
    static int32_t memoryRange(int64_t kb);

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void setupListeners(android::Parcel& out) override;
    void registerDispatcherTag() override;
    void setCandidateElector() override;
    int32_t lateInitialize() override;
    int32_t setConfiguration() override;
    void dump(android::String8& out) override;

    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t onForegroundChanged(const android::Parcel& data) override;
    int32_t onScreenStateChanged(const android::Parcel& data) override;
    int32_t onChargerOnlineChanged(const android::Parcel& data) override;
    int32_t onDataPolling(const android::Parcel& data) override;
    int32_t onHourlyTick(const android::Parcel& data) override;
    int32_t onDailyTick(const android::Parcel& data) override;
    int32_t onApplicationsAccounting(const android::Parcel& data) override;
    int32_t onComponentAccounting(const android::Parcel& data) override;
    int32_t onHourlyUploading(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t onDawnUploading(const android::Parcel& data) override;
    int32_t logApplicationsAccounting(int64_t time) override;
    int32_t logComponentAccounting(int64_t time) override;
    int32_t handleBufferedLog(const android::Parcel& data) override;

    // Array lengths of the uploads.
    static constexpr int32_t kTopSources = 10;
    static constexpr int32_t kTopApplications = 20;
    static constexpr int32_t kMaxUploadName = 100;

private:
    // The four arrays of the energy component data over (end - window, end].
    void formComponentData(int64_t end, int64_t window, android::Parcel& out);
    void formStatisticsData(int64_t end, android::Parcel& out);
    void formUserData(int64_t end, android::Parcel& out);
    int32_t handleKworker(const uint8_t* data, size_t size);
    int32_t handleUevent(const uint8_t* data, size_t size);
    int32_t handleBinderStats(const uint8_t* data, size_t size);
    int32_t handleDailyStatistics(const uint8_t* data, size_t size);
    int32_t handleMobilePhone(const uint8_t* data, size_t size);
    int32_t handlePackageVersions(const uint8_t* data, size_t size);
    // Asks the kernel for binder statistics of kind k at t.
    int32_t requestBinderStats(int64_t time, int32_t kind);
    // Votes at the hour remembered with a request, once.
    void voteRemembered(int64_t* hour, int32_t candidate, uint32_t elector);
    int32_t handleTimeChanged(int64_t time, const char* text);
    int32_t handleSuspend(int64_t time);
    int32_t handleResume(int64_t time);
    int32_t handleWakeup(int64_t time, const char* text);
    int32_t handleAlarm(int64_t time, const char* text);
    int32_t handleWorkSource(const char* text);
    int32_t handlePackage(int64_t time, const char* text, bool added);
    int32_t handleUidRemoved(const char* text);
    int32_t handleBootCompleted(int64_t time);
    int32_t handleShutDown(int64_t time);
    int32_t handlePhoneState(int64_t time, const char* text);
    // The records written as one row each.
    int32_t handleRecord(int64_t time, int32_t tag, const char* text);
    // "name=A,B,C type=T count=3 update=U": with update 1 the type's rows
    // are replaced by the names.
    int32_t handleStrategy(int64_t time, const char* text);
    // "num=N count=C1,..,CN name=A1,..,AN": one row per name.
    int32_t handleLocationCounter(int64_t time, const char* text);
    // "count=N flag=F name=A1,..,AN type=T1,..,TN": flag 1 records the
    // types of new names, flag 0 forgets the names.
    int32_t handleAppType(int64_t time, const char* text);
    int32_t checkAlarmWakeup(int64_t wake);
    int32_t checkWifiWake(int64_t wake);
    int32_t insertMiscData(const android::Parcel& data);
    int32_t insertErrorLog(const android::Parcel& data);

    // Alarm capture.
    void cancelAlarmTimeout();
    void takeAlarm(const alarm_record& alarm);
    void closeBatch();
    void archiveAlarms();

    int32_t insertStartUp(int64_t time, int32_t state);
    int32_t readMemory(int64_t time);
    int32_t readKernelWakelocks(int64_t time);
    int32_t readPartialWakelocks(int64_t time);
    int32_t readDdr(int64_t time);
    int32_t logHourlyQuery(const char* sql, const table_attribute& table, int32_t columns,
                           int64_t hour, const char* failure);
    // An error line at most once per cause and hour (repeats of every poll).
    bool shouldLogRepeat(int32_t cause, int64_t time);

    bool mScreenOn;
    bool mChargerOnline;
    int64_t mSuspendTime;  // -1 when no suspend waits for its resume
    bool mWoken;

    bool mAccepting;
    bool mWaitingWorkSource;
    int32_t mBatchCounter;
    int32_t mBatchSize;
    int32_t mAlarmTimeoutId;
    std::vector<alarm_record> mAlarms;
    std::deque<std::vector<alarm_record>> mAlarmHistory;
    bool mHasPendingWorkSource;
    alarm_record mPendingWorkSource;

    int32_t mWifiWakeGpio;
    std::string mPendingGpioName;
    int64_t mLastWifiWakeTime;
    android::String8 mForeground;

    KernelWakelockReader mKernelWakelocks;
    PartialWakelockTracker mPartialWakelocks;
    DdrFrequencyReader mDdr;
    int32_t mDdrLevels;

    // Kernel statistics are collected for some log user types only.
    bool mStatsUser;
    int64_t mKworkerHour;  // -1 when no answer is awaited
    int64_t mUeventHour;
    int64_t mBinderHour;
    int64_t mDailyHour;
    int64_t mMobileHour;
    int64_t mBinderPrevious;  // end of the previous binder statistics answer
    SystemRecords::daily_statistics mDailyStatistics;
    bool mDailyRecordSinceUpload;
    int64_t mRepeatHour[4];
};

}  // namespace kelvo
