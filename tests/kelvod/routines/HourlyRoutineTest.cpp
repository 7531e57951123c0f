#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <mutex>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "core/AppsAccounting.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/TimerManager.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using namespace kelvo::test;

namespace {

// 2026-12-06 00:00:00 UTC.
constexpr int64_t kDay = 1796515200000LL;
constexpr int64_t kH = 3600000;
constexpr int64_t kMin = 60000;

const column_attribute kTimeChangedColumns[] = {{COLUMN_TIME, "timestamp"}, {COLUMN_LONG, "delta"}};
const table_attribute kTimeChanged = {"1.0", 1, 2, kTimeChangedColumns, "raw_time_changed"};

std::mutex gLock;
std::vector<std::string> gSeen;  // "notification@HH:MM[/ratio x 1000]"

std::vector<std::string> seen() {
    std::lock_guard<std::mutex> guard(gLock);
    return gSeen;
}

// Votes for its candidates when announced (unless held) and reports its
// energies at the tick. Elector 0x1 also records what it saw and fills the
// upload events.
class Elector : public KelvoOperator {
public:
    Elector(uint32_t bit, std::vector<int32_t> candidates, std::vector<int64_t> energies = {})
        : KelvoOperator("TestElector", -1, bit), mCandidates(candidates), mEnergies(energies) {}
    void setupListeners(Parcel& out) override {
        for (int32_t type : kTypes) addNotifierListener(type, out);
    }
    void setCandidateElector() override {
        Parcel c;
        for (int32_t v : mCandidates) c.writeInt32(v);
        setElector(mElector, c);
    }
    int32_t handleParcelMessage(const ParcelMessage& msg) override {
        const int32_t* type = std::find(kTypes, kTypes + 8, msg.what);
        if (msg.type != MESSAGE_NOTIFICATION || type == kTypes + 8) {
            return KelvoOperator::handleParcelMessage(msg);
        }
        int32_t candidate = type - kTypes + 1;
        const Parcel& d = msg.getParcel();
        if (candidate == 1 || candidate == 5) d.readInt64();
        float ratio = candidate == 4 || candidate == 6 || candidate == 8 ? d.readFloat() : -1;
        int64_t hour = d.readInt64();
        char text[48];
        snprintf(text, sizeof(text), ratio < 0 ? "%d@%02d:00" : "%d@%02d:00/%d", *type,
                 static_cast<int>(hour % (24 * kH) / kH), KelvoUtils::saturateInt32(ratio * 1000.0));
        for (int64_t e : mEnergies) {
            if (candidate == 1) updateCompensation(hour, mElector, e);
        }
        if (mElector == 0x1) {
            std::lock_guard<std::mutex> guard(gLock);
            gSeen.push_back(text);
            Parcel field;
            DataUploader::formIntData(6, 1, field);
            if (ratio >= 0) setEventData(candidate == 4 ? 903001060 : 903001050, field, true);
        }
        if (std::count(mCandidates.begin(), mCandidates.end(), candidate) != 0 && !mHold) {
            voteCandidate(hour, candidate, mElector);
        }
        return 0;
    }

    std::atomic<bool> mHold{false};

private:
    static constexpr int32_t kTypes[] = {8, 10, 11, 12, 9, 13, 22, 14};
    std::vector<int32_t> mCandidates;
    std::vector<int64_t> mEnergies;
};

class HourlyRoutineTest : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        gSeen.clear();  // every elector of the last test has been joined
        setClock(kDay + 9 * kH + 20 * kMin);
        std::string xml = "<kelvo_config><element id=\"4\"><component id=\"0\"><parameter>";
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         xml + std::to_string(mCompensation) +
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
        mElectors.push_back(mRoutine.get());
        for (const sp<KelvoOperator>& op : mElectors) {
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        WallClock::setFixedTimeMs(-1);
        AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }
    static void setClock(int64_t t) { WallClock::setFixedTimeMs(t); }
    // The routine and its electors: 0x1 records and uploads, 64 is the
    // battery; nobody registers for candidates 5 and 7.
    void start(std::vector<int64_t> battery = {}, std::vector<int64_t> model = {}) {
        mRoutine->earlyInitialize();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        mRoutine->initialize();
        add(new Elector(0x1, {1, 2, 3, 4, 6, 8}, model));
        add(new Elector(0x2, {2, 3}));
        add(new Elector(HourlyRoutine::kBatteryElector, {1}, battery));
    }
    sp<Elector> add(Elector* e) {
        mElectors.push_back(e);
        e->initialize();
        return e;
    }
    void notify(int32_t type, int64_t t) {
        Parcel body;
        body.writeInt64(t);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_NOTIFICATION, type, body));
    }
    void tickAt(int64_t t) {
        setClock(t);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
    }
    int32_t request(int32_t code, const Parcel& data, Parcel* reply) {
        return KelvoAgent::getInstance()->sendToRoutine(ROUTINE_HOURLY, code, data, reply, true);
    }
    int32_t vote(int64_t hour, int32_t candidate, uint32_t elector) {
        Parcel vote, reply;
        vote.writeInt64(hour);
        vote.writeInt32(candidate);
        vote.writeUint32(elector);
        return request(HourlyRoutine::REQUEST_VOTE, vote, &reply);
    }
    // Once `rounds` tick rows are written: the notifications seen.
    void expectSteps(size_t rounds, const std::string& expected) {
        size_t count = std::count(expected.begin(), expected.end(), ' ') + 1;
        waitFor([&] { return rows("SELECT id FROM debug_hourly_tick").size() >= rounds; });
        waitFor([&] { return seen().size() >= count; }, std::chrono::milliseconds(500));
        std::string out;
        for (const std::string& s : seen()) out += (out.empty() ? "" : " ") + s;
        EXPECT_EQ(expected, out);
    }
    // "event start..end 35=value" of every upload, ';'-separated.
    std::string uploads() {
        std::string out;
        for (const Json::Value& e : events()) {
            const Json::Value& p = e["params"];
            out += (out.empty() ? "" : ";") + std::to_string(e["event"].asUInt()) + " " +
                   p["0"].asString() + ".." + p["1"].asString().substr(11) +
                   (p.isMember("35") ? " 35=" + std::to_string(p["35"].asInt()) : "");
        }
        return out;
    }

    int mCompensation = 1;
    sp<HourlyRoutine> mRoutine;
    std::vector<sp<KelvoOperator>> mElectors;
};

// A round: an earlier run's last round, a stored clock change, energy
// reports at the tick (battery; model, negative for free), then a tick (or
// boot-completed) at `at`; the notifications, the uploads and the
// compensation row (battery|model|free|ratio).
struct FlowCase {
    const char* name;
    int64_t lastStart, timeChange, at;
    bool boot;
    const char* steps;
    std::string uploaded;
    int compensation = 1;
    int64_t battery = 0, battery2 = 0, free = 0, model = 0;
    const char* row = nullptr;
    friend void PrintTo(const FlowCase& c, std::ostream* os) { *os << c.name; }
};

class HourlyFlowTest : public HourlyRoutineTest, public ::testing::WithParamInterface<FlowCase> {
    void addTables() override {
        mCompensation = GetParam().compensation;
        HourlyRoutineTest::addTables();
    }
};

TEST_P(HourlyFlowTest, RoundsStepAndUploadOnTheLastVote) {
    const FlowCase& c = GetParam();
    DirectDb db(dbPath());
    std::string last = std::to_string(c.lastStart), delta = std::to_string(c.timeChange);
    db.exec("INSERT INTO debug_hourly_tick(start_routine) SELECT " + last + " WHERE " + last);
    db.exec("INSERT INTO raw_time_changed(delta) SELECT " + delta + " WHERE " + delta);
    LogCapture log;
    start({c.battery, c.battery2}, {c.free, c.model});
    setClock(c.at);
    c.boot ? notify(NOTIFICATION_BOOT_COMPLETED, c.at) : tickAt(c.at);
    expectSteps(2 * (c.lastStart != 0) + !c.boot, c.steps);
    EXPECT_EQ(c.uploaded, uploads());
    if (c.row != nullptr) {
        EXPECT_EQ(std::vector<std::string>{std::string("1796547600000|1796551200000|") + c.row},
                  rows("SELECT start_time, end_time, battery, power_model, free, ratio FROM "
                       "debug_energy_compensation"));
    }
    // Every step ended on its votes, none at the time-out.
    EXPECT_FALSE(log.contains("is timeout"));
}

const int64_t k10 = kDay + 10 * kH;
const std::string kHourly = "903001060 2026-12-06 09:00:00..10:00:00";
INSTANTIATE_TEST_SUITE_P(
    Flows, HourlyFlowTest,
    ::testing::Values(
        FlowCase{"Hourly", 0, 0, k10 + 5000, false, "8@10:00 10@10:00 11@10:00 12@10:00/0", kHourly},
        FlowCase{"Daily", 0, 0, kDay + 5000, false,
                 "8@00:00 10@00:00 11@00:00 12@00:00/0 9@00:00 13@00:00/0",
                 "903001060 2026-12-05 23:00:00..00:00:00;"
                 "903001050 2026-12-05 00:00:00..00:00:00"},
        FlowCase{"Dawn", 0, 0, kDay + 6 * kH + 5000, false,
                 "8@06:00 10@06:00 11@06:00 12@06:00/0 14@06:00/0",
                 "903001060 2026-12-06 05:00:00..06:00:00;"
                 "903001050 2026-12-06 00:00:00..06:00:00"},
        FlowCase{"ClockSetBackAnHour", 0, -3600000, k10 + 5000, false, "8@10:00 10@10:00 11@10:00",
                 ""},
        FlowCase{"ClockSetBackJustUnderAnHour", 0, -3599999, k10 + 5000, false,
                 "8@10:00 10@10:00 11@10:00 12@10:00/0", kHourly},
        // Off from 10:30 to 14:10: the hour to 11:00 is caught up from
        // candidate 2, at boot-completed or after the first round.
        FlowCase{"CatchUpAtBootSameDay", k10 + 5000, 0, kDay + 14 * kH + 10 * kMin, true,
                 "10@11:00 11@11:00 12@11:00/0", "903001060 2026-12-06 10:00:00..11:00:00"},
        FlowCase{"CatchUpAfterFirstRound", k10 + 5000, 0, kDay + 15 * kH + 5000, false,
                 "8@15:00 10@15:00 11@15:00 12@15:00/0 10@11:00 11@11:00 12@11:00/0",
                 "903001060 2026-12-06 14:00:00..15:00:00;"
                 "903001060 2026-12-06 10:00:00..11:00:00"},
        FlowCase{"CatchUpOtherDay", kDay - 2 * kH + 5000, 0, kDay + 9 * kH, true,
                 "10@23:00 11@23:00 12@23:00/0 22@23:00 13@23:00/0",
                 "903001060 2026-12-05 22:00:00..23:00:00;"
                 "903001050 2026-12-04 23:00:00..23:00:00"},
        FlowCase{"Compensated", 0, 0, k10 + 5000, false, "8@10:00 10@10:00 11@10:00 12@10:00/2000",
                 kHourly + " 35=2000", 1, 1000, 0, -200, 400, "1000|400|200|2000"},
        FlowCase{"CompensationOff", 0, 0, k10 + 5000, false,
                 "8@10:00 10@10:00 11@10:00 12@10:00/1000", kHourly + " 35=1000", 0, 1000, 0, -200,
                 400, "1000|400|200|1000"},
        FlowCase{"NoMeasurement", 0, 0, k10 + 5000, false, "8@10:00 10@10:00 11@10:00 12@10:00/0",
                 kHourly, 1, 100, 0, -100, 400, "100|400|100|0"},
        FlowCase{"Saturated", 0, 0, k10 + 5000, false,
                 "8@10:00 10@10:00 11@10:00 12@10:00/2147483647", kHourly + " 35=2147483647", 1,
                 INT64_MAX, 1, 0, 1, "2147483647|1|0|2147483647"}),
    [](const ::testing::TestParamInfo<FlowCase>& info) { return info.param.name; });

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
    // Candidate 2 waits for 0x8 and 0x10 (set despite the bad candidate).
    ASSERT_TRUE(waitFor([] { return seen().size() == 2; }));
    EXPECT_EQ(-5, vote(k10, 9, 0x8));
    EXPECT_EQ(-5, vote(k10, 2, 0));
    EXPECT_EQ(-2, vote(k10 - kH, 2, 0x8));
    EXPECT_EQ(-16, vote(k10, 5, 0x8));
    EXPECT_EQ(refused + 5, HealthCounters::get(Health::RoutineRequestsRefused));
    expectSteps(1, "8@10:00 10@10:00 11@10:00 12@10:00/0");
    EXPECT_EQ(1u, log.count("Voting(24) for candidate(2) is timeout", ANDROID_LOG_ERROR));
}

TEST_F(HourlyRoutineTest, ForwardClockChangeOpensTheCrossedHourAfterTheActiveRound) {
    start();
    sp<Elector> held = add(new Elector(0x20, {1}));
    held->mHold = true;
    tickAt(k10 + 5000);
    ASSERT_TRUE(waitFor([] { return seen().size() == 1; }));
    // Set forward across 11:00 (twice) while the 10:00 round waits at its tick.
    setClock(k10 + 70 * kMin);
    notify(NOTIFICATION_TIME_CHANGED, k10 + 70 * kMin);
    notify(NOTIFICATION_TIME_CHANGED, k10 + 70 * kMin);
    Parcel offset;
    ASSERT_EQ(0, request(HourlyRoutine::REQUEST_OFFSET, Parcel(), &offset));
    EXPECT_EQ(k10 + 70 * kMin, offset.readInt64());
    EXPECT_EQ(50 * kMin, (offset.readInt64() + 999) / 1000 * 1000);
    EXPECT_EQ(std::vector<std::string>{"8@10:00"}, seen());
    held->mHold = false;
    EXPECT_EQ(0, vote(k10, 1, 0x20));
    expectSteps(2, "8@10:00 10@10:00 11@10:00 12@10:00/0 8@11:00 10@11:00 11@11:00 12@11:00/0");
}

TEST_F(HourlyRoutineTest, ALostTimerIsAddedAgainByTheDelayedRetry) {
#ifdef KELVO_SANITIZED
    GTEST_SKIP() << "starving the process of descriptors also starves the sanitizer runtime";
#endif
    KelvoOperator::setTimerRetryDelayMs(1000);
    uint64_t retries = HealthCounters::get(Health::TimerRearmRetries);
    LogCapture log;
    mRoutine->earlyInitialize();
    KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
    Notifier::getInstance();
    TimerManager::getInstance();
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
    Parcel reply;
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

}  // namespace
