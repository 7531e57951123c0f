#include "handlers/components/BatteryHandler.h"

#include <ctype.h>
#include <errno.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "kelvo/RootPath.h"
#include "storage/DataUploader.h"
#include "utils/TimeProvider.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDawnMs = 21600000;
constexpr int64_t kDayMs = 86400000;
constexpr int32_t kDefaultTolerance = -200;
// Level rises of 1 to 4 % while discharging are noise.
constexpr int32_t kLevelNoise = -5;
constexpr size_t kLineLength = 127;
constexpr size_t kBrandLength = 31;
constexpr uint32_t kClassLevel = 903009047;
constexpr int32_t kHoursPerDay = 24;

// Parameters of the discharge totals and of the daily statistics event.
constexpr uint32_t kGasField = 2;
constexpr uint32_t kLevelField = 3;
constexpr uint32_t kFullCapacityField = 2;
constexpr uint32_t kChargeCountField = 3;
constexpr uint32_t kChargeDurationField = 4;
constexpr uint32_t kDischargeDurationField = 5;
constexpr uint32_t kScreenOnGasField = 6;
constexpr uint32_t kScreenOffGasField = 7;
constexpr uint32_t kChargeScreenOnField = 17;
constexpr uint32_t kChargeScreenOffField = 18;
constexpr uint32_t kDischargeScreenOnField = 19;
constexpr uint32_t kDischargeScreenOffField = 20;
constexpr uint32_t kLevelDistributionField = 23;

// The rows every upload sums: spans with a large negative value (a real
// rise while discharging, or a fall while charging) are left out.
constexpr const char* kValidSpans =
    " AND discharge_screen_on_gas_gauge >= 0 AND discharge_screen_off_gas_gauge >= 0 AND "
    "discharge_screen_on_level >= 0 AND discharge_screen_off_level >= 0";

const column_attribute kStateColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "gas_gauge"},   {COLUMN_INT, "level"},
    {COLUMN_INT, "voltage"},    {COLUMN_INT, "temperature"}, {COLUMN_INT, "charge"},
    {COLUMN_INT, "screen"},
};
// The span columns: four buckets (discharging screen on, screen off,
// charging screen on, screen off) of duration, gas gauge and level.
const column_attribute kRawColumns[] = {
    {COLUMN_TIME, "start_time"},
    {COLUMN_TIME, "end_time"},
    {COLUMN_LONG, "discharge_screen_on_duration"},
    {COLUMN_INT, "discharge_screen_on_gas_gauge"},
    {COLUMN_INT, "discharge_screen_on_level"},
    {COLUMN_LONG, "discharge_screen_off_duration"},
    {COLUMN_INT, "discharge_screen_off_gas_gauge"},
    {COLUMN_INT, "discharge_screen_off_level"},
    {COLUMN_LONG, "charge_screen_on_duration"},
    {COLUMN_INT, "charge_screen_on_gas_gauge"},
    {COLUMN_INT, "charge_screen_on_level"},
    {COLUMN_LONG, "charge_screen_off_duration"},
    {COLUMN_INT, "charge_screen_off_gas_gauge"},
    {COLUMN_INT, "charge_screen_off_level"},
};
const column_attribute kHourlyColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_LONG, "discharge_screen_on_duration"},
    {COLUMN_INT, "discharge_screen_on_gas_gauge"},
    {COLUMN_INT, "discharge_screen_on_level"},
    {COLUMN_LONG, "discharge_screen_off_duration"},
    {COLUMN_INT, "discharge_screen_off_gas_gauge"},
    {COLUMN_INT, "discharge_screen_off_level"},
    {COLUMN_LONG, "charge_screen_on_duration"},
    {COLUMN_INT, "charge_screen_on_gas_gauge"},
    {COLUMN_INT, "charge_screen_on_level"},
    {COLUMN_LONG, "charge_screen_off_duration"},
    {COLUMN_INT, "charge_screen_off_gas_gauge"},
    {COLUMN_INT, "charge_screen_off_level"},
};
constexpr int32_t kSpanValues = 12;

const table_attribute kStateTable = {"1.0", 1, 7, kStateColumns, "raw_battery_state"};
const table_attribute kRawTable = {"1.0", 1, 14, kRawColumns, "raw_component_battery"};
const table_attribute kHourlyTable = {"1.0", 1, 13, kHourlyColumns, "hourly_component_battery"};

const char* const kSpanSums =
    "SUM(discharge_screen_on_duration), SUM(discharge_screen_on_gas_gauge), "
    "SUM(discharge_screen_on_level), SUM(discharge_screen_off_duration), "
    "SUM(discharge_screen_off_gas_gauge), SUM(discharge_screen_off_level), "
    "SUM(charge_screen_on_duration), SUM(charge_screen_on_gas_gauge), "
    "SUM(charge_screen_on_level), SUM(charge_screen_off_duration), "
    "SUM(charge_screen_off_gas_gauge), SUM(charge_screen_off_level)";

// Runs a query whose first column is COUNT(*) followed by `values` numbers;
// false when it failed or matched no row.
bool querySums(const String8& sql, int32_t values, int64_t* out, int32_t* ret) {
    Parcel reply;
    int32_t rows = 0;
    *ret = StorageOperator::queryEntriesSimple(sql, &reply, values + 1, rows);
    if (*ret < 0 || rows != 1) {
        *ret = *ret < 0 ? -17 : 0;
        return false;
    }
    int64_t count = 0;
    if (reply.readInt64(&count) != android::NO_ERROR) {
        *ret = -17;
        return false;
    }
    for (int32_t i = 0; i < values; ++i) {
        if (reply.readInt64(&out[i]) != android::NO_ERROR) {
            *ret = -17;
            return false;
        }
    }
    return count > 0;
}

}  // namespace

BatteryHandler::BatteryHandler()
    : KelvoOperator("BatteryHandler", -1, kElector),
      mPrevious{0, 0, 0, 0, 0, false, true},
      mUnit(1),
      mTolerance(kDefaultTolerance),
      mFullCapacity(0),
      mChargeCount(0),
      mLastCurrent(0),
      mLastFullCapacity(0) {
    mPrevious.timestamp = TimeProvider::getCurrentTime(TIME_TYPE_WALL);
}

int32_t BatteryHandler::toleranceOf(int32_t fullCapacity) {
    return fullCapacity < 1 ? kDefaultTolerance : -(fullCapacity / 20);
}

void BatteryHandler::addSchemaTable() {
    addSchema(kStateTable);
    addSchema(kRawTable);
    addSchema(kHourlyTable);
}

void BatteryHandler::cleanTables(int64_t time) {
    cleanObsoleteEntries(kStateTable.name, time, "timestamp");
    cleanObsoleteEntries(kRawTable.name, time, "end_time");
    cleanObsoleteEntries(kHourlyTable.name, time, "timestamp");
}

int32_t BatteryHandler::checkEnable() {
    static const struct {
        const char* path;
        int32_t unit;
    } kLayouts[] = {{kUpperPath, 1}, {kLowerPath, 1000}};
    for (const auto& layout : kLayouts) {
        std::string file = RootPath::resolve(std::string(layout.path) + "/charge_full");
        FILE* f = fopen(file.c_str(), "re");
        if (f == nullptr) {
            continue;
        }
        fclose(f);
        mPath = layout.path;
        mUnit = layout.unit;
        // The capacity is known from the start: the tolerance and the gauge
        // of the micro-unit layout depend on it on the first day too, and
        // a capacity report before the first daily tick has its count.
        refreshFullCapacity();
        refreshChargeCount();
        KLOGI("Battery path: %s, unit: %d", mPath.string(), mUnit);
        return 0;
    }
    KLOGE("Failed to get a valid battery path");
    return -2;
}

void BatteryHandler::setupListeners(Parcel& out) {
    for (int32_t type :
         {NOTIFICATION_CHARGER_ONLINE_CHANGED, NOTIFICATION_BATTERY_LEVEL_CHANGED,
          NOTIFICATION_SCREEN_STATE_CHANGED, NOTIFICATION_HOURLY_TICK, NOTIFICATION_HOURLY_UPLOADING,
          NOTIFICATION_COMPONENT_ACCOUNTING, NOTIFICATION_DAILY_TICK, NOTIFICATION_DAILY_UPLOADING,
          NOTIFICATION_DAWN_UPLOADING, NOTIFICATION_TIME_CHANGED, NOTIFICATION_ABNORMALITY_THERMAL,
          NOTIFICATION_FORCE_BALANCE, NOTIFICATION_SHUT_DOWN, NOTIFICATION_DIFF_DAY_REBOOT}) {
        addNotifierListener(type, out);
    }
}

void BatteryHandler::setCandidateElector() {
    Parcel candidates;
    for (int32_t c : {CANDIDATE_HOURLY_TICK, CANDIDATE_COMPONENT_ACCOUNTING,
                      CANDIDATE_HOURLY_UPLOAD, CANDIDATE_DAILY_TICK, CANDIDATE_DAILY_UPLOAD,
                      CANDIDATE_DIFF_DAY_REBOOT, CANDIDATE_DAWN_UPLOAD}) {
        candidates.writeInt32(c);
    }
    setElector(mElector, candidates);
}

void BatteryHandler::dump(String8& out) {
    out.appendFormat(
        "BatteryHandler: path %s unit %d full %d tolerance %d count %d; last state at %lld: "
        "gas %d level %d voltage %d temperature %d charge %d screen %d\n",
        mPath.string(), mUnit, mFullCapacity, mTolerance, mChargeCount,
        static_cast<long long>(mPrevious.timestamp), mPrevious.gasGauge, mPrevious.level,
        mPrevious.voltage, mPrevious.temperature, mPrevious.charge ? 1 : 0,
        mPrevious.screen ? 1 : 0);
    KelvoOperator::dump(out);
}

int32_t BatteryHandler::readValue(const char* file, int32_t* out) const {
    std::string path = RootPath::resolve(std::string(mPath.string()) + "/" + file);
    FILE* f = fopen(path.c_str(), "re");
    if (f == nullptr) {
        KLOGE("Failed to open %s: (%s)", path.c_str(), strerror(errno));
        return -14;
    }
    char buffer[kLineLength + 1] = {};
    errno = 0;
    bool read = fgets(buffer, sizeof(buffer), f) != nullptr;
    int error = errno;
    fclose(f);
    if (!read) {
        KLOGE("Failed to read %s: (%s)", path.c_str(), error != 0 ? strerror(error) : "empty");
        return -14;
    }
    // One whole number of 32 bits and nothing but blanks after it.
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(buffer, &end, 10);
    bool number = end != buffer && errno == 0 && value >= INT32_MIN && value <= INT32_MAX;
    while (number && *end != '\0' && isspace(static_cast<unsigned char>(*end))) {
        ++end;
    }
    if (!number || *end != '\0') {
        buffer[strcspn(buffer, "\n")] = '\0';
        KLOGE("Error value(path=%s, buffer=%s), ret=%d", path.c_str(), buffer, number ? 1 : 0);
        return -2;
    }
    *out = static_cast<int32_t>(value);
    return 0;
}

void BatteryHandler::readFailed(const char* what, int32_t ret) const {
    HealthCounters::add(Health::BatteryReadingsKept);
    KLOGD("Keeping the last %s: %d", what, ret);
}

int32_t BatteryHandler::refreshFullCapacity() {
    int32_t value = 0;
    int32_t ret = readValue("charge_full", &value);
    if (ret == 0 && value < 0) {
        KLOGE("Invalid capacity: %d", value);
        ret = -2;
    }
    if (ret < 0) {
        readFailed("full capacity", ret);
        return ret;
    }
    mFullCapacity = value / mUnit;
    mTolerance = toleranceOf(mFullCapacity);
    return mFullCapacity;
}

int32_t BatteryHandler::readLevel(int32_t* out) const {
    int32_t value = 0;
    int32_t ret = readValue("capacity", &value);
    if (ret == 0 && value < 0) {
        KLOGE("Invalid capacity: %d", value);
        ret = -2;
    }
    if (ret == 0) {
        *out = value;
    }
    return ret;
}

int32_t BatteryHandler::readGasGauge(int32_t* out) {
    int32_t value = 0;
    int32_t ret = 0;
    if (mUnit == 1) {
        ret = readValue("charge_now", &value);
        value /= mUnit;
    } else {
        int32_t level = 0;
        if (mFullCapacity < 1) {
            refreshFullCapacity();
        }
        ret = readLevel(&level);
        if (ret == 0 && mFullCapacity < 1) {
            ret = -2;  // no capacity to scale the level by
        }
        value = static_cast<int32_t>(static_cast<int64_t>(level) * mFullCapacity / 100);
    }
    if (ret == 0) {
        if (value < 0) {
            KLOGE("Invalid gas gauge: %d", value);
            ret = -2;
        } else {
            *out = value;
        }
    }
    return ret;
}

void BatteryHandler::refreshChargeCount() {
    int32_t value = 0;
    int32_t ret = readValue("cycle_count", &value);
    if (ret == 0 && value < 0) {
        KLOGE("Invalid count: %d", value);
        ret = -2;
    }
    if (ret < 0) {
        readFailed("charge count", ret);
        return;
    }
    mChargeCount = value;
}

int32_t BatteryHandler::readCurrent() {
    int32_t value = 0;
    int32_t ret = readValue("current_now", &value);
    if (ret < 0) {
        readFailed("current", ret);
    } else {
        mLastCurrent = value / mUnit;
    }
    return mLastCurrent;
}

String8 BatteryHandler::readBrand() const {
    if (mUnit != 1) {
        return String8(kUnknownBrand);
    }
    std::string path = RootPath::resolve(std::string(mPath.string()) + "/brand");
    FILE* f = fopen(path.c_str(), "re");
    if (f == nullptr) {
        return String8(kUnknownBrand);
    }
    char buffer[kBrandLength + 1] = {};
    bool read = fgets(buffer, sizeof(buffer), f) != nullptr;
    fclose(f);
    buffer[strcspn(buffer, "\r\n")] = '\0';
    return read && buffer[0] != '\0' ? String8(buffer) : String8(kUnknownBrand);
}

BatteryHandler::battery_state BatteryHandler::begin(int64_t t) {
    battery_state next = mPrevious;
    next.timestamp = t;
    int32_t gas = 0;
    int32_t ret = readGasGauge(&gas);
    if (ret == 0) {
        next.gasGauge = gas;
    } else {
        readFailed("gas gauge", ret);
    }
    return next;
}

void BatteryHandler::commit(const battery_state& next) {
    // Until the platform has reported the battery, its level and voltage
    // are unknown: the first report opens the first span.
    if (mPrevious.voltage >= 1) {
        recordSpan(mPrevious, next);
    }
    mPrevious = next;
}

void BatteryHandler::recordSpan(const battery_state& from, const battery_state& to) {
    int64_t duration = to.timestamp - from.timestamp;
    if (duration < 1) {
        return;
    }
    int64_t gas = from.charge ? static_cast<int64_t>(to.gasGauge) - from.gasGauge
                              : static_cast<int64_t>(from.gasGauge) - to.gasGauge;
    int32_t level = from.charge ? to.level - from.level : from.level - to.level;
    if (gas < 0 && gas > mTolerance) {
        gas = 0;
    }
    if (level < 0 && level > kLevelNoise) {
        level = 0;
    }
    int32_t bucket = (from.charge ? 2 : 0) + (from.screen ? 0 : 1);
    Parcel row;
    row.writeInt64(from.timestamp);
    row.writeInt64(to.timestamp);
    for (int32_t b = 0; b < 4; ++b) {
        bool mine = b == bucket;
        row.writeInt64(mine ? duration : 0);
        row.writeInt32(mine ? static_cast<int32_t>(gas) : 0);
        row.writeInt32(mine ? level : 0);
    }
    insertEntries(kRawTable, row, 1, false);
    Parcel state;
    state.writeInt64(to.timestamp);
    state.writeInt32(to.gasGauge);
    state.writeInt32(to.level);
    state.writeInt32(to.voltage);
    state.writeInt32(to.temperature);
    state.writeInt32(to.charge ? 1 : 0);
    state.writeInt32(to.screen ? 1 : 0);
    insertEntries(kStateTable, state, 1, false);
}

int32_t BatteryHandler::onChargerOnlineChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    bool online = false;
    if (data.readInt64(&time) != android::NO_ERROR || data.readBool(&online) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid charger notification");
        return -5;
    }
    battery_state next = begin(time);
    next.charge = online;
    // The forced form ("--discharge") carries the time and the flag only.
    if (data.dataAvail() > 0) {
        int32_t values[3] = {};
        bool ok = true;
        for (int32_t& v : values) {
            ok = ok && data.readInt32(&v) == android::NO_ERROR;
        }
        if (ok) {
            next.level = values[0];
            next.voltage = values[1];
            next.temperature = values[2];
        }
    }
    KLOGI("Battery charge state: %d", online ? 1 : 0);
    commit(next);
    return 0;
}

int32_t BatteryHandler::onBatteryLevelChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    int32_t level = 0;
    int32_t voltage = 0;
    int32_t temperature = 0;
    if (data.readInt64(&time) != android::NO_ERROR || data.readInt32(&level) != android::NO_ERROR ||
        data.readInt32(&voltage) != android::NO_ERROR ||
        data.readInt32(&temperature) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid battery level notification");
        return -5;
    }
    battery_state next = begin(time);
    checkCapacity(level, temperature);
    checkLevel(level, voltage, temperature);
    next.level = level;
    next.voltage = voltage;
    next.temperature = temperature;
    commit(next);
    return 0;
}

void BatteryHandler::checkCapacity(int32_t level, int32_t temperature) {
    if (level != 100 || mPrevious.level >= 100) {
        return;
    }
    int32_t full = refreshFullCapacity();
    if (full < 0) {
        return;  // nothing known about this full charge
    }
    int32_t last = mLastFullCapacity;
    mLastFullCapacity = full;
    if (full < 1 || last <= full) {
        return;
    }
    int32_t decrease = last - full;
    int32_t percentage = static_cast<int32_t>(static_cast<int64_t>(decrease) * 100 / last);
    if (percentage < 1) {
        return;
    }
    KLOGD("Battery capacity decreased: %d", decrease);
    Parcel report;
    report.writeInt32(percentage);
    report.writeInt32(full);
    report.writeInt32(decrease);
    report.writeInt32(mChargeCount);
    report.writeInt32(temperature);
    report.writeString8(readBrand());
    KelvoAgent::getInstance()->sendToRoutine(ROUTINE_ABNORMALITY, kCapacityDecrease, report,
                                             nullptr, false);
}

void BatteryHandler::checkLevel(int32_t level, int32_t voltage, int32_t temperature) {
    if (mPrevious.level <= level) {
        return;
    }
    KLOGD("Battery level decreased: %d", mPrevious.level - level);
    Parcel report;
    report.writeInt32(mPrevious.level - level);
    report.writeInt32(mPrevious.gasGauge);
    report.writeInt32(temperature);
    report.writeInt32(readCurrent());
    report.writeInt32(voltage);
    report.writeString8(readBrand());
    KelvoAgent::getInstance()->sendToRoutine(ROUTINE_ABNORMALITY, kLevelDecrease, report, nullptr,
                                             false);
}

int32_t BatteryHandler::onScreenStateChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    bool on = false;
    if (data.readInt64(&time) != android::NO_ERROR || data.readBool(&on) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid screen notification");
        return -5;
    }
    battery_state next = begin(time);
    next.screen = on;
    commit(next);
    return 0;
}

int32_t BatteryHandler::onHourlyTick(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    int64_t hour = data.readInt64();
    if (hour > mPrevious.timestamp) {
        commit(begin(hour));
    }
    voteCandidate(hour, CANDIDATE_HOURLY_TICK, mElector);
    return 0;
}

int32_t BatteryHandler::onTimeChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t before = data.readInt64();
    int64_t after = data.readInt64();
    commit(begin(before));
    // The jump itself is no span.
    mPrevious.timestamp = after;
    return 0;
}

int32_t BatteryHandler::onForceBalance(const Parcel& data) {
    data.setDataPosition(0);
    commit(begin(data.readInt64()));
    return 0;
}

int32_t BatteryHandler::onShutDown(const Parcel& data) {
    data.setDataPosition(0);
    battery_state next = begin(data.readInt64());
    next.screen = false;
    commit(next);
    return forceFlushEntries();
}

int32_t BatteryHandler::sendDailyMisc(int64_t time) {
    const struct {
        const char* name;
        int32_t value;
    } kValues[] = {{"battery_full_capacity", mFullCapacity}, {"battery_charge_count", mChargeCount}};
    int32_t ret = 0;
    for (const auto& v : kValues) {
        Parcel misc;
        misc.writeInt64(time);
        misc.writeString8(String8(v.name));
        misc.writeString8(String8::format("%d", v.value));
        if (KelvoAgent::getInstance()->sendToHandler(HANDLER_SYSTEM, kSystemMiscData, misc, nullptr,
                                                     false) < 0) {
            KLOGE("Failed to sent data to common table!");
            ret = -2;
        }
    }
    return ret;
}

int32_t BatteryHandler::onRefresh(int64_t time, int32_t candidate) {
    refreshFullCapacity();
    refreshChargeCount();
    int32_t ret = sendDailyMisc(time);
    voteCandidate(time, candidate, mElector);
    return ret;
}

int32_t BatteryHandler::onDailyTick(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    return onRefresh(data.readInt64(), CANDIDATE_DAILY_TICK);
}

int32_t BatteryHandler::onDiffDayReboot(const Parcel& data) {
    data.setDataPosition(0);
    return onRefresh(data.readInt64(), CANDIDATE_DIFF_DAY_REBOOT);
}

int32_t BatteryHandler::logComponentAccounting(int64_t time) {
    // The span closed at the hourly tick may still be queued.
    forceFlushEntries();
    const long long from = time - kHourMs;
    const long long to = time;
    int64_t sums[kSpanValues] = {};
    int32_t ret = 0;
    String8 sql = String8::format(
        "SELECT COUNT(*), %s FROM raw_component_battery WHERE end_time > %lld AND end_time <= "
        "%lld",
        kSpanSums, from, to);
    if (!querySums(sql, kSpanValues, sums, &ret)) {
        if (ret < 0) {
            KLOGE("Failed to query raw battery data");
        }
        return ret;
    }
    // The measured side of the compensation: the hour's discharge over the
    // same spans the uploads count.
    int64_t gas[2] = {};
    sql = String8::format(
        "SELECT COUNT(*), SUM(discharge_screen_on_gas_gauge), SUM(discharge_screen_off_gas_gauge) "
        "FROM raw_component_battery WHERE end_time > %lld AND end_time <= %lld%s",
        from, to, kValidSpans);
    if (querySums(sql, 2, gas, &ret) && gas[0] + gas[1] >= 1) {
        int64_t total = gas[0] + gas[1];
        KLOGI("Hourly total gas gauge: %lld", static_cast<long long>(total));
        updateCompensation(time, mElector, total * 3600);  // mAh to mA·s
    } else if (ret < 0) {
        KLOGE("Failed to query raw battery data");
    }
    Parcel row;
    row.writeInt64(time);
    for (int32_t i = 0; i < kSpanValues; ++i) {
        // Durations are long columns, the rest int.
        if (i % 3 == 0) {
            row.writeInt64(sums[i]);
        } else {
            row.writeInt32(static_cast<int32_t>(sums[i]));
        }
    }
    insertEntries(kHourlyTable, row, 1, false);
    return 0;
}

int32_t BatteryHandler::uploadTotals(uint32_t event, int64_t end, int64_t window) {
    if (event != EVENT_HOURLY_COMPONENTS && event != EVENT_DAILY_COMPONENTS) {
        KLOGE("Unknown eventid(%u)", event);
        return -2;
    }
    int64_t totals[2] = {};
    int32_t ret = 0;
    String8 sql = String8::format(
        "SELECT COUNT(*), SUM(discharge_screen_on_gas_gauge)+SUM(discharge_screen_off_gas_gauge), "
        "SUM(discharge_screen_on_level)+SUM(discharge_screen_off_level) FROM "
        "raw_component_battery WHERE end_time > %lld AND end_time <= %lld%s",
        static_cast<long long>(end - window), static_cast<long long>(end), kValidSpans);
    if (!querySums(sql, 2, totals, &ret)) {
        if (ret < 0) {
            KLOGE("Failed to query raw battery component");
        }
        return ret;
    }
    Parcel out;
    if (totals[0] >= 1) {
        DataUploader::formIntData(kGasField, totals[0], out);
    }
    if (totals[1] >= 1) {
        DataUploader::formIntData(kLevelField, totals[1], out);
    }
    if (setEventData(event, out, true) < 0) {
        KLOGE("Failed to set upload battery gas gauge and level");
        return -23;
    }
    return 0;
}

int32_t BatteryHandler::uploadDailyStatistics(int64_t end, int64_t window) {
    const long long from = end - window;
    const long long to = end;
    int32_t ret = 0;
    int64_t gas[2] = {};
    String8 sql = String8::format(
        "SELECT COUNT(*), SUM(discharge_screen_on_gas_gauge), SUM(discharge_screen_off_gas_gauge) "
        "FROM raw_component_battery WHERE end_time > %lld AND end_time <= %lld%s",
        from, to, kValidSpans);
    bool haveGas = querySums(sql, 2, gas, &ret);
    if (ret < 0) {
        KLOGE("Failed to query raw battery component");
        return -17;
    }
    int64_t durations[4] = {};
    sql = String8::format(
        "SELECT COUNT(*), SUM(discharge_screen_on_duration), SUM(discharge_screen_off_duration), "
        "SUM(charge_screen_on_duration), SUM(charge_screen_off_duration) FROM "
        "raw_component_battery WHERE end_time > %lld AND end_time <= %lld",
        from, to);
    querySums(sql, 4, durations, &ret);
    if (ret < 0) {
        KLOGE("Failed to query battery charge and discharge duration");
        return -17;
    }
    Parcel out;
    if (haveGas) {
        DataUploader::formIntData(kScreenOnGasField, gas[0], out);
        DataUploader::formIntData(kScreenOffGasField, gas[1], out);
    }
    DataUploader::formIntData(kChargeDurationField, durations[2] + durations[3], out);
    DataUploader::formIntData(kDischargeDurationField, durations[0] + durations[1], out);
    DataUploader::formIntData(kChargeScreenOnField, durations[2], out);
    DataUploader::formIntData(kChargeScreenOffField, durations[3], out);
    DataUploader::formIntData(kDischargeScreenOnField, durations[0], out);
    DataUploader::formIntData(kDischargeScreenOffField, durations[1], out);
    DataUploader::formIntData(kFullCapacityField, mFullCapacity, out);
    DataUploader::formIntData(kChargeCountField, mChargeCount, out);

    // The level at each hour's end and the charge gained in that hour, by
    // local hour 1..24 (midnight is 24). Rows come in time order and each
    // goes to its own hour: a repeated hour (a clock set back) keeps the
    // later row, and an hour without a row is (0, 0).
    Parcel reply;
    int32_t rows = 0;
    sql = String8::format(
        "SELECT hourly.timestamp, hourly.charge_screen_on_gas_gauge+hourly.charge_screen_off_gas_"
        "gauge, raw.level FROM hourly_component_battery as hourly JOIN raw_battery_state as raw on "
        "hourly.timestamp=raw.timestamp WHERE hourly.timestamp > %lld AND hourly.timestamp <= "
        "%lld ORDER BY hourly.timestamp",
        from, to);
    if (queryEntriesSimple(sql, &reply, 3, rows) < 0) {
        KLOGE("Failed to query battery level");
        return -17;
    }
    int64_t levels[kHoursPerDay + 1] = {};
    int64_t charged[kHoursPerDay + 1] = {};
    for (int32_t r = 0; r < rows; ++r) {
        int64_t v[3] = {};
        if (reply.readInt64(&v[0]) != android::NO_ERROR ||
            reply.readInt64(&v[1]) != android::NO_ERROR ||
            reply.readInt64(&v[2]) != android::NO_ERROR) {
            break;
        }
        int32_t hour = TimeProvider::getHour(v[0], true);
        hour = hour == 0 ? kHoursPerDay : hour;
        levels[hour] = v[2];
        charged[hour] = v[1];
    }
    for (int32_t hour = 1; hour <= kHoursPerDay; ++hour) {
        Parcel element;
        DataUploader::formIntData(0, levels[hour], element);
        DataUploader::formIntData(1, charged[hour], element);
        DataUploader::formClassArray(kLevelDistributionField, kClassLevel, element, out);
    }
    if (setEventData(EVENT_DAILY_SYSTEM, out, true) < 0) {
        KLOGE("Failed to upload daily battery statistics data");
        return -23;
    }
    return 0;
}

int32_t BatteryHandler::onPeriodUploading(const Parcel& data, uint32_t event, int64_t window,
                                          int32_t candidate, const char* what) {
    data.setDataPosition(0);
    data.readFloat();  // the ratio: the battery is what it is measured against
    int64_t end = data.readInt64();
    int32_t ret = uploadTotals(event, end, window);
    if (ret < 0) {
        KLOGE("Failed to upload %s battery gas gauge and level", what);
    }
    if (candidate == CANDIDATE_DAILY_UPLOAD && uploadDailyStatistics(end, window) < 0) {
        ret = -23;
    }
    voteCandidate(end, candidate, mElector);
    return ret;
}

int32_t BatteryHandler::onHourlyUploading(const Parcel& data) {
    return onPeriodUploading(data, EVENT_HOURLY_COMPONENTS, kHourMs, CANDIDATE_HOURLY_UPLOAD,
                             "hourly");
}

int32_t BatteryHandler::onDailyUploading(const Parcel& data) {
    return onPeriodUploading(data, EVENT_DAILY_COMPONENTS, kDayMs, CANDIDATE_DAILY_UPLOAD, "daily");
}

int32_t BatteryHandler::onDawnUploading(const Parcel& data) {
    return onPeriodUploading(data, EVENT_DAILY_COMPONENTS, kDawnMs, CANDIDATE_DAWN_UPLOAD, "dawn");
}

}  // namespace kelvo
