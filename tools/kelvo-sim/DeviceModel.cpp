#include "DeviceModel.h"

#include <string.h>

#include <algorithm>

namespace kelvo {
namespace sim {

namespace {

constexpr size_t kRecordBytes = 65;
constexpr size_t kNameBytes = 48;
// Idle time goes a quarter to the shallow state, the rest to the deep one.
constexpr int32_t kIdleStates = 2;

bool isAppUid(int32_t uid) {
    int32_t app = uid % 100000;
    return app >= 10000 && app <= 19999;
}

// Kernel threads of these uids are accounted under their name's prefix.
std::string uniformThreadName(int32_t uid, const std::string& name) {
    static const char* const kSystem[] = {"system_server_Binder",    "system_server_HwBinder",
                                          "system_server_Thread",    "system_server_pool",
                                          "system_server_AsyncTask", "system_server_SyncHandler",
                                          "system_server_Timer"};
    static const char* const kKernel[] = {"kernel_kworker", "kernel_watchdog", "kernel_migration",
                                          "kernel_ksoftirqd", "kernel_jbd2/sdd"};
    if (uid == 1000) {
        for (const char* prefix : kSystem) {
            if (name.compare(0, strlen(prefix), prefix) == 0) {
                return prefix;
            }
        }
    } else if (uid == 0) {
        for (const char* prefix : kKernel) {
            if (name.compare(0, strlen(prefix), prefix) == 0) {
                return prefix;
            }
        }
    }
    return name;
}

void putLe(std::string* out, uint64_t value, int bytes) {
    for (int i = 0; i < bytes; ++i) {
        out->push_back(static_cast<char>((value >> (8 * i)) & 0xFF));
    }
}

}  // namespace

DeviceModel::DeviceModel(const Scenario& scenario) : mScenario(scenario) {
    for (const Scenario::Process& process : scenario.processes()) {
        ProcessState state;
        state.process = &process;
        mProcesses[process.pid] = state;
    }
    int32_t core = 0;
    for (int32_t i = 0; i < Scenario::kClusterCount; ++i) {
        ClusterState cluster;
        for (int32_t c = 0; c < Scenario::clusterCores(i); ++c) {
            cluster.cores.push_back(core++);
            cluster.idleUs.push_back(std::vector<uint64_t>(kIdleStates, 0));
        }
        cluster.frequencies = Scenario::clusterFrequencies(i);
        cluster.ticks.assign(cluster.frequencies.size(), 0);
        mClusters.push_back(cluster);
    }
}

std::vector<CpuTree::Cluster> DeviceModel::clusters() const {
    std::vector<CpuTree::Cluster> out;
    for (const ClusterState& state : mClusters) {
        CpuTree::Cluster cluster;
        cluster.cores = state.cores;
        cluster.frequencies = state.frequencies;
        cluster.idleStates = kIdleStates;
        out.push_back(cluster);
    }
    return out;
}

void DeviceModel::setLoad(int32_t pid, int32_t cluster, int32_t percent, int32_t frequency) {
    auto it = mProcesses.find(pid);
    if (it == mProcesses.end() || cluster < 0 || cluster >= static_cast<int32_t>(mClusters.size())) {
        return;
    }
    if (percent <= 0) {
        it->second.loads.erase(cluster);
        return;
    }
    it->second.loads[cluster] = Load{percent, frequency};
}

void DeviceModel::advance(int64_t ms) {
    if (ms <= 0) {
        return;
    }
    std::vector<int64_t> busyPercent(mClusters.size(), 0);
    std::vector<int32_t> frequency(mClusters.size(), 0);
    for (auto& entry : mProcesses) {
        ProcessState& state = entry.second;
        int64_t percent = 0;
        for (const auto& load : state.loads) {
            percent += load.second.percent;
            busyPercent[load.first] += load.second.percent;
            const std::vector<int32_t>& steps = mClusters[load.first].frequencies;
            int32_t wanted = load.second.frequency != 0 ? load.second.frequency : steps.back();
            frequency[load.first] = std::max(frequency[load.first], wanted);
        }
        // percent x ms / 100 is ms of CPU; a tick is 10 ms.
        state.carry += percent * ms;
        state.ticks += state.carry / (100 * kTickMs);
        state.carry %= 100 * kTickMs;
    }
    for (size_t i = 0; i < mClusters.size(); ++i) {
        ClusterState& cluster = mClusters[i];
        size_t step = 0;
        if (frequency[i] != 0) {
            step = std::find(cluster.frequencies.begin(), cluster.frequencies.end(), frequency[i]) -
                   cluster.frequencies.begin();
            step = std::min(step, cluster.frequencies.size() - 1);
        }
        cluster.carryMs += ms;
        cluster.ticks[step] += cluster.carryMs / kTickMs;
        cluster.carryMs %= kTickMs;
        int64_t cores = static_cast<int64_t>(cluster.cores.size());
        int64_t busyUs = std::min(busyPercent[i] * ms * 10, cores * ms * 1000);
        int64_t idlePerCoreUs = ms * 1000 - busyUs / cores;
        for (std::vector<uint64_t>& states : cluster.idleUs) {
            int64_t shallow = idlePerCoreUs / 4;
            states[0] += shallow;
            states[1] += idlePerCoreUs - shallow;
        }
    }
}

bool DeviceModel::writeCounters(CpuTree* tree) {
    bool ok = true;
    for (size_t i = 0; i < mClusters.size(); ++i) {
        const ClusterState& cluster = mClusters[i];
        ok = tree->setClusterTicks(i, cluster.ticks) && ok;
        for (size_t c = 0; c < cluster.cores.size(); ++c) {
            for (int32_t s = 0; s < kIdleStates; ++s) {
                ok = tree->setIdleTime(cluster.cores[c], s, cluster.idleUs[c][s]) && ok;
            }
        }
    }
    std::map<int32_t, uint64_t> uidUs;
    for (const auto& entry : mProcesses) {
        uidUs[entry.second.process->uid] += static_cast<uint64_t>(entry.second.ticks) * 10000;
    }
    std::vector<CpuTree::UidTime> times;
    for (const auto& entry : uidUs) {
        // Roughly two thirds in user mode; the sum is what counts.
        uint64_t user = entry.second / 3 * 2;
        times.push_back(
            CpuTree::UidTime{static_cast<uint32_t>(entry.first), user, entry.second - user});
    }
    if (tree->setUidTimes(times)) {
        mWrittenUidUs = uidUs;
    } else {
        ok = false;
    }
    return ok;
}

std::string DeviceModel::processRecords() {
    std::string out;
    out.reserve(mProcesses.size() * kRecordBytes);
    for (auto& entry : mProcesses) {
        ProcessState& state = entry.second;
        const Scenario::Process& process = *state.process;
        putLe(&out, static_cast<uint32_t>(process.uid), 4);
        putLe(&out, static_cast<uint32_t>(process.pid), 4);
        putLe(&out, static_cast<uint64_t>(state.ticks) * 10000, 8);
        out.push_back(static_cast<char>(process.nameType));
        char name[kNameBytes] = {};
        memcpy(name, process.name.data(), std::min(process.name.size(), kNameBytes - 1));
        out.append(name, kNameBytes);
        state.reportedTicks = state.ticks;
    }
    return out;
}

bool DeviceModel::singlePackageApp(int32_t uid) const {
    const Scenario::App* app = mScenario.findApp(uid);
    return isAppUid(uid) && app != nullptr && app->packages.size() == 1;
}

std::string DeviceModel::accountedName(const Scenario::Process& process) const {
    const Scenario::App* app = mScenario.findApp(process.uid);
    if (singlePackageApp(process.uid)) {
        return app->packages[0];
    }
    if (process.nameType == 2) {
        return uniformThreadName(process.uid, process.name);
    }
    if (!process.package.empty()) {
        return process.package;
    }
    if (isAppUid(process.uid) && app != nullptr && app->packages.size() > 1) {
        return app->packages[0] + "-" + process.name;
    }
    return process.name;
}

std::map<std::string, int64_t> DeviceModel::seenMs() const {
    std::map<std::string, int64_t> seen;
    for (const auto& entry : mProcesses) {
        const Scenario::Process& process = *entry.second.process;
        std::string name = accountedName(process);
        if (singlePackageApp(process.uid)) {
            auto written = mWrittenUidUs.find(process.uid);
            seen[name] = written == mWrittenUidUs.end() ? 0 : written->second / 1000;
        } else {
            seen[name] += entry.second.reportedTicks * kTickMs;
        }
    }
    return seen;
}

std::map<std::string, int32_t> DeviceModel::nameUids() const {
    std::map<std::string, int32_t> uids;
    for (const auto& entry : mProcesses) {
        uids[accountedName(*entry.second.process)] = entry.second.process->uid;
    }
    return uids;
}

int64_t DeviceModel::totalMs() const {
    int64_t total = 0;
    for (const auto& entry : mProcesses) {
        total += entry.second.ticks * kTickMs;
    }
    return total;
}

}  // namespace sim
}  // namespace kelvo
