// One hourly round with 18 operators that all vote at once on every step:
// the time from the tick to the round's debug_hourly_tick row on disk. A
// round never waits on a vote time-out when every elector votes.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "core/AppsAccounting.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "routines/HourlyRoutine.h"
#include "storage/DataUploader.h"

using android::Parcel;
using android::sp;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kOperators = 18;
constexpr int kRounds = 15;
// 2026-12-06 00:00:00 UTC; the rounds run from 01:00 on (all hourly).
constexpr int64_t kDay = 1796515200000LL;
constexpr int64_t kHourMs = 3600000;

// Registers for the four steps of an hourly round and votes on each.
class VotingOperator : public kelvo::KelvoOperator {
public:
    explicit VotingOperator(uint32_t bit) : KelvoOperator("BenchVoter", -1, bit) {}
    void setupListeners(Parcel& out) override {
        for (int32_t type : {8, 10, 11, 12}) addNotifierListener(type, out);
    }
    void setCandidateElector() override {
        Parcel candidates;
        for (int32_t c : {1, 2, 3, 4}) candidates.writeInt32(c);
        setElector(mElector, candidates);
    }
    int32_t onHourlyTick(const Parcel& d) override {
        d.readInt64();
        return voteCandidate(d.readInt64(), 1, mElector);
    }
    int32_t onHourlyUploading(const Parcel& d) override {
        d.readFloat();
        return voteCandidate(d.readInt64(), 4, mElector);
    }
};

int64_t tickRows() {
    Parcel reply;
    int32_t rows = 0;
    if (kelvo::StorageOperator::queryEntriesSimple(
            android::String8("SELECT COUNT(*) FROM debug_hourly_tick"), &reply, 1, rows) < 0 ||
        rows < 1) {
        return -1;
    }
    return reply.readInt64();
}

void BM_HourlyRound(benchmark::State& state) {
    setenv("TZ", "UTC", 1);
    tzset();
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    std::string root = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
    kelvo::RootPath::setRoot(root.c_str());
    kelvo::WallClock::setFixedTimeMs(kDay + 20 * 60000);
    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<kelvo::HourlyRoutine> routine = new kelvo::HourlyRoutine();
    routine->addSchemaTable();
    kelvo::AppsAccounting::getInstance()->addSchemaTable();
    kelvo::DataUploader::getInstance()->addSchemaTable();
    if (storage->startConnection() != 0) {
        state.SkipWithError("storage did not start");
        return;
    }
    routine->earlyInitialize();
    kelvo::KelvoAgent::getInstance()->setRoutineForTest(kelvo::ROUTINE_HOURLY, routine);
    routine->initialize();
    std::vector<sp<VotingOperator>> voters;
    for (int i = 0; i < kOperators; ++i) {
        voters.push_back(new VotingOperator(1u << i));
        voters.back()->initialize();
    }
    // Every elector is registered once a request queued after them returns.
    Parcel reply;
    routine->sendCustomizedMessage(kelvo::HourlyRoutine::REQUEST_OFFSET, Parcel(), &reply, true);

    std::vector<double> ms;
    for (auto _ : state) {
        for (int r = 0; r < kRounds; ++r) {
            int64_t before = tickRows();
            kelvo::WallClock::setFixedTimeMs(kDay + (r + 1) * kHourMs + 5000);
            Clock::time_point start = Clock::now();
            routine->sendMessage(
                kelvo::ParcelMessage(kelvo::MESSAGE_TIMER, kelvo::HourlyRoutine::kHourlyTimerId));
            while (tickRows() == before && Clock::now() - start < std::chrono::seconds(70)) {
                std::this_thread::sleep_for(std::chrono::microseconds(200));
            }
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - start).count());
        }
    }
    std::sort(ms.begin(), ms.end());
    state.counters["hourly_round_ms"] = ms[ms.size() / 2];

    for (const sp<VotingOperator>& v : voters) {
        v->readyToDestroy();
        v->requestThreadExit();
        v->join();
    }
    routine->readyToDestroy();
    routine->requestThreadExit();
    routine->join();
    kelvo::KelvoAgent::getInstance()->setRoutineForTest(kelvo::ROUTINE_HOURLY, nullptr);
    kelvo::WallClock::setFixedTimeMs(-1);
    storage->closeConnection();
    std::string cmd = "rm -rf '" + root + "'";
    if (root.rfind("/tmp/kelvo-bench-", 0) == 0 && system(cmd.c_str()) != 0) {
        state.SkipWithError("could not remove the bench root");
    }
}
BENCHMARK(BM_HourlyRound)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
