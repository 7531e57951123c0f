// One modem statistics block of 13 records (every decoded module and a PAM
// record) posted to the modem handler as the manager service posts it, and
// taken on the handler's thread through the decoders, the accounter, the
// traffic collectors over 300 uids x 2 counter sets on rmnet_data0 and the
// balance, up to the rows queued for the storage thread.

#include <benchmark/benchmark.h>
#include <binder/Parcel.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <map>
#include <string>
#include <vector>

#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "handlers/components/ModemHandler.h"
#include "kelvo/RootPath.h"
#include "storage/KelvoStorage.h"
#include "storage/StorageOperator.h"
#include "utils/XmlParser.h"

using android::Parcel;

namespace {

constexpr int kUids = 300;
// Record sizes of modules 0 to 11 in uint32 fields, then the PAM record.
const size_t kFields[] = {8, 21, 8, 12, 9, 13, 15, 19, 34, 38, 72, 5, 10};

void writeFile(const std::string& path, const std::string& text) {
    std::ofstream(path + ".new", std::ios::trunc) << text;
    rename((path + ".new").c_str(), path.c_str());
}

void writeCounters(long long n) {
    std::string uids =
        "idx iface acct_tag_hex uid_tag_int cnt_set rx_bytes rx_packets tx_bytes tx_packets\n";
    int index = 2;
    for (int uid = 10000; uid < 10000 + kUids; ++uid) {
        for (int set = 0; set < 2; ++set) {
            uids += std::to_string(index++) + " rmnet_data0 0x0 " + std::to_string(uid) + " " +
                    std::to_string(set) + " " + std::to_string(n * 1500) + " " + std::to_string(n) +
                    " " + std::to_string(n * 700) + " " + std::to_string(n) + "\n";
        }
    }
    const std::string root = kelvo::RootPath::root();
    writeFile(root + kelvo::TrafficReader::kUidStatsPath, uids);
    writeFile(root + kelvo::TrafficReader::kPidStatsPath,
              "iface\tuid\tpid\tname\trx_bytes\ttx_bytes\trx_packets\ttx_packets\n");
    writeFile(root + kelvo::TrafficReader::kInterfaceStatsPath,
              "rmnet_data0 1 0 0 0 0 " + std::to_string(n * 900000) + " " + std::to_string(n * 600) +
                  " " + std::to_string(n * 400000) + " " + std::to_string(n * 600) + "\n");
}

// The block: n, data length, then per record L, SIM, module and counters
// that leave every decoder something to send.
std::string block() {
    std::string body;
    auto put = [&body](uint32_t v) { body.append(reinterpret_cast<const char*>(&v), 4); };
    uint32_t module = 0;
    for (size_t fields : kFields) {
        put(static_cast<uint32_t>(4 * fields));
        put(0);
        const uint32_t id = module++;
        put(id);
        for (size_t i = 0; i < fields; ++i) {
            uint32_t value = static_cast<uint32_t>(1000 + 100 * i);
            if (id == 5) {
                // LTE physical layer: band 0, the active time within the
                // connected time and above the transmit and VoLTE times.
                value = i == 10 ? 0 : i == 7 ? (1u << 28) : i == 8 ? (1u << 27) : value << 12;
            }
            put(value);
        }
    }
    std::string out;
    const uint32_t head[2] = {static_cast<uint32_t>(sizeof(kFields) / sizeof(kFields[0])),
                              static_cast<uint32_t>(body.size())};
    out.append(reinterpret_cast<const char*>(head), sizeof(head));
    return out + body;
}

void BM_ModemBlock(benchmark::State& state) {
    char tmpl[] = "/tmp/kelvo-bench-modem-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        state.SkipWithError("no private root");
        return;
    }
    const std::string root = tmpl;
    const std::string savedRoot = kelvo::RootPath::root();
    kelvo::RootPath::setRoot(root.c_str());
    std::string cmd =
        "mkdir -p '" + root + "/proc/net/xt_qtaguid' '" + root + "/proc/net/proc_netstat' '" +
        root + "/sys/devices/platform/tervin_modem_pm_info' '" + root +
        "/data/misc/kelvo' && touch '" + root + kelvo::ModemHandler::kControlPath +
        "' && cp '" KELVO_SAMPLE_CONFIG "' '" + root + "/data/misc/kelvo/tv_kelvo_config.xml'";
    bool failed = system(cmd.c_str()) != 0;
    kelvo::XmlParser::resetInstance();
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::KelvoLibAgent::getInstance()->start(0);
    long long n = 1;
    writeCounters(n);
    std::map<int32_t, std::string> names;
    for (int uid = 10000; uid < 10000 + kUids; ++uid) {
        names[uid] = "com.bench.app" + std::to_string(uid);
    }
    android::sp<kelvo::ModemHandler> modem = new kelvo::ModemHandler(
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
    android::sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    modem->addSchemaTable();
    failed |= storage->startConnection() != 0;
    failed |= modem->earlyInitialize() != 0;
    modem->initialize();
    kelvo::KelvoAgent::getInstance()->setHandlerForTest(kelvo::HANDLER_MODEM, modem);
    const std::string bytes = block();
    std::vector<double> ms;
    for (auto _ : state) {
        state.PauseTiming();
        writeCounters(++n);
        Parcel parcel;
        parcel.writeInt32(static_cast<int32_t>(bytes.size()));
        parcel.write(bytes.data(), bytes.size());
        Parcel reply;
        state.ResumeTiming();
        auto start = std::chrono::steady_clock::now();
        failed |= kelvo::KelvoAgent::getInstance()->sendToHandler(
                      kelvo::HANDLER_MODEM, kelvo::ModemHandler::TAG_MODEM_BLOCK, parcel, &reply,
                      true) != 0;
        ms.push_back(
            std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start)
                .count());
    }
    kelvo::KelvoAgent::getInstance()->setHandlerForTest(kelvo::HANDLER_MODEM, nullptr);
    modem->readyToDestroy();
    modem->requestThreadExit();
    modem->join();
    kelvo::StorageOperator::forceFlushEntries();
    storage->closeConnection();
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::XmlParser::resetInstance();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    cmd = "rm -rf '" + root + "'";
    failed |= system(cmd.c_str()) != 0;
    if (failed || ms.empty()) {
        state.SkipWithError("a modem block failed");
        return;
    }
    std::sort(ms.begin(), ms.end());
    state.counters["modem_block_ms"] = ms[ms.size() / 2];
}
BENCHMARK(BM_ModemBlock)->Iterations(30)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
