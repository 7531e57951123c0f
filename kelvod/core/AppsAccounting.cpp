#include "core/AppsAccounting.h"

#include <powerlog/powerlog.h>

#include <cinttypes>
#include <vector>

#include "KelvoLog.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/PackageProperty.h"
#include "utils/TimeProvider.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
        {COLUMN_TIME, "timestamp"},          {COLUMN_TEXT, "name"},
        {COLUMN_INT, "component"},           {COLUMN_LONG, "foreground_energy"},
        {COLUMN_LONG, "background_energy"},  {COLUMN_LONG, "screen_on_energy"},
        {COLUMN_LONG, "screen_off_energy"},  {COLUMN_LONG, "value1"},
        {COLUMN_LONG, "value2"},             {COLUMN_LONG, "value3"},
        {COLUMN_LONG, "value4"},
};
const table_attribute kTable = {"1.0", 1, 11, kColumns, "hourly_applications_accounting"};

enum data_kind { KIND_COMMON, KIND_SHARED, KIND_DISPLAY, KIND_NETWORK };

const data_kind kKinds[APPS_COMPONENT_COUNT] = {
        KIND_COMMON,  KIND_DISPLAY, KIND_SHARED, KIND_COMMON,  KIND_COMMON,   KIND_COMMON,
        KIND_COMMON,  KIND_COMMON,  KIND_DISPLAY, KIND_NETWORK, KIND_NETWORK, KIND_SHARED,
};
const int32_t kSubEventIds[APPS_COMPONENT_COUNT] = {9, 1, 12, 6, 7, 2, 8, 3, 5, 10, 11, 4};
// Order of the rows of one application: common, shared, display, network.
const int32_t kRowOrder[APPS_COMPONENT_COUNT] = {0, 3, 4, 5, 6, 7, 2, 11, 1, 8, 9, 10};

constexpr uint32_t kEnergyClass = 903009021;
constexpr uint32_t kApplicationClass = 903009027;
constexpr uint32_t kPackageClass = 903009063;
constexpr int32_t kNameLimit = 101; // at most 100 characters
constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDayMs = 86400000;
constexpr int64_t kDawnMs = 21600000;

bool readInt64s(const android::Parcel& p, int64_t* out, int n) {
    for (int i = 0; i < n; ++i) {
        if (p.readInt64(&out[i]) != android::NO_ERROR) return false;
    }
    return true;
}

bool readInt32s(const android::Parcel& p, int64_t* out, int n) {
    for (int i = 0; i < n; ++i) {
        int32_t v = 0;
        if (p.readInt32(&v) != android::NO_ERROR) return false;
        out[i] = v;
    }
    return true;
}

int64_t largest(const std::map<int32_t, int64_t>& sums) {
    int64_t best = 0;
    for (const auto& entry : sums) {
        best = entry.second > best ? entry.second : best;
    }
    return best;
}

} // namespace

const table_attribute& AppsAccounting::table() {
    return kTable;
}

AppsAccounting* AppsAccounting::getInstance() {
    static std::mutex lock;
    static AppsAccounting* instance = nullptr;
    std::lock_guard<std::mutex> guard(lock);
    if (instance == nullptr) {
        instance = new AppsAccounting();
    }
    return instance;
}

void AppsAccounting::addSchemaTable() {
    addSchema(kTable);
}

void AppsAccounting::cleanTables(int64_t time) {
    cleanObsoleteEntries(kTable.name, time, "timestamp");
}

int32_t AppsAccounting::getSubEventId(int32_t component) {
    if (component < 0 || component >= APPS_COMPONENT_COUNT) {
        KLOGE("Invalid component: %d", component);
        return -1;
    }
    return kSubEventIds[component];
}

int32_t AppsAccounting::addAppsData(const android::Parcel& record) {
    record.setDataPosition(0);
    int64_t timestamp = 0;
    android::String8 name;
    int32_t component = -1;
    if (record.readInt64(&timestamp) != android::NO_ERROR ||
        record.readString8(&name) != android::NO_ERROR ||
        record.readInt32(&component) != android::NO_ERROR) {
        KLOGE("Invalid applications record");
        return -5;
    }
    if (component < 0 || component >= APPS_COMPONENT_COUNT) {
        KLOGE("Unknown component type: %d", component);
        return -5;
    }
    // Read the whole record before touching the store: a short record adds
    // nothing.
    int64_t energy[4] = {0, 0, 0, 0};
    int64_t value[4] = {0, 0, 0, 0};
    int32_t subKey = 0;
    bool ok = false;
    switch (kKinds[component]) {
        case KIND_COMMON:
            ok = readInt64s(record, energy, 4) && readInt32s(record, value, 4);
            break;
        case KIND_SHARED:
            ok = record.readInt32(&subKey) == android::NO_ERROR && readInt64s(record, energy, 4) &&
                    readInt32s(record, value, 4);
            break;
        case KIND_DISPLAY:
            ok = readInt64s(record, &energy[0], 1) && readInt64s(record, &value[0], 1);
            break;
        case KIND_NETWORK:
            ok = readInt64s(record, energy, 4) && readInt64s(record, value, 4);
            break;
    }
    if (!ok) {
        KLOGE("Invalid applications record of component: %d", component);
        return -5;
    }
    int64_t hour = TimeProvider(timestamp).startOfHour() * 1000 + kHourMs;

    std::lock_guard<std::mutex> guard(mLock);
    component_slot& slot = mStore[hour][name.string()].slots[component];
    slot.used = true;
    for (int i = 0; i < 4; ++i) {
        slot.energy[i] += energy[i];
        if (kKinds[component] == KIND_SHARED) {
            slot.shared[i][subKey] += value[i];
        } else {
            slot.value[i] += value[i];
        }
    }
    return 0;
}

void AppsAccounting::writeRow(android::Parcel& rows, int64_t hour, const std::string& name,
                              int32_t component, const int64_t energy[4],
                              const int64_t value[4]) {
    rows.writeInt64(hour);
    rows.writeString8(android::String8(name.c_str()));
    rows.writeInt32(component);
    for (int i = 0; i < 4; ++i) rows.writeInt64(energy[i]);
    for (int i = 0; i < 4; ++i) rows.writeInt64(value[i]);
}

int32_t AppsAccounting::balanceAccount() {
    std::lock_guard<std::mutex> guard(mLock);
    android::Parcel rows;
    int32_t count = 0;
    int32_t result = 0;
    // Rows go out in chunks the storage accepts, so a large hour is never
    // refused whole after the store was emptied.
    auto flushRows = [&]() {
        if (count > 0 && insertEntries(kTable, rows, count, false) < 0) {
            result = -1;
        }
        rows.freeData();
        count = 0;
    };
    for (const auto& hourEntry : mStore) {
        for (const auto& appEntry : hourEntry.second) {
            for (int32_t component : kRowOrder) {
                const component_slot& slot = appEntry.second.slots[component];
                if (!slot.used) {
                    continue;
                }
                int64_t energy[4] = {slot.energy[0], slot.energy[1], slot.energy[2],
                                     slot.energy[3]};
                int64_t value[4] = {slot.value[0], slot.value[1], slot.value[2], slot.value[3]};
                switch (kKinds[component]) {
                    case KIND_COMMON:
                    case KIND_NETWORK:
                        if (energy[0] + energy[1] < 1) continue;
                        break;
                    case KIND_SHARED:
                        if (energy[0] + energy[1] < 1) continue;
                        for (int i = 0; i < 4; ++i) value[i] = largest(slot.shared[i]);
                        break;
                    case KIND_DISPLAY: {
                        if (slot.energy[0] < 1) continue;
                        int64_t e = slot.energy[0];
                        int64_t d = slot.value[0];
                        energy[0] = e;
                        energy[1] = 0;
                        energy[2] = e;
                        energy[3] = 0;
                        value[0] = d;
                        value[1] = 0;
                        value[2] = d;
                        value[3] = 0;
                        break;
                    }
                }
                writeRow(rows, hourEntry.first, appEntry.first, component, energy, value);
                if (++count == kMaxInsertRows) {
                    flushRows();
                }
            }
        }
    }
    mStore.clear();
    flushRows();
    return result;
}

int32_t AppsAccounting::uploadHourlyAppsAccounting(int64_t end, float scale) {
    return uploadAppsAccounting(EVENT_HOURLY_APPLICATIONS, end - kHourMs, end, scale);
}

int32_t AppsAccounting::uploadDailyAppsAccounting(int64_t end, float scale) {
    return uploadAppsAccounting(EVENT_DAILY_APPLICATIONS, end - kDayMs, end, scale);
}

int32_t AppsAccounting::uploadDawnAppsAccounting(int64_t end, float scale) {
    return uploadAppsAccounting(EVENT_DAILY_APPLICATIONS, end - kDawnMs, end, scale);
}

int32_t AppsAccounting::uploadAppsAccounting(uint32_t event, int64_t start, int64_t end,
                                             float scale) {
    if (event != EVENT_HOURLY_APPLICATIONS && event != EVENT_DAILY_APPLICATIONS) {
        KLOGE("Unknown eventid(%u)", event);
        return -2;
    }
    const int32_t limit = event == EVENT_DAILY_APPLICATIONS ? 20 : 10;
    android::String8 sql = android::String8::format(
            "SELECT name FROM hourly_applications_accounting WHERE timestamp > %" PRId64
            " AND timestamp <= %" PRId64
            " GROUP BY name ORDER BY SUM(foreground_energy + background_energy) DESC LIMIT %d",
            start, end, limit);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 1, rows) < 0) {
        KLOGE("Failed to query top applications accounting data");
        return -17;
    }
    if (rows > limit) {
        KLOGE("Invalid rows: %d", rows);
        return -16;
    }
    std::vector<android::String8> names;
    for (int32_t i = 0; i < rows; ++i) {
        android::String8 name;
        if (reply.readString8(&name) != android::NO_ERROR) {
            break;
        }
        names.push_back(name);
    }
    android::Parcel data;
    for (size_t i = 0; i < names.size(); ++i) {
        android::Parcel object;
        // A failed query ends the upload: a partial top list is not sent.
        if (queryAppsComponent(start, end, names[i], object, scale) < 0) {
            return -17;
        }
        if (object.dataSize() == 0) {
            continue;
        }
        android::Parcel package;
        DataUploader::formVarcharData(0, names[i].string(), kNameLimit, package);
        DataUploader::formClassData(15, kPackageClass, package, object);
        int32_t type = PackageProperty::getInstance()->getPackageType(names[i]);
        if (type >= 1) {
            DataUploader::formIntData(16, type, object);
        }
        DataUploader::formClassData(static_cast<uint32_t>(i + 2), kApplicationClass, object, data);
    }
    // The day's names go to the power log whether or not any of them had
    // fields to upload.
    if (end - start == kDayMs && !names.empty()) {
        std::string powerLog;
        for (const android::String8& name : names) {
            powerLog.append(name.string()).append("#");
        }
        __android_logPower_print(5, 215, "", "apps", powerLog.c_str());
    }
    if (data.dataSize() == 0) {
        return 0;
    }
    if (DataUploader::getInstance()->setEventData(event, data, true) < 0) {
        KLOGE("Failed to set applications accounting upload data(%u)", event);
        return -23;
    }
    return 0;
}

int32_t AppsAccounting::queryAppsComponent(int64_t start, int64_t end,
                                           const android::String8& name, android::Parcel& object,
                                           float scale) {
    android::String8 sql = android::String8::format(
            "SELECT component, SUM(foreground_energy), SUM(background_energy), "
            "SUM(screen_on_energy), SUM(screen_off_energy), SUM(value1), SUM(value2), "
            "SUM(value3), SUM(value4) FROM hourly_applications_accounting WHERE timestamp > "
            "%" PRId64 " AND timestamp <= %" PRId64 " AND name = ",
            start, end);
    sql.append(KelvoUtils::quoteSqlText(name.string()));
    sql.append(" GROUP BY component");
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 9, rows) < 0) {
        KLOGE("Failed to query applications accounting data: %s", name.string());
        return -17;
    }
    // Idle and voice modem energy is the modem's own estimate: never scaled.
    const double factor = (name == "modem_idle" || name == "modem_voice") ? 1.0 : scale;
    for (int32_t r = 0; r < rows; ++r) {
        int64_t c = 0;
        int64_t energy[4];
        int64_t value[4];
        if (reply.readInt64(&c) != android::NO_ERROR || !readInt64s(reply, energy, 4) ||
            !readInt64s(reply, value, 4)) {
            break;
        }
        if (c < 0 || c >= APPS_COMPONENT_COUNT) {
            KLOGE("Invalid component: %lld", static_cast<long long>(c));
            continue;
        }
        for (int i = 0; i < 4; ++i) {
            energy[i] = KelvoUtils::scaleEnergy(energy[i], factor);
        }
        android::Parcel fields;
        switch (kKinds[c]) {
            case KIND_COMMON:
            case KIND_SHARED: {
                const uint32_t valueFields[4] = {5, 7, 1, 3};
                const uint32_t energyFields[4] = {4, 6, 0, 2};
                for (int i = 0; i < 4; ++i) {
                    if (value[i] >= 1) {
                        DataUploader::formIntData(valueFields[i], value[i], fields);
                        DataUploader::formIntData(energyFields[i], energy[i], fields);
                    }
                }
                break;
            }
            case KIND_NETWORK: {
                const uint32_t energyFields[4] = {4, 6, 0, 2};
                const uint32_t valueFields[4] = {12, 14, 8, 10};
                for (int i = 0; i < 4; ++i) {
                    if (energy[i] >= 1) DataUploader::formIntData(energyFields[i], energy[i], fields);
                }
                for (int i = 0; i < 4; ++i) {
                    if (value[i] >= 1) DataUploader::formIntData(valueFields[i], value[i], fields);
                }
                break;
            }
            case KIND_DISPLAY:
                if (value[0] >= 1) {
                    DataUploader::formIntData(5, value[0], fields);
                    DataUploader::formIntData(1, value[0], fields);
                    DataUploader::formIntData(4, energy[0], fields);
                    DataUploader::formIntData(0, energy[0], fields);
                }
                break;
        }
        DataUploader::formClassData(static_cast<uint32_t>(kSubEventIds[c]), kEnergyClass, fields,
                                    object);
    }
    if (object.dataSize() > 0) {
        int32_t strategy = PackageProperty::getInstance()->getPackageStrategy(name);
        if (strategy >= 1) {
            DataUploader::formIntData(13, strategy, object);
        }
    }
    return 0;
}

} // namespace kelvo
