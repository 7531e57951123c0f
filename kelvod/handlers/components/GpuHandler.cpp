#include "handlers/components/GpuHandler.h"

#include <vector>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Notifier.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/devices/KelvoDevice.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kDayMs = 86400000;
constexpr int32_t kBalanceCandidate = 1;  // the hourly poll stands for the hourly tick
constexpr uint32_t kFrequencyField = 14;
constexpr uint32_t kClassFrequency = 903009030;
// Buckets of an application result: the first (foreground) and the fifth
// (charging) are stored; the sixth is not read.
constexpr int32_t kResultGroups = 5;

const column_attribute kRawApplicationsColumns[] = {
    {COLUMN_TIME, "start_time"},     {COLUMN_TIME, "end_time"},     {COLUMN_TEXT, "name"},
    {COLUMN_INT, "duration"},        {COLUMN_LONG, "usage"},        {COLUMN_LONG, "energy"},
    {COLUMN_INT, "charge_duration"}, {COLUMN_LONG, "charge_usage"}, {COLUMN_LONG, "charge_energy"},
};
const column_attribute kHourlyApplicationsColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},   {COLUMN_INT, "duration"},
    {COLUMN_LONG, "usage"},     {COLUMN_LONG, "energy"},
};
const column_attribute kHourlyComponentColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "duration"},
    {COLUMN_LONG, "usage"},
    {COLUMN_LONG, "energy"},
};
const column_attribute kFrequencyColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"}, {COLUMN_LONG, "frequency"},
    {COLUMN_LONG, "run"},       {COLUMN_LONG, "idle"},
};

const table_attribute kRawApplications = {"1.1", 1, 9, kRawApplicationsColumns,
                                          "raw_applications_gpu"};
const table_attribute kHourlyApplications = {"1.0", 1, 5, kHourlyApplicationsColumns,
                                             "hourly_applications_gpu"};
const table_attribute kHourlyComponent = {"1.0", 1, 4, kHourlyComponentColumns,
                                          "hourly_component_gpu"};
const table_attribute kFrequency = {"1.0", 1, 5, kFrequencyColumns, "raw_gpu_frequency"};

// Summed values: duration, usage (busy time), energy. Both pairs go out when
// the busy time is at least 1.
const upload_pair kUploadPairs[] = {{1, 2, 5, 4}, {1, 2, 1, 0}};

const component_family kFamily = {
    "gpu",
    &kRawApplications,
    nullptr,
    &kHourlyApplications,
    &kHourlyComponent,
    APPS_GPU,
    12,
    13,
    kUploadPairs,
    2,
    nullptr,
    0,
    {2, -1},
    "name != 'screen_off'",
    true,
    "SUM(usage)",
};

}  // namespace

GpuHandler::GpuHandler()
    : ComponentHandler("GpuHandler", ACCOUNTER_GPU, kElector, {&kFamily},
                       {POLICY_GPU, "Gpu", {kDefaultPolicy}}),
      mScreenOn(false),
      mChargerOnline(false) {}

const component_family& GpuHandler::family() {
    return kFamily;
}

void GpuHandler::addSchemaTable() {
    ComponentHandler::addSchemaTable();
    addSchema(kFrequency);
}

void GpuHandler::cleanTables(int64_t time) {
    ComponentHandler::cleanTables(time);
    cleanObsoleteEntries(kFrequency.name, time, "timestamp");
}

void GpuHandler::setupListeners(Parcel& out) {
    // Charger, clock, thermal, balance and shut-down all arrive as polls.
    static const int32_t kNotifications[] = {
        NOTIFICATION_FOREGROUND_CHANGED,   NOTIFICATION_SCREEN_STATE_CHANGED,
        NOTIFICATION_DATA_POLLING,         NOTIFICATION_APPLICATIONS_ACCOUNTING,
        NOTIFICATION_COMPONENT_ACCOUNTING, NOTIFICATION_HOURLY_UPLOADING,
        NOTIFICATION_DAILY_UPLOADING,      NOTIFICATION_DAWN_UPLOADING,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    addLibraryListener(mAccounterType, out);
}

int32_t GpuHandler::lateInitialize() {
    int ret = KelvoDevice::setGpuEnable(true);
    if (ret < 0) {
        KLOGE("Failed to enable gpu data: %d", ret);
    }
    // What the kernel gathered before the start belongs to nobody known:
    // read it and let it go, so the first application is not charged for it.
    gpu_info_t info;
    ret = KelvoDevice::getGpuInfo(&info);
    KLOGD("Discarded first gpu reading: %d, count: %d", ret, ret == 0 ? info.count : 0);
    return 0;
}

int32_t GpuHandler::readFrequency(int64_t time) {
    gpu_info_t info;
    int ret = KelvoDevice::getGpuInfo(&info);
    if (ret < 0) {
        // A count outside 0..20 is refused by the device wrapper (-2).
        KLOGE("Failed to get gpu data: %d", ret);
        return -18;
    }
    std::vector<gpu_freq_entry_t> steps;
    for (int32_t i = 0; i < info.count; ++i) {
        const gpu_freq_entry_t step = info.entries[i];
        if (step.frequency <= 0 || step.busyUs < 0 || step.idleUs < 0) {
            HealthCounters::add(Health::DeviceAnswersRefused);
            KLOGE("Invalid gpu step: %lld %lld %lld", static_cast<long long>(step.frequency),
                  static_cast<long long>(step.busyUs), static_cast<long long>(step.idleUs));
            continue;
        }
        steps.push_back(step);
    }
    if (steps.empty()) {
        KLOGD("No frequency data.");
        return 0;
    }
    const int32_t count = static_cast<int32_t>(steps.size());
    Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt64(time);
    action.writeBool(mChargerOnline);
    action.writeInt32(count);
    Parcel rows;
    for (int32_t i = 0; i < count; ++i) {
        const int64_t run = steps[i].busyUs / 1000;
        const int64_t idle = steps[i].idleUs / 1000;
        action.writeInt64(steps[i].frequency);
        action.writeInt64(run);
        action.writeInt64(idle);
        rows.writeInt64(time);
        rows.writeString8(mForeground);
        rows.writeInt64(steps[i].frequency);
        rows.writeInt64(run);
        rows.writeInt64(idle);
        KLOGD("Package: %s, Count: %d, index: %d, frequency: %lld, run: %lld, idle: %lld",
              mForeground.string(), count, i, static_cast<long long>(steps[i].frequency),
              static_cast<long long>(run), static_cast<long long>(idle));
    }
    feedAccounter(action);
    insertEntries(kFrequency, rows, count, false);
    return 0;
}

int32_t GpuHandler::onForegroundChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    String8 name;
    if (data.readInt64(&time) != android::NO_ERROR || data.readString8(&name) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid foreground message");
        return -5;
    }
    int32_t ret = 0;
    if (!mForeground.isEmpty()) {
        // The reading up to now belongs to the application leaving; a
        // failed one is lost, but the change still goes through so the
        // next reading is not charged to the wrong application.
        ret = readFrequency(time);
        if (ret < 0) {
            KLOGE("Failed to data accounting: %d", ret);
        }
    }
    feedStateChange(ACTION_FOREGROUND, data, true);
    mForeground = name;
    return ret < 0 ? -2 : 0;
}

int32_t GpuHandler::onScreenStateChanged(const Parcel& data) {
    // Only remembered: the display handler moves the foreground to
    // "screen_off", which is what the accounter sees.
    data.setDataPosition(0);
    int64_t time = 0;
    bool on = false;
    if (data.readInt64(&time) != android::NO_ERROR || data.readBool(&on) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid screen state message");
        return -5;
    }
    mScreenOn = on;
    return 0;
}

int32_t GpuHandler::onDataPolling(const Parcel& data) {
    data.setDataPosition(0);
    PollingPayload poll;
    if (PollingPayload::readFrom(data, &poll) < 0) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid data polling message");
        return -5;
    }
    const bool hourly = poll.reason == POLLING_HOURLY_TICK;
    const int64_t time = hourly ? poll.hour : poll.time;
    int32_t ret = -1;
    if (hourly || mScreenOn) {
        ret = readFrequency(time);
    }
    // The balance follows the poll: an hour, a clock change, a forced
    // balance or a shut-down closes the period whatever the reading did.
    switch (poll.reason) {
        case POLLING_TIME_CHANGED:
            balanceAccounting(poll.time, BALANCE_SPAN, poll.newTime);
            return 0;
        case POLLING_HOURLY_TICK:
        case POLLING_THERMAL:
        case POLLING_FORCE_BALANCE:
        case POLLING_SHUT_DOWN:
            balanceAccounting(time, BALANCE_AT, 0);
            break;
        default:
            if (ret >= 0) {
                balanceAccounting(time, BALANCE_AT, 0);
            }
            break;
    }
    if (poll.reason == POLLING_CHARGER) {
        mChargerOnline = poll.online;
    }
    if (hourly) {
        voteCandidate(poll.hour, kBalanceCandidate, mElector);
    }
    return 0;
}

int32_t GpuHandler::handleApplicationResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t header = 0;
    int64_t start = 0;
    int64_t end = 0;
    String8 name;
    int32_t durations[kResultGroups] = {};
    int64_t usages[kResultGroups] = {};
    int64_t energies[kResultGroups] = {};
    bool ok = data.readInt32(&header) == android::NO_ERROR &&
              data.readInt64(&start) == android::NO_ERROR &&
              data.readInt64(&end) == android::NO_ERROR &&
              data.readString8(&name) == android::NO_ERROR;
    for (int32_t i = 0; ok && i < kResultGroups; ++i) {
        ok = data.readInt32(&durations[i]) == android::NO_ERROR &&
             data.readInt64(&usages[i]) == android::NO_ERROR &&
             data.readInt64(&energies[i]) == android::NO_ERROR;
    }
    if (!ok) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid gpu application result");
        return -2;
    }
    if (energies[0] >= 0 && name != kScreenOffName) {
        Parcel record;
        record.writeInt64(start);
        record.writeString8(name);
        record.writeInt32(APPS_GPU);
        record.writeInt64(energies[0]);
        record.writeInt64(usages[0]);
        AppsAccounting::getInstance()->addAppsData(record);
    }
    Parcel row;
    row.writeInt64(start);
    row.writeInt64(end);
    row.writeString8(name);
    for (int32_t i : {0, kResultGroups - 1}) {
        row.writeInt32(durations[i]);
        row.writeInt64(usages[i]);
        row.writeInt64(energies[i]);
    }
    return insertEntries(kRawApplications, row, 1, false);
}

int32_t GpuHandler::onDailyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    int32_t ret = setPeriodData(EVENT_DAILY_COMPONENTS, end, kDayMs, ratio);
    if (setFrequencyDistribution(end) < 0) {
        ret = -23;
    }
    voteCandidate(end, CANDIDATE_DAILY_UPLOAD, mElector);
    return ret;
}

int32_t GpuHandler::setFrequencyDistribution(int64_t end) {
    Parcel reply;
    int32_t rows = 0;
    String8 sql = String8::format(
        "SELECT frequency, SUM(run), SUM(idle) FROM raw_gpu_frequency WHERE timestamp > %lld AND "
        "timestamp <= %lld GROUP BY frequency",
        static_cast<long long>(end - kDayMs), static_cast<long long>(end));
    if (queryEntriesSimple(sql, &reply, 3, rows) < 0) {
        KLOGE("Failed to query accounting gpu data");
        return -17;
    }
    if (rows > KelvoDevice::kMaxGpuSteps) {
        // More steps than one reading can hold (the kernel's table changed
        // during the day): the first 20 still go out.
        HealthCounters::add(Health::UploadRecordsRefused);
        KLOGE("Invalid row count: %d", rows);
    }
    Parcel out;
    for (int32_t r = 0; r < rows && r < KelvoDevice::kMaxGpuSteps; ++r) {
        int64_t v[3] = {};
        if (reply.readInt64(&v[0]) != android::NO_ERROR ||
            reply.readInt64(&v[1]) != android::NO_ERROR ||
            reply.readInt64(&v[2]) != android::NO_ERROR) {
            break;
        }
        Parcel element;
        DataUploader::formIntData(1, v[0], element);
        DataUploader::formIntData(3, v[1], element);
        DataUploader::formIntData(4, v[2], element);
        DataUploader::formClassArray(kFrequencyField, kClassFrequency, element, out);
    }
    if (out.dataSize() == 0) {
        return 0;
    }
    if (setEventData(EVENT_DAILY_SYSTEM, out, true) < 0) {
        KLOGE("Failed to set gpu upload data");
        return -23;
    }
    return 0;
}

}  // namespace kelvo
