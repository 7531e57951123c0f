#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <climits>
#include <thread>
#include <vector>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "common/RecordingHandler.h"
#include "common/TestEnv.h"
#include "utils/HandlerThread.h"

using android::Parcel;
using android::sp;
using kelvo::HandlerThread;
using kelvo::ParcelMessage;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

// Records what it receives (the body: one int64 value). Code 7 sleeps for
// the value's milliseconds then replies; code 8 replies with the value
// doubled; code 10 holds the thread until released.
class RecordingThread : public kelvo::test::RecordingHandler {
public:
    explicit RecordingThread(const char* name = "RecordingThread") : RecordingHandler(name) {}

    int32_t handleParcelMessage(const ParcelMessage& msg) override {
        RecordingHandler::handleParcelMessage(msg);
        msg.getParcel().setDataPosition(0);
        int32_t value = static_cast<int32_t>(msg.getParcel().readInt64());
        switch (msg.what) {
            case 7:
                std::this_thread::sleep_for(std::chrono::milliseconds(value));
                msg.getReply()->writeInt32(value);
                return 70;
            case 8:
                msg.getReply()->writeInt32(value * 2);
                return 80;
            case 10:
                while (!mRelease.load()) {
                    std::this_thread::sleep_for(std::chrono::milliseconds(1));
                }
                return 100;
            default:
                return 0;
        }
    }
    size_t count() { return got().size(); }

    std::atomic<bool> mRelease{false};
};

ParcelMessage makeMessage(int32_t what, int32_t value, Parcel* reply = nullptr) {
    Parcel p;
    p.writeInt64(value);
    return ParcelMessage(kelvo::MESSAGE_CUSTOMIZED, what, p, reply);
}

class HandlerThreadTest : public ::testing::Test {
protected:
    void TearDown() override { HandlerThread::setSyncTimeoutMs(0); }
};

} // namespace

TEST_F(HandlerThreadTest, RemovedMessagesAreNeverHandledNorWaitedFor) {
    sp<RecordingThread> t = new RecordingThread();
    int32_t late = t->sendMessageDelayed(ms2ns(300), makeMessage(1, 1));
    int32_t removed = t->sendMessageDelayed(ms2ns(300), makeMessage(1, 2));
    ASSERT_GE(late, 0);
    ASSERT_GE(removed, 0);
    EXPECT_EQ(0, t->removeMessage(removed));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(0u, t->count());
    ASSERT_TRUE(waitFor([&] { return t->count() == 1; }));
    EXPECT_EQ(1, t->got()[0].time);

    // An id already delivered (or removed) is unknown.
    LogCapture log;
    EXPECT_EQ(-4, t->removeMessage(late));
    EXPECT_EQ(-4, t->removeMessage(removed));
    EXPECT_TRUE(log.contains("removeMessage# Invalid message id[" + std::to_string(late) +
                             "] in RecordingThread", ANDROID_LOG_ERROR));

    // The synchronous waiter of a removed message returns at once.
    t->sendMessage(makeMessage(10, 0));
    ASSERT_TRUE(waitFor([&] { return t->count() == 2; }));
    auto start = std::chrono::steady_clock::now();
    std::thread waiter([&] { EXPECT_EQ(-1, t->sendMessageSync(makeMessage(8, 1))); });
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    t->removeAllMessages();
    waiter.join();
    // Far below the 20 s time-out.
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
    t->mRelease = true;
    t->requestThreadExit();
}

TEST_F(HandlerThreadTest, SynchronousTimeOutDiscardsTheLateReply) {
    HandlerThread::setSyncTimeoutMs(100);
    sp<RecordingThread> t = new RecordingThread();
    LogCapture log;
    Parcel reply;
    reply.writeInt32(-7);
    EXPECT_EQ(-1, t->sendMessageSync(makeMessage(7, 400, &reply)));
    EXPECT_TRUE(log.contains("Failed to send synchronized message to RecordingThread: 110, "
                             "result: -1",
                             ANDROID_LOG_ERROR));
    // The handler finishes later; its reply must not reach the caller's parcel.
    ASSERT_TRUE(waitFor([&] { return t->count() == 1; }));
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    EXPECT_EQ(4u, reply.dataSize());
    reply.setDataPosition(0);
    EXPECT_EQ(-7, reply.readInt32());
    // The thread still serves synchronous requests afterwards.
    Parcel again;
    EXPECT_EQ(80, t->sendMessageSync(makeMessage(8, 5, &again)));
    EXPECT_EQ(10, again.readInt32());
    t->requestThreadExit();
}

TEST_F(HandlerThreadTest, ManyConcurrentSynchronousSendersEachGetTheirOwnAnswer) {
    sp<RecordingThread> t = new RecordingThread();
    std::atomic<int> wrong{0};
    std::vector<std::thread> senders;
    for (int s = 0; s < 4; ++s) {
        senders.emplace_back([&, s] {
            for (int i = 0; i < 200; ++i) {
                Parcel reply;
                int32_t value = s * 1000 + i;
                if (t->sendMessageSync(makeMessage(8, value, &reply)) != 80 ||
                    reply.readInt32() != value * 2) {
                    wrong++;
                }
            }
        });
    }
    for (auto& s : senders) s.join();
    EXPECT_EQ(0, wrong.load());
    t->requestThreadExit();
}

TEST_F(HandlerThreadTest, AfterExitSendsAreRefusedAndQueuedMessagesDropped) {
    sp<RecordingThread> t = new RecordingThread();
    // Hold the thread busy, queue more behind it, then ask it to exit.
    t->sendMessage(makeMessage(10, 0));
    ASSERT_TRUE(waitFor([&] { return t->count() == 1; }));
    t->sendMessage(makeMessage(1, 1));
    t->sendMessage(makeMessage(1, 2));

    LogCapture log;
    uint64_t refused = kelvo::HealthCounters::get(kelvo::Health::MessagesRefused);
    uint64_t dropped = kelvo::HealthCounters::get(kelvo::Health::MessagesDropped);
    t->requestThreadExit();
    EXPECT_EQ(-2, t->sendMessage(makeMessage(1, 3)));
    Parcel reply;
    EXPECT_EQ(-2, t->sendMessageSync(makeMessage(8, 3, &reply)));
    EXPECT_EQ(2u, log.count("RecordingThread is not running or is pending to exit",
                            ANDROID_LOG_ERROR));

    t->mRelease = true;
    t->join();
    EXPECT_EQ(1u, t->count());
    EXPECT_TRUE(log.contains("RecordingThread is pending to exit", ANDROID_LOG_ERROR));
    EXPECT_EQ(refused + 2, kelvo::HealthCounters::get(kelvo::Health::MessagesRefused));
    EXPECT_EQ(dropped + 2, kelvo::HealthCounters::get(kelvo::Health::MessagesDropped));
}

TEST_F(HandlerThreadTest, DeliversInOrderWithIdsThatWrapToZeroAndSkipPendingOnes) {
    sp<RecordingThread> t = new RecordingThread();
    // Ids run 1, 2, 3 ...
    for (int i = 1; i <= 50; ++i) {
        EXPECT_EQ(i, t->sendMessage(makeMessage(1, i)));
    }
    t->setLastMessageId(INT32_MAX - 1);
    // Busy with this one, so the next stay pending.
    EXPECT_EQ(INT32_MAX, t->sendMessage(makeMessage(10, 51)));
    ASSERT_TRUE(waitFor([&] { return t->count() == 51; }));
    EXPECT_EQ(0, t->sendMessage(makeMessage(1, 52)));
    EXPECT_EQ(1, t->sendMessage(makeMessage(1, 53)));
    // Wrapping again lands on pending ids 0 and 1: both are skipped.
    t->setLastMessageId(INT32_MAX);
    EXPECT_EQ(2, t->sendMessage(makeMessage(1, 54)));
    t->mRelease = true;
    ASSERT_TRUE(waitFor([&] { return t->count() == 54; }));
    std::vector<kelvo::test::RecordingHandler::Got> got = t->got();
    for (int i = 0; i < 54; ++i) {
        EXPECT_EQ(i + 1, got[i].time);
    }
    t->requestThreadExit();
}
