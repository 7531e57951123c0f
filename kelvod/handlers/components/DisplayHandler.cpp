#include "handlers/components/DisplayHandler.h"

#include <algorithm>
#include <chrono>
#include <limits>
#include <string>
#include <thread>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "storage/DataUploader.h"
#include "utils/TimeProvider.h"
#include "utils/devices/KelvoDevice.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kDayMs = 86400000;

constexpr uint32_t kClassDistribution = 903009028;
// Parameters of the daily statistics event.
constexpr uint32_t kScreenOffField = 8;
constexpr uint32_t kBacklightField = 10;
constexpr uint32_t kAmbientField = 11;
// 256 levels in 16 buckets, numbered 1 to 16.
constexpr int32_t kBucketWidth = 16;
constexpr int32_t kBuckets = 16;
// Ambient types of the daily distribution; the front levels follow the auto
// ones (0..5, then 6..11).
constexpr int32_t kAmbientAuto = 0;
constexpr int32_t kAmbientFront = 3;

const column_attribute kForegroundColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_TEXT, "foreground"},
};
const column_attribute kScreenStateColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "state"},
};
const column_attribute kBrightnessColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "brightness"},
    {COLUMN_INT, "duration"},
    {COLUMN_INT, "charge"},
};
const column_attribute kAmbientColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "type"},
    {COLUMN_INT, "level"},
    {COLUMN_INT, "duration"},
};
const column_attribute kRawApplicationsColumns[] = {
    {COLUMN_TIME, "start_time"},    {COLUMN_TIME, "end_time"}, {COLUMN_TEXT, "name"},
    {COLUMN_INT, "duration"},       {COLUMN_LONG, "energy"},   {COLUMN_INT, "charge_duration"},
    {COLUMN_LONG, "charge_energy"},
};
const column_attribute kHourlyApplicationsColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "duration"},
    {COLUMN_LONG, "energy"},
};
const column_attribute kHourlyComponentColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "duration"},
    {COLUMN_LONG, "energy"},
};

const table_attribute kForegroundTable = {"1.0", 1, 2, kForegroundColumns, "raw_foreground"};
const table_attribute kScreenStateTable = {"1.0", 1, 2, kScreenStateColumns, "raw_screen_state"};
const table_attribute kBrightnessTable = {"1.1", 1, 4, kBrightnessColumns, "raw_screen_brightness"};
const table_attribute kAmbientTable = {"1.0", 1, 4, kAmbientColumns, "raw_ambient_light"};
const table_attribute kRawApplications = {"1.1", 1, 7, kRawApplicationsColumns,
                                          "raw_applications_backlight"};
const table_attribute kHourlyApplications = {"1.0", 1, 4, kHourlyApplicationsColumns,
                                             "hourly_applications_backlight"};
const table_attribute kHourlyComponent = {"1.0", 1, 3, kHourlyComponentColumns,
                                          "hourly_component_backlight"};

// The backlight counts as foreground and as screen-on use.
const upload_pair kUploadPairs[] = {{0, 1, 5, 4}, {0, 1, 1, 0}};

component_family makeFamily() {
    component_family f = {
        "display",         &kRawApplications, nullptr, &kHourlyApplications,
        &kHourlyComponent, APPS_DISPLAY,      4,       5,
    };
    f.uploadPairs = kUploadPairs;
    f.uploadPairCount = 2;
    f.compensationValues[1] = -1;  // the energy alone
    // Screen-off time stays in the hourly application rows for the daily
    // screen-off duration, and out of the component and the uploads.
    f.filter = "name != 'screen_off'";
    f.filterAccounting = false;
    f.rankBy = "SUM(duration)";
    return f;
}
const component_family kFamily = makeFamily();

const dispatcher_tag kTags[] = {
    {"KELVO_TAG_FOREGROUND_CHANGED", DisplayHandler::TAG_FOREGROUND_CHANGED},
    {"KELVO_TAG_BRIGHTNESS", DisplayHandler::TAG_BRIGHTNESS},
    {"KELVO_TAG_AUTO_AMBIENT_LIGHT", DisplayHandler::TAG_AUTO_AMBIENT_LIGHT},
    {"KELVO_TAG_MANUAL_AMBIENT_LIGHT", DisplayHandler::TAG_MANUAL_AMBIENT_LIGHT},
    {"KELVO_TAG_APP_AMBIENT_LIGHT", DisplayHandler::TAG_APP_AMBIENT_LIGHT},
    {"KELVO_TAG_FRONT_AMBIENT_LIGHT", DisplayHandler::TAG_FRONT_AMBIENT_LIGHT},
};

int64_t readTime(const Parcel& data) {
    data.setDataPosition(0);
    return data.readInt64();
}

}  // namespace

std::atomic<int64_t> DisplayHandler::sForegroundDelayMs{
    DisplayHandler::kForegroundNotificationDelayMs};

DisplayHandler::DisplayHandler()
    : ComponentHandler("DisplayHandler", ACCOUNTER_BRIGHTNESS, kElector, {&kFamily},
                       {POLICY_DISPLAY, "Display", {kPolicyLevels, kPolicyAdvanced}}),
      mChargerOnline(false),
      mScreenOn(false),
      mLastBrightness(0),
      mLastBrightnessTime(TimeProvider::getCurrentTime(TIME_TYPE_WALL)),
      mForeground(kScreenOffName),
      mAdvancedReportTime(-1) {}

const component_family& DisplayHandler::family() {
    return kFamily;
}

void DisplayHandler::setForegroundNotificationDelayMs(int64_t ms) {
    sForegroundDelayMs.store(ms >= 0 ? ms : kForegroundNotificationDelayMs);
}

void DisplayHandler::addSchemaTable() {
    for (const table_attribute* table :
         {&kForegroundTable, &kScreenStateTable, &kBrightnessTable, &kAmbientTable}) {
        addSchema(*table);
    }
    ComponentHandler::addSchemaTable();
}

void DisplayHandler::cleanTables(int64_t time) {
    for (const table_attribute* table :
         {&kForegroundTable, &kScreenStateTable, &kBrightnessTable, &kAmbientTable}) {
        cleanObsoleteEntries(table->name, time, "timestamp");
    }
    ComponentHandler::cleanTables(time);
}

int32_t DisplayHandler::setConfiguration() {
    int32_t ret = ComponentHandler::setConfiguration();
    if (mPolicy == kPolicyAdvanced && KelvoDevice::setBrightnessInfoEnable(true) < 0) {
        KLOGE("Failed to set CABC/RGBW, using policy %d", kPolicyLevels);
        mPolicy = kPolicyLevels;
    }
    // The accounter scales its powers by the policy actually in force.
    if (mPolicy == kPolicyLevels || mPolicy == kPolicyAdvanced) {
        setDisplayEnergyPolicy(mPolicy);
    }
    return ret;
}

int32_t DisplayHandler::checkEnable() {
    int32_t ret = ComponentHandler::checkEnable();
    if (ret < 0) {
        KLOGE("Display handler disabled: no operator gets foreground or screen changes");
    }
    return ret;
}

void DisplayHandler::setupListeners(Parcel& out) {
    // Foreground and screen state are not listened to: they are sent here.
    static const int32_t kNotifications[] = {
        NOTIFICATION_CHARGER_ONLINE_CHANGED,
        NOTIFICATION_HOURLY_TICK,
        NOTIFICATION_DAILY_TICK,
        NOTIFICATION_APPLICATIONS_ACCOUNTING,
        NOTIFICATION_COMPONENT_ACCOUNTING,
        NOTIFICATION_HOURLY_UPLOADING,
        NOTIFICATION_DAILY_UPLOADING,
        NOTIFICATION_DAWN_UPLOADING,
        NOTIFICATION_TIME_CHANGED,
        NOTIFICATION_ABNORMALITY_THERMAL,
        NOTIFICATION_FORCE_BALANCE,
        NOTIFICATION_SHUT_DOWN,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    addLibraryListener(mAccounterType, out);
}

void DisplayHandler::registerDispatcherTag() {
    for (const dispatcher_tag& tag : kTags) {
        Dispatcher::getInstance()->registerTag(tag, this);
    }
}

int32_t DisplayHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    switch (tag) {
        case TAG_FOREGROUND_CHANGED:
            return handleForeground(time, text);
        case TAG_BRIGHTNESS:
            return handleBrightness(time, text);
        case TAG_AUTO_AMBIENT_LIGHT:
        case TAG_MANUAL_AMBIENT_LIGHT:
        case TAG_APP_AMBIENT_LIGHT:
        case TAG_FRONT_AMBIENT_LIGHT:
            return handleAmbientLight(time, tag - TAG_AUTO_AMBIENT_LIGHT, text);
        default:
            KLOGE("Unknown message tag: %d", tag);
            return -3;
    }
}

int32_t DisplayHandler::handleBrightness(int64_t time, const char* text) {
    // Starts below every level: a value that is no number stays out of range
    // instead of reading as 0 (screen off) or as the previous level.
    int32_t level = -1;
    int32_t ret = parseInt(text, "brightness=", nullptr, -1, &level);
    if (ret < 0 && ret != -2) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse message: %d", ret);
        return -19;
    }
    if (static_cast<uint32_t>(level) > static_cast<uint32_t>(kMaxBrightness)) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Invalid brightness: %d", level);
        return -9;
    }
    if (mPolicy == kPolicyLevels) {
        sendSetValue(time, level);
    }
    if (!mScreenOn && level >= 1) {
        changeScreen(time, true);
    } else if (mScreenOn && level == 0) {
        changeScreen(time, false);
    }
    closeSpan(time, level);
    return 0;
}

int32_t DisplayHandler::handleForeground(int64_t time, const char* text) {
    std::string name;
    int32_t ret = parseName(text, "name=", nullptr, &name);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse message: %d", ret);
        return -19;
    }
    KLOGD("Foreground: %s", name.c_str());
    changeForeground(time, String8(name.c_str()));
    return 0;
}

int32_t DisplayHandler::handleAmbientLight(int64_t time, int32_t type, const char* text) {
    int32_t durations[kAmbientLevels] = {};
    for (int32_t i = 0; i < kAmbientLevels; ++i) {
        std::string key = "d" + std::to_string(i) + "=";
        std::string next = "d" + std::to_string(i + 1) + "=";
        int32_t ret = parseInt(text, key.c_str(), i + 1 < kAmbientLevels ? next.c_str() : nullptr,
                               std::numeric_limits<int32_t>::min(), &durations[i]);
        if (ret < 0) {
            HealthCounters::add(Health::LoggerMessageRefused);
            KLOGE("Failed to parse duration: %d %s", i, text);
            return -19;
        }
    }
    Parcel rows;
    int32_t count = 0;
    for (int32_t i = 0; i < kAmbientLevels; ++i) {
        if (durations[i] >= 1) {
            rows.writeInt64(time);
            rows.writeInt32(type);
            rows.writeInt32(i);
            rows.writeInt32(durations[i]);
            ++count;
        }
    }
    return count > 0 ? insertEntries(kAmbientTable, rows, count, false) : 0;
}

void DisplayHandler::changeForeground(int64_t time, const String8& name) {
    if (name == mForeground) {
        return;
    }
    // The span ending here belongs to the application leaving the front.
    reportAdvanced(time);
    mForeground = name;
    std::this_thread::sleep_for(std::chrono::milliseconds(sForegroundDelayMs.load()));
    Parcel notification;
    notification.writeInt64(time);
    notification.writeString8(name);
    sendNotification(NOTIFICATION_FOREGROUND_CHANGED, notification);
    feedStateChange(ACTION_FOREGROUND, notification, true);
    insertEntries(kForegroundTable, notification, 1, false);
}

void DisplayHandler::changeScreen(int64_t time, bool on) {
    if (on == mScreenOn) {
        return;
    }
    if (!on) {
        changeForeground(time, String8(kScreenOffName));
    } else if (mForeground == kScreenOffName) {
        changeForeground(time, String8(kLauncherName));
    }
    mScreenOn = on;
    KLOGD("Screen state: %d", on ? 1 : 0);
    Parcel notification;
    notification.writeInt64(time);
    notification.writeBool(on);
    sendNotification(NOTIFICATION_SCREEN_STATE_CHANGED, notification);
    feedStateChange(ACTION_SCREEN_STATE, notification, false);
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(on ? 1 : 0);
    insertEntries(kScreenStateTable, row, 1, false);
}

void DisplayHandler::closeSpan(int64_t time, int32_t level) {
    KLOGD("Last brightness %d last timestamp %lld timestamp %lld", mLastBrightness,
          static_cast<long long>(mLastBrightnessTime), static_cast<long long>(time));
    // A time before the span's start (a clock that went back without a time
    // change) gives an empty span; the start never moves back.
    int64_t duration = time - mLastBrightnessTime;
    if (duration < 0 || duration > std::numeric_limits<int32_t>::max()) {
        HealthCounters::add(Health::ValuesSaturated);
        duration = duration < 0 ? 0 : std::numeric_limits<int32_t>::max();
    }
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(mLastBrightness);
    row.writeInt32(static_cast<int32_t>(duration));
    row.writeInt32(mChargerOnline ? 1 : 0);
    insertEntries(kBrightnessTable, row, 1, false);
    if (time > mLastBrightnessTime) {
        mLastBrightnessTime = time;
    }
    mLastBrightness = level;
}

void DisplayHandler::reportAdvanced(int64_t time) {
    if (mPolicy != kPolicyAdvanced) {
        return;
    }
    if (mAdvancedReportTime < 0) {
        // The first span runs from the boot; it cannot start after it ends.
        mAdvancedReportTime = std::min(KelvoAgent::getInstance()->getSystemBootTime(), time);
    }
    // A failed read keeps the span's start: the next read covers it too.
    uint32_t value = 0;
    if (KelvoDevice::getBrightnessInfo(&value) < 0) {
        return;
    }
    if (value > kMaxAdvancedBrightness) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        KLOGE("Get wrong brightness data: %u", value);
        return;
    }
    if (mForeground == kScreenOffName) {
        value = 0;
    }
    KLOGD("Brightness: %u last time: %lld", value, static_cast<long long>(mAdvancedReportTime));
    sendSetValue(mAdvancedReportTime, static_cast<int32_t>(value));
    mAdvancedReportTime = time;
}

void DisplayHandler::sendSetValue(int64_t time, int32_t value) {
    Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt64(time);
    action.writeInt32(value);
    feedAccounter(action);
}

int32_t DisplayHandler::handleApplicationResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t header = 0;
    int64_t start = 0;
    int64_t end = 0;
    String8 name;
    // The whole period's pair, three pairs not kept, the charge pair.
    int32_t durations[5] = {};
    int64_t energies[5] = {};
    bool ok = data.readInt32(&header) == android::NO_ERROR &&
              data.readInt64(&start) == android::NO_ERROR &&
              data.readInt64(&end) == android::NO_ERROR &&
              data.readString8(&name) == android::NO_ERROR;
    for (int i = 0; ok && i < 5; ++i) {
        ok = data.readInt32(&durations[i]) == android::NO_ERROR &&
             data.readInt64(&energies[i]) == android::NO_ERROR;
    }
    if (!ok) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid display application result");
        return -2;
    }
    Parcel row;
    row.writeInt64(start);
    row.writeInt64(end);
    row.writeString8(name);
    row.writeInt32(durations[0]);
    row.writeInt64(energies[0]);
    row.writeInt32(durations[4]);
    row.writeInt64(energies[4]);
    insertEntries(kRawApplications, row, 1, false);
    if (energies[0] >= 0 && name != kScreenOffName) {
        Parcel record;
        record.writeInt64(start);
        record.writeString8(name);
        record.writeInt32(APPS_DISPLAY);
        record.writeInt64(energies[0]);
        record.writeInt64(durations[0]);
        AppsAccounting::getInstance()->addAppsData(record);
    }
    return 0;
}

int32_t DisplayHandler::onChargerOnlineChanged(const Parcel& data) {
    int64_t time = readTime(data);
    bool online = data.readBool();
    reportAdvanced(time);
    // The span so far was held with the old charge state.
    closeSpan(time, mLastBrightness);
    mChargerOnline = online;
    return ComponentHandler::onChargerOnlineChanged(data);
}

int32_t DisplayHandler::onHourlyTick(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    reportAdvanced(data.readInt64());
    return ComponentHandler::onHourlyTick(data);
}

int32_t DisplayHandler::onDailyTick(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    int64_t hour = data.readInt64();
    reportAdvanced(hour);
    closeSpan(hour, mLastBrightness);
    return 0;
}

int32_t DisplayHandler::onTimeChanged(const Parcel& data) {
    int64_t before = readTime(data);
    int64_t after = data.readInt64();
    // Both spans end at the old time; the next ones start at the new time,
    // so a jump back charges nothing twice and a jump ahead nothing unseen.
    reportAdvanced(before);
    int32_t ret = ComponentHandler::onTimeChanged(data);
    closeSpan(before, mLastBrightness);
    mLastBrightnessTime = after;
    if (mPolicy == kPolicyAdvanced && mAdvancedReportTime >= 0) {
        mAdvancedReportTime = after;
    }
    return ret;
}

int32_t DisplayHandler::onAbnormalityThermal(const Parcel& data) {
    reportAdvanced(readTime(data));
    return ComponentHandler::onAbnormalityThermal(data);
}

int32_t DisplayHandler::onForceBalance(const Parcel& data) {
    reportAdvanced(readTime(data));
    return ComponentHandler::onForceBalance(data);
}

int32_t DisplayHandler::onShutDown(const Parcel& data) {
    int64_t time = readTime(data);
    reportAdvanced(time);
    ComponentHandler::onShutDown(data);
    Parcel state;
    state.writeInt64(time);
    state.writeInt32(0);
    insertEntries(kScreenStateTable, state, 1, false);
    Parcel foreground;
    foreground.writeInt64(time);
    foreground.writeString8(String8(kPowerOffName));
    insertEntries(kForegroundTable, foreground, 1, false);
    closeSpan(time, mLastBrightness);
    return forceFlushEntries();
}

int32_t DisplayHandler::onDailyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    int32_t ret = setPeriodData(EVENT_DAILY_COMPONENTS, end, kDayMs, ratio);
    if (setDailyStatistics(end) < 0) {
        ret = -23;
    }
    voteCandidate(end, CANDIDATE_DAILY_UPLOAD, mElector);
    return ret;
}

int32_t DisplayHandler::setDailyStatistics(int64_t end) {
    // The span closed at the daily tick may still be queued.
    forceFlushEntries();
    const long long from = end - kDayMs;
    const long long to = end;
    Parcel out;
    std::vector<sum_row> sums;
    String8 sql = String8::format(
        "SELECT COUNT(*), SUM(duration) FROM hourly_applications_backlight WHERE name == "
        "'screen_off' AND timestamp > %lld AND timestamp <= %lld",
        from, to);
    if (querySumRows(sql, false, 1, &sums) < 0) {
        KLOGE("Failed to query applications backlight data");
    } else if (!sums.empty() && sums[0].v[0] >= 1) {
        DataUploader::formIntData(kScreenOffField, sums[0].v[0], out);
    }

    Parcel reply;
    int32_t rows = 0;
    sql = String8::format(
        "SELECT brightness/%d+1, SUM(duration) FROM raw_screen_brightness WHERE charge = 0 AND "
        "brightness != 0 AND duration > 0 AND timestamp > %lld AND timestamp <= %lld GROUP BY "
        "brightness/%d",
        kBucketWidth, from, to, kBucketWidth);
    if (queryEntriesSimple(sql, &reply, 2, rows) < 0) {
        KLOGE("Failed to query brightness data");
    } else if (rows > kBuckets) {
        KLOGE("Invalid row count: %d", rows);
    } else {
        for (int32_t r = 0; r < rows; ++r) {
            int64_t bucket = 0;
            int64_t duration = 0;
            if (reply.readInt64(&bucket) != android::NO_ERROR ||
                reply.readInt64(&duration) != android::NO_ERROR) {
                break;
            }
            KLOGD("brightness: %lld, duration: %lld", static_cast<long long>(bucket),
                  static_cast<long long>(duration));
            if (duration >= 1) {
                Parcel element;
                DataUploader::formIntData(0, bucket, element);
                DataUploader::formIntData(1, duration, element);
                DataUploader::formClassArray(kBacklightField, kClassDistribution, element, out);
            }
        }
    }

    Parcel ambient;
    sql = String8::format(
        "SELECT type, level, SUM(duration) FROM raw_ambient_light WHERE (type = %d OR type = %d) "
        "AND timestamp > %lld AND timestamp <= %lld GROUP BY type, level",
        kAmbientAuto, kAmbientFront, from, to);
    int32_t ret = queryEntriesSimple(sql, &ambient, 3, rows);
    if (ret < 0) {
        KLOGE("Failed to query ambient light data: %d", ret);
    } else {
        for (int32_t r = 0; r < rows; ++r) {
            int64_t v[3] = {};
            if (ambient.readInt64(&v[0]) != android::NO_ERROR ||
                ambient.readInt64(&v[1]) != android::NO_ERROR ||
                ambient.readInt64(&v[2]) != android::NO_ERROR) {
                break;
            }
            KLOGD("type: %lld, level: %lld, duration: %lld", static_cast<long long>(v[0]),
                  static_cast<long long>(v[1]), static_cast<long long>(v[2]));
            if (v[2] >= 1) {
                Parcel element;
                DataUploader::formIntData(0, v[1] + (v[0] == kAmbientFront ? kAmbientLevels : 0),
                                          element);
                DataUploader::formIntData(1, v[2], element);
                DataUploader::formClassArray(kAmbientField, kClassDistribution, element, out);
            }
        }
    }
    if (setEventData(EVENT_DAILY_SYSTEM, out, true) < 0) {
        KLOGE("Failed to set upload data");
        return -23;
    }
    return 0;
}

}  // namespace kelvo
