// One sampled battery event: a screen change read by the battery handler,
// its gauge read from the power-supply file and the span and state rows
// queued for storage, run to its end on the handler's thread. The median of
// many events alternating the screen.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "BatteryModel.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "handlers/components/BatteryHandler.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"

using android::Parcel;
using android::sp;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kEvents = 2000;
constexpr int64_t kStart = 1796515200000LL;  // 2026-12-06 00:00:00 UTC

int32_t notify(const sp<kelvo::BatteryHandler>& handler, int32_t type, const Parcel& body) {
    return handler->sendMessageSync(kelvo::ParcelMessage(kelvo::MESSAGE_NOTIFICATION, type, body));
}

void BM_BatteryEvent(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    char tmpl[] = "/tmp/kelvo-bench-battery-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        state.SkipWithError("no root");
        return;
    }
    const std::string root = tmpl;
    kelvo::RootPath::setRoot(root.c_str());
    kelvo::WallClock::setFixedTimeMs(kStart);
    bool failed = !kelvo::BatteryModel(root, kelvo::BatteryModel::Config()).writeFiles();

    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<kelvo::BatteryHandler> handler = new kelvo::BatteryHandler();
    failed |= handler->earlyInitialize() != 0;
    handler->addSchemaTable();
    failed |= storage->startConnection() != 0;
    // The platform's first report, before the clock starts: spans from here.
    int64_t time = kStart + 1000;
    Parcel level;
    level.writeInt64(time);
    level.writeInt32(50);
    level.writeInt32(3800);
    level.writeInt32(250);
    failed |= notify(handler, kelvo::NOTIFICATION_BATTERY_LEVEL_CHANGED, level) < 0;

    std::vector<double> us;
    for (auto _ : state) {
        for (int i = 0; i < kEvents && !failed; ++i) {
            time += 1000;
            Parcel screen;
            screen.writeInt64(time);
            screen.writeBool(i % 2 == 0);
            Clock::time_point start = Clock::now();
            failed |= notify(handler, kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, screen) < 0;
            us.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
        }
    }
    handler->requestThreadExit();
    handler->join();
    handler.clear();
    kelvo::StorageOperator::forceFlushEntries();
    storage->closeConnection();
    kelvo::WallClock::setFixedTimeMs(-1);
    kelvo::RootPath::setRoot(savedRoot.c_str());
    std::string cmd = "rm -rf '" + root + "'";
    if (system(cmd.c_str()) != 0 || failed || us.empty()) {
        state.SkipWithError("a battery event failed");
        return;
    }
    std::sort(us.begin(), us.end());
    state.counters["battery_event_us"] = us[us.size() / 2];
}
BENCHMARK(BM_BatteryEvent)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
