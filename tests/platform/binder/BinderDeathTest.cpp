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

// One death of a serving process: the call in flight, later calls and the
// objects it served all fail as dead, and each link is told once.
TEST_F(BinderDeathTest, ADeathFailsEveryCallAndIsToldOncePerLink) {
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
    ASSERT_EQ(android::NO_ERROR, proxy->transact(kelvo::test::kSameObject, data, &reply));
    EXPECT_EQ(proxy.get(), reply.readStrongBinder().get());

    sp<DeathCounter> first = new DeathCounter();
    sp<DeathCounter> second = new DeathCounter();
    sp<DeathCounter> dropped = new DeathCounter();
    sp<DeathCounter> ofObject = new DeathCounter();
    ASSERT_EQ(android::NO_ERROR, proxy->linkToDeath(first));
    ASSERT_EQ(android::NO_ERROR, proxy->linkToDeath(second, reinterpret_cast<void*>(2)));
    ASSERT_EQ(android::NO_ERROR, proxy->linkToDeath(dropped, reinterpret_cast<void*>(7)));
    ASSERT_EQ(android::NO_ERROR, object->linkToDeath(ofObject));
    // An unlinked recipient is not told; the cookie is part of the link.
    EXPECT_EQ(android::NAME_NOT_FOUND, proxy->unlinkToDeath(dropped));
    android::wp<IBinder::DeathRecipient> out;
    EXPECT_EQ(android::NO_ERROR, proxy->unlinkToDeath(dropped, reinterpret_cast<void*>(7), 0, &out));
    EXPECT_EQ(dropped.get(), out.promote().get());
    EXPECT_EQ(android::NAME_NOT_FOUND, proxy->unlinkToDeath(dropped, reinterpret_cast<void*>(7)));

    // A call waits inside the service (up to 10 s) when the child dies.
    auto call = std::async(std::launch::async, [proxy] {
        Parcel in;
        Parcel answer;
        in.writeInt32(2);
        return proxy->transact(kelvo::test::kBlock, in, &answer);
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    Clock::time_point killed = Clock::now();
    killRemote();
    ASSERT_EQ(std::future_status::ready, call.wait_for(std::chrono::seconds(8)));
    EXPECT_EQ(android::DEAD_OBJECT, call.get());
    EXPECT_LT(Clock::now() - killed, std::chrono::seconds(8));
    ASSERT_TRUE(kelvo::test::waitFor(
        [&] { return first->count() > 0 && second->count() > 0 && ofObject->count() > 0; },
        std::chrono::seconds(10)));
    EXPECT_NE(std::this_thread::get_id(), first->thread());
    EXPECT_EQ(proxy.get(), first->who().promote().get());
    EXPECT_FALSE(proxy->isBinderAlive());

    // Calls now fail at once, whatever they are; links are refused.
    EXPECT_EQ(android::DEAD_OBJECT, kelvo::test::echo(proxy, 2));
    EXPECT_EQ(android::DEAD_OBJECT, kelvo::test::echo(object, 2));
    EXPECT_EQ(android::DEAD_OBJECT, proxy->pingBinder());
    EXPECT_EQ(android::DEAD_OBJECT,
              proxy->transact(kelvo::test::kRecord, data, nullptr, IBinder::FLAG_ONEWAY));
    sp<DeathCounter> late = new DeathCounter();
    EXPECT_EQ(android::DEAD_OBJECT, proxy->linkToDeath(late));
    EXPECT_EQ(android::DEAD_OBJECT, proxy->unlinkToDeath(first));

    // A dead server's socket is no service; a restarted one is another
    // object, which the old proxy never reaches.
    EXPECT_EQ(nullptr, android::defaultServiceManager()->checkService(String16("test.remote")));
    sp<IBinder> after = startRemote();
    ASSERT_NE(nullptr, after);
    EXPECT_NE(proxy.get(), after.get());
    EXPECT_EQ(android::NO_ERROR, kelvo::test::echo(after, 4));
    EXPECT_EQ(android::DEAD_OBJECT, kelvo::test::echo(proxy, 3));

    // However often the death shows, each link is told once.
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(1, first->count());
    EXPECT_EQ(1, second->count());
    EXPECT_EQ(1, ofObject->count());
    EXPECT_EQ(0, late->count());
    EXPECT_EQ(0, dropped->count());
}

// Many threads call several services while one of them dies and comes back:
// every call is answered or fails as dead, nothing hangs or crashes, and no
// link is told of a death twice.
TEST(BinderStressTest, CallsAreAnsweredOrDeadWhileAServiceRestarts) {
    const char* const services[] = {"stress.local.a", "stress.local.b", "stress.remote"};
    kelvo::test::TempRoot root;
    kelvo::test::ServiceWait wait(10000);
    auto sm = android::defaultServiceManager();
    for (int i = 0; i < 2; ++i) {
        ASSERT_EQ(android::NO_ERROR,
                  sm->addService(String16(services[i]), new kelvo::test::TestService()));
    }
    sp<IBinder> first;
    std::atomic<pid_t> remote{kelvo::test::startRemoteService(services[2], &first)};
    ASSERT_NE(nullptr, first);

    std::atomic<int> answered{0}, dead{0}, deathsTold{0};
    std::atomic<bool> stop{false};
    std::mutex lock;
    std::vector<std::string> wrong;
    auto bad = [&](const std::string& what) {
        std::lock_guard<std::mutex> guard(lock);
        wrong.push_back(what);
    };
    std::vector<std::thread> callers;
    for (int t = 0; t < 8; ++t) {
        callers.emplace_back([&, t] {
            sp<IBinder> proxies[3];
            std::vector<sp<DeathCounter>> counters;
            for (int i = 0; !stop.load() && i < 20000; ++i) {
                int which = (i + t) % 3;
                if (proxies[which] == nullptr || !proxies[which]->isBinderAlive()) {
                    proxies[which] = sm->checkService(String16(services[which]));
                    if (proxies[which] == nullptr) {
                        dead++;  // between a kill and the restart
                        continue;
                    }
                    sp<DeathCounter> counter = new DeathCounter();
                    if (which == 2 && t % 2 == 0 &&
                        proxies[which]->linkToDeath(counter) == android::NO_ERROR) {
                        counters.push_back(counter);
                    }
                }
                android::status_t err;
                int32_t answer = i + 1;
                if (i % 7 == 0) {
                    Parcel data;
                    data.writeInt32(i);
                    err = proxies[which]->transact(kelvo::test::kRecord, data, nullptr,
                                                   IBinder::FLAG_ONEWAY);
                } else {
                    err = kelvo::test::echo(proxies[which], i, &answer);
                }
                if (err == android::NO_ERROR && answer == i + 1) {
                    answered++;
                } else if (err == android::DEAD_OBJECT && which == 2) {
                    dead++;
                } else {
                    bad(std::string(services[which]) + " gave " + std::to_string(err) + "/" +
                        std::to_string(answer));
                }
            }
            for (const auto& counter : counters) {
                if (counter->count() > 1) {
                    bad("a death told twice");
                }
                deathsTold += counter->count();
            }
        });
    }

    for (int r = 0; r < 6; ++r) {
        std::this_thread::sleep_for(std::chrono::milliseconds(150));
        kelvo::test::killChild(remote.load());
        std::this_thread::sleep_for(std::chrono::milliseconds(30));
        remote = kelvo::test::forkService(services[2]);
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
        kelvo::ServiceControl::stopService(String16(services[i]));
    }
    EXPECT_EQ(0u, wrong.size()) << wrong.front();
    EXPECT_GT(answered.load(), 8 * 10);
    EXPECT_GT(dead.load(), 0);
    EXPECT_GT(deathsTold.load(), 0);
}

} // namespace
