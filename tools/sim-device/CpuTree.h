#pragma once

#include <stdint.h>

#include <string>
#include <utility>
#include <vector>

namespace kelvo {

// Writes the CPU counters of a simulated device below a root directory, in
// the layout the daemon reads:
//   sys/devices/system/cpu/possible                       "0-N"
//   sys/devices/system/cpu/cpuN/cpufreq/related_cpus      "0 1 2 3"
//   sys/devices/system/cpu/cpuN/cpufreq/scaling_available_frequencies
//   sys/devices/system/cpu/cpuN/cpufreq/stats/time_in_state  "kHz ticks" lines
//   sys/devices/system/cpu/cpuN/cpuidle/stateK/time        µs
//   proc/uid_cputime/show_uid_stat                         "uid: user_us system_us"
// Counter files are replaced whole (a temporary file renamed over the old
// one), so a reader never sees half a file. Used by tests and the simulator.
class CpuTree {
public:
    struct Cluster {
        std::vector<int32_t> cores;        // core numbers, ascending
        std::vector<int32_t> frequencies;  // kHz, ascending
        int32_t idleStates = 2;
    };
    struct UidTime {
        uint32_t uid;
        uint64_t userUs;
        uint64_t systemUs;
    };

    explicit CpuTree(std::string root) : mRoot(std::move(root)) {}

    // Two clusters of four cores, as the sample power profile has them:
    // 0-3 little with 8 steps, 4-7 big with 9 steps.
    static std::vector<Cluster> phoneClusters();

    // Lays out the clusters' folders and fixed files and zeroes every
    // counter. False with errno set when a file cannot be written.
    bool layout(const std::vector<Cluster>& clusters);

    // Residency of one core's policy in clock ticks, one value per frequency
    // of its cluster, in the cluster's order.
    bool setFrequencyTicks(int32_t core, const std::vector<uint64_t>& ticks);
    // The same residency for every core of a cluster (all share one policy).
    bool setClusterTicks(size_t cluster, const std::vector<uint64_t>& ticks);
    // Total time one core spent in an idle state, µs.
    bool setIdleTime(int32_t core, int32_t state, uint64_t us);
    // Rewrites the per-uid CPU times.
    bool setUidTimes(const std::vector<UidTime>& times);

    // Rewrites (atomically) or removes a file given relative to the root,
    // for cases the setters above do not shape.
    bool writeFile(const std::string& relative, const std::string& text) const;
    bool removeFile(const std::string& relative) const;

    // "sys/devices/system/cpu/cpuN/...": relative paths of the counters.
    static std::string timeInStatePath(int32_t core);
    static std::string idleTimePath(int32_t core, int32_t state);
    static std::string uidStatPath() { return "proc/uid_cputime/show_uid_stat"; }

    const std::vector<Cluster>& clusters() const { return mClusters; }
    const std::string& root() const { return mRoot; }

private:
    const Cluster* clusterOf(int32_t core) const;
    bool makeDirs(const std::string& relative) const;

    std::string mRoot;
    std::vector<Cluster> mClusters;
};

}  // namespace kelvo
