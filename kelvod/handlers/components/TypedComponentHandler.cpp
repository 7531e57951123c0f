#include "handlers/components/TypedComponentHandler.h"

#include <string.h>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "utils/KelvoUtils.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr int32_t kRowsPerInsert = 200;

}  // namespace

TypedComponentHandler::TypedComponentHandler(const char* name, int32_t accounterType,
                                             uint32_t elector, const component_family* family)
    : ComponentHandler(name, accounterType, elector, {family}) {}

int32_t TypedComponentHandler::sendTypedAction(int32_t action, int32_t type, int64_t time,
                                               const String8& name) {
    Parcel parcel;
    parcel.writeInt32(mAccounterType);
    parcel.writeInt32(action);
    parcel.writeInt32(type);
    parcel.writeInt64(time);
    parcel.writeString8(name);
    return feedAccounter(parcel);
}

int32_t TypedComponentHandler::handleApplicationResult(const Parcel& data) {
    const component_family& family = *mFamilies[0];
    data.setDataPosition(0);
    int32_t type = 0;
    int64_t start = 0;
    int64_t end = 0;
    String8 name;
    int32_t durations[6] = {};
    int64_t energies[6] = {};
    bool ok =
        data.readInt32(&type) == android::NO_ERROR && data.readInt64(&start) == android::NO_ERROR &&
        data.readInt64(&end) == android::NO_ERROR && data.readString8(&name) == android::NO_ERROR;
    for (int i = 0; ok && i < 6; ++i) {
        ok = data.readInt32(&durations[i]) == android::NO_ERROR &&
             data.readInt64(&energies[i]) == android::NO_ERROR;
    }
    if (!ok) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid %s application result", family.word);
        return -2;
    }
    name = accountedName(name);
    if (energies[0] + energies[1] >= 0) {
        Parcel record;
        record.writeInt64(start);
        record.writeString8(name);
        record.writeInt32(family.appsCode);
        record.writeInt32(type);
        for (int i = 0; i < 4; ++i) {
            record.writeInt64(energies[i]);
        }
        for (int i = 0; i < 4; ++i) {
            record.writeInt32(durations[i]);
        }
        AppsAccounting::getInstance()->addAppsData(record);
    }
    Parcel row;
    row.writeInt32(type);
    row.writeInt64(start);
    row.writeInt64(end);
    row.writeString8(name);
    for (int i = 0; i < 6; ++i) {
        row.writeInt32(durations[i]);
        row.writeInt64(energies[i]);
    }
    return insertEntries(*family.rawApplications, row, 1, false);
}

int32_t TypedComponentHandler::handleComponentResult(const Parcel& data) {
    const component_family& family = *mFamilies[0];
    if (family.rawComponent == nullptr) {
        // The member's component sums come from its application rows.
        return 0;
    }
    data.setDataPosition(0);
    int32_t type = 0;
    int64_t start = 0;
    int64_t end = 0;
    bool ok = data.readInt32(&type) == android::NO_ERROR &&
              data.readInt64(&start) == android::NO_ERROR &&
              data.readInt64(&end) == android::NO_ERROR;
    Parcel row;
    row.writeInt32(type);
    row.writeInt64(start);
    row.writeInt64(end);
    for (int i = 0; ok && i < 6; ++i) {
        int32_t duration = 0;
        int64_t energy = 0;
        ok = data.readInt32(&duration) == android::NO_ERROR &&
             data.readInt64(&energy) == android::NO_ERROR;
        row.writeInt32(duration);
        row.writeInt64(energy);
    }
    if (!ok) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid %s component result", family.word);
        return -2;
    }
    return insertEntries(*family.rawComponent, row, 1, false);
}

int32_t TypedComponentHandler::logApplicationsAccounting(int64_t time) {
    forceFlushEntries();
    const component_family& family = *mFamilies[0];
    const table_attribute& hourly = *family.hourlyApplications;
    const table_attribute& component = *family.hourlyComponent;
    const int32_t values = component.count - 1;
    String8 sums;
    for (int32_t c = 1; c < component.count; ++c) {
        sums.appendFormat(", SUM(%s)", component.columns[c].name);
    }
    String8 sql = String8::format(
        "SELECT COUNT(*), name, type%s FROM %s WHERE end_time > %lld AND end_time <= %lld "
        "GROUP BY name, type",
        sums.string(), family.rawApplications->name, static_cast<long long>(time - kHourMs),
        static_cast<long long>(time));
    std::vector<sum_row> rows;
    if (querySumRows(sql, true, 1 + values, &rows) < 0) {
        KLOGE("Failed to query accounting %s data", family.word);
        return -17;
    }
    Parcel out;
    int32_t count = 0;
    for (const sum_row& row : rows) {
        // row.v: the type, then the values in the hourly tables' order.
        int32_t value = 1;
        for (int32_t c = 0; c < hourly.count; ++c) {
            const column_attribute& column = hourly.columns[c];
            if (strcmp(column.name, "timestamp") == 0) {
                out.writeInt64(time);
            } else if (strcmp(column.name, "name") == 0) {
                out.writeString8(row.name);
            } else if (strcmp(column.name, "type") == 0) {
                out.writeInt32(KelvoUtils::saturateInt32(row.v[0]));
            } else if (value <= values) {
                if (column.type == COLUMN_INT) {
                    out.writeInt32(KelvoUtils::saturateInt32(row.v[value]));
                } else {
                    out.writeInt64(row.v[value]);
                }
                ++value;
            }
        }
        if (++count == kRowsPerInsert) {
            insertEntries(hourly, out, count, false);
            out.setDataSize(0);
            out.setDataPosition(0);
            count = 0;
        }
    }
    if (count > 0) {
        insertEntries(hourly, out, count, false);
    }
    return 0;
}

}  // namespace kelvo
