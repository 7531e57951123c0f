#include "handlers/components/WifiHandler.h"

#include <algorithm>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/Notifier.h"
#include "routines/PollingPayload.h"
#include "utils/KelvoUtils.h"
#include "utils/PackageProperty.h"
#include "utils/TimeProvider.h"

using android::NO_ERROR;
using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kHourMs = 3600000;
// Uids whose missing name is remembered within an hour, at most.
constexpr size_t kMaxNameLogged = 1000;
constexpr int32_t kRowsPerInsert = 200;
// Numeric message values start here, so a value that is no number fails.
constexpr int32_t kUnparsed = INT32_MIN;
// The accounter's signal levels: levels 0 and 1 of the handler are one.
constexpr int32_t kAccounterLevels = 4;
// Result headers: the allocator key of the record.
constexpr int32_t kResultHotspot = 0;
constexpr int32_t kResultApplications = 1;
const char* const kHotspotName = "wifi_ap";

const column_attribute kStateColumns[] = {{COLUMN_TIME, "timestamp"}, {COLUMN_INT, "state"}};
const column_attribute kScanColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"}, {COLUMN_INT, "foreground"}};
const column_attribute kBandColumns[] = {{COLUMN_TIME, "timestamp"}, {COLUMN_INT, "band"}};
const column_attribute kActivityColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "activity"}, {COLUMN_INT, "signal_level"}};
const column_attribute kActivityDurationColumns[] = {
    {COLUMN_TIME, "timestamp"},      {COLUMN_LONG, "signal_level_0"},
    {COLUMN_LONG, "signal_level_1"}, {COLUMN_LONG, "signal_level_2"},
    {COLUMN_LONG, "signal_level_3"}, {COLUMN_LONG, "signal_level_4"}};

// The traffic result columns of one bucket, in the order of the records.
#define WIFI_BUCKET(prefix)                                              \
    {COLUMN_INT, prefix "_duration"}, {COLUMN_LONG, prefix "_tx_bytes"}, \
        {COLUMN_LONG, prefix "_rx_bytes"}, {                             \
        COLUMN_LONG, prefix "_energy"                                    \
    }

const column_attribute kRawApplicationsColumns[] = {
    {COLUMN_TIME, "start_time"},     {COLUMN_TIME, "end_time"},
    {COLUMN_TEXT, "name"},           WIFI_BUCKET("foreground"),
    WIFI_BUCKET("background"),       WIFI_BUCKET("screen_on"),
    WIFI_BUCKET("screen_off"),       WIFI_BUCKET("charge_foreground"),
    WIFI_BUCKET("charge_background")};
const column_attribute kHourlyApplicationsColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},    WIFI_BUCKET("foreground"),
    WIFI_BUCKET("background"),  WIFI_BUCKET("screen_on"), WIFI_BUCKET("screen_off")};
const column_attribute kHourlyComponentColumns[] = {{COLUMN_TIME, "timestamp"},
                                                    WIFI_BUCKET("foreground"),
                                                    WIFI_BUCKET("background"),
                                                    WIFI_BUCKET("screen_on"),
                                                    WIFI_BUCKET("screen_off")};

#undef WIFI_BUCKET

template <size_t N>
constexpr int32_t countOf(const column_attribute (&)[N]) {
    return static_cast<int32_t>(N);
}

const table_attribute kWifiState = {"1.0", 1, countOf(kStateColumns), kStateColumns,
                                    "raw_wifi_state"};
const table_attribute kWifiApState = {"1.0", 1, countOf(kStateColumns), kStateColumns,
                                      "raw_wifi_ap_state"};
const table_attribute kWifiScan = {"1.1", 1, countOf(kScanColumns), kScanColumns, "raw_wifi_scan"};
const table_attribute kWifiBand = {"1.0", 1, countOf(kBandColumns), kBandColumns, "raw_wifi_band"};
const table_attribute kWifiActivity = {"1.1", 1, countOf(kActivityColumns), kActivityColumns,
                                       "raw_wifi_activity"};
const table_attribute kWifiActivityDuration = {"1.0", 1, countOf(kActivityDurationColumns),
                                               kActivityDurationColumns,
                                               "raw_wifi_activity_duration"};
const table_attribute kRawApplications = {"1.1", 1, countOf(kRawApplicationsColumns),
                                          kRawApplicationsColumns, "raw_applications_wifi"};
const table_attribute kHourlyApplications = {"1.0", 1, countOf(kHourlyApplicationsColumns),
                                             kHourlyApplicationsColumns, "hourly_applications_wifi"};
const table_attribute kHourlyComponent = {"1.0", 1, countOf(kHourlyComponentColumns),
                                          kHourlyComponentColumns, "hourly_component_wifi"};

// The energy class of the uploads, by bucket: the summed values (duration,
// tx, rx, energy per bucket) and their fields. These are fields of the
// energy class 903009021; field 12 here is the foreground tx bytes, while
// parameter 12 of the hourly event 903001060 is the GPU's component class:
// two classes, two meanings.
const upload_traffic kUploadTraffic[] = {
    {1, 2, 3, 12, 13, 4},     // foreground
    {5, 6, 7, 14, 15, 6},     // background
    {9, 10, 11, 8, 9, 0},     // screen on
    {13, 14, 15, 10, 11, 2},  // screen off
};

component_family makeFamily() {
    component_family f = {
        "wifi",
        &kRawApplications,
        nullptr,  // the component sums are those of the hourly application rows
        &kHourlyApplications,
        &kHourlyComponent,
        APPS_WIFI,
        25,
        26,
    };
    f.uploadTraffic = kUploadTraffic;
    f.uploadTrafficCount = 4;
    f.compensationValues[0] = 3;  // foreground energy
    f.compensationValues[1] = 7;  // background energy
    f.rankBy =
        "SUM(foreground_tx_bytes) + SUM(foreground_rx_bytes) + "
        "SUM(background_tx_bytes) + SUM(background_rx_bytes)";
    return f;
}

const component_family kFamily = makeFamily();

int64_t saturatedSum(int64_t a, int64_t b) {
    int64_t sum = 0;
    if (__builtin_add_overflow(a, b, &sum)) {
        HealthCounters::add(Health::ValuesSaturated);
        return b > 0 ? INT64_MAX : INT64_MIN;
    }
    return sum;
}

}  // namespace

WifiHandler::WifiHandler() : WifiHandler(nullptr, nullptr) {}

WifiHandler::WifiHandler(TrafficCollector::PackageLookup packages,
                         TrafficReader::NameLookup processes)
    : ComponentHandler("WifiHandler", ACCOUNTER_WIFI, kElector, {&kFamily}),
      mActivityState(0),
      mActivityStart(0),
      mSignalLevel(4),
      mDistribution{},
      mScreenOn(true),
      mNameLogHour(-1) {
    // The collector lives inside the handler and runs on its thread.
    mTraffic = std::make_unique<TrafficCollector>(
        kWifiTrafficConfig, [this](const Parcel& action) { return feedAccounter(action); },
        std::move(packages), std::move(processes));
    // Traffic from before the daemon started is never counted.
    mTraffic->takeBaseline();
}

WifiHandler::~WifiHandler() = default;

const component_family& WifiHandler::family() {
    return kFamily;
}

void WifiHandler::addSchemaTable() {
    for (const table_attribute* table :
         {&kWifiState, &kWifiApState, &kWifiScan, &kWifiBand, &kWifiActivity, &kWifiActivityDuration,
          kWifiTrafficConfig.packageTable, kWifiTrafficConfig.interfaceTable}) {
        addSchema(*table);
    }
    ComponentHandler::addSchemaTable();
}

void WifiHandler::cleanTables(int64_t time) {
    for (const table_attribute* table :
         {&kWifiState, &kWifiApState, &kWifiScan, &kWifiBand, &kWifiActivity, &kWifiActivityDuration,
          kWifiTrafficConfig.packageTable, kWifiTrafficConfig.interfaceTable}) {
        cleanObsoleteEntries(table->name, time, "timestamp");
    }
    ComponentHandler::cleanTables(time);
}

void WifiHandler::setupListeners(Parcel& out) {
    static const int32_t kNotifications[] = {
        NOTIFICATION_DATA_POLLING,
        NOTIFICATION_UID_REMOVED,
        NOTIFICATION_APPLICATIONS_ACCOUNTING,
        NOTIFICATION_COMPONENT_ACCOUNTING,
        NOTIFICATION_SCREEN_STATE_CHANGED,
        NOTIFICATION_HOURLY_UPLOADING,
        NOTIFICATION_DAILY_UPLOADING,
        NOTIFICATION_DAWN_UPLOADING,
        NOTIFICATION_VM_DIED,
        NOTIFICATION_FOREGROUND_CHANGED,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    addLibraryListener(mAccounterType, out);
}

void WifiHandler::registerDispatcherTag() {
    static const struct {
        const char* tag;
        int32_t index;
    } kTags[] = {
        {"KELVO_TAG_WIFI_ON", TAG_WIFI_ON},
        {"KELVO_TAG_WIFI_OFF", TAG_WIFI_OFF},
        {"KELVO_TAG_WIFI_AP_ON", TAG_WIFI_AP_ON},
        {"KELVO_TAG_WIFI_AP_OFF", TAG_WIFI_AP_OFF},
        {"KELVO_TAG_WIFI_SCAN_STARTED", TAG_WIFI_SCAN_STARTED},
        {"KELVO_TAG_WIFI_BAND", TAG_WIFI_BAND},
        {"KELVO_TAG_WIFI_ACTIVITY", TAG_WIFI_ACTIVITY},
        {"KELVO_TAG_WIFI_SIGNAL_LEVEL", TAG_WIFI_SIGNAL_LEVEL},
    };
    for (const auto& t : kTags) {
        Dispatcher::getInstance()->registerTag({t.tag, t.index}, this);
    }
}

int32_t WifiHandler::sendSetValue(int32_t subtype, const Parcel& fields) {
    Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt32(subtype);
    action.appendFrom(&fields, 0, fields.dataSize());
    return feedAccounter(action);
}

int32_t WifiHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    switch (tag) {
        case TAG_WIFI_ON:
        case TAG_WIFI_OFF: {
            Parcel row;
            row.writeInt64(time);
            row.writeInt32(tag == TAG_WIFI_ON ? 1 : 0);
            insertEntries(kWifiState, row, 1, false);
            if (tag == TAG_WIFI_OFF && mActivityState != 0) {
                changeActivity(time, false);
            }
            return 0;
        }
        case TAG_WIFI_AP_ON:
        case TAG_WIFI_AP_OFF: {
            const bool on = tag == TAG_WIFI_AP_ON;
            Parcel action;
            action.writeInt32(mAccounterType);
            action.writeInt32(on ? ACTION_ACTIVATE : ACTION_DEACTIVATE);
            action.writeInt32(WIFI_HOTSPOT);
            action.writeInt64(time);
            action.writeString8(String8(kHotspotName));
            feedAccounter(action);
            Parcel row;
            row.writeInt64(time);
            row.writeInt32(on ? 1 : 0);
            return insertEntries(kWifiApState, row, 1, false);
        }
        case TAG_WIFI_SCAN_STARTED:
            return onScanStarted(time, text);
        case TAG_WIFI_BAND:
            return onBand(time, text);
        case TAG_WIFI_ACTIVITY: {
            int32_t activity = 0;
            int32_t ret = parseInt(text, "activity=", nullptr, kUnparsed, &activity);
            if (ret < 0) {
                HealthCounters::add(Health::LoggerMessageRefused);
                KLOGE("Failed to parse activity, ret: %d", ret);
                return -19;
            }
            changeActivity(time, activity != 0);
            return 0;
        }
        case TAG_WIFI_SIGNAL_LEVEL:
            return onSignalLevel(text);
        default:
            KLOGE("Unknown message tag: %d", tag);
            return -3;
    }
}

void WifiHandler::logMissingName(int64_t time, int32_t uid) {
    const int64_t hour = time / kHourMs;
    if (hour != mNameLogHour) {
        mNameLogHour = hour;
        mNameLogged.clear();
    }
    if (mNameLogged.size() >= kMaxNameLogged) {
        mNameLogged.clear();
    }
    if (mNameLogged.insert(uid).second) {
        KLOGE("Can not find name for uid=%d", uid);
    } else {
        KLOGD("Can not find name for uid=%d", uid);
    }
}

int32_t WifiHandler::onScanStarted(int64_t time, const char* text) {
    int32_t uid = 0;
    int32_t ret = parseInt(text, "uid=", nullptr, kUnparsed, &uid);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse uid, ret: %d", ret);
        return -19;
    }
    String8 name;
    if (PackageProperty::getInstance()->queryPackageByUid(uid, name) < 0 || name.size() == 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        logMissingName(time, uid);
        return -2;
    }
    auto it = mScanData.find(uid);
    if (it == mScanData.end()) {
        if (mScanData.size() >= kMaxScanUids) {
            HealthCounters::add(Health::AccounterStateCapped);
            KLOGE("Too many scanning uids: %zu, refused: %d", mScanData.size(), uid);
            return -2;
        }
        it = mScanData.emplace(uid, scan_data{name, 0, 0}).first;
    }
    const bool foreground = name == mTraffic->foreground().c_str();
    uint32_t& count = foreground ? it->second.foreground : it->second.background;
    if (count < UINT32_MAX) {
        ++count;
    }
    Parcel row;
    row.writeInt64(time);
    row.writeString8(name);
    row.writeInt32(foreground ? 1 : 0);
    insertEntries(kWifiScan, row, 1, false);
    KLOGD("timestamp: %lld, name: %s, foreground: %s", static_cast<long long>(time), name.c_str(),
          foreground ? "true" : "false");
    return 0;
}

int32_t WifiHandler::onBand(int64_t time, const char* text) {
    int32_t band = 0;
    int32_t ret = parseInt(text, "band=", nullptr, kUnparsed, &band);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse band, ret: %d", ret);
        return -19;
    }
    if (static_cast<uint32_t>(band) > 2) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Invalid band: %d", band);
        return -9;
    }
    // Band 0 (none known) is stored and sent; the accounter keeps its band.
    Parcel fields;
    fields.writeInt32(band);
    sendSetValue(WIFI_BAND, fields);
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(band);
    return insertEntries(kWifiBand, row, 1, false);
}

int32_t WifiHandler::onSignalLevel(const char* text) {
    int32_t level = 0;
    int32_t ret = parseInt(text, "level=", nullptr, kUnparsed, &level);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse level, ret: %d", ret);
        return -19;
    }
    if (static_cast<uint32_t>(level) >= static_cast<uint32_t>(kSignalLevels)) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Invalid signal level: %d", level);
        return -9;
    }
    // The time so far belongs to the level that held during it.
    subtotalActivity();
    mSignalLevel = level;
    return 0;
}

void WifiHandler::subtotalActivity() {
    const int64_t now = TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC);
    if (now <= mActivityStart) {
        return;
    }
    KLOGD("state=%d, starttime=%lld timestamp=%lld", mActivityState,
          static_cast<long long>(mActivityStart), static_cast<long long>(now));
    if (mActivityState != 0) {
        int64_t& slot = mDistribution[mSignalLevel];
        slot = saturatedSum(slot, now - mActivityStart);
    }
    mActivityStart = now;
}

void WifiHandler::changeActivity(int64_t time, bool active) {
    const int32_t state = active ? 1 : 0;
    // While the screen is off the link counts as idle.
    if (!mScreenOn || state == mActivityState) {
        return;
    }
    subtotalActivity();
    mActivityState = state;
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(mActivityState);
    row.writeInt32(mSignalLevel);
    insertEntries(kWifiActivity, row, 1, false);
}

void WifiHandler::pollAll(int64_t time) {
    mTraffic->collectInterfaces(time);
    collectActivity(time);
    mTraffic->collectSystem(time, mTraffic->foreground());
    mTraffic->collectPackages(time);
    collectScans(time);
}

void WifiHandler::collectActivity(int64_t time) {
    subtotalActivity();
    Parcel fields;
    fields.writeInt32(kAccounterLevels);
    fields.writeInt64(saturatedSum(mDistribution[0], mDistribution[1]));
    for (int32_t level = 2; level < kSignalLevels; ++level) {
        fields.writeInt64(mDistribution[level]);
    }
    int64_t total = 0;
    Parcel row;
    row.writeInt64(time);
    for (int32_t level = 0; level < kSignalLevels; ++level) {
        KLOGD("mActivitiesDistribution[%d]=%lld", level,
              static_cast<long long>(mDistribution[level]));
        row.writeInt64(mDistribution[level]);
        total = saturatedSum(total, mDistribution[level]);
        mDistribution[level] = 0;
    }
    sendSetValue(WIFI_ACTIVITY, fields);
    if (total >= 1) {
        insertEntries(kWifiActivityDuration, row, 1, false);
    }
}

// One record per uid and fg/bg with scans, at most kMaxBatchRecords a
// batch; the uids left over keep their counts for the next batch.
void WifiHandler::collectScans(int64_t time) {
    if (mScanData.empty() && mRemovedScans.empty()) {
        return;
    }
    Parcel records;
    int32_t count = 0;
    auto append = [&](const scan_data& scan) {
        if (count + (scan.foreground != 0) + (scan.background != 0) > kMaxBatchRecords) {
            return false;
        }
        if (scan.foreground != 0) {
            KLOGD("foreground scan, timestamp: %lld, name: %s, count: %u",
                  static_cast<long long>(time), scan.name.c_str(), scan.foreground);
            records.writeString8(scan.name);
            records.writeInt32(1);
            records.writeInt32(static_cast<int32_t>(std::min<uint32_t>(scan.foreground, INT32_MAX)));
            ++count;
        }
        if (scan.background != 0) {
            KLOGD("background scan, timestamp: %lld, name: %s, count: %u",
                  static_cast<long long>(time), scan.name.c_str(), scan.background);
            records.writeString8(scan.name);
            records.writeInt32(0);
            records.writeInt32(static_cast<int32_t>(std::min<uint32_t>(scan.background, INT32_MAX)));
            ++count;
        }
        return true;
    };
    while (!mRemovedScans.empty() && append(mRemovedScans.back())) {
        mRemovedScans.pop_back();
    }
    for (auto it = mScanData.begin(); it != mScanData.end() && append(it->second);) {
        it = mScanData.erase(it);
    }
    if (count == 0) {
        return;
    }
    Parcel fields;
    fields.writeInt64(time);
    fields.writeInt32(count);
    fields.appendFrom(&records, 0, records.dataSize());
    sendSetValue(WIFI_SCANS, fields);
}

int32_t WifiHandler::onDataPolling(const Parcel& data) {
    data.setDataPosition(0);
    PollingPayload poll;
    if (PollingPayload::readFrom(data, &poll) < 0) {
        KLOGE("Invalid data polling parcel");
        return -5;
    }
    KLOGD("reason=%d, timestamp=%lld", poll.reason, static_cast<long long>(poll.time));
    switch (poll.reason) {
        case POLLING_HOURLY_TICK:
            pollAll(poll.hour);
            balanceAccounting(poll.hour, BALANCE_AT, 0);
            voteCandidate(poll.hour, CANDIDATE_HOURLY_TICK, mElector);
            break;
        case POLLING_TIME_CHANGED:
            pollAll(poll.time);
            balanceAccounting(poll.time, BALANCE_SPAN, poll.newTime);
            break;
        case POLLING_CHARGER: {
            pollAll(poll.time);
            balanceAccounting(poll.time, BALANCE_AT, 0);
            Parcel fields;
            fields.writeBool(poll.online);
            sendSetValue(WIFI_CHARGER, fields);
            break;
        }
        default:
            pollAll(poll.time);
            balanceAccounting(poll.time, BALANCE_AT, 0);
            break;
    }
    return 0;
}

int32_t WifiHandler::onUidRemoved(const Parcel& data) {
    data.setDataPosition(0);
    int32_t uid = 0;
    if (data.readInt32(&uid) != NO_ERROR) {
        return -5;
    }
    mTraffic->removeUid(uid);
    // Its scans so far are still charged, under the name they were made by.
    auto it = mScanData.find(uid);
    if (it != mScanData.end()) {
        if (mRemovedScans.size() < kMaxScanUids) {
            mRemovedScans.push_back(it->second);
        } else {
            HealthCounters::add(Health::AccounterStateCapped);
            KLOGE("Too many removed uids with scans, dropped: %d", uid);
        }
        mScanData.erase(it);
    }
    return 0;
}

int32_t WifiHandler::onScreenStateChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    bool on = false;
    if (data.readInt64(&time) != NO_ERROR || data.readBool(&on) != NO_ERROR) {
        return -5;
    }
    pollAll(time);
    if (!on) {
        changeActivity(time, false);
    }
    mScreenOn = on;
    return ComponentHandler::onScreenStateChanged(data);
}

int32_t WifiHandler::onForegroundChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    String8 package;
    if (data.readInt64(&time) != NO_ERROR || data.readString8(&package) != NO_ERROR) {
        return -5;
    }
    mTraffic->changeForeground(time, package.c_str());
    return 0;
}

int32_t WifiHandler::handleApplicationResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t header = -1;
    if (data.readInt32(&header) != NO_ERROR) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid type: %d", header);
        return -2;
    }
    switch (header) {
        case kResultApplications:
            return storeApplicationList(data);
        case kResultHotspot:
            return storeHotspotResult(data);
        default:
            HealthCounters::add(Health::LibraryParcelRefused);
            KLOGE("Invalid type: %d", header);
            return -2;
    }
}

namespace {

// One application record of the Wi-Fi accounter: start, end, name, then per
// bucket int32 share, int64 tx bytes, int64 rx bytes, int64 energy.
struct wifi_row {
    int64_t start = 0;
    int64_t end = 0;
    String8 name;
    int32_t duration[6] = {};
    int64_t tx[6] = {};
    int64_t rx[6] = {};
    int64_t energy[6] = {};

    void write(Parcel& out) const {
        out.writeInt64(start);
        out.writeInt64(end);
        out.writeString8(name);
        for (int i = 0; i < 6; ++i) {
            out.writeInt32(duration[i]);
            out.writeInt64(tx[i]);
            out.writeInt64(rx[i]);
            out.writeInt64(energy[i]);
        }
    }

    // The applications-accounting record, when the energy is not negative.
    void account() const {
        if (saturatedSum(energy[0], energy[1]) < 0) {
            return;
        }
        Parcel record;
        record.writeInt64(start);
        record.writeString8(name);
        record.writeInt32(APPS_WIFI);
        for (int i = 0; i < 4; ++i) {
            record.writeInt64(energy[i]);
        }
        for (int i = 0; i < 4; ++i) {
            record.writeInt64(saturatedSum(tx[i], rx[i]));
        }
        AppsAccounting::getInstance()->addAppsData(record);
    }
};

}  // namespace

int32_t WifiHandler::storeApplicationList(const Parcel& data) {
    int32_t n = -1;
    if (data.readInt32(&n) != NO_ERROR || n < 0 || n > kMaxBatchRecords) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid application count: %d", n);
        return -2;
    }
    Parcel rows;
    int32_t pending = 0;
    int32_t stored = 0;
    for (; stored < n; ++stored) {
        wifi_row row;
        bool ok = data.readInt64(&row.start) == NO_ERROR && data.readInt64(&row.end) == NO_ERROR &&
                  data.readString8(&row.name) == NO_ERROR;
        for (int i = 0; ok && i < 6; ++i) {
            ok = data.readInt32(&row.duration[i]) == NO_ERROR &&
                 data.readInt64(&row.tx[i]) == NO_ERROR && data.readInt64(&row.rx[i]) == NO_ERROR &&
                 data.readInt64(&row.energy[i]) == NO_ERROR;
        }
        if (!ok) {
            break;
        }
        row.account();
        row.write(rows);
        if (++pending == kRowsPerInsert) {
            insertEntries(kRawApplications, rows, pending, false);
            rows.setDataSize(0);
            rows.setDataPosition(0);
            pending = 0;
        }
    }
    if (pending > 0) {
        insertEntries(kRawApplications, rows, pending, false);
    }
    if (stored < n) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Application list ends after %d of %d rows", stored, n);
        return -2;
    }
    return 0;
}

int32_t WifiHandler::storeHotspotResult(const Parcel& data) {
    wifi_row row;
    bool ok = data.readInt64(&row.start) == NO_ERROR && data.readInt64(&row.end) == NO_ERROR &&
              data.readString8(&row.name) == NO_ERROR;
    for (int i = 0; ok && i < 6; ++i) {
        ok = data.readInt32(&row.duration[i]) == NO_ERROR &&
             data.readInt64(&row.energy[i]) == NO_ERROR;
    }
    if (!ok) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid wifi hotspot result");
        return -2;
    }
    row.account();
    Parcel out;
    row.write(out);
    return insertEntries(kRawApplications, out, 1, false);
}

void WifiHandler::dump(String8& out) {
    out.append("======WifiHandler BEGIN======\n");
    if (!mScanData.empty()) {
        out.appendFormat("mScanData[0..%lu]={\n", static_cast<unsigned long>(mScanData.size() - 1));
        for (const auto& entry : mScanData) {
            out.appendFormat("   [%d] = {.name=%s, .fore=%u, .back=%u},\n", entry.first,
                             entry.second.name.c_str(), entry.second.foreground,
                             entry.second.background);
        }
        out.append("}\n");
    }
    out.appendFormat("Signal level=%d, mLastActivityState=%d mLastActivityStartTime=%lld\n",
                     mSignalLevel, mActivityState, static_cast<long long>(mActivityStart));
    for (size_t level = 0; level < kSignalLevels; ++level) {
        out.appendFormat("   mActivitiesDistribution[%zu] = %lld\n", level,
                         static_cast<long long>(mDistribution[level]));
    }
    out.append("======WifiHandler END======\n");
}

}  // namespace kelvo
