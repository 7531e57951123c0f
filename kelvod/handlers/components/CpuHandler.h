#pragma once

#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/String8.h>

#include <atomic>
#include <deque>
#include <map>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "core/KelvoOperator.h"
#include "handlers/components/CpuReport.h"

namespace kelvo {

// Owns the CPU accounter. A sampling pass reads three kernel counter sets
// (per-uid CPU time, per-core idle time, per-cluster frequency residency),
// attributes the CPU time to packages (down to processes and kernel threads
// where a uid hosts several packages, from the kernel's per-process report),
// hands the deltas to the accounter, stores what comes back, keeps hourly
// per-package totals and uploads CPU statistics hourly, daily and at dawn.
//
// A pass starts from a foreground change or a data poll: the handler asks the
// kernel for the per-process report, which arrives later as a buffered-log
// entry and completes the pass. When the report does not come, a watchdog
// runs the pass from the uid counters alone.
class CpuHandler : public KelvoOperator {
public:
    static constexpr uint32_t kElector = 0x100;
    // Buffered-log sender and entry type of the per-process report.
    static constexpr const char* kDriverName = "kelvo_driver";
    static constexpr int32_t kReportMagic = 0;
    // Pass modes (echoed by the kernel with its report).
    enum pass_mode : int32_t {
        MODE_FOREGROUND = 0,
        MODE_POLL = 1,
        MODE_HOURLY = 2,
        MODE_TIME_CHANGED = 3,
        MODE_CHARGER_ON = 4,
        MODE_CHARGER_OFF = 5,
    };
    // A periodic poll closer than this to the last request is ignored.
    static constexpr int64_t kMinPollIntervalMs = 300000;
    // At most this often (elapsed clock) background use goes to the
    // abnormality routine.
    static constexpr int64_t kBackgroundReportMs = 300000;
    // A process unseen this long, or a uid with nothing left, is forgotten.
    static constexpr int64_t kBaselineAgeMs = 24 * 3600 * 1000LL;
    // Most processes and uids followed at once; more are counted and skipped.
    static constexpr size_t kMaxPids = 32768;
    static constexpr size_t kMaxUids = 8192;
    // Most pass requests waiting for their report.
    static constexpr size_t kMaxPending = 64;
    static constexpr int64_t kDefaultReportWaitMs = 3000;

    CpuHandler();
    ~CpuHandler() override;

    // How long a pass waits for the kernel's report (tests shorten it).
    static void setReportWaitMs(int64_t ms);
    // The clock-tick rate of handlers created afterwards; 0 takes the
    // system's (100 when it cannot be read). Tests use rates that do not
    // divide 1000.
    static void setClockHz(int64_t hz);

    void setupListeners(android::Parcel& out) override;
    void setCandidateElector() override;
    int32_t checkEnable() override;
    void addSchemaTable() override;
    void cleanTables(int64_t time) override;

    int32_t onForegroundChanged(const android::Parcel& data) override;
    int32_t onDataPolling(const android::Parcel& data) override;
    int32_t onUidRemoved(const android::Parcel& data) override;
    int32_t onPackageRemoved(const android::Parcel& data) override;
    int32_t onPackageAdded(const android::Parcel& data) override;
    int32_t onHourlyUploading(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t onDawnUploading(const android::Parcel& data) override;
    int32_t logComponentAccounting(int64_t time) override;
    int32_t handleBufferedLog(const android::Parcel& data) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t handleApplicationResult(const android::Parcel& data) override;
    int32_t handleComponentResult(const android::Parcel& data) override;
    int32_t handleParcelMessage(const ParcelMessage& msg) override;

    static const table_attribute& rawFrequencyTable();
    static const table_attribute& rawIdleTable();
    static const table_attribute& rawComponentTable();
    static const table_attribute& hourlyComponentTable();
    static const table_attribute& rawApplicationsTable();
    static const table_attribute& hourlyApplicationsTable();

private:
    // One counter of the kernel: its last reading, once there is one.
    struct counter {
        int64_t value = 0;
        bool known = false;
        // The delta to a new reading; the first reading is the baseline (0),
        // a reading below the last one a reset (the new value).
        int64_t advance(int64_t reading);
    };
    struct freq_step {
        int32_t frequency = 0;  // kHz; 0 until the first reading
        counter time;           // ms
    };
    struct cluster_info {
        int32_t index = 0;
        std::vector<int32_t> cores;
        int32_t idleStates = 0;
        // Per core position and state (position * idleStates + state), ms.
        std::vector<counter> idle;
        std::vector<freq_step> steps;
        bool extraLinesLogged = false;
        // The deltas of the pass being built.
        int64_t idleDelta = 0;
        std::vector<int64_t> stepDeltas;
    };
    struct package_entry {
        bool removed = false;
        int64_t passTime = 0;  // ms waiting for the next accepted pass
        // Hourly sums: foreground, background, screen on, screen off.
        int64_t hourTime[4] = {0, 0, 0, 0};
        int64_t hourEnergy[4] = {0, 0, 0, 0};
        // Background use since the last background report (charging included).
        int64_t backgroundTime = 0;
        int64_t backgroundEnergy = 0;
        std::set<int32_t> pids;
    };
    struct uid_entry {
        bool removed = false;
        // The packages the package service listed (and packages added since).
        std::set<std::string> listed;
        std::map<std::string, package_entry> packages;
        int64_t lastSeen = 0;  // elapsed ms
    };
    // A process's baseline; kept apart from the uid entries, which the
    // hourly clean-up may drop while the process still runs.
    struct pid_entry {
        uint32_t uid = 0;
        int64_t lastTime = 0;  // ms
        int64_t lastSeen = 0;  // elapsed ms
        bool kernelThread = false;
        std::string name;
        std::vector<std::string> packages;  // from the activity manager
    };
    // A pass whose report is awaited.
    struct pending_pass {
        uint32_t id = 0;
        int64_t time = 0;
        int32_t mode = 0;
        int64_t newTime = 0;  // MODE_TIME_CHANGED: the clock after the change
    };
    // The readings of one pass, committed only when all three succeeded.
    struct uid_reading {
        uint32_t uid;
        int64_t ms;
    };

    // Cluster discovery (once it succeeded, only again after it failed).
    int32_t checkCpuConfigs();
    int32_t readClusterConfig(int32_t core, std::map<std::string, cluster_info>& clusters,
                              int32_t* nextIndex);

    // Trigger side.
    int32_t requestPass(int64_t time, int32_t mode, int64_t newTime, bool runOnFailure);
    void resolvePendingBefore(uint32_t id);
    void onReportWaitExpired(uint32_t id);

    // The pass: reads, attribution, the accounter, then the mode's follow-up.
    int32_t updateCpuInfo(int64_t time, int32_t mode, int64_t newTime);
    int32_t readUidTimes(std::vector<uid_reading>* out);
    // Per cluster, per core and state (core position * states + state): ms,
    // or -1 for a file that could not be read.
    int32_t readIdleTimes(std::vector<std::vector<int64_t>>* out);
    // Per cluster, (kHz, ms) per step; empty when no core's table opened.
    int32_t readFrequencyTimes(std::vector<std::vector<std::pair<int32_t, int64_t>>>* out);
    void commitReadings(int64_t time, const std::vector<uid_reading>& uids,
                        const std::vector<std::vector<int64_t>>& idle,
                        const std::vector<std::vector<std::pair<int32_t, int64_t>>>& freqs);
    int32_t sendSetValue(int64_t time, int32_t mode, bool hasData);
    void writeClusterData(android::Parcel& action);
    int32_t logPackageAccounting(int64_t time);
    void sendBackgroundReport();
    void ageEntries();

    // Attribution.
    bool accounting() const { return !mFirstSample && mConfigsReady; }
    uid_entry* findOrCreateUid(uint32_t uid);
    package_entry& packageOf(uid_entry& entry, const std::string& name);
    bool isSinglePackageApp(uint32_t uid, const uid_entry& entry) const;
    void setUidCpuTime(uint32_t uid, int64_t ms);
    void setPidCpuTime(const CpuReport::Record& record, int64_t ms, bool attribute);
    void handleDeadPid(const CpuReport::Record& record, int64_t ms, bool attribute);
    void shareAmong(uid_entry& entry, const std::vector<std::string>& names, int64_t delta);
    std::string processName(const CpuReport::Record& record, pid_entry& pid);

    // Uploads.
    int32_t uploadComponent(int64_t end, int64_t window, float ratio, android::Parcel& out);
    int32_t uploadTopApplications(int64_t end, int64_t window, float ratio, android::Parcel& out);
    int32_t uploadDistributions(int64_t end);
    int32_t uploadPeriod(uint32_t event, int64_t end, int64_t window, float ratio);

    static uint64_t pidKey(uint32_t uid, int32_t pid) {
        return (static_cast<uint64_t>(uid) << 32) | static_cast<uint32_t>(pid);
    }

    int64_t mClockHz;
    bool mFirstSample;
    bool mConfigsReady;
    bool mPidCpuTimeEnabled;
    int64_t mLastRequestTime;
    int64_t mLastBackgroundReport;
    std::map<std::string, cluster_info> mClusters;
    // Clusters by index, into mClusters.
    std::vector<cluster_info*> mClusterOrder;
    std::map<uint32_t, uid_entry> mUids;
    // The last total of each uid listed by the uid counters.
    std::unordered_map<uint32_t, int64_t> mUidBaselines;
    std::unordered_map<uint64_t, pid_entry> mPids;
    std::deque<pending_pass> mPending;
    uint32_t mNextPendingId;
    // The component state of the last component result, for its rows.
    bool mScreenOn;
    bool mCharging;

    static std::atomic<int64_t> sReportWaitMs;
    static std::atomic<int64_t> sClockHz;
};

}  // namespace kelvo
