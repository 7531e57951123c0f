// Deaths of services and of the processes that serve them, also under load.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
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
using kelvo::test::DeathCounter;
using Clock = std::chrono::steady_clock;

namespace {

class BinderDeathTest : public ::testing::Test {
protected:
    void TearDown() override {
        for (pid_t pid : mChildren) {
            kelvo::test::killChild(pid);
        }
    }

    // Serves "test.remote" from a child process and returns a proxy to it.
    sp<IBinder> startRemote() {
        sp<IBinder> proxy;
        pid_t pid = kelvo::test::startRemoteService("test.remote", &proxy);
        mChildren.push_back(pid);
        EXPECT_NE(nullptr, proxy);
        return proxy;
    }

    void killRemote() {
        ASSERT_FALSE(mChildren.empty());
        kelvo::test::killChild(mChildren.back());
        mChildren.pop_back();
    }

    kelvo::test::TempRoot mRoot;
    kelvo::test::ServiceWait mWait{10000};
    std::vector<pid_t> mChildren;
};

TEST_F(BinderDeathTest, DeathIsToldOnceOnTheDeathThread) {
    sp<IBinder> proxy = startRemote();
    ASSERT_NE(nullptr, proxy);
    ASSERT_EQ(android::NO_ERROR, kelvo::test::echo(proxy, 1));
    sp<DeathCounter> first = new DeathCounter();
    sp<DeathCounter> second = new DeathCounter();
    sp<DeathCounter> dropped = new DeathCounter();
    ASSERT_EQ(android::NO_ERROR, proxy->linkToDeath(first));
    ASSERT_EQ(android::NO_ERROR, proxy->linkToDeath(second, reinterpret_cast<void*>(2)));
    ASSERT_EQ(android::NO_ERROR, proxy->linkToDeath(dropped, reinterpret_cast<void*>(7)));
    // An unlinked recipient is not told; the cookie is part of the link.
    EXPECT_EQ(android::NAME_NOT_FOUND, proxy->unlinkToDeath(dropped));
    android::wp<IBinder::DeathRecipient> out;
    EXPECT_EQ(android::NO_ERROR, proxy->unlinkToDeath(dropped, reinterpret_cast<void*>(7), 0, &out));
    EXPECT_EQ(dropped.get(), out.promote().get());
    EXPECT_EQ(android::NAME_NOT_FOUND, proxy->unlinkToDeath(dropped, reinterpret_cast<void*>(7)));

    killRemote();
    ASSERT_TRUE(kelvo::test::waitFor([&] { return first->count() > 0 && second->count() > 0; },
                                     std::chrono::seconds(10)));
    EXPECT_NE(std::this_thread::get_id(), first->thread());
    EXPECT_EQ(proxy.get(), first->who().promote().get());
    EXPECT_FALSE(proxy->isBinderAlive());

    // Calls now fail at once, whatever they are; links are refused.
    EXPECT_EQ(android::DEAD_OBJECT, kelvo::test::echo(proxy, 2));
    EXPECT_EQ(android::DEAD_OBJECT, proxy->pingBinder());
    Parcel data;
    EXPECT_EQ(android::DEAD_OBJECT,
              proxy->transact(kelvo::test::kRecord, data, nullptr, IBinder::FLAG_ONEWAY));
    sp<DeathCounter> late = new DeathCounter();
    EXPECT_EQ(android::DEAD_OBJECT, proxy->linkToDeath(late));
    EXPECT_EQ(android::DEAD_OBJECT, proxy->unlinkToDeath(first));

    // However often the death shows, each link is told once.
    EXPECT_EQ(android::DEAD_OBJECT, kelvo::test::echo(proxy, 3));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(1, first->count());
    EXPECT_EQ(1, second->count());
    EXPECT_EQ(0, late->count());
    EXPECT_EQ(0, dropped->count());
}

TEST_F(BinderDeathTest, DeathDuringACallFailsTheCall) {
    sp<IBinder> proxy = startRemote();
    ASSERT_NE(nullptr, proxy);
    sp<DeathCounter> counter = new DeathCounter();
    ASSERT_EQ(android::NO_ERROR, proxy->linkToDeath(counter));

    // The call waits inside the service (up to 10 s) until the child dies.
    auto call = std::async(std::launch::async, [proxy] {
        Parcel data;
        Parcel reply;
        data.writeInt32(2);
        return proxy->transact(kelvo::test::kBlock, data, &reply);
    });
    // Let it get there before the kill.
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    Clock::time_point killed = Clock::now();
    killRemote();
    ASSERT_EQ(std::future_status::ready, call.wait_for(std::chrono::seconds(8)));
    EXPECT_EQ(android::DEAD_OBJECT, call.get());
    EXPECT_LT(Clock::now() - killed, std::chrono::seconds(8));
    EXPECT_TRUE(
        kelvo::test::waitFor([&] { return counter->count() == 1; }, std::chrono::seconds(10)));
}

TEST_F(BinderDeathTest, ObjectsOfADeadProcessDieWithIt) {
    sp<IBinder> proxy = startRemote();
    ASSERT_NE(nullptr, proxy);
    Parcel data;
    Parcel reply;
    ASSERT_EQ(android::NO_ERROR, proxy->transact(kelvo::test::kNewObject, data, &reply));
    sp<IBinder> object = reply.readStrongBinder();
    ASSERT_NE(nullptr, object);
    ASSERT_NE(nullptr, object->remoteBinder());
    ASSERT_EQ(android::NO_ERROR, kelvo::test::echo(object, 1));
    // The same remote object read twice is the same proxy.
    Parcel again;
    ASSERT_EQ(android::NO_ERROR, proxy->transact(kelvo::test::kSameObject, data, &again));
    EXPECT_EQ(proxy.get(), again.readStrongBinder().get());

    sp<DeathCounter> counter = new DeathCounter();
    ASSERT_EQ(android::NO_ERROR, object->linkToDeath(counter));
    killRemote();
    ASSERT_TRUE(
        kelvo::test::waitFor([&] { return counter->count() == 1; }, std::chrono::seconds(10)));
    EXPECT_EQ(android::DEAD_OBJECT, kelvo::test::echo(object, 1));
    // A dead server's socket is no service; a restarted one is another
    // object, which the old proxy never reaches.
    EXPECT_EQ(nullptr, android::defaultServiceManager()->checkService(String16("test.remote")));
    sp<IBinder> after = startRemote();
    ASSERT_NE(nullptr, after);
    EXPECT_NE(proxy.get(), after.get());
    EXPECT_EQ(android::NO_ERROR, kelvo::test::echo(after, 4));
    EXPECT_EQ(android::DEAD_OBJECT, kelvo::test::echo(proxy, 1));
    EXPECT_FALSE(proxy->isBinderAlive());
}

// Many threads call several services while one of them dies and comes back:
// every call is answered or fails as dead, nothing hangs or crashes.
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
