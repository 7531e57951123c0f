// One system resume over 256 enabled sensors of the sensor handler: every
// sensor stopped at the suspend and started again at the resume through the
// sensor accounter, run to its end on the handler's thread. The median of
// many resumes.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "handlers/components/SensorHandler.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kSensors = 256;
constexpr int kResumes = 200;
constexpr int64_t kStart = 1796515200000LL;  // 2026-12-06 00:00:00 UTC

void BM_SensorRevise(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    char tmpl[] = "/tmp/kelvo-bench-sensor-XXXXXX";
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

    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<kelvo::SensorHandler> handler = new kelvo::SensorHandler();
    failed |= handler->earlyInitialize() != 0;
    handler->addSchemaTable();
    failed |= storage->startConnection() != 0;
    // The accounter's records come back to the handler and are stored.
    handler->initialize();
    // 64 applications with four sensor types each, enabled before the clock
    // starts.
    int64_t time = kStart + 1000;
    for (int i = 0; i < kSensors && !failed; ++i) {
        Parcel body;
        body.writeInt64(time);
        std::string text = "uid=" + std::to_string(10000 + i / 4) + " name=com.bench.app" +
                           std::to_string(i / 4) + " type=" + std::to_string(1 + i % 4) +
                           " connection=c" + std::to_string(i);
        body.writeCString(text.c_str());
        failed |= handler->sendMessageSync(kelvo::ParcelMessage(
                      kelvo::MESSAGE_LOGGER, kelvo::SensorHandler::TAG_SENSOR_ENABLE, body)) < 0;
    }
    std::vector<double> ms;
    for (auto _ : state) {
        for (int i = 0; i < kResumes && !failed; ++i) {
            Parcel sleep;
            sleep.writeInt64(time + 1000);
            sleep.writeInt64(time + 61000);
            time += 62000;
            Clock::time_point start = Clock::now();
            failed |=
                handler->sendMessageSync(kelvo::ParcelMessage(
                    kelvo::MESSAGE_CUSTOMIZED, kelvo::SensorHandler::kSystemResume, sleep)) < 0;
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - start).count());
        }
    }
    handler->readyToDestroy();
    handler->requestThreadExit();
    handler->join();
    handler.clear();
    kelvo::StorageOperator::forceFlushEntries();
    storage->closeConnection();
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::WallClock::setFixedTimeMs(-1);
    kelvo::RootPath::setRoot(savedRoot.c_str());
    kelvo::XmlParser::resetInstance();
    cmd = "rm -rf '" + root + "'";
    if (system(cmd.c_str()) != 0 || failed || ms.empty()) {
        state.SkipWithError("a sensor message failed");
        return;
    }
    std::sort(ms.begin(), ms.end());
    state.counters["sensor_revise_ms"] = ms[ms.size() / 2];
}
BENCHMARK(BM_SensorRevise)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
