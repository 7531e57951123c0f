// One brightness message of the display handler without a screen change:
// its parse, the level handed to the backlight accounter and the span row
// queued for storage, run to its end on the handler's thread. The median of
// many messages alternating between two levels.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "handlers/components/DisplayHandler.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kMessages = 2000;
constexpr int64_t kStart = 1796515200000LL;  // 2026-12-06 00:00:00 UTC

int32_t brightness(const sp<kelvo::DisplayHandler>& handler, int64_t time, int32_t level) {
    Parcel body;
    body.writeInt64(time);
    body.writeCString(("brightness=" + std::to_string(level)).c_str());
    return handler->sendMessageSync(
        kelvo::ParcelMessage(kelvo::MESSAGE_LOGGER, kelvo::DisplayHandler::TAG_BRIGHTNESS, body));
}

void BM_DisplayBrightnessMessage(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    char tmpl[] = "/tmp/kelvo-bench-display-XXXXXX";
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
    kelvo::WallClock::setFixedTimeMs(kStart);
    kelvo::DisplayHandler::setForegroundNotificationDelayMs(0);

    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<kelvo::DisplayHandler> handler = new kelvo::DisplayHandler();
    failed |= handler->earlyInitialize() != 0;
    handler->addSchemaTable();
    failed |= storage->startConnection() != 0;
    // The screen goes on once, before the clock starts.
    int64_t time = kStart + 1000;
    failed |= brightness(handler, time, 120) < 0;

    std::vector<double> us;
    for (auto _ : state) {
        for (int i = 0; i < kMessages && !failed; ++i) {
            time += 1000;
            Clock::time_point start = Clock::now();
            failed |= brightness(handler, time, 100 + i % 2) < 0;
            us.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
        }
    }
    handler->requestThreadExit();
    handler->join();
    handler.clear();
    kelvo::StorageOperator::forceFlushEntries();
    storage->closeConnection();
    kelvo::DisplayHandler::setForegroundNotificationDelayMs(-1);
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::WallClock::setFixedTimeMs(-1);
    kelvo::RootPath::setRoot(savedRoot.c_str());
    kelvo::XmlParser::resetInstance();
    cmd = "rm -rf '" + root + "'";
    if (system(cmd.c_str()) != 0 || failed || us.empty()) {
        state.SkipWithError("a brightness message failed");
        return;
    }
    std::sort(us.begin(), us.end());
    state.counters["display_brightness_msg_us"] = us[us.size() / 2];
}
BENCHMARK(BM_DisplayBrightnessMessage)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
