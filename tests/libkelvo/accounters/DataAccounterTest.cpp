// The actions of the accounter base, through setDataAccounter: how each is
// decoded, how it drives the allocators and how failures stay local.

#include <gtest/gtest.h>

#include <stdint.h>

#include "HealthCounters.h"
#include "common/TestEnv.h"
#include "libkelvo/LibraryTestUtil.h"

using namespace kelvo;
using namespace kelvo::test;

namespace {

class DataAccounterTest : public ::testing::Test {
protected:
    LibraryFixture mLibrary;
    LogCapture mLog;
};

// Every refused action says why, is counted, and changes nothing.
TEST_F(DataAccounterTest, RefusedActionsAreCountedAndChangeNothing) {
    auto listener = listenTo(kSole);
    ASSERT_EQ(0, activate(kSole, 0, 10, "a"));
    HealthCounters::resetForTest();
    size_t refused = 0;
    auto refuse = [&](const Fields& action, const char* log) {
        SCOPED_TRACE(log);
        mLog.clear();
        EXPECT_EQ(-1, action.send());
        if (log[0] != '\0') {
            EXPECT_TRUE(mLog.contains(log, ANDROID_LOG_ERROR));
        }
        ++refused;
    };
    refuse(Fields(kSole, 8).i64(0), "[DataAccounter.cpp] handleAction# Unknown action: 8");
    // Parcels that end before an action's fields.
    refuse(Fields(kSole, ACTION_ACTIVATE).i32(0).i64(10), "");
    refuse(Fields(kSole, ACTION_SET_VALUE).i32(0).i64(20), "Failed to get power value");
    // Allocators that do not exist or cannot.
    refuse(Fields(kSole, ACTION_DEACTIVATE).i32(5).i64(10).str("a"), "Failed to find allocator: 5");
    refuse(Fields(kSole, ACTION_ACTIVATE).i32(-3).i64(10).str("a"), "Invalid allocator key: -3");
    refuse(Fields(kSole, ACTION_DEACTIVATE).i32(0).i64(30).str("b"), "Failed to remove element");
    // Types without an accounter.
    refuse(Fields(12, ACTION_FOREGROUND).i64(0).str("a"),
           "[KelvoLibAgent.cpp] findAccounter# Invalid accounter type: 12");
    refuse(Fields(-1, ACTION_FOREGROUND).i64(0).str("a"),
           "[KelvoLibAgent.cpp] setDataAccounter# Failed to find accounter by type: -1");
    android::Parcel typeOnly;
    typeOnly.writeInt32(kSole);
    EXPECT_EQ(-1, setDataAccounter(typeOnly));
    EXPECT_EQ(refused + 1, HealthCounters::get(Health::LibraryParcelRefused));
    EXPECT_TRUE(listener->mReplies.empty());
    // The element is still there.
    EXPECT_EQ(0, deactivate(kSole, 0, 40, "a"));
}

TEST_F(DataAccounterTest, StateBeforeAnyAllocatorIsKept) {
    auto listener = listenTo(kSole);
    // No allocator yet: the foreground and the screen state are only stored.
    EXPECT_EQ(0, Fields(kSole, ACTION_FOREGROUND).i64(0).str("com.game").send());
    EXPECT_EQ(0, Fields(kSole, ACTION_SCREEN_STATE).i64(0).flag(false).send());
    ASSERT_EQ(0, setPower(kSole, 0, 0, 1000));
    ASSERT_EQ(0, activate(kSole, 0, 0, "com.game"));
    ASSERT_EQ(0, Fields(kSole, ACTION_DEACTIVATE).i32(0).i64(40).str("com.game").send());
    Buckets offInFront = Buckets().set(BUCKET_FOREGROUND, 40, 40).set(BUCKET_SCREEN_OFF, 40, 40);
    EXPECT_EQ(std::vector<Bytes>{elementReply(0, 0, 40, "com.game", offInFront)},
              replyBytes(*listener));
}

// Reason 0 ends the records at one time and starts them again; reason 1 ends
// them and starts them later, the time between belonging to no record.
TEST_F(DataAccounterTest, BalanceReasons) {
    auto listener = listenTo(kSole);
    ASSERT_EQ(0, setPower(kSole, 0, 0, 1000));
    ASSERT_EQ(0, activate(kSole, 0, 0, "a"));
    EXPECT_EQ(-1, Fields(kSole, ACTION_BALANCE).i32(2).i64(100).send());
    EXPECT_TRUE(mLog.contains("Unknown balance reason: 2", ANDROID_LOG_ERROR));
    EXPECT_TRUE(listener->mReplies.empty());

    EXPECT_EQ(0, balanceAt(kSole, 100));
    EXPECT_EQ(0, Fields(kSole, ACTION_BALANCE).i32(BALANCE_SPAN).i64(300).i64(1000).send());
    EXPECT_EQ(-1, Fields(kSole, ACTION_BALANCE).i32(BALANCE_SPAN).i64(1100).send());
    ASSERT_EQ(0, deactivate(kSole, 0, 2000, "a"));
    // Accounted up to 4000 already; a balance at 3500 does not move back.
    ASSERT_EQ(0, activate(kSole, 0, 3000, "a"));
    ASSERT_EQ(0, setPower(kSole, 0, 4000, 1000));
    ASSERT_EQ(0, balanceAt(kSole, 3500));
    ASSERT_EQ(0, deactivate(kSole, 0, 5000, "a"));
    EXPECT_EQ((std::vector<Bytes>{
                  elementReply(0, 0, 100, "a", screenOnBackground(100, 100)),
                  elementReply(0, 100, 300, "a", screenOnBackground(200, 200)),
                  elementReply(0, 1000, 2000, "a", screenOnBackground(1000, 1000)),
                  elementReply(0, 3000, 3500, "a", screenOnBackground(1000, 1000)),
                  elementReply(0, 3500, 5000, "a", screenOnBackground(1000, 1000)),
              }),
              replyBytes(*listener));
}

// A refused record stops no balance, a failed removal no removal of all.
TEST_F(DataAccounterTest, OneFailureStopsNoOtherAllocator) {
    auto listener = listenTo(kSole);
    // Key 0 exists but is idle (its removal fails); keys 1 to 3 are active.
    ASSERT_EQ(0, setPower(kSole, 0, 0, 1000));
    for (int32_t key = 1; key <= 3; ++key) {
        ASSERT_EQ(0, setPower(kSole, key, 0, 1000));
        ASSERT_EQ(0, activate(kSole, key, 0, "app"));
    }
    listener->refuse(2);
    EXPECT_EQ(-1, balanceAt(kSole, 70));
    EXPECT_EQ(1u, mLog.count("Failed to balance accounting data", ANDROID_LOG_ERROR));
    ASSERT_EQ(3u, listener->mReplies.size());
    for (int32_t key = 1; key <= 3; ++key) {
        EXPECT_EQ(elementReply(key, 0, 70, "app", screenOnBackground(70, 70)),
                  listener->mReplies[key - 1].bytes);
    }
    // Every allocator was cut at 70, the refused one too. The Sole reply
    // opens with the accounter's prefix: the last key it read.
    EXPECT_EQ(0, Fields(kSole, ACTION_DEACTIVATE_ALL).i64(100).send());
    EXPECT_EQ(1u, mLog.count("Failed to remove all elements", ANDROID_LOG_ERROR));
    EXPECT_EQ(std::vector<Bytes>(3, elementReply(3, 70, 100, "app", screenOnBackground(30, 30))),
              replyBytes(*listener, 3));
}

TEST_F(DataAccounterTest, AKeyWithoutAllocatorStandsInNobodysWay) {
    auto listener = listenTo(kSole);
    ASSERT_EQ(0, setPower(kSole, 1, 0, 1000));
    ASSERT_EQ(0, activate(kSole, 1, 0, "a"));
    EXPECT_EQ(-1, activate(kSole, kKeyWithoutAllocator, 0, "b"));
    EXPECT_EQ(-1, Fields(kSole, ACTION_SET_VALUE).i32(kKeyWithoutAllocator).i64(0).i32(5).send());
    EXPECT_EQ(2u, mLog.count("Invalid allocator", ANDROID_LOG_ERROR));
    // Not stored: the key is unknown afterwards.
    EXPECT_EQ(-1, deactivate(kSole, kKeyWithoutAllocator, 0, "b"));
    EXPECT_TRUE(mLog.contains("Failed to find allocator: 99", ANDROID_LOG_ERROR));

    // State changes and balances go on for the others.
    EXPECT_EQ(0, Fields(kSole, ACTION_SCREEN_STATE).i64(60).flag(false).send());
    EXPECT_EQ(0, balanceAt(kSole, 100));
    Buckets off = Buckets().set(BUCKET_BACKGROUND, 40, 40).set(BUCKET_SCREEN_OFF, 40, 40);
    EXPECT_EQ(std::vector<Bytes>{elementReply(1, 0, 100, "a", screenOnBackground(60, 60) + off)},
              replyBytes(*listener));
}

} // namespace
