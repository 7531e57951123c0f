#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

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

int64_t now() {
    return TimeProvider::getCurrentTime(TIME_TYPE_WALL);
}

// Answers the polling routine's offset request with chosen values or an error.
class HourlyStandIn : public KelvoOperator {
public:
    HourlyStandIn() : KelvoOperator("HourlyStandIn", -1, 0) {}
    int32_t handleCustomized(int32_t code, const Parcel&, Parcel* reply) override {
        if (result < 0) return result;
        reply->writeInt64(lastTick);
        reply->writeInt64(left);
        return 0;
    }
    std::atomic<int32_t> result{0};
    std::atomic<int64_t> lastTick{0};
    std::atomic<int64_t> left{kFar};
};

// Reads every data-polling notification back with the shared reader.
class PollListener : public KelvoOperator {
public:
    PollListener() : KelvoOperator("PollListener", -1, 0) {}
    void setupListeners(Parcel& out) override {
        addNotifierListener(NOTIFICATION_DATA_POLLING, out);
    }
    int32_t onDataPolling(const Parcel& data) override {
        PollingPayload p;
        p.reason = PollingPayload::readFrom(data, &p) == 0 ? p.reason : -1;
        std::lock_guard<std::mutex> guard(mLock);
        mGot.push_back(p);
        return 0;
    }
    std::vector<PollingPayload> got() {
        std::lock_guard<std::mutex> guard(mLock);
        return mGot;
    }
    bool waitFor(size_t n) {
        return test::waitFor([&] { return got().size() >= n; });
    }

private:
    std::mutex mLock;
    std::vector<PollingPayload> mGot;
};

void retire(const sp<KelvoOperator>& op) {
    op->readyToDestroy();
    op->requestThreadExit();
    op->join();
}

class PollingRoutineTest : public test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        mRoutine = new PollingRoutine();
        mRoutine->addSchemaTable();
    }
    void SetUp() override {
        AgentStorageTest::SetUp();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mHourly);
        mListener->initialize();
        mRoutine->initialize();
    }
    void TearDown() override {
        TimerManager::getInstance()->removeTimer(mRoutine->getTimer());
        retire(mRoutine);
        retire(mListener);
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
    void expire() {
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, PollingRoutine::kPollingTimerId));
    }
    // The reasons polled after the first n, once a shut-down poll closed them.
    std::vector<int32_t> reasonsAfter(size_t n) {
        notify(NOTIFICATION_SHUT_DOWN, now());
        std::vector<int32_t> out;
        if (!test::waitFor([&] {
                std::vector<PollingPayload> got = mListener->got();
                return got.size() > n && got.back().reason == POLLING_SHUT_DOWN;
            })) {
            return out;
        }
        for (const PollingPayload& p : mListener->got()) out.push_back(p.reason);
        return std::vector<int32_t>(out.begin() + n, out.end() - 1);
    }

    sp<PollingRoutine> mRoutine;
    sp<HourlyStandIn> mHourly = new HourlyStandIn();
    sp<PollListener> mListener = new PollListener();
};

} // namespace

TEST_F(PollingRoutineTest, SettingsAcceptedOnlyWithinTheirRange) {
    struct Case {
        const char* period;
        const char* minInterval;
        int64_t floor;
        int64_t expectedPeriod;
        int64_t expectedMin;
        uint64_t refused;
    };
    const Case cases[] = {
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
        int64_t left = TimerManager::getInstance()->getExpireTime(routine->getTimer());
        EXPECT_TRUE(left > c.expectedPeriod - 5000 && left <= c.expectedPeriod) << left;
        if (c.floor > 0) {
            EXPECT_TRUE(mListener->waitFor(1));
            EXPECT_EQ(POLLING_PERIODIC, mListener->got()[0].reason);
        }
        TimerManager::getInstance()->removeTimer(routine->getTimer());
        retire(routine);
    }
    PollingRoutine::setSettingFloorForTest(0);
}

// Battery-level and timer polls: past the minimum interval only, never near
// the hourly tick; an offset the hourly routine cannot give never stops them.
TEST_F(PollingRoutineTest, SuppressionRule) {
    struct Case {
        const char* name;
        bool timer;      // a timer expiry (now) instead of a battery change
        int64_t delta;   // after the previous poll
        int32_t result;  // of the offset request
        int64_t tickAgo; // t - last tick
        int64_t left;    // until the next tick
        bool polls;
    };
    const Case cases[] = {
            {"interval equal", false, 300000, 0, kFar, kFar, false},
            {"interval over", false, 300001, 0, kFar, kFar, true},
            {"30 s before the hour", true, 400000, 0, kFar, 30000, false},
            {"30 s after the tick", true, 400000, 0, 30000, kFar, false},
            {"offset request failed", false, 400000, -2, 0, 0, true},
            {"negative time left", true, 400000, 0, kFar, -4, true},
            {"clock set back", false, 400000, 0, -3600000, kFar, true},
    };
    for (const Case& c : cases) {
        int64_t t = c.timer ? now() : 1700000000000LL;
        mHourly->result = c.result;
        mHourly->lastTick = t - c.tickAgo;
        mHourly->left = c.left;
        size_t before = mListener->got().size();
        notify(NOTIFICATION_ABNORMALITY_THERMAL, t - c.delta);
        ASSERT_TRUE(mListener->waitFor(before + 1));
        if (c.timer) {
            expire();
        } else {
            notify(NOTIFICATION_BATTERY_LEVEL_CHANGED, t);
        }
        std::vector<int32_t> expected = {POLLING_THERMAL};
        if (c.polls) expected.push_back(c.timer ? POLLING_PERIODIC : POLLING_BATTERY_LEVEL);
        EXPECT_EQ(expected, reasonsAfter(before)) << c.name;
    }
}

// Every reason's payload reads back with the shared reader and is recorded;
// only battery, tick, clock, thermal and balance polls restart the timer.
TEST_F(PollingRoutineTest, PayloadsRowsAndTimerRestarts) {
    const int64_t t = now() + 400000;
    struct Case {
        int32_t type;
        std::function<void(Parcel&)> extra;
        PollingPayload expected;
        bool restarts;
    };
    const Case cases[] = {
            {NOTIFICATION_BATTERY_LEVEL_CHANGED, [](Parcel& p) { p.writeInt32(50); },
             {POLLING_BATTERY_LEVEL, t}, true},
            {NOTIFICATION_HOURLY_TICK, [&](Parcel& p) { p.writeInt64(t - 5); },
             {POLLING_HOURLY_TICK, t + 1, t - 5}, true},
            {NOTIFICATION_CHARGER_ONLINE_CHANGED, [](Parcel& p) { p.writeBool(true); },
             {POLLING_CHARGER, t + 1, 0, 0, true}, false},
            {NOTIFICATION_ABNORMALITY_THERMAL, nullptr, {POLLING_THERMAL, t + 1}, true},
            {NOTIFICATION_FORCE_BALANCE, nullptr, {POLLING_FORCE_BALANCE, t + 1}, true},
            {NOTIFICATION_SHUT_DOWN, nullptr, {POLLING_SHUT_DOWN, t + 1}, false},
            {NOTIFICATION_TIME_CHANGED, [&](Parcel& p) { p.writeInt64(t + 9); },
             {POLLING_TIME_CHANGED, 1000, 0, t + 9}, true},
    };
    std::string expectedRows;
    for (size_t i = 0; i < sizeof(cases) / sizeof(cases[0]); ++i) {
        const Case& c = cases[i];
        usleep(200000);
        int64_t before = TimerManager::getInstance()->getExpireTime(mRoutine->getTimer());
        notify(c.type, c.expected.time, c.extra);
        ASSERT_TRUE(mListener->waitFor(i + 1)) << i;
        mRoutine->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));  // done with the poll
        PollingPayload got = mListener->got()[i];
        EXPECT_EQ(c.expected.reason, got.reason);
        EXPECT_EQ(c.expected.time, got.time) << i;
        EXPECT_EQ(c.expected.hour, got.hour) << i;
        EXPECT_EQ(c.expected.newTime, got.newTime) << i;
        EXPECT_EQ(c.expected.online, got.online) << i;
        int64_t after = TimerManager::getInstance()->getExpireTime(mRoutine->getTimer());
        EXPECT_EQ(c.restarts, after > before) << i << ": " << before << " -> " << after;
        expectedRows += std::to_string(c.expected.time) + "|" + std::to_string(c.expected.reason);
    }
    // Measured on the new clock: a periodic poll right after the change waits.
    expire();
    EXPECT_EQ(std::vector<int32_t>(), reasonsAfter(sizeof(cases) / sizeof(cases[0])));
    // A timer the manager lost comes back with the next restart.
    TimerManager::getInstance()->removeTimer(mRoutine->getTimer());
    notify(NOTIFICATION_FORCE_BALANCE, t + 2);
    ASSERT_TRUE(test::waitFor([&] {
        return TimerManager::getInstance()->getExpireTime(mRoutine->getTimer()) > 0;
    }));
    std::string stored;
    for (const std::string& r : rows("SELECT timestamp, reason FROM debug_data_polling ORDER BY id "
                                     "LIMIT 7")) {
        stored += r;
    }
    EXPECT_EQ(expectedRows, stored);
}
