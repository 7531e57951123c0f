// One GPU reading: a data poll with the screen on reads the residency of 20
// frequency steps from the fake kernel driver over its socket, hands it to
// the accounter (SetValue, then the balance) and queues the 20 rows, run to
// its end on the handler's thread. The median of many polls.

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
#include "handlers/components/GpuHandler.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "routines/PollingPayload.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kPolls = 1000;
constexpr int64_t kStart = 1796515200000LL;  // 2026-12-06 00:00:00 UTC

int32_t notify(const sp<kelvo::GpuHandler>& handler, int32_t type, const Parcel& body) {
    return handler->sendMessageSync(kelvo::ParcelMessage(kelvo::MESSAGE_NOTIFICATION, type, body));
}

void BM_GpuReading(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    char tmpl[] = "/tmp/kelvo-bench-gpu-XXXXXX";
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
    kelvo::fake::FakeKernelDriver driver;
    failed |= !driver.start();

    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<kelvo::GpuHandler> handler = new kelvo::GpuHandler();
    failed |= handler->earlyInitialize() != 0;
    handler->addSchemaTable();
    failed |= storage->startConnection() != 0;
    int64_t time = kStart + 1000;
    Parcel screen;
    screen.writeInt64(time);
    screen.writeBool(true);
    failed |= notify(handler, kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, screen) < 0;
    Parcel front;
    front.writeInt64(time);
    front.writeString8(android::String8("com.bench.game"));
    failed |= notify(handler, kelvo::NOTIFICATION_FOREGROUND_CHANGED, front) < 0;

    std::vector<double> us;
    for (auto _ : state) {
        for (int i = 0; i < kPolls && !failed; ++i) {
            for (int32_t step = 0; step < 20; ++step) {
                driver.addGpuResidency(200000000 + step * 30000000LL, 1000 + i, 2000);
            }
            time += 1000;
            kelvo::PollingPayload poll;
            poll.time = time;
            Parcel body;
            poll.writeTo(body);
            Clock::time_point start = Clock::now();
            failed |= notify(handler, kelvo::NOTIFICATION_DATA_POLLING, body) < 0;
            us.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
            failed |= !driver.state().gpuSteps.empty();
        }
    }
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
        state.SkipWithError("a gpu reading failed");
        return;
    }
    std::sort(us.begin(), us.end());
    state.counters["gpu_reading_us"] = us[us.size() / 2];
}
BENCHMARK(BM_GpuReading)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
