#include "handlers/components/CpuHandler.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <limits>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "accounters/CpuAccounter.h"
#include "binder/managers/ActivityManager.h"
#include "core/AppsAccounting.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "kelvo/Processors.h"
#include "kelvo/RootPath.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/PackageProperty.h"
#include "utils/TimeProvider.h"
#include "utils/devices/KelvoDevice.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

// Runs a pass whose report did not come in time (what: the pass's id).
constexpr int32_t kReportWaitMessage = 120;
constexpr int32_t kProcessNameQuery = 0;
constexpr int32_t kAbnormalityBackgroundReport = 3;

constexpr int32_t kCandidateHourlyTick = 1;
constexpr int32_t kCandidateHourlyUpload = 4;
constexpr int32_t kCandidateDailyUpload = 6;
constexpr int32_t kCandidateDawnUpload = 8;

constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDayMs = 86400000;
constexpr int64_t kDawnMs = 21600000;

constexpr uint32_t kClassEnergy = 903009021;
constexpr uint32_t kClassApplication = 903009022;
constexpr uint32_t kClassPackage = 903009063;
constexpr uint32_t kClassFrequency = 903009030;
constexpr uint32_t kClassIdle = 903009029;
constexpr int32_t kTopApplications = 20;
// Longest uploaded application name. (Named apart from the thread name bound
// the handler inherits, which would hide a file-scope constant of that name.)
constexpr int32_t kMaxUploadNameLength = 100;

constexpr const char* kCpuDir = "/sys/devices/system/cpu";
constexpr const char* kUidStatPath = "/proc/uid_cputime/show_uid_stat";
// Most idle states looked for per core, and most bytes of the uid counters.
constexpr int32_t kMaxIdleStates = 16;
constexpr size_t kMaxUidStatBytes = 4 << 20;
constexpr size_t kMaxDistributionRows = 4096;

const column_attribute kRawFrequencyColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "cluster"},
    {COLUMN_INT, "frequency"},
    {COLUMN_LONG, "time"},
};
const column_attribute kRawIdleColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "cluster"},
    {COLUMN_LONG, "idle_time"},
};

// Times as int, energies as long, in the pairs' order.
const column_attribute kRawComponentColumns[] = {
    {COLUMN_TIME, "start_time"},
    {COLUMN_TIME, "end_time"},
    {COLUMN_INT, "foreground_time"},
    {COLUMN_LONG, "foreground_energy"},
    {COLUMN_INT, "background_time"},
    {COLUMN_LONG, "background_energy"},
    {COLUMN_INT, "screen_on_time"},
    {COLUMN_LONG, "screen_on_energy"},
    {COLUMN_INT, "screen_off_time"},
    {COLUMN_LONG, "screen_off_energy"},
    {COLUMN_INT, "charge_foreground_time"},
    {COLUMN_LONG, "charge_foreground_energy"},
    {COLUMN_INT, "charge_background_time"},
    {COLUMN_LONG, "charge_background_energy"},
};
const column_attribute kHourlyComponentColumns[] = {
    {COLUMN_TIME, "timestamp"},         {COLUMN_INT, "foreground_time"},
    {COLUMN_LONG, "foreground_energy"}, {COLUMN_INT, "background_time"},
    {COLUMN_LONG, "background_energy"}, {COLUMN_INT, "screen_on_time"},
    {COLUMN_LONG, "screen_on_energy"},  {COLUMN_INT, "screen_off_time"},
    {COLUMN_LONG, "screen_off_energy"},
};
const column_attribute kRawApplicationsColumns[] = {
    {COLUMN_INT, "uid"},
    {COLUMN_TIME, "start_time"},
    {COLUMN_TIME, "end_time"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "foreground_time"},
    {COLUMN_LONG, "foreground_energy"},
    {COLUMN_INT, "background_time"},
    {COLUMN_LONG, "background_energy"},
    {COLUMN_INT, "screen_on_time"},
    {COLUMN_LONG, "screen_on_energy"},
    {COLUMN_INT, "screen_off_time"},
    {COLUMN_LONG, "screen_off_energy"},
    {COLUMN_INT, "charge_foreground_time"},
    {COLUMN_LONG, "charge_foreground_energy"},
    {COLUMN_INT, "charge_background_time"},
    {COLUMN_LONG, "charge_background_energy"},
};
const column_attribute kHourlyApplicationsColumns[] = {
    {COLUMN_INT, "uid"},
    {COLUMN_TIME, "timestamp"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "foreground_time"},
    {COLUMN_LONG, "foreground_energy"},
    {COLUMN_INT, "background_time"},
    {COLUMN_LONG, "background_energy"},
    {COLUMN_INT, "screen_on_time"},
    {COLUMN_LONG, "screen_on_energy"},
    {COLUMN_INT, "screen_off_time"},
    {COLUMN_LONG, "screen_off_energy"},
};

template <size_t N>
constexpr int32_t columnCount(const column_attribute (&)[N]) {
    return static_cast<int32_t>(N);
}

const table_attribute kRawFrequencyTable = {"1.0", 1, columnCount(kRawFrequencyColumns),
                                            kRawFrequencyColumns, "raw_cpu_frequencies_time"};
const table_attribute kRawIdleTable = {"1.0", 1, columnCount(kRawIdleColumns), kRawIdleColumns,
                                       "raw_cpu_idle_time"};
const table_attribute kRawComponentTable = {"1.0", 1, columnCount(kRawComponentColumns),
                                            kRawComponentColumns, "raw_component_cpu"};
const table_attribute kHourlyComponentTable = {"1.0", 1, columnCount(kHourlyComponentColumns),
                                               kHourlyComponentColumns, "hourly_component_cpu"};
const table_attribute kRawApplicationsTable = {"1.0", 1, columnCount(kRawApplicationsColumns),
                                               kRawApplicationsColumns, "raw_applications_cpu"};
const table_attribute kHourlyApplicationsTable = {"1.0", 1, columnCount(kHourlyApplicationsColumns),
                                                  kHourlyApplicationsColumns,
                                                  "hourly_applications_cpu"};

const char* const kPairSums =
    "SUM(foreground_time), SUM(foreground_energy), SUM(background_time), "
    "SUM(background_energy), SUM(screen_on_time), SUM(screen_on_energy), "
    "SUM(screen_off_time), SUM(screen_off_energy)";

bool isAppUid(uint32_t uid) {
    uint32_t app = uid % 100000;
    return app >= 10000 && app <= 19999;
}

int64_t elapsedNow() {
    return TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC);
}

// Reads at most cap - 1 bytes of a small file and terminates them; -1 with
// errno set when it cannot be opened or read.
ssize_t readSmallFile(const std::string& path, char* buf, size_t cap) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return -1;
    }
    size_t done = 0;
    while (done + 1 < cap) {
        ssize_t n = read(fd, buf + done, cap - 1 - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            int err = errno;
            close(fd);
            errno = err;
            return -1;
        }
        if (n == 0) {
            break;
        }
        done += static_cast<size_t>(n);
    }
    close(fd);
    buf[done] = '\0';
    return static_cast<ssize_t>(done);
}

// A whole file of at most max bytes; false with errno set otherwise.
bool readWholeFile(const std::string& path, size_t max, std::string* out) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return false;
    }
    out->clear();
    char buf[16384];
    for (;;) {
        ssize_t n = read(fd, buf, sizeof(buf));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 || out->size() + static_cast<size_t>(n) > max) {
            int err = n < 0 ? errno : EFBIG;
            close(fd);
            errno = err;
            return false;
        }
        if (n == 0) {
            break;
        }
        out->append(buf, static_cast<size_t>(n));
    }
    close(fd);
    return true;
}

std::string cpuPath(int32_t core, const char* leaf) {
    char path[128];
    snprintf(path, sizeof(path), "%s/cpu%d/%s", kCpuDir, core, leaf);
    return RootPath::resolve(path);
}

std::string idlePath(int32_t core, int32_t state) {
    char path[128];
    snprintf(path, sizeof(path), "%s/cpu%d/cpuidle/state%d/time", kCpuDir, core, state);
    return RootPath::resolve(path);
}

// The eight sums of a pair row, in column order.
struct pair_sums {
    int64_t v[8] = {0, 0, 0, 0, 0, 0, 0, 0};
    bool read(const Parcel& reply) {
        for (int64_t& x : v) {
            if (reply.readInt64(&x) != android::NO_ERROR) {
                return false;
            }
        }
        return true;
    }
};

// The energy class of an upload: each (time, energy) pair when its time is
// at least 1, the energy scaled by the hour's ratio.
void energyClass(const pair_sums& s, float ratio, Parcel& out) {
    // Column pairs (time, energy) and their fields (time, energy).
    static const int32_t kFields[4][2] = {{5, 4}, {7, 6}, {1, 0}, {3, 2}};
    for (int i = 0; i < 4; ++i) {
        if (s.v[2 * i] >= 1) {
            DataUploader::formIntData(kFields[i][0], s.v[2 * i], out);
            DataUploader::formIntData(kFields[i][1], KelvoUtils::scaleEnergy(s.v[2 * i + 1], ratio),
                                      out);
        }
    }
}

void clearParcel(Parcel& p) {
    p.setDataSize(0);
    p.setDataPosition(0);
}

}  // namespace

std::atomic<int64_t> CpuHandler::sReportWaitMs{CpuHandler::kDefaultReportWaitMs};
std::atomic<int64_t> CpuHandler::sClockHz{0};

int64_t CpuHandler::counter::advance(int64_t reading) {
    if (!known) {
        known = true;
        value = reading;
        return 0;
    }
    int64_t delta = reading >= value ? reading - value : reading;
    value = reading;
    return delta;
}

CpuHandler::CpuHandler()
    : KelvoOperator("CpuHandler", ACCOUNTER_CPU, kElector),
      mFirstSample(true),
      mConfigsReady(false),
      mPidCpuTimeEnabled(false),
      mLastRequestTime(TimeProvider::getCurrentTime(TIME_TYPE_WALL)),
      mLastBackgroundReport(elapsedNow()),
      mNextPendingId(0),
      mScreenOn(true),
      mCharging(false) {
    long hz = sClockHz.load() > 0 ? sClockHz.load() : sysconf(_SC_CLK_TCK);
    mClockHz = hz > 0 ? hz : 100;
}

CpuHandler::~CpuHandler() {
    if (mPidCpuTimeEnabled) {
        KelvoDevice::enablePidCpuTime(false);
    }
}

void CpuHandler::setClockHz(int64_t hz) {
    sClockHz = hz > 0 ? hz : 0;
}

void CpuHandler::setReportWaitMs(int64_t ms) {
    sReportWaitMs = ms > 0 ? ms : kDefaultReportWaitMs;
}

const table_attribute& CpuHandler::rawFrequencyTable() {
    return kRawFrequencyTable;
}
const table_attribute& CpuHandler::rawIdleTable() {
    return kRawIdleTable;
}
const table_attribute& CpuHandler::rawComponentTable() {
    return kRawComponentTable;
}
const table_attribute& CpuHandler::hourlyComponentTable() {
    return kHourlyComponentTable;
}
const table_attribute& CpuHandler::rawApplicationsTable() {
    return kRawApplicationsTable;
}
const table_attribute& CpuHandler::hourlyApplicationsTable() {
    return kHourlyApplicationsTable;
}

void CpuHandler::setupListeners(Parcel& out) {
    static const int32_t kNotifications[] = {
        NOTIFICATION_FOREGROUND_CHANGED, NOTIFICATION_DATA_POLLING,
        NOTIFICATION_UID_REMOVED,        NOTIFICATION_PACKAGE_REMOVED,
        NOTIFICATION_PACKAGE_ADDED,      NOTIFICATION_COMPONENT_ACCOUNTING,
        NOTIFICATION_HOURLY_UPLOADING,   NOTIFICATION_DAILY_UPLOADING,
        NOTIFICATION_DAWN_UPLOADING,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    addLibraryListener(mAccounterType, out);
    addBufferedLogReceiver(kDriverName, kReportMagic, out);
}

void CpuHandler::setCandidateElector() {
    Parcel candidates;
    for (int32_t c : {1, 3, 4, 6, 8}) {
        candidates.writeInt32(c);
    }
    setElector(mElector, candidates);
}

int32_t CpuHandler::checkEnable() {
    if (checkCpuConfigs() < 0) {
        KLOGE("Failed to check cpu configs");
        return -2;
    }
    if (KelvoDevice::enablePidCpuTime(true) != 0) {
        KLOGE("Failed to set process cputime statistics enable");
        return -2;
    }
    mPidCpuTimeEnabled = true;
    return 0;
}

void CpuHandler::addSchemaTable() {
    for (const table_attribute* t :
         {&kRawFrequencyTable, &kRawIdleTable, &kRawComponentTable, &kHourlyComponentTable,
          &kRawApplicationsTable, &kHourlyApplicationsTable}) {
        addSchema(*t);
    }
}

void CpuHandler::cleanTables(int64_t time) {
    cleanObsoleteEntries(kRawFrequencyTable.name, time, "timestamp");
    cleanObsoleteEntries(kRawIdleTable.name, time, "timestamp");
    cleanObsoleteEntries(kRawComponentTable.name, time, "end_time");
    cleanObsoleteEntries(kHourlyComponentTable.name, time, "timestamp");
    cleanObsoleteEntries(kRawApplicationsTable.name, time, "end_time");
    cleanObsoleteEntries(kHourlyApplicationsTable.name, time, "timestamp");
}

// ---- Cluster discovery ----

int32_t CpuHandler::readClusterConfig(int32_t core, std::map<std::string, cluster_info>& clusters,
                                      int32_t* nextIndex) {
    std::string path = cpuPath(core, "cpufreq/related_cpus");
    char related[128];
    ssize_t n = readSmallFile(path, related, sizeof(related));
    if (n < 0) {
        KLOGE("Failed to open %s: %s", path.c_str(), strerror(errno));
        return -1;
    }
    related[strcspn(related, "\n")] = '\0';
    if (related[0] == '\0') {
        KLOGE("Failed to read related cpus of cpu%d: %d", core, static_cast<int32_t>(n));
        return -1;
    }
    auto it = clusters.find(related);
    if (it == clusters.end()) {
        int32_t idleStates = 0;
        for (; idleStates < kMaxIdleStates; ++idleStates) {
            char dir[128];
            snprintf(dir, sizeof(dir), "%s/cpu%d/cpuidle/state%d/", kCpuDir, core, idleStates);
            struct stat st;
            if (stat(RootPath::resolve(dir).c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
                break;
            }
        }
        if (idleStates == 0) {
            KLOGE("Failed to get cpu%d idle count", core);
            return -1;
        }
        std::string freqPath = cpuPath(core, "cpufreq/scaling_available_frequencies");
        char freqs[1024];
        if (readSmallFile(freqPath, freqs, sizeof(freqs)) < 0) {
            KLOGE("Failed to get cpu%d scaling_available_frequencies: %d", core, -errno);
            return -1;
        }
        int32_t steps = 0;
        for (char* p = freqs;;) {
            char* end = nullptr;
            strtol(p, &end, 10);
            if (end == p) {
                break;
            }
            ++steps;
            p = end;
        }
        if (steps == 0 || steps > static_cast<int32_t>(CpuAccounter::kMaxSteps)) {
            KLOGE("Failed to get cpu%d available frequencies count", core);
            return -1;
        }
        if (*nextIndex >= static_cast<int32_t>(CpuAccounter::kMaxClusters)) {
            KLOGE("Too many cpu clusters: %d", *nextIndex + 1);
            return -1;
        }
        KLOGI("related: %s, idleCount: %d, freqCount: %d", related, idleStates, steps);
        KLOGI("cpu%d, %d available frequencies:%s", core, steps, freqs);
        cluster_info info;
        info.index = (*nextIndex)++;
        info.idleStates = idleStates;
        info.steps.resize(static_cast<size_t>(steps));
        it = clusters.emplace(related, std::move(info)).first;
    }
    it->second.cores.push_back(core);
    return 0;
}

int32_t CpuHandler::checkCpuConfigs() {
    if (mConfigsReady) {
        return 0;
    }
    int32_t count = Processors::configuredCount();
    if (count < 1) {
        KLOGE("Invalid count of cpu cores: %d", count);
        return -2;
    }
    std::map<std::string, cluster_info> clusters;
    int32_t nextIndex = 0;
    int32_t failed = 0;
    for (int32_t core = 0; core < count; ++core) {
        if (readClusterConfig(core, clusters, &nextIndex) < 0) {
            KLOGE("Failed to get cpu%d configuration", core);
            ++failed;
        }
    }
    mClusters.clear();
    mClusterOrder.clear();
    if (failed == count) {
        KLOGE("Failed to get configurations of all(%d) cpu cores", count);
        return -2;
    }
    if (failed > 0) {
        KLOGE("Failed to get configurations of %d of the %d cpu cores", failed, count);
        return 0;
    }
    mClusters = std::move(clusters);
    mClusterOrder.resize(mClusters.size());
    for (auto& entry : mClusters) {
        cluster_info& c = entry.second;
        c.idle.assign(c.cores.size() * static_cast<size_t>(c.idleStates), counter());
        c.stepDeltas.assign(c.steps.size(), 0);
        mClusterOrder[static_cast<size_t>(c.index)] = &c;
    }
    mConfigsReady = true;
    mFirstSample = true;
    KLOGI("Check configurations of all(%d) cpu cores successfully", count);
    return 0;
}

// ---- Triggers ----

int32_t CpuHandler::onForegroundChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    KelvoOperator::onForegroundChanged(data);
    return requestPass(time, MODE_FOREGROUND, 0, true);
}

int32_t CpuHandler::onDataPolling(const Parcel& data) {
    data.setDataPosition(0);
    PollingPayload poll;
    if (PollingPayload::readFrom(data, &poll) < 0) {
        KLOGE("Invalid data polling parcel");
        return -5;
    }
    int64_t time = poll.time;
    int64_t newTime = 0;
    int32_t mode = MODE_POLL;
    switch (poll.reason) {
        case POLLING_HOURLY_TICK:
            time = poll.hour;
            mode = MODE_HOURLY;
            break;
        case POLLING_TIME_CHANGED:
            newTime = poll.newTime;
            mode = MODE_TIME_CHANGED;
            break;
        case POLLING_THERMAL:
        case POLLING_FORCE_BALANCE:
        case POLLING_SHUT_DOWN:
            break;
        case POLLING_CHARGER:
            mode = poll.online ? MODE_CHARGER_ON : MODE_CHARGER_OFF;
            break;
        default:
            if (time - mLastRequestTime < kMinPollIntervalMs) {
                return 0;
            }
            break;
    }
    return requestPass(time, mode, newTime, poll.reason >= POLLING_HOURLY_TICK);
}

int32_t CpuHandler::requestPass(int64_t time, int32_t mode, int64_t newTime, bool runOnFailure) {
    // After a clock change the periodic polls count from the new clock.
    mLastRequestTime = mode == MODE_TIME_CHANGED ? newTime : time;
    dev_transmit_t transmit = KelvoDevice::makeTransmit(time, mode);
    int ret = KelvoDevice::requestPidCpuTime(&transmit);
    if (ret != 0) {
        KLOGE("Failed to request process cpu time: %d", ret);
        return runOnFailure ? updateCpuInfo(time, mode, newTime) : ret;
    }
    if (mPending.size() >= kMaxPending) {
        // The oldest request has waited far too long: account it now.
        onReportWaitExpired(mPending.front().id);
    }
    pending_pass pass;
    pass.id = ++mNextPendingId;
    pass.time = time;
    pass.mode = mode;
    pass.newTime = newTime;
    mPending.push_back(pass);
    sendMessageDelayed(sReportWaitMs.load() * 1000000LL,
                       ParcelMessage(kReportWaitMessage, static_cast<int32_t>(pass.id)));
    return 0;
}

void CpuHandler::resolvePendingBefore(uint32_t id) {
    while (!mPending.empty() && mPending.front().id < id) {
        pending_pass pass = mPending.front();
        mPending.pop_front();
        HealthCounters::add(Health::CpuReportsLate);
        KLOGE("No cpu report for the request at %lld, mode %d: accounting uid times only",
              static_cast<long long>(pass.time), pass.mode);
        updateCpuInfo(pass.time, pass.mode, pass.newTime);
    }
}

void CpuHandler::onReportWaitExpired(uint32_t id) {
    bool pending = std::any_of(mPending.begin(), mPending.end(),
                               [id](const pending_pass& p) { return p.id == id; });
    if (pending) {
        resolvePendingBefore(id + 1);
    }
}

int32_t CpuHandler::handleParcelMessage(const ParcelMessage& msg) {
    if (msg.type == kReportWaitMessage) {
        onReportWaitExpired(static_cast<uint32_t>(msg.what));
        return 0;
    }
    return KelvoOperator::handleParcelMessage(msg);
}

int32_t CpuHandler::handleBufferedLog(const Parcel& data) {
    data.setDataPosition(0);
    int64_t arrival = 0;
    String8 sender;
    int32_t magic = 0;
    int32_t length = 0;
    if (data.readInt64(&arrival) != android::NO_ERROR ||
        data.readString8(&sender) != android::NO_ERROR ||
        data.readInt32(&magic) != android::NO_ERROR ||
        data.readInt32(&length) != android::NO_ERROR || length < 1) {
        HealthCounters::add(Health::CpuReportsRefused);
        KLOGE("Invalid data length");
        return -5;
    }
    const void* bytes = data.readInplace(static_cast<size_t>(length));
    if (bytes == nullptr) {
        HealthCounters::add(Health::CpuReportsRefused);
        KLOGE("Failed to read message");
        return -14;
    }
    CpuReport report;
    if (CpuReport::parse(static_cast<const uint8_t*>(bytes), static_cast<size_t>(length), &report) <
        0) {
        HealthCounters::add(Health::CpuReportsRefused);
        KLOGE("Invalid data length: %d", length);
        return -5;
    }
    if (report.state != CpuReport::STATE_ALIVE && report.state != CpuReport::STATE_DEAD) {
        HealthCounters::add(Health::CpuReportsRefused);
        KLOGE("Unknown process state: %d", report.state);
        return -5;
    }
    auto match = std::find_if(mPending.begin(), mPending.end(), [&report](const pending_pass& p) {
        return p.time == report.timestamp && p.mode == report.mode;
    });
    bool current = match != mPending.end();
    if (current) {
        // Requests older than the one answered will not be answered: their
        // passes come first, so the passes stay in time order.
        uint32_t id = match->id;
        resolvePendingBefore(id);
        match = mPending.begin();
    }
    // A report whose pass already ran (or was never asked for) only moves
    // the baselines: its time was accounted from the uid counters.
    bool attribute = current && accounting();
    for (const CpuReport::Record& record : report.records) {
        if (record.pid < 0 || record.timeUs < 0) {
            KLOGE("Invalid parameter");
            continue;
        }
        int64_t ms = record.timeUs / 1000;
        if (report.state == CpuReport::STATE_DEAD) {
            handleDeadPid(record, ms, attribute);
        } else if (ms != 0) {
            setPidCpuTime(record, ms, attribute);
        }
    }
    if (current && report.state == CpuReport::STATE_ALIVE) {
        pending_pass pass = *match;
        mPending.erase(match);
        return updateCpuInfo(pass.time, pass.mode, pass.newTime);
    }
    return 0;
}

// ---- Attribution ----

CpuHandler::uid_entry* CpuHandler::findOrCreateUid(uint32_t uid) {
    auto it = mUids.find(uid);
    if (it == mUids.end()) {
        if (mUids.size() >= kMaxUids) {
            HealthCounters::add(Health::CpuEntriesCapped);
            return nullptr;
        }
        uid_entry entry;
        std::vector<String8> packages;
        if (PackageProperty::getInstance()->queryPackagesByUid(static_cast<int32_t>(uid),
                                                               packages) == 0) {
            for (const String8& p : packages) {
                if (p.length() > 0) {
                    entry.listed.insert(p.string());
                    entry.packages[p.string()];
                }
            }
        }
        it = mUids.emplace(uid, std::move(entry)).first;
    }
    it->second.lastSeen = elapsedNow();
    return &it->second;
}

CpuHandler::package_entry& CpuHandler::packageOf(uid_entry& entry, const std::string& name) {
    return entry.packages[name];
}

bool CpuHandler::isSinglePackageApp(uint32_t uid, const uid_entry& entry) const {
    return isAppUid(uid) && entry.listed.size() == 1;
}

void CpuHandler::shareAmong(uid_entry& entry, const std::vector<std::string>& names, int64_t delta) {
    if (names.empty()) {
        return;
    }
    int64_t share = delta / static_cast<int64_t>(names.size());
    if (share < 1) {
        return;
    }
    for (const std::string& name : names) {
        packageOf(entry, name).passTime += share;
    }
}

std::string CpuHandler::processName(const CpuReport::Record& record, pid_entry& pid) {
    if (!pid.name.empty()) {
        return pid.name;
    }
    std::string name;
    if (record.nameType == CpuReport::NAME_KERNEL_THREAD && !record.name.empty()) {
        name = CpuReport::uniformThreadName(record.uid, record.name);
    } else if (record.nameType == CpuReport::NAME_PROCESS && !record.name.empty()) {
        name = record.name;
    } else if (KelvoDevice::getProcessName(record.pid, nullptr, &name) != 0) {
        KLOGE("Failed to ioctl to get process name");
        return std::string();
    }
    auto it = mUids.find(record.uid);
    if (it != mUids.end() && isAppUid(record.uid) && it->second.listed.size() > 1) {
        name = *it->second.listed.begin() + "-" + name;
    }
    pid.name = name;
    return name;
}

void CpuHandler::setUidCpuTime(uint32_t uid, int64_t ms) {
    auto it = mUidBaselines.find(uid);
    int64_t last = it != mUidBaselines.end() ? it->second : 0;
    // A uid new to the counters has all of its time since the last pass.
    int64_t delta = ms >= last ? ms - last : ms;
    if (delta <= 0 || !accounting() || !isAppUid(uid)) {
        return;
    }
    uid_entry* entry = findOrCreateUid(uid);
    if (entry != nullptr && isSinglePackageApp(uid, *entry)) {
        packageOf(*entry, *entry->listed.begin()).passTime += delta;
    }
}

void CpuHandler::setPidCpuTime(const CpuReport::Record& record, int64_t ms, bool attribute) {
    uint64_t key = pidKey(record.uid, record.pid);
    auto it = mPids.find(key);
    if (it == mPids.end()) {
        if (mPids.size() >= kMaxPids) {
            HealthCounters::add(Health::CpuEntriesCapped);
            return;
        }
        pid_entry entry;
        entry.uid = record.uid;
        entry.kernelThread = record.nameType == CpuReport::NAME_KERNEL_THREAD;
        uid_entry* uid = findOrCreateUid(record.uid);
        if (uid != nullptr && !entry.kernelThread && !isSinglePackageApp(record.uid, *uid)) {
            std::vector<String8> packages;
            if (ActivityManager::getInstance()->getPackagesForPid(static_cast<int32_t>(record.uid),
                                                                  record.pid, packages) == 0) {
                for (const String8& p : packages) {
                    entry.packages.push_back(p.string());
                }
            }
        }
        it = mPids.emplace(key, std::move(entry)).first;
        if (record.nameType != CpuReport::NAME_NONE) {
            processName(record, it->second);
        }
    }
    pid_entry& pid = it->second;
    pid.lastSeen = elapsedNow();
    // A time below the baseline is a new process under a reused pid.
    int64_t delta = ms >= pid.lastTime ? ms - pid.lastTime : ms;
    if (ms < pid.lastTime) {
        KLOGD("Invalid delta time, uid=%u, pid=%d, name=%s", record.uid, record.pid,
              record.name.c_str());
    }
    pid.lastTime = ms;
    if (!attribute || delta == 0) {
        return;
    }
    uid_entry* uid = findOrCreateUid(record.uid);
    if (uid == nullptr || isSinglePackageApp(record.uid, *uid)) {
        return;
    }
    if (!pid.packages.empty()) {
        shareAmong(*uid, pid.packages, delta);
        return;
    }
    std::string name = processName(record, pid);
    if (name.empty()) {
        KLOGI("Package name cannot be empty");
        return;
    }
    package_entry& package = packageOf(*uid, name);
    package.passTime += delta;
    package.pids.insert(record.pid);
    package.removed = false;
}

void CpuHandler::handleDeadPid(const CpuReport::Record& record, int64_t ms, bool attribute) {
    auto it = mPids.find(pidKey(record.uid, record.pid));
    if (it != mPids.end()) {
        pid_entry pid = std::move(it->second);
        mPids.erase(it);
        if (!attribute) {
            return;
        }
        uid_entry* uid = findOrCreateUid(record.uid);
        if (uid == nullptr || isSinglePackageApp(record.uid, *uid)) {
            return;
        }
        int64_t delta = ms >= pid.lastTime ? ms - pid.lastTime : ms;
        if (!pid.packages.empty()) {
            shareAmong(*uid, pid.packages, delta);
            return;
        }
        std::string name = pid.name;
        if (name.empty() && record.nameType != CpuReport::NAME_NONE) {
            name = processName(record, pid);
        }
        if (name.empty()) {
            return;
        }
        package_entry& package = packageOf(*uid, name);
        package.passTime += delta;
        package.pids.erase(record.pid);
        if (package.pids.empty()) {
            package.removed = true;
        }
        return;
    }
    if (ms == 0 || !attribute) {
        return;
    }
    uid_entry* uid = findOrCreateUid(record.uid);
    if (uid == nullptr || isSinglePackageApp(record.uid, *uid)) {
        return;
    }
    if (uid->listed.empty() || record.nameType == CpuReport::NAME_KERNEL_THREAD) {
        // A process that lived and died between two reports.
        pid_entry scratch;
        std::string name =
            record.nameType == CpuReport::NAME_NONE ? std::string() : processName(record, scratch);
        if (name.empty()) {
            return;
        }
        package_entry& package = packageOf(*uid, name);
        package.passTime += ms;
        if (package.pids.empty()) {
            package.removed = true;
        }
        return;
    }
    std::vector<std::string> active;
    for (const std::string& name : uid->listed) {
        if (packageOf(*uid, name).passTime >= 1) {
            active.push_back(name);
        }
    }
    if (active.empty()) {
        active.assign(uid->listed.begin(), uid->listed.end());
    }
    shareAmong(*uid, active, ms);
}

// ---- The pass ----

int32_t CpuHandler::readUidTimes(std::vector<uid_reading>* out) {
    std::string path = RootPath::resolve(kUidStatPath);
    std::string text;
    if (!readWholeFile(path, kMaxUidStatBytes, &text)) {
        KLOGE("Failed to open %s: %s", path.c_str(), strerror(errno));
        return -2;
    }
    out->clear();
    const char* p = text.c_str();
    int32_t malformed = 0;
    while (*p != '\0') {
        const char* lineEnd = strchr(p, '\n');
        if (lineEnd == nullptr) {
            lineEnd = p + strlen(p);
        }
        char* end = nullptr;
        errno = 0;
        unsigned long uid = strtoul(p, &end, 10);
        bool ok = end != p && *end == ':' && errno == 0 && uid <= UINT32_MAX;
        unsigned long long user = 0;
        unsigned long long system = 0;
        if (ok) {
            const char* q = end + 1;
            user = strtoull(q, &end, 10);
            ok = end != q && errno == 0;
            q = end;
            system = ok ? strtoull(q, &end, 10) : 0;
            ok = ok && end != q && errno == 0 && end <= lineEnd;
        }
        if (ok) {
            unsigned long long us = user + system;
            if (us < user) {
                us = std::numeric_limits<unsigned long long>::max();
            }
            int64_t ms = static_cast<int64_t>(
                std::min<unsigned long long>(us / 1000, std::numeric_limits<int64_t>::max()));
            if (ms != 0) {
                out->push_back({static_cast<uint32_t>(uid), ms});
            }
        } else if (lineEnd != p) {
            ++malformed;
        }
        p = *lineEnd == '\n' ? lineEnd + 1 : lineEnd;
    }
    if (malformed > 0) {
        KLOGE("Skipped %d malformed lines of %s", malformed, path.c_str());
    }
    return 0;
}

int32_t CpuHandler::readIdleTimes(std::vector<std::vector<int64_t>>* out) {
    out->assign(mClusterOrder.size(), {});
    for (const cluster_info* c : mClusterOrder) {
        if (c->cores.empty() || c->idleStates <= 0) {
            KLOGE("Invalid cluster info");
            return -2;
        }
        std::vector<int64_t>& readings = (*out)[static_cast<size_t>(c->index)];
        readings.assign(c->cores.size() * static_cast<size_t>(c->idleStates), -1);
        for (size_t i = 0; i < c->cores.size(); ++i) {
            for (int32_t s = 0; s < c->idleStates; ++s) {
                std::string path = idlePath(c->cores[i], s);
                char buf[64];
                if (readSmallFile(path, buf, sizeof(buf)) < 0) {
                    // Offline cores have no idle files: they keep their last value.
                    KLOGD("Failed to open %s: %s", path.c_str(), strerror(errno));
                    continue;
                }
                char* end = nullptr;
                unsigned long long us = strtoull(buf, &end, 10);
                if (end == buf) {
                    KLOGE("Failed to get cpu%d idle state%d time: %s", c->cores[i], s, buf);
                    continue;
                }
                readings[i * static_cast<size_t>(c->idleStates) + static_cast<size_t>(s)] =
                    static_cast<int64_t>(std::min<unsigned long long>(
                        us / 1000, std::numeric_limits<int64_t>::max()));
            }
        }
    }
    return 0;
}

int32_t CpuHandler::readFrequencyTimes(std::vector<std::vector<std::pair<int32_t, int64_t>>>* out) {
    out->assign(mClusterOrder.size(), {});
    for (cluster_info* c : mClusterOrder) {
        std::string text;
        bool opened = false;
        for (int32_t core : c->cores) {
            if (readWholeFile(cpuPath(core, "cpufreq/stats/time_in_state"), 1 << 16, &text)) {
                opened = true;
                break;
            }
        }
        if (!opened) {
            KLOGE("Failed to open cpufreq node of cluster: %d", c->index);
            continue;
        }
        std::vector<std::pair<int32_t, int64_t>>& steps = (*out)[static_cast<size_t>(c->index)];
        int32_t count = static_cast<int32_t>(c->steps.size());
        int32_t line = 0;
        int32_t previous = 0;
        const char* p = text.c_str();
        while (*p != '\0') {
            const char* lineEnd = strchr(p, '\n');
            if (lineEnd == nullptr) {
                lineEnd = p + strlen(p);
            }
            if (lineEnd != p) {
                char* end = nullptr;
                errno = 0;
                long freq = strtol(p, &end, 10);
                const char* q = end;
                unsigned long long ticks = end != p ? strtoull(q, &end, 10) : 0;
                if (end == p || end == q || errno != 0 || freq <= 0 || freq > INT32_MAX ||
                    end > lineEnd) {
                    KLOGE("Failed to get cpu%d frequency time: %.*s", c->cores[0],
                          static_cast<int>(lineEnd - p), p);
                    return -14;
                }
                if (freq <= previous) {
                    KLOGE(
                        "Invalid count or frequencies order, count: %d, freqCount: %d, "
                        "freq: %d, preFreq: %d",
                        line + 1, count, static_cast<int32_t>(freq), previous);
                    return -16;
                }
                previous = static_cast<int32_t>(freq);
                if (line < count) {
                    int32_t saved = c->steps[static_cast<size_t>(line)].frequency;
                    if (saved != 0 && saved != freq) {
                        KLOGE("Mismatch frequency, freq: %d, freqSaved: %d",
                              static_cast<int32_t>(freq), saved);
                        return -16;
                    }
                    // ticks * 1000 / hz in 64 bits: exact for any tick rate.
                    unsigned long long capped = std::min<unsigned long long>(
                        ticks, std::numeric_limits<int64_t>::max() / 1000);
                    steps.emplace_back(static_cast<int32_t>(freq),
                                       static_cast<int64_t>(capped) * 1000 / mClockHz);
                } else {
                    // Boost steps beyond the advertised ones are not accounted.
                    HealthCounters::add(Health::CpuCounterLinesIgnored);
                    if (!c->extraLinesLogged) {
                        c->extraLinesLogged = true;
                        KLOGE("Ignoring frequency %d of cluster %d beyond its %d steps",
                              static_cast<int32_t>(freq), c->index, count);
                    }
                }
                ++line;
            }
            p = *lineEnd == '\n' ? lineEnd + 1 : lineEnd;
        }
    }
    return 0;
}

void CpuHandler::commitReadings(int64_t time, const std::vector<uid_reading>& uids,
                                const std::vector<std::vector<int64_t>>& idle,
                                const std::vector<std::vector<std::pair<int32_t, int64_t>>>& freqs) {
    std::unordered_map<uint32_t, int64_t> baselines;
    baselines.reserve(uids.size());
    for (const uid_reading& r : uids) {
        setUidCpuTime(r.uid, r.ms);
        baselines[r.uid] = r.ms;
    }
    // A uid that left the counters starts from 0 when it comes back.
    mUidBaselines.swap(baselines);

    Parcel idleRows;
    int32_t idleCount = 0;
    Parcel freqRows;
    int32_t freqCount = 0;
    for (cluster_info* c : mClusterOrder) {
        size_t index = static_cast<size_t>(c->index);
        c->idleDelta = 0;
        bool hadBaseline = false;
        const std::vector<int64_t>& readings = idle[index];
        for (size_t i = 0; i < readings.size() && i < c->idle.size(); ++i) {
            if (readings[i] < 0) {
                continue;
            }
            hadBaseline = hadBaseline || c->idle[i].known;
            c->idleDelta += c->idle[i].advance(readings[i]);
        }
        if (hadBaseline) {
            idleRows.writeInt64(time);
            idleRows.writeInt32(c->index);
            idleRows.writeInt64(c->idleDelta);
            ++idleCount;
        }
        std::fill(c->stepDeltas.begin(), c->stepDeltas.end(), 0);
        const std::vector<std::pair<int32_t, int64_t>>& steps = freqs[index];
        for (size_t s = 0; s < steps.size() && s < c->steps.size(); ++s) {
            freq_step& step = c->steps[s];
            bool known = step.time.known;
            step.frequency = steps[s].first;
            c->stepDeltas[s] = step.time.advance(steps[s].second);
            if (known) {
                freqRows.writeInt64(time);
                freqRows.writeInt32(c->index);
                freqRows.writeInt32(step.frequency);
                freqRows.writeInt64(c->stepDeltas[s]);
                ++freqCount;
            }
        }
    }
    if (idleCount > 0) {
        insertEntries(kRawIdleTable, idleRows, idleCount, false);
    }
    if (freqCount > 0) {
        insertEntries(kRawFrequencyTable, freqRows, freqCount, false);
    }
}

void CpuHandler::writeClusterData(Parcel& action) {
    action.writeUint32(static_cast<uint32_t>(mClusterOrder.size()));
    for (const cluster_info* c : mClusterOrder) {
        int64_t total = 0;
        for (int64_t d : c->stepDeltas) {
            total += d > 0 ? d : 0;
        }
        int64_t idle = c->idleDelta;
        if (idle < 0) {
            KLOGE("Invalid delta time: Cluster%d total idle time: %lld", c->index,
                  static_cast<long long>(idle));
            idle = 0;
        }
        if (total < 1) {
            total = 1;
        }
        action.writeUint32(static_cast<uint32_t>(c->index));
        action.writeUint32(static_cast<uint32_t>(c->cores.size()));
        action.writeInt32(KelvoUtils::saturateInt32(idle));
        action.writeInt32(KelvoUtils::saturateInt32(total));
        action.writeUint32(static_cast<uint32_t>(c->stepDeltas.size()));
        for (int64_t d : c->stepDeltas) {
            action.writeInt32(KelvoUtils::saturateInt32(d > 0 ? d : 0));
        }
    }
}

int32_t CpuHandler::sendSetValue(int64_t time, int32_t mode, bool hasData) {
    Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt64(time);
    action.writeInt32(mode);
    action.writeBool(hasData);
    if (hasData) {
        writeClusterData(action);
        int64_t sum = 0;
        for (auto& u : mUids) {
            for (auto& p : u.second.packages) {
                if (p.second.passTime > 0) {
                    sum += std::min<int64_t>(p.second.passTime, INT32_MAX);
                }
            }
        }
        action.writeInt64(sum);
        for (auto& u : mUids) {
            for (auto& p : u.second.packages) {
                if (p.second.passTime > 0) {
                    action.writeInt32(static_cast<int32_t>(u.first));
                    action.writeString8(String8(p.first.c_str()));
                    action.writeInt32(KelvoUtils::saturateInt32(p.second.passTime));
                }
            }
        }
    }
    if (feedAccounter(action) < 0) {
        // The pass's CPU time waits for the next pass.
        KLOGE("Failed to calculate cpu energy");
        return -1;
    }
    if (hasData) {
        for (auto& u : mUids) {
            for (auto& p : u.second.packages) {
                if (p.second.passTime > 0) {
                    p.second.passTime -= std::min<int64_t>(p.second.passTime, INT32_MAX);
                }
            }
        }
    }
    return 0;
}

int32_t CpuHandler::updateCpuInfo(int64_t time, int32_t mode, int64_t newTime) {
    checkCpuConfigs();
    std::vector<uid_reading> uids;
    std::vector<std::vector<int64_t>> idle;
    std::vector<std::vector<std::pair<int32_t, int64_t>>> freqs;
    int32_t ret = readUidTimes(&uids);
    if (ret < 0) {
        KLOGE("Failed to get uid cpu time: %d", ret);
    } else if ((ret = readIdleTimes(&idle)) < 0) {
        KLOGE("Failed to read cpu idle time: %d", ret);
    } else if ((ret = readFrequencyTimes(&freqs)) < 0) {
        KLOGE("Failed to read cpu frequency time: %d", ret);
    }
    bool readOk = ret >= 0;
    if (!readOk) {
        KLOGE("Failed to get cpu information");
    } else {
        commitReadings(time, uids, idle, freqs);
        ret = sendSetValue(time, mode, accounting());
    }
    switch (mode) {
        case MODE_HOURLY:
            logPackageAccounting(time);
            voteCandidate(time, kCandidateHourlyTick, mElector);
            ageEntries();
            break;
        case MODE_TIME_CHANGED:
            balanceAccounting(time, BALANCE_SPAN, newTime);
            break;
        case MODE_CHARGER_ON:
        case MODE_CHARGER_OFF: {
            Parcel change;
            change.writeInt64(time);
            change.writeBool(mode == MODE_CHARGER_ON);
            KelvoOperator::onChargerOnlineChanged(change);
            break;
        }
        default:
            break;
    }
    // Only a pass that read everything ends the baseline: otherwise the next
    // one would take whole since-boot totals as one delta.
    if (readOk) {
        mFirstSample = false;
    }
    return ret < 0 ? ret : 0;
}

// ---- Results ----

int32_t CpuHandler::handleComponentResult(const Parcel& data) {
    int64_t start = 0;
    int64_t end = 0;
    int32_t fgTime = 0;
    int64_t fgEnergy = 0;
    int32_t time = 0;
    int64_t energy = 0;
    bool screenOn = false;
    bool charging = false;
    if (data.readInt64(&start) != android::NO_ERROR || data.readInt64(&end) != android::NO_ERROR ||
        data.readInt32(&fgTime) != android::NO_ERROR ||
        data.readInt64(&fgEnergy) != android::NO_ERROR ||
        data.readInt32(&time) != android::NO_ERROR || data.readInt64(&energy) != android::NO_ERROR ||
        data.readBool(&screenOn) != android::NO_ERROR ||
        data.readBool(&charging) != android::NO_ERROR) {
        KLOGE("Invalid cpu component result");
        return -5;
    }
    mScreenOn = screenOn;
    mCharging = charging;
    int64_t pairs[6][2] = {};
    int64_t bgTime = static_cast<int64_t>(time) - fgTime;
    int64_t bgEnergy = energy - fgEnergy;
    if (charging) {
        pairs[4][0] = fgTime;
        pairs[4][1] = fgEnergy;
        pairs[5][0] = bgTime;
        pairs[5][1] = bgEnergy;
    } else {
        pairs[0][0] = fgTime;
        pairs[0][1] = fgEnergy;
        pairs[1][0] = bgTime;
        pairs[1][1] = bgEnergy;
        pairs[screenOn ? 2 : 3][0] = time;
        pairs[screenOn ? 2 : 3][1] = energy;
    }
    Parcel row;
    row.writeInt64(start);
    row.writeInt64(end);
    for (const auto& pair : pairs) {
        row.writeInt32(KelvoUtils::saturateInt32(pair[0]));
        row.writeInt64(pair[1]);
    }
    return insertEntries(kRawComponentTable, row, 1, false);
}

int32_t CpuHandler::handleApplicationResult(const Parcel& data) {
    Parcel rows;
    // The rows take about the room of the records they come from.
    rows.setDataCapacity(data.dataSize() + 64);
    int32_t count = 0;
    while (data.dataAvail() > 0) {
        int32_t uid = 0;
        int64_t start = 0;
        int64_t end = 0;
        String8 name;
        int32_t times[6] = {};
        int64_t energies[6] = {};
        bool ok = data.readInt32(&uid) == android::NO_ERROR &&
                  data.readInt64(&start) == android::NO_ERROR &&
                  data.readInt64(&end) == android::NO_ERROR &&
                  data.readString8(&name) == android::NO_ERROR;
        for (int i = 0; ok && i < 6; ++i) {
            ok = data.readInt32(&times[i]) == android::NO_ERROR &&
                 data.readInt64(&energies[i]) == android::NO_ERROR;
        }
        if (!ok) {
            KLOGE("Invalid cpu application result");
            break;
        }
        uid_entry* entry = findOrCreateUid(static_cast<uint32_t>(uid));
        if (entry != nullptr) {
            package_entry& package = packageOf(*entry, name.string());
            for (int i = 0; i < 4; ++i) {
                package.hourTime[i] += times[i];
                package.hourEnergy[i] += energies[i];
            }
            package.backgroundTime += static_cast<int64_t>(times[1]) + times[5];
            package.backgroundEnergy += energies[1] + energies[5];
        }
        if (energies[0] + energies[1] >= 0) {
            Parcel record;
            record.writeInt64(start);
            record.writeString8(name);
            record.writeInt32(APPS_CPU);
            for (int i = 0; i < 4; ++i) {
                record.writeInt64(energies[i]);
            }
            for (int i = 0; i < 4; ++i) {
                record.writeInt32(times[i]);
            }
            AppsAccounting::getInstance()->addAppsData(record);
        }
        rows.writeInt32(uid);
        rows.writeInt64(start);
        rows.writeInt64(end);
        rows.writeString8(name);
        for (int i = 0; i < 6; ++i) {
            rows.writeInt32(times[i]);
            rows.writeInt64(energies[i]);
        }
        if (++count == kMaxInsertRows) {
            insertEntries(kRawApplicationsTable, rows, count, false);
            clearParcel(rows);
            count = 0;
        }
    }
    if (count > 0) {
        insertEntries(kRawApplicationsTable, rows, count, false);
    }
    if (elapsedNow() - mLastBackgroundReport >= kBackgroundReportMs) {
        sendBackgroundReport();
    }
    return 0;
}

void CpuHandler::sendBackgroundReport() {
    int64_t now = elapsedNow();
    int64_t elapsed = now - mLastBackgroundReport;
    mLastBackgroundReport = now;
    int32_t cores = 0;
    for (const cluster_info* c : mClusterOrder) {
        cores += static_cast<int32_t>(c->cores.size());
    }
    Parcel report;
    for (auto& u : mUids) {
        for (auto& p : u.second.packages) {
            package_entry& package = p.second;
            if (package.backgroundTime <= 0 && package.backgroundEnergy <= 0) {
                continue;
            }
            float share = elapsed > 0 && cores > 0
                              ? static_cast<float>(package.backgroundTime) /
                                    static_cast<float>(elapsed) / static_cast<float>(cores) * 100.0f
                              : 0.0f;
            report.writeInt32(static_cast<int32_t>(u.first));
            report.writeString8(String8(p.first.c_str()));
            report.writeFloat(share);
            report.writeInt32(KelvoUtils::saturateInt32(package.backgroundTime));
            report.writeInt64(package.backgroundEnergy);
            package.backgroundTime = 0;
            package.backgroundEnergy = 0;
        }
    }
    android::sp<KelvoAgent> agent = KelvoAgent::getInstance();
    if (report.dataSize() > 0 && agent->getRoutine(ROUTINE_ABNORMALITY) != nullptr) {
        agent->sendToRoutine(ROUTINE_ABNORMALITY, kAbnormalityBackgroundReport, report, nullptr,
                             false);
    }
}

int32_t CpuHandler::logPackageAccounting(int64_t time) {
    Parcel rows;
    int32_t count = 0;
    for (auto& u : mUids) {
        for (auto& p : u.second.packages) {
            package_entry& package = p.second;
            if (package.hourTime[0] + package.hourTime[1] > 0) {
                rows.writeInt32(static_cast<int32_t>(u.first));
                rows.writeInt64(time);
                rows.writeString8(String8(p.first.c_str()));
                for (int i = 0; i < 4; ++i) {
                    rows.writeInt32(KelvoUtils::saturateInt32(package.hourTime[i]));
                    rows.writeInt64(package.hourEnergy[i]);
                }
                if (++count == kMaxInsertRows) {
                    insertEntries(kHourlyApplicationsTable, rows, count, false);
                    clearParcel(rows);
                    count = 0;
                }
            }
            std::fill(std::begin(package.hourTime), std::end(package.hourTime), 0);
            std::fill(std::begin(package.hourEnergy), std::end(package.hourEnergy), 0);
        }
    }
    if (count > 0) {
        insertEntries(kHourlyApplicationsTable, rows, count, false);
    }
    // Removed packages, then removed uids, go once their hour is written.
    // The counter baselines stay: a package that comes back (an update)
    // does not count its history again.
    for (auto u = mUids.begin(); u != mUids.end();) {
        auto& packages = u->second.packages;
        for (auto p = packages.begin(); p != packages.end();) {
            p = p->second.removed && p->second.passTime <= 0 ? packages.erase(p) : std::next(p);
        }
        u = u->second.removed ? mUids.erase(u) : std::next(u);
    }
    return 0;
}

void CpuHandler::ageEntries() {
    int64_t now = elapsedNow();
    for (auto it = mPids.begin(); it != mPids.end();) {
        it = now - it->second.lastSeen > kBaselineAgeMs ? mPids.erase(it) : std::next(it);
    }
    for (auto it = mUids.begin(); it != mUids.end();) {
        bool idle = now - it->second.lastSeen > kBaselineAgeMs;
        for (const auto& p : it->second.packages) {
            const package_entry& package = p.second;
            idle = idle && package.passTime <= 0 && package.backgroundTime <= 0;
        }
        it = idle ? mUids.erase(it) : std::next(it);
    }
}

int32_t CpuHandler::logComponentAccounting(int64_t time) {
    forceFlushEntries();
    String8 sql = String8::format(
        "SELECT %s FROM raw_component_cpu WHERE end_time > %lld AND "
        "end_time <= %lld",
        kPairSums, static_cast<long long>(time - kHourMs), static_cast<long long>(time));
    Parcel reply;
    int32_t rows = 0;
    int32_t ret = queryEntriesSimple(sql, &reply, 8, rows);
    if (ret < 0) {
        KLOGE("Failed to query component cpu data: %d", ret);
        return -17;
    }
    if (rows != 1) {
        KLOGE("Invalid row: %d", rows);
        return -2;
    }
    pair_sums sums;
    if (!sums.read(reply)) {
        KLOGE("Invalid row: %d", rows);
        return -2;
    }
    int64_t energy = sums.v[1] + sums.v[3];
    if (energy > 0) {
        updateCompensation(time, mElector, energy);
    }
    return logSimpleQueryResult(kHourlyComponentTable, reply, time);
}

// ---- Packages and uids ----

int32_t CpuHandler::onUidRemoved(const Parcel& data) {
    data.setDataPosition(0);
    int32_t uid = data.readInt32();
    auto it = mUids.find(static_cast<uint32_t>(uid));
    if (it == mUids.end()) {
        KLOGE("Failed to find uid entry: %d", uid);
        return -4;
    }
    it->second.removed = true;
    KLOGD("Set removed: uid=%d", uid);
    return 0;
}

int32_t CpuHandler::onPackageRemoved(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    int32_t uid = data.readInt32();
    String8 name = data.readString8();
    auto it = mUids.find(static_cast<uint32_t>(uid));
    if (it == mUids.end()) {
        KLOGE("Failed to find uid entry: %d", uid);
        return -4;
    }
    auto package = it->second.packages.find(name.string());
    if (package != it->second.packages.end()) {
        package->second.removed = true;
    }
    if (isSinglePackageApp(static_cast<uint32_t>(uid), it->second)) {
        it->second.removed = true;
    }
    KLOGD("Set removed: uid=%d, package=%s", uid, name.string());
    return 0;
}

int32_t CpuHandler::onPackageAdded(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    int32_t uid = data.readInt32();
    String8 name = data.readString8();
    if (uid < 0 || name.length() == 0) {
        KLOGE("Invalid parameter");
        return -5;
    }
    uid_entry* entry = findOrCreateUid(static_cast<uint32_t>(uid));
    if (entry == nullptr) {
        return -4;
    }
    entry->removed = false;
    entry->listed.insert(name.string());
    packageOf(*entry, name.string()).removed = false;
    return 0;
}

int32_t CpuHandler::handleCustomized(int32_t code, const Parcel& data, Parcel* reply) {
    if (code != kProcessNameQuery) {
        KLOGE("Unknown customized tag: %d", code);
        return -3;
    }
    data.setDataPosition(0);
    int32_t uid = data.readInt32();
    int32_t pid = data.readInt32();
    if (mUids.find(static_cast<uint32_t>(uid)) == mUids.end()) {
        KLOGD("Failed to find uid entry: %d", uid);
        return -4;
    }
    auto it = mPids.find(pidKey(static_cast<uint32_t>(uid), pid));
    if (it == mPids.end()) {
        KLOGD("Failed to find pid entry: %d", pid);
        return -4;
    }
    if (it->second.name.empty() || reply == nullptr) {
        KLOGD("Failed to find entry: %d %d", uid, pid);
        return -4;
    }
    reply->writeString8(String8(it->second.name.c_str()));
    return 0;
}

// ---- Uploads ----

int32_t CpuHandler::uploadComponent(int64_t end, int64_t window, float ratio, Parcel& out) {
    String8 sql = String8::format(
        "SELECT %s FROM raw_component_cpu WHERE end_time > %lld AND end_time <= %lld", kPairSums,
        static_cast<long long>(end - window), static_cast<long long>(end));
    Parcel reply;
    int32_t rows = 0;
    pair_sums sums;
    if (queryEntriesSimple(sql, &reply, 8, rows) < 0 || rows != 1 || !sums.read(reply)) {
        KLOGE("Failed to query hourly component data");
        return -17;
    }
    Parcel energy;
    energyClass(sums, ratio, energy);
    if (energy.dataSize() > 0) {
        DataUploader::formClassData(6, kClassEnergy, energy, out);
    }
    return 0;
}

int32_t CpuHandler::uploadTopApplications(int64_t end, int64_t window, float ratio, Parcel& out) {
    String8 sql = String8::format(
        "SELECT name, %s FROM hourly_applications_cpu WHERE timestamp > %lld AND "
        "timestamp <= %lld GROUP BY name ORDER BY SUM(foreground_time) + "
        "SUM(background_time) DESC LIMIT %d",
        kPairSums, static_cast<long long>(end - window), static_cast<long long>(end),
        kTopApplications);
    Parcel reply;
    int32_t rows = 0;
    int32_t ret = queryEntriesSimple(sql, &reply, 9, rows);
    if (ret < 0) {
        KLOGE("Failed to query top applications data: %d", ret);
        return -17;
    }
    if (rows > kTopApplications) {
        KLOGE("Invalid rows: %d", rows);
        return -2;
    }
    for (int32_t r = 0; r < rows; ++r) {
        String8 name;
        pair_sums sums;
        if (reply.readString8(&name) != android::NO_ERROR || !sums.read(reply)) {
            KLOGE("Invalid rows: %d", rows);
            return -2;
        }
        Parcel energy;
        energyClass(sums, ratio, energy);
        if (energy.dataSize() == 0) {
            continue;
        }
        Parcel package;
        DataUploader::formVarcharData(0, name.string(), kMaxUploadNameLength + 1, package);
        Parcel element;
        DataUploader::formClassData(3, kClassPackage, package, element);
        int32_t strategy = PackageProperty::getInstance()->getPackageStrategy(name);
        if (strategy >= 1) {
            DataUploader::formIntData(2, strategy, element);
        }
        int32_t type = PackageProperty::getInstance()->getPackageType(name);
        if (type >= 1) {
            DataUploader::formIntData(4, type, element);
        }
        DataUploader::formClassData(1, kClassEnergy, energy, element);
        DataUploader::formClassArray(7, kClassApplication, element, out);
    }
    return 0;
}

int32_t CpuHandler::uploadPeriod(uint32_t event, int64_t end, int64_t window, float ratio) {
    forceFlushEntries();
    Parcel out;
    uploadComponent(end, window, ratio, out);
    uploadTopApplications(end, window, ratio, out);
    return setEventData(event, out, true);
}

int32_t CpuHandler::uploadDistributions(int64_t end) {
    int64_t start = end - kDayMs;
    Parcel out;
    Parcel reply;
    int32_t rows = 0;
    String8 sql = String8::format(
        "SELECT cluster, frequency, SUM(time) FROM raw_cpu_frequencies_time WHERE "
        "timestamp > %lld AND timestamp <= %lld GROUP BY cluster, frequency",
        static_cast<long long>(start), static_cast<long long>(end));
    if (queryEntriesSimple(sql, &reply, 3, rows) == 0) {
        for (int32_t r = 0; r < rows && static_cast<size_t>(r) < kMaxDistributionRows; ++r) {
            int64_t v[3] = {};
            if (reply.readInt64(&v[0]) != android::NO_ERROR ||
                reply.readInt64(&v[1]) != android::NO_ERROR ||
                reply.readInt64(&v[2]) != android::NO_ERROR) {
                break;
            }
            Parcel element;
            for (int i = 0; i < 3; ++i) {
                DataUploader::formIntData(i, v[i], element);
            }
            DataUploader::formClassArray(13, kClassFrequency, element, out);
        }
    }
    clearParcel(reply);
    sql = String8::format(
        "SELECT cluster, SUM(idle_time) FROM raw_cpu_idle_time WHERE "
        "timestamp > %lld AND timestamp <= %lld GROUP BY cluster",
        static_cast<long long>(start), static_cast<long long>(end));
    if (queryEntriesSimple(sql, &reply, 2, rows) == 0) {
        for (int32_t r = 0; r < rows && static_cast<size_t>(r) < kMaxDistributionRows; ++r) {
            int64_t v[2] = {};
            if (reply.readInt64(&v[0]) != android::NO_ERROR ||
                reply.readInt64(&v[1]) != android::NO_ERROR) {
                break;
            }
            Parcel element;
            DataUploader::formIntData(0, v[0], element);
            DataUploader::formIntData(1, v[1], element);
            DataUploader::formClassArray(12, kClassIdle, element, out);
        }
    }
    return setEventData(EVENT_DAILY_SYSTEM, out, true);
}

int32_t CpuHandler::onHourlyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    if (uploadPeriod(EVENT_HOURLY_COMPONENTS, end, kHourMs, ratio) < 0) {
        KLOGE("Failed to set cpu component hourly upload data");
    }
    voteCandidate(end, kCandidateHourlyUpload, mElector);
    return 0;
}

int32_t CpuHandler::onDailyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    if (uploadPeriod(EVENT_DAILY_COMPONENTS, end, kDayMs, ratio) < 0) {
        KLOGE("Failed to set cpu component daily upload data");
    }
    if (uploadDistributions(end) < 0) {
        KLOGE("Failed to set cpu statistics upload data");
    }
    voteCandidate(end, kCandidateDailyUpload, mElector);
    return 0;
}

int32_t CpuHandler::onDawnUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    if (uploadPeriod(EVENT_DAILY_COMPONENTS, end, kDawnMs, ratio) < 0) {
        KLOGE("Failed to set cpu component dawn upload data");
    }
    voteCandidate(end, kCandidateDawnUpload, mElector);
    return 0;
}

}  // namespace kelvo
