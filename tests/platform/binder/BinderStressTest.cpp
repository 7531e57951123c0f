// Many threads call several services while one of them dies and comes back:
// every call is answered or fails as dead, nothing hangs or crashes.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "common/TestEnv.h"
#include "platform/binder/BinderTestUtil.h"

using android::IBinder;
using android::Parcel;
using android::sp;
using android::String16;

namespace {

constexpr int kThreads = 8;
constexpr int kRestarts = 6;
const char* const kServices[] = {"stress.local.a", "stress.local.b", "stress.remote"};

struct Tally {
    std::atomic<int> answered{0};
    std::atomic<int> dead{0};
    std::mutex lock;
    std::vector<std::string> wrong;

    void bad(const std::string& what) {
        std::lock_guard<std::mutex> guard(lock);
        wrong.push_back(what);
    }
};

TEST(BinderStressTest, CallsAreAnsweredOrDeadWhileAServiceRestarts) {
    kelvo::test::TempRoot root;
    kelvo::test::ServiceWait wait(10000);
    auto sm = android::defaultServiceManager();
    sp<kelvo::test::TestService> local = new kelvo::test::TestService();
    ASSERT_EQ(android::NO_ERROR, sm->addService(String16(kServices[0]), local));
    ASSERT_EQ(android::NO_ERROR,
              sm->addService(String16(kServices[1]), new kelvo::test::TestService()));
    sp<IBinder> first;
    std::atomic<pid_t> remote{kelvo::test::startRemoteService(kServices[2], &first)};
    ASSERT_NE(nullptr, first);

    Tally tally;
    std::atomic<bool> stop{false};
    std::atomic<int> deathsTold{0};
    std::vector<std::thread> callers;
    for (int t = 0; t < kThreads; ++t) {
        callers.emplace_back([&, t] {
            sp<IBinder> proxies[3];
            std::vector<sp<kelvo::test::DeathCounter>> counters;
            for (int i = 0; !stop.load() && i < 20000; ++i) {
                int which = (i + t) % 3;
                if (proxies[which] == nullptr || !proxies[which]->isBinderAlive()) {
                    proxies[which] = sm->checkService(String16(kServices[which]));
                    if (proxies[which] == nullptr) {
                        tally.dead++;  // between a kill and the restart
                        continue;
                    }
                    if (which == 2 && t % 2 == 0) {
                        sp<kelvo::test::DeathCounter> counter = new kelvo::test::DeathCounter();
                        if (proxies[which]->linkToDeath(counter) == android::NO_ERROR) {
                            counters.push_back(counter);
                        }
                    }
                }
                android::status_t err;
                if (i % 7 == 0) {
                    Parcel data;
                    data.writeInt32(i);
                    err = proxies[which]->transact(kelvo::test::kRecord, data, nullptr,
                                                   IBinder::FLAG_ONEWAY);
                } else {
                    int32_t answer = 0;
                    err = kelvo::test::echo(proxies[which], i, &answer);
                    if (err == android::NO_ERROR && answer != i + 1) {
                        tally.bad("wrong answer from " + std::string(kServices[which]));
                        continue;
                    }
                }
                if (err == android::NO_ERROR) {
                    tally.answered++;
                } else if (err == android::DEAD_OBJECT && which == 2) {
                    tally.dead++;
                } else {
                    tally.bad(std::string(kServices[which]) + " failed with " + std::to_string(err));
                }
            }
            for (const auto& counter : counters) {
                if (counter->count() > 1) {
                    tally.bad("a death told twice");  // each link is told once at most
                }
                deathsTold += counter->count();
            }
        });
    }

    for (int r = 0; r < kRestarts; ++r) {
        std::this_thread::sleep_for(std::chrono::milliseconds(150));
        kelvo::test::killChild(remote.load());
        std::this_thread::sleep_for(std::chrono::milliseconds(30));
        remote = kelvo::test::forkService(kServices[2]);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(150));
    stop = true;
    // A child forked from this busy process may itself be stuck (a lock
    // some other thread held at the fork): its death ends any call waiting
    // on it, as a death must.
    kelvo::test::killChild(remote.load());
    for (std::thread& t : callers) {
        t.join();
    }
    for (int i = 0; i < 2; ++i) {
        kelvo::ServiceControl::stopService(String16(kServices[i]));
    }

    EXPECT_EQ(0u, tally.wrong.size()) << tally.wrong.front();
    EXPECT_GT(tally.answered.load(), kThreads * 10);
    EXPECT_GT(tally.dead.load(), 0);
    EXPECT_GT(deathsTold.load(), 0);
}

} // namespace
