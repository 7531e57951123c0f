#include "routines/AbnormalityRoutine.h"

#include <powerlog/powerlog.h>

#include <cinttypes>
#include <cstdio>
#include <cstring>

#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "binder/managers/PackageManager.h"
#include "core/Dispatcher.h"
#include "core/Notifier.h"
#include "kelvo/Processors.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/LoggerMessage.h"
#include "utils/PackageProperty.h"
#include "utils/SystraceDumper.h"
#include "utils/TimeProvider.h"
#include "utils/TimerManager.h"

#define ABNLOGD(format, ...) KLOGM(LOG_MODULE_ABNORMALITY, format, ##__VA_ARGS__)

namespace kelvo {

namespace {

constexpr uint32_t kEventCapacity = 903002051;
constexpr uint32_t kEventLevel = 903002052;
constexpr uint32_t kEventSystem = 903002053;
constexpr uint32_t kEventScreenOff = 903002054;
constexpr uint32_t kEventApplications = 903002055;
constexpr uint32_t kEventRestart = 903002056;

constexpr uint32_t kClassCount = 903009023;
constexpr uint32_t kClassAlarm = 903009024;
constexpr uint32_t kClassWakelock = 903009025;
constexpr uint32_t kClassSensorhub = 903009034;
constexpr uint32_t kClassApplications = 903009035;
constexpr uint32_t kClassCpu = 903009036;
constexpr uint32_t kClassGnss = 903009037;
constexpr uint32_t kClassRestart = 903009038;
constexpr uint32_t kClassFreezeApp = 903009039;
constexpr uint32_t kClassFreezeProcess = 903009040;
constexpr uint32_t kClassName = 903009063;
constexpr uint32_t kClassComponent = 903009021;

constexpr int32_t kNameLimit = 100;
constexpr int32_t kShortLimit = 20;
constexpr int32_t kVersionLimit = 32;
constexpr size_t kVersionLength = 31;
constexpr int32_t kTopRows = 5;
constexpr int32_t kMaxModemRows = 7;
constexpr int32_t kLocationElements = 3;
constexpr int32_t kMaxComponentRows = 12;
constexpr int64_t kHourMs = 3600000;
constexpr float kCpuUsageLimit = 1.25f;
// Sub-event ids of the applications-accounting components 0 to 10.
constexpr uint32_t kComponentParams[] = {11, 3, 14, 8, 9, 4, 10, 5, 7, 12, 13};
constexpr int32_t kSensorComponent = 11;

constexpr int32_t kTypeFreezeFailed = 4;
constexpr int32_t kTypeGnss = 15;
constexpr int32_t kTypeRestart = 16;
constexpr int32_t kTypeScreenOff = 17;
constexpr int32_t kTypeCpu = 20;
constexpr int32_t kTypeWakelock = 21;

const column_attribute kPelmoraColumns[] = {{COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "message"}};
const table_attribute kPelmoraTable = {"1.0", 1, 2, kPelmoraColumns, "raw_pelmora"};

const column_attribute kPelmoraAbnormalColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "type"},  {COLUMN_TEXT, "name"},
    {COLUMN_TEXT, "reason"},    {COLUMN_INT, "count"},
};
const table_attribute kPelmoraAbnormalTable = {"1.0", 1, 5, kPelmoraAbnormalColumns,
                                               "raw_pelmora_abnormal"};

const column_attribute kCapacityColumns[] = {
    {COLUMN_TIME, "start_time"},   {COLUMN_TIME, "end_time"},    {COLUMN_INT, "full_capacity"},
    {COLUMN_INT, "diff_capacity"}, {COLUMN_INT, "charge_count"}, {COLUMN_INT, "temperature"},
    {COLUMN_TEXT, "version"},
};
const table_attribute kCapacityTable = {"1.0", 1, 7, kCapacityColumns,
                                        "debug_abnormal_battery_capacity"};

const column_attribute kLevelColumns[] = {
    {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"},   {COLUMN_INT, "diff_level"},
    {COLUMN_INT, "gas_gauge"},   {COLUMN_INT, "temperature"}, {COLUMN_INT, "current"},
    {COLUMN_INT, "voltage"},     {COLUMN_TEXT, "version"},
};
const table_attribute kLevelTable = {"1.0", 1, 8, kLevelColumns, "debug_abnormal_battery_level"};

const column_attribute kSourceCountColumns[] = {
    {COLUMN_TIME, "start_time"},
    {COLUMN_TIME, "end_time"},
    {COLUMN_TEXT, "source"},
    {COLUMN_INT, "count"},
};
const table_attribute kWakeupTable = {"1.0", 1, 4, kSourceCountColumns, "debug_abnormal_wakeup"};
const table_attribute kModemTable = {"1.0", 1, 4, kSourceCountColumns, "debug_abnormal_modem"};

const column_attribute kAlarmColumns[] = {
    {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"}, {COLUMN_TEXT, "app"},
    {COLUMN_TEXT, "tag"},        {COLUMN_INT, "count"},
};
const table_attribute kAlarmTable = {"1.0", 1, 5, kAlarmColumns, "debug_abnormal_alarm"};

const column_attribute kWakelockColumns[] = {
    {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"}, {COLUMN_TEXT, "app"},
    {COLUMN_TEXT, "version"},    {COLUMN_TEXT, "tag"},      {COLUMN_INT, "duration"},
};
const table_attribute kWakelockTable = {"1.0", 1, 6, kWakelockColumns, "debug_abnormal_wakelock"};

const column_attribute kSensorhubColumns[] = {
    {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"}, {COLUMN_INT, "source"},
    {COLUMN_INT, "reason"},      {COLUMN_INT, "count"},
};
const table_attribute kSensorhubTable = {"1.0", 1, 5, kSensorhubColumns, "debug_abnormal_sensorhub"};

const column_attribute kCpuColumns[] = {
    {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"}, {COLUMN_TEXT, "app"},
    {COLUMN_INT, "usage_rate"},  {COLUMN_INT, "bg_usage"},  {COLUMN_LONG, "bg_energy"},
};
const table_attribute kCpuTable = {"1.0", 1, 6, kCpuColumns, "debug_abnormal_cpu"};

const column_attribute kFreezeColumns[] = {
    {COLUMN_TIME, "start_time"},
    {COLUMN_TIME, "end_time"},
    {COLUMN_TEXT, "process"},
    {COLUMN_INT, "count"},
};
const table_attribute kFreezeTable = {"1.0", 1, 4, kFreezeColumns, "debug_abnormal_freeze_fail"};

const column_attribute kLocationColumns[] = {
    {COLUMN_TIME, "start_time"},
    {COLUMN_TIME, "end_time"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "count"},
};
const table_attribute kLocationTable = {"1.0", 1, 4, kLocationColumns,
                                        "debug_abnormal_location_counter"};

const table_attribute* const kDebugTables[] = {
    &kCapacityTable, &kLevelTable,     &kWakeupTable, &kModemTable,  &kAlarmTable,
    &kWakelockTable, &kSensorhubTable, &kCpuTable,    &kFreezeTable, &kLocationTable,
};

const dispatcher_tag kPelmoraDispatcherTag = {"KELVO_TAG_PM_POWER_CONTROL",
                                              AbnormalityRoutine::kPelmoraTag};

int64_t wallNow() {
    return TimeProvider::getCurrentTime(TIME_TYPE_WALL);
}

// time - span, unless the span is not positive or the start would fall
// before the epoch (a record's count or duration is outside data).
int64_t windowStart(int64_t time, int64_t span) {
    return span > 0 && span < time ? time - span : time;
}

// A name inside an element: a class of its own holding the text.
void formName(uint32_t id, const std::string& text, int32_t limit, android::Parcel& out) {
    android::Parcel name;
    DataUploader::formVarcharData(0, text.c_str(), limit, name);
    DataUploader::formClassData(id, kClassName, name, out);
}

// The application type, only when known.
void formPackageType(uint32_t id, const std::string& name, android::Parcel& out) {
    int32_t type = PackageProperty::getInstance()->getPackageType(android::String8(name.c_str()));
    if (type >= 1) {
        DataUploader::formIntData(id, type, out);
    }
}

bool readText(const android::Parcel& reply, std::string& out) {
    android::String8 text;
    if (reply.readString8(&text) != android::NO_ERROR) {
        return false;
    }
    out.assign(text.string(), text.size());
    return true;
}

bool readLong(const android::Parcel& reply, int64_t& out) {
    return reply.readInt64(&out) == android::NO_ERROR;
}

std::string packageVersion(const std::string& name) {
    android::Parcel out;
    if (PackageManager::getInstance()->getPackageVersion(android::String8(name.c_str()), &out) < 0) {
        return "";
    }
    out.setDataPosition(0);
    int32_t code = 0;
    if (out.readInt32(&code) != android::NO_ERROR) {
        return "";
    }
    android::String8 version(out.readString16());
    return version.string();
}

}  // namespace

std::atomic<int64_t> AbnormalityRoutine::sCheckPeriodMs{AbnormalityRoutine::kCheckPeriodMs};

void AbnormalityRoutine::setCheckPeriodMs(int64_t ms) {
    sCheckPeriodMs.store(ms > 0 ? ms : kCheckPeriodMs, std::memory_order_relaxed);
}

AbnormalityRoutine::AbnormalityRoutine()
    : KelvoOperator("AbnormalityRoutine", -1, 0),
      mFilter(-1),
      mThresholdsRead(false),
      mLastCheck(0),
      mCapacity{0, {0, 0, 0, 0}, ""},
      mLevel{0, {0, 0, 0, 0}, ""},
      mCpu{{}, 0},
      mGnss{{}, 0},
      mWakelock{{}, 0},
      mHourlyTicks(0) {
    // The dumper measures its interval from its creation: made with the
    // routine, not at the first capture.
    SystraceDumper::getInstance();
}

AbnormalityRoutine::~AbnormalityRoutine() {
    if (mTimer != nullptr) {
        TimerManager::getInstance()->removeTimer(mTimer);
    }
}

void AbnormalityRoutine::refused() {
    HealthCounters::add(Health::AbnormalityInputRefused);
}

void AbnormalityRoutine::addSchemaTable() {
    addSchema(kPelmoraTable);
    addSchema(kPelmoraAbnormalTable);
    for (const table_attribute* table : kDebugTables) {
        addSchema(*table);
    }
}

void AbnormalityRoutine::cleanTables(int64_t time) {
    cleanObsoleteEntries(kPelmoraTable.name, time, "timestamp");
    cleanObsoleteEntries(kPelmoraAbnormalTable.name, time, "timestamp");
    for (const table_attribute* table : kDebugTables) {
        cleanObsoleteEntries(table->name, time, "end_time");
    }
}

int32_t AbnormalityRoutine::setConfiguration() {
    if (readThresholds() < 0) {
        KLOGE("Get abnormality threshold failed");
    }
    android::Parcel request;
    request.writeInt32(0);
    android::Parcel reply;
    if (getXmlConfig(CONFIG_FILTER, request, &reply) < 0) {
        KLOGE("Get filter data failed");
    } else {
        int32_t filter = 0;
        if (reply.readInt32(&filter) == android::NO_ERROR) {
            mFilter = filter;
        }
    }
    return 0;
}

int32_t AbnormalityRoutine::readThresholds() {
    android::Parcel request;
    request.writeInt32(0);
    request.writeInt32(-1);
    request.writeBool(false);
    android::Parcel reply;
    if (getXmlConfig(CONFIG_ABNORMALITY_THRESHOLD, request, &reply) < 0) {
        return -2;
    }
    // Groups: key, then (1, value) pairs while the mark is 1; -1 ends the
    // keys. The reply may end anywhere: reading stops with it.
    int32_t key = 0;
    while (reply.readInt32(&key) == android::NO_ERROR && key != -1) {
        std::vector<int32_t> values;
        int32_t mark = 0;
        int32_t value = 0;
        bool ended = false;
        while (!ended) {
            if (reply.readInt32(&mark) != android::NO_ERROR) {
                ended = true;
                break;
            }
            if (mark != 1) {
                break;
            }
            if (reply.readInt32(&value) != android::NO_ERROR) {
                ended = true;
                break;
            }
            values.push_back(value);
        }
        if (!values.empty()) {
            mThresholds[key] = values;
        } else {
            // A key without values has no limit: its check stays off.
            refused();
        }
        if (ended) {
            break;
        }
    }
    mThresholdsRead = !mThresholds.empty();
    return mThresholdsRead ? 0 : -2;
}

bool AbnormalityRoutine::threshold(int32_t key, int32_t& value) const {
    auto it = mThresholds.find(key);
    if (it == mThresholds.end()) {
        ABNLOGD("Failed to find abnormality threshold");
        return false;
    }
    value = it->second.back();
    return true;
}

void AbnormalityRoutine::setupListeners(android::Parcel& out) {
    addNotifierListener(NOTIFICATION_HOURLY_TICK, out);
    addNotifierListener(NOTIFICATION_DAILY_TICK, out);
}

void AbnormalityRoutine::registerDispatcherTag() {
    Dispatcher::getInstance()->registerTag(kPelmoraDispatcherTag, this);
}

int32_t AbnormalityRoutine::lateInitialize() {
    if (!mThresholdsRead) {
        return 0;
    }
    // Made here, on the routine's own thread: the callback holds the routine.
    mTimer = new TimerCallback(this, kCheckTimerId);
    return armTimer();
}

int32_t AbnormalityRoutine::armTimer() {
    if (mTimer == nullptr) {
        return -2;
    }
    int64_t period = sCheckPeriodMs.load(std::memory_order_relaxed);
    return rearmTimer(mTimer, period, period);
}

int32_t AbnormalityRoutine::handleTimerRearm(int32_t id) {
    if (id != kCheckTimerId) {
        return KelvoOperator::handleTimerRearm(id);
    }
    return armTimer();
}

int32_t AbnormalityRoutine::handleTimerExpired(int32_t id) {
    if (id != kCheckTimerId) {
        KLOGE("Unknown timer: %d", id);
        return -5;
    }
    int64_t now = wallNow();
    ABNLOGD("Abnormality check start: timestamp=%lld", static_cast<long long>(now));
    onAbnormalityCheck(now);
    return 0;
}

void AbnormalityRoutine::onAbnormalityCheck(int64_t now) {
    int64_t period = sCheckPeriodMs.load(std::memory_order_relaxed);
    // From the end of the last window; the first one, and the one after a
    // clock set back, take the last period.
    window w = {mLastCheck > 0 && mLastCheck <= now ? mLastCheck : now - period, now};
    mLastCheck = now;
    forceFlushEntries();

    checkBattery(w, true);
    checkBattery(w, false);

    android::Parcel p;
    checkWakeup(w, p);
    checkModem(w, p);
    checkAlarm(w, p);
    std::string push;
    checkKernelWakelock(w, p, push);
    checkPartialWakelock(w, p, push);
    sendPowerpush(push, kPowerLogWakelock);
    checkSensorhub(w, p);
    checkLocation(w, p);
    sendWindowEvent(kEventSystem, w, p);

    checkScreenOffDrain(w);

    sendWindowEvent(kEventApplications, w, mPendingApps);
    mPendingApps.freeData();

    p.freeData();
    checkPelmoraList(w, kTypeRestart, 2, kClassRestart, p);
    checkPelmoraList(w, kTypeFreezeFailed, 3, kClassFreezeApp, p);
    checkFreezeFailedProcess(w, p);
    sendWindowEvent(kEventRestart, w, p);
}

void AbnormalityRoutine::sendWindowEvent(uint32_t event, const window& w, android::Parcel& p) {
    if (p.dataSize() == 0) {
        return;
    }
    p.setDataPosition(p.dataSize());
    DataUploader::formDatetimeData(0, w.start, p);
    DataUploader::formDatetimeData(1, w.end, p);
    if (setAndUploadEvent(event, p, true) < 0) {
        KLOGE("Failed to upload abnormality event: %u", event);
    }
}

void AbnormalityRoutine::checkBattery(const window& w, bool capacity) {
    battery_report& report = capacity ? mCapacity : mLevel;
    int32_t limit = 0;
    if (!threshold(capacity ? KEY_BATTERY_CAPACITY : KEY_BATTERY_LEVEL, limit)) {
        return;
    }
    if (report.first > limit) {
        android::Parcel p;
        DataUploader::formDatetimeData(0, w.start, p);
        DataUploader::formDatetimeData(1, w.end, p);
        DataUploader::formIntData(2, report.first, p);
        // The capacity row keeps the four values; the level row the
        // difference too.
        android::Parcel row;
        row.writeInt64(w.start);
        row.writeInt64(w.end);
        if (!capacity) {
            row.writeInt32(report.first);
        }
        for (uint32_t i = 0; i < 4; ++i) {
            DataUploader::formIntData(3 + i, report.values[i], p);
            row.writeInt32(report.values[i]);
        }
        DataUploader::formVarcharData(capacity ? 6 : 7, report.version.c_str(), kVersionLimit, p);
        row.writeString8(android::String8(report.version.c_str()));
        insertEntries(capacity ? kCapacityTable : kLevelTable, row, 1, false);
        if (setAndUploadEvent(capacity ? kEventCapacity : kEventLevel, p, true) < 0) {
            KLOGE("Failed to upload battery abnormality");
        }
    }
    report = {0, {0, 0, 0, 0}, ""};
}

void AbnormalityRoutine::checkWakeup(const window& w, android::Parcel& p) {
    int32_t limit = 0;
    if (!threshold(KEY_WAKEUP, limit)) {
        return;
    }
    android::String8 sql = android::String8::format(
        "SELECT name, COUNT(*) FROM raw_ap_wake_irq WHERE timestamp > %" PRId64
        " AND timestamp <= %" PRId64
        " AND name != '{ipc[1:0]ipc_mbx[9:0],ipc_ns[1:0],ipc_ns_mbx[9:0]}' AND name != "
        "'IPF_intr1' AND name != 'GPIO%d' AND name != 'RTC0' AND name != 'MDM_IPF_intr1' "
        "GROUP BY name ORDER BY COUNT(*) DESC LIMIT %d",
        w.start, w.end, mFilter, kTopRows);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 2, rows) < 0) {
        KLOGE("Failed to query entries");
        return;
    }
    for (int32_t i = 0; i < rows && i < kTopRows; ++i) {
        std::string name;
        int64_t count = 0;
        if (!readText(reply, name) || !readLong(reply, count)) {
            break;
        }
        if (count <= limit) {
            continue;
        }
        android::Parcel element;
        formName(0, name, kNameLimit, element);
        DataUploader::formIntData(1, count, element);
        DataUploader::formClassArray(2, kClassCount, element, p);
        ABNLOGD("Wakeup: %s count: %lld", name.c_str(), static_cast<long long>(count));
        android::Parcel row;
        row.writeInt64(w.start);
        row.writeInt64(w.end);
        row.writeString8(android::String8(name.c_str()));
        row.writeInt32(KelvoUtils::saturateInt32(count));
        insertEntries(kWakeupTable, row, 1, false);
    }
}

void AbnormalityRoutine::checkModem(const window& w, android::Parcel& p) {
    int32_t limit = 0;
    if (!threshold(KEY_MODEM, limit)) {
        return;
    }
    android::String8 sql = android::String8::format(
        "SELECT type, COUNT(*) FROM raw_modem_wakeup_source WHERE timestamp >= %" PRId64
        " AND timestamp < %" PRId64 " GROUP BY type",
        w.start, w.end);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 2, rows) < 0) {
        KLOGE("Failed to query entries");
        return;
    }
    // Types 0, 5 and 6 make the sum, whatever rows there are.
    std::vector<std::pair<int64_t, int64_t>> counts;
    int64_t sum = 0;
    for (int32_t i = 0; i < rows; ++i) {
        int64_t type = 0;
        int64_t count = 0;
        if (!readLong(reply, type) || !readLong(reply, count)) {
            break;
        }
        if (type == 0 || type == 5 || type == 6) {
            sum += count;
        }
        counts.emplace_back(type, count);
    }
    if (sum <= limit) {
        return;
    }
    ABNLOGD("Modem: %lld", static_cast<long long>(sum));
    android::Parcel content;
    for (size_t i = 0; i < counts.size(); ++i) {
        if (i >= static_cast<size_t>(kMaxModemRows)) {
            refused();
            break;
        }
        std::string type = std::to_string(counts[i].first);
        android::Parcel element;
        formName(0, type, kNameLimit, element);
        DataUploader::formIntData(1, counts[i].second, element);
        DataUploader::formClassArray(3, kClassCount, element, content);
        android::Parcel row;
        row.writeInt64(w.start);
        row.writeInt64(w.end);
        row.writeString8(android::String8(type.c_str()));
        row.writeInt32(KelvoUtils::saturateInt32(counts[i].second));
        insertEntries(kModemTable, row, 1, false);
    }
    if (content.dataSize() == 0) {
        ABNLOGD("Content is empty");
        return;
    }
    p.appendFrom(&content, 0, content.dataSize());
}

void AbnormalityRoutine::checkAlarm(const window& w, android::Parcel& p) {
    int32_t limit = 0;
    if (!threshold(KEY_ALARM, limit)) {
        return;
    }
    android::String8 sql = android::String8::format(
        "SELECT name, tag, SUM(1000/count) FROM raw_applications_alarm WHERE timestamp >= "
        "%" PRId64 " AND timestamp < %" PRId64
        " GROUP BY name, tag ORDER BY SUM(1000/count) DESC LIMIT %d",
        w.start, w.end, kTopRows);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 3, rows) < 0) {
        KLOGE("Failed to query entries");
        return;
    }
    if (rows > kTopRows) {
        KLOGE("Invalid row count: %d", rows);
        return;
    }
    for (int32_t i = 0; i < rows; ++i) {
        std::string name;
        std::string tag;
        int64_t sum = 0;
        if (!readText(reply, name) || !readText(reply, tag) || !readLong(reply, sum)) {
            break;
        }
        if (name.empty() || tag == "com.android.internal.location.ALARM_WAKEUP") {
            continue;
        }
        int64_t count = sum / 1000;
        if (count <= limit) {
            continue;
        }
        android::Parcel element;
        formName(3, name, kNameLimit, element);
        if (!tag.empty()) {
            formName(4, tag, kNameLimit, element);
        }
        formPackageType(5, name, element);
        DataUploader::formIntData(2, count, element);
        DataUploader::formClassArray(4, kClassAlarm, element, p);
        ABNLOGD("Alarm: %s tag: %s count: %lld", name.c_str(), tag.c_str(),
                static_cast<long long>(count));
        android::Parcel row;
        row.writeInt64(w.start);
        row.writeInt64(w.end);
        row.writeString8(android::String8(name.c_str()));
        row.writeString8(android::String8(tag.c_str()));
        row.writeInt32(KelvoUtils::saturateInt32(count));
        insertEntries(kAlarmTable, row, 1, false);
    }
}

void AbnormalityRoutine::uploadWakelock(const window& w, const std::string& app,
                                        const std::string& version, const std::string& tag,
                                        int64_t duration, android::Parcel& p) {
    android::Parcel element;
    formName(5, app, kNameLimit, element);
    if (!version.empty()) {
        formName(7, version, kShortLimit, element);
    }
    if (!tag.empty()) {
        formName(6, tag, kNameLimit, element);
    }
    formPackageType(8, app, element);
    DataUploader::formIntData(3, duration, element);
    DataUploader::formClassArray(5, kClassWakelock, element, p);
    android::Parcel row;
    row.writeInt64(w.start);
    row.writeInt64(w.end);
    row.writeString8(android::String8(app.c_str()));
    row.writeString8(android::String8(version.c_str()));
    row.writeString8(android::String8(tag.c_str()));
    row.writeInt32(KelvoUtils::saturateInt32(duration));
    insertEntries(kWakelockTable, row, 1, false);
}

void AbnormalityRoutine::checkKernelWakelock(const window& w, android::Parcel& p,
                                             std::string& push) {
    int32_t limit = 0;
    if (!threshold(KEY_WAKELOCK, limit)) {
        return;
    }
    android::String8 sql = android::String8::format(
        "SELECT name, SUM(duration) FROM raw_kernel_wakelock WHERE timestamp > %" PRId64
        " AND timestamp <= %" PRId64
        " AND name != 'PowerManagerService.WakeLocks' AND name != 'PowerManagerService.Display' "
        "AND name != 'charge_wakelock' AND name != 'usb_wake_lock' AND name != 'mmc1_detect' "
        "GROUP BY name HAVING SUM(duration) > %d ORDER BY SUM(duration) DESC",
        w.start, w.end, limit);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 2, rows) < 0) {
        KLOGE("Failed to query entries");
        return;
    }
    int64_t period = w.end - w.start;
    int32_t uploaded = 0;
    for (int32_t i = 0; i < rows; ++i) {
        std::string name;
        int64_t duration = 0;
        if (!readText(reply, name) || !readLong(reply, duration)) {
            break;
        }
        if (name.empty()) {
            continue;
        }
        char item[512];
        snprintf(item, sizeof(item), "0:kernel:%s:%lld:%lld#", name.c_str(),
                 static_cast<long long>(duration), static_cast<long long>(period));
        push += item;
        if (uploaded >= kTopRows) {
            continue;
        }
        ++uploaded;
        ABNLOGD("Kernel wakelock: %s duration: %lld", name.c_str(),
                static_cast<long long>(duration));
        if (name != "GPSD") {
            uploadWakelock(w, name, "", "", duration, p);
            continue;
        }
        // The location daemon's wakelock is charged to the application that
        // kept the GNSS on longest with the screen off.
        android::String8 gnss = android::String8::format(
            "SELECT name, SUM(screen_off_duration) FROM raw_applications_gnss WHERE end_time > "
            "%" PRId64 " AND end_time <= %" PRId64
            " GROUP BY name HAVING SUM(screen_off_duration) > %d ORDER BY "
            "SUM(screen_off_duration) DESC LIMIT %d",
            w.start, w.end, limit, 1);
        android::Parcel app;
        int32_t appRows = 0;
        std::string appName;
        int64_t appDuration = 0;
        if (queryEntriesSimple(gnss, &app, 2, appRows) == 0 && appRows == 1 &&
            readText(app, appName) && readLong(app, appDuration)) {
            uploadWakelock(w, appName, packageVersion(appName), "GPSD", appDuration, p);
        } else {
            uploadWakelock(w, name, "", "", duration, p);
        }
    }
}

void AbnormalityRoutine::checkPartialWakelock(const window& w, android::Parcel& p,
                                              std::string& push) {
    int32_t limit = 0;
    if (!threshold(KEY_WAKELOCK, limit)) {
        return;
    }
    android::String8 sql = android::String8::format(
        "SELECT uid, name, tag, SUM(duration) FROM raw_partial_wakelock WHERE timestamp > "
        "%" PRId64 " AND timestamp <= %" PRId64
        " AND tag != '*alarm*' AND uid < 10000 GROUP BY name, tag HAVING SUM(duration) > %d "
        "ORDER BY SUM(duration) DESC",
        w.start, w.end, limit);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 4, rows) < 0) {
        KLOGE("Failed to query entries");
        return;
    }
    int64_t period = w.end - w.start;
    int32_t uploaded = 0;
    for (int32_t i = 0; i < rows; ++i) {
        int64_t uid = 0;
        std::string name;
        std::string tag;
        int64_t duration = 0;
        if (!readLong(reply, uid) || !readText(reply, name) || !readText(reply, tag) ||
            !readLong(reply, duration)) {
            break;
        }
        if (name.empty()) {
            continue;
        }
        char item[768];
        snprintf(item, sizeof(item), "%d:%s:%s:%lld:%lld#", static_cast<int32_t>(uid), name.c_str(),
                 tag.c_str(), static_cast<long long>(duration), static_cast<long long>(period));
        push += item;
        if (uploaded >= kTopRows) {
            continue;
        }
        ++uploaded;
        ABNLOGD("Partial wakelock: %s tag: %s duration: %lld", name.c_str(), tag.c_str(),
                static_cast<long long>(duration));
        uploadWakelock(w, name, "", tag, duration, p);
    }
}

void AbnormalityRoutine::checkSensorhub(const window& w, android::Parcel& p) {
    int32_t limit = 0;
    if (!threshold(KEY_SENSORHUB, limit)) {
        return;
    }
    android::String8 sql = android::String8::format(
        "SELECT source, reason, COUNT(*) FROM raw_sensorhub_wake WHERE timestamp >= %" PRId64
        " AND timestamp < %" PRId64 " GROUP BY source, reason ORDER BY COUNT(*) DESC LIMIT %d",
        w.start, w.end, kTopRows);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 3, rows) < 0) {
        KLOGE("Failed to query entries");
        return;
    }
    for (int32_t i = 0; i < rows && i < kTopRows; ++i) {
        int64_t source = 0;
        int64_t reason = 0;
        int64_t count = 0;
        if (!readLong(reply, source) || !readLong(reply, reason) || !readLong(reply, count)) {
            break;
        }
        if (count <= limit) {
            continue;
        }
        android::Parcel element;
        DataUploader::formIntData(0, source, element);
        DataUploader::formIntData(1, reason, element);
        DataUploader::formIntData(2, count, element);
        DataUploader::formClassArray(6, kClassSensorhub, element, p);
        ABNLOGD("Sensorhub source: %lld reason: %lld wake: %lld", static_cast<long long>(source),
                static_cast<long long>(reason), static_cast<long long>(count));
        android::Parcel row;
        row.writeInt64(w.start);
        row.writeInt64(w.end);
        row.writeInt32(KelvoUtils::saturateInt32(source));
        row.writeInt32(KelvoUtils::saturateInt32(reason));
        row.writeInt32(KelvoUtils::saturateInt32(count));
        insertEntries(kSensorhubTable, row, 1, false);
    }
}

void AbnormalityRoutine::checkLocation(const window& w, android::Parcel& p) {
    int32_t limit = 0;
    if (!threshold(KEY_LOCATION, limit)) {
        return;
    }
    android::String8 sql = android::String8::format(
        "SELECT name, SUM(count) FROM raw_location_counter WHERE timestamp >= %" PRId64
        " AND timestamp < %" PRId64 " GROUP BY name ORDER BY SUM(count) DESC",
        w.start, w.end);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 2, rows) < 0) {
        KLOGE("Failed to query entries");
        return;
    }
    std::vector<std::pair<std::string, int64_t>> top;
    int64_t sum = 0;
    for (int32_t i = 0; i < rows; ++i) {
        std::string name;
        int64_t count = 0;
        if (!readText(reply, name) || !readLong(reply, count)) {
            break;
        }
        sum += count;
        if (top.size() < static_cast<size_t>(kLocationElements)) {
            top.emplace_back(name, count);
        }
    }
    if (sum <= limit) {
        return;
    }
    top.emplace_back("total", sum);
    for (const auto& entry : top) {
        android::Parcel element;
        formName(2, entry.first, kNameLimit, element);
        formPackageType(3, entry.first, element);
        DataUploader::formIntData(1, entry.second, element);
        DataUploader::formClassArray(7, kClassCount, element, p);
        ABNLOGD("Location abnormalty: %s count: %lld", entry.first.c_str(),
                static_cast<long long>(entry.second));
        android::Parcel row;
        row.writeInt64(w.start);
        row.writeInt64(w.end);
        row.writeString8(android::String8(entry.first.c_str()));
        row.writeInt32(KelvoUtils::saturateInt32(entry.second));
        insertEntries(kLocationTable, row, 1, false);
    }
}

int32_t AbnormalityRoutine::queryPelmoraAbnormality(const window& w, int32_t type,
                                                    android::Parcel* reply, int32_t& rows) {
    android::String8 sql = android::String8::format(
        "SELECT name, reason, SUM(count) FROM %s WHERE timestamp >= %" PRId64
        " AND timestamp < %" PRId64
        " AND type = %d GROUP BY name, reason ORDER BY SUM(count) DESC LIMIT %d",
        kPelmoraAbnormalTable.name, w.start, w.end, type, kTopRows);
    int32_t ret = queryEntriesSimple(sql, reply, 3, rows);
    if (ret < 0) {
        return ret;
    }
    if (rows > kTopRows) {
        KLOGE("Invalid row count: %d", rows);
        return -2;
    }
    return 0;
}

void AbnormalityRoutine::checkScreenOffDrain(const window& w) {
    android::Parcel reply;
    int32_t rows = 0;
    if (queryPelmoraAbnormality(w, kTypeScreenOff, &reply, rows) < 0) {
        KLOGE("Query pelmora abnormality error.");
        return;
    }
    std::string gauge;
    std::string reason;
    int64_t count = 0;
    if (rows < 1 || !readText(reply, gauge) || !readText(reply, reason) || !readLong(reply, count)) {
        return;
    }
    int32_t modemLog = 0;
    int32_t wifiSpot = 0;
    int32_t ret =
        parseMessage(reason.c_str(), "modem_log=", "wifi_spot=", "%d", &modemLog, sizeof(modemLog));
    if (ret < 0) {
        KLOGE("Failed to parse modem log switch, ret: %d", ret);
        return;
    }
    ret = parseMessage(reason.c_str(), "wifi_spot=", nullptr, "%d", &wifiSpot, sizeof(wifiSpot));
    if (ret < 0) {
        KLOGE("Failed to parse wifi spot switch, ret: %d", ret);
        return;
    }
    char* end = nullptr;
    long long gas = strtoll(gauge.c_str(), &end, 10);
    if (gauge.empty() || end == nullptr || *end != '\0') {
        KLOGE("Failed to get gas gauge: %s", gauge.c_str());
        return;
    }
    android::Parcel p;
    DataUploader::formDatetimeData(0, w.start, p);
    DataUploader::formDatetimeData(1, w.end, p);
    DataUploader::formIntData(2, gas, p);
    DataUploader::formIntData(3, count, p);
    DataUploader::formIntData(4, modemLog, p);
    DataUploader::formIntData(5, wifiSpot, p);
    if (setAndUploadEvent(kEventScreenOff, p, true) < 0) {
        KLOGE("Failed to upload screen off drain");
    }
}

void AbnormalityRoutine::checkPelmoraList(const window& w, int32_t type, uint32_t param,
                                          uint32_t classId, android::Parcel& p) {
    android::Parcel reply;
    int32_t rows = 0;
    if (queryPelmoraAbnormality(w, type, &reply, rows) < 0) {
        if (type == kTypeRestart) {
            KLOGE("Query pelmora abnormality error");
        } else {
            KLOGE("Query pelmora abnormality error.");
        }
        return;
    }
    for (int32_t i = 0; i < rows; ++i) {
        std::string name;
        std::string reason;
        int64_t count = 0;
        if (!readText(reply, name) || !readText(reply, reason) || !readLong(reply, count)) {
            break;
        }
        android::Parcel element;
        formName(3, name, kNameLimit, element);
        formPackageType(5, name, element);
        formName(4, reason, kShortLimit, element);
        DataUploader::formIntData(2, count, element);
        DataUploader::formClassArray(param, classId, element, p);
    }
}

void AbnormalityRoutine::checkFreezeFailedProcess(const window& w, android::Parcel& p) {
    int32_t limit = 0;
    if (!threshold(KEY_FREEZE_FAILED, limit)) {
        return;
    }
    android::String8 sql = android::String8::format(
        "SELECT name, COUNT(name) FROM raw_freezing_failed WHERE timestamp >= %" PRId64
        " AND timestamp < %" PRId64 " GROUP BY name ORDER BY COUNT(name) DESC LIMIT %d",
        w.start, w.end, kTopRows);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 2, rows) < 0) {
        KLOGE("Failed to query entries");
        return;
    }
    for (int32_t i = 0; i < rows && i < kTopRows; ++i) {
        std::string name;
        int64_t count = 0;
        if (!readText(reply, name) || !readLong(reply, count)) {
            break;
        }
        if (count <= limit) {
            continue;
        }
        android::Parcel element;
        formName(2, name, kNameLimit, element);
        formPackageType(3, name, element);
        DataUploader::formIntData(1, count, element);
        DataUploader::formClassArray(4, kClassFreezeProcess, element, p);
        ABNLOGD("Freeze failed: %s count: %lld", name.c_str(), static_cast<long long>(count));
        android::Parcel row;
        row.writeInt64(w.start);
        row.writeInt64(w.end);
        row.writeString8(android::String8(name.c_str()));
        row.writeInt32(KelvoUtils::saturateInt32(count));
        insertEntries(kFreezeTable, row, 1, false);
    }
}

int32_t AbnormalityRoutine::handleLogger(int64_t time, int32_t tag, const char* text) {
    if (tag != kPelmoraTag) {
        KLOGE("Unknown message type: %d", tag);
        refused();
        return -3;
    }
    return onPelmoraMessage(time, text);
}

int32_t AbnormalityRoutine::parsePelmoraAbnormality(const char* text, pelmora_report& out) {
    char name[128] = {};
    int32_t ret = parseMessage(text, "package=", "count=", "%s", name, sizeof(name));
    if (ret < 0) {
        KLOGE("Failed to parse name, ret: %d", ret);
        return -19;
    }
    int32_t count = 0;
    if (parseMessage(text, "count=", "reason=", "%d", &count, sizeof(count)) < 0) {
        KLOGE("Failed to parse count");
        return -19;
    }
    char reason[256] = {};
    if (parseMessage(text, "reason=", nullptr, "%s", reason, sizeof(reason)) < 0) {
        KLOGE("Failed to parse reason");
        return -19;
    }
    out = {name, reason, count};
    return 0;
}

int32_t AbnormalityRoutine::onPelmoraMessage(int64_t time, const char* text) {
    int32_t type = -1;
    int32_t ret = parseMessage(text, "type=", nullptr, "%d", &type, sizeof(type));
    if (ret < 0) {
        KLOGE("Failed to parse type, ret: %d", ret);
        refused();
        return -19;
    }
    pelmora_report report;
    bool parsed = false;
    switch (type) {
        case kTypeFreezeFailed:
        case kTypeGnss:
        case kTypeRestart:
        case kTypeScreenOff:
            if (parsePelmoraAbnormality(text, report) < 0) {
                KLOGE("Failed to parese abnormaltiy");
                refused();
                return -19;
            }
            parsed = true;
            break;
        case kTypeCpu:
            ret = onCpuAbnormality(time, text);
            break;
        case kTypeWakelock:
            ret = onWakelockAbnormality(time, text);
            break;
        case 0:
        case 1:
        case 2:
        case 3:
        case 5:
        case 6:
        case 8:
        case 9:
        case 10:
        case 11:
        case 12:
        case 13:
        case 14:
        case 18:
        case 19:
        case 10000:
            break;
        default:
            KLOGE("Unkown type: %d", type);
            refused();
            return -3;
    }
    if (ret < 0) {
        refused();
        return ret;
    }
    if (parsed) {
        if (type == kTypeFreezeFailed) {
            size_t colon = report.reason.find(':');
            if (colon == std::string::npos) {
                KLOGE("Failed to get reason");
                refused();
                return -2;
            }
            bool kept = atoi(report.reason.substr(0, colon).c_str()) == 1;
            report.reason = report.reason.substr(colon + 1);
            parsed = kept;
        } else if (type == kTypeScreenOff) {
            int32_t modemLog = 0;
            int32_t wifiSpot = 0;
            char tail = 0;
            if (sscanf(report.reason.c_str(), "modem_log:%d|wifi_spot:%d%c", &modemLog, &wifiSpot,
                       &tail) != 2) {
                KLOGE("Failed to get modem log and wifi spot switch");
                refused();
                return -2;
            }
            char stored[64];
            snprintf(stored, sizeof(stored), "modem_log=%d wifi_spot=%d", modemLog, wifiSpot);
            report.reason = stored;
        }
    }
    if (parsed) {
        android::Parcel row;
        row.writeInt64(time);
        row.writeInt32(type);
        row.writeString8(android::String8(report.name.c_str()));
        row.writeString8(android::String8(report.reason.c_str()));
        row.writeInt32(report.count);
        insertEntries(kPelmoraAbnormalTable, row, 1, false);
        if (type == kTypeGnss) {
            reportGnss({windowStart(time, report.count), time}, report);
        }
    }
    android::Parcel raw;
    raw.writeInt64(time);
    raw.writeString8(android::String8(text));
    insertEntries(kPelmoraTable, raw, 1, false);
    ABNLOGD("Pelmora message: %s", text);
    return 0;
}

int32_t AbnormalityRoutine::onCpuAbnormality(int64_t time, const char* text) {
    char package[64] = {};
    int32_t ret = parseMessage(text, "package=", "usage=", "%s", package, sizeof(package));
    if (ret < 0) {
        KLOGE("Failed to parse package, ret: %d", ret);
        KLOGE("Failed to parese abnormaltiy");
        return -19;
    }
    int32_t usage = 0;
    int32_t cpuTime = 0;
    long long energy = 0;
    if (parseMessage(text, "time=", "energy=", "%d", &cpuTime, sizeof(cpuTime)) < 0) {
        KLOGE("Failed to parse time");
        KLOGE("Failed to parese abnormaltiy");
        return -19;
    }
    if (parseMessage(text, "usage=", "time=", "%d", &usage, sizeof(usage)) < 0) {
        KLOGE("Failed to parse usage");
        KLOGE("Failed to parese abnormaltiy");
        return -19;
    }
    if (parseMessage(text, "energy=", nullptr, "%lld", &energy, sizeof(energy)) < 0) {
        KLOGE("Failed to parse energy");
        KLOGE("Failed to parese abnormaltiy");
        return -19;
    }
    int32_t cpus = Processors::configuredCount();
    // The CPU time spreads over every processor.
    window w = {windowStart(time, cpuTime / (cpus < 1 ? 1 : cpus)), time};
    android::Parcel row;
    row.writeInt64(w.start);
    row.writeInt64(w.end);
    row.writeString8(android::String8(package));
    row.writeInt32(usage);
    row.writeInt32(cpuTime / 1000);
    row.writeInt64(energy);
    insertEntries(kCpuTable, row, 1, false);
    reportCpu(w, package, usage, cpuTime, energy);
    return 0;
}

int32_t AbnormalityRoutine::onWakelockAbnormality(int64_t time, const char* text) {
    char package[128] = {};
    int32_t ret = parseMessage(text, "package=", "reason=", "%s", package, sizeof(package));
    if (ret < 0) {
        KLOGE("Failed to parse package, ret: %d", ret);
        KLOGE("Failed to parese wakelock abnormaltiy");
        return -19;
    }
    char reason[256] = {};
    ret = parseMessage(text, "reason=", "count=", "%s", reason, sizeof(reason));
    if (ret < 0) {
        KLOGE("Failed to parse reason, ret: %d", ret);
        KLOGE("Failed to parese wakelock abnormaltiy");
        return -19;
    }
    const char* hash = strchr(reason, '#');
    if (hash == nullptr) {
        KLOGE("Failed to find #");
        KLOGE("Failed to parese wakelock abnormaltiy");
        return -19;
    }
    int32_t duration = 0;
    ret = parseMessage(text, "count=", nullptr, "%d", &duration, sizeof(duration));
    if (ret < 0) {
        KLOGE("Failed to parse count, ret: %d", ret);
        KLOGE("Failed to parese wakelock abnormaltiy");
        return -19;
    }
    std::string tag(reason, hash - reason);
    ABNLOGD("Wakelock: %s tag: %s duration: %d", package, tag.c_str(), duration);
    if (!takeReport(mWakelock, package)) {
        return 0;
    }
    window w = {windowStart(time, duration), time};
    android::Parcel p;
    uploadWakelock(w, package, packageVersion(package), tag, duration, p);
    ABNLOGD("Received wakelock app: %s", package);
    sendWindowEvent(kEventSystem, w, p);
    return 0;
}

bool AbnormalityRoutine::takeReport(recent_reports& kind, const std::string& package) {
    if (kind.packages.count(package) != 0) {
        return false;
    }
    if (kind.today >= kDailyReportLimit) {
        refused();
        return false;
    }
    kind.packages.insert(package);
    ++kind.today;
    return true;
}

void AbnormalityRoutine::reportGnss(const window& w, const pelmora_report& report) {
    if (!takeReport(mGnss, report.name)) {
        return;
    }
    KLOGI("Received gps process: %s", report.name.c_str());
    android::Parcel element;
    formName(3, report.name, kNameLimit, element);
    formPackageType(5, report.name, element);
    if (!report.reason.empty()) {
        formName(4, report.reason, kShortLimit, element);
    }
    DataUploader::formIntData(2, report.count, element);
    android::Parcel p;
    DataUploader::formClassArray(4, kClassGnss, element, p);
    sendWindowEvent(kEventApplications, w, p);
}

void AbnormalityRoutine::reportCpu(const window& w, const std::string& package, int32_t usage,
                                   int64_t cpuTime, int64_t energy) {
    ABNLOGD("Cpu: %s usage: %d time: %ld", package.c_str(), usage,
            static_cast<long>(cpuTime / 1000));
    if (!takeReport(mCpu, package)) {
        return;
    }
    std::string trace;
    SystraceDumper::getInstance()->dumpSystrace(w.end, trace);
    android::Parcel element;
    formName(4, package, kNameLimit, element);
    formPackageType(5, package, element);
    DataUploader::formIntData(1, usage, element);
    DataUploader::formIntData(2, cpuTime / 1000, element);
    DataUploader::formIntData(3, energy, element);
    android::Parcel p;
    DataUploader::formClassArray(3, kClassCpu, element, p);
    if (!trace.empty()) {
        DataUploader::formDynamicPathData(trace.c_str(), 256, p);
    }
    ABNLOGD("Received cpu process: %s", package.c_str());
    sendWindowEvent(kEventApplications, w, p);
}

int32_t AbnormalityRoutine::handleCustomized(int32_t code, const android::Parcel& data,
                                             android::Parcel*) {
    data.setDataPosition(0);
    switch (code) {
        case REQUEST_BATTERY_CAPACITY:
            return onBatteryReport(data, mCapacity);
        case REQUEST_BATTERY_LEVEL:
            return onBatteryReport(data, mLevel);
        case REQUEST_HOURLY_APPLICATIONS:
            return onHourlyApplications(data);
        case REQUEST_CPU_REPORT:
            return onCpuHandlerReport(data);
        default:
            KLOGE("Unknown customized tag: %d", code);
            refused();
            return -3;
    }
}

int32_t AbnormalityRoutine::onBatteryReport(const android::Parcel& data, battery_report& stored) {
    battery_report report = {0, {0, 0, 0, 0}, ""};
    android::String8 version;
    bool ok = data.readInt32(&report.first) == android::NO_ERROR;
    for (int32_t i = 0; ok && i < 4; ++i) {
        ok = data.readInt32(&report.values[i]) == android::NO_ERROR;
    }
    if (!ok || data.readString8(&version) != android::NO_ERROR) {
        KLOGE("Invalid battery report");
        refused();
        return -5;
    }
    if (report.first <= stored.first) {
        return 0;
    }
    report.version.assign(version.string(), std::min(version.size(), kVersionLength));
    stored = report;
    return 0;
}

int32_t AbnormalityRoutine::onHourlyApplications(const android::Parcel& data) {
    if (mTimer == nullptr) {
        return 0;
    }
    int64_t hour = 0;
    if (data.readInt64(&hour) != android::NO_ERROR) {
        KLOGE("Invalid hourly applications request");
        refused();
        return -5;
    }
    auto it = mThresholds.find(KEY_APPLICATIONS);
    if (it == mThresholds.end() || it->second.size() < 2) {
        ABNLOGD("Invalid configuration parameter");
        return -2;
    }
    int64_t totalLimit = it->second[0];
    int64_t backgroundLimit = it->second[1];
    window w = {hour - kHourMs, hour};
    // Ranked by energy: the applications that used the most are examined.
    android::String8 sql = android::String8::format(
        "SELECT name, SUM(foreground_energy + background_energy), SUM(background_energy) FROM "
        "hourly_applications_accounting WHERE timestamp > %" PRId64 " AND timestamp <= %" PRId64
        " GROUP BY name ORDER BY SUM(foreground_energy + background_energy) DESC LIMIT %d",
        w.start, w.end, kTopRows);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 3, rows) < 0) {
        KLOGE("Failed to query applications accounting data");
        return -17;
    }
    if (rows > kTopRows) {
        KLOGE("Invalid row count: %d", rows);
        return -2;
    }
    for (int32_t i = 0; i < rows; ++i) {
        std::string name;
        int64_t total = 0;
        int64_t background = 0;
        if (!readText(reply, name) || !readLong(reply, total) || !readLong(reply, background)) {
            break;
        }
        if (name.empty()) {
            continue;
        }
        android::String8 name8(name.c_str());
        if (total > totalLimit) {
            android::Parcel element;
            formName(15, name, kNameLimit, element);
            formPackageType(16, name, element);
            DataUploader::formIntData(1, total, element);
            if (queryApplicationParts(w, name8, true, element) < 0) {
                KLOGE("Failed to query total application");
                continue;
            }
            DataUploader::formClassArray(2, kClassApplications, element, mPendingApps);
        }
        if (background > backgroundLimit) {
            android::Parcel element;
            formName(15, name, kNameLimit, element);
            formPackageType(16, name, element);
            DataUploader::formIntData(2, background, element);
            if (queryApplicationParts(w, name8, false, element) < 0) {
                KLOGE("Failed to query background application");
                continue;
            }
            DataUploader::formClassArray(2, kClassApplications, element, mPendingApps);
        }
    }
    return 0;
}

int32_t AbnormalityRoutine::queryApplicationParts(const window& w, const android::String8& name,
                                                  bool total, android::Parcel& element) {
    android::String8 quoted = KelvoUtils::quoteSqlText(name.string());
    android::String8 sql = android::String8::format(
        total ? "SELECT component, SUM(foreground_energy), SUM(background_energy) FROM "
                "hourly_applications_accounting WHERE timestamp > %" PRId64
                " AND timestamp <= %" PRId64 " AND name = %s GROUP BY name, component"
              : "SELECT component, SUM(background_energy) FROM hourly_applications_accounting "
                "WHERE timestamp > %" PRId64 " AND timestamp <= %" PRId64
                " AND name = %s GROUP BY name, component",
        w.start, w.end, quoted.string());
    android::Parcel reply;
    int32_t rows = 0;
    int32_t columns = total ? 3 : 2;
    if (queryEntriesSimple(sql, &reply, columns, rows) < 0) {
        return -17;
    }
    if (rows > kMaxComponentRows) {
        refused();
        rows = kMaxComponentRows;
    }
    for (int32_t i = 0; i < rows; ++i) {
        int64_t component = 0;
        int64_t foreground = 0;
        int64_t background = 0;
        if (!readLong(reply, component) || (total && !readLong(reply, foreground)) ||
            !readLong(reply, background)) {
            return -2;
        }
        if (component == kSensorComponent) {
            ABNLOGD("Skip sensor component of %s", name.string());
            continue;
        }
        if (component < 0 ||
            component >= static_cast<int64_t>(sizeof(kComponentParams) / sizeof(uint32_t))) {
            KLOGE("Invalid component: %d", static_cast<int32_t>(component));
            continue;
        }
        android::Parcel part;
        if (total) {
            DataUploader::formIntData(4, foreground, part);
        }
        DataUploader::formIntData(6, background, part);
        DataUploader::formClassData(kComponentParams[component], kClassComponent, part, element);
    }
    return 0;
}

int32_t AbnormalityRoutine::onCpuHandlerReport(const android::Parcel& data) {
    ABNLOGD("Check cpu handler abnormality");
    std::string text;
    int32_t taken = 0;
    while (data.dataAvail() > 0) {
        int32_t uid = 0;
        android::String8 name;
        float usage = 0;
        int32_t time = 0;
        int64_t energy = 0;
        if (data.readInt32(&uid) != android::NO_ERROR ||
            data.readString8(&name) != android::NO_ERROR ||
            data.readFloat(&usage) != android::NO_ERROR ||
            data.readInt32(&time) != android::NO_ERROR ||
            data.readInt64(&energy) != android::NO_ERROR) {
            KLOGE("Invalid cpu handler report");
            refused();
            break;
        }
        if (taken >= kMaxCpuRecords) {
            refused();
            break;
        }
        ++taken;
        if (usage > kCpuUsageLimit) {
            char item[512];
            snprintf(item, sizeof(item), "%u:%s:%.3f:%d:%lld#", static_cast<uint32_t>(uid),
                     name.string(), static_cast<double>(usage) / 100.0, time,
                     static_cast<long long>(energy));
            text += item;
        }
    }
    sendPowerpush(text, kPowerLogCpu);
    return 0;
}

void AbnormalityRoutine::sendPowerpush(std::string text, int32_t code) {
    if (text.empty()) {
        return;
    }
    const char* category = nullptr;
    if (code == kPowerLogWakelock) {
        category = "wakelock";
    } else if (code == kPowerLogCpu) {
        category = "cpu";
    } else {
        KLOGE("Unknown abnormality code: %d", code);
        return;
    }
    if (text.back() == '#') {
        text.pop_back();
    }
    __android_logPower_print(5, code, "", category, text.c_str());
    KLOGI("%s", text.c_str());
}

int32_t AbnormalityRoutine::onHourlyTick(const android::Parcel&) {
    if (++mHourlyTicks % 2 == 0) {
        mCpu.packages.clear();
        mGnss.packages.clear();
        mWakelock.packages.clear();
    }
    return 0;
}

int32_t AbnormalityRoutine::onDailyTick(const android::Parcel&) {
    mCpu.today = 0;
    mGnss.today = 0;
    mWakelock.today = 0;
    return 0;
}

}  // namespace kelvo
