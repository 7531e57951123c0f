#include "handlers/SystemHandler.h"

#include <cutils/properties.h>
#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <functional>
#include <map>

#include "ErrorLogger.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "binder/managers/PackageManager.h"
#include "binder/managers/WakelockManager.h"
#include "core/BufferedLogServer.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "kelvo/RootPath.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/LoggerMessage.h"
#include "utils/PackageProperty.h"
#include "utils/SystraceDumper.h"
#include "utils/TimeProvider.h"
#include "utils/devices/KelvoDevice.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDayMs = 86400000;
constexpr const char* kWakeupSourcesPath = "/proc/wakeup_sources";
constexpr const char* kBufferedSender = "KelvoService";
constexpr const char* kDriverSender = "kelvo_driver";
constexpr int32_t kRequestDailyStatistics = 0;
constexpr int32_t kRequestMobilePhone = 1;
constexpr int32_t kRequestPackageList = 2;

// Causes of repeated per-poll lines.
enum repeat_cause : int32_t {
    REPEAT_MEMINFO = 0,
    REPEAT_MEMORY_VALUE = 1,
    REPEAT_WAKEUP_SOURCES = 2,
    REPEAT_PARTIAL = 3,
};

// Candidates.
constexpr int32_t kCandidateTick = 1;
constexpr int32_t kCandidateApplications = 2;
constexpr int32_t kCandidateComponent = 3;
constexpr int32_t kCandidateHourlyUpload = 4;
constexpr int32_t kCandidateDailyTick = 5;
constexpr int32_t kCandidateDailyUpload = 6;
constexpr int32_t kCandidateDawnUpload = 8;

#define TABLE(version, name, ...)                                                                \
    const column_attribute k_##name##_columns[] = {__VA_ARGS__};                                 \
    const table_attribute k_##name = {                                                           \
        version, 1, static_cast<int32_t>(sizeof(k_##name##_columns) / sizeof(column_attribute)), \
        k_##name##_columns, #name};

TABLE("1.1", raw_applications_alarm, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_TEXT, "tag"}, {COLUMN_INT, "worksource"}, {COLUMN_INT, "count"})
TABLE("1.0", raw_wake_up_source, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "source"})
TABLE("1.0", raw_system_suspend, {COLUMN_TIME, "suspend"}, {COLUMN_TIME, "resume"})
TABLE("1.0", raw_memory_range, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "type"},
      {COLUMN_INT, "range"})
TABLE("1.0", raw_partial_wakelock, {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "uid"},
      {COLUMN_TEXT, "name"}, {COLUMN_TEXT, "tag"}, {COLUMN_LONG, "duration"})
TABLE("1.0", raw_kernel_wakelock, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_INT, "count"}, {COLUMN_LONG, "duration"})
TABLE("1.0", raw_time_changed, {COLUMN_TIME, "old_time"}, {COLUMN_TIME, "new_time"},
      {COLUMN_LONG, "delta"})
TABLE("1.1", raw_wake_status, {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "ap"}, {COLUMN_INT, "modem"},
      {COLUMN_INT, "hifi"}, {COLUMN_INT, "iomcu"}, {COLUMN_INT, "sevra"}, {COLUMN_INT, "hotplug0"},
      {COLUMN_INT, "hotplug1"})
TABLE("1.0", raw_freezing_failed, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"})
TABLE("1.0", raw_modem_wakeup_source, {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "type"},
      {COLUMN_TEXT, "source"})
TABLE("1.0", raw_package_state, {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "state"},
      {COLUMN_TEXT, "name"}, {COLUMN_TEXT, "version"})
TABLE("1.0", raw_kworker, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "symbol"},
      {COLUMN_LONG, "count"}, {COLUMN_LONG, "time"})
TABLE("1.0", raw_uevent, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "devpath"},
      {COLUMN_INT, "action"}, {COLUMN_INT, "count"})
TABLE("1.0", raw_ap_wake_irq, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"})
TABLE("1.0", raw_mobile_phone, {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sub_id"},
      {COLUMN_INT, "mcc"}, {COLUMN_INT, "mnc"}, {COLUMN_INT, "data_switch"},
      {COLUMN_INT, "voice_switch"})
TABLE("1.0", raw_wake_up_packet, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_INT, "net"}, {COLUMN_INT, "protocol"})
TABLE("1.0", raw_ddr_frequency, {COLUMN_TIME, "timestamp"}, {COLUMN_LONG, "freq"},
      {COLUMN_LONG, "duration"})
TABLE("1.0", raw_sensorhub_wake, {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "source"},
      {COLUMN_INT, "reason"})
TABLE("1.0", raw_devices_model, {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "device"},
      {COLUMN_INT, "model"})
TABLE("1.0", raw_package_version, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_TEXT, "version"})
TABLE("1.0", raw_pelmora_strategy, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_INT, "type"})
TABLE("1.0", raw_pelmora_scene, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_INT, "scene"}, {COLUMN_INT, "state"})
TABLE("1.0", raw_location_counter, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_INT, "count"})
TABLE("1.0", raw_app_wakeup, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_TEXT, "source"})
TABLE("1.0", raw_binder_stats, {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"},
      {COLUMN_TEXT, "service"}, {COLUMN_INT, "s_uid"}, {COLUMN_INT, "s_pid"},
      {COLUMN_TEXT, "client"}, {COLUMN_INT, "c_uid"}, {COLUMN_INT, "c_pid"},
      {COLUMN_INT, "forward"}, {COLUMN_INT, "backward"}, {COLUMN_INT, "foreground"},
      {COLUMN_INT, "screen"}, {COLUMN_INT, "charge"})
TABLE("2.0", raw_app_type, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"}, {COLUMN_LONG, "type"})
TABLE("1.0", hourly_applications_alarm, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_TEXT, "tag"}, {COLUMN_INT, "worksource"}, {COLUMN_INT, "count"})
TABLE("1.0", hourly_wake_up_source, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "source"},
      {COLUMN_INT, "count"})
TABLE("1.0", hourly_system_suspend, {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "duration"},
      {COLUMN_INT, "count"})
TABLE("1.0", hourly_applications_partial_wakelock, {COLUMN_TIME, "timestamp"},
      {COLUMN_TEXT, "name"}, {COLUMN_TEXT, "tag"}, {COLUMN_LONG, "duration"})
TABLE("1.0", hourly_applications_kernel_wakelock, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_INT, "count"}, {COLUMN_LONG, "duration"})
TABLE("1.0", daily_misc_data, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_TEXT, "value"})
TABLE("1.2", debug_start_up, {COLUMN_TIME, "timestamp"}, {COLUMN_LONG, "elapse_time"},
      {COLUMN_INT, "state"}, {COLUMN_INT, "daemon_pid"})
TABLE("1.0", debug_error_log, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "error_log"})
TABLE("1.0", about_kelvo_daemon, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "key"},
      {COLUMN_TEXT, "value"})
TABLE("1.0", module_cloud_update, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "module"},
      {COLUMN_TEXT, "version"})

#undef TABLE

const table_attribute* const kTables[] = {
    &k_raw_applications_alarm,
    &k_raw_wake_up_source,
    &k_raw_system_suspend,
    &k_raw_memory_range,
    &k_raw_partial_wakelock,
    &k_raw_kernel_wakelock,
    &k_raw_time_changed,
    &k_raw_wake_status,
    &k_raw_freezing_failed,
    &k_raw_modem_wakeup_source,
    &k_raw_package_state,
    &k_raw_kworker,
    &k_raw_uevent,
    &k_raw_ap_wake_irq,
    &k_raw_mobile_phone,
    &k_raw_wake_up_packet,
    &k_raw_ddr_frequency,
    &k_raw_sensorhub_wake,
    &k_raw_devices_model,
    &k_raw_package_version,
    &k_raw_pelmora_strategy,
    &k_raw_pelmora_scene,
    &k_raw_location_counter,
    &k_raw_app_wakeup,
    &k_raw_binder_stats,
    &k_raw_app_type,
    &k_hourly_applications_alarm,
    &k_hourly_wake_up_source,
    &k_hourly_system_suspend,
    &k_hourly_applications_partial_wakelock,
    &k_hourly_applications_kernel_wakelock,
    &k_daily_misc_data,
    &k_debug_start_up,
    &k_debug_error_log,
    &k_about_kelvo_daemon,
    &k_module_cloud_update,
};

// Tables whose rows are kept (versions, strategies, cloud modules, types).
const table_attribute* const kKeptTables[] = {
    &k_about_kelvo_daemon,   &k_raw_devices_model,   &k_raw_package_version,
    &k_raw_pelmora_strategy, &k_module_cloud_update, &k_raw_app_type,
};

const char* const kTagNames[SystemHandler::TAG_COUNT] = {
    "KELVO_TAG_TIME_CHANGED",        "KELVO_TAG_KERNEL_SUSPEND", "KELVO_TAG_KERNEL_RESUME",
    "KELVO_TAG_KERNEL_WAKEUP",       "KELVO_TAG_ALARM_TRIGGER",  "KELVO_TAG_ALARM_WORKSOURCE",
    "KELVO_TAG_PACKAGE_REMOVED",     "KELVO_TAG_PACKAGE_ADDED",  "KELVO_TAG_UID_REMOVED",
    "KELVO_TAG_BOOT_COMPLETED",      "KELVO_TAG_SHUTDOWN",       "KELVO_TAG_PHONE_STATE",
    "KELVO_TAG_RESET_BATTERY_STAT",  "KELVO_TAG_WAKE_STATUS",    "KELVO_TAG_FREEZING_FAILED",
    "KELVO_TAG_MODEM_WAKEUP_SOURCE", "KELVO_TAG_AP_WAKE_IRQ",    "KELVO_TAG_KERNEL_WAKEUP_PACKET",
    "KELVO_TAG_SENSORHUB_WAKE",      "KELVO_TAG_WIFI_WAKE_IPV4", "KELVO_TAG_CLOUD_UPDATE",
    "KELVO_TAG_PM_STRATEGY",         "KELVO_TAG_PM_SCENE",       "KELVO_TAG_LOCATION_COUNTER",
    "KELVO_TAG_APP_WAKEUP",          "KELVO_TAG_APP_TYPE",
};

// How long the kernel has been up, in ms.
int64_t kernelUptimeMs() {
    struct timespec ts = {};
    clock_gettime(CLOCK_BOOTTIME, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

int64_t hourOf(int64_t time) {
    return time - ((time % kHourMs) + kHourMs) % kHourMs;
}

// The tag of an alarm without its "*walarm*:" or "*alarm*:" prefix.
std::string alarmTag(const std::string& tag) {
    for (const char* prefix : {"*walarm*:", "*alarm*:"}) {
        size_t n = strlen(prefix);
        if (tag.compare(0, n, prefix) == 0) {
            return tag.substr(n);
        }
    }
    return tag;
}

int32_t parseText(const char* text, const char* key, const char* next, size_t size,
                  std::string* out) {
    char buffer[256] = {};
    int32_t ret =
        parseMessage(text, key, next, "%s", buffer, size < sizeof(buffer) ? size : sizeof(buffer));
    if (ret == 0) {
        out->assign(buffer);
    }
    return ret;
}

// A value that is no number ("uid=abc") fails instead of reading as 0.
int32_t parseInt(const char* text, const char* key, const char* next, int32_t* out) {
    int32_t value = INT32_MIN;
    int32_t ret = parseMessage(text, key, next, "%d", &value, sizeof(value));
    if (ret < 0) {
        return ret;
    }
    if (value == INT32_MIN) {
        return -2;
    }
    *out = value;
    return 0;
}

std::string readProperty(const char* name) {
    char value[PROPERTY_VALUE_MAX] = {};
    property_get(name, value, "");
    return value;
}

int32_t refuse(const char* what) {
    HealthCounters::add(Health::LoggerMessageRefused);
    KLOGE("%s", what);
    return -19;
}

}  // namespace

SystemHandler::SystemHandler()
    : KelvoOperator("SystemHandler", -1, kElectorAlarm),
      mScreenOn(true),
      mChargerOnline(false),
      mSuspendTime(-1),
      mWoken(false),
      mAccepting(false),
      mWaitingWorkSource(false),
      mBatchCounter(0),
      mBatchSize(0),
      mAlarmTimeoutId(-1),
      mHasPendingWorkSource(false),
      mWifiWakeGpio(0),
      mLastWifiWakeTime(0),
      mPartialWakelocks(kernelUptimeMs() > kRestartUptimeMs),
      mDdrLevels(0),
      mStatsUser(gLogUserType.load() == 3 || gLogUserType.load() == 5),
      mKworkerHour(-1),
      mUeventHour(-1),
      mBinderHour(-1),
      mDailyHour(-1),
      mMobileHour(-1),
      mBinderPrevious(KelvoAgent::getInstance()->getSystemBootTime()),
      mDailyRecordSinceUpload(false),
      mRepeatHour{-1, -1, -1, -1} {
    const std::string ddr = RootPath::resolve(kDdrPath);
    mDdrLevels = std::max(0, DdrFrequencyReader::countLevels(ddr));
    if (mDdrLevels > 0 && kernelUptimeMs() > kRestartUptimeMs) {
        // Residency from before a restart was counted by the previous run.
        mDdr.read(ddr, true, nullptr);
    }
}

const table_attribute* const* SystemHandler::tables(int32_t* count) {
    *count = static_cast<int32_t>(sizeof(kTables) / sizeof(kTables[0]));
    return kTables;
}

int32_t SystemHandler::memoryRange(int64_t kb) {
    static const int64_t kBounds[] = {4194304, 2097152, 1048576, 524288, 262144, 0};
    for (int32_t i = 0; i < 6; ++i) {
        if (kb > kBounds[i]) {
            return 5 - i;
        }
    }
    return -1;
}

void SystemHandler::addSchemaTable() {
    for (const table_attribute* table : kTables) {
        addSchema(*table);
    }
}

void SystemHandler::cleanTables(int64_t time) {
    for (const table_attribute* table : kTables) {
        bool kept = false;
        for (const table_attribute* k : kKeptTables) {
            kept = kept || k == table;
        }
        if (kept) {
            continue;
        }
        if (table == &k_raw_time_changed) {
            cleanAllEntries(table->name);
        } else if (table == &k_raw_system_suspend) {
            cleanObsoleteEntries(table->name, time, "resume");
        } else if (table == &k_raw_binder_stats) {
            cleanObsoleteEntries(table->name, time, "end_time");
        } else {
            cleanObsoleteEntries(table->name, time, "timestamp");
        }
    }
}

void SystemHandler::setupListeners(Parcel& out) {
    static const int32_t kNotifications[] = {
        NOTIFICATION_DATA_POLLING,         NOTIFICATION_HOURLY_TICK,
        NOTIFICATION_DAILY_TICK,           NOTIFICATION_APPLICATIONS_ACCOUNTING,
        NOTIFICATION_COMPONENT_ACCOUNTING, NOTIFICATION_DAILY_UPLOADING,
        NOTIFICATION_DAWN_UPLOADING,       NOTIFICATION_HOURLY_UPLOADING,
        NOTIFICATION_SCREEN_STATE_CHANGED, NOTIFICATION_CHARGER_ONLINE_CHANGED,
        NOTIFICATION_FOREGROUND_CHANGED,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    for (int32_t type : {SERVICE_DAILY_STATISTICS, SERVICE_MOBILE_PHONE, SERVICE_PACKAGE_VERSIONS}) {
        addBufferedLogReceiver(kBufferedSender, type, out);
    }
    for (int32_t type : {DRIVER_KWORKER, DRIVER_UEVENT, DRIVER_BINDER_STATS}) {
        addBufferedLogReceiver(kDriverSender, type, out);
    }
}

void SystemHandler::registerDispatcherTag() {
    for (int32_t i = 0; i < TAG_COUNT; ++i) {
        Dispatcher::getInstance()->registerTag({kTagNames[i], i}, this);
    }
}

void SystemHandler::setCandidateElector() {
    struct elector_candidates {
        uint32_t elector;
        std::vector<int32_t> candidates;
    };
    const elector_candidates kElectors[] = {
        {kElectorWakelock, {1, 2, 4, 6, 8}},
        {kElectorAlarm, {2, 4, 6, 8}},
        {kElectorComponent, {3, 4, 6, 8}},
        {kElectorComponentUpload, {3, 6}},
        {kElectorMemory, {1, 6}},
        {kElectorDailyStatistics, {5, 6}},
        {kElectorMobilePhone, {1, 6}},
        {kElectorDdr, {5, 6}},
        {kElectorDailyRecord, {5, 6}},
    };
    for (const elector_candidates& e : kElectors) {
        Parcel candidates;
        for (int32_t c : e.candidates) {
            candidates.writeInt32(c);
        }
        setElector(e.elector, candidates);
    }
    if (mStatsUser) {
        Parcel tick;
        tick.writeInt32(kCandidateTick);
        setElector(kElectorKworker | kElectorUevent | kElectorBinderStats, tick);
    }
}

int32_t SystemHandler::insertStartUp(int64_t time, int32_t state) {
    Parcel row;
    row.writeInt64(time);
    row.writeInt64(TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC));
    row.writeInt32(state);
    row.writeInt32(static_cast<int32_t>(getpid()));
    return insertEntries(k_debug_start_up, row, 1, false);
}

int32_t SystemHandler::setConfiguration() {
    Parcel request;
    request.writeInt32(1);
    Parcel reply;
    int32_t gpio = 0;
    if (getXmlConfig(CONFIG_FILTER, request, &reply) < 0 ||
        reply.readInt32(&gpio) != android::NO_ERROR) {
        // Every GPIO wake-up is then an AP wake interrupt at once.
        KLOGE("Get filter data failed");
        return -2;
    }
    mWifiWakeGpio = gpio;
    return 0;
}

int32_t SystemHandler::lateInitialize() {
    insertStartUp(KelvoAgent::getInstance()->getSystemBootTime(), 0);
    Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(String8("SELECT COUNT(*) FROM debug_error_log"), &reply, 1, rows) >= 0 &&
        rows == 1) {
        int64_t count = reply.readInt64();
        ErrorLogger::setCounter(KelvoUtils::saturateInt32(count));
        KLOGI("Initial error log count: %lld", static_cast<long long>(count));
    } else {
        KLOGE("Failed to query error log count: %d", rows);
    }
    // The versions, one row per key.
    std::vector<std::pair<const char*, std::string>> versions = {
        {"kelvod_version", "000.1.4.0"},
        {"product_version", readProperty("ro.build.description")},
        {"software_version", readProperty("ro.build.display.id")},
    };
    Parcel textRequest;
    textRequest.writeInt32(0);
    Parcel textReply;
    String8 xmlVersion;
    if (getXmlConfig(CONFIG_TEXT, textRequest, &textReply) >= 0 &&
        textReply.readString8(&xmlVersion) == android::NO_ERROR && xmlVersion.length() > 0) {
        versions.emplace_back("xml_version", xmlVersion.c_str());
    } else {
        KLOGD("Get xml version failed");
    }
    for (const auto& v : versions) {
        Parcel row;
        row.writeInt64(KelvoAgent::getInstance()->getSystemBootTime());
        row.writeString8(String8(v.first));
        row.writeString8(String8(v.second.c_str()));
        updateEntries(
            k_about_kelvo_daemon, row,
            String8::format("key = %s", KelvoUtils::quoteSqlText(v.first).c_str()).c_str());
    }
    if (mStatsUser) {
        if (KelvoDevice::setLogStatsEnable(true) < 0) {
            KLOGE("Failed to enable stats logging");
        }
        // Only today's dumps count against the daily cap.
        const long long today =
            TimeProvider(TimeProvider::getCurrentTime(TIME_TYPE_WALL)).startOfDay() * 1000;
        Parcel dumps;
        int32_t dumpRows = 0;
        if (queryEntriesSimple(String8::format("SELECT COUNT(*) FROM daily_misc_data WHERE name "
                                               "== 'systrace' AND timestamp >= %lld",
                                               today),
                               &dumps, 1, dumpRows) >= 0 &&
            dumpRows == 1) {
            SystraceDumper::getInstance()->setDumpCount(
                KelvoUtils::saturateInt32(dumps.readInt64()));
        } else {
            KLOGE("Failed to query entries");
        }
    }
    Parcel types;
    int32_t typeRows = 0;
    int32_t ret = queryEntriesSimple(
        String8::format("SELECT timestamp, name, type FROM %s", k_raw_app_type.name), &types, 3,
        typeRows);
    if (ret < 0) {
        KLOGE("Failed to query app type: %d", ret);
    } else if (typeRows > 0) {
        PackageProperty::getInstance()->addPackageType(types);
    }
    // Nothing read the current state yet: the first poll only sets the baseline.
    std::vector<KernelWakelockReader::increment> ignored;
    mKernelWakelocks.read(RootPath::resolve(kWakeupSourcesPath), &ignored);
    return 0;
}

void SystemHandler::dump(String8& out) {
    out.appendFormat("SystemHandler: screen %d, charger %d, alarm lists %zu, kernel sources %zu\n",
                     mScreenOn, mChargerOnline, mAlarmHistory.size(), mKernelWakelocks.size());
    KelvoOperator::dump(out);
}

int32_t SystemHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    switch (tag) {
        case TAG_TIME_CHANGED:
            return handleTimeChanged(time, text);
        case TAG_KERNEL_SUSPEND:
            return handleSuspend(time);
        case TAG_KERNEL_RESUME:
            return handleResume(time);
        case TAG_KERNEL_WAKEUP:
            return handleWakeup(time, text);
        case TAG_ALARM_TRIGGER:
            return handleAlarm(time, text);
        case TAG_ALARM_WORKSOURCE:
            return handleWorkSource(text);
        case TAG_PACKAGE_REMOVED:
            return handlePackage(time, text, false);
        case TAG_PACKAGE_ADDED:
            return handlePackage(time, text, true);
        case TAG_UID_REMOVED:
            return handleUidRemoved(text);
        case TAG_BOOT_COMPLETED:
            return handleBootCompleted(time);
        case TAG_SHUTDOWN:
            return handleShutDown(time);
        case TAG_PHONE_STATE:
            return handlePhoneState(time, text);
        case TAG_RESET_BATTERY_STAT:
            readPartialWakelocks(time);
            WakelockManager::getInstance()->noteResetBatteryStats();
            mPartialWakelocks.clear();
            return 0;
        case TAG_WIFI_WAKE_IPV4:
            mLastWifiWakeTime = time;
            return 0;
        case TAG_PM_STRATEGY:
            return handleStrategy(time, text);
        case TAG_LOCATION_COUNTER:
            return handleLocationCounter(time, text);
        case TAG_APP_TYPE:
            return handleAppType(time, text);
        default:
            if (tag > TAG_RESET_BATTERY_STAT && tag < TAG_COUNT) {
                return handleRecord(time, tag, text);
            }
            KLOGE("Unknown message type: %d", tag);
            return -3;
    }
}

int32_t SystemHandler::handleTimeChanged(int64_t time, const char* text) {
    long long delta = LLONG_MIN;
    if (parseMessage(text, "delta=", nullptr, "%lld", &delta, sizeof(delta)) < 0 ||
        delta == LLONG_MIN || delta > kMaxTimeDeltaMs || delta < -kMaxTimeDeltaMs) {
        return refuse("Failed to parse message");
    }
    const int64_t effective = delta + 10;
    const int64_t newTime = time + effective;
    KLOGI("Original timestamp: %lld, new timestamp: %lld, delta: %lld", static_cast<long long>(time),
          static_cast<long long>(newTime), static_cast<long long>(effective));
    if (!(effective < 60000 && effective > -60000 && hourOf(time) == hourOf(newTime))) {
        Parcel note;
        note.writeInt64(time);
        note.writeInt64(newTime);
        sendNotification(NOTIFICATION_TIME_CHANGED, note);
    }
    Parcel row;
    row.writeInt64(time);
    row.writeInt64(newTime);
    row.writeInt64(effective);
    return insertEntries(k_raw_time_changed, row, 1, false);
}

void SystemHandler::cancelAlarmTimeout() {
    if (mAlarmTimeoutId >= 1) {
        removeMessage(mAlarmTimeoutId);
    }
    mAlarmTimeoutId = -1;
}

void SystemHandler::archiveAlarms() {
    if (!mAlarms.empty()) {
        if (mAlarmHistory.size() >= kMaxAlarmHistory) {
            mAlarmHistory.pop_front();
            HealthCounters::add(Health::SystemReadingsRefused);
        }
        mAlarmHistory.push_back(std::move(mAlarms));
    }
    mAlarms.clear();
}

void SystemHandler::closeBatch() {
    cancelAlarmTimeout();
    archiveAlarms();
    mBatchCounter = 0;
    mWaitingWorkSource = false;
    mAccepting = false;
}

int32_t SystemHandler::handleSuspend(int64_t time) {
    cancelAlarmTimeout();
    archiveAlarms();
    mBatchCounter = 0;
    mWaitingWorkSource = false;
    mAccepting = true;
    mSuspendTime = time;
    return 0;
}

int32_t SystemHandler::handleResume(int64_t time) {
    if (!mWoken) {
        return 0;
    }
    mWoken = false;
    // One resume consumes its suspend: a lost suspend never counts twice.
    const int64_t suspend = mSuspendTime;
    mSuspendTime = -1;
    if (suspend < 0 || suspend >= time) {
        return 0;
    }
    Parcel rows;
    int32_t count = 0;
    int64_t start = suspend;
    for (int64_t next = hourOf(start) + kHourMs; next < time; next += kHourMs) {
        rows.writeInt64(start);
        rows.writeInt64(next);
        ++count;
        start = next;
    }
    rows.writeInt64(start);
    rows.writeInt64(time);
    ++count;
    int32_t ret = insertEntries(k_raw_system_suspend, rows, count, false);
    Parcel sensor;
    sensor.writeInt64(start);
    sensor.writeInt64(time);
    KelvoAgent::getInstance()->sendToHandler(HANDLER_SENSOR, 0, sensor, nullptr, false);
    return ret;
}

int32_t SystemHandler::handleWakeup(int64_t time, const char* text) {
    std::string irq;
    if (parseText(text, "irq=", "gpio=", 128, &irq) < 0) {
        return refuse("Failed to parse irq");
    }
    int32_t gpio = 0;
    if (parseInt(text, "gpio=", nullptr, &gpio) < 0) {
        return refuse("Failed to parse tag");
    }
    std::string source = irq;
    if (gpio >= 1) {
        source = "GPIO" + std::to_string(gpio);
        mPendingGpioName = source;
    }
    if (irq == "RTC0") {
        Parcel check;
        check.writeInt64(time);
        sendMessageDelayed(ms2ns(kRtcCheckDelayMs),
                           ParcelMessage(MESSAGE_CUSTOMIZED, MESSAGE_ALARM_WAKEUP_CHECK, check));
    }
    mWoken = true;
    if (!mPendingGpioName.empty()) {
        if (gpio != mWifiWakeGpio || mWifiWakeGpio < 1) {
            if (!mChargerOnline) {
                Parcel row;
                row.writeInt64(time);
                row.writeString8(String8(mPendingGpioName.c_str()));
                insertEntries(k_raw_ap_wake_irq, row, 1, false);
            }
            mPendingGpioName.clear();
        } else {
            Parcel check;
            check.writeInt64(time);
            sendMessageDelayed(ms2ns(kWifiCheckDelayMs),
                               ParcelMessage(MESSAGE_CUSTOMIZED, MESSAGE_WIFI_WAKE_CHECK, check));
        }
    }
    Parcel row;
    row.writeInt64(time);
    row.writeString8(String8(source.c_str()));
    return insertEntries(k_raw_wake_up_source, row, 1, false);
}

int32_t SystemHandler::checkWifiWake(int64_t wake) {
    int64_t gap = wake - mLastWifiWakeTime;
    if ((gap >= 101 || gap <= -101) && !mPendingGpioName.empty() && !mChargerOnline) {
        Parcel row;
        row.writeInt64(wake);
        row.writeString8(String8(mPendingGpioName.c_str()));
        insertEntries(k_raw_ap_wake_irq, row, 1, false);
    }
    mPendingGpioName.clear();
    return 0;
}

void SystemHandler::takeAlarm(const alarm_record& alarm) {
    if (alarm.type != 0 && alarm.type != 2) {
        return;
    }
    if (alarm.worksource != 0) {
        mPendingWorkSource = alarm;
        mHasPendingWorkSource = true;
    } else {
        mAlarms.push_back(alarm);
    }
}

int32_t SystemHandler::handleAlarm(int64_t time, const char* text) {
    if (!mAccepting || mChargerOnline) {
        return 0;
    }
    alarm_record alarm;
    alarm.time = time;
    int32_t uid = 0;
    int32_t size = 0;
    std::string tag;
    const bool hasWorkSource = strstr(text, "worksource=") != nullptr;
    const char* afterSize = hasWorkSource ? "worksource=" : nullptr;
    if (parseInt(text, "uid=", "name=", &uid) < 0) {
        return refuse("Failed to parse uid");
    }
    if (parseText(text, "name=", "type=", kNameSize, &alarm.name) < 0) {
        return refuse("Failed to parse name");
    }
    if (parseInt(text, "type=", "tag=", &alarm.type) < 0) {
        return refuse("Failed to parse type");
    }
    if (parseText(text, "tag=", "size=", 256, &tag) < 0) {
        return refuse("Failed to parse tag");
    }
    if (parseInt(text, "size=", afterSize, &size) < 0 || size < 1) {
        return refuse("Failed to parse size");
    }
    if (hasWorkSource && parseInt(text, "worksource=", nullptr, &alarm.worksource) < 0) {
        return refuse("Failed to parse work source");
    }
    alarm.tag = alarmTag(tag);
    if (mBatchCounter == 0) {
        mBatchSize = size;
        takeAlarm(alarm);
        mBatchCounter = 1;
        cancelAlarmTimeout();
        int32_t id =
            sendMessageDelayed(ms2ns(kAlarmTimeoutMs),
                               ParcelMessage(MESSAGE_CUSTOMIZED, MESSAGE_ALARM_TIMEOUT, Parcel()));
        mAlarmTimeoutId = id >= 1 ? id : -1;
    } else if (mBatchCounter < mBatchSize) {
        takeAlarm(alarm);
        ++mBatchCounter;
    }
    if (mBatchCounter >= mBatchSize) {
        if (alarm.worksource != 0 && (alarm.type == 0 || alarm.type == 2)) {
            mWaitingWorkSource = true;
        } else {
            closeBatch();
        }
    }
    return 0;
}

int32_t SystemHandler::handleWorkSource(const char* text) {
    if (!mAccepting || mChargerOnline) {
        return 0;
    }
    int32_t uid = 0;
    int32_t finished = 0;
    std::string name;
    std::string tag;
    if (parseInt(text, "uid=", "name=", &uid) < 0 ||
        parseText(text, "name=", "tag=", kNameSize, &name) < 0 ||
        parseText(text, "tag=", "finished=", 256, &tag) < 0 ||
        parseInt(text, "finished=", nullptr, &finished) < 0) {
        mHasPendingWorkSource = false;
        return refuse("Failed to parse alarm worksource message");
    }
    if (!mHasPendingWorkSource) {
        return 0;
    }
    tag = alarmTag(tag);
    if (tag != mPendingWorkSource.tag) {
        KLOGI("Alarm work source tag not match: %s : %s", tag.c_str(),
              mPendingWorkSource.tag.c_str());
        mHasPendingWorkSource = false;
        return -2;
    }
    alarm_record alarm = mPendingWorkSource;
    if (uid >= 10000 && uid <= 19999) {
        alarm.name = name;
        if (name == "null") {
            String8 package;
            if (PackageProperty::getInstance()->queryPackageByUid(uid, package) >= 0 &&
                package.length() > 0) {
                alarm.name = package.c_str();
            }
        }
    }
    mAlarms.push_back(alarm);
    if (finished == 1) {
        mHasPendingWorkSource = false;
        if (mWaitingWorkSource) {
            closeBatch();
        }
    }
    return 0;
}

int32_t SystemHandler::checkAlarmWakeup(int64_t wake) {
    KLOGI("Receive alarm wakeup delayed message");
    if (mAlarmHistory.empty()) {
        return -2;
    }
    Parcel rows;
    int32_t count = 0;
    for (auto it = mAlarmHistory.begin(); it != mAlarmHistory.end();) {
        if (it->empty()) {
            it = mAlarmHistory.erase(it);
            continue;
        }
        const int64_t first = it->front().time;
        if (first > wake + kAlarmWakeWindowMs) {
            ++it;
            continue;
        }
        if (first >= wake - kAlarmWakeWindowMs) {
            for (const alarm_record& a : *it) {
                rows.writeInt64(a.time);
                rows.writeString8(String8(a.name.c_str()));
                rows.writeString8(String8(a.tag.c_str()));
                rows.writeInt32(a.worksource);
                rows.writeInt32(static_cast<int32_t>(it->size()));
                ++count;
            }
        }
        it = mAlarmHistory.erase(it);
    }
    return count > 0 ? insertEntries(k_raw_applications_alarm, rows, count, false) : 0;
}

int32_t SystemHandler::handlePackage(int64_t time, const char* text, bool added) {
    int32_t uid = 0;
    std::string name;
    if (text == nullptr || text[0] == '\0') {
        return refuse("Invalid parameter");
    }
    if (parseInt(text, "uid=", "name=", &uid) < 0) {
        return refuse("Failed to parse uid");
    }
    if (parseText(text, "name=", nullptr, kNameSize, &name) < 0) {
        return refuse("Failed to parse name");
    }
    const String8 package(name.c_str());
    PackageProperty* properties = PackageProperty::getInstance();
    if (added && properties->addPackage(uid, package) < 0) {
        KLOGE("Failed to add uid=%d, name=%s", uid, name.c_str());
    } else if (!added && properties->removePackage(uid, package) < 0) {
        KLOGE("Failed to remove uid=%d, name=%s", uid, name.c_str());
    }
    Parcel note;
    note.writeInt64(time);
    note.writeInt32(uid);
    note.writeString8(package);
    sendNotification(added ? NOTIFICATION_PACKAGE_ADDED : NOTIFICATION_PACKAGE_REMOVED, note);
    String8 version;
    if (added) {
        Parcel reply;
        if (PackageManager::getInstance()->getPackageVersion(package, &reply) >= 0) {
            reply.setDataPosition(0);
            reply.readString8(&version);
        }
    }
    Parcel state;
    state.writeInt64(time);
    state.writeInt32(added ? 1 : 0);
    state.writeString8(package);
    state.writeString8(version);
    insertEntries(k_raw_package_state, state, 1, false);
    const String8 condition =
        String8::format("name = %s", KelvoUtils::quoteSqlText(name.c_str()).c_str());
    if (added) {
        // One row per name: the newest version replaces the older ones.
        Parcel row;
        row.writeInt64(time);
        row.writeString8(package);
        row.writeString8(version);
        updateEntries(k_raw_package_version, row, condition.c_str());
        KLOGD("uid: %d, package: %s, version: %s", uid, name.c_str(), version.c_str());
    } else {
        deleteEntries(k_raw_package_version.name, condition.c_str());
        KLOGD("uid: %d, package: %s", uid, name.c_str());
    }
    return 0;
}

int32_t SystemHandler::handleUidRemoved(const char* text) {
    int32_t uid = 0;
    if (parseInt(text, "uid=", nullptr, &uid) < 0) {
        return refuse("Failed to parse uid");
    }
    if (PackageProperty::getInstance()->removeUid(uid) < 0) {
        KLOGE("Failed to remove uid=%d", uid);
    }
    Parcel note;
    note.writeInt32(uid);
    return sendNotification(NOTIFICATION_UID_REMOVED, note);
}

int32_t SystemHandler::handleBootCompleted(int64_t time) {
    Parcel note;
    note.writeInt64(time);
    sendNotification(NOTIFICATION_BOOT_COMPLETED, note);
    insertStartUp(time, 1);
    Parcel reply;
    int32_t rows = 0;
    int32_t ret =
        queryEntriesSimple(String8("SELECT COUNT(*) FROM raw_package_version"), &reply, 1, rows);
    // COUNT(*) always answers one row: the list is missing when it says 0.
    if (ret >= 0 && rows == 1 && reply.readInt64() == 0) {
        int32_t request = 0;
        ret = BufferedLogServer::getInstance()->requestLogMessage(String8(kBufferedSender),
                                                                  kRequestPackageList, &request, 0);
        if (ret < 0) {
            KLOGE("Failed to check package list: %d", ret);
        }
    } else if (ret < 0) {
        KLOGE("Failed to check package list: %d", ret);
    }
    if (mStatsUser) {
        if (KelvoDevice::setBinderStatsEnable(true) < 0) {
            KLOGE("Failed to enable binder stats logging");
        }
        mBinderPrevious = time;
    }
    return 0;
}

int32_t SystemHandler::handleShutDown(int64_t time) {
    Parcel note;
    note.writeInt64(time);
    sendNotification(NOTIFICATION_SHUT_DOWN, note);
    int32_t ret = readDdr(time);
    if (ret < 0) {
        KLOGE("Failed to get ddr frequency: %d", ret);
    }
    insertStartUp(time, 2);
    KLOGI("Receive system shut down message, force to flush all entries");
    return sendMessageDelayed(ms2ns(kShutDownFlushDelayMs),
                              ParcelMessage(MESSAGE_CUSTOMIZED, MESSAGE_FLUSH_ALL, Parcel()));
}

int32_t SystemHandler::handlePhoneState(int64_t time, const char* text) {
    int32_t subId = 0;
    int32_t state = 0;
    int32_t ret = parseInt(text, "subId=", "state=", &subId);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse subId, ret: %d", ret);
        return -19;
    }
    ret = parseInt(text, "state=", nullptr, &state);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse state, ret: %d", ret);
        return -19;
    }
    if (state < 0 || state > 2) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Invalid state: %d", state);
        return -5;
    }
    Parcel note;
    note.writeInt64(time);
    note.writeInt32(state);
    note.writeInt32(subId);
    return sendNotification(NOTIFICATION_PHONE_STATE_CHANGED, note);
}

int32_t SystemHandler::handleRecord(int64_t time, int32_t tag, const char* text) {
    Parcel row;
    row.writeInt64(time);
    const table_attribute* table = nullptr;
    int32_t v[7] = {};
    std::string a;
    std::string b;
    bool ok = true;
    switch (tag) {
        case TAG_WAKE_STATUS: {
            static const char* const kKeys[] = {
                "ap=", "modem=", "hifi=", "iomcu=", "sevra=", "hotplug0=", "hotplug1="};
            for (int i = 0; ok && i < 7; ++i) {
                ok = parseInt(text, kKeys[i], i < 6 ? kKeys[i + 1] : nullptr, &v[i]) == 0;
                row.writeInt32(v[i]);
            }
            table = &k_raw_wake_status;
            break;
        }
        case TAG_FREEZING_FAILED:
        case TAG_AP_WAKE_IRQ:
            ok = parseText(text, "name=", nullptr, kNameSize, &a) == 0;
            row.writeString8(String8(a.c_str()));
            table = tag == TAG_AP_WAKE_IRQ ? &k_raw_ap_wake_irq : &k_raw_freezing_failed;
            if (tag == TAG_AP_WAKE_IRQ && mChargerOnline) {
                return 0;
            }
            break;
        case TAG_MODEM_WAKEUP_SOURCE:
            ok = parseInt(text, "type=", "source=", &v[0]) == 0 &&
                 parseText(text, "source=", nullptr, 256, &a) == 0;
            row.writeInt32(v[0]);
            row.writeString8(String8(a.c_str()));
            table = &k_raw_modem_wakeup_source;
            break;
        case TAG_WAKEUP_PACKET: {
            ok = parseInt(text, "net=", "uid=", &v[0]) == 0 &&
                 parseInt(text, "uid=", "pid=", &v[1]) == 0 &&
                 parseInt(text, "pid=", "protocol=", &v[2]) == 0 &&
                 parseInt(text, "protocol=", nullptr, &v[3]) == 0;
            String8 name;
            if (ok &&
                (PackageProperty::getInstance()->queryPackageByUidAndPid(v[1], v[2], name) < 0 ||
                 name.length() == 0)) {
                name = String8::format("uid_%d", v[1]);
            }
            row.writeString8(name);
            row.writeInt32(v[0]);
            row.writeInt32(v[3]);
            table = &k_raw_wake_up_packet;
            break;
        }
        case TAG_SENSORHUB_WAKE: {
            long long data = LLONG_MIN;
            ok = parseMessage(text, "data=", nullptr, "%lld", &data, sizeof(data)) == 0 &&
                 data >= 0 && data <= UINT32_MAX;
            row.writeInt32(static_cast<int32_t>(data >> 16));
            row.writeInt32(static_cast<int32_t>(data & 0xFFFF));
            table = &k_raw_sensorhub_wake;
            break;
        }
        case TAG_CLOUD_UPDATE:
            ok = parseText(text, "module=", "version=", kNameSize, &a) == 0 &&
                 parseText(text, "version=", nullptr, kNameSize, &b) == 0;
            if (ok) {
                row.writeString8(String8(a.c_str()));
                row.writeString8(String8(b.c_str()));
                String8 condition =
                    String8::format("module = %s", KelvoUtils::quoteSqlText(a.c_str()).c_str());
                return updateEntries(k_module_cloud_update, row, condition.c_str());
            }
            break;
        case TAG_PM_SCENE:
            ok = parseInt(text, "scene=", "name=", &v[0]) == 0 &&
                 parseText(text, "name=", "state=", kNameSize, &a) == 0 &&
                 parseInt(text, "state=", nullptr, &v[1]) == 0;
            row.writeString8(String8(a.c_str()));
            row.writeInt32(v[0]);
            row.writeInt32(v[1]);
            table = &k_raw_pelmora_scene;
            break;
        case TAG_APP_WAKEUP:
            ok = parseText(text, "procname=", "source=", kNameSize, &a) == 0 &&
                 parseText(text, "source=", "gpio=", kNameSize, &b) == 0 &&
                 parseInt(text, "gpio=", nullptr, &v[0]) == 0;
            if (v[0] >= 1) {
                b = "GPIO" + std::to_string(v[0]);
            }
            row.writeString8(String8(a.c_str()));
            row.writeString8(String8(b.c_str()));
            table = &k_raw_app_wakeup;
            break;
        default:
            KLOGE("Unknown message type: %d", tag);
            return -3;
    }
    if (!ok || table == nullptr) {
        return refuse("Failed to parse message");
    }
    return insertEntries(*table, row, 1, false);
}

namespace {

// The items of a comma-separated list; empty or over-long items are left
// out, so that the caller's count check refuses the record.
std::vector<std::string> splitList(const std::string& text, size_t maxItem) {
    std::vector<std::string> list;
    for (size_t start = 0; start <= text.size();) {
        size_t comma = text.find(',', start);
        if (comma == std::string::npos) {
            comma = text.size();
        }
        if (comma > start && comma - start < maxItem) {
            list.push_back(text.substr(start, comma - start));
        }
        start = comma + 1;
    }
    return list;
}

// A whole decimal number in [min, max].
bool parseWhole(const std::string& text, long long min, long long max, long long* out) {
    if (text.empty() || text.size() > 19) {
        return false;
    }
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(text.c_str(), &end, 10);
    if (errno != 0 || end == nullptr || *end != '\0' || value < min || value > max) {
        return false;
    }
    *out = value;
    return true;
}

int32_t refuseCount(const char* what, int32_t count, size_t items) {
    HealthCounters::add(Health::LoggerMessageRefused);
    KLOGE("Invalid %s count: %d, names: %zu", what, count, items);
    return -5;
}

}  // namespace

int32_t SystemHandler::handleStrategy(int64_t time, const char* text) {
    int32_t type = 0;
    int32_t count = 0;
    int32_t update = 0;
    char buffer[4096] = {};
    if (parseMessage(text, "name=", "type=", "%s", buffer, sizeof(buffer)) < 0 ||
        parseInt(text, "type=", "count=", &type) < 0 ||
        parseInt(text, "count=", "update=", &count) < 0 ||
        parseInt(text, "update=", nullptr, &update) < 0) {
        return refuse("Failed to parse message");
    }
    const std::vector<std::string> list = splitList(buffer, kNameSize);
    if (count < 1 || count > kMaxStrategyNames || static_cast<size_t>(count) != list.size()) {
        return refuseCount("strategy", count, list.size());
    }
    if (update == 1) {
        // Once for the whole list: the type's rows become these names.
        deleteEntries(k_raw_pelmora_strategy.name, String8::format("type = %d", type).c_str());
    }
    Parcel rows;
    for (const std::string& name : list) {
        rows.writeInt64(time);
        rows.writeString8(String8(name.c_str()));
        rows.writeInt32(type);
    }
    return insertEntries(k_raw_pelmora_strategy, rows, count, false);
}

int32_t SystemHandler::handleLocationCounter(int64_t time, const char* text) {
    int32_t num = 0;
    char counts[4096] = {};
    char names[4096] = {};
    if (parseInt(text, "num=", "count=", &num) < 0 ||
        parseMessage(text, "count=", "name=", "%s", counts, sizeof(counts)) < 0 ||
        parseMessage(text, "name=", nullptr, "%s", names, sizeof(names)) < 0) {
        return refuse("Failed to parse message");
    }
    const std::vector<std::string> countList = splitList(counts, 12);
    const std::vector<std::string> nameList = splitList(names, kNameSize);
    if (num < 1 || num > kMaxStrategyNames || static_cast<size_t>(num) != nameList.size() ||
        nameList.size() != countList.size()) {
        return refuseCount("location counter", num, nameList.size());
    }
    Parcel rows;
    for (int32_t i = 0; i < num; ++i) {
        long long value = 0;
        if (!parseWhole(countList[i], 0, INT32_MAX, &value)) {
            return refuse("Failed to parse message");
        }
        KLOGI("id: %d, timestamp: %lld, name: %s, number: %lld", i, static_cast<long long>(time),
              nameList[i].c_str(), value);
        rows.writeInt64(time);
        rows.writeString8(String8(nameList[i].c_str()));
        rows.writeInt32(static_cast<int32_t>(value));
    }
    return insertEntries(k_raw_location_counter, rows, num, false);
}

int32_t SystemHandler::handleAppType(int64_t time, const char* text) {
    int32_t count = 0;
    int32_t flag = -1;
    char names[4096] = {};
    char types[4096] = {};
    const bool hasTypes = strstr(text, " type=") != nullptr;
    if (parseInt(text, "count=", "flag=", &count) < 0 ||
        parseInt(text, "flag=", "name=", &flag) < 0 ||
        parseMessage(text, "name=", hasTypes ? "type=" : nullptr, "%s", names, sizeof(names)) < 0 ||
        (hasTypes && parseMessage(text, "type=", nullptr, "%s", types, sizeof(types)) < 0)) {
        return refuse("Failed to parse message");
    }
    if (flag != 0 && flag != 1) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Invalid flag: %d", flag);
        return -5;
    }
    const std::vector<std::string> nameList = splitList(names, kNameSize);
    const std::vector<std::string> typeList = splitList(types, 20);
    if (count < 1 || count > kMaxStrategyNames || static_cast<size_t>(count) != nameList.size() ||
        (flag == 1 && typeList.size() != nameList.size())) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Invalid app count: %d, flag: %d", count, flag);
        return -5;
    }
    // Every type is checked before anything is recorded.
    std::vector<long long> typeValues(typeList.size());
    for (size_t i = 0; flag == 1 && i < typeList.size(); ++i) {
        if (!parseWhole(typeList[i], 1, INT32_MAX, &typeValues[i])) {
            return refuse("Failed to parse message");
        }
    }
    PackageProperty* packages = PackageProperty::getInstance();
    Parcel rows;
    int32_t added = 0;
    for (int32_t i = 0; i < count; ++i) {
        const String8 name(nameList[i].c_str());
        if (flag == 0) {
            Parcel forget;
            forget.writeString8(name);
            forget.setDataPosition(0);
            packages->removePackageType(forget);
            deleteEntries(
                k_raw_app_type.name,
                String8::format("name = %s", KelvoUtils::quoteSqlText(nameList[i].c_str()).c_str())
                    .c_str());
            continue;
        }
        const long long type = typeValues[i];
        if (packages->getPackageType(name) != 0) {
            KLOGI("App type exist, name: %s", name.c_str());
            continue;
        }
        Parcel record;
        record.writeInt64(time);
        record.writeString8(name);
        record.writeInt64(type);
        record.setDataPosition(0);
        packages->addPackageType(record);
        rows.writeInt64(time);
        rows.writeString8(name);
        rows.writeInt64(type);
        ++added;
    }
    return added > 0 ? insertEntries(k_raw_app_type, rows, added, false) : 0;
}

int32_t SystemHandler::insertMiscData(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    String8 name;
    String8 value;
    if (data.readInt64(&time) != android::NO_ERROR || data.readString8(&name) != android::NO_ERROR ||
        data.readString8(&value) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid misc data");
        return -5;
    }
    Parcel row;
    row.writeInt64(time);
    row.writeString8(name);
    row.writeString8(value);
    return insertEntries(k_daily_misc_data, row, 1, false);
}

int32_t SystemHandler::insertErrorLog(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    String8 line;
    if (data.readInt64(&time) != android::NO_ERROR || data.readString8(&line) != android::NO_ERROR) {
        HealthCounters::add(Health::ErrorRowsDropped);
        return -5;
    }
    Parcel row;
    row.writeInt64(time);
    row.writeString8(line);
    return insertEntries(k_debug_error_log, row, 1, false);
}

int32_t SystemHandler::handleCustomized(int32_t code, const Parcel& data, Parcel*) {
    data.setDataPosition(0);
    switch (code) {
        case MESSAGE_ALARM_WAKEUP_CHECK:
            return checkAlarmWakeup(data.readInt64());
        case MESSAGE_ALARM_TIMEOUT:
            KLOGI("Receive wakeup alarm delayed message");
            mAlarmTimeoutId = -1;
            mAlarms.clear();
            mBatchCounter = 0;
            mWaitingWorkSource = false;
            mAccepting = false;
            return 0;
        case MESSAGE_MISC_DATA:
            return insertMiscData(data);
        case MESSAGE_ERROR_LOG:
            return insertErrorLog(data);
        case MESSAGE_FLUSH_ALL:
            KLOGD("Flush all entries before system shut down");
            KelvoAgent::getInstance()->forceFlushDatabase();
            return 0;
        case MESSAGE_WIFI_WAKE_CHECK:
            return checkWifiWake(data.readInt64());
        default:
            KLOGE("Unknown customized tag: %d", code);
            return -3;
    }
}

bool SystemHandler::shouldLogRepeat(int32_t cause, int64_t time) {
    const int64_t hour = hourOf(time);
    if (mRepeatHour[cause] == hour) {
        return false;
    }
    mRepeatHour[cause] = hour;
    return true;
}

int32_t SystemHandler::readMemory(int64_t time) {
    std::ifstream in(RootPath::resolve(kMemInfoPath));
    if (!in.is_open()) {
        if (shouldLogRepeat(REPEAT_MEMINFO, time)) {
            KLOGE("Failed to open %s", kMemInfoPath);
        }
        return -14;
    }
    int64_t values[2] = {-1, -1};
    static const char* const kKeys[2] = {"MemFree:", "MemAvailable:"};
    std::string line;
    while (std::getline(in, line) && (values[0] < 0 || values[1] < 0)) {
        for (int32_t i = 0; i < 2; ++i) {
            if (line.compare(0, strlen(kKeys[i]), kKeys[i]) == 0) {
                long long kb = -1;
                if (sscanf(line.c_str() + strlen(kKeys[i]), "%lld kB", &kb) == 1) {
                    values[i] = kb;
                }
            }
        }
    }
    int32_t ranges[2] = {memoryRange(values[0]), memoryRange(values[1])};
    if (ranges[0] < 0 || ranges[1] < 0) {
        HealthCounters::add(Health::SystemReadingsRefused);
        if (shouldLogRepeat(REPEAT_MEMORY_VALUE, time)) {
            KLOGE("Invalid size");
        }
        return -1;
    }
    Parcel rows;
    for (int32_t i = 0; i < 2; ++i) {
        rows.writeInt64(time);
        rows.writeString8(String8(kKeys[i]));
        rows.writeInt32(ranges[i]);
    }
    KLOGD("Memory distribution: free(%d), available(%d)", ranges[0], ranges[1]);
    return insertEntries(k_raw_memory_range, rows, 2, false);
}

int32_t SystemHandler::readKernelWakelocks(int64_t time) {
    std::vector<KernelWakelockReader::increment> increments;
    int32_t ret = mKernelWakelocks.read(RootPath::resolve(kWakeupSourcesPath), &increments);
    if (ret < 0) {
        if (shouldLogRepeat(REPEAT_WAKEUP_SOURCES, time)) {
            KLOGE("Failed to open %s: %d", kWakeupSourcesPath, ret);
        }
        return ret;
    }
    // Rows cover exactly the screen-off periods on battery.
    if (mScreenOn || mChargerOnline || increments.empty()) {
        return 0;
    }
    Parcel rows;
    for (const KernelWakelockReader::increment& inc : increments) {
        rows.writeInt64(time);
        rows.writeString8(String8(inc.name.c_str()));
        rows.writeInt32(inc.count);
        rows.writeInt64(inc.time);
    }
    return insertEntries(k_raw_kernel_wakelock, rows, static_cast<int32_t>(increments.size()),
                         false);
}

int32_t SystemHandler::readPartialWakelocks(int64_t time) {
    std::vector<android::String16> records;
    int32_t ret = WakelockManager::getInstance()->getPartialWakelocks(records);
    if (ret < 0) {
        if (shouldLogRepeat(REPEAT_PARTIAL, time)) {
            KLOGE("Failed to get partial wakelock data");
        }
        return -2;
    }
    std::vector<std::string> texts;
    texts.reserve(records.size());
    for (const android::String16& r : records) {
        texts.emplace_back(String8(r).c_str());
    }
    std::vector<PartialWakelockTracker::increment> increments;
    mPartialWakelocks.update(texts, &increments);
    Parcel rows;
    int32_t count = 0;
    for (PartialWakelockTracker::increment& inc : increments) {
        if (inc.name == "NULL") {
            String8 package;
            if (PackageProperty::getInstance()->queryPackageByUid(inc.uid, package) < 0 ||
                package.length() == 0) {
                KLOGE("Can not find name for uid=%d", inc.uid);
                continue;
            }
            inc.name = package.c_str();
        }
        rows.writeInt64(time);
        rows.writeInt32(inc.uid);
        rows.writeString8(String8(inc.name.c_str()));
        rows.writeString8(String8(inc.tag.c_str()));
        rows.writeInt64(inc.duration);
        ++count;
    }
    return count > 0 ? insertEntries(k_raw_partial_wakelock, rows, count, false) : 0;
}

int32_t SystemHandler::readDdr(int64_t time) {
    const std::string path = RootPath::resolve(kDdrPath);
    if (mDdrLevels == 0) {
        mDdrLevels = std::max(0, DdrFrequencyReader::countLevels(path));
        if (mDdrLevels == 0) {
            return -2;
        }
    }
    std::vector<std::pair<int64_t, int64_t>> increments;
    if (mDdr.read(path, false, &increments) < 0) {
        return -14;
    }
    Parcel rows;
    for (const auto& inc : increments) {
        KLOGD("Freq: %lld, Delta: %lld", static_cast<long long>(inc.first),
              static_cast<long long>(inc.second));
        rows.writeInt64(time);
        rows.writeInt64(inc.first);
        rows.writeInt64(inc.second);
    }
    return increments.empty() ? 0
                              : insertEntries(k_raw_ddr_frequency, rows,
                                              static_cast<int32_t>(increments.size()), false);
}

int32_t SystemHandler::onForegroundChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    requestBinderStats(time, 0);
    data.readString8(&mForeground);
    return 0;
}

int32_t SystemHandler::onScreenStateChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    bool on = data.readBool();
    if (!mChargerOnline && on != mScreenOn) {
        readKernelWakelocks(time);
    }
    mScreenOn = on;
    return 0;
}

int32_t SystemHandler::onChargerOnlineChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    bool online = data.readBool();
    if (!mScreenOn && online != mChargerOnline) {
        readKernelWakelocks(time);
    }
    mChargerOnline = online;
    return 0;
}

int32_t SystemHandler::onDataPolling(const Parcel& data) {
    data.setDataPosition(0);
    PollingPayload poll;
    if (PollingPayload::readFrom(data, &poll) < 0) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid polling message");
        return -5;
    }
    const bool hourly = poll.reason == POLLING_HOURLY_TICK;
    const int64_t time = hourly ? poll.hour : poll.time;
    int32_t kind = 1;
    int64_t binderTime = poll.time;
    if (poll.reason == POLLING_CHARGER) {
        kind = poll.online ? 4 : 5;
    } else if (poll.reason == POLLING_TIME_CHANGED) {
        kind = 3;
        binderTime = poll.newTime;
    } else if (hourly) {
        kind = 2;
        binderTime = poll.hour;
    }
    int32_t ret = requestBinderStats(binderTime, kind);
    if (ret < 0) {
        KLOGD("Failed to request binder stats information: %d", ret);
    }
    ret = readMemory(time);
    if (ret < 0) {
        KLOGD("Failed to handle memory: %d", ret);
    }
    if (hourly) {
        voteCandidate(poll.hour, kCandidateTick, kElectorMemory);
    }
    ret = readPartialWakelocks(time);
    if (ret < 0) {
        KLOGD("Failed to handle wakelock: %d", ret);
    }
    ret = readKernelWakelocks(time);
    if (ret < 0) {
        KLOGD("Failed to handle wakelock: %d", ret);
    }
    if (hourly) {
        voteCandidate(poll.hour, kCandidateTick, kElectorWakelock);
        int32_t request = 0;
        ret = BufferedLogServer::getInstance()->requestLogMessage(String8(kBufferedSender),
                                                                  kRequestMobilePhone, &request, 0);
        if (ret < 0) {
            KLOGD("Failed to handle mobile phone: %d", ret);
            voteCandidate(poll.hour, kCandidateTick, kElectorMobilePhone);
        } else {
            mMobileHour = poll.hour;
        }
    }
    return 0;
}

int32_t SystemHandler::onHourlyTick(const Parcel& data) {
    if (!mStatsUser) {
        return 0;
    }
    data.setDataPosition(0);
    data.readInt64();
    const int64_t hour = data.readInt64();
    int32_t ret = KelvoDevice::requestKworkerInfo(hour);
    if (ret < 0) {
        KLOGE("Failed to request kworker information: %d", ret);
        voteCandidate(hour, kCandidateTick, kElectorKworker);
    } else {
        mKworkerHour = hour;
    }
    ret = KelvoDevice::requestUeventInfo(hour);
    if (ret < 0) {
        KLOGE("Failed to request uevent information: %d", ret);
        voteCandidate(hour, kCandidateTick, kElectorUevent);
    } else {
        mUeventHour = hour;
    }
    return 0;
}

int32_t SystemHandler::requestBinderStats(int64_t time, int32_t kind) {
    if (!mStatsUser) {
        return 0;
    }
    dev_transmit_t transmit = {12, time, kind};
    int32_t ret = KelvoDevice::requestBinderStats(&transmit);
    if (ret < 0) {
        KLOGE("Failed to request binder stats: %d", ret);
        if (kind == 2) {
            voteCandidate(time, kCandidateTick, kElectorBinderStats);
        }
        return ret;
    }
    if (kind == 2) {
        mBinderHour = time;
    }
    return 0;
}

void SystemHandler::voteRemembered(int64_t* hour, int32_t candidate, uint32_t elector) {
    if (*hour >= 0) {
        voteCandidate(*hour, candidate, elector);
        *hour = -1;
    }
}

int32_t SystemHandler::handleBufferedLog(const Parcel& data) {
    data.setDataPosition(0);
    int64_t arrival = 0;
    String8 sender;
    int32_t magic = 0;
    int32_t length = 0;
    const void* bytes = nullptr;
    bool ok = data.readInt64(&arrival) == android::NO_ERROR &&
              data.readString8(&sender) == android::NO_ERROR &&
              data.readInt32(&magic) == android::NO_ERROR &&
              data.readInt32(&length) == android::NO_ERROR && length >= 1 &&
              (bytes = data.readInplace(static_cast<size_t>(length))) != nullptr;
    const uint8_t* entry = ok ? static_cast<const uint8_t*>(bytes) : nullptr;
    const size_t size = ok ? static_cast<size_t>(length) : 0;
    if (sender == kBufferedSender) {
        switch (magic) {
            case SERVICE_DAILY_STATISTICS:
                return handleDailyStatistics(entry, size);
            case SERVICE_MOBILE_PHONE:
                return handleMobilePhone(entry, size);
            case SERVICE_PACKAGE_VERSIONS:
                return handlePackageVersions(entry, size);
            default:
                break;
        }
    }
    if (sender == kDriverSender) {
        switch (magic) {
            case DRIVER_KWORKER:
                return handleKworker(entry, size);
            case DRIVER_UEVENT:
                return handleUevent(entry, size);
            case DRIVER_BINDER_STATS:
                return handleBinderStats(entry, size);
            default:
                break;
        }
    }
    HealthCounters::add(Health::BufferedEntryRefused);
    KLOGE("Unknown buffered log type: %s", sender.c_str());
    return -3;
}

namespace {

int32_t refuseEntry() {
    HealthCounters::add(Health::BufferedEntryRefused);
    KLOGE("Invalid data length");
    return -2;
}

}  // namespace

int32_t SystemHandler::handleKworker(const uint8_t* data, size_t size) {
    SystemRecords::echo head;
    std::vector<SystemRecords::kworker> entries;
    int32_t ret = SystemRecords::parseKworker(data, size, &head, &entries);
    if (ret == 0 && !entries.empty()) {
        Parcel rows;
        for (const SystemRecords::kworker& k : entries) {
            rows.writeInt64(head.time);
            rows.writeString8(String8(k.symbol.c_str()));
            rows.writeInt64(k.count);
            rows.writeInt64(k.time);
        }
        insertEntries(k_raw_kworker, rows, static_cast<int32_t>(entries.size()), false);
    }
    voteRemembered(&mKworkerHour, kCandidateTick, kElectorKworker);
    return ret < 0 ? refuseEntry() : 0;
}

int32_t SystemHandler::handleUevent(const uint8_t* data, size_t size) {
    SystemRecords::echo head;
    std::vector<SystemRecords::uevent> entries;
    int32_t ret = SystemRecords::parseUevent(data, size, &head, &entries);
    if (ret == 0 && !entries.empty()) {
        Parcel rows;
        for (const SystemRecords::uevent& u : entries) {
            rows.writeInt64(head.time);
            rows.writeString8(String8(u.devpath.c_str()));
            rows.writeInt32(u.action);
            rows.writeInt32(u.count);
        }
        insertEntries(k_raw_uevent, rows, static_cast<int32_t>(entries.size()), false);
    }
    voteRemembered(&mUeventHour, kCandidateTick, kElectorUevent);
    return ret < 0 ? refuseEntry() : 0;
}

int32_t SystemHandler::handleBinderStats(const uint8_t* data, size_t size) {
    SystemRecords::echo head;
    std::vector<SystemRecords::binder_entry> entries;
    int32_t ret = SystemRecords::parseBinderStats(data, size, &head, &entries);
    if (ret < 0) {
        // The vote of an awaited hourly answer is still cast.
        voteRemembered(&mBinderHour, kCandidateTick, kElectorBinderStats);
        return refuseEntry();
    }
    struct merged {
        SystemRecords::binder_entry e;
        int64_t forward;
        int64_t backward;
    };
    std::vector<merged> rows;
    std::map<std::pair<std::string, std::string>, size_t> index;
    PackageProperty* packages = PackageProperty::getInstance();
    for (SystemRecords::binder_entry& e : entries) {
        String8 name;
        if (packages->queryPackageByUidAndPid(e.serviceUid, e.servicePid, name) >= 0 &&
            name.length() > 0) {
            e.service = name.c_str();
        }
        name = String8();
        if (packages->queryPackageByUidAndPid(e.clientUid, e.clientPid, name) >= 0 &&
            name.length() > 0) {
            e.client = name.c_str();
        }
        auto same = index.find({e.service, e.client});
        if (same != index.end()) {
            rows[same->second].forward += e.count;
            continue;
        }
        auto swapped = index.find({e.client, e.service});
        if (swapped != index.end()) {
            rows[swapped->second].backward += e.count;
            continue;
        }
        index[{e.service, e.client}] = rows.size();
        rows.push_back({e, e.count, 0});
    }
    const std::string foreground = mForeground.c_str();
    Parcel out;
    int32_t count = 0;
    for (size_t i = 0; i < rows.size(); ++i) {
        const merged& m = rows[i];
        out.writeInt64(mBinderPrevious);
        out.writeInt64(head.time);
        out.writeString8(String8(m.e.service.c_str()));
        out.writeInt32(m.e.serviceUid);
        out.writeInt32(m.e.servicePid);
        out.writeString8(String8(m.e.client.c_str()));
        out.writeInt32(m.e.clientUid);
        out.writeInt32(m.e.clientPid);
        out.writeInt32(KelvoUtils::saturateInt32(m.forward));
        out.writeInt32(KelvoUtils::saturateInt32(m.backward));
        out.writeInt32(
            !foreground.empty() && (foreground == m.e.service || foreground == m.e.client) ? 1 : 0);
        out.writeInt32(mScreenOn ? 1 : 0);
        out.writeInt32(mChargerOnline ? 1 : 0);
        if (++count == kMaxRowsPerInsert || i + 1 == rows.size()) {
            insertEntries(k_raw_binder_stats, out, count, false);
            out.setDataSize(0);
            out.setDataPosition(0);
            count = 0;
        }
    }
    mBinderPrevious = head.time;
    if (head.reason == 2) {
        voteRemembered(&mBinderHour, kCandidateTick, kElectorBinderStats);
    }
    return 0;
}

int32_t SystemHandler::handleMobilePhone(const uint8_t* data, size_t size) {
    std::vector<SystemRecords::mobile_phone> entries;
    int32_t ret = SystemRecords::parseMobilePhone(data, size, &entries);
    KLOGD("size=%zu", entries.size());
    if (ret == 0 && !entries.empty()) {
        const int64_t time = TimeProvider::getCurrentTime(TIME_TYPE_WALL);
        Parcel rows;
        for (const SystemRecords::mobile_phone& m : entries) {
            rows.writeInt64(time);
            rows.writeInt32(m.subId);
            rows.writeInt32(m.mcc);
            rows.writeInt32(m.mnc);
            rows.writeInt32(m.dataSwitch);
            rows.writeInt32(m.voiceSwitch);
        }
        insertEntries(k_raw_mobile_phone, rows, static_cast<int32_t>(entries.size()), false);
    }
    voteRemembered(&mMobileHour, kCandidateTick, kElectorMobilePhone);
    return ret < 0 ? refuseEntry() : 0;
}

int32_t SystemHandler::handlePackageVersions(const uint8_t* data, size_t size) {
    std::vector<SystemRecords::package_version> entries;
    if (SystemRecords::parsePackageVersions(data, size, &entries) < 0) {
        return refuseEntry();
    }
    const int64_t time = TimeProvider::getCurrentTime(TIME_TYPE_WALL);
    for (const SystemRecords::package_version& p : entries) {
        Parcel row;
        row.writeInt64(time);
        row.writeString8(String8(p.name.c_str()));
        row.writeString8(String8(p.version.c_str()));
        updateEntries(
            k_raw_package_version, row,
            String8::format("name = %s", KelvoUtils::quoteSqlText(p.name.c_str()).c_str()).c_str());
    }
    return 0;
}

int32_t SystemHandler::handleDailyStatistics(const uint8_t* data, size_t size) {
    SystemRecords::daily_statistics record;
    if (SystemRecords::parseDailyStatistics(data, size, &record) < 0) {
        return refuseEntry();
    }
    static const char* const kNames[] = {
        "storage_sdcard",           "storage_usb",
        "settings_wlan_connection", "settings_mobile_connection",
        "settings_power_saving",    "settings_aod",
        "settings_face_unlock",     "settings_inscreen_unlock",
    };
    const int64_t time = record.day;
    Parcel rows;
    auto add = [&rows, time](const char* name, long long value) {
        rows.writeInt64(time);
        rows.writeString8(String8(name));
        rows.writeString8(String8::format("%lld", value));
    };
    add("storage_free", record.free);
    add("storage_available", record.available);
    for (int i = 0; i < 8; ++i) {
        add(kNames[i], record.settings[i]);
    }
    insertEntries(k_daily_misc_data, rows, 10, false);
    KLOGI(
        "Free: %lld, Available: %lld, Sdcard: %d, Usb: %d, Wlan: %d, Mobile: %d, Power "
        "saving: %d, Aod: %d, Face: %d, Inscreen: %d",
        static_cast<long long>(record.free), static_cast<long long>(record.available),
        record.settings[0], record.settings[1], record.settings[2], record.settings[3],
        record.settings[4], record.settings[5], record.settings[6], record.settings[7]);
    mDailyStatistics = record;
    mDailyRecordSinceUpload = true;
    voteRemembered(&mDailyHour, kCandidateDailyTick, kElectorDailyRecord | kElectorDailyStatistics);
    return 0;
}

int32_t SystemHandler::onDailyTick(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    const int64_t hour = data.readInt64();
    int32_t request = 0;
    int32_t ret = BufferedLogServer::getInstance()->requestLogMessage(
        String8(kBufferedSender), kRequestDailyStatistics, &request, 0);
    uint32_t elector = kElectorDdr;
    if (ret < 0) {
        KLOGE("Failed to handle storage: %d", ret);
        elector |= kElectorDailyRecord | kElectorDailyStatistics;
    } else {
        mDailyHour = hour;
    }
    readDdr(hour);
    voteCandidate(hour, kCandidateDailyTick, elector);
    ErrorLogger::setCounter(0);
    SystraceDumper::getInstance()->setDumpCount(0);
    mKernelWakelocks.prune();
    mPartialWakelocks.prune();
    return 0;
}

int32_t SystemHandler::onApplicationsAccounting(const Parcel& data) {
    data.setDataPosition(0);
    int64_t hour = data.readInt64();
    logApplicationsAccounting(hour);
    return voteCandidate(hour, kCandidateApplications, kApplicationsVote);
}

int32_t SystemHandler::onComponentAccounting(const Parcel& data) {
    data.setDataPosition(0);
    int64_t hour = data.readInt64();
    logComponentAccounting(hour);
    return voteCandidate(hour, kCandidateComponent, kComponentVote);
}

int32_t SystemHandler::logHourlyQuery(const char* sql, const table_attribute& table,
                                      int32_t columns, int64_t hour, const char* failure) {
    Parcel reply;
    int32_t rows = 0;
    String8 query =
        String8::format(sql, static_cast<long long>(hour - kHourMs), static_cast<long long>(hour));
    if (queryEntriesSimple(query, &reply, columns, rows) < 0) {
        KLOGE("%s", failure);
        return -17;
    }
    if (rows == 0) {
        return 0;
    }
    return logSimpleQueryResult(table, reply, hour);
}

int32_t SystemHandler::logApplicationsAccounting(int64_t hour) {
    forceFlushEntries();
    logHourlyQuery(
        "SELECT name, tag, worksource, SUM(1000/count) FROM raw_applications_alarm WHERE "
        "timestamp > %lld AND timestamp <= %lld GROUP BY name, tag",
        k_hourly_applications_alarm, 4, hour, "Failed to query raw wakeup alarm data");
    logHourlyQuery(
        "SELECT name, tag, SUM(duration) FROM raw_partial_wakelock WHERE timestamp > %lld AND "
        "timestamp <= %lld GROUP BY name, tag",
        k_hourly_applications_partial_wakelock, 3, hour, "Failed to query raw partial wakelock");
    logHourlyQuery(
        "SELECT name, SUM(count), SUM(duration) FROM raw_kernel_wakelock WHERE timestamp > %lld "
        "AND timestamp <= %lld GROUP BY name",
        k_hourly_applications_kernel_wakelock, 3, hour, "Failed to query raw kernel wakelock");
    return 0;
}

int32_t SystemHandler::logComponentAccounting(int64_t hour) {
    forceFlushEntries();
    logHourlyQuery(
        "SELECT source, COUNT(source) FROM raw_wake_up_source WHERE timestamp > %lld AND "
        "timestamp <= %lld GROUP BY source",
        k_hourly_wake_up_source, 2, hour, "Failed to query raw wakeup alarm data");
    // Suspends split on the hour start exactly at it: [H-1h, H).
    Parcel reply;
    int32_t rows = 0;
    String8 query = String8::format(
        "SELECT COUNT(id), SUM(resume-suspend) FROM raw_system_suspend WHERE suspend >= %lld "
        "AND suspend < %lld",
        static_cast<long long>(hour - kHourMs), static_cast<long long>(hour));
    if (queryEntriesSimple(query, &reply, 2, rows) < 0 || rows != 1) {
        KLOGE("Failed to query raw wakeup alarm data");
        return -17;
    }
    int64_t count = reply.readInt64();
    int64_t duration = reply.readInt64();
    if (count < 1) {
        return 0;
    }
    Parcel row;
    row.writeInt64(hour);
    row.writeInt32(KelvoUtils::saturateInt32(duration));
    row.writeInt32(KelvoUtils::saturateInt32(count));
    return insertEntries(k_hourly_system_suspend, row, 1, false);
}

namespace {

constexpr uint32_t kClassPackage = 903009063;

// Runs a query and hands each row's reply position to the reader; the
// number of rows, or -17.
int32_t forEachRow(const String8& sql, int32_t columns,
                   const std::function<void(const Parcel&)>& read) {
    Parcel reply;
    int32_t rows = 0;
    if (StorageOperator::queryEntriesSimple(sql, &reply, columns, rows) < 0) {
        return -17;
    }
    for (int32_t r = 0; r < rows; ++r) {
        read(reply);
    }
    return rows;
}

void formPackage(uint32_t id, const String8& name, Parcel& out) {
    Parcel package;
    DataUploader::formVarcharData(0, name.c_str(), SystemHandler::kMaxUploadName + 1, package);
    DataUploader::formClassData(id, kClassPackage, package, out);
}

}  // namespace

void SystemHandler::formComponentData(int64_t end, int64_t window, Parcel& out) {
    const long long from = end - window;
    const long long to = end;
    int32_t ret = forEachRow(
        String8::format("SELECT source, SUM(count) FROM hourly_wake_up_source WHERE timestamp > "
                        "%lld AND timestamp <= %lld GROUP BY source ORDER BY SUM(count) DESC "
                        "LIMIT %d",
                        from, to, kTopSources),
        2, [&out](const Parcel& r) {
            Parcel e;
            DataUploader::formVarcharData(0, r.readString8().c_str(), kMaxUploadName + 1, e);
            DataUploader::formIntData(1, r.readInt64(), e);
            DataUploader::formClassArray(29, 903009023, e, out);
        });
    if (ret < 0) {
        KLOGE("Failed to query wake up source data: %d", ret);
    }
    ret = forEachRow(
        String8::format("SELECT name, tag, SUM(count) FROM hourly_applications_alarm WHERE "
                        "timestamp > %lld AND timestamp <= %lld GROUP BY name, tag ORDER BY "
                        "SUM(count) DESC LIMIT %d",
                        from, to, kTopApplications),
        3, [&out](const Parcel& r) {
            String8 name = r.readString8();
            String8 tag = r.readString8();
            Parcel e;
            formPackage(3, name, e);
            formPackage(4, tag, e);
            int32_t type = PackageProperty::getInstance()->getPackageType(name);
            if (type >= 1) {
                DataUploader::formIntData(5, type, e);
            }
            DataUploader::formIntData(2, r.readInt64(), e);
            DataUploader::formClassArray(30, 903009024, e, out);
        });
    if (ret < 0) {
        KLOGE("Failed to query applications alarm data: %d", ret);
    }
    ret = forEachRow(
        String8::format("SELECT name, tag, SUM(duration) FROM "
                        "hourly_applications_partial_wakelock WHERE timestamp > %lld AND "
                        "timestamp <= %lld GROUP BY name, tag ORDER BY SUM(duration) DESC LIMIT "
                        "%d",
                        from, to, kTopApplications),
        3, [&out](const Parcel& r) {
            String8 name = r.readString8();
            String8 tag = r.readString8();
            int64_t duration = r.readInt64();
            KLOGD("%s %s %lld", name.c_str(), tag.c_str(), static_cast<long long>(duration));
            Parcel e;
            formPackage(5, name, e);
            formPackage(6, tag, e);
            int32_t type = PackageProperty::getInstance()->getPackageType(name);
            if (type >= 1) {
                DataUploader::formIntData(8, type, e);
            }
            DataUploader::formIntData(3, duration, e);
            DataUploader::formClassArray(31, 903009025, e, out);
        });
    if (ret < 0) {
        KLOGE("Failed to query partial wakelock data: %d", ret);
    }
    ret = forEachRow(
        String8::format("SELECT name, SUM(count), SUM(duration) FROM "
                        "hourly_applications_kernel_wakelock WHERE timestamp > %lld AND "
                        "timestamp <= %lld AND name != 'PowerManagerService.Display' AND name != "
                        "'PowerManagerService.WakeLocks' AND name != 'charge_wakelock' AND name "
                        "!= 'usb_wake_lock' GROUP BY name ORDER BY SUM(duration) DESC LIMIT %d",
                        from, to, kTopApplications),
        3, [&out](const Parcel& r) {
            String8 name = r.readString8();
            int64_t count = r.readInt64();
            int64_t duration = r.readInt64();
            KLOGD("%s %lld %lld", name.c_str(), static_cast<long long>(count),
                  static_cast<long long>(duration));
            Parcel e;
            DataUploader::formVarcharData(0, name.c_str(), kMaxUploadName + 1, e);
            DataUploader::formIntData(1, count, e);
            DataUploader::formIntData(2, duration, e);
            DataUploader::formClassArray(32, 903009026, e, out);
        });
    if (ret < 0) {
        KLOGE("Failed to query kernel wakelock data: %d", ret);
    }
}

void SystemHandler::formStatisticsData(int64_t end, Parcel& out) {
    const long long from = end - kDayMs;
    const long long to = end;
    int32_t ret = forEachRow(
        String8::format("SELECT COUNT(*), SUM(duration) FROM hourly_system_suspend WHERE "
                        "timestamp > %lld AND timestamp <= %lld",
                        from, to),
        2, [&out](const Parcel& r) {
            if (r.readInt64() > 0) {
                int64_t duration = r.readInt64();
                KLOGD("duration: %lld", static_cast<long long>(duration));
                DataUploader::formIntData(9, duration, out);
            }
        });
    if (ret < 0) {
        KLOGE("Failed to query sum system suspend data: %d", ret);
    }
    ret = forEachRow(
        String8::format("SELECT freq, SUM(duration) FROM raw_ddr_frequency WHERE timestamp > "
                        "%lld AND timestamp <= %lld GROUP BY freq",
                        from, to),
        2, [&out](const Parcel& r) {
            Parcel e;
            DataUploader::formIntData(1, r.readInt64(), e);
            DataUploader::formIntData(2, r.readInt64(), e);
            DataUploader::formClassArray(15, 903009030, e, out);
        });
    if (ret < 0) {
        KLOGE("Failed to query ddr frequency data: %d", ret);
    }
}

void SystemHandler::formUserData(int64_t end, Parcel& out) {
    // The day's statistics only when a record arrived since the last upload.
    if (mDailyRecordSinceUpload) {
        const SystemRecords::daily_statistics& d = mDailyStatistics;
        DataUploader::formIntData(2, d.settings[0], out);
        DataUploader::formIntData(3, d.settings[1], out);
        DataUploader::formIntData(10, d.free, out);
        DataUploader::formIntData(11, d.available, out);
        DataUploader::formIntData(14, d.settings[2], out);
        DataUploader::formIntData(15, d.settings[3], out);
        DataUploader::formIntData(16, d.settings[4], out);
        DataUploader::formIntData(17, d.settings[5], out);
        DataUploader::formIntData(18, (d.settings[6] == 1 ? 1 : 0) | (d.settings[7] == 1 ? 2 : 0),
                                  out);
        mDailyRecordSinceUpload = false;
    }
    if (forEachRow(
            String8("SELECT module, version FROM module_cloud_update"), 2, [&out](const Parcel& r) {
                Parcel e;
                DataUploader::formVarcharData(0, r.readString8().c_str(), kMaxUploadName + 1, e);
                DataUploader::formVarcharData(1, r.readString8().c_str(), 33, e);
                DataUploader::formClassArray(13, 903009044, e, out);
            }) < 0) {
        KLOGE("Failed to query module cloud update information");
    }
    // Mobile-phone data: read for the debug output only (nothing uploaded).
    const long long from = end - kDayMs;
    const long long to = end;
    if (forEachRow(String8::format("SELECT COUNT(*), SUM(data_switch) FROM raw_mobile_phone "
                                   "WHERE timestamp > %lld AND timestamp <= %lld",
                                   from, to),
                   2, [](const Parcel& r) {
                       r.readInt64();
                       KLOGD("network switch: %lld", static_cast<long long>(r.readInt64()));
                   }) < 0) {
        KLOGE("Failed to query network switch time: %d", -17);
    }
    // The latest row of each card: SQLite takes the bare columns from the
    // row of MAX(timestamp).
    if (forEachRow(String8::format("SELECT sub_id, mcc, mnc, MAX(timestamp) FROM "
                                   "raw_mobile_phone WHERE timestamp > %lld AND timestamp <= "
                                   "%lld GROUP BY sub_id",
                                   from, to),
                   4, [](const Parcel& r) {
                       long long sub = r.readInt64();
                       long long mcc = r.readInt64();
                       long long mnc = r.readInt64();
                       r.readInt64();
                       KLOGD("sim card data: sub_id=%lld mcc=%lld mnc=%lld", sub, mcc, mnc);
                   }) < 0) {
        KLOGE("Failed to query mobile phone data: %d", -17);
    }
    const struct {
        const char* type;
        uint32_t id;
    } kMemory[] = {{"MemFree:", 8}, {"MemAvailable:", 9}};
    for (const auto& m : kMemory) {
        Parcel ranges;
        bool bad = false;
        int32_t rows = forEachRow(
            String8::format("SELECT range, COUNT(type) FROM raw_memory_range WHERE type = '%s' "
                            "AND timestamp > %lld AND timestamp <= %lld GROUP BY range",
                            m.type, static_cast<long long>(end - kDayMs),
                            static_cast<long long>(end)),
            2, [&ranges, &bad](const Parcel& r) {
                int64_t range = r.readInt64();
                int64_t count = r.readInt64();
                if (range < 0 || range > 5) {
                    bad = true;
                    return;
                }
                DataUploader::formIntData(static_cast<uint32_t>(range), count, ranges);
            });
        if (rows < 0) {
            KLOGE("Failed to query accounting memory data");
        } else if (rows > 6 || bad) {
            KLOGE("Invalid memory range rows: %d", rows);
        } else if (rows > 0) {
            DataUploader::formClassData(m.id, 903009032, ranges, out);
        }
    }
}

int32_t SystemHandler::onHourlyUploading(const Parcel& data) {
    data.setDataPosition(0);
    data.readFloat();
    const int64_t end = data.readInt64();
    forceFlushEntries();
    Parcel out;
    formComponentData(end, kHourMs, out);
    if (setEventData(EVENT_HOURLY_COMPONENTS, out, true) < 0) {
        KLOGE("Failed to set upload energy component data");
    }
    return voteCandidate(end, kCandidateHourlyUpload, kPeriodUploadVote);
}

int32_t SystemHandler::onDailyUploading(const Parcel& data) {
    data.setDataPosition(0);
    data.readFloat();
    const int64_t end = data.readInt64();
    forceFlushEntries();
    Parcel components;
    formComponentData(end, kDayMs, components);
    if (setEventData(EVENT_DAILY_COMPONENTS, components, true) < 0) {
        KLOGE("Failed to set upload energy component data");
    }
    Parcel statistics;
    formStatisticsData(end, statistics);
    if (setEventData(EVENT_DAILY_SYSTEM, statistics, true) < 0) {
        KLOGE("Failed to set upload energy statistics data");
    }
    Parcel users;
    formUserData(end, users);
    if (setEventData(EVENT_DAILY_USERS, users, true) < 0) {
        KLOGE("Failed to set upload energy user data");
    }
    return voteCandidate(end, kCandidateDailyUpload, kDailyUploadVote);
}

int32_t SystemHandler::onDawnUploading(const Parcel& data) {
    data.setDataPosition(0);
    data.readFloat();
    const int64_t end = data.readInt64();
    forceFlushEntries();
    Parcel out;
    formComponentData(end, 21600000, out);
    if (setEventData(EVENT_DAILY_COMPONENTS, out, true) < 0) {
        KLOGE("Failed to set upload energy component data");
    }
    return voteCandidate(end, kCandidateDawnUpload, kPeriodUploadVote);
}

}  // namespace kelvo
