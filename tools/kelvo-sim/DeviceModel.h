#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <utility>
#include <vector>

#include "CpuTree.h"
#include "Scenario.h"

namespace kelvo {
namespace sim {

// The simulated phone's CPU: what each process has run, each cluster's
// frequency residency and each core's idle time, advanced in simulated
// milliseconds as the scenario's load says. CPU time moves in whole clock
// ticks (10 ms), as the kernel counts it; fractions carry over.
class DeviceModel {
public:
    static constexpr int64_t kTickMs = 10;

    explicit DeviceModel(const Scenario& scenario);

    // The clusters as the counter tree lays them out.
    std::vector<CpuTree::Cluster> clusters() const;

    // From now on the process uses percent of one core of the cluster at the
    // frequency (kHz; 0: the cluster's highest step). 0 % ends the load.
    void setLoad(int32_t pid, int32_t cluster, int32_t percent, int32_t frequency);
    void advance(int64_t ms);
    // Rewrites every counter file; false when one could not be written.
    bool writeCounters(CpuTree* tree);

    // The per-process report's records (65 bytes each: uid, pid, CPU time in
    // µs, name type, 48-byte name) of every declared process, as of now.
    // Remembers what was reported for the truth.
    std::string processRecords();
    int32_t processCount() const { return static_cast<int32_t>(mProcesses.size()); }

    // The name under which the daemon is expected to account a process.
    std::string accountedName(const Scenario::Process& process) const;
    // CPU time (ms) per accounted name as the daemon could see it at the last
    // report: the uid counter as last written for single-package apps, the
    // reported process times for the others.
    std::map<std::string, int64_t> seenMs() const;
    // The uid of each accounted name.
    std::map<std::string, int32_t> nameUids() const;

    // Total CPU time given so far, ms.
    int64_t totalMs() const;

private:
    struct Load {
        int32_t percent = 0;
        int32_t frequency = 0;
    };
    struct ProcessState {
        const Scenario::Process* process;
        int64_t ticks = 0;
        int64_t carry = 0;  // percent x ms not yet a whole tick
        int64_t reportedTicks = 0;
        std::map<int32_t, Load> loads;  // by cluster
    };
    struct ClusterState {
        std::vector<int32_t> cores;
        std::vector<int32_t> frequencies;
        std::vector<uint64_t> ticks;  // residency per step
        int64_t carryMs = 0;
        std::vector<std::vector<uint64_t>> idleUs;  // per core, per state
    };

    bool singlePackageApp(int32_t uid) const;

    const Scenario& mScenario;
    std::map<int32_t, ProcessState> mProcesses;  // by pid
    std::vector<ClusterState> mClusters;
    std::map<int32_t, uint64_t> mWrittenUidUs;
};

}  // namespace sim
}  // namespace kelvo
