// Queries through binder with a listener, answered from the database; and
// --dump collected on each operator's own thread.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "HealthCounters.h"
#include "KelvoQueryClient.h"
#include "core/KelvoOperator.h"
#include "kelvod/binder/KelvoServiceFixture.h"

using android::sp;
using namespace kelvo;

namespace {

class QueryServiceTest : public kelvo::test::KelvoServiceFixture {};

struct Query {
    bool apps;
    int64_t start;
    int64_t end;
    int32_t maskOrTop;
    int32_t flag;
    std::string expected;
};

TEST_F(QueryServiceTest, ComponentAndApplicationsQueriesAnswerEveryBlock) {
    SKIP_UNLESS_ROOT();
    kelvo::test::DirectDb db(dbPath());
    std::string sql =
        "CREATE TABLE hourly_component_cpu (timestamp INTEGER, foreground_energy INTEGER, "
        "background_energy INTEGER);"
        "INSERT INTO hourly_component_cpu VALUES (3600000, 10, 5), (3600000, 1, 1), "
        "(7200000, 20, 0);"
        "CREATE TABLE raw_applications_backlight (start_time INTEGER, end_time INTEGER, "
        "energy INTEGER);"
        "INSERT INTO raw_applications_backlight VALUES (0, 1000, 7), (1000, 2000, 8);"
        "CREATE TABLE hourly_applications_accounting (timestamp INTEGER, name TEXT, "
        "foreground_energy INTEGER, background_energy INTEGER);"
        "INSERT INTO hourly_applications_accounting VALUES (3600000, 'a', 5, 0), "
        "(3600000, 'b', 9, 1), (3600000, 'c', 1, 0);"
        // 70000 rows of 16 bytes: past the reply's size budget.
        "CREATE TABLE hourly_component_gpu (timestamp INTEGER, energy INTEGER);"
        "WITH RECURSIVE n(x) AS (SELECT 1 UNION ALL SELECT x + 1 FROM n WHERE x < 70000) "
        "INSERT INTO hourly_component_gpu SELECT x, 1 FROM n;";
    std::string top100 = "hour 1:\n";
    for (int i = 0; i < 120; ++i) {
        sql += "INSERT INTO hourly_applications_accounting VALUES (7200000, 'app" +
               std::to_string(i + 100) + "', " + std::to_string(i) + ", 0);";
        if (i >= 20)
            top100 = top100 + "  7200000 app" + std::to_string(239 - i) + " " +
                     std::to_string(139 - i) + "\n";
    }
    ASSERT_EQ(0, db.exec(sql));
    // Modules whose tables are missing, and the absent DPM handler, give -1
    // blocks; totals over no rows too; top is capped, and below 1 is empty.
    const std::vector<Query> queries = {
        {false, 0, 7200000, 0, 0, ""},
        {false, 0, 7200000, 1 << 14, 0, ""},
        {false, 0, 7200000, (1 << 1) | (1 << 5) | (1 << 6), 0,
         "audio: no data\ncpu:\n  3600000 17\n  7200000 20\ndisplay: no data\n"},
        {false, 0, 5000, (1 << 0) | (1 << 6), 1, "battery: no data\ndisplay:\n  15\n"},
        {false, 10000, 20000, 1 << 6, 1, "display: no data\n"},
        {false, 0, 7200000, 1 << 7, 0, "dpm: no data\n"},
        {false, 0, 7200000, (1 << 10) | (1 << 13), 0, "gpu: no data\nwifi: no data\n"},
        {true, 0, 3600000, 2, 0, "hour 1:\n  3600000 b 10\n  3600000 a 5\n"},
        {true, 0, 7200000, -1, 0, "hour 1: no data\nhour 2: no data\n"},
        {true, 3600000, 7200000, 1000000, 0, top100},
        {true, 1000000000, 2000000000, 3, 0, "no data\n"},
    };
    uint64_t refused = HealthCounters::get(Health::ServiceRequestsRefused);
    std::vector<std::string> calls;
    for (const Query& q : queries) {
        calls.insert(calls.end(), {q.apps ? "apps" : "component", std::to_string(q.start),
                                   std::to_string(q.end), std::to_string(q.maskOrTop)});
        if (!q.apps) calls.push_back(std::to_string(q.flag));
    }
    // The oversized block takes seconds under the sanitizers.
    std::string got = asUid(1000, calls, nullptr, 60000);
    std::string expected;
    for (const Query& q : queries) expected += q.expected + "--\n";
    EXPECT_EQ(expected, got);
    // The oversized block and the capped top.
    EXPECT_EQ(refused + 2, HealthCounters::get(Health::ServiceRequestsRefused));
}

// Says whether it dumps on its own thread (noted by any request); code 1
// keeps it busy for 3 s.
class DumpingOperator : public KelvoOperator {
public:
    explicit DumpingOperator(const char* name) : KelvoOperator(name, -1, 0) {}
    void dump(android::String8& out) override {
        bool own = std::this_thread::get_id() == mThread;
        out.appendFormat("%s on its thread: %d\n", getName(), own);
    }
    int32_t handleCustomized(int32_t code, const android::Parcel&, android::Parcel*) override {
        mThread = std::this_thread::get_id();
        if (code == 1) std::this_thread::sleep_for(std::chrono::seconds(3));
        return 0;
    }

private:
    std::thread::id mThread;
};

TEST_F(QueryServiceTest, DumpIsMadeOnEachOperatorsThreadAndSkipsABusyOne) {
    sp<KelvoAgent> agent = KelvoAgent::getInstance();
    sp<KelvoOperator> busy = new DumpingOperator("DumpBusy");
    sp<KelvoOperator> flooded = new DumpingOperator("DumpFlooded");
    agent->setRoutineForTest(ROUTINE_POLLING, busy);
    agent->setRoutineForTest(ROUTINE_HOURLY, flooded);
    android::Parcel reply;
    for (const sp<KelvoOperator>& op : {busy, flooded}) {
        ASSERT_EQ(0, op->sendCustomizedMessage(0, android::Parcel(), &reply, true));
    }
    busy->sendCustomizedMessage(1, android::Parcel(), nullptr, false);
    std::atomic<bool> stop{false};
    std::thread flood([&] {
        for (int i = 0; i < 2000 && !stop; ++i)
            flooded->sendCustomizedMessage(2, android::Parcel(), nullptr, false);
    });
    auto start = std::chrono::steady_clock::now();
    std::string out = dumpOf(mService, {"--dump"});
    auto elapsed = std::chrono::steady_clock::now() - start;
    stop = true;
    flood.join();
    EXPECT_EQ("DumpFlooded on its thread: 1\n", out);
    EXPECT_LT(elapsed, std::chrono::milliseconds(KelvoAgent::kDumpWaitMs * 2));
    agent->setRoutineForTest(ROUTINE_POLLING, nullptr);
    agent->setRoutineForTest(ROUTINE_HOURLY, nullptr);
    busy->requestThreadExit();
    flooded->requestThreadExit();
}

}  // namespace
