#include "handlers/ThermalHandler.h"

#include <math.h>
#include <time.h>

#include <string>
#include <vector>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/BufferedLogServer.h"
#include "core/Dispatcher.h"
#include "core/Notifier.h"
#include "storage/DataUploader.h"
#include "utils/PackageProperty.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kDayMs = 86400000;
constexpr uint32_t kClassCall = 903009042;
constexpr uint32_t kClassScenePackages = 903009033;
constexpr uint32_t kClassPackage = 903009063;
constexpr int32_t kMaxUploadName = 100;

#define TABLE(version, name, ...)                                                                \
    const column_attribute k_##name##_columns[] = {__VA_ARGS__};                                 \
    const table_attribute k_##name = {                                                           \
        version, 1, static_cast<int32_t>(sizeof(k_##name##_columns) / sizeof(column_attribute)), \
        k_##name##_columns, #name};

TABLE("1.0", raw_thermal_abnormality, {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"})
TABLE("1.0", daily_thermal_applications, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
      {COLUMN_TEXT, "temperature_range"}, {COLUMN_INT, "count"})
TABLE("1.0", daily_thermal_shell, {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "temperature_range"},
      {COLUMN_INT, "count"})
TABLE("1.3", raw_thermal_heat_scene, {COLUMN_TIME, "timestamp"}, {COLUMN_TIME, "start_time"},
      {COLUMN_TIME, "end_time"}, {COLUMN_TEXT, "current_package"},
      {COLUMN_TEXT, "previous_package"}, {COLUMN_INT, "start_temperature"},
      {COLUMN_INT, "end_temperature"}, {COLUMN_INT, "top_temperature"}, {COLUMN_TIME, "top_time"},
      {COLUMN_INT, "brightness"}, {COLUMN_INT, "media_volume"}, {COLUMN_INT, "signal_kind"},
      {COLUMN_INT, "signal_level"}, {COLUMN_INT, "gps_state"}, {COLUMN_INT, "wifi_state"},
      {COLUMN_INT, "wifi_ap_state"}, {COLUMN_INT, "calling_state"}, {COLUMN_INT, "ap_temperature"},
      {COLUMN_INT, "charger_temperature"}, {COLUMN_INT, "flashlight_temperature"},
      {COLUMN_INT, "pa_temperature"}, {COLUMN_INT, "dcxo_temperature"},
      {COLUMN_INT, "rear_main_camera_temperature"}, {COLUMN_INT, "front_camera_temperature"},
      {COLUMN_INT, "rear_secondary_camera_temperature"}, {COLUMN_INT, "camera_model"},
      {COLUMN_INT, "battery_temperature"}, {COLUMN_INT, "charger_state"},
      {COLUMN_INT, "battery_current"}, {COLUMN_INT, "battery_voltage"},
      {COLUMN_INT, "ambient_light"}, {COLUMN_INT, "ambient_temperature"},
      {COLUMN_INT, "average_power"}, {COLUMN_TEXT, "top1_consumption_package"},
      {COLUMN_TEXT, "top2_consumption_package"}, {COLUMN_TEXT, "top3_consumption_package"},
      {COLUMN_INT, "wifi_temp"}, {COLUMN_INT, "ambient_temperature_2"})

#undef TABLE

const table_attribute* const kTables[] = {
    &k_raw_thermal_abnormality,
    &k_daily_thermal_applications,
    &k_daily_thermal_shell,
    &k_raw_thermal_heat_scene,
};

// Usage and energy summed over an episode. Tables with result buckets sum
// their four usage buckets (foreground, background and the two charging
// ones; screen on and off repeat them).
#define BUCKET_SUM(suffix)                                                      \
    "SUM(foreground_" suffix "+background_" suffix "+charge_foreground_" suffix \
    "+charge_background_" suffix ")"
#define BUCKET_SUMS(unit) BUCKET_SUM(unit) ", " BUCKET_SUM("energy")

struct usage_query {
    const char* select;  // before " FROM table"
    const char* table;
    int32_t usageParam;
    int32_t energyParam;
    const char* what;  // in the error line
};

const usage_query kUsageQueries[] = {
    {"SUM(duration+charge_duration), SUM(energy+charge_energy)", "raw_applications_backlight", 5, 4,
     "display usage and energy"},
    {BUCKET_SUMS("time"), "raw_component_cpu", 7, 6, "cpu usage and energy"},
    {BUCKET_SUMS("duration"), "raw_component_gnss", 9, 8, "gnss usage and energy"},
    {BUCKET_SUMS("duration"), "raw_component_sensor", 11, 10, "sensor usage and energy"},
    {"SUM(usage+charge_usage), SUM(energy+charge_energy)", "raw_applications_gpu", 13, 12,
     "gpu usage and energy"},
    {BUCKET_SUMS("duration"), "raw_applications_front_camera", 15, 14,
     "camera usage and energy: raw_applications_front_camera"},
    {BUCKET_SUMS("duration"), "raw_applications_rear_camera", 17, 16,
     "camera usage and energy: raw_applications_rear_camera"},
    {BUCKET_SUMS("duration"), "raw_applications_flashlight", 19, 18, "flashlight usage and energy"},
    {BUCKET_SUMS("duration"), "raw_applications_audio", 21, 20, "audio usage and energy"},
    {BUCKET_SUM("tx_bytes") "+" BUCKET_SUM("rx_bytes") ", " BUCKET_SUM("energy"),
     "raw_applications_wifi", 26, 25, "wifi traffic and energy"},
    {BUCKET_SUMS("duration"), "raw_applications_bluetooth", 28, 27, "bluetooth usage and energy"},
};

#undef BUCKET_SUMS
#undef BUCKET_SUM

constexpr const char* kWindow = " WHERE end_time > %lld AND end_time <= %lld";

// The values of a query expected to give exactly one row; false (values
// left at 0) otherwise.
bool queryOne(const String8& sql, int32_t columns, int64_t* values) {
    for (int32_t i = 0; i < columns; ++i) {
        values[i] = 0;
    }
    Parcel reply;
    int32_t rows = 0;
    if (StorageOperator::queryEntriesSimple(sql, &reply, columns, rows) < 0 || rows != 1) {
        return false;
    }
    for (int32_t i = 0; i < columns; ++i) {
        values[i] = reply.readInt64();
    }
    return true;
}

int64_t clampToInt64(double value) {
    if (!(value == value)) {
        return 0;
    }
    if (value >= 9223372036854775807.0) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT64_MAX;
    }
    if (value <= -9223372036854775808.0) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT64_MIN;
    }
    return static_cast<int64_t>(value);
}

// The local calendar day of a time, as year * 1000 + day of the year (the
// zone's offset at that very time).
int64_t localDay(int64_t ms) {
    time_t seconds = static_cast<time_t>(ms / 1000 - (ms % 1000 < 0 ? 1 : 0));
    struct tm local = {};
    if (localtime_r(&seconds, &local) == nullptr) {
        return ms / kDayMs;
    }
    return static_cast<int64_t>(local.tm_year) * 1000 + local.tm_yday;
}

void formPackage(uint32_t id, const std::string& name, Parcel& out) {
    Parcel package;
    DataUploader::formVarcharData(0, name.c_str(), kMaxUploadName + 1, package);
    DataUploader::formClassData(id, kClassPackage, package, out);
    int32_t type = PackageProperty::getInstance()->getPackageType(String8(name.c_str()));
    if (type >= 1) {
        DataUploader::formIntData(id + 1, type, out);
    }
}

}  // namespace

std::atomic<int64_t> ThermalHandler::sRecordDelayMs{ThermalHandler::kRecordDelayMs};
std::atomic<int64_t> ThermalHandler::sAnswerWaitMs{ThermalHandler::kAnswerWaitMs};

void ThermalHandler::setDelaysForTest(int64_t recordMs, int64_t answerMs) {
    sRecordDelayMs.store(recordMs > 0 ? recordMs : kRecordDelayMs);
    sAnswerWaitMs.store(answerMs > 0 ? answerMs : kAnswerWaitMs);
}

ThermalHandler::ThermalHandler() : KelvoOperator("ThermalHandler", -1, kElector) {}

ThermalHandler::~ThermalHandler() {
    readyToDestroy();
}

void ThermalHandler::addSchemaTable() {
    for (const table_attribute* table : kTables) {
        addSchema(*table);
    }
}

void ThermalHandler::cleanTables(int64_t time) {
    for (const table_attribute* table : kTables) {
        cleanObsoleteEntries(table->name, time,
                             table == &k_raw_thermal_abnormality ? "end_time" : "timestamp");
    }
}

void ThermalHandler::setupListeners(Parcel& out) {
    addNotifierListener(NOTIFICATION_DAILY_TICK, out);
    addBufferedLogReceiver(kSender, kSenderType, out);
}

void ThermalHandler::registerDispatcherTag() {
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_HIGH_TEMP_ENTER", TAG_HIGH_TEMP_ENTER}, this);
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_HIGH_TEMP_EXIT", TAG_HIGH_TEMP_EXIT}, this);
}

void ThermalHandler::setCandidateElector() {
    Parcel candidates;
    candidates.writeInt32(kCandidateDailyTick);
    setElector(kElector, candidates);
}

void ThermalHandler::dump(String8& out) {
    out.appendFormat("ThermalHandler: state %d, episodes today %d, last %lld .. %lld, day %lld\n",
                     mState, mCount, static_cast<long long>(mStart), static_cast<long long>(mEnd),
                     static_cast<long long>(mDayStamp));
    KelvoOperator::dump(out);
}

int32_t ThermalHandler::refuse(int32_t ret) {
    HealthCounters::add(Health::ThermalInputRefused);
    return ret;
}

int32_t ThermalHandler::handleLogger(int64_t time, int32_t tag, const char* /* text */) {
    if (tag != TAG_HIGH_TEMP_ENTER && tag != TAG_HIGH_TEMP_EXIT) {
        KLOGE("Unknown message tag: %d", tag);
        return -3;
    }
    if (tag == mState) {
        KLOGI("Repeated thermal abnormality trigger");
        return refuse(-2);
    }
    return tag == TAG_HIGH_TEMP_ENTER ? enterEpisode(time) : exitEpisode(time);
}

int32_t ThermalHandler::enterEpisode(int64_t time) {
    // A clock set back puts the enter before the previous start: far enough.
    if (time >= mStart && time - mStart <= kMinEnterSpacingMs) {
        KLOGI("Ignore nearest thermal abnormality trigger");
        return refuse(-2);
    }
    const int32_t user = gLogUserType.load();
    const int32_t limit = user == 3 || user == 5 ? kDailyLimitDebugUser : kDailyLimit;
    if (mCount >= limit) {
        KLOGI("Thermal abnormality count has reached the limit");
        return refuse(-2);
    }
    ++mCount;
    mState = TAG_HIGH_TEMP_ENTER;
    mStart = time;
    Parcel data;
    data.writeInt64(time);
    sendNotification(NOTIFICATION_ABNORMALITY_THERMAL, data);
    return 0;
}

int32_t ThermalHandler::exitEpisode(int64_t time) {
    mState = TAG_HIGH_TEMP_EXIT;
    mEnd = time;
    Parcel data;
    data.writeInt64(time);
    sendNotification(NOTIFICATION_ABNORMALITY_THERMAL, data);
    Parcel row;
    row.writeInt64(mStart);
    row.writeInt64(mEnd);
    insertEntries(k_raw_thermal_abnormality, row, 1, false);
    // The window travels with the message: a new episode may start before
    // this one is summed.
    Parcel episode;
    episode.writeInt64(mStart);
    episode.writeInt64(mEnd);
    int32_t ret = sendCustomizedMessageDelayed(MESSAGE_RECORD_EPISODE, episode, sRecordDelayMs);
    if (ret < 0) {
        return ret;
    }
    ++mRecordsPending;
    return 0;
}

int32_t ThermalHandler::handleCustomized(int32_t code, const Parcel& data, Parcel* /* reply */) {
    data.setDataPosition(0);
    if (code == MESSAGE_RECORD_EPISODE) {
        int64_t start = 0;
        int64_t end = 0;
        if (data.readInt64(&start) != android::NO_ERROR ||
            data.readInt64(&end) != android::NO_ERROR) {
            KLOGE("Invalid parameter");
            return -5;
        }
        int32_t ret = recordEpisode(start, end);
        if (mRecordsPending > 0 && --mRecordsPending == 0) {
            std::vector<int64_t> held;
            held.swap(mHeldVotes);
            for (int64_t hour : held) {
                voteCandidate(hour, kCandidateDailyTick, kElector);
            }
        }
        return ret;
    }
    if (code == MESSAGE_ANSWER_TIMEOUT) {
        if (mPendingDay >= 0 && data.readInt64() == mPendingDay) {
            KLOGE("No thermal log from %s for %lld", kSender, static_cast<long long>(mPendingDay));
            voteAnswered();
        }
        return 0;
    }
    KLOGE("Unknown customized tag: %d", code);
    return -3;
}

int32_t ThermalHandler::recordEpisode(int64_t start, int64_t end) {
    forceFlushEntries();
    const long long from = start;
    const long long to = end;
    Parcel out;
    int64_t battery[3];
    const bool batteryKnown = queryOne(
        String8::format("SELECT SUM(discharge_screen_on_gas_gauge+discharge_screen_off_gas_gauge), "
                        "SUM(discharge_screen_on_level+discharge_screen_off_level), "
                        "SUM(charge_screen_on_duration+charge_screen_off_duration) FROM "
                        "raw_component_battery WHERE end_time > %lld AND end_time <= %lld AND "
                        "discharge_screen_on_gas_gauge >= 0 AND discharge_screen_off_gas_gauge >= "
                        "0 AND discharge_screen_on_level >= 0 AND discharge_screen_off_level >= 0",
                        from, to),
        3, battery);
    if (!batteryKnown) {
        KLOGE("Failed to query battery data");
    }
    DataUploader::formIntData(2, battery[0], out);
    DataUploader::formIntData(3, battery[1], out);
    DataUploader::formIntData(29, battery[2], out);

    struct energy_param {
        int32_t id;
        int64_t energy;
    };
    std::vector<energy_param> energies;
    for (const usage_query& q : kUsageQueries) {
        int64_t values[2];
        String8 sql = String8::format("SELECT %s FROM %s", q.select, q.table);
        sql.appendFormat(kWindow, from, to);
        if (!queryOne(sql, 2, values)) {
            KLOGE("Failed to query %s", q.what);
        }
        DataUploader::formIntData(q.usageParam, values[0], out);
        energies.push_back({q.energyParam, values[1]});
    }
    int64_t modem[3];
    const char* const kModem[] = {
        "SELECT SUM(foreground_tx_bytes+foreground_rx_bytes+background_tx_bytes+"
        "background_rx_bytes+charge_foreground_tx_bytes+charge_foreground_rx_bytes+"
        "charge_background_tx_bytes+charge_background_rx_bytes) FROM raw_applications_modem",
        "SELECT SUM(energy+charge_energy) FROM raw_component_modem",
        "SELECT SUM(duration+charge_duration) FROM raw_component_modem",
    };
    const char* const kModemErrors[] = {"traffic", "energy", "call usage"};
    for (int32_t i = 0; i < 3; ++i) {
        String8 sql(kModem[i]);
        sql.appendFormat(kWindow, from, to);
        if (i == 2) {
            sql.append(" AND type = 0");
        }
        if (!queryOne(sql, 1, &modem[i])) {
            KLOGE("Failed to query modem %s", kModemErrors[i]);
        }
    }
    DataUploader::formIntData(23, modem[0], out);
    energies.push_back({22, modem[1]});
    Parcel call;
    DataUploader::formIntData(0, modem[2], call);
    DataUploader::formClassData(24, kClassCall, call, out);

    // What the battery delivered over what was accounted: the components'
    // energies are shared out so that they add up to it.
    double sum = 0;
    for (const energy_param& e : energies) {
        sum += static_cast<double>(e.energy);
    }
    const bool scaled = batteryKnown && sum >= 1 && battery[0] >= 0 && battery[2] == 0;
    const double factor = scaled ? static_cast<double>(battery[0]) * 3600.0 / sum : 1.0;
    for (const energy_param& e : energies) {
        DataUploader::formIntData(e.id, clampToInt64(static_cast<double>(e.energy) * factor), out);
    }
    DataUploader::formDatetimeData(0, start, out);
    DataUploader::formDatetimeData(1, end, out);
    KLOGD("Episode %lld .. %lld: gas gauge %lld, accounted %.0f, factor %.4f", from, to,
          static_cast<long long>(battery[0]), sum, factor);
    if (setAndUploadEvent(EVENT_THERMAL_ABNORMALITY, out, true) < 0) {
        KLOGE("Failed to set upload thermal abonomality data");
        return -23;
    }
    return 0;
}

int32_t ThermalHandler::onDailyTick(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    const int64_t hour = data.readInt64();
    // Local days: a day of 23 or 25 hours is still one day.
    if (localDay(hour) <= localDay(mDayStamp)) {
        KLOGI("Ignore repeated daily tick in one day");
        voteDaily(hour);
        return 0;
    }
    mDayStamp = hour;
    mCount = 0;
    int64_t request = hour;
    int32_t ret = BufferedLogServer::getInstance()->requestLogMessage(String8(kSender), kSenderType,
                                                                      &request, sizeof(request));
    if (ret < 0) {
        KLOGE("Failed to request log, ret: %d", ret);
        voteDaily(hour);
        return -2;
    }
    if (mPendingDay >= 0) {
        voteAnswered();  // the earlier request's round is over
    }
    mPendingDay = hour;
    Parcel timeout;
    timeout.writeInt64(hour);
    sendCustomizedMessageDelayed(MESSAGE_ANSWER_TIMEOUT, timeout, sAnswerWaitMs);
    return 0;
}

void ThermalHandler::voteDaily(int64_t hour) {
    // The round cleans the day's raw rows after this step: an episode that
    // ended before the tick is summed first.
    if (mRecordsPending > 0) {
        mHeldVotes.push_back(hour);
        return;
    }
    voteCandidate(hour, kCandidateDailyTick, kElector);
}

void ThermalHandler::voteAnswered() {
    if (mPendingDay >= 0) {
        voteDaily(mPendingDay);
        mPendingDay = -1;
    }
}

int32_t ThermalHandler::handleBufferedLog(const Parcel& data) {
    data.setDataPosition(0);
    int64_t arrival = 0;
    String8 sender;
    int32_t magic = 0;
    int32_t length = 0;
    const void* bytes = nullptr;
    const bool ok =
        data.readInt64(&arrival) == android::NO_ERROR &&
        data.readString8(&sender) == android::NO_ERROR &&
        data.readInt32(&magic) == android::NO_ERROR &&
        data.readInt32(&length) == android::NO_ERROR && length >= 0 &&
        (length == 0 || (bytes = data.readInplace(static_cast<size_t>(length))) != nullptr);
    int32_t ret = 0;
    if (!ok || sender != kSender || magic != kSenderType) {
        KLOGE("Unknown buffered log type");
        ret = refuse(-3);
    } else {
        ret = handleDaily(static_cast<const uint8_t*>(bytes), static_cast<size_t>(length));
    }
    // Whatever the entry held, the awaited answer has come.
    voteAnswered();
    return ret;
}

int32_t ThermalHandler::handleDaily(const uint8_t* data, size_t size) {
    ThermalRecords::daily daily;
    const int32_t parsed = ThermalRecords::parse(data, size, &daily);
    if (size >= sizeof(int64_t) && daily.dayStamp != mDayStamp) {
        KLOGE("This is not today's thermal data(%lld, %lld)",
              static_cast<long long>(daily.dayStamp), static_cast<long long>(mDayStamp));
        return refuse(-16);
    }
    storeDaily(daily);
    if (parsed == ThermalRecords::kUnknownBlock) {
        KLOGE("Unknown thermal type: %d", daily.unknownType);
        return refuse(-3);
    }
    if (parsed < 0) {
        KLOGE("Invalid thermal data: %zu bytes", size);
        return refuse(-2);
    }
    return 0;
}

void ThermalHandler::storeDaily(const ThermalRecords::daily& daily) {
    Parcel rows;
    int32_t count = 0;
    for (size_t i = 0; i < daily.applications.size(); ++i) {
        const ThermalRecords::application_range& a = daily.applications[i];
        rows.writeInt64(daily.dayStamp);
        rows.writeString8(String8(a.name.c_str()));
        rows.writeString8(String8(a.range.c_str()));
        rows.writeInt32(a.count);
        if (++count == kMaxRowsPerInsert || i + 1 == daily.applications.size()) {
            insertEntries(k_daily_thermal_applications, rows, count, false);
            rows.setDataSize(0);
            rows.setDataPosition(0);
            count = 0;
        }
    }
    for (size_t i = 0; i < daily.shell.size(); ++i) {
        rows.writeInt64(daily.dayStamp);
        rows.writeString8(String8(daily.shell[i].range.c_str()));
        rows.writeInt32(daily.shell[i].count);
        if (++count == kMaxRowsPerInsert || i + 1 == daily.shell.size()) {
            insertEntries(k_daily_thermal_shell, rows, count, false);
            rows.setDataSize(0);
            rows.setDataPosition(0);
            count = 0;
        }
    }
    uploadShell(daily);
    for (const ThermalRecords::heat_scene& scene : daily.scenes) {
        storeScene(daily.dayStamp, scene);
    }
}

void ThermalHandler::uploadShell(const ThermalRecords::daily& daily) {
    // Range0's parameter is the window's end stamp as well: the count,
    // formed last, keeps the place (the end is the start plus a day).
    Parcel out;
    DataUploader::formDatetimeData(0, daily.dayStamp - kDayMs, out);
    DataUploader::formDatetimeData(1, daily.dayStamp, out);
    bool formed = false;
    for (const ThermalRecords::range_count& r : daily.shell) {
        const int64_t index = ThermalRecords::rangeIndex(r.range);
        if (index < 0) {
            KLOGE("Failed to get temperature range index: %s", r.range.c_str());
            refuse(0);
            continue;
        }
        if (index > kMaxRangeIndex) {
            KLOGE("Invalid range index: %lld", static_cast<long long>(index));
            refuse(0);
            continue;
        }
        DataUploader::formIntData(static_cast<uint32_t>(index + 1), r.count, out);
        formed = true;
    }
    if (formed && setAndUploadEvent(EVENT_THERMAL_SHELL, out, true) < 0) {
        KLOGE("Failed to set upload thermal shell data");
    }
}

void ThermalHandler::storeScene(int64_t dayStamp, const ThermalRecords::heat_scene& s) {
    Parcel row;
    row.writeInt64(dayStamp);
    row.writeInt64(s.startTime);
    row.writeInt64(s.endTime);
    row.writeString8(String8(s.currentPackage.c_str()));
    row.writeString8(String8(s.previousPackage.c_str()));
    row.writeInt32(s.startTemperature);
    row.writeInt32(s.endTemperature);
    row.writeInt32(s.topTemperature);
    row.writeInt64(s.topTime);
    row.writeInt32(s.brightness);
    row.writeInt32(s.mediaVolume);
    for (int32_t value : s.values) {
        row.writeInt32(value);
    }
    row.writeInt32(s.ambientTemperature);
    row.writeInt32(s.averagePower);
    for (const std::string& top : s.topPackages) {
        row.writeString8(String8(top.c_str()));
    }
    row.writeInt32(s.wifiTemp);
    row.writeInt32(s.ambientTemperature2);
    insertEntries(k_raw_thermal_heat_scene, row, 1, false);

    Parcel out;
    DataUploader::formDatetimeData(0, s.startTime, out);
    DataUploader::formDatetimeData(1, s.endTime, out);
    DataUploader::formIntData(2, s.startTemperature, out);
    DataUploader::formIntData(3, s.endTemperature, out);
    DataUploader::formIntData(4, s.topTemperature, out);
    DataUploader::formDatetimeData(5, s.topTime, out);
    DataUploader::formIntData(6, s.brightness, out);
    DataUploader::formIntData(7, s.mediaVolume, out);
    // signal_kind .. battery_voltage; ambient_light has its own place.
    for (int32_t i = 0; i < ThermalRecords::kSceneInts - 1; ++i) {
        DataUploader::formIntData(static_cast<uint32_t>(8 + i), s.values[i], out);
    }
    DataUploader::formIntData(28, s.values[ThermalRecords::kSceneInts - 1], out);
    DataUploader::formIntData(29, s.ambientTemperature, out);
    DataUploader::formIntData(30, s.averagePower, out);
    DataUploader::formIntData(31, s.ambientTemperature2, out);
    DataUploader::formIntData(32, s.wifiTemp, out);
    Parcel packages;
    formPackage(5, s.currentPackage, packages);
    formPackage(7, s.previousPackage, packages);
    for (uint32_t i = 0; i < 3; ++i) {
        formPackage(9 + 2 * i, s.topPackages[i], packages);
    }
    DataUploader::formClassData(27, kClassScenePackages, packages, out);
    if (setAndUploadEvent(EVENT_THERMAL_SCENE, out, true) < 0) {
        KLOGE("Failed to set upload thermal heat scene data");
    }
}

}  // namespace kelvo
