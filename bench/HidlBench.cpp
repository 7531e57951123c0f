// The manager service: a 4 KiB block from KelvoManagerClient (memfd, one
// call on the service's socket) through KelvoManager's checks and copy to
// the post to the modem handler. Reported beside binder_roundtrip_us_p50.

#include <benchmark/benchmark.h>
#include <hidl/HidlTransportSupport.h>
#include <stdlib.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <string>
#include <vector>

#include "core/KelvoAgent.h"
#include "hidl/KelvoManager.h"
#include "kelvo/KelvoManagerClient.h"
#include "kelvo/RootPath.h"

using android::sp;
using Clock = std::chrono::steady_clock;

namespace {

// Counts the events that reach it.
class CountingModem : public kelvo::KelvoOperator {
public:
    CountingModem() : KelvoOperator("BenchModem", -1, 0) {}
    int32_t handleCustomized(int32_t code, const android::Parcel& data, android::Parcel*) override {
        if (code == kelvo::KelvoManager::kModemEventRequest && data.dataSize() == 4 + 4096) {
            mCount++;
        }
        return 0;
    }
    int count() const { return mCount.load(); }

private:
    std::atomic<int> mCount{0};
};

void BM_HidlEvent(benchmark::State& state) {
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    std::string root = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
    std::string savedRoot = kelvo::RootPath::root();
    kelvo::RootPath::setRoot(root.c_str());
    sp<kelvo::KelvoAgent> agent = new kelvo::KelvoAgent();
    sp<CountingModem> modem = new CountingModem();
    agent->setHandlerForTest(kelvo::HANDLER_MODEM, modem);
    android::hardware::configureRpcThreadpool(kelvo::KelvoManager::kThreadPoolSize, false);
    sp<kelvo::KelvoManager> manager = new kelvo::KelvoManager(agent);
    if (manager->registerAsService(kelvo::KelvoManager::kInstanceName) != android::NO_ERROR) {
        state.SkipWithError("cannot register the manager service");
        return;
    }
    const std::string block(4096, 'b');
    constexpr int kWarmUp = 200;
    constexpr int kCalls = 3000;
    std::vector<double> micros;
    micros.reserve(kCalls);
    for (auto _ : state) {
        for (int i = 0; i < kWarmUp + kCalls; ++i) {
            Clock::time_point start = Clock::now();
            int32_t result = kelvo::KelvoManagerClient::send(100, block.data(), block.size());
            double us = std::chrono::duration<double, std::micro>(Clock::now() - start).count();
            if (result != 0) {
                state.SkipWithError("event refused");
                break;
            }
            if (i >= kWarmUp) micros.push_back(us);
        }
    }
    // Every event reached the handler.
    for (int wait = 0; wait < 500 && modem->count() < kWarmUp + kCalls; ++wait) {
        usleep(10000);
    }
    if (micros.size() == static_cast<size_t>(kCalls) && modem->count() == kWarmUp + kCalls) {
        std::nth_element(micros.begin(), micros.begin() + kCalls / 2, micros.end());
        state.counters["hidl_event_us_p50"] = micros[kCalls / 2];
    } else if (micros.size() == static_cast<size_t>(kCalls)) {
        state.SkipWithError("events lost on the way to the handler");
    }
    modem->requestThreadExit();
    agent->getStorage()->requestThreadExit();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    std::string cmd = "rm -rf '" + root + "'";
    if (root.rfind("/tmp/kelvo-bench-", 0) == 0) {
        int ignored = system(cmd.c_str());
        (void)ignored;
    }
}
BENCHMARK(BM_HidlEvent)->Iterations(1)->UseRealTime();

} // namespace
