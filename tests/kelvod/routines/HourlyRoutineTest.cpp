#include <stdlib.h>
#include <sys/resource.h>
#include <unistd.h>

#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/TimeProvider.h"
#include "utils/TimerManager.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

// 2026-12-06 00:00:00 UTC.
constexpr int64_t kDay = 1796515200000LL;
constexpr int64_t kH = 3600000;
constexpr int64_t kMin = 60000;

const column_attribute kTimeChangedColumns[] = {{COLUMN_TIME, "timestamp"},
                                                {COLUMN_LONG, "delta"}};
const table_attribute kTimeChanged = {"1.0", 1, 2, kTimeChangedColumns, "raw_time_changed"};
const column_attribute kTickColumns[] = {{COLUMN_TIME, "start_routine"},
                                         {COLUMN_TIME, "end_routine"}};
const table_attribute kTick = {"1.0", 1, 2, kTickColumns, "debug_hourly_tick"};

std::mutex gLock;
std::vector<std::string> gSeen;

std::vector<std::string> seen() {
    std::lock_guard<std::mutex> guard(gLock);
    return gSeen;
}

std::string hhmm(int64_t t) {
    return std::string(TimeProvider(t).toString(TIME_FORMAT_DATE, false)).substr(11, 5);
}

// Votes for its candidates when announced (unless held), reports its
// energies at the tick, fills the upload events and records what it saw.
class Elector : public KelvoOperator {
public:
    Elector(uint32_t bit, std::vector<int32_t> candidates, std::vector<int64_t> energies = {},
            bool record = false)
        : KelvoOperator("TestElector", -1, bit), mCandidates(candidates), mEnergies(energies),
          mRecord(record) {}
    void setupListeners(Parcel& out) override {
        for (int32_t type : {8, 9, 10, 11, 12, 13, 14, 22}) addNotifierListener(type, out);
    }
    void setCandidateElector() override {
        Parcel c;
        for (int32_t v : mCandidates) c.writeInt32(v);
        setElector(mElector, c);
    }
    int32_t onHourlyTick(const Parcel& d) override { return step(1, d); }
    int32_t onApplicationsAccounting(const Parcel& d) override { return step(2, d); }
    int32_t onComponentAccounting(const Parcel& d) override { return step(3, d); }
    int32_t onHourlyUploading(const Parcel& d) override { return step(4, d); }
    int32_t onDailyTick(const Parcel& d) override { return step(5, d); }
    int32_t onDailyUploading(const Parcel& d) override { return step(6, d); }
    int32_t onDiffDayReboot(const Parcel& d) override { return step(7, d); }
    int32_t onDawnUploading(const Parcel& d) override { return step(8, d); }

    std::atomic<bool> mHold{false};

private:
    int32_t step(int32_t candidate, const Parcel& d) {
        static const int32_t kTypes[] = {8, 10, 11, 12, 9, 13, 22, 14};
        std::string text = std::to_string(kTypes[candidate - 1]);
        if (candidate == 1 || candidate == 5) d.readInt64();
        float ratio = candidate == 4 || candidate == 6 || candidate == 8 ? d.readFloat() : -1;
        int64_t hour = d.readInt64();
        text += "@" + hhmm(hour);
        if (ratio >= 0) text += "/" + std::to_string(KelvoUtils::saturateInt32(ratio * 1000.0));
        if (mRecord) {
            std::lock_guard<std::mutex> guard(gLock);
            gSeen.push_back(text);
        }
        if (candidate == 1) {
            for (int64_t e : mEnergies) updateCompensation(hour, mElector, e);
        }
        if (mRecord && ratio >= 0) {
            Parcel field;
            DataUploader::formIntData(6, 1, field);
            setEventData(candidate == 4 ? EVENT_HOURLY_COMPONENTS : EVENT_DAILY_COMPONENTS,
                         field, true);
        }
        for (int32_t c : mCandidates) {
            if (c == candidate && !mHold) voteCandidate(hour, candidate, mElector);
        }
        return 0;
    }
    std::vector<int32_t> mCandidates;
    std::vector<int64_t> mEnergies;
    bool mRecord;
};

class HourlyRoutineTest : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        { std::lock_guard<std::mutex> guard(gLock); gSeen.clear(); }
        setClock(kDay + 9 * kH + 20 * kMin);
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         "<kelvo_config><element id=\"4\"><component id=\"0\"><parameter>" +
                                 std::to_string(mCompensation) +
                                 "</parameter></component></element></kelvo_config>");
        XmlParser::resetInstance();
        HourlyRoutine::setVoteTimeoutMs(5000);
        mRoutine = new HourlyRoutine();
        mRoutine->addSchemaTable();
        AppsAccounting::getInstance()->addSchemaTable();
        DataUploader::getInstance()->addSchemaTable();
        StorageOperator::addSchema(kTimeChanged);
    }
    void TearDown() override {
        for (const sp<Elector>& e : mElectors) stop(e);
        stop(mRoutine);
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        WallClock::setFixedTimeMs(-1);
        AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }
    template <typename T> static void stop(const sp<T>& op) {
        op->readyToDestroy();
        op->requestThreadExit();
        op->join();
    }
    static void setClock(int64_t t) { WallClock::setFixedTimeMs(t); }
    // The routine with the usual electors: 0x1 records and uploads, the
    // battery reports; candidates 5 to 8 have none.
    void start(std::vector<int64_t> battery = {}, std::vector<int64_t> model = {}) {
        mRoutine->earlyInitialize();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        mRoutine->initialize();
        add(new Elector(0x1, {1, 2, 3, 4}, model, true));
        add(new Elector(0x2, {2, 3}));
        add(new Elector(HourlyRoutine::kBatteryElector, {1}, battery));
    }
    sp<Elector> add(Elector* e) {
        mElectors.push_back(e);
        e->initialize();
        return e;
    }
    void send(int32_t type, int32_t what, int64_t t) {
        Parcel body;
        body.writeInt64(t);
        mRoutine->sendMessage(ParcelMessage(type, what, body));
    }
    void tickAt(int64_t t) {
        setClock(t);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
    }
    int32_t request(int32_t code, const Parcel& data, Parcel* reply) {
        return KelvoAgent::getInstance()->sendToRoutine(ROUTINE_HOURLY, code, data, reply, true);
    }
    // Waits until `rounds` rounds wrote their tick row and the notifications are in.
    void expectRounds(size_t rounds, const std::vector<std::string>& expected) {
        waitFor([&] { return rows("SELECT id FROM debug_hourly_tick").size() >= rounds; });
        waitFor([&] { return seen().size() >= expected.size(); }, std::chrono::milliseconds(500));
        EXPECT_EQ(expected, seen());
    }
    // "event start..end 35=value" of every upload.
    std::vector<std::string> uploads() {
        std::vector<std::string> out;
        for (const Json::Value& e : events()) {
            const Json::Value& p = e["params"];
            out.push_back(std::to_string(e["event"].asUInt()) + " " + p["0"].asString() + ".." +
                          p["1"].asString().substr(11) +
                          (p.isMember("35") ? " 35=" + std::to_string(p["35"].asInt()) : ""));
        }
        return out;
    }

    int mCompensation = 1;
    sp<HourlyRoutine> mRoutine;
    std::vector<sp<Elector>> mElectors;
};

struct FlowCase {
    const char* name;
    int64_t lastStart;  // a debug_hourly_tick row of an earlier run, 0: none
    int64_t timeChange; // a stored clock change, 0: none
    int64_t at;
    bool boot; // boot-completed at `at` instead of a tick
    std::vector<std::string> steps;
    std::vector<std::string> uploaded;
};
void PrintTo(const FlowCase& c, std::ostream* os) { *os << c.name; }

class HourlyFlowTest : public HourlyRoutineTest, public ::testing::WithParamInterface<FlowCase> {};

TEST_P(HourlyFlowTest, RoundsStepThroughTheirCandidatesOnTheLastVote) {
    const FlowCase& c = GetParam();
    if (c.lastStart != 0) {
        Parcel row;
        row.writeInt64(c.lastStart);
        row.writeInt64(c.lastStart + kMin);
        StorageOperator::insertEntries(kTick, row, 1, false);
    }
    if (c.timeChange != 0) {
        Parcel row;
        row.writeInt64(kDay);
        row.writeInt64(c.timeChange);
        StorageOperator::insertEntries(kTimeChanged, row, 1, false);
    }
    mStorage->flushAllEntries();
    LogCapture log;
    start();
    if (c.boot) {
        setClock(c.at);
        send(MESSAGE_NOTIFICATION, NOTIFICATION_BOOT_COMPLETED, c.at);
    } else {
        tickAt(c.at);
    }
    std::set<std::string> hours;
    for (const std::string& s : c.steps) hours.insert(s.substr(s.find('@'), 6));
    expectRounds(hours.size() + (c.lastStart != 0), c.steps);
    EXPECT_EQ(c.uploaded, uploads());
    // Every step ended on its votes, none at the time-out.
    EXPECT_FALSE(log.contains("is timeout"));
}

const int64_t k10 = kDay + 10 * kH;
INSTANTIATE_TEST_SUITE_P(
        Flows, HourlyFlowTest,
        ::testing::Values(
                FlowCase{"Hourly", 0, 0, k10 + 5000, false,
                         {"8@10:00", "10@10:00", "11@10:00", "12@10:00/0"},
                         {"903001060 2026-12-06 09:00:00..10:00:00"}},
                FlowCase{"Daily", 0, 0, kDay + 5000, false,
                         {"8@00:00", "10@00:00", "11@00:00", "12@00:00/0", "9@00:00",
                          "13@00:00/0"},
                         {"903001060 2026-12-05 23:00:00..00:00:00",
                          "903001050 2026-12-05 00:00:00..00:00:00"}},
                FlowCase{"Dawn", 0, 0, kDay + 6 * kH + 5000, false,
                         {"8@06:00", "10@06:00", "11@06:00", "12@06:00/0", "14@06:00/0"},
                         {"903001060 2026-12-06 05:00:00..06:00:00",
                          "903001050 2026-12-06 00:00:00..06:00:00"}},
                FlowCase{"ClockSetBackAnHour", 0, -3600000, k10 + 5000, false,
                         {"8@10:00", "10@10:00", "11@10:00"}, {}},
                FlowCase{"ClockSetBackJustUnderAnHour", 0, -3599999, k10 + 5000, false,
                         {"8@10:00", "10@10:00", "11@10:00", "12@10:00/0"},
                         {"903001060 2026-12-06 09:00:00..10:00:00"}},
                FlowCase{"CatchUpAtBootSameDay", k10 + 5000, 0, kDay + 14 * kH + 10 * kMin, true,
                         {"10@11:00", "11@11:00", "12@11:00/0"},
                         {"903001060 2026-12-06 10:00:00..11:00:00"}},
                FlowCase{"CatchUpAfterFirstRound", k10 + 5000, 0, kDay + 15 * kH + 5000, false,
                         {"8@15:00", "10@15:00", "11@15:00", "12@15:00/0", "10@11:00", "11@11:00",
                          "12@11:00/0"},
                         {"903001060 2026-12-06 14:00:00..15:00:00",
                          "903001060 2026-12-06 10:00:00..11:00:00"}},
                FlowCase{"CatchUpOtherDay", kDay - 2 * kH + 5000, 0, kDay + 9 * kH, true,
                         {"10@23:00", "11@23:00", "12@23:00/0", "22@23:00", "13@23:00/0"},
                         {"903001060 2026-12-05 22:00:00..23:00:00",
                          "903001050 2026-12-04 23:00:00..23:00:00"}}),
        [](const ::testing::TestParamInfo<FlowCase>& info) { return info.param.name; });

struct RatioCase {
    const char* name;
    int enabled;
    std::vector<int64_t> battery, model;
    std::string row;      // debug_energy_compensation battery|model|free|ratio
    std::string uploaded; // the hourly event
};
void PrintTo(const RatioCase& c, std::ostream* os) { *os << c.name; }

class HourlyRatioTest : public HourlyRoutineTest, public ::testing::WithParamInterface<RatioCase> {
    void addTables() override {
        mCompensation = GetParam().enabled;
        HourlyRoutineTest::addTables();
    }
};

TEST_P(HourlyRatioTest, CompensationRowAndParameter) {
    const RatioCase& c = GetParam();
    start(c.battery, c.model);
    tickAt(k10 + 5000);
    expectRounds(1, {"8@10:00", "10@10:00", "11@10:00",
                     "12@10:00/" + std::to_string(std::stoll(c.row.substr(c.row.rfind('|') + 1)))});
    EXPECT_EQ(std::vector<std::string>{"1796547600000|1796551200000|" + c.row},
              rows("SELECT start_time, end_time, battery, power_model, free, ratio FROM "
                   "debug_energy_compensation"));
    EXPECT_EQ(std::vector<std::string>{"903001060 2026-12-06 09:00:00..10:00:00" + c.uploaded},
              uploads());
}

INSTANTIATE_TEST_SUITE_P(
        Ratios, HourlyRatioTest,
        ::testing::Values(
                RatioCase{"Compensated", 1, {1000}, {-200, 400}, "1000|400|200|2000", " 35=2000"},
                RatioCase{"Disabled", 0, {1000}, {-200, 400}, "1000|400|200|1000", " 35=1000"},
                RatioCase{"NoMeasurement", 1, {100}, {-100, 400}, "100|400|100|0", ""},
                RatioCase{"Saturated", 1, {INT64_MAX, 1}, {1}, "2147483647|1|0|2147483647",
                          " 35=2147483647"}),
        [](const ::testing::TestParamInfo<RatioCase>& info) { return info.param.name; });

TEST_F(HourlyRoutineTest, SilentElectorIsPassedAtTheTimeOutAndBadRequestsAreRefused) {
    HourlyRoutine::setVoteTimeoutMs(1000);
    start();
    add(new Elector(0x8, {2}))->mHold = true;
    uint64_t refused = HealthCounters::get(Health::RoutineRequestsRefused);
    Parcel bad, reply;
    bad.writeUint32(0x10);
    bad.writeInt32(9);
    bad.writeInt32(2);
    EXPECT_EQ(-3, request(HourlyRoutine::REQUEST_ELECTOR, bad, &reply));
    LogCapture log;
    tickAt(k10 + 5000);
    // The round waits at candidate 2 for 0x8 (and 0x10, set despite the bad candidate).
    ASSERT_TRUE(waitFor([] { return seen().size() == 2; }));
    struct { int64_t hour; int32_t candidate; uint32_t elector; int32_t result; } votes[] = {
            {k10, 9, 0x8, -5}, {k10, 2, 0, -5}, {k10 - kH, 2, 0x8, -2}, {k10, 5, 0x8, -16}};
    for (const auto& v : votes) {
        Parcel vote;
        vote.writeInt64(v.hour);
        vote.writeInt32(v.candidate);
        vote.writeUint32(v.elector);
        EXPECT_EQ(v.result, request(HourlyRoutine::REQUEST_VOTE, vote, &reply));
    }
    EXPECT_EQ(refused + 5, HealthCounters::get(Health::RoutineRequestsRefused));
    expectRounds(1, {"8@10:00", "10@10:00", "11@10:00", "12@10:00/0"});
    EXPECT_EQ(1u, log.count("Voting(24) for candidate(2) is timeout", ANDROID_LOG_ERROR));
}

TEST_F(HourlyRoutineTest, ForwardClockChangeOpensTheCrossedHourAfterTheActiveRound) {
    start();
    sp<Elector> held = add(new Elector(0x20, {1}));
    held->mHold = true;
    tickAt(k10 + 5000);
    ASSERT_TRUE(waitFor([] { return seen().size() == 1; }));
    // Set forward across 11:00 while the 10:00 round waits at its tick.
    setClock(k10 + 70 * kMin);
    send(MESSAGE_NOTIFICATION, NOTIFICATION_TIME_CHANGED, k10 + 70 * kMin);
    send(MESSAGE_NOTIFICATION, NOTIFICATION_TIME_CHANGED, k10 + 70 * kMin);
    Parcel offset, vote;
    ASSERT_EQ(0, request(HourlyRoutine::REQUEST_OFFSET, Parcel(), &offset));
    EXPECT_EQ(k10 + 70 * kMin, offset.readInt64());
    int64_t left = offset.readInt64();
    EXPECT_TRUE(left > 50 * kMin - 5000 && left <= 50 * kMin) << left;
    EXPECT_EQ(std::vector<std::string>{"8@10:00"}, seen());
    held->mHold = false;
    vote.writeInt64(k10);
    vote.writeInt32(1);
    vote.writeUint32(0x20);
    EXPECT_EQ(0, request(HourlyRoutine::REQUEST_VOTE, vote, &offset));
    expectRounds(2, {"8@10:00", "10@10:00", "11@10:00", "12@10:00/0", "8@11:00", "10@11:00",
                     "11@11:00", "12@11:00/0"});
}

TEST_F(HourlyRoutineTest, ALostTimerIsAddedAgainByTheDelayedRetry) {
    KelvoOperator::setTimerRetryDelayMs(1000);
    uint64_t retries = HealthCounters::get(Health::TimerRearmRetries);
    LogCapture log;
    mRoutine->earlyInitialize();
    KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
    Notifier::getInstance();
    TimerManager::getInstance();
    Parcel reply;
    request(HourlyRoutine::REQUEST_OFFSET, Parcel(), &reply);
    // No descriptor can be made while the routine arms its timer.
    struct rlimit saved;
    getrlimit(RLIMIT_NOFILE, &saved);
    int lowest = dup(0);
    close(lowest);
    struct rlimit tight = {static_cast<rlim_t>(lowest), saved.rlim_max};
    setrlimit(RLIMIT_NOFILE, &tight);
    mRoutine->initialize();
    setrlimit(RLIMIT_NOFILE, &saved);
    EXPECT_EQ(retries + 1, HealthCounters::get(Health::TimerRearmRetries));
    EXPECT_TRUE(log.contains("Failed to re-arm timer 1 of HourlyRoutine", ANDROID_LOG_ERROR));
    // Without a timer there is no time left to tell: a failure, nothing written.
    EXPECT_EQ(-2, request(HourlyRoutine::REQUEST_OFFSET, Parcel(), &reply));
    EXPECT_EQ(0u, reply.dataSize());
    EXPECT_TRUE(waitFor([&] {
        reply.freeData();
        return request(HourlyRoutine::REQUEST_OFFSET, Parcel(), &reply) == 0;
    }));
    reply.readInt64();
    EXPECT_EQ(40 * kMin, (reply.readInt64() + 999) / 1000 * 1000);
    KelvoOperator::setTimerRetryDelayMs(0);
}

} // namespace
