// One session start or stop message of the audio handler with 512 sessions
// held, 256 of them playing: its parse, the play row queued, the accounter's
// SetValue and Activate (or Deactivate and its record), the reference spans
// and the foreground match over the playing sessions, run to its end on the
// handler's thread. The median of many messages alternating start and stop.

#include <benchmark/benchmark.h>
#include <binder/ServiceControl.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "PlatformServices.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "handlers/components/AudioHandler.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "utils/PackageProperty.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using kelvo::AudioHandler;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kMessages = 2000;
constexpr int kSessions = 512;
constexpr int64_t kStart = 1796515200000LL;  // 2026-12-06 00:00:00 UTC

int32_t message(const sp<AudioHandler>& handler, int32_t tag, int64_t time,
                const std::string& text) {
    Parcel body;
    body.writeInt64(time);
    body.writeCString(text.c_str());
    return handler->sendMessageSync(kelvo::ParcelMessage(kelvo::MESSAGE_LOGGER, tag, body));
}

void BM_AudioSessionMessage(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    char tmpl[] = "/tmp/kelvo-bench-audio-XXXXXX";
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
    kelvo::ServiceControl::setServiceWaitMs(300);
    auto services = std::make_unique<kelvo::PlatformServices>();
    failed |= services->startAll() != android::NO_ERROR;
    for (int i = 0; i < 16; ++i) {
        services->state()->setPackages(10100 + i, {"com.bench.player" + std::to_string(i)});
        kelvo::PackageProperty::getInstance()->removeUid(10100 + i);
    }

    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<AudioHandler> handler = new AudioHandler();
    failed |= handler->earlyInitialize() != 0;
    handler->addSchemaTable();
    failed |= storage->startConnection() != 0;
    handler->initialize();
    int64_t time = kStart + 1000;
    for (int s = 0; s < kSessions && !failed; ++s) {
        failed |= message(handler, AudioHandler::TAG_AUDIO_SESSION_ACQUIRE, time,
                          "session=" + std::to_string(1000 + s) + " pid=" + std::to_string(s + 1) +
                              " uid=" + std::to_string(10100 + s % 16)) < 0;
        if (s % 2 == 1) {
            failed |= message(handler, AudioHandler::TAG_AUDIO_SESSION_START, time,
                              "session=" + std::to_string(1000 + s) +
                                  " stream=" + std::to_string(s % 12)) < 0;
        }
    }

    std::vector<double> us;
    for (auto _ : state) {
        for (int i = 0; i < kMessages && !failed; ++i) {
            time += 1000;
            const int32_t tag = i % 2 == 0 ? AudioHandler::TAG_AUDIO_SESSION_START
                                           : AudioHandler::TAG_AUDIO_SESSION_STOP;
            Clock::time_point start = Clock::now();
            failed |= message(handler, tag, time, "session=1000 stream=3") < 0;
            us.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
        }
    }
    handler->readyToDestroy();
    handler->requestThreadExit();
    handler->join();
    handler.clear();
    kelvo::StorageOperator::forceFlushEntries();
    storage->closeConnection();
    services.reset();
    kelvo::ServiceControl::setServiceWaitMs(kelvo::ServiceControl::kDefaultServiceWaitMs);
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::WallClock::setFixedTimeMs(-1);
    kelvo::RootPath::setRoot(savedRoot.c_str());
    kelvo::XmlParser::resetInstance();
    cmd = "rm -rf '" + root + "'";
    if (system(cmd.c_str()) != 0 || failed || us.empty()) {
        state.SkipWithError("an audio session message failed");
        return;
    }
    std::sort(us.begin(), us.end());
    state.counters["audio_session_msg_us"] = us[us.size() / 2];
}
BENCHMARK(BM_AudioSessionMessage)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
