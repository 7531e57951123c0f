// One Wi-Fi poll's traffic collectors: the interface, system and package
// collectors over 300 uids x 2 counter sets on two interfaces and 100 system
// process lines, every counter growing between polls. Names come from a
// cache, as they do once the package properties know every uid.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <map>
#include <string>
#include <vector>

#include "core/KelvoAgent.h"
#include "handlers/components/TrafficCollector.h"
#include "kelvo/RootPath.h"
#include "storage/KelvoStorage.h"
#include "storage/StorageOperator.h"

namespace {

constexpr int kUids = 300;
constexpr int kProcesses = 100;
const char* const kInterfaces[] = {"wlan0", "wlan1"};

void writeFile(const std::string& path, const std::string& text) {
    std::ofstream(path + ".new", std::ios::trunc) << text;
    rename((path + ".new").c_str(), path.c_str());
}

void writeCounters(long long n) {
    std::string uids =
        "idx iface acct_tag_hex uid_tag_int cnt_set rx_bytes rx_packets tx_bytes tx_packets\n";
    std::string pids = "iface\tuid\tpid\tname\trx_bytes\ttx_bytes\trx_packets\ttx_packets\n";
    std::string ifaces;
    int index = 2;
    for (const char* iface : kInterfaces) {
        for (int uid = 10000; uid < 10000 + kUids; ++uid) {
            for (int set = 0; set < 2; ++set) {
                uids += std::to_string(index++) + " " + iface + " 0x0 " + std::to_string(uid) +
                        " " + std::to_string(set) + " " + std::to_string(n * 1500) + " " +
                        std::to_string(n) + " " + std::to_string(n * 700) + " " +
                        std::to_string(n) + "\n";
            }
        }
        ifaces += std::string(iface) + " 1 0 0 0 0 " + std::to_string(n * 900000) + " " +
                  std::to_string(n * 600) + " " + std::to_string(n * 400000) + " " +
                  std::to_string(n * 600) + "\n";
    }
    for (int i = 0; i < kProcesses; ++i) {
        pids += std::string(kInterfaces[i % 2]) + "\t" + std::to_string(i % 2 ? 1000 : 0) + "\t" +
                std::to_string(500 + i) + "\t\t" + std::to_string(n * 300) + "\t" +
                std::to_string(n * 200) + "\t" + std::to_string(n) + "\t" + std::to_string(n) + "\n";
    }
    std::string root = kelvo::RootPath::root();
    writeFile(root + kelvo::TrafficReader::kUidStatsPath, uids);
    writeFile(root + kelvo::TrafficReader::kPidStatsPath, pids);
    writeFile(root + kelvo::TrafficReader::kInterfaceStatsPath, ifaces);
}

void BM_WifiPoll(benchmark::State& state) {
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    std::string root = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
    const std::string savedRoot = kelvo::RootPath::root();
    kelvo::RootPath::setRoot(root.c_str());
    std::string cmd =
        "mkdir -p '" + root + "/proc/net/xt_qtaguid' '" + root + "/proc/net/proc_netstat'";
    if (system(cmd.c_str()) != 0) {
        state.SkipWithError("cannot lay out the root");
        return;
    }
    android::sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    kelvo::StorageOperator::addSchema(kelvo::kRawWifiPackageTraffic);
    kelvo::StorageOperator::addSchema(kelvo::kRawWifiInterfaceTraffic);
    if (storage->startConnection() != 0) {
        state.SkipWithError("storage did not start");
        return;
    }
    std::map<int32_t, std::string> names;
    for (int uid = 10000; uid < 10000 + kUids; ++uid) {
        names[uid] = "com.bench.app" + std::to_string(uid);
    }
    int64_t actions = 0;
    long long n = 1;
    writeCounters(n);
    kelvo::TrafficCollector collector(
        kelvo::kWifiTrafficConfig, [&](const android::Parcel&) { return ++actions, 0; },
        [&](int32_t uid, std::string* name) {
            auto it = names.find(uid);
            if (it == names.end()) return -4;
            *name = it->second;
            return 0;
        },
        [](int32_t, int32_t pid, std::string* name) {
            *name = "system_process" + std::to_string(pid % 50);
            return 0;
        });
    collector.takeBaseline();
    uint64_t lookupsBefore = 0;
    std::vector<double> ms;
    int64_t polls = 0;
    for (auto _ : state) {
        state.PauseTiming();
        writeCounters(++n);
        lookupsBefore = collector.packageLookups() + collector.reader().nameLookups();
        state.ResumeTiming();
        auto start = std::chrono::steady_clock::now();
        collector.collectInterfaces(n);
        collector.collectSystem(n, "com.bench.app10000");
        collector.collectPackages(n);
        ms.push_back(
            std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start)
                .count());
        ++polls;
    }
    uint64_t lookups = collector.packageLookups() + collector.reader().nameLookups();
    std::sort(ms.begin(), ms.end());
    state.counters["wifi_poll_ms"] = ms.empty() ? 0 : ms[ms.size() / 2];
    state.counters["wifi_poll_package_lookups"] = static_cast<double>(lookups - lookupsBefore);
    kelvo::StorageOperator::forceFlushEntries();
    storage->closeConnection();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    cmd = "rm -rf '" + root + "'";
    if (root.rfind("/tmp/kelvo-bench-", 0) == 0 && system(cmd.c_str()) != 0) {
        state.SkipWithError("could not remove the bench root");
    }
    benchmark::DoNotOptimize(actions + polls);
}
BENCHMARK(BM_WifiPoll)->Iterations(30)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
