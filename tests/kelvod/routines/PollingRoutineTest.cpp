#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>

#include "HealthCounters.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "kelvo/HostProperties.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/PollingRoutine.h"
#include "utils/TimeProvider.h"
#include "utils/TimerManager.h"

using android::Parcel;
using android::sp;
using namespace kelvo;

namespace {

constexpr int64_t kFar = 1800000;

int64_t timeLeft(const sp<PollingRoutine>& routine) {
    return TimerManager::getInstance()->getExpireTime(routine->getTimer());
}

void retire(const sp<KelvoOperator>& op) {
    op->readyToDestroy();
    op->requestThreadExit();
    op->join();
}

// Stands in for the hourly routine (the offset request answers the values
// set, or fails with result) and reads every poll back with the shared
// reader, as "reason:time:hour:new time:online".
class HourlyStandIn : public KelvoOperator {
public:
    HourlyStandIn() : KelvoOperator("HourlyStandIn", -1, 0) {}
    void setupListeners(Parcel& out) override {
        addNotifierListener(NOTIFICATION_DATA_POLLING, out);
    }
    int32_t handleCustomized(int32_t, const Parcel&, Parcel* reply) override {
        reply->writeInt64(lastTick);
        reply->writeInt64(left);
        return static_cast<int32_t>(result);
    }
    int32_t onDataPolling(const Parcel& data) override {
        PollingPayload p;
        std::string s = PollingPayload::readFrom(data, &p) < 0 ? "unreadable:" : "";
        for (int64_t v : {int64_t(p.reason), p.time, p.hour, p.newTime})
            s += std::to_string(v) + ":";
        std::lock_guard<std::mutex> guard(lock);
        polls.push_back(s + std::to_string(p.online));
        return 0;
    }
    std::atomic<int64_t> result{0}, lastTick{0}, left{kFar};
    std::mutex lock;
    std::vector<std::string> polls;
};

class PollingRoutineTest : public test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        mRoutine->addSchemaTable();
    }
    void SetUp() override {
        AgentStorageTest::SetUp();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mHourly);
        mHourly->initialize();
        mRoutine->initialize();
    }
    void TearDown() override {
        TimerManager::getInstance()->removeTimer(mRoutine->getTimer());
        retire(mRoutine);
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        retire(mHourly);
        AgentStorageTest::TearDown();
    }
    void notify(int32_t type, int64_t t, const std::function<void(Parcel&)>& extra = nullptr) {
        Parcel body;
        body.writeInt64(t);
        if (extra) extra(body);
        Notifier::getInstance()->sendNotification(type, body);
    }
    std::vector<std::string> polls() {
        std::lock_guard<std::mutex> guard(mHourly->lock);
        return mHourly->polls;
    }
    // The reasons polled after the first n ("41"), closed by a shut-down poll.
    std::string reasonsAfter(size_t n) {
        notify(NOTIFICATION_SHUT_DOWN, 0);
        EXPECT_TRUE(test::waitFor([&] { return polls().size() > n && polls().back()[0] == '7'; }));
        std::string out;
        for (size_t i = n; i + 1 < polls().size(); ++i) out += polls()[i][0];
        return out;
    }

    const int64_t mNow = TimeProvider::getCurrentTime(TIME_TYPE_WALL);
    sp<PollingRoutine> mRoutine = new PollingRoutine();
    sp<HourlyStandIn> mHourly = new HourlyStandIn();
    ParcelMessage mExpiry{MESSAGE_TIMER, PollingRoutine::kPollingTimerId};
};

}  // namespace

TEST_F(PollingRoutineTest, SettingsAcceptedOnlyWithinTheirRange) {
    struct Case {
        const char *period, *minInterval;
        int64_t floor, expectedPeriod, expectedMin;
        uint64_t refused;
    } cases[] = {
        {"30000", "", 0, 600000, 300000, 1},
        {"60000", "86400000", 0, 60000, 86400000, 0},
        {"86400001", "9223372036854775808", 0, 600000, 300000, 2},
        {"60000ms", "-60000", 0, 600000, 300000, 2},
        {"200", "100", 100, 200, 100, 0},  // a shortened floor: the timer really polls
    };
    for (const Case& c : cases) {
        HostProperties::setForTest(PollingRoutine::kPeriodProperty, c.period);
        HostProperties::setForTest(PollingRoutine::kMinIntervalProperty, c.minInterval);
        PollingRoutine::setSettingFloorForTest(c.floor);
        uint64_t refused = HealthCounters::get(Health::SettingsRefused);
        sp<PollingRoutine> routine = new PollingRoutine();
        routine->initialize();
        EXPECT_EQ(c.expectedPeriod, routine->getPeriodMs()) << c.period;
        EXPECT_EQ(c.expectedMin, routine->getMinIntervalMs()) << c.minInterval;
        EXPECT_EQ(refused + c.refused, HealthCounters::get(Health::SettingsRefused)) << c.period;
        EXPECT_GT(timeLeft(routine), c.expectedPeriod - 5000) << c.period;
        EXPECT_TRUE(c.floor == 0 || test::waitFor([&] { return !polls().empty(); }));
        TimerManager::getInstance()->removeTimer(routine->getTimer());
        retire(routine);
    }
    PollingRoutine::setSettingFloorForTest(0);
    EXPECT_EQ('0', polls()[0][0]);  // from the 200 ms timer
}

// Battery-level and timer polls: past the minimum interval only, never near
// the hourly tick; an offset the hourly routine cannot give never stops them.
TEST_F(PollingRoutineTest, SuppressionRule) {
    struct Case {
        bool timer;  // a timer expiry (now) instead of a battery change
        int64_t sinceLastPoll, result, sinceTick, left;
        const char* polled;
    } cases[] = {
        {false, 300000, 0, kFar, kFar, "4"},       // the minimum interval
        {false, 300001, 0, kFar, kFar, "41"},      // just past it
        {true, 400000, 0, kFar, 30000, "4"},       // 30 s before the hour
        {true, 400000, 0, 30000, kFar, "4"},       // 30 s after the tick
        {false, 400000, -2, 0, 0, "41"},           // the offset request failed
        {true, 400000, 0, kFar, -4, "40"},         // an error code as time left
        {false, 400000, 0, -3600000, kFar, "41"},  // the clock was set back
    };
    for (const Case& c : cases) {
        int64_t t = c.timer ? TimeProvider::getCurrentTime(TIME_TYPE_WALL) : 1700000000000LL;
        mHourly->result = c.result;
        mHourly->lastTick = t - c.sinceTick;
        mHourly->left = c.left;
        size_t before = polls().size();
        notify(NOTIFICATION_ABNORMALITY_THERMAL, t - c.sinceLastPoll);
        ASSERT_TRUE(test::waitFor([&] { return polls().size() > before; }));
        c.timer ? (void)mRoutine->sendMessage(mExpiry)
                : notify(NOTIFICATION_BATTERY_LEVEL_CHANGED, t);
        EXPECT_EQ(c.polled, reasonsAfter(before)) << c.sinceLastPoll << " " << c.left;
    }
}

// Every reason's payload reads back with the shared reader and is recorded;
// charger and shut-down polls leave the timer running, the others restart it.
TEST_F(PollingRoutineTest, PayloadsRowsAndTimerRestarts) {
    const std::string t = std::to_string(mNow + 400000);
    std::function<void(Parcel&)> none;
    struct Case {
        int32_t type;
        std::function<void(Parcel&)> extra;
        std::string expected;
    } cases[] = {
        {NOTIFICATION_BATTERY_LEVEL_CHANGED, [](Parcel& p) { p.writeInt32(50); },
         "1:" + t + ":0:0:0"},
        {NOTIFICATION_HOURLY_TICK, [](Parcel& p) { p.writeInt64(5); }, "2:" + t + ":5:0:0"},
        {NOTIFICATION_CHARGER_ONLINE_CHANGED, [](Parcel& p) { p.writeBool(true); },
         "6:" + t + ":0:0:1"},
        {NOTIFICATION_ABNORMALITY_THERMAL, none, "4:" + t + ":0:0:0"},
        {NOTIFICATION_FORCE_BALANCE, none, "5:" + t + ":0:0:0"},
        {NOTIFICATION_SHUT_DOWN, none, "7:" + t + ":0:0:0"},
        {NOTIFICATION_TIME_CHANGED, [](Parcel& p) { p.writeInt64(9); }, "3:1000:0:9:0"},
    };
    std::string expectedRows, stored;
    for (size_t i = 0; i < 7; ++i) {
        int64_t time = i == 6 ? 1000 : mNow + 400000;  // a time change carries the old clock
        usleep(200000);
        int64_t before = timeLeft(mRoutine);
        notify(cases[i].type, time, cases[i].extra);
        ASSERT_TRUE(test::waitFor([&] { return polls().size() > i; }));
        mRoutine->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));  // done with the poll
        EXPECT_EQ(cases[i].expected, polls()[i]);
        // Charger and shut-down polls leave the timer running.
        bool restarts = cases[i].expected[0] != '6' && cases[i].expected[0] != '7';
        EXPECT_EQ(restarts, timeLeft(mRoutine) > before) << cases[i].expected;
        expectedRows += std::to_string(time) + "|" + cases[i].expected[0];
    }
    // Measured on the new clock: a periodic poll right after the change waits.
    mRoutine->sendMessage(mExpiry);
    EXPECT_EQ("", reasonsAfter(7));
    // A timer the manager lost comes back with the next restart.
    TimerManager::getInstance()->removeTimer(mRoutine->getTimer());
    notify(NOTIFICATION_FORCE_BALANCE, 0);
    EXPECT_TRUE(test::waitFor([&] { return timeLeft(mRoutine) > 0; }));
    for (const std::string& r : rows("SELECT timestamp, reason FROM debug_data_polling LIMIT 7")) {
        stored += r;
    }
    EXPECT_EQ(expectedRows, stored);
}
