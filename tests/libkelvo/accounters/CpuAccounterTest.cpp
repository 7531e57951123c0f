#include <gtest/gtest.h>

#include <limits>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "common/TestEnv.h"
#include "libkelvo/LibraryTestUtil.h"
#include "utils/XmlParser.h"

using namespace kelvo;
using namespace kelvo::test;

namespace {

constexpr int32_t kCpu = ACCOUNTER_CPU;
constexpr int32_t kMax = std::numeric_limits<int32_t>::max();

struct Cluster {
    int32_t cores; // written as uint32
    int32_t idle;
    int32_t total;
    std::vector<int32_t> steps;
};

// The sample profile: cluster 0 has 8 steps (16..76), cluster 1 9 steps
// (58..290), idle power 4.
class CpuAccounterTest : public ::testing::Test {
protected:
    void SetUp() override {
        mRoot.writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                        readHostFile(KELVO_SAMPLE_CONFIG));
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(500);
        mListener = listenTo(kCpu);
    }
    void TearDown() override {
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        XmlParser::resetInstance();
    }

    static Fields pass(int64_t end, int32_t mode, const std::vector<Cluster>& clusters) {
        Fields f(kCpu, ACTION_SET_VALUE);
        f.i64(end).i32(mode).flag(true).i32(static_cast<int32_t>(clusters.size()));
        for (const Cluster& c : clusters) {
            f.i32(7).i32(c.cores).i32(c.idle).i32(c.total).i32(static_cast<int32_t>(c.steps.size()));
            for (int32_t t : c.steps) {
                f.i32(t);
            }
        }
        return f;
    }
    static int32_t foreground(int64_t t, const char* name) {
        return Fields(kCpu, ACTION_FOREGROUND).i64(t).str(name).send();
    }
    static Bytes component(int64_t start, int64_t end, int32_t fgUsage, int64_t fgEnergy,
                           int32_t usage, int64_t energy, bool screenOn) {
        return Fields().i64(start).i64(end).i32(fgUsage).i64(fgEnergy).i32(usage).i64(energy)
                .flag(screenOn).flag(false).bytes();
    }

    TempRoot mRoot;
    LogCapture mLog;
    android::sp<RecordingListener> mListener;
};

const Cluster kLittle{4, 400, 1000, {600, 0, 0, 0, 0, 0, 0, 400}};
const Cluster kBig{2, 100, 500, {0, 0, 0, 0, 0, 0, 0, 0, 500}};

// Usage = sum of (t - t/S*I/K) * K; energy = (sum power * active + idle
// power * I) / 1000, per pass, from the sample profile.
TEST_F(CpuAccounterTest, PassesAreAccountedFromTheProfile) {
    struct Case {
        const char* what;
        std::vector<Cluster> clusters;
        int32_t usage;
        int64_t energy;
    } cases[] = {
        // 16*540 + 76*360 + 4*400 + 290*450 + 4*100 = 168500
        {"profile shape", {kLittle, kBig}, 4500, 168},
        {"third cluster uses the last", {kLittle, kBig, {1, 0, 100, {100}}}, 4600, 174},
        {"twelfth step uses the last", {kLittle, {1, 0, 300, std::vector<int32_t>(11, 0)}}, 3900, 124},
        {"fewer clusters and steps", {{1, 0, 200, {100, 100}}}, 200, 3},
        {"same short shape again", {{1, 0, 200, {100, 100}}}, 200, 3},
        {"profile kept after short passes", {kLittle, kBig}, 4500, 168},
        {"no step time: no idle share", {{2, 100, 0, {50}}}, 100, 1},
        {"no cores: no idle share", {{0, 100, 100, {100}}}, 0, 2},
        {"negative times count as 0", {{1, -50, -10, {-5, 100}}}, 100, 2},
        {"saturated usage, 64-bit energy",
         {{-1, kMax, kMax, std::vector<int32_t>(64, kMax)}}, kMax, 9859097418},
    };
    cases[2].clusters[1].steps.push_back(300); // 12 steps: 290 * 300 = 87000
    int64_t end = 500;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        size_t before = mListener->mReplies.size();
        ASSERT_EQ(0, pass(end + 100, 1, c.clusters).send());
        ASSERT_EQ(before + 2, mListener->mReplies.size());
        EXPECT_EQ(LIBRARY_EVENT_COMPONENT, mListener->mReplies[before].event);
        EXPECT_EQ(component(end, end + 100, 0, 0, c.usage, c.energy, true),
                  mListener->mReplies[before].bytes);
        end += 100;
    }
    // Each distinct shape is logged once.
    EXPECT_EQ(4u, mLog.count("Mismatched cluster count"));
    EXPECT_EQ(5u, mLog.count("Mismatched freq count"));
}

TEST_F(CpuAccounterTest, HostileParcelsAreRefusedAndTheStartStays) {
    const uint64_t refused = HealthCounters::get(Health::LibraryParcelRefused);
    Fields cases[] = {
        std::move(Fields(kCpu, ACTION_SET_VALUE).i64(900).i32(1).flag(true).i32(1000000000)),
        std::move(Fields(kCpu, ACTION_SET_VALUE).i64(900).i32(1).flag(true).i32(33)),
        std::move(Fields(kCpu, ACTION_SET_VALUE).i64(900).i32(1).flag(true)), // no count
        std::move(Fields(kCpu, ACTION_SET_VALUE).i64(900).i32(1).flag(true).i32(3).i32(7).i32(1)
                          .i32(0).i32(0).i32(0)), // three clusters announced, one given
        std::move(Fields(kCpu, ACTION_SET_VALUE).i64(900).i32(1).flag(true).i32(1).i32(0).i32(1)
                          .i32(0).i32(0).i32(1000000000)),
        std::move(pass(900, 1, {{1, 0, 0, std::vector<int32_t>(65, 1)}})),
        std::move(Fields(kCpu, ACTION_SET_VALUE).i64(900).i32(1).flag(true).i32(1).i32(0).i32(1)
                          .i32(0).i32(0).i32(8).i32(1).i32(2).i32(3)), // truncated steps
        std::move(Fields(kCpu, ACTION_SET_VALUE).i64(900).i32(1)),
    };
    for (size_t i = 0; i < sizeof(cases) / sizeof(cases[0]); ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(-1, cases[i].send());
    }
    EXPECT_EQ(refused + 8, HealthCounters::get(Health::LibraryParcelRefused));
    EXPECT_TRUE(mListener->mReplies.empty());
    ASSERT_EQ(0, pass(900, 1, {kLittle, kBig}).send());
    EXPECT_EQ(component(500, 900, 0, 0, 4500, 168, true), mListener->mReplies[0].bytes);
}

// A pass triggered by a foreground change is charged to the state recorded
// before that change; polling passes use the current state.
TEST_F(CpuAccounterTest, ForegroundTimeline) {
    const Cluster one{1, 0, 100, {100}}; // usage 100, energy 1
    auto withApp = [&](int64_t end, int32_t mode) {
        return pass(end, mode, {one}).i64(100).i32(10001).str("com.a").i32(100).send();
    };
    ASSERT_EQ(0, foreground(600, "com.a"));
    // The second change in that millisecond is refused but still applies.
    EXPECT_EQ(-1, foreground(600, "screen_off"));
    EXPECT_EQ(-1, withApp(700, 0)); // no event at 700
    ASSERT_EQ(0, withApp(600, 0));
    EXPECT_EQ(-1, withApp(600, 0)); // its event went with the pass
    ASSERT_EQ(0, withApp(700, 1));
    ASSERT_EQ(4u, mListener->mReplies.size());
    EXPECT_EQ(component(500, 600, 0, 0, 100, 1, true), mListener->mReplies[0].bytes);
    EXPECT_EQ(elementReply(10001, 500, 600, "com.a", screenOnBackground(100, 1)),
              mListener->mReplies[1].bytes);
    EXPECT_EQ(component(600, 700, 0, 0, 100, 1, false), mListener->mReplies[2].bytes);
    EXPECT_EQ(elementReply(10001, 600, 700, "com.a",
                           Buckets().set(BUCKET_BACKGROUND, 100, 1).set(BUCKET_SCREEN_OFF, 100, 1)),
              mListener->mReplies[3].bytes);

    // Events a pass or a balance has left behind are dropped: the same
    // millisecond is free again (and, being past, not recorded).
    ASSERT_EQ(0, foreground(800, "com.b"));
    // Only the screen-state action turns the screen on again: an application
    // in front after "screen_off" does not.
    ASSERT_EQ(0, Fields(kCpu, ACTION_SCREEN_STATE).i64(800).flag(true).send());
    ASSERT_EQ(0, Fields(kCpu, ACTION_SET_VALUE).i64(900).i32(1).flag(false).send());
    EXPECT_EQ(0, foreground(800, "com.b"));
    ASSERT_EQ(0, foreground(1000, "com.a"));
    EXPECT_EQ(-1, Fields(kCpu, ACTION_BALANCE).i32(BALANCE_AT).i64(1100).send());
    ASSERT_EQ(0, Fields(kCpu, ACTION_BALANCE).i32(BALANCE_SPAN).i64(1100).i64(1100).send());
    EXPECT_EQ(0, foreground(1000, "com.a"));
    EXPECT_EQ(-1, withApp(1050, 1)); // before the balanced start
    ASSERT_EQ(0, withApp(1200, 1));
    EXPECT_EQ(component(1100, 1200, 100, 1, 100, 1, true), mListener->mReplies[4].bytes);

    // Changes that no pass takes are capped: the oldest goes, counted.
    uint64_t dropped = HealthCounters::get(Health::AccounterEventsDropped);
    for (int64_t t = 2000; t < 2000 + 1025; ++t) ASSERT_EQ(0, foreground(t, "com.a"));
    EXPECT_EQ(dropped + 1, HealthCounters::get(Health::AccounterEventsDropped));
    EXPECT_EQ(-1, withApp(2000, 0));
    EXPECT_EQ(0, withApp(2001, 0));
}

} // namespace
