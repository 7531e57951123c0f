// One poll's wakelock pass: the wakeup-source table of 400 kernel sources
// read against its baseline and 200 framework partial wakelock records
// folded into theirs, every source growing between passes.

#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <fstream>
#include <string>
#include <vector>

#include "handlers/KernelWakelockReader.h"
#include "handlers/PartialWakelockTracker.h"

namespace {

constexpr int kSources = 400;
constexpr int kPartials = 200;

void writeSources(const std::string& path, long long base) {
    std::ofstream out(path, std::ios::trunc);
    out << "name\t\tactive_count\tevent_count\twakeup_count\texpire_count\tactive_since\t"
           "total_time\tmax_time\tlast_change\tprevent_suspend_time\n";
    for (int i = 0; i < kSources; ++i) {
        out << "source_" << i << "\t\t" << base / 1000 << "\t\t0\t\t0\t\t0\t\t0\t\t" << base + i
            << "\t\t0\t\t0\t\t0\n";
    }
}

void BM_WakelockPass(benchmark::State& state) {
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    std::string dir = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
    const std::string path = dir + "/wakeup_sources";
    kelvo::KernelWakelockReader kernel;
    kelvo::PartialWakelockTracker partial(false);
    long long held = 1000;
    double totalMs = 0;
    int64_t passes = 0;
    for (auto _ : state) {
        state.PauseTiming();
        held += 1500;
        writeSources(path, held);
        std::vector<std::string> texts;
        texts.reserve(kPartials);
        for (int i = 0; i < kPartials; ++i) {
            texts.push_back("uid=" + std::to_string(10000 + i) +
                            " prevent_time=" + std::to_string(held) + " ws_name=com.bench.app" +
                            std::to_string(i) + " tag=*job*/sync" + std::to_string(i));
        }
        state.ResumeTiming();
        auto start = std::chrono::steady_clock::now();
        std::vector<kelvo::KernelWakelockReader::increment> k;
        kernel.read(path, &k);
        std::vector<kelvo::PartialWakelockTracker::increment> p;
        partial.update(texts, &p);
        benchmark::DoNotOptimize(k.size() + p.size());
        totalMs +=
            std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start)
                .count();
        ++passes;
    }
    state.counters["wakelock_pass_ms"] = passes > 0 ? totalMs / passes : 0;
    unlink(path.c_str());
    rmdir(dir.c_str());
}
BENCHMARK(BM_WakelockPass)->Iterations(50)->Unit(benchmark::kMillisecond);

}  // namespace

// System records through the log device: SUSPEND, WAKEUP and RESUME triples
// written from another thread, read by the dispatcher and handled by the
// system handler, until the last suspend row is flushed to the database.

#include <atomic>
#include <thread>

#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "handlers/SystemHandler.h"
#include "kelvo/LogDevice.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"
#include "storage/KelvoStorage.h"
#include "storage/StorageOperator.h"

namespace {

// The real handler, counting the records it finished.
class CountingSystemHandler : public kelvo::SystemHandler {
public:
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override {
        int32_t ret = SystemHandler::handleLogger(time, tag, text);
        mHandled.fetch_add(1, std::memory_order_release);
        return ret;
    }
    uint64_t handled() const { return mHandled.load(std::memory_order_acquire); }

private:
    std::atomic<uint64_t> mHandled{0};
};

void BM_SystemRecords(benchmark::State& state) {
    using Clock = std::chrono::steady_clock;
    constexpr uint64_t kTriples = 20000;
    constexpr int kRounds = 3;
    constexpr int64_t kStart = 1796515200000LL;  // a midnight, UTC
    setenv("TZ", "UTC", 1);
    tzset();
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        state.SkipWithError("no private root");
        return;
    }
    const std::string root = tmpl;
    const std::string savedRoot = kelvo::RootPath::root();
    kelvo::RootPath::setRoot(root.c_str());
    kelvo::Dispatcher::resetForTest();
    android::sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    android::sp<CountingSystemHandler> handler = new CountingSystemHandler();
    handler->addSchemaTable();
    bool ok = storage->startConnection() == 0 && handler->earlyInitialize() == 0;
    if (ok) {
        handler->initialize();
        ok = kelvo::Dispatcher::getInstance()->startDispatchMessage() == 0;
    }
    const std::string device = kelvo::RootPath::resolve(KELVO_LOG_DEVICE);
    std::vector<double> rates;
    int64_t time = kStart;
    for (auto _ : state) {
        for (int round = 0; round < kRounds && ok; ++round) {
            const uint64_t base = handler->handled();
            std::atomic<bool> failed{false};
            const Clock::time_point start = Clock::now();
            std::thread writer([&] {
                kelvo::LogWriter log(device);
                log.setTimeout(20000);
                for (uint64_t i = 0; i < kTriples && !failed; ++i, time += 1000) {
                    if (log.write(kelvo::LogWriter::PRIORITY_INFO, "KELVO_TAG_KERNEL_SUSPEND", "",
                                  time) != 0 ||
                        log.write(kelvo::LogWriter::PRIORITY_INFO, "KELVO_TAG_KERNEL_WAKEUP",
                                  "irq=qcom,smd-modem gpio=0", time + 600) != 0 ||
                        log.write(kelvo::LogWriter::PRIORITY_INFO, "KELVO_TAG_KERNEL_RESUME", "",
                                  time + 700) != 0) {
                        failed = true;
                    }
                }
            });
            writer.join();
            const Clock::time_point deadline = Clock::now() + std::chrono::seconds(60);
            while (!failed && handler->handled() - base < 3 * kTriples && Clock::now() < deadline) {
                std::this_thread::sleep_for(std::chrono::microseconds(200));
            }
            if (failed || handler->handled() - base < 3 * kTriples ||
                kelvo::StorageOperator::forceFlushEntries() < 0) {
                ok = false;
                break;
            }
            const double seconds = std::chrono::duration<double>(Clock::now() - start).count();
            rates.push_back(3 * kTriples / seconds);
        }
    }
    android::Parcel reply;
    int32_t rows = 0;
    if (ok &&
        (kelvo::StorageOperator::queryEntriesSimple(
             android::String8("SELECT COUNT(*) FROM raw_system_suspend"), &reply, 1, rows) < 0 ||
         rows != 1 || reply.readInt64() < static_cast<int64_t>(kRounds * kTriples))) {
        ok = false;
    }
    kelvo::Dispatcher::resetForTest();
    handler->readyToDestroy();
    handler->requestThreadExit();
    handler->join();
    storage->closeConnection();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    const std::string cleanup = "rm -rf '" + root + "'";
    if (system(cleanup.c_str()) != 0) {
        fprintf(stderr, "could not remove %s\n", root.c_str());
    }
    if (!ok || rates.empty()) {
        state.SkipWithError("records were lost or not handled");
        return;
    }
    std::sort(rates.begin(), rates.end());
    state.counters["system_records_per_s"] = rates[rates.size() / 2];
}
BENCHMARK(BM_SystemRecords)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
