#include "handlers/components/SensorHandler.h"

#include <string.h>

#include <algorithm>
#include <limits>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "utils/LoggerMessage.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

const column_attribute kStateColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "type"},  {COLUMN_INT, "state"},
    {COLUMN_INT, "uid"},        {COLUMN_TEXT, "name"}, {COLUMN_TEXT, "connection"},
};
const column_attribute kHourlyApplicationsColumns[] = {
    {COLUMN_INT, "type"},
    {COLUMN_TIME, "timestamp"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "foreground_duration"},
    {COLUMN_LONG, "foreground_energy"},
    {COLUMN_INT, "background_duration"},
    {COLUMN_LONG, "background_energy"},
    {COLUMN_INT, "screen_on_duration"},
    {COLUMN_LONG, "screen_on_energy"},
    {COLUMN_INT, "screen_off_duration"},
    {COLUMN_LONG, "screen_off_energy"},
};

const table_attribute kRawApplications = {"1.1", 1, kTypedRawApplicationsCount,
                                          kTypedRawApplicationsColumns, "raw_applications_sensor"};
const table_attribute kRawComponent = {"1.1", 1, kTypedRawComponentCount, kTypedRawComponentColumns,
                                       "raw_component_sensor"};
const table_attribute kHourlyApplications = {
    "1.0", 1, static_cast<int32_t>(sizeof(kHourlyApplicationsColumns) / sizeof(column_attribute)),
    kHourlyApplicationsColumns, "hourly_applications_sensor"};
const table_attribute kHourlyComponent = {"1.0", 1, kFamilyHourlyComponentCount,
                                          kFamilyHourlyComponentColumns, "hourly_component_sensor"};
const table_attribute kStateTable = {"1.0", 1, 6, kStateColumns, "raw_sensor_state"};

component_family makeFamily() {
    component_family f = {
        "sensor",
        &kRawApplications,
        &kRawComponent,
        &kHourlyApplications,
        &kHourlyComponent,
        APPS_SENSOR,
        10,
        11,
    };
    f.rankBy = "MAX(foreground_duration + background_duration)";
    f.longestDurations = true;
    return f;
}
const component_family kFamily = makeFamily();

constexpr int32_t kNoNumber = std::numeric_limits<int32_t>::min();

}  // namespace

SensorHandler::SensorHandler()
    : TypedComponentHandler("SensorHandler", ACCOUNTER_SENSOR, kElector, &kFamily) {}

const component_family& SensorHandler::family() {
    return kFamily;
}

const table_attribute& SensorHandler::stateTable() {
    return kStateTable;
}

bool SensorHandler::isWakeUpType(int32_t type) {
    return type == 17 || type == 19 || type == 65545;
}

void SensorHandler::addSchemaTable() {
    ComponentHandler::addSchemaTable();
    addSchema(kStateTable);
}

void SensorHandler::cleanTables(int64_t time) {
    ComponentHandler::cleanTables(time);
    cleanObsoleteEntries(kStateTable.name, time, "timestamp");
}

void SensorHandler::registerDispatcherTag() {
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_SENSOR_ENABLE", TAG_SENSOR_ENABLE}, this);
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_SENSOR_DISABLE", TAG_SENSOR_DISABLE}, this);
}

String8 SensorHandler::accountedName(const String8& name) const {
    // The accounter's element is "package|connection": the package is the
    // application, unless it is the system's own.
    const char* text = name.c_str();
    const char* bar = strchr(text, '|');
    if (bar == nullptr) {
        return name;
    }
    String8 package(text, bar - text);
    return package == "android" ? name : package;
}

int32_t SensorHandler::parseSensor(const char* text, sensor_state* out) {
    int32_t ret = parseInt(text, "uid=", "name=", kNoNumber, &out->uid);
    if (ret < 0) {
        KLOGE("Failed to parse uid, ret: %d", ret);
        return -19;
    }
    char name[kNameSize] = {};
    ret = parseMessage(text, "name=", "type=", "%s", name, sizeof(name));
    if (ret < 0) {
        KLOGE("Failed to parse name, ret: %d", ret);
        return -19;
    }
    ret = parseInt(text, "type=", "connection=", kNoNumber, &out->type);
    if (ret < 0) {
        KLOGE("Failed to parse type, ret: %d", ret);
        return -19;
    }
    char connection[kConnectionSize] = {};
    ret = parseMessage(text, "connection=", nullptr, "%s", connection, sizeof(connection));
    if (ret < 0) {
        KLOGE("Failed to parse connection, ret: %d", ret);
        return -19;
    }
    out->name = String8(name);
    out->connection = String8(connection);
    return 0;
}

int32_t SensorHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    if (tag != TAG_SENSOR_ENABLE && tag != TAG_SENSOR_DISABLE) {
        KLOGE("Unknown message tag: %d", tag);
        return -3;
    }
    sensor_state s = {0, 0, String8(), String8()};
    int32_t ret = parseSensor(text, &s);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse sensor data, ret: %d", ret);
        return -2;
    }
    const bool on = tag == TAG_SENSOR_ENABLE;
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(s.type);
    row.writeInt32(on ? 1 : 0);
    row.writeInt32(s.uid);
    row.writeString8(s.name);
    row.writeString8(s.connection);
    insertEntries(kStateTable, row, 1, false);
    return on ? enable(time, s) : disable(time, s);
}

void SensorHandler::sendSensorAction(int32_t action, int64_t time, const sensor_state& s) {
    Parcel parcel;
    parcel.writeInt32(mAccounterType);
    parcel.writeInt32(action);
    parcel.writeInt32(s.type);
    parcel.writeInt64(time);
    parcel.writeString8(s.name);
    parcel.writeString8(s.connection);
    feedAccounter(parcel);
}

int32_t SensorHandler::enable(int64_t time, const sensor_state& s) {
    if (s.type == kAnyType) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Invalid sensor type to enable: %d", s.type);
        return -2;
    }
    if (mEnabled.count(s) > 0) {
        // The accounter already charges it: one Activate per sensor.
        KLOGD("Already enabled type=%d uid=%d name=%s connection=%s", s.type, s.uid, s.name.c_str(),
              s.connection.c_str());
        return 0;
    }
    if (mEnabled.size() >= kMaxEnabled) {
        HealthCounters::add(Health::HandlerStateCapped);
        KLOGE("Too many enabled sensors: %zu, refused type=%d name=%s", mEnabled.size(), s.type,
              s.name.c_str());
        return -2;
    }
    mEnabled.insert(s);
    sendSensorAction(ACTION_ACTIVATE, time, s);
    if (isWakeUpType(s.type)) {
        return 0;
    }
    if (mCache.size() >= kMaxCached) {
        const sensor_state& old = mCache.front();
        HealthCounters::add(Health::HandlerStateCapped);
        KLOGE("Sensor cache full, no longer revised: type=%d uid=%d name=%s connection=%s",
              old.type, old.uid, old.name.c_str(), old.connection.c_str());
        mCache.pop_front();
    }
    mCache.push_back(s);
    KLOGD("Add sensor type=%d uid=%d name=%s connection=%s", s.type, s.uid, s.name.c_str(),
          s.connection.c_str());
    return 0;
}

int32_t SensorHandler::disable(int64_t time, const sensor_state& s) {
    auto matches = [&s](const sensor_state& e) {
        return (s.type == kAnyType || e.type == s.type) && e.uid == s.uid && e.name == s.name &&
               e.connection == s.connection;
    };
    bool found = false;
    for (auto it = mEnabled.begin(); it != mEnabled.end();) {
        if (!matches(*it)) {
            ++it;
            continue;
        }
        found = true;
        sendSensorAction(ACTION_DEACTIVATE, time, *it);
        it = mEnabled.erase(it);
    }
    for (auto it = mCache.begin(); it != mCache.end();) {
        if (!matches(*it)) {
            ++it;
            continue;
        }
        KLOGD("Remove sensor type=%d uid=%d name=%s connection=%s", it->type, it->uid,
              it->name.c_str(), it->connection.c_str());
        it = mCache.erase(it);
    }
    if (!found) {
        KLOGD("Not enabled type=%d uid=%d name=%s connection=%s", s.type, s.uid, s.name.c_str(),
              s.connection.c_str());
    }
    return 0;
}

int32_t SensorHandler::handleCustomized(int32_t code, const Parcel& data, Parcel*) {
    if (code != kSystemResume) {
        KLOGE("Unknown customized tag: %d", code);
        return -3;
    }
    data.setDataPosition(0);
    int64_t suspend = 0;
    int64_t resume = 0;
    if (data.readInt64(&suspend) != android::NO_ERROR ||
        data.readInt64(&resume) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid system resume");
        return -2;
    }
    return revise(suspend, resume);
}

int32_t SensorHandler::revise(int64_t suspend, int64_t resume) {
    if (suspend >= resume) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid sleep: %lld to %lld", static_cast<long long>(suspend),
              static_cast<long long>(resume));
        return -2;
    }
    // Every sensor stops at the suspend before any starts again, so no
    // sensor re-added at the resume is charged the sleep of one still on.
    for (const sensor_state& s : mCache) {
        sendSensorAction(ACTION_DEACTIVATE, suspend, s);
    }
    for (const sensor_state& s : mCache) {
        sendSensorAction(ACTION_ACTIVATE, resume, s);
        KLOGD("Revise sensor type=%d uid=%d name=%s connection=%s cut=%lld", s.type, s.uid,
              s.name.c_str(), s.connection.c_str(), static_cast<long long>(resume - suspend));
    }
    return 0;
}

int32_t SensorHandler::onVmDied(const Parcel& data) {
    int32_t ret = TypedComponentHandler::onVmDied(data);
    // The accounter dropped every connection: none is revised again.
    mEnabled.clear();
    mCache.clear();
    return ret;
}

}  // namespace kelvo
