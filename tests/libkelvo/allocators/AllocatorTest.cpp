// The split rules of the allocators, driven through setDataAccounter and read
// back from the listener's replies byte for byte. Powers of 1000 make an
// interval's energy equal to its length in ms.

#include <gtest/gtest.h>

#include <stdint.h>

#include "common/TestEnv.h"
#include "libkelvo/LibraryTestUtil.h"

using namespace kelvo;
using namespace kelvo::test;

namespace {

class AllocatorTest : public ::testing::Test {
protected:
    LibraryFixture mLibrary;
};

TEST_F(AllocatorTest, SoleChargesItsOneElementIn64Bits) {
    auto listener = listenTo(kSole);
    ASSERT_EQ(0, setPower(kSole, 0, 0, 600));
    ASSERT_EQ(0, activate(kSole, 0, 1000, "com.music"));
    ASSERT_EQ(0, deactivate(kSole, 0, 1000 + 3600000, "com.music"));
    // About 35 days in one record: the duration stops at INT32_MAX ms.
    ASSERT_EQ(0, setPower(kSole, 1, 0, 1000));
    ASSERT_EQ(0, activate(kSole, 1, 0, "com.nav"));
    ASSERT_EQ(0, deactivate(kSole, 1, 3000000000LL, "com.nav"));
    // A time before the last accounted one adds nothing.
    ASSERT_EQ(0, activate(kSole, 1, 5000, "com.nav"));
    ASSERT_EQ(0, deactivate(kSole, 1, 4000, "com.nav"));
    // An hour at power 600: 3600000 ms * 600 / 1000 = 2160000 (the 32-bit
    // product would wrap).
    EXPECT_EQ(
        (std::vector<Bytes>{
            elementReply(0, 1000, 3601000, "com.music", screenOnBackground(3600000, 2160000)),
            elementReply(1, 0, 3000000000LL, "com.nav", screenOnBackground(INT32_MAX, INT32_MAX)),
            elementReply(1, 5000, 4000, "com.nav", Buckets()),
        }),
        replyBytes(*listener));
    EXPECT_EQ(LIBRARY_EVENT_APPLICATION, listener->mReplies[0].event);
    EXPECT_EQ(0u, listener->mPosition[0]);

    // Key 2: B replaces A; the power changes inside the record.
    ASSERT_EQ(0, setPower(kSole, 2, 0, 1000));
    ASSERT_EQ(0, activate(kSole, 2, 0, "A"));
    // B takes over: A's record is dropped, no reply.
    ASSERT_EQ(0, activate(kSole, 2, 1000, "B"));
    EXPECT_EQ(3u, listener->mReplies.size());
    LogCapture log;
    EXPECT_EQ(-1, deactivate(kSole, 2, 1500, "A"));
    EXPECT_TRUE(log.contains("Element name A is not matched with name B", ANDROID_LOG_ERROR));
    // Power 3000 from 2000 on: 1000 ms at 1000 and 1000 ms at 3000.
    ASSERT_EQ(0, setPower(kSole, 2, 2000, 3000));
    ASSERT_EQ(0, deactivate(kSole, 2, 3000, "B"));
    ASSERT_EQ(4u, listener->mReplies.size());
    EXPECT_EQ(elementReply(2, 1000, 3000, "B", screenOnBackground(2000, 4000)),
              listener->mReplies[3].bytes);
    // Nothing active any more: refused without a log line.
    log.clear();
    EXPECT_EQ(-1, deactivate(kSole, 2, 4000, "B"));
    EXPECT_FALSE(log.contains("is not matched"));
}

TEST_F(AllocatorTest, BucketsFollowForegroundScreenAndCharger) {
    auto listener = listenTo(kSole);
    ASSERT_EQ(0, setPower(kSole, 0, 0, 2000));
    ASSERT_EQ(0, activate(kSole, 0, 0, "com.a:service"));
    // Each change closes the interval before it under the old state.
    ASSERT_EQ(0, Fields(kSole, ACTION_FOREGROUND).i64(1000).str("com.a").send());
    ASSERT_EQ(0, Fields(kSole, ACTION_SCREEN_STATE).i64(3000).flag(false).send());
    ASSERT_EQ(0, Fields(kSole, ACTION_CHARGER_ONLINE).i64(6000).flag(true).send());
    ASSERT_EQ(0, Fields(kSole, ACTION_FOREGROUND).i64(10000).str("com.b").send());
    ASSERT_EQ(0, deactivate(kSole, 0, 15000, "com.a:service"));
    // 0-1000 background, screen on; 1000-3000 foreground, screen on;
    // 3000-6000 foreground, screen off; 6000-10000 charging in the
    // foreground; 10000-15000 charging in the background. Energy = 2 * ms.
    Buckets expected;
    expected.set(BUCKET_FOREGROUND, 5000, 10000)
        .set(BUCKET_BACKGROUND, 1000, 2000)
        .set(BUCKET_SCREEN_ON, 3000, 6000)
        .set(BUCKET_SCREEN_OFF, 3000, 6000)
        .set(BUCKET_CHARGE_FOREGROUND, 4000, 8000)
        .set(BUCKET_CHARGE_BACKGROUND, 5000, 10000);
    ASSERT_EQ(1u, listener->mReplies.size());
    EXPECT_EQ(elementReply(0, 0, 15000, "com.a:service", expected), listener->mReplies[0].bytes);
}

TEST_F(AllocatorTest, SharedSplitsEnergyEvenly) {
    auto listener = listenTo(kShared);
    ASSERT_EQ(0, setPower(kShared, 3, 0, 1000));
    for (const char* name : {"a", "b", "c"}) {
        ASSERT_EQ(0, activate(kShared, 3, 0, name));
    }
    // 10 ms at 1000: energy 10, each user 10 / 3 = 3, the component 10.
    ASSERT_EQ(0, balanceAt(kShared, 10));
    // b leaves at 16: 6 ms shared by three (2 each); then a and c share 4 ms.
    ASSERT_EQ(0, deactivate(kShared, 3, 16, "b"));
    ASSERT_EQ(0, Fields(kShared, ACTION_DEACTIVATE_ALL).i64(20).send());
    // No element: a balance reports nothing, not even the component.
    ASSERT_EQ(0, balanceAt(kShared, 30));
    EXPECT_EQ((std::vector<Bytes>{
                  elementReply(3, 0, 10, "a", screenOnBackground(10, 3)),
                  elementReply(3, 0, 10, "b", screenOnBackground(10, 3)),
                  elementReply(3, 0, 10, "c", screenOnBackground(10, 3)),
                  componentReply(3, 0, 10, screenOnBackground(10, 10)),
                  elementReply(3, 10, 16, "b", screenOnBackground(6, 2)),
                  elementReply(3, 10, 20, "a", screenOnBackground(10, 4)),
                  elementReply(3, 10, 20, "c", screenOnBackground(10, 4)),
                  componentReply(3, 10, 20, screenOnBackground(10, 10)),
              }),
              replyBytes(*listener));
    EXPECT_EQ(LIBRARY_EVENT_APPLICATION, listener->mReplies[2].event);
    EXPECT_EQ(LIBRARY_EVENT_COMPONENT, listener->mReplies[3].event);
}

TEST_F(AllocatorTest, SharedForegroundAmongTwoOfFour) {
    auto listener = listenTo(kShared);
    ASSERT_EQ(0, setPower(kShared, 0, 0, 1000));
    ASSERT_EQ(0, Fields(kShared, ACTION_FOREGROUND).i64(0).str("com.fg").send());
    for (const char* name : {"com.y", "com.fg:remote", "com.x", "com.fg"}) {
        ASSERT_EQ(0, activate(kShared, 0, 0, name));
    }
    // 101 ms, energy 101: each element 101 / 4 = 25; the component's
    // foreground share 101 * 2 / 4 = 50, the background the other 51.
    ASSERT_EQ(0, balanceAt(kShared, 101));
    Buckets fg = screenOnForeground(101, 25);
    Buckets bg = screenOnBackground(101, 25);
    Buckets component = screenOnForeground(50, 50) + screenOnBackground(51, 51);
    EXPECT_EQ((std::vector<Bytes>{
                  elementReply(0, 0, 101, "com.fg", fg),
                  elementReply(0, 0, 101, "com.fg:remote", fg), elementReply(0, 0, 101, "com.x", bg),
                  elementReply(0, 0, 101, "com.y", bg), componentReply(0, 0, 101, component)}),
              replyBytes(*listener));

    // Charging: the same split in the charge buckets, no screen bucket.
    ASSERT_EQ(0, Fields(kShared, ACTION_CHARGER_ONLINE).i64(101).flag(true).send());
    ASSERT_EQ(0, balanceAt(kShared, 202));
    fg = Buckets().set(BUCKET_CHARGE_FOREGROUND, 101, 25);
    bg = Buckets().set(BUCKET_CHARGE_BACKGROUND, 101, 25);
    component =
        Buckets().set(BUCKET_CHARGE_FOREGROUND, 50, 50).set(BUCKET_CHARGE_BACKGROUND, 51, 51);
    EXPECT_EQ(
        (std::vector<Bytes>{
            elementReply(0, 101, 202, "com.fg", fg), elementReply(0, 101, 202, "com.fg:remote", fg),
            elementReply(0, 101, 202, "com.x", bg), elementReply(0, 101, 202, "com.y", bg),
            componentReply(0, 101, 202, component)}),
        replyBytes(*listener, 5));
}

TEST_F(AllocatorTest, NothingIsForegroundWithoutAForeground) {
    auto listener = listenTo(kShared);
    ASSERT_EQ(0, setPower(kShared, 0, 0, 1000));
    ASSERT_EQ(0, activate(kShared, 0, 0, "com.a"));
    ASSERT_EQ(0, activate(kShared, 0, 0, "com.b"));
    ASSERT_EQ(0, Fields(kShared, ACTION_FOREGROUND).i64(100).str("com.a").send());
    ASSERT_EQ(0, Fields(kShared, ACTION_FOREGROUND).i64(200).str("").send());
    ASSERT_EQ(0, balanceAt(kShared, 300));
    // 0-100 and 200-300 without a foreground: all background. 100-200: com.a
    // in the foreground, half of the component's 100.
    Buckets a = screenOnForeground(100, 50) + screenOnBackground(200, 100);
    Buckets component = screenOnForeground(50, 50) + screenOnBackground(250, 250);
    EXPECT_EQ((std::vector<Bytes>{elementReply(0, 0, 300, "com.a", a),
                                  elementReply(0, 0, 300, "com.b", screenOnBackground(300, 150)),
                                  componentReply(0, 0, 300, component)}),
              replyBytes(*listener));
}

TEST_F(AllocatorTest, EnergiesKeepTheirSignAndSensorsTheirScale) {
    auto listener = listenTo(kShared);
    // Energy -10 among three users: -3 each (an unsigned division would give
    // a huge number).
    ASSERT_EQ(0, setPower(kShared, 0, 0, -1000));
    for (const char* name : {"a", "b", "c"}) {
        ASSERT_EQ(0, activate(kShared, 0, 0, name));
    }
    ASSERT_EQ(0, balanceAt(kShared, 10));
    ASSERT_EQ(4u, listener->mReplies.size());
    EXPECT_EQ(elementReply(0, 0, 10, "a", screenOnBackground(10, -3)), listener->mReplies[0].bytes);
    EXPECT_EQ(componentReply(0, 0, 10, screenOnBackground(10, -10)), listener->mReplies[3].bytes);

    // A sensor at power 50 for an hour: 3600000 * 50 / 10000 = 18000.
    auto sensorListener = listenTo(kSensor);
    ASSERT_EQ(0, setPower(kSensor, 1, 0, 50));
    ASSERT_EQ(0, activate(kSensor, 1, 0, "com.step|walk"));
    ASSERT_EQ(0, deactivate(kSensor, 1, 3600000, "com.step|walk"));
    Buckets hour = screenOnBackground(3600000, 18000);
    EXPECT_EQ((std::vector<Bytes>{elementReply(1, 0, 3600000, "com.step|walk", hour),
                                  componentReply(1, 0, 3600000, hour)}),
              replyBytes(*sensorListener));
    EXPECT_EQ(LIBRARY_EVENT_COMPONENT, sensorListener->mReplies[1].event);
}

// A traffic record in a balance reply: int64 usage per bucket.
Fields& trafficRecord(Fields& f, int64_t start, int64_t end, const char* name, const Buckets& b) {
    return f.i64(start).i64(end).str(name).buckets(b, true);
}

struct TrafficEntry {
    const char* name;
    int32_t foreground;
    int64_t bytes;
};

Fields trafficBatch(int32_t count, std::initializer_list<TrafficEntry> entries) {
    Fields action(kTraffic, ACTION_SET_VALUE);
    action.i32(1).i32(500).i64(1000).i32(count);
    for (const TrafficEntry& entry : entries) {
        action.str(entry.name).i32(entry.foreground).i64(entry.bytes);
    }
    return action;
}

TEST_F(AllocatorTest, TrafficBatchesAreBoundedByCountAndData) {
    auto listener = listenTo(kTraffic);
    // Power 500: energy = bytes / 2.
    ASSERT_EQ(0,
              trafficBatch(3, {{"com.a", 1, 2000}, {"com.b", 0, 4000}, {"com.a", 0, 1000}}).send());
    LogCapture log;
    EXPECT_EQ(-1, trafficBatch(5001, {{"com.a", 1, 2000}}).send());
    EXPECT_TRUE(log.contains("Invalid traffic data count(5001)", ANDROID_LOG_ERROR));
    EXPECT_EQ(0, trafficBatch(0, {}).send());
    EXPECT_EQ(0, trafficBatch(-4, {}).send());
    // Three promised, two present: the two are kept, nothing else appears.
    EXPECT_EQ(-1, trafficBatch(3, {{"com.c", 0, 600}, {"com.c", 0, 400}}).send());
    EXPECT_TRUE(log.contains("Traffic data ends after 2 of 3 entries", ANDROID_LOG_ERROR));

    ASSERT_EQ(0, balanceAt(kTraffic, 5000));
    // Prefix 1 and the count, then the records.
    Buckets a = screenOnForeground(2000, 1000) + screenOnBackground(1000, 500);
    ASSERT_EQ(1u, listener->mReplies.size());
    Fields expected;
    trafficRecord(expected.i32(1).i32(3), 0, 5000, "com.a", a);
    trafficRecord(expected, 0, 5000, "com.b", screenOnBackground(4000, 2000));
    trafficRecord(expected, 0, 5000, "com.c", screenOnBackground(1000, 500));
    EXPECT_EQ(expected.bytes(), listener->mReplies[0].bytes);

    // Charging: the flag picks the charge bucket; records start at the
    // previous balance.
    ASSERT_EQ(0, Fields(kTraffic, ACTION_CHARGER_ONLINE).i64(5000).flag(true).send());
    ASSERT_EQ(0, trafficBatch(1, {{"com.a", 1, 10}}).send());
    ASSERT_EQ(0, balanceAt(kTraffic, 9000));
    ASSERT_EQ(2u, listener->mReplies.size());
    Fields charging;
    trafficRecord(charging.i32(1).i32(1), 5000, 9000, "com.a",
                  Buckets().set(BUCKET_CHARGE_FOREGROUND, 10, 5));
    EXPECT_EQ(charging.bytes(), listener->mReplies[1].bytes);
}

Fields cpuBatch(int64_t totalApplicationUsage) {
    // The component: 0-1000, usage 800, energy 1000.
    Fields action(kWeight, ACTION_SET_VALUE);
    action.i64(0).i64(1000).i32(800).i64(1000).i64(totalApplicationUsage);
    return action;
}

// The component record of cpuBatch with its foreground share.
Bytes cpuComponent(int32_t foregroundUsage, int64_t foregroundEnergy) {
    Fields f;
    f.i64(0).i64(1000).i32(foregroundUsage).i64(foregroundEnergy).i32(800).i64(1000);
    return f.flag(true).flag(false).bytes();
}

// An application record of cpuBatch.
Fields& cpuRecord(Fields& f, int32_t uid, const char* name, const Buckets& b) {
    return f.i32(uid).i64(0).i64(1000).str(name).buckets(b);
}

TEST_F(AllocatorTest, WeightSplitsByCpuTime) {
    auto listener = listenTo(kWeight);
    ASSERT_EQ(0, Fields(kWeight, ACTION_FOREGROUND).i64(0).str("com.fg").send());
    // 1/3 and 2/3 of 1000: 333 and 667 (rounded).
    ASSERT_EQ(0, cpuBatch(3).i32(10010).str("com.fg").i32(1).i32(10020).str("com.bg").i32(2).send());
    ASSERT_EQ(2u, listener->mReplies.size());
    EXPECT_EQ(LIBRARY_EVENT_COMPONENT, listener->mReplies[0].event);
    EXPECT_EQ(cpuComponent(1, 333), listener->mReplies[0].bytes);
    Fields applications;
    cpuRecord(applications, 10010, "com.fg", screenOnForeground(1, 333));
    cpuRecord(applications, 10020, "com.bg", screenOnBackground(2, 667));
    EXPECT_EQ(LIBRARY_EVENT_APPLICATION, listener->mReplies[1].event);
    EXPECT_EQ(applications.bytes(), listener->mReplies[1].bytes);

    // Applications without a total usage cannot be split: nothing is sent.
    LogCapture log;
    EXPECT_EQ(-1, cpuBatch(0).i32(10010).str("com.fg").i32(1).send());
    EXPECT_TRUE(log.contains("Invalid total application usage", ANDROID_LOG_ERROR));
    EXPECT_EQ(2u, listener->mReplies.size());

    // No applications: both replies, the second empty.
    EXPECT_EQ(0, cpuBatch(0).send());
    ASSERT_EQ(4u, listener->mReplies.size());
    EXPECT_EQ(cpuComponent(0, 0), listener->mReplies[2].bytes);
    EXPECT_TRUE(listener->mReplies[3].bytes.empty());

    // The data end inside the second application: the first is reported,
    // the call fails.
    EXPECT_EQ(-1, cpuBatch(4).i32(10020).str("com.bg").i32(1).i32(10030).send());
    ASSERT_EQ(6u, listener->mReplies.size());
    Fields first;
    EXPECT_EQ(cpuComponent(0, 0), listener->mReplies[4].bytes);
    EXPECT_EQ(cpuRecord(first, 10020, "com.bg", screenOnBackground(1, 250)).bytes(),
              listener->mReplies[5].bytes);
}

} // namespace
