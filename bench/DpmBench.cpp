// One DPM read: a data poll reads the 58 blocks of the extended IP set and
// the 4 DDR bandwidth levels from the fake kernel driver over its socket,
// hands the 62 records to the accounter, queues the 62 rows it answers and
// resets the statistics, run to its end on the handler's thread. The median
// of many polls.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "FakeKernelDriver.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/DpmHandler.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "routines/PollingPayload.h"
#include "utils/XmlParser.h"
#include "utils/devices/DpmIpNames.h"

using android::Parcel;
using android::sp;

namespace {

using Clock = std::chrono::steady_clock;
using Driver = kelvo::fake::FakeKernelDriver;

constexpr int kPolls = 500;
constexpr int64_t kStart = 1796515200000LL;  // 2026-12-06 00:00:00 UTC

void BM_DpmRead(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    char tmpl[] = "/tmp/kelvo-bench-dpm-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        state.SkipWithError("no root");
        return;
    }
    const std::string root = tmpl;
    kelvo::RootPath::setRoot(root.c_str());
    std::string cmd = "mkdir -p '" + root + "/data/misc/kelvo' && cp '" KELVO_SAMPLE_CONFIG "' '" +
                      root + "/data/misc/kelvo/tv_kelvo_config.xml'";
    bool failed = system(cmd.c_str()) != 0;
    kelvo::XmlParser::resetInstance();
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::KelvoLibAgent::getInstance()->start(0);
    kelvo::WallClock::setFixedTimeMs(kStart);
    Driver driver;
    failed |= !driver.start();
    failed |= !driver.useIpNames(2);

    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<kelvo::DpmHandler> handler = new kelvo::DpmHandler();
    failed |= handler->earlyInitialize() != 0;
    handler->addSchemaTable();
    failed |= storage->startConnection() != 0;
    handler->initialize();
    int64_t time = kStart;
    std::vector<double> us;
    for (auto _ : state) {
        for (int i = 0; i <= kPolls && !failed; ++i) {
            for (const kelvo::dpm_ip_name& ip : kelvo::kDpmPolicy2Ips) {
                driver.addIpTime(ip.name, Driver::DPM_BUSY, 300 + i);
                driver.addIpTime(ip.name, Driver::DPM_IDLE, 700);
            }
            for (int32_t level = 0; level < 4; ++level) {
                driver.addDdr(level, 1, 1200 + level * 300);
            }
            time += 1000;
            kelvo::PollingPayload poll;
            poll.time = time;
            Parcel body;
            poll.writeTo(body);
            Clock::time_point start = Clock::now();
            failed |= handler->sendMessageSync(kelvo::ParcelMessage(
                          kelvo::MESSAGE_NOTIFICATION, kelvo::NOTIFICATION_DATA_POLLING, body)) < 0;
            // The first read only sets the DDR baselines: 58 records.
            if (i > 0) {
                us.push_back(
                    std::chrono::duration<double, std::micro>(Clock::now() - start).count());
            }
            failed |= driver.state().ips[1].times[Driver::DPM_BUSY] != 0;  // reset
        }
    }
    handler->readyToDestroy();
    handler->requestThreadExit();
    handler->join();
    handler.clear();
    kelvo::StorageOperator::forceFlushEntries();
    storage->closeConnection();
    driver.stop();
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::WallClock::setFixedTimeMs(-1);
    kelvo::RootPath::setRoot(savedRoot.c_str());
    kelvo::XmlParser::resetInstance();
    cmd = "rm -rf '" + root + "'";
    if (system(cmd.c_str()) != 0 || failed || us.empty()) {
        state.SkipWithError("a dpm read failed");
        return;
    }
    std::sort(us.begin(), us.end());
    state.counters["dpm_read_us"] = us[us.size() / 2];
}
BENCHMARK(BM_DpmRead)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
