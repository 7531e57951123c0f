#include "handlers/components/ModemHandler.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Notifier.h"
#include "handlers/components/modem/ModemData.h"
#include "kelvo/RootPath.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/TimeProvider.h"

using android::NO_ERROR;
using android::Parcel;
using android::String8;

namespace kelvo {

std::atomic<int64_t> ModemHandler::sHourlyTimeoutMs{ModemHandler::kHourlyTimeoutMs};
std::atomic<int64_t> ModemHandler::sSpacingMs{ModemHandler::kRequestSpacingMs};

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDayMs = 86400000;
constexpr int64_t kDawnMs = 21600000;
constexpr int32_t kRowsPerInsert = 200;
constexpr uint32_t kClassCallUsage = 903009042;
constexpr uint32_t kCallUsageField = 24;
// A component record in the result: int64 start, int64 end, int32 module,
// int64 duration, int64 energy.
constexpr size_t kComponentRecordBytes = 8 + 8 + 4 + 8 + 8;
const char* const kIdleName = "modem_idle";
const char* const kVoiceName = "modem_voice";

const column_attribute kPamColumns[] = {
    {COLUMN_TIME, "timestamp"},   {COLUMN_INT, "type"},   {COLUMN_INT, "sender_pid"},
    {COLUMN_INT, "receiver_pid"}, {COLUMN_INT, "msg_id"}, {COLUMN_INT, "count"},
};
const column_attribute kRawComponentColumns[] = {
    {COLUMN_TIME, "start_time"},      {COLUMN_TIME, "end_time"},      {COLUMN_INT, "type"},
    {COLUMN_INT, "module"},           {COLUMN_LONG, "duration"},      {COLUMN_LONG, "energy"},
    {COLUMN_LONG, "charge_duration"}, {COLUMN_LONG, "charge_energy"},
};

#define MODEM_TEMP_BUCKET(prefix)                                                 \
    {COLUMN_LONG, prefix "_tx_bytes"}, {COLUMN_LONG, prefix "_tx_packets"},       \
        {COLUMN_LONG, prefix "_rx_bytes"}, {COLUMN_LONG, prefix "_rx_packets"}, { \
        COLUMN_LONG, prefix "_energy"                                             \
    }
#define MODEM_BUCKET(prefix)                                                \
    {COLUMN_LONG, prefix "_tx_bytes"}, {COLUMN_LONG, prefix "_rx_bytes"}, { \
        COLUMN_LONG, prefix "_energy"                                       \
    }

const column_attribute kTempApplicationsColumns[] = {{COLUMN_TIME, "start_time"},
                                                     {COLUMN_TIME, "end_time"},
                                                     {COLUMN_TEXT, "name"},
                                                     MODEM_TEMP_BUCKET("foreground"),
                                                     MODEM_TEMP_BUCKET("background"),
                                                     MODEM_TEMP_BUCKET("screen_on"),
                                                     MODEM_TEMP_BUCKET("screen_off"),
                                                     MODEM_TEMP_BUCKET("charge_foreground"),
                                                     MODEM_TEMP_BUCKET("charge_background")};
const column_attribute kRawApplicationsColumns[] = {{COLUMN_TIME, "start_time"},
                                                    {COLUMN_TIME, "end_time"},
                                                    {COLUMN_TEXT, "name"},
                                                    MODEM_BUCKET("foreground"),
                                                    MODEM_BUCKET("background"),
                                                    MODEM_BUCKET("screen_on"),
                                                    MODEM_BUCKET("screen_off"),
                                                    MODEM_BUCKET("charge_foreground"),
                                                    MODEM_BUCKET("charge_background")};
const column_attribute kHourlyApplicationsColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},     MODEM_BUCKET("foreground"),
    MODEM_BUCKET("background"), MODEM_BUCKET("screen_on"), MODEM_BUCKET("screen_off")};
const column_attribute kHourlyComponentColumns[] = {{COLUMN_TIME, "timestamp"},
                                                    MODEM_BUCKET("foreground"),
                                                    MODEM_BUCKET("background"),
                                                    MODEM_BUCKET("screen_on"),
                                                    MODEM_BUCKET("screen_off")};

#undef MODEM_TEMP_BUCKET
#undef MODEM_BUCKET

template <size_t N>
constexpr int32_t countOf(const column_attribute (&)[N]) {
    return static_cast<int32_t>(N);
}

const table_attribute kPamTable = {"1.0", 1, countOf(kPamColumns), kPamColumns,
                                   "raw_modem_pam_wakeup_source"};
const table_attribute kRawComponent = {"1.0", 1, countOf(kRawComponentColumns),
                                       kRawComponentColumns, "raw_component_modem"};
const table_attribute kTempApplications = {"1.0", 1, countOf(kTempApplicationsColumns),
                                           kTempApplicationsColumns, "temp_applications_modem"};
const table_attribute kRawApplications = {"1.0", 1, countOf(kRawApplicationsColumns),
                                          kRawApplicationsColumns, "raw_applications_modem"};
const table_attribute kHourlyApplications = {"1.0", 1, countOf(kHourlyApplicationsColumns),
                                             kHourlyApplicationsColumns,
                                             "hourly_applications_modem"};
const table_attribute kHourlyComponent = {"1.0", 1, countOf(kHourlyComponentColumns),
                                          kHourlyComponentColumns, "hourly_component_modem"};

// The hourly sums in column order: per bucket tx bytes, rx bytes, energy.
enum sum_index : int32_t {
    SUM_FG_TX = 0,
    SUM_FG_ENERGY = 2,
    SUM_BG_ENERGY = 5,
    SUM_ON_ENERGY = 8,
    SUM_OFF_ENERGY = 11,
    SUM_COUNT = 12,
};

// The energy class of the uploads, Wi-Fi's layout: tx, rx, energy per
// bucket and their fields.
const upload_traffic kUploadTraffic[] = {
    {0, 1, 2, 12, 13, 4},    // foreground
    {3, 4, 5, 14, 15, 6},    // background
    {6, 7, 8, 8, 9, 0},      // screen on
    {9, 10, 11, 10, 11, 2},  // screen off
};

component_family makeFamily() {
    component_family f = {
        "modem",
        &kRawApplications,
        &kRawComponent,
        &kHourlyApplications,
        &kHourlyComponent,
        APPS_MODEM,
        22,
        23,
    };
    f.uploadTraffic = kUploadTraffic;
    f.uploadTrafficCount = 4;
    // Idle and call energy move no bytes and must still be uploaded.
    f.componentEnergyAlone = true;
    f.compensationValues[0] = SUM_FG_ENERGY;
    f.compensationValues[1] = SUM_BG_ENERGY;
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

// packets x energy / total, in 128 bits, clamped to int64.
int64_t share(int64_t packets, int64_t energy, int64_t total) {
    if (packets <= 0 || energy <= 0) {
        return 0;
    }
    __int128 value = static_cast<__int128>(packets) * energy / (total < 1 ? 1 : total);
    if (value > INT64_MAX) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT64_MAX;
    }
    return static_cast<int64_t>(value);
}

void clearParcel(Parcel& p) {
    p.setDataSize(0);
    p.setDataPosition(0);
}

// Sends a network applications-accounting record.
void accountNetwork(int64_t time, const String8& name, const int64_t energy[4],
                    const int64_t traffic[4]) {
    Parcel record;
    record.writeInt64(time);
    record.writeString8(name);
    record.writeInt32(APPS_MODEM);
    for (int i = 0; i < 4; ++i) {
        record.writeInt64(energy[i]);
    }
    for (int i = 0; i < 4; ++i) {
        record.writeInt64(traffic[i]);
    }
    AppsAccounting::getInstance()->addAppsData(record);
}

// One-value query with COUNT(*) first; 0 with the value (0 over no rows),
// or -17.
int32_t querySum(const String8& sql, int64_t* value) {
    std::vector<ComponentHandler::sum_row> rows;
    if (ComponentHandler::querySumRows(sql, false, 1, &rows) < 0) {
        return -17;
    }
    *value = rows.empty() ? 0 : rows[0].v[0];
    return 0;
}

}  // namespace

ModemHandler::ModemHandler() : ModemHandler(nullptr, nullptr) {}

ModemHandler::ModemHandler(TrafficCollector::PackageLookup packages,
                           TrafficReader::NameLookup processes)
    : ComponentHandler("ModemHandler", ACCOUNTER_MODEM, kElector, {&kFamily},
                       {kPolicyComponent, "Modem", {1}}),
      mPollingReason(POLLING_PERIODIC),
      mHourlyStamp(TimeProvider::getCurrentTime(TIME_TYPE_WALL)),
      mHourlyPending(false),
      mPendingTimeout(-1),
      mLastPollingMonotonic(-1),
      mChargerOnline(false) {
    mTraffic = std::make_unique<TrafficCollector>(
        kModemTrafficConfig, [this](const Parcel& action) { return feedAccounter(action); },
        std::move(packages), std::move(processes));
    // Traffic from before the daemon started is never counted.
    mTraffic->takeBaseline();
}

ModemHandler::~ModemHandler() = default;

const component_family& ModemHandler::family() {
    return kFamily;
}

void ModemHandler::setTimingForTest(int64_t hourlyTimeoutMs, int64_t spacingMs) {
    sHourlyTimeoutMs = hourlyTimeoutMs > 0 ? hourlyTimeoutMs : kHourlyTimeoutMs;
    sSpacingMs = spacingMs > 0 ? spacingMs : kRequestSpacingMs;
}

namespace {

// The tables of logModemData by index: 0 the component rows, 1 to 12 the
// decoders' (module + 1), then the handler's own.
const table_attribute* tableAt(int32_t index) {
    if (index >= 1 && index <= 12) {
        return ModemData::table(index - 1);
    }
    switch (index) {
        case 0:
            return &kRawComponent;
        case ModemHandler::kPamTableIndex:
            return &kPamTable;
        case 14:
            return kModemTrafficConfig.packageTable;
        case 15:
            return kModemTrafficConfig.interfaceTable;
        case 16:
            return &kTempApplications;
        case 17:
            return &kRawApplications;
        case 18:
            return &kHourlyApplications;
        case 19:
            return &kHourlyComponent;
        default:
            return nullptr;
    }
}

}  // namespace

int32_t ModemHandler::logModemData(int32_t index, const Parcel& row) {
    const table_attribute* table = index >= 0 && index < kTableCount ? tableAt(index) : nullptr;
    if (table == nullptr) {
        KLOGE("unknown index=%d", index);
        return -3;
    }
    return insertEntries(*table, row, 1, false);
}

int32_t ModemHandler::accountingModemData(Parcel& action) {
    KLOGD("accountingModemData");
    action.setDataPosition(0);
    return feedAccounter(action);
}

void ModemHandler::addSchemaTable() {
    for (int32_t i = 0; i < kTableCount; ++i) {
        const table_attribute* table = tableAt(i);
        if (table != nullptr && table != &kRawComponent && table != &kRawApplications &&
            table != &kHourlyApplications && table != &kHourlyComponent) {
            addSchema(*table);
        }
    }
    ComponentHandler::addSchemaTable();
}

void ModemHandler::cleanTables(int64_t time) {
    for (int32_t i = 0; i < kTableCount; ++i) {
        const table_attribute* table = tableAt(i);
        if (table == nullptr || table == &kRawComponent || table == &kRawApplications ||
            table == &kHourlyApplications || table == &kHourlyComponent) {
            continue;
        }
        cleanObsoleteEntries(table->name, time,
                             table == &kTempApplications ? "end_time" : "timestamp");
    }
    ComponentHandler::cleanTables(time);
}

int32_t ModemHandler::writeControl() {
    const std::string path = RootPath::resolve(kControlPath);
    int fd = open(path.c_str(), O_WRONLY | O_CLOEXEC);
    if (fd < 0) {
        KLOGE("Failed to open %s: %s", kControlPath, strerror(errno));
        return -1;
    }
    const size_t length = strlen(kModuleList);
    ssize_t written = TEMP_FAILURE_RETRY(write(fd, kModuleList, length));
    int error = errno;
    close(fd);
    if (written != static_cast<ssize_t>(length)) {
        KLOGE("Failed to set modem config: %s", written < 0 ? strerror(error) : "short write");
        return -1;
    }
    KLOGD("Set modem configuration success: %s", kModuleList);
    return 0;
}

int32_t ModemHandler::setConfiguration() {
    int32_t ret = ComponentHandler::setConfiguration();
    if (ret < 0) {
        return ret;
    }
    if (mPolicy == 1 && writeControl() < 0) {
        KLOGE("Failed to config modem %d", mPolicy);
        return -2;
    }
    return 0;
}

int32_t ModemHandler::checkEnable() {
    int32_t ret = ComponentHandler::checkEnable();
    if (ret < 0) {
        return ret;
    }
    const std::string path = RootPath::resolve(kControlPath);
    int fd = open(path.c_str(), O_WRONLY | O_CLOEXEC);
    if (fd < 0) {
        KLOGE("Modem is not supported: %d", mPolicy);
        return -2;
    }
    close(fd);
    return 0;
}

void ModemHandler::setupListeners(Parcel& out) {
    static const int32_t kNotifications[] = {
        NOTIFICATION_DATA_POLLING,
        NOTIFICATION_UID_REMOVED,
        NOTIFICATION_APPLICATIONS_ACCOUNTING,
        NOTIFICATION_COMPONENT_ACCOUNTING,
        NOTIFICATION_HOURLY_UPLOADING,
        NOTIFICATION_DAILY_UPLOADING,
        NOTIFICATION_DAWN_UPLOADING,
        NOTIFICATION_SCREEN_STATE_CHANGED,
        NOTIFICATION_FOREGROUND_CHANGED,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    addLibraryListener(mAccounterType, out);
}

int32_t ModemHandler::handleCustomized(int32_t code, const Parcel& data, Parcel* /*reply*/) {
    switch (code) {
        case TAG_HOURLY_TIMEOUT:
            return onHourlyTimeout(data);
        case TAG_MODEM_BLOCK:
            return onBlockMessage(data);
        default:
            KLOGE("Unknown customized tag: %d", code);
            return -3;
    }
}

int32_t ModemHandler::requestData(int64_t time, int32_t reason, bool wait) {
    int64_t monotonic = TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC);
    const int64_t spacing = sSpacingMs.load();
    if (wait && mLastPollingMonotonic >= 0 && monotonic - mLastPollingMonotonic < spacing) {
        KLOGD("sleep %llds, timestamp=%lld, mLastPollingTime=%lld",
              static_cast<long long>(spacing / 1000), static_cast<long long>(time),
              static_cast<long long>(mLastPollingMonotonic));
        usleep(static_cast<useconds_t>(spacing * 1000));
        time += spacing;
        monotonic += spacing;
    }
    mLastPollingMonotonic = monotonic;
    mPollingReason = reason;
    if (mOutstanding.size() >= kMaxOutstanding) {
        HealthCounters::add(Health::ModemBlocksRefused);
        KLOGE("No answer to %zu modem requests, forgetting the oldest", mOutstanding.size());
        mOutstanding.pop_front();
    }
    mOutstanding.push_back({reason, reason == POLLING_HOURLY_TICK ? mHourlyStamp : time, monotonic});
    KLOGD("set config, mPollingReason=%d, timestamp=%lld", reason, static_cast<long long>(time));
    if (writeControl() < 0) {
        mOutstanding.pop_back();
        if (reason == POLLING_HOURLY_TICK) {
            finishHourly();
        }
        return -14;
    }
    return 0;
}

void ModemHandler::finishHourly() {
    if (mPendingTimeout >= 1) {
        removeMessage(mPendingTimeout);
    }
    mPendingTimeout = -1;
    if (mHourlyPending) {
        mHourlyPending = false;
        voteCandidate(mHourlyStamp, CANDIDATE_HOURLY_TICK, mElector);
    }
}

int32_t ModemHandler::onDataPolling(const Parcel& data) {
    data.setDataPosition(0);
    PollingPayload poll;
    if (PollingPayload::readFrom(data, &poll) < 0) {
        data.setDataPosition(0);
        KLOGE("Unknown polling reason: %d", data.readInt32());
        return -2;
    }
    KLOGD("reason=%d, timestamp=%lld", poll.reason, static_cast<long long>(poll.time));
    if (poll.reason == POLLING_HOURLY_TICK) {
        // An hour still waiting (a time-out longer than the hour) is voted
        // for now: its answer is no longer told apart.
        finishHourly();
        mOutstanding.erase(
            std::remove_if(mOutstanding.begin(), mOutstanding.end(),
                           [](const request& r) { return r.reason == POLLING_HOURLY_TICK; }),
            mOutstanding.end());
        mHourlyStamp = poll.hour;
        mHourlyPending = true;
        Parcel stamp;
        stamp.writeInt64(mHourlyStamp);
        int32_t id = sendCustomizedMessageDelayed(TAG_HOURLY_TIMEOUT, stamp, sHourlyTimeoutMs);
        mPendingTimeout = id >= 1 ? id : -1;
        KLOGD("polling hourly, mHourlyTimestamp=%lld", static_cast<long long>(mHourlyStamp));
    } else if (poll.reason == POLLING_CHARGER) {
        mChargerOnline = poll.online;
    }
    return requestData(poll.time, poll.reason, true);
}

int32_t ModemHandler::onHourlyTimeout(const Parcel& data) {
    data.setDataPosition(0);
    int64_t stamp = 0;
    if (data.readInt64(&stamp) != NO_ERROR || !mHourlyPending || stamp != mHourlyStamp) {
        // The answer came first, or a later hour began: nothing waits.
        return 0;
    }
    TimeProvider when(stamp);
    KLOGI("Modem pmom log no response, force to vote modem candidate, %s",
          when.toString(TIME_FORMAT_DATE, true));
    mPendingTimeout = -1;
    // A late answer is not this hour's: it is stamped when it arrives.
    mOutstanding.erase(
        std::remove_if(mOutstanding.begin(), mOutstanding.end(),
                       [](const request& r) { return r.reason == POLLING_HOURLY_TICK; }),
        mOutstanding.end());
    finishHourly();
    return 0;
}

int32_t ModemHandler::onBlockMessage(const Parcel& data) {
    data.setDataPosition(0);
    const int64_t now = TimeProvider::getCurrentTime(TIME_TYPE_WALL);
    const int64_t monotonic = TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC);
    // Requests whose answer window passed are not answered by this block.
    while (!mOutstanding.empty() && monotonic - mOutstanding.front().monotonic > sHourlyTimeoutMs &&
           mOutstanding.front().reason != POLLING_HOURLY_TICK) {
        mOutstanding.pop_front();
    }
    request answered = {POLLING_PERIODIC, now, monotonic};
    const bool solicited = !mOutstanding.empty();
    if (solicited) {
        answered = mOutstanding.front();
        mOutstanding.pop_front();
    }
    const bool hourly = solicited && answered.reason == POLLING_HOURLY_TICK && mHourlyPending;
    if (answered.reason == POLLING_TIME_CHANGED) {
        KLOGD("time changed from %lld to %lld", static_cast<long long>(answered.time),
              static_cast<long long>(now));
    }

    int32_t size = -1;
    const void* bytes = nullptr;
    if (data.readInt32(&size) != NO_ERROR || size < 1 ||
        static_cast<size_t>(size) > ModemBlock::kMaxBytes ||
        static_cast<size_t>(size) > data.dataAvail()) {
        HealthCounters::add(Health::ModemBlocksRefused);
        KLOGE("Invalid data length: %d", size);
    } else {
        // The S bytes are there (checked above); a sender that did not pad
        // them to four is read all the same.
        bytes = data.data() + data.dataPosition();
    }
    int32_t ret = bytes == nullptr
                      ? -9
                      : handleBlock(static_cast<const uint8_t*>(bytes), static_cast<size_t>(size),
                                    answered.time, answered.reason);
    // A block read whole, even one a record ended early, is booked.
    if (ret != -9) {
        collectTraffic(answered.time);
        balanceAccounting(answered.time, BALANCE_AT, 0);
        Parcel action;
        action.writeInt32(mAccounterType);
        action.writeInt32(ACTION_SET_VALUE);
        action.writeInt32(MODEM_CHARGER);
        action.writeBool(mChargerOnline);
        feedAccounter(action);
    }
    if (hourly) {
        finishHourly();
    }
    return ret;
}

int32_t ModemHandler::handleBlock(const uint8_t* data, size_t size, int64_t blockTime,
                                  int32_t reason) {
    int32_t ret = mBlock.parse(data, size);
    if (ret == -9) {
        HealthCounters::add(Health::ModemBlocksRefused);
        KLOGE("Invalid data length: %zu", size);
        return -9;
    }
    KLOGD("length=%zu, num=%u, dataLength=%u", size, mBlock.count, mBlock.dataLength);
    for (const ModemBlock::Record& record : mBlock.records) {
        KLOGD("length=%u, sim=%u, module=%u", record.length, record.sim, record.module);
        if (decodeRecord(record, blockTime, reason) < 0) {
            return -3;
        }
    }
    if (ret == 0) {
        return 0;
    }
    HealthCounters::add(Health::ModemBlocksRefused);
    switch (mBlock.error) {
        case ModemBlock::FAULT_SIM:
            KLOGE("input sim type error, sim=%u", mBlock.faultValue);
            break;
        case ModemBlock::FAULT_MODULE:
            KLOGE("Unknown module: %u", mBlock.faultValue);
            KLOGE("Failed to add module data %u", mBlock.faultValue);
            break;
        default:
            KLOGE("Modem block ends at record %zu of %u: %s", mBlock.faultAt, mBlock.count,
                  ModemBlock::faultName(mBlock.error));
            break;
    }
    return -3;
}

int32_t ModemHandler::decodeRecord(const ModemBlock::Record& record, int64_t blockTime,
                                   int32_t reason) {
    if (record.module == kPamModule) {
        return storePamItems(record, blockTime);
    }
    const int32_t module = static_cast<int32_t>(record.module);
    auto it = mDecoders.find(module);
    if (it == mDecoders.end()) {
        std::unique_ptr<ModemData> decoder = ModemData::create(module, this);
        if (decoder == nullptr) {
            HealthCounters::add(Health::ModemBlocksRefused);
            KLOGE("Unknown module: %d", module);
            KLOGE("Failed to add module data %d", module);
            return -3;
        }
        it = mDecoders.emplace(module, std::move(decoder)).first;
    }
    // A record its decoder rejects is skipped; the block goes on. The
    // parser has checked that the header and L bytes are there.
    it->second->setData(record.header, ModemBlock::kRecordHeaderSize + record.length, blockTime,
                        reason, mHourlyStamp);
    return 0;
}

int32_t ModemHandler::storePamItems(const ModemBlock::Record& record, int64_t blockTime) {
    if (record.length < kPamItemSize) {
        HealthCounters::add(Health::ModemRecordsRefused);
        KLOGE("Invalid input data length %u", record.length);
        return 0;
    }
    const size_t items = record.length / kPamItemSize;
    Parcel rows;
    int32_t pending = 0;
    for (size_t i = 0; i < items; ++i) {
        int32_t fields[5];
        memcpy(fields, record.data + i * kPamItemSize, sizeof(fields));
        rows.writeInt64(blockTime);
        for (int32_t value : fields) {
            rows.writeInt32(value);
        }
        if (++pending == kMaxRowsPerInsert) {
            insertEntries(kPamTable, rows, pending, false);
            clearParcel(rows);
            pending = 0;
        }
    }
    if (pending > 0) {
        insertEntries(kPamTable, rows, pending, false);
    }
    return 0;
}

void ModemHandler::collectTraffic(int64_t time) {
    mTraffic->collectInterfaces(time);
    mTraffic->collectSystem(time, mTraffic->foreground());
    mTraffic->collectPackages(time);
}

int32_t ModemHandler::onUidRemoved(const Parcel& data) {
    data.setDataPosition(0);
    int32_t uid = 0;
    if (data.readInt32(&uid) != NO_ERROR) {
        return -5;
    }
    mTraffic->removeUid(uid);
    return 0;
}

int32_t ModemHandler::onScreenStateChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    if (data.readInt64(&time) != NO_ERROR) {
        return -5;
    }
    // The traffic so far belongs to the screen state it happened in.
    collectTraffic(time);
    return ComponentHandler::onScreenStateChanged(data);
}

int32_t ModemHandler::onForegroundChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    String8 package;
    if (data.readInt64(&time) != NO_ERROR || data.readString8(&package) != NO_ERROR) {
        return -5;
    }
    mTraffic->changeForeground(time, package.c_str());
    return 0;
}

int32_t ModemHandler::handleComponentResult(const Parcel& data) {
    data.setDataPosition(0);
    bool charging = false;
    if (data.readBool(&charging) != NO_ERROR) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid modem component result");
        return -2;
    }
    int64_t energy[RESULT_TYPES] = {};
    int64_t last[RESULT_TYPES] = {};
    Parcel rows;
    int32_t pending = 0;
    int32_t ret = 0;
    for (int32_t group = 0; group < RESULT_TYPES && ret == 0; ++group) {
        int32_t type = -1;
        int32_t count = -1;
        if (data.readInt32(&type) != NO_ERROR || data.readInt32(&count) != NO_ERROR) {
            ret = -2;
            break;
        }
        if (type < 0 || type >= RESULT_TYPES) {
            KLOGE("Invalid modem result type: %d", type);
            ret = -3;
            break;
        }
        if (count < 0 || static_cast<size_t>(count) > data.dataAvail() / kComponentRecordBytes) {
            KLOGE("Invalid modem record count: %d", count);
            ret = -2;
            break;
        }
        for (int32_t i = 0; i < count; ++i) {
            int64_t start = data.readInt64();
            int64_t end = data.readInt64();
            int32_t module = data.readInt32();
            int64_t duration = data.readInt64();
            int64_t value = data.readInt64();
            if (duration == 0) {
                continue;
            }
            rows.writeInt64(start);
            rows.writeInt64(end);
            rows.writeInt32(type);
            rows.writeInt32(module);
            rows.writeInt64(charging ? 0 : duration);
            rows.writeInt64(charging ? 0 : value);
            rows.writeInt64(charging ? duration : 0);
            rows.writeInt64(charging ? value : 0);
            if (!charging) {
                energy[type] = saturatedSum(energy[type], value);
            }
            last[type] = std::max(last[type], end > start ? end - 1 : start);
            if (++pending == kRowsPerInsert) {
                insertEntries(kRawComponent, rows, pending, false);
                clearParcel(rows);
                pending = 0;
            }
        }
    }
    if (pending > 0) {
        insertEntries(kRawComponent, rows, pending, false);
    }
    if (ret < 0) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid modem component result");
    }
    // Idle energy is the foreground's while the screen is on; call energy
    // the background's while it is off. Stamped inside the hour they end in.
    const int64_t none[4] = {};
    if (energy[RESULT_IDLE] >= 1) {
        const int64_t e[4] = {energy[RESULT_IDLE], 0, energy[RESULT_IDLE], 0};
        accountNetwork(last[RESULT_IDLE], String8(kIdleName), e, none);
    }
    if (energy[RESULT_VOICE] >= 1) {
        const int64_t e[4] = {0, energy[RESULT_VOICE], 0, energy[RESULT_VOICE]};
        accountNetwork(last[RESULT_VOICE], String8(kVoiceName), e, none);
    }
    return ret;
}

int32_t ModemHandler::handleApplicationResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t key = 0;
    int32_t n = -1;
    if (data.readInt32(&key) != NO_ERROR || data.readInt32(&n) != NO_ERROR || n < 0 ||
        n > TrafficCollector::kMaxRecords) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid application count: %d", n);
        return -2;
    }
    Parcel rows;
    int32_t pending = 0;
    int32_t stored = 0;
    for (; stored < n; ++stored) {
        int64_t start = 0;
        int64_t end = 0;
        String8 name;
        if (data.readInt64(&start) != NO_ERROR || data.readInt64(&end) != NO_ERROR ||
            data.readString8(&name) != NO_ERROR) {
            break;
        }
        // Per bucket c1 tx packets, c2 rx packets, c3 tx bytes, c4 rx bytes,
        // energy; stored as tx bytes, tx packets, rx bytes, rx packets, energy.
        int64_t bucket[6][5] = {};
        bool ok = true;
        for (int b = 0; ok && b < 6; ++b) {
            for (int v = 0; ok && v < 5; ++v) {
                ok = data.readInt64(&bucket[b][v]) == NO_ERROR;
            }
        }
        if (!ok) {
            break;
        }
        rows.writeInt64(start);
        rows.writeInt64(end);
        rows.writeString8(name);
        for (const auto& c : bucket) {
            rows.writeInt64(c[2]);
            rows.writeInt64(c[0]);
            rows.writeInt64(c[3]);
            rows.writeInt64(c[1]);
            rows.writeInt64(c[4]);
        }
        if (++pending == kRowsPerInsert) {
            insertEntries(kTempApplications, rows, pending, false);
            clearParcel(rows);
            pending = 0;
        }
    }
    if (pending > 0) {
        insertEntries(kTempApplications, rows, pending, false);
    }
    if (stored < n) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Application list ends after %d of %d rows", stored, n);
        return -2;
    }
    return 0;
}

int32_t ModemHandler::redistribute(int64_t time) {
    const long long from = static_cast<long long>(time - kHourMs);
    const long long to = static_cast<long long>(time);
    std::vector<sum_row> sums;
    String8 sql = String8::format(
        "SELECT COUNT(*), SUM(foreground_tx_packets + foreground_rx_packets + "
        "background_tx_packets + background_rx_packets), SUM(foreground_energy + "
        "background_energy), SUM(charge_foreground_tx_packets + charge_foreground_rx_packets + "
        "charge_background_tx_packets + charge_background_rx_packets), "
        "SUM(charge_foreground_energy + charge_background_energy) FROM temp_applications_modem "
        "WHERE end_time > %lld AND end_time <= %lld",
        from, to);
    if (querySumRows(sql, false, 4, &sums) < 0) {
        KLOGE("Failed to query temp modem applications data");
        return -17;
    }
    if (sums.empty()) {
        return 0;
    }
    // Energy per packet of each kind; rows are copied whatever the totals
    // are (without packets or energy the share is 0), so the traffic of an
    // hour always reaches the raw table.
    const int64_t packets[2] = {sums[0].v[0], sums[0].v[2]};
    const int64_t energy[2] = {sums[0].v[1], sums[0].v[3]};
    static const char* const kBuckets[6] = {"foreground", "background",        "screen_on",
                                            "screen_off", "charge_foreground", "charge_background"};
    String8 columns;
    for (const char* b : kBuckets) {
        columns.appendFormat(", %s_tx_bytes, %s_rx_bytes, %s_tx_packets + %s_rx_packets", b, b, b,
                             b);
    }
    constexpr int32_t kColumns = 4 + 18;
    int64_t lastRowid = 0;
    int32_t ret = 0;
    for (;;) {
        String8 page = String8::format(
            "SELECT rowid, start_time, end_time, name%s FROM temp_applications_modem WHERE "
            "end_time > %lld AND end_time <= %lld AND rowid > %lld ORDER BY rowid LIMIT %d",
            columns.string(), from, to, static_cast<long long>(lastRowid), kMaxRowsPerInsert);
        Parcel reply;
        int32_t count = 0;
        if (queryEntriesSimple(page, &reply, kColumns, count) < 0) {
            KLOGE("Failed to reallocate applications energy");
            ret = -17;
            break;
        }
        Parcel rows;
        int32_t pending = 0;
        bool ok = true;
        for (int32_t r = 0; ok && r < count; ++r) {
            int64_t start = 0;
            int64_t end = 0;
            String8 name;
            ok = reply.readInt64(&lastRowid) == NO_ERROR && reply.readInt64(&start) == NO_ERROR &&
                 reply.readInt64(&end) == NO_ERROR && reply.readString8(&name) == NO_ERROR;
            int64_t values[18] = {};
            for (int32_t i = 0; ok && i < 18; ++i) {
                ok = reply.readInt64(&values[i]) == NO_ERROR;
            }
            if (!ok) {
                break;
            }
            rows.writeInt64(start);
            rows.writeInt64(end);
            rows.writeString8(name);
            for (int32_t b = 0; b < 6; ++b) {
                const int kind = b < 4 ? 0 : 1;
                rows.writeInt64(values[3 * b]);
                rows.writeInt64(values[3 * b + 1]);
                rows.writeInt64(share(values[3 * b + 2], energy[kind], packets[kind]));
            }
            if (++pending == kRowsPerInsert) {
                insertEntries(kRawApplications, rows, pending, false);
                clearParcel(rows);
                pending = 0;
            }
        }
        if (pending > 0) {
            insertEntries(kRawApplications, rows, pending, false);
        }
        if (!ok) {
            KLOGE("Failed to reallocate applications energy");
            ret = -17;
            break;
        }
        if (count < kMaxRowsPerInsert) {
            break;
        }
    }
    forceFlushEntries();
    return ret;
}

int32_t ModemHandler::logApplicationsAccounting(int64_t time) {
    forceFlushEntries();
    redistribute(time);
    String8 sql = String8::format(
        "SELECT COUNT(*), name, SUM(foreground_tx_bytes), SUM(foreground_rx_bytes), "
        "SUM(foreground_energy), SUM(background_tx_bytes), SUM(background_rx_bytes), "
        "SUM(background_energy), SUM(screen_on_tx_bytes), SUM(screen_on_rx_bytes), "
        "SUM(screen_on_energy), SUM(screen_off_tx_bytes), SUM(screen_off_rx_bytes), "
        "SUM(screen_off_energy) FROM raw_applications_modem WHERE end_time > %lld AND "
        "end_time <= %lld GROUP BY name",
        static_cast<long long>(time - kHourMs), static_cast<long long>(time));
    std::vector<sum_row> sums;
    if (querySumRows(sql, true, SUM_COUNT, &sums) < 0) {
        KLOGE("Failed to query raw modem applications data");
        return -17;
    }
    Parcel rows;
    int32_t pending = 0;
    for (const sum_row& row : sums) {
        const int64_t* v = row.v.data();
        if (saturatedSum(v[SUM_FG_ENERGY], v[SUM_BG_ENERGY]) >= 1) {
            const int64_t energy[4] = {v[2], v[5], v[8], v[11]};
            const int64_t traffic[4] = {saturatedSum(v[0], v[1]), saturatedSum(v[3], v[4]),
                                        saturatedSum(v[6], v[7]), saturatedSum(v[9], v[10])};
            // Stamped at the hour's start: the record is this hour's.
            accountNetwork(time - kHourMs, row.name, energy, traffic);
        }
        rows.writeInt64(time);
        rows.writeString8(row.name);
        for (int64_t value : row.v) {
            rows.writeInt64(value);
        }
        if (++pending == kRowsPerInsert) {
            insertEntries(kHourlyApplications, rows, pending, false);
            clearParcel(rows);
            pending = 0;
        }
    }
    if (pending > 0) {
        insertEntries(kHourlyApplications, rows, pending, false);
    }
    return 0;
}

int32_t ModemHandler::logComponentAccounting(int64_t time) {
    forceFlushEntries();
    const long long from = static_cast<long long>(time - kHourMs);
    const long long to = static_cast<long long>(time);
    int64_t idle = 0;
    int64_t voice = 0;
    const char* kEnergySql =
        "SELECT COUNT(*), SUM(%s) FROM raw_component_modem WHERE end_time > %lld AND "
        "end_time <= %lld AND type = %d";
    if (querySum(String8::format(kEnergySql, "energy", from, to, RESULT_IDLE), &idle) < 0) {
        KLOGE("Failed to query modem idle energy");
    }
    if (querySum(String8::format(kEnergySql, "energy", from, to, RESULT_VOICE), &voice) < 0) {
        KLOGE("Failed to query modem voice energy");
    }
    const int64_t own = saturatedSum(idle, voice);
    if (own >= 1) {
        // Already part of the applications' totals through modem_idle and
        // modem_voice.
        updateCompensation(time, mElector, -own);
    }
    String8 sql = String8::format(
        "SELECT COUNT(*), SUM(foreground_tx_bytes), SUM(foreground_rx_bytes), "
        "SUM(foreground_energy), SUM(background_tx_bytes), SUM(background_rx_bytes), "
        "SUM(background_energy), SUM(screen_on_tx_bytes), SUM(screen_on_rx_bytes), "
        "SUM(screen_on_energy), SUM(screen_off_tx_bytes), SUM(screen_off_rx_bytes), "
        "SUM(screen_off_energy) FROM hourly_applications_modem WHERE timestamp > %lld AND "
        "timestamp <= %lld",
        from, to);
    std::vector<sum_row> sums;
    if (querySumRows(sql, false, SUM_COUNT, &sums) < 0) {
        KLOGE("Failed to query hourly applications modem data");
        return -17;
    }
    if (sums.empty() && own < 1) {
        return 0;
    }
    std::vector<int64_t> v = sums.empty() ? std::vector<int64_t>(SUM_COUNT, 0) : sums[0].v;
    const int64_t applications = saturatedSum(v[SUM_FG_ENERGY], v[SUM_BG_ENERGY]);
    if (applications >= 1) {
        updateCompensation(time, mElector, applications);
    }
    v[SUM_FG_ENERGY] = saturatedSum(v[SUM_FG_ENERGY], idle);
    v[SUM_ON_ENERGY] = saturatedSum(v[SUM_ON_ENERGY], idle);
    v[SUM_BG_ENERGY] = saturatedSum(v[SUM_BG_ENERGY], voice);
    v[SUM_OFF_ENERGY] = saturatedSum(v[SUM_OFF_ENERGY], voice);
    Parcel row;
    row.writeInt64(time);
    for (int64_t value : v) {
        row.writeInt64(value);
    }
    return insertEntries(kHourlyComponent, row, 1, false);
}

int32_t ModemHandler::uploadPeriod(uint32_t event, int64_t end, int64_t window, float ratio,
                                   int32_t candidate) {
    int32_t ret = setPeriodData(event, end, window, ratio);
    int64_t calls = 0;
    String8 sql = String8::format(
        "SELECT COUNT(*), SUM(duration + charge_duration) FROM raw_component_modem WHERE "
        "end_time > %lld AND end_time <= %lld AND type = %d",
        static_cast<long long>(end - window), static_cast<long long>(end), RESULT_VOICE);
    if (querySum(sql, &calls) < 0) {
        KLOGE("Failed to query call usage");
    } else {
        KLOGD("total call duration=%lld", static_cast<long long>(calls));
        if (calls >= 1) {
            Parcel usage;
            DataUploader::formIntData(0, calls, usage);
            Parcel out;
            DataUploader::formClassData(kCallUsageField, kClassCallUsage, usage, out);
            if (setEventData(event, out, true) < 0) {
                KLOGE("Failed to set modem upload data");
                ret = -23;
            }
        }
    }
    // Whatever failed, the round goes on.
    voteCandidate(end, candidate, mElector);
    return ret;
}

int32_t ModemHandler::onHourlyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    return uploadPeriod(EVENT_HOURLY_COMPONENTS, end, kHourMs, ratio, CANDIDATE_HOURLY_UPLOAD);
}

int32_t ModemHandler::onDailyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    return uploadPeriod(EVENT_DAILY_COMPONENTS, end, kDayMs, ratio, CANDIDATE_DAILY_UPLOAD);
}

int32_t ModemHandler::onDawnUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    return uploadPeriod(EVENT_DAILY_COMPONENTS, end, kDawnMs, ratio, CANDIDATE_DAWN_UPLOAD);
}

void ModemHandler::dump(String8& out) {
    out.append("======ModemHandler BEGIN======\n");
    out.appendFormat("mPolicy=%d, mPollingReason=%d, mHourlyTimestamp=%lld, hourly pending=%d\n",
                     mPolicy, mPollingReason, static_cast<long long>(mHourlyStamp),
                     mHourlyPending ? 1 : 0);
    out.appendFormat("outstanding requests=%zu, decoders=%zu, charger=%d, foreground=%s\n",
                     mOutstanding.size(), mDecoders.size(), mChargerOnline ? 1 : 0,
                     mTraffic->foreground().c_str());
    out.append("======ModemHandler END======\n");
    KelvoOperator::dump(out);
}

}  // namespace kelvo
