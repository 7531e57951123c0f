// Buffered-log ingestion: 4 KiB entries written by a client from another
// thread, read by the buffered log server and delivered to a registered
// operator, which reads each entry's data out of its message.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "core/BufferedLogServer.h"
#include "core/KelvoOperator.h"
#include "kelvo/BufferedLogClient.h"
#include "kelvo/RootPath.h"

using Clock = std::chrono::steady_clock;

namespace {

constexpr size_t kEntrySize = 4096;

class EntryCountingOperator : public kelvo::KelvoOperator {
public:
    EntryCountingOperator() : KelvoOperator("BufLogOperator", -1, 0) {}

    void setupListeners(android::Parcel& out) override {
        addBufferedLogReceiver("kelvo_driver", 0, out);
    }

    int32_t handleBufferedLog(const android::Parcel& data) override {
        data.readInt64();
        data.readString8();
        data.readInt32();
        int32_t length = data.readInt32();
        if (length == static_cast<int32_t>(kEntrySize) &&
            data.readInplace(static_cast<size_t>(length)) != nullptr) {
            mHandled.fetch_add(1, std::memory_order_release);
        }
        return 0;
    }

    uint64_t handled() const { return mHandled.load(std::memory_order_acquire); }

private:
    std::atomic<uint64_t> mHandled{0};
};

void BM_BufferedLogEntries(benchmark::State& state) {
    constexpr uint64_t kEntries = 50000;
    constexpr int kRounds = 5;

    char dir[] = "/tmp/kelvo-bench-XXXXXX";
    if (mkdtemp(dir) == nullptr) {
        state.SkipWithError("no private root");
        return;
    }
    std::string savedRoot = kelvo::RootPath::root();
    kelvo::RootPath::setRoot(dir);
    bool ok = kelvo::BufferedLogServer::getInstance()->start() == 0;
    android::sp<EntryCountingOperator> op = new EntryCountingOperator();
    op->initialize();

    std::string data(kEntrySize, 'e');
    std::vector<double> rates;
    for (auto _ : state) {
        for (int round = 0; round < kRounds && ok; ++round) {
            uint64_t base = op->handled();
            std::atomic<bool> failed{false};
            Clock::time_point start = Clock::now();
            std::thread writer([&] {
                kelvo::BufferedLogClient client;
                if (client.connect("kelvo_driver") < 0) {
                    failed = true;
                    return;
                }
                for (uint64_t i = 0; i < kEntries; ++i) {
                    if (client.send(0, data) < 0) {
                        failed = true;
                        return;
                    }
                }
            });
            Clock::time_point deadline = start + std::chrono::seconds(60);
            while (!failed && op->handled() - base < kEntries && Clock::now() < deadline) {
                std::this_thread::sleep_for(std::chrono::microseconds(200));
            }
            double seconds = std::chrono::duration<double>(Clock::now() - start).count();
            if (failed || op->handled() - base < kEntries) {
                failed = true;
                ok = false;
            }
            writer.join();
            if (!ok) {
                break;
            }
            rates.push_back(kEntries / seconds);
        }
    }

    op->readyToDestroy();
    op->requestThreadExit();
    op->join();
    op.clear();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    std::string cleanup = std::string("rm -rf '") + dir + "'";
    if (system(cleanup.c_str()) != 0) {
        fprintf(stderr, "could not remove %s\n", dir);
    }
    if (!ok || rates.empty()) {
        state.SkipWithError("entries were lost or refused");
        return;
    }
    std::sort(rates.begin(), rates.end());
    state.counters["buffered_log_entries_per_s"] = rates[rates.size() / 2];
}
BENCHMARK(BM_BufferedLogEntries)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
