// The accounter table behind the entry functions: lookup, lazy creation,
// listeners and the routing of action parcels.

#include <gtest/gtest.h>

#include <stdint.h>

#include <atomic>

#include <binder/Parcel.h>

#include "common/TestEnv.h"
#include "libkelvo/LibraryTestUtil.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using namespace kelvo::test;

namespace {

class KelvoLibAgentTest : public ::testing::Test {
protected:
    LibraryFixture mLibrary;
    LogCapture mLog;
};

TEST_F(KelvoLibAgentTest, AccountersAreCreatedOnceOnFirstUse) {
    std::atomic<int> created{0};
    KelvoLibAgent::getInstance()->setAccounterFactoryForTest(ACCOUNTER_GPU, [&created] {
        created++;
        return std::make_unique<SoleTestAccounter>();
    });
    EXPECT_EQ(0, created.load());
    // Registering a listener creates the accounter.
    auto listener = listenTo(ACCOUNTER_GPU);
    EXPECT_EQ(1, created.load());
    ASSERT_EQ(0, setPower(ACCOUNTER_GPU, 0, 0, 1000));
    ASSERT_EQ(0, activate(ACCOUNTER_GPU, 0, 0, "a"));
    ASSERT_EQ(0, unregisterLibraryListener(ACCOUNTER_GPU));
    ASSERT_EQ(0, registerLibraryListener(ACCOUNTER_GPU, listener));
    EXPECT_EQ(1, created.load());
    // The same accounter kept its element.
    ASSERT_EQ(0, deactivate(ACCOUNTER_GPU, 0, 5, "a"));
    EXPECT_EQ(std::vector<Bytes>{elementReply(0, 0, 5, "a", screenOnBackground(5, 5))},
              replyBytes(*listener));
}

TEST_F(KelvoLibAgentTest, OneListenerPerAccounterOfAKnownType) {
    for (int32_t type : {12, -1}) {
        EXPECT_EQ(-1, registerLibraryListener(type, new RecordingListener()));
        EXPECT_EQ(-1, unregisterLibraryListener(type));
    }
    EXPECT_EQ(-1, registerLibraryListener(kSole, nullptr));
    EXPECT_TRUE(mLog.contains("[KelvoLibAgent.cpp] registerListener# Invalid parameter"));
    sp<RecordingListener> first = listenTo(kSole);
    sp<RecordingListener> second = listenTo(kSole);
    sp<RecordingListener> other = listenTo(kShared);
    ASSERT_EQ(0, setPower(kSole, 0, 0, 1000));
    ASSERT_EQ(0, activate(kSole, 0, 0, "a"));
    // The parcel is read from its start whatever its position.
    Fields removal(kSole, ACTION_DEACTIVATE);
    removal.i32(0).i64(10).str("a");
    removal.parcel().setDataPosition(removal.parcel().dataSize());
    ASSERT_EQ(0, removal.send());
    EXPECT_TRUE(first->mReplies.empty());
    EXPECT_TRUE(other->mReplies.empty());
    ASSERT_EQ(1u, second->mReplies.size());
    EXPECT_EQ(0u, second->mPosition[0]);

    // Unregistered: the records are dropped and the library lets go of it.
    ASSERT_EQ(0, unregisterLibraryListener(kSole));
    EXPECT_EQ(1, second->getStrongCount());
    ASSERT_EQ(0, activate(kSole, 0, 10, "a"));
    EXPECT_EQ(-1, deactivate(kSole, 0, 20, "a"));
    EXPECT_TRUE(mLog.contains("Invalid listener", ANDROID_LOG_ERROR));
    // The element is gone all the same.
    ASSERT_EQ(0, registerLibraryListener(kSole, second));
    EXPECT_EQ(0, balanceAt(kSole, 30));
    EXPECT_EQ(1u, second->mReplies.size());
}

// Hands a new action to the accounter that is calling it.
class ReenteringListener : public LibraryListener {
public:
    int32_t handleLibraryEvent(int32_t event, const Parcel& reply) override {
        mNestedResult = activate(kSole, 0, 100, "b");
        mReplies++;
        return 0;
    }
    int32_t mNestedResult = 0;
    int mReplies = 0;
};

TEST_F(KelvoLibAgentTest, AListenerCannotActOnItsOwnAccounter) {
    sp<ReenteringListener> listener = new ReenteringListener();
    ASSERT_EQ(0, registerLibraryListener(kSole, listener));
    ASSERT_EQ(0, setPower(kSole, 0, 0, 1000));
    ASSERT_EQ(0, activate(kSole, 0, 0, "a"));
    EXPECT_EQ(0, deactivate(kSole, 0, 10, "a"));
    EXPECT_EQ(1, listener->mReplies);
    EXPECT_EQ(-1, listener->mNestedResult);
    EXPECT_TRUE(mLog.contains("Nested action refused: 4", ANDROID_LOG_ERROR));
    // The accounter still serves its own caller afterwards.
    EXPECT_EQ(0, activate(kSole, 0, 20, "c"));
}

} // namespace
