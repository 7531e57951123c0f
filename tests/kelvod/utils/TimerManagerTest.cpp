#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "KelvoLog.h"
#include "common/RecordingHandler.h"
#include "common/TestEnv.h"
#include "utils/HandlerThread.h"
#include "utils/TimerCallback.h"
#include "utils/TimerManager.h"

using android::sp;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;
using namespace std::chrono_literals;

namespace {

// Records what reaches it; counts the timer messages of one id.
class RecordingThread : public kelvo::test::RecordingHandler {
public:
    explicit RecordingThread(const char* name) : RecordingHandler(name) {}
    size_t timerCount(int32_t id) { return count(kelvo::MESSAGE_TIMER, id); }
};

// Timer descriptors currently open in this process.
std::set<int> openTimerFds() {
    std::set<int> fds;
    DIR* dir = opendir("/proc/self/fd");
    if (dir == nullptr) return fds;
    while (struct dirent* entry = readdir(dir)) {
        std::string path = std::string("/proc/self/fd/") + entry->d_name;
        char target[64] = {};
        ssize_t n = readlink(path.c_str(), target, sizeof(target) - 1);
        if (n > 0 && std::string(target, n) == "anon_inode:[timerfd]") {
            fds.insert(atoi(entry->d_name));
        }
    }
    closedir(dir);
    return fds;
}

class TimerManagerTest : public ::testing::Test {
protected:
    void SetUp() override {
        mInfoWas = kelvo::gLogInfoEnable.load();
        kelvo::gLogInfoEnable.store(1);
        mManager = TimerManager::getInstance();
        mThread = new RecordingThread("TimerTarget");
    }

    void TearDown() override {
        for (const sp<TimerCallback>& callback : mCallbacks) {
            mManager->removeTimer(callback);
        }
        mThread->requestThreadExit();
        mThread->join();
        kelvo::gLogInfoEnable.store(mInfoWas);
    }

    sp<TimerCallback> makeCallback(int32_t id) {
        sp<TimerCallback> callback = new TimerCallback(mThread, id);
        mCallbacks.push_back(callback);
        return callback;
    }

    TimerManager* mManager = nullptr;
    sp<RecordingThread> mThread;
    std::vector<sp<TimerCallback>> mCallbacks;
    int32_t mInfoWas = 0;
};

TEST_F(TimerManagerTest, OneShotFiresOncePeriodicRepeatsAndADuplicateIsRefused) {
    LogCapture log;
    sp<TimerCallback> once = makeCallback(7);
    sp<TimerCallback> a = makeCallback(1);
    sp<TimerCallback> b = makeCallback(2);
    ASSERT_EQ(0, mManager->addTimer(0, 0, once));
    ASSERT_EQ(0, mManager->addTimer(10, 20, a));
    ASSERT_EQ(0, mManager->addTimer(0, 25, b));
    // Had the duplicate replaced the first timer, nothing would come for a
    // minute.
    EXPECT_EQ(-13, mManager->addTimer(60000, 0, a));
    EXPECT_TRUE(log.contains("[TimerManager.cpp] addTimer# This callback has been added",
                             ANDROID_LOG_INFO));
    ASSERT_TRUE(waitFor([&] { return mThread->timerCount(1) >= 5 && mThread->timerCount(2) >= 5; },
                        3000ms));
    ASSERT_TRUE(mThread->drain());
    EXPECT_EQ(1u, mThread->timerCount(7));
    // Spent: nothing left to wait for; the periodic one is armed again.
    EXPECT_EQ(0, mManager->getExpireTime(once));
    EXPECT_LE(mManager->getExpireTime(a), 20);
    for (const auto& got : mThread->got()) {
        if (got.type == kelvo::MESSAGE_TIMER) {
            EXPECT_TRUE(got.what == 1 || got.what == 2 || got.what == 7) << got.what;
        }
    }
}

TEST_F(TimerManagerTest, ExpireTimeFollowsReschedulesAndBadTimesAreRefused) {
    LogCapture log;
    sp<TimerCallback> callback = makeCallback(5);
    EXPECT_EQ(-5, mManager->addTimer(-1, 0, callback));
    EXPECT_EQ(-5, mManager->addTimer(0, -1, callback));
    EXPECT_EQ(-5, mManager->addTimer(0, 0, nullptr));
    // None of the refused adds left a timer behind.
    EXPECT_EQ(-4, mManager->getExpireTime(callback));
    EXPECT_EQ(3u, log.count("[TimerManager.cpp] addTimer# Invalid parameter", ANDROID_LOG_ERROR));

    ASSERT_EQ(0, mManager->addTimer(3000, 0, callback));
    EXPECT_GT(mManager->getExpireTime(callback), 2000);
    // Stored times, counted again from now.
    std::this_thread::sleep_for(300ms);
    EXPECT_LE(mManager->getExpireTime(callback), 2700);
    ASSERT_EQ(0, mManager->rescheduleTimer(callback));
    EXPECT_GT(mManager->getExpireTime(callback), 2800);

    // Negative new times leave the timer as it was; new times replace it.
    EXPECT_EQ(-5, mManager->rescheduleTimer(-5, 0, callback));
    EXPECT_EQ(-5, mManager->rescheduleTimer(0, -5, callback));
    ASSERT_EQ(0, mManager->rescheduleTimer(60000, 0, callback));
    EXPECT_GT(mManager->getExpireTime(callback), 59000);
    std::this_thread::sleep_for(150ms);
    ASSERT_TRUE(mThread->drain());
    EXPECT_EQ(0u, mThread->timerCount(5));

    // From a one-shot far away to a periodic one firing now, and those
    // become the stored times.
    ASSERT_EQ(0, mManager->rescheduleTimer(0, 15, callback));
    EXPECT_TRUE(waitFor([&] { return mThread->timerCount(5) >= 3; }, 2000ms));
    ASSERT_EQ(0, mManager->rescheduleTimer(callback));
    EXPECT_LE(mManager->getExpireTime(callback), 15);
}

// Tells the looper to drop its descriptor after its first expiry, as a
// callback does after an unexpected event.
class DroppingCallback : public TimerCallback {
public:
    DroppingCallback(const sp<HandlerThread>& target, int32_t id) : TimerCallback(target, id) {}
    int handleEvent(int fd, int events, void* data) override {
        int ret = TimerCallback::handleEvent(fd, events, data);
        return mDrop.exchange(false) ? 0 : ret;
    }
    std::atomic<bool> mDrop{true};
};

TEST_F(TimerManagerTest, ReArmedTimerIsWatchedAgainAfterTheLooperDroppedIt) {
    sp<DroppingCallback> dropping = new DroppingCallback(mThread, 12);
    mCallbacks.push_back(dropping);
    ASSERT_EQ(0, mManager->addTimer(0, 20, dropping));
    ASSERT_TRUE(waitFor([&] { return mThread->timerCount(12) == 1; }, 2000ms));
    // Periodic, but no longer watched: nothing more arrives.
    std::this_thread::sleep_for(150ms);
    ASSERT_TRUE(mThread->drain());
    EXPECT_EQ(1u, mThread->timerCount(12));
    ASSERT_EQ(0, mManager->rescheduleTimer(0, 20, dropping));
    EXPECT_TRUE(waitFor([&] { return mThread->timerCount(12) >= 3; }, 2000ms));
}

TEST_F(TimerManagerTest, RearmAddsATimerTheManagerLost) {
    sp<TimerCallback> callback = makeCallback(13);
    // Never added (or erased by a failed reschedule): a plain reschedule
    // gives up, a re-arm adds it with the same times.
    EXPECT_EQ(-4, mManager->rescheduleTimer(0, 20, callback));
    ASSERT_EQ(0, mManager->rearmTimer(0, 20, callback));
    ASSERT_TRUE(waitFor([&] { return mThread->timerCount(13) >= 2; }, 2000ms));
    ASSERT_EQ(0, mManager->rearmTimer(60000, 0, callback));
    EXPECT_GT(mManager->getExpireTime(callback), 50000);
    EXPECT_EQ(-5, mManager->rearmTimer(-1, 0, callback));
}

TEST_F(TimerManagerTest, RemovedAndRescheduledTimersRacingTheirExpiriesStayQuiet) {
    LogCapture log;
    constexpr int kTimers = 24;
    std::set<int> fdsBefore = openTimerFds();
    std::vector<sp<TimerCallback>> callbacks;
    for (int i = 0; i < kTimers; ++i) {
        callbacks.push_back(makeCallback(100 + i));
        ASSERT_EQ(0, mManager->addTimer(0, 1, callbacks.back()));
    }

    // Two threads remove and add back halves of the timers while they fire,
    // so descriptors close and their numbers are reused within one poll
    // batch.
    std::atomic<bool> stop{false};
    std::atomic<int> failures{0};
    auto churn = [&](int first) {
        while (!stop.load()) {
            for (int i = first; i < kTimers; i += 2) {
                if (mManager->removeTimer(callbacks[i]) != 0 ||
                    mManager->addTimer(0, 1, callbacks[i]) != 0) {
                    failures++;
                }
            }
        }
    };
    // A third one flips a timer between due at once and a minute away: an
    // expiry the poll saw may be gone when the timer thread reads it.
    sp<TimerCallback> racing = makeCallback(10);
    ASSERT_EQ(0, mManager->addTimer(1, 1, racing));
    std::thread rearm([&] {
        for (bool soon = true; !stop.load(); soon = !soon) {
            failures += mManager->rescheduleTimer(soon ? 0 : 60000, soon ? 1 : 0, racing) != 0;
        }
    });
    std::thread even(churn, 0);
    std::thread odd(churn, 1);
    std::this_thread::sleep_for(300ms);
    stop.store(true);
    even.join();
    odd.join();
    rearm.join();
    EXPECT_EQ(0, failures.load());
    ASSERT_EQ(0, mManager->removeTimer(racing));

    for (const sp<TimerCallback>& callback : callbacks) {
        ASSERT_EQ(0, mManager->removeTimer(callback));
    }
    ASSERT_TRUE(mThread->drain());
    std::vector<size_t> settled;
    for (int i = 0; i < kTimers; ++i) {
        settled.push_back(mThread->timerCount(100 + i));
    }
    std::this_thread::sleep_for(200ms);
    ASSERT_TRUE(mThread->drain());
    for (int i = 0; i < kTimers; ++i) {
        EXPECT_EQ(settled[i], mThread->timerCount(100 + i)) << "timer " << 100 + i;
    }
    EXPECT_FALSE(log.contains("Failed to read"));
    EXPECT_FALSE(log.contains("Unexpected events"));

    // Every descriptor was closed, and the timer thread still works.
    sp<TimerCallback> probe = makeCallback(200);
    ASSERT_EQ(0, mManager->addTimer(0, 0, probe));
    EXPECT_TRUE(waitFor([&] { return mThread->timerCount(200) == 1; }, 2000ms));
    ASSERT_EQ(0, mManager->removeTimer(probe));
    EXPECT_EQ(fdsBefore, openTimerFds());
}

} // namespace
