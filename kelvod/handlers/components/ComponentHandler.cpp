#include "handlers/components/ComponentHandler.h"

#include <algorithm>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Notifier.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/LoggerMessage.h"
#include "utils/PackageProperty.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDayMs = 86400000;
constexpr int64_t kDawnMs = 21600000;

constexpr uint32_t kClassEnergy = 903009021;
constexpr uint32_t kClassApplication = 903009022;
constexpr uint32_t kClassPackage = 903009063;

// Rows written by one insert request.
constexpr int32_t kRowsPerInsert = 200;

void clearParcel(Parcel& p) {
    p.setDataSize(0);
    p.setDataPosition(0);
}

// The four result pairs: foreground, background, screen on, screen off.
const upload_pair kResultPairs[] = {{0, 1, 5, 4}, {2, 3, 7, 6}, {4, 5, 1, 0}, {6, 7, 3, 2}};

// The energy class of an upload: each (duration, energy) pair whose
// duration is at least 1, the energy scaled by the period's ratio.
void energyClass(const component_family& family, const ComponentHandler::sum_row& row, float ratio,
                 Parcel& out, bool component = false) {
    const int32_t values = static_cast<int32_t>(row.v.size());
    if (family.uploadTraffic != nullptr) {
        const bool energyAlone = component && family.componentEnergyAlone;
        for (int32_t i = 0; i < family.uploadTrafficCount; ++i) {
            const upload_traffic& group = family.uploadTraffic[i];
            if (group.tx >= values || group.rx >= values || group.energy >= values ||
                (row.v[group.tx] < 1 && row.v[group.rx] < 1 &&
                 !(energyAlone && row.v[group.energy] >= 1))) {
                continue;
            }
            DataUploader::formIntData(group.txField, row.v[group.tx], out);
            DataUploader::formIntData(group.rxField, row.v[group.rx], out);
            DataUploader::formIntData(group.energyField,
                                      KelvoUtils::scaleEnergy(row.v[group.energy], ratio), out);
        }
        return;
    }
    const upload_pair* pairs = family.uploadPairs != nullptr ? family.uploadPairs : kResultPairs;
    int32_t count = family.uploadPairs != nullptr ? family.uploadPairCount : 4;
    for (int32_t i = 0; i < count; ++i) {
        const upload_pair& pair = pairs[i];
        if (pair.duration < values && pair.energy < values && row.v[pair.duration] >= 1) {
            DataUploader::formIntData(pair.durationField, row.v[pair.duration], out);
            DataUploader::formIntData(pair.energyField,
                                      KelvoUtils::scaleEnergy(row.v[pair.energy], ratio), out);
        }
    }
}

// Writes the values of a summed row in the hourly tables' column types.
void writeValues(const component_family& family, const ComponentHandler::sum_row& row, Parcel& out) {
    const table_attribute& table = *family.hourlyComponent;
    for (int32_t c = 1; c < table.count && static_cast<size_t>(c - 1) < row.v.size(); ++c) {
        if (table.columns[c].type == COLUMN_INT) {
            out.writeInt32(KelvoUtils::saturateInt32(row.v[c - 1]));
        } else {
            out.writeInt64(row.v[c - 1]);
        }
    }
}

}  // namespace

String8 ComponentHandler::sumList(const component_family& family) {
    const table_attribute& table = *family.hourlyComponent;
    String8 list;
    for (int32_t c = 1; c < table.count; ++c) {
        list.appendFormat(c > 1 ? ", SUM(%s)" : "SUM(%s)", table.columns[c].name);
    }
    return list;
}

String8 ComponentHandler::valueList(const component_family& family) {
    if (!family.longestDurations) {
        return sumList(family);
    }
    const table_attribute& table = *family.hourlyComponent;
    String8 list;
    for (int32_t c = 1; c < table.count; ++c) {
        const bool duration = table.columns[c].type == COLUMN_INT;
        list.appendFormat(duration ? "%s%s" : "%sSUM(%s)", c > 1 ? ", " : "", table.columns[c].name);
    }
    return list;
}

int32_t ComponentHandler::valueCount(const component_family& family) {
    return family.hourlyComponent->count - 1;
}

String8 ComponentHandler::filterClause(const component_family& family) {
    return family.filter != nullptr ? String8::format(" AND (%s)", family.filter) : String8();
}

ComponentHandler::ComponentHandler(const char* name, int32_t accounterType, uint32_t elector,
                                   std::vector<const component_family*> families,
                                   data_source_policy policy)
    : KelvoOperator(name, accounterType, elector),
      mFamilies(std::move(families)),
      mPolicySource(std::move(policy)),
      mPolicy(kDefaultPolicy) {}

int32_t ComponentHandler::parseName(const char* text, const char* key, const char* nextKey,
                                    std::string* out) {
    char buffer[kNameBufferSize] = {};
    int32_t ret = parseMessage(text, key, nextKey, "%s", buffer, sizeof(buffer));
    if (ret < 0) {
        return ret;
    }
    out->assign(buffer);
    return 0;
}

int32_t ComponentHandler::parseInt(const char* text, const char* key, const char* nextKey,
                                   int32_t sentinel, int32_t* out) {
    int32_t value = sentinel;
    int32_t ret = parseMessage(text, key, nextKey, "%d", &value, sizeof(value));
    if (ret < 0) {
        return ret;
    }
    if (value == sentinel) {
        return -2;
    }
    *out = value;
    return 0;
}

int32_t ComponentHandler::readPolicy(int32_t component, int32_t* policy) {
    Parcel request;
    request.writeInt32(component);
    Parcel reply;
    int32_t value = 0;
    if (getXmlConfig(CONFIG_COMPONENT_POLICY, request, &reply) < 0 ||
        reply.readInt32(&value) != android::NO_ERROR) {
        return -1;
    }
    *policy = value;
    return 0;
}

int32_t ComponentHandler::setConfiguration() {
    if (mPolicySource.component < 0) {
        return 0;
    }
    // An unreadable policy leaves the default: the member still runs.
    mPolicy = kDefaultPolicy;
    int32_t policy = 0;
    if (readPolicy(mPolicySource.component, &policy) < 0) {
        HealthCounters::add(Health::SettingsRefused);
        KLOGE("Failed to get data source policy for %s, using %d", mPolicySource.word,
              kDefaultPolicy);
        return -2;
    }
    mPolicy = policy;
    KLOGI("%s policy: %d", mPolicySource.word, mPolicy);
    return 0;
}

int32_t ComponentHandler::checkEnable() {
    if (mPolicySource.component < 0) {
        return 0;
    }
    const std::vector<int32_t>& accepted = mPolicySource.accepted;
    if (std::find(accepted.begin(), accepted.end(), mPolicy) == accepted.end()) {
        KLOGE("%s is not supported: %d", mPolicySource.word, mPolicy);
        return -2;
    }
    return 0;
}

void ComponentHandler::addSchemaTable() {
    for (const component_family* f : mFamilies) {
        for (const table_attribute* table :
             {f->rawApplications, f->rawComponent, f->hourlyApplications, f->hourlyComponent}) {
            if (table != nullptr) {
                addSchema(*table);
            }
        }
    }
}

void ComponentHandler::cleanTables(int64_t time) {
    for (const component_family* f : mFamilies) {
        for (const table_attribute* table : {f->rawApplications, f->rawComponent}) {
            if (table != nullptr) {
                cleanObsoleteEntries(table->name, time, "end_time");
            }
        }
        for (const table_attribute* table : {f->hourlyApplications, f->hourlyComponent}) {
            if (table != nullptr) {
                cleanObsoleteEntries(table->name, time, "timestamp");
            }
        }
    }
}

void ComponentHandler::setupListeners(Parcel& out) {
    static const int32_t kNotifications[] = {
        NOTIFICATION_CHARGER_ONLINE_CHANGED,
        NOTIFICATION_SCREEN_STATE_CHANGED,
        NOTIFICATION_FOREGROUND_CHANGED,
        NOTIFICATION_HOURLY_TICK,
        NOTIFICATION_APPLICATIONS_ACCOUNTING,
        NOTIFICATION_COMPONENT_ACCOUNTING,
        NOTIFICATION_HOURLY_UPLOADING,
        NOTIFICATION_DAILY_UPLOADING,
        NOTIFICATION_DAWN_UPLOADING,
        NOTIFICATION_TIME_CHANGED,
        NOTIFICATION_ABNORMALITY_THERMAL,
        NOTIFICATION_FORCE_BALANCE,
        NOTIFICATION_SHUT_DOWN,
        NOTIFICATION_VM_DIED,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    if (mAccounterType >= 0) {
        addLibraryListener(mAccounterType, out);
    }
}

void ComponentHandler::setCandidateElector() {
    Parcel candidates;
    static const int32_t kCandidates[] = {
        CANDIDATE_HOURLY_TICK,   VOTE_APPLICATIONS_ACCOUNTING, VOTE_COMPONENT_ACCOUNTING,
        CANDIDATE_HOURLY_UPLOAD, CANDIDATE_DAILY_UPLOAD,       CANDIDATE_DAWN_UPLOAD,
    };
    for (int32_t c : kCandidates) {
        candidates.writeInt32(c);
    }
    setElector(mElector, candidates);
}

int32_t ComponentHandler::sendNamedAction(int32_t action, int64_t time, const String8& name) {
    Parcel parcel;
    parcel.writeInt32(mAccounterType);
    parcel.writeInt32(action);
    parcel.writeInt64(time);
    parcel.writeString8(name);
    return feedAccounter(parcel);
}

int32_t ComponentHandler::onHourlyTick(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    int64_t hour = data.readInt64();
    // The accounter closes the running periods at the hour and reports them.
    balanceAccounting(hour, BALANCE_AT, 0);
    voteCandidate(hour, CANDIDATE_HOURLY_TICK, mElector);
    return 0;
}

int32_t ComponentHandler::handleApplicationResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t header = 0;
    if (data.readInt32(&header) != android::NO_ERROR) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid %s application result", mFamilies[0]->word);
        return -2;
    }
    return storeApplicationResult(*mFamilies[0], data);
}

int32_t ComponentHandler::storeApplicationResult(const component_family& family,
                                                 const Parcel& data) {
    int64_t start = 0;
    int64_t end = 0;
    String8 name;
    int32_t durations[6] = {};
    int64_t energies[6] = {};
    bool ok = data.readInt64(&start) == android::NO_ERROR &&
              data.readInt64(&end) == android::NO_ERROR &&
              data.readString8(&name) == android::NO_ERROR;
    for (int i = 0; ok && i < 6; ++i) {
        ok = data.readInt32(&durations[i]) == android::NO_ERROR &&
             data.readInt64(&energies[i]) == android::NO_ERROR;
    }
    if (!ok) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid %s application result", family.word);
        return -2;
    }
    if (energies[0] + energies[1] >= 0) {
        Parcel record;
        record.writeInt64(start);
        record.writeString8(name);
        record.writeInt32(family.appsCode);
        for (int i = 0; i < 4; ++i) {
            record.writeInt64(energies[i]);
        }
        for (int i = 0; i < 4; ++i) {
            record.writeInt32(durations[i]);
        }
        AppsAccounting::getInstance()->addAppsData(record);
    }
    Parcel row;
    row.writeInt64(start);
    row.writeInt64(end);
    row.writeString8(name);
    for (int i = 0; i < 6; ++i) {
        row.writeInt32(durations[i]);
        row.writeInt64(energies[i]);
    }
    return insertEntries(*family.rawApplications, row, 1, false);
}

int32_t ComponentHandler::handleComponentResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t header = 0;
    if (data.readInt32(&header) != android::NO_ERROR) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid %s component result", mFamilies[0]->word);
        return -2;
    }
    return storeComponentResult(*mFamilies[0], data);
}

int32_t ComponentHandler::storeComponentResult(const component_family& family, const Parcel& data) {
    if (family.rawComponent == nullptr) {
        KLOGE("No %s component table", family.word);
        return -2;
    }
    int64_t start = 0;
    int64_t end = 0;
    bool ok =
        data.readInt64(&start) == android::NO_ERROR && data.readInt64(&end) == android::NO_ERROR;
    Parcel row;
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

int32_t ComponentHandler::querySumRows(const String8& sql, bool named, int32_t values,
                                       std::vector<sum_row>* out) {
    Parcel reply;
    int32_t rows = 0;
    int32_t ret = queryEntriesSimple(sql, &reply, 1 + (named ? 1 : 0) + values, rows);
    if (ret < 0) {
        return -17;
    }
    for (int32_t r = 0; r < rows; ++r) {
        int64_t count = 0;
        sum_row row;
        row.v.assign(values, 0);
        bool ok = reply.readInt64(&count) == android::NO_ERROR &&
                  (!named || reply.readString8(&row.name) == android::NO_ERROR);
        for (int32_t i = 0; ok && i < values; ++i) {
            ok = reply.readInt64(&row.v[i]) == android::NO_ERROR;
        }
        if (!ok) {
            KLOGE("Invalid rows: %d", rows);
            return -17;
        }
        // SUM over no rows is NULL: no data, no row.
        if (count > 0) {
            out->push_back(row);
        }
    }
    return 0;
}

int32_t ComponentHandler::logApplicationsAccounting(int64_t time) {
    forceFlushEntries();
    int32_t ret = 0;
    for (const component_family* f : mFamilies) {
        ret = std::min(ret, logApplicationsAccounting(*f, time));
    }
    return ret;
}

int32_t ComponentHandler::logApplicationsAccounting(const component_family& family, int64_t time) {
    String8 sql = String8::format(
        "SELECT COUNT(*), name, %s FROM %s WHERE end_time > %lld AND end_time <= %lld%s "
        "GROUP BY name",
        sumList(family).string(), family.rawApplications->name,
        static_cast<long long>(time - kHourMs), static_cast<long long>(time),
        family.filterAccounting ? filterClause(family).string() : "");
    std::vector<sum_row> sums;
    int32_t ret = querySumRows(sql, true, valueCount(family), &sums);
    if (ret < 0) {
        KLOGE("Failed to query accounting %s data: %d", family.word, ret);
        return -17;
    }
    Parcel rows;
    int32_t count = 0;
    for (const sum_row& row : sums) {
        rows.writeInt64(time);
        rows.writeString8(row.name);
        writeValues(family, row, rows);
        if (++count == kRowsPerInsert) {
            insertEntries(*family.hourlyApplications, rows, count, false);
            clearParcel(rows);
            count = 0;
        }
    }
    if (count > 0) {
        insertEntries(*family.hourlyApplications, rows, count, false);
    }
    return 0;
}

String8 ComponentHandler::componentSumsQuery(const component_family& family, int64_t from,
                                             int64_t to) {
    // Durations of overlapping rows come from the longest one.
    const char* longest = family.longestDurations
                              ? " ORDER BY MAX(foreground_duration + background_duration) DESC"
                              : "";
    if (family.rawComponent != nullptr) {
        return String8::format(
            "SELECT COUNT(*), %s FROM %s WHERE end_time > %lld AND "
            "end_time <= %lld%s",
            valueList(family).string(), family.rawComponent->name, static_cast<long long>(from),
            static_cast<long long>(to), longest);
    }
    return String8::format(
        "SELECT COUNT(*), %s FROM %s WHERE timestamp > %lld AND "
        "timestamp <= %lld%s%s",
        valueList(family).string(), family.hourlyApplications->name, static_cast<long long>(from),
        static_cast<long long>(to), filterClause(family).string(), longest);
}

int32_t ComponentHandler::logComponentAccounting(int64_t time) {
    // The raw component rows of the hour were written with the application
    // rows' flush; a member summing its hourly application rows needs those
    // just queued.
    for (const component_family* f : mFamilies) {
        if (f->rawComponent == nullptr) {
            forceFlushEntries();
            break;
        }
    }
    int32_t ret = 0;
    for (const component_family* f : mFamilies) {
        ret = std::min(ret, logComponentAccounting(*f, time));
    }
    return ret;
}

int32_t ComponentHandler::logComponentAccounting(const component_family& family, int64_t time) {
    std::vector<sum_row> sums;
    int32_t ret = querySumRows(componentSumsQuery(family, time - kHourMs, time), false,
                               valueCount(family), &sums);
    if (ret < 0) {
        KLOGE("Failed to query component %s data: %d", family.word, ret);
        return -17;
    }
    if (sums.empty()) {
        return 0;
    }
    const sum_row& row = sums[0];
    int64_t energy = 0;
    for (int32_t value : family.compensationValues) {
        if (value >= 0 && static_cast<size_t>(value) < row.v.size()) {
            energy += row.v[value];
        }
    }
    if (energy >= 1) {
        updateCompensation(time, mElector, energy);
    }
    Parcel out;
    out.writeInt64(time);
    writeValues(family, row, out);
    return insertEntries(*family.hourlyComponent, out, 1, false);
}

int32_t ComponentHandler::uploadComponent(const component_family& family, int64_t end,
                                          int64_t window, float ratio, Parcel& out) {
    String8 sql =
        String8::format("SELECT COUNT(*), %s FROM %s WHERE timestamp > %lld AND timestamp <= %lld",
                        sumList(family).string(), family.hourlyComponent->name,
                        static_cast<long long>(end - window), static_cast<long long>(end));
    std::vector<sum_row> sums;
    if (querySumRows(sql, false, valueCount(family), &sums) < 0) {
        KLOGE("Failed to query hourly component data");
        return -17;
    }
    if (sums.empty()) {
        return 0;
    }
    Parcel energy;
    energyClass(family, sums[0], ratio, energy, true);
    if (energy.dataSize() > 0) {
        DataUploader::formClassData(family.componentField, kClassEnergy, energy, out);
    }
    return 0;
}

int32_t ComponentHandler::uploadTopApplications(const component_family& family, int64_t end,
                                                int64_t window, float ratio, Parcel& out) {
    const long long from = static_cast<long long>(end - window);
    String8 source(family.hourlyApplications->name);
    const char* rank = family.rankBy != nullptr
                           ? family.rankBy
                           : "SUM(foreground_duration) + SUM(background_duration)";
    if (family.longestDurations) {
        // Overlapping rows: per application and hour the longest row's
        // durations and the summed energies, then the window's hours added
        // up (a day is not the longest single hour).
        const table_attribute& table = *family.hourlyComponent;
        String8 columns;
        for (int32_t c = 1; c < table.count; ++c) {
            const char* name = table.columns[c].name;
            if (table.columns[c].type == COLUMN_INT) {
                columns.appendFormat("%s, ", name);
            } else {
                columns.appendFormat("SUM(%s) AS %s, ", name, name);
            }
        }
        source = String8::format(
            "(SELECT name, timestamp, %sMAX(foreground_duration + background_duration) FROM %s "
            "WHERE timestamp > %lld AND timestamp <= %lld%s GROUP BY name, timestamp)",
            columns.string(), family.hourlyApplications->name, from,
            static_cast<long long>(end), filterClause(family).string());
        rank = "SUM(foreground_duration) + SUM(background_duration)";
    }
    String8 sql = String8::format(
        "SELECT COUNT(*), name, %s FROM %s WHERE timestamp > %lld AND timestamp <= %lld%s "
        "GROUP BY name ORDER BY %s DESC LIMIT %d",
        sumList(family).string(), source.string(), from, static_cast<long long>(end),
        filterClause(family).string(), rank, kTopApplications);
    std::vector<sum_row> rows;
    int32_t ret = querySumRows(sql, true, valueCount(family), &rows);
    if (ret < 0) {
        KLOGE("Failed to query top applications data: %d", ret);
        return -17;
    }
    if (rows.size() > static_cast<size_t>(kTopApplications)) {
        KLOGE("Invalid row count: %zu", rows.size());
        return -2;
    }
    for (const sum_row& row : rows) {
        Parcel energy;
        energyClass(family, row, ratio, energy);
        if (energy.dataSize() == 0) {
            continue;
        }
        Parcel package;
        DataUploader::formVarcharData(0, row.name.string(), kMaxUploadName + 1, package);
        Parcel element;
        DataUploader::formClassData(3, kClassPackage, package, element);
        int32_t strategy = PackageProperty::getInstance()->getPackageStrategy(row.name);
        if (strategy >= 1) {
            DataUploader::formIntData(2, strategy, element);
        }
        int32_t type = PackageProperty::getInstance()->getPackageType(row.name);
        if (type >= 1) {
            DataUploader::formIntData(4, type, element);
        }
        DataUploader::formClassData(1, kClassEnergy, energy, element);
        DataUploader::formClassArray(family.applicationsField, kClassApplication, element, out);
    }
    return 0;
}

int32_t ComponentHandler::uploadPeriod(uint32_t event, int64_t end, int64_t window, float ratio,
                                       int32_t candidate) {
    int32_t ret = setPeriodData(event, end, window, ratio);
    // Whatever failed, the round goes on.
    voteCandidate(end, candidate, mElector);
    return ret;
}

int32_t ComponentHandler::setPeriodData(uint32_t event, int64_t end, int64_t window, float ratio) {
    forceFlushEntries();
    Parcel out;
    for (const component_family* f : mFamilies) {
        uploadComponent(*f, end, window, ratio, out);
        uploadTopApplications(*f, end, window, ratio, out);
    }
    int32_t ret = setEventData(event, out, true);
    if (ret < 0) {
        KLOGE("Failed to set %s upload data", mFamilies[0]->word);
    }
    return ret < 0 ? -23 : 0;
}

int32_t ComponentHandler::onHourlyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    return uploadPeriod(EVENT_HOURLY_COMPONENTS, end, kHourMs, ratio, CANDIDATE_HOURLY_UPLOAD);
}

int32_t ComponentHandler::onDailyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    return uploadPeriod(EVENT_DAILY_COMPONENTS, end, kDayMs, ratio, CANDIDATE_DAILY_UPLOAD);
}

int32_t ComponentHandler::onDawnUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    return uploadPeriod(EVENT_DAILY_COMPONENTS, end, kDawnMs, ratio, CANDIDATE_DAWN_UPLOAD);
}

}  // namespace kelvo
