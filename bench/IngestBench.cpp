// Log-device ingestion: records written with the kelvo-log writer from
// another thread, read by the dispatcher, forwarded to an operator whose
// handleLogger takes two values out of each text with parseMessage.

#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <string>
#include <thread>
#include <vector>

#include "core/Dispatcher.h"
#include "core/KelvoOperator.h"
#include "kelvo/LogDevice.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"
#include "utils/LoggerMessage.h"

using Clock = std::chrono::steady_clock;

namespace {

constexpr const char* kTag = "KELVO_TAG_PACKAGE_ADDED";

// Reads uid and name from every record, as the system handler does.
class IngestingOperator : public kelvo::KelvoOperator {
public:
    IngestingOperator() : KelvoOperator("IngestOperator", -1, 0) {}

    void registerDispatcherTag() override {
        kelvo::Dispatcher::getInstance()->registerTag({kTag, 7}, this);
    }

    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override {
        int32_t uid = -1;
        char name[64];
        if (kelvo::parseMessage(text, "uid=", "name=", "%d", &uid, sizeof(uid)) == 0 &&
            kelvo::parseMessage(text, "name=", nullptr, "%s", name, sizeof(name)) == 0 &&
            uid >= 0 && name[0] != '\0') {
            mParsed.fetch_add(1, std::memory_order_relaxed);
        }
        mHandled.fetch_add(1, std::memory_order_release);
        return 0;
    }

    uint64_t handled() const { return mHandled.load(std::memory_order_acquire); }
    uint64_t parsed() const { return mParsed.load(std::memory_order_relaxed); }

private:
    std::atomic<uint64_t> mHandled{0};
    std::atomic<uint64_t> mParsed{0};
};

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    size_t n = values.size();
    return n % 2 == 1 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

void BM_IngestRecords(benchmark::State& state) {
    constexpr uint64_t kRecords = 100000;
    constexpr int kRounds = 5;

    char dir[] = "/tmp/kelvo-bench-XXXXXX";
    if (mkdtemp(dir) == nullptr) {
        state.SkipWithError("no private root");
        return;
    }
    std::string savedRoot = kelvo::RootPath::root();
    kelvo::RootPath::setRoot(dir);
    kelvo::Dispatcher::resetForTest();

    android::sp<IngestingOperator> op = new IngestingOperator();
    op->initialize();
    std::string path = kelvo::RootPath::resolve(KELVO_LOG_DEVICE);
    bool ok = kelvo::Dispatcher::getInstance()->startDispatchMessage() == 0;

    // Texts of the usual length, prepared beforehand.
    std::vector<std::string> texts;
    for (int i = 0; i < 64; ++i) {
        texts.push_back("uid=" + std::to_string(10000 + i) + " name=com.example.app" +
                        std::to_string(i));
    }
    std::vector<double> rates;
    for (auto _ : state) {
        for (int round = 0; round < kRounds && ok; ++round) {
            uint64_t base = op->handled();
            std::atomic<int> failures{0};
            Clock::time_point start = Clock::now();
            std::thread writer([&] {
                kelvo::LogWriter log(path);
                log.setTimeout(20000);
                for (uint64_t i = 0; i < kRecords; ++i) {
                    if (log.write(kelvo::LogWriter::PRIORITY_INFO, kTag,
                                  texts[i % texts.size()].c_str(), 1700000000000LL) != 0) {
                        failures++;
                        return;
                    }
                }
            });
            writer.join();
            Clock::time_point deadline = Clock::now() + std::chrono::seconds(60);
            while (failures.load() == 0 && op->handled() - base < kRecords &&
                   Clock::now() < deadline) {
                std::this_thread::sleep_for(std::chrono::microseconds(200));
            }
            if (failures.load() != 0 || op->handled() - base < kRecords) {
                ok = false;
                break;
            }
            double seconds = std::chrono::duration<double>(Clock::now() - start).count();
            rates.push_back(kRecords / seconds);
        }
    }
    if (ok && op->parsed() != op->handled()) {
        ok = false;
    }

    kelvo::Dispatcher::resetForTest();
    op->requestThreadExit();
    op->join();
    op.clear();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    std::string cleanup = std::string("rm -rf '") + dir + "'";
    if (system(cleanup.c_str()) != 0) {
        fprintf(stderr, "could not remove %s\n", dir);
    }
    if (!ok || rates.empty()) {
        state.SkipWithError("records were lost, refused or not parsed");
        return;
    }
    state.counters["ingest_records_per_s"] = median(rates);
}
BENCHMARK(BM_IngestRecords)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

} // namespace
