#include <gtest/gtest.h>

#include <atomic>
#include <cstdio>
#include <unistd.h>
#include <memory>
#include <mutex>
#include <thread>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "common/TestEnv.h"
#include "core/KelvoAgent.h"

using android::Parcel;
using android::sp;
using android::String8;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

std::mutex gEventsLock;
std::vector<std::string> gEvents;

void record(const std::string& event) {
    std::lock_guard<std::mutex> guard(gEventsLock);
    gEvents.push_back(event);
}

std::vector<std::string> events() {
    std::lock_guard<std::mutex> guard(gEventsLock);
    return gEvents;
}

// An operator that records its start-up steps and answers requests: code 1
// replies with its name, code 3 (an error row) is recorded with its text and
// handed on to handler 2 (code 8) when it asks to be stored; code 7 removes
// an unknown message id, code 8 fails with an error line. Routines record
// the parcels of the hourly requests 0, 3 and 4 field by field.
class FakeOperator : public KelvoOperator {
public:
    FakeOperator(const char* name, bool enabled)
        : KelvoOperator(name, -1, 0), mEnabled(enabled) {
        record(std::string("create ") + name);
    }
    int32_t checkEnable() override { return mEnabled ? 0 : -1; }
    int32_t lateInitialize() override {
        record(std::string("init ") + getName());
        return 0;
    }
    int32_t handleCustomized(int32_t code, const Parcel& data, Parcel* reply) override {
        if (std::string(getName()).rfind("FakeRoutine", 0) == 0 && code != 1) {
            std::string r = "routine " + std::to_string(code);
            if (code == 0 || code == 3) r += " " + std::to_string(data.readInt64());
            if (code == 0) r += " " + std::to_string(data.readInt32());
            r += " " + std::to_string(data.readUint32());
            if (code == 3) r += " " + std::to_string(data.readInt64());
            while (code == 4 && data.dataAvail() >= 4) r += " " + std::to_string(data.readUint32());
            record(r + (data.dataAvail() == 0 ? "" : " +extra"));
            return 0;
        }
        if (code == 1) {
            reply->writeString8(String8(getName()));
            return 11;
        }
        if (code == 3) {
            data.readInt64();
            std::string text = data.readString8().string();
            record("error " + text);
            if (text.find("store me") != std::string::npos) {
                KelvoAgent::getInstance()->sendToHandler(2, 8, Parcel(), nullptr, false);
            }
        }
        if (code == 7) removeMessage(999999);
        if (code == 8) {
            KLOGE("Failed to store the error row");
            record("store failed");
        }
        return 0;
    }

private:
    bool mEnabled;
};

template <int N>
sp<KelvoOperator> makeHandler() {
    static const std::string name = "FakeHandler" + std::to_string(N);
    // Handler 1 (the CPU handler's slot) reports its component unsupported.
    return new FakeOperator(name.c_str(), N != 1);
}

template <int N>
sp<KelvoOperator> makeRoutine() {
    static const std::string name = "FakeRoutine" + std::to_string(N);
    return new FakeOperator(name.c_str(), true);
}

bool hasEvent(const std::string& event) {
    for (const std::string& e : events()) {
        if (e == event) return true;
    }
    return false;
}

std::atomic<int> gExitStatus{-1};

void recordExit(int status) {
    gExitStatus = status;
}

class KelvoAgentTest : public ::testing::Test {
protected:
    void SetUp() override {
        {
            std::lock_guard<std::mutex> guard(gEventsLock);
            gEvents.clear();
        }
        // Only the operators a test installs (start-up has defaults).
        for (int i = 0; i < kelvo::HANDLER_COUNT; ++i) KelvoAgent::setHandlerFactory(i, nullptr);
        for (int i = 0; i < kelvo::ROUTINE_COUNT; ++i) KelvoAgent::setRoutineFactory(i, nullptr);
        mRoot.reset(new kelvo::test::TempRoot());
        gExitStatus = -1;
        KelvoAgent::setExitHook(recordExit);
    }
    void TearDown() override {
        for (int i = 0; i < kelvo::HANDLER_COUNT; ++i) KelvoAgent::setHandlerFactory(i, nullptr);
        for (int i = 0; i < kelvo::ROUTINE_COUNT; ++i) KelvoAgent::setRoutineFactory(i, nullptr);
        for (const sp<KelvoAgent>& agent : mAgents) {
            agent->getStorage()->closeConnection();
            agent->getStorage()->requestThreadExit();
        }
        KelvoAgent::setExitHook(nullptr);
        mRoot.reset();
    }
    sp<KelvoAgent> makeAgent() {
        sp<KelvoAgent> agent = new KelvoAgent();
        mAgents.push_back(agent);
        return agent;
    }

    std::unique_ptr<kelvo::test::TempRoot> mRoot;
    std::vector<sp<KelvoAgent>> mAgents;
    template <int... H, int... R>
    void installAll(std::integer_sequence<int, H...>, std::integer_sequence<int, R...>) {
        (KelvoAgent::setHandlerFactory(H, makeHandler<H>), ...);
        (KelvoAgent::setRoutineFactory(R, makeRoutine<R>), ...);
    }
};

} // namespace

TEST_F(KelvoAgentTest, StartsOperatorsInOrderAndDropsUnsupportedOnes) {
    installAll(std::make_integer_sequence<int, kelvo::HANDLER_COUNT>(),
               std::make_integer_sequence<int, kelvo::ROUTINE_COUNT>());
    sp<KelvoAgent> agent = makeAgent();
    LogCapture log;
    EXPECT_EQ(0, agent->initiate());

    std::vector<std::string> expected;
    for (int id : {0, 1, 2, 3, 7, 4, 5, 6, 8, 9, 10, 11, 12, 13, 14}) {
        expected.push_back("create FakeHandler" + std::to_string(id));
    }
    for (int id : {0, 1, 2}) expected.push_back("create FakeRoutine" + std::to_string(id));
    // Routines are initialized before handlers.
    for (int id : {0, 1, 2}) expected.push_back("init FakeRoutine" + std::to_string(id));
    for (int id = 0; id < kelvo::HANDLER_COUNT; ++id) {
        if (id != 1) expected.push_back("init FakeHandler" + std::to_string(id));
    }
    EXPECT_EQ(expected, events());

    EXPECT_TRUE(log.contains("earlyInitialize# Check support failed, disable module: -1",
                             ANDROID_LOG_ERROR));
    EXPECT_EQ(nullptr, agent->getHandler(1));
    Parcel reply;
    EXPECT_EQ(-11, agent->sendToHandler(1, 1, Parcel(), &reply, true));

    for (int id = 0; id < kelvo::HANDLER_COUNT; ++id) {
        if (agent->getHandler(id) != nullptr) agent->getHandler(id)->requestThreadExit();
    }
    for (int id = 0; id < kelvo::ROUTINE_COUNT; ++id) agent->getRoutine(id)->requestThreadExit();
}

TEST_F(KelvoAgentTest, RoutesRequestsByIdAndRefusesBadIds) {
    KelvoAgent::setHandlerFactory(5, makeHandler<5>);
    KelvoAgent::setRoutineFactory(1, makeRoutine<1>);
    sp<KelvoAgent> agent = makeAgent();
    agent->initiate();

    Parcel reply;
    EXPECT_EQ(11, agent->sendToHandler(5, 1, Parcel(), &reply, true));
    EXPECT_STREQ("FakeHandler5", reply.readString8().string());
    Parcel routineReply;
    EXPECT_EQ(11, agent->sendToRoutine(1, 1, Parcel(), &routineReply, true));
    EXPECT_STREQ("FakeRoutine1", routineReply.readString8().string());
    // Synchronous without a reply parcel.
    EXPECT_EQ(-5, agent->sendToHandler(5, 1, Parcel(), nullptr, true));

    LogCapture log;
    EXPECT_EQ(-5, agent->sendToHandler(15, 1, Parcel(), &reply, true));
    EXPECT_EQ(-5, agent->sendToHandler(-1, 1, Parcel(), &reply, true));
    EXPECT_EQ(-5, agent->sendToRoutine(3, 1, Parcel(), &reply, true));
    EXPECT_EQ(3u, log.count("Invalid parameter", ANDROID_LOG_ERROR));
    EXPECT_EQ(-11, agent->sendToRoutine(0, 1, Parcel(), &reply, true));

    agent->getHandler(5)->requestThreadExit();
    agent->getRoutine(1)->requestThreadExit();
}

TEST_F(KelvoAgentTest, ErrorLinesReachTheSystemHandlerWhileStartUpRuns) {
    KelvoAgent::setHandlerFactory(0, makeHandler<0>);
    sp<KelvoAgent> agent = makeAgent();
    // Errors are forwarded from other threads while the slots are written.
    std::atomic<bool> stop{false};
    std::thread noisy([&] {
        while (!stop.load()) {
            Parcel row;
            row.writeInt64(1);
            row.writeString8(String8("noise"));
            row.setDataPosition(0);
            agent->logError(row);
            std::this_thread::yield();
        }
    });
    agent->initiate();
    stop = true;
    noisy.join();

    Parcel row;
    row.writeInt64(123);
    row.writeString8(String8("[X.cpp] f# stored error"));
    row.setDataPosition(0);
    agent->logError(row);
    EXPECT_TRUE(waitFor([] { return hasEvent("error [X.cpp] f# stored error"); }));
    agent->getHandler(0)->requestThreadExit();
    agent->getHandler(0)->join();
    // Without a system handler the row is lost, and counted (other threads
    // may lose theirs meanwhile).
    uint64_t dropped = kelvo::HealthCounters::get(kelvo::Health::ErrorRowsDropped);
    agent->logError(row);
    EXPECT_LE(dropped + 1, kelvo::HealthCounters::get(kelvo::Health::ErrorRowsDropped));
}

namespace {

// Runs in a process of its own (the agent is process-wide): the start-up of
// the process-wide agent with a system handler, handler 2 and the hourly
// routine, each a FakeOperator. Exits 0 when all holds, else 1 with the
// failures on stderr.
void runProcessWideAgent() {
    // A hang (a thread stuck on its own lock) ends the process with a signal.
    alarm(60);
    kelvo::test::TempRoot root;
    KelvoAgent::setRoutineFactory(kelvo::ROUTINE_POLLING, nullptr);
    KelvoAgent::setHandlerFactory(0, makeHandler<0>);
    KelvoAgent::setHandlerFactory(2, makeHandler<2>);
    KelvoAgent::setRoutineFactory(kelvo::ROUTINE_HOURLY, makeRoutine<1>);
    // Raised before the agent exists: the system log only, never stored later.
    KLOGE("before the agent");
    sp<KelvoAgent> agent = KelvoAgent::getInstance();
    agent->initiate();
    bool ok = true;
    auto check = [&ok](bool condition, const std::string& what) {
        if (!condition) {
            fprintf(stderr, "FAILED: %s\n", what.c_str());
            ok = false;
        }
    };

    // The requests operators hand to the hourly routine, field by field.
    sp<KelvoOperator> op = agent->getHandler(2);
    op->voteCandidate(7200000, KelvoOperator::VOTE_COMPONENT_ACCOUNTING, 0x2);
    Parcel candidates;
    candidates.writeUint32(0x4);
    candidates.writeUint32(0x8);
    op->setElector(0x2, candidates);
    op->updateCompensation(3600000, 5, -9);
    for (const char* e : {"routine 0 7200000 3 2", "routine 4 2 4 8", "routine 3 3600000 5 -9"}) {
        check(waitFor([e] { return hasEvent(e); }), std::string("no ") + e);
    }

    // The system handler removing an unknown id logs an error that lands in
    // its own queue: it must not hang on its own lock.
    agent->sendToHandler(0, 7, Parcel(), nullptr, false);
    check(waitFor([] {
              return hasEvent("error [HandlerThread.cpp] removeMessage# Invalid message "
                              "id[999999] in FakeHandler0");
          }),
          "the system handler did not store its own error");

    // An error raised on another thread while it stores an error row is
    // written to the system log only.
    KLOGE("store me");
    check(waitFor([] { return hasEvent("store failed"); }), "the row was not handed on");
    Parcel reply;
    agent->sendToHandler(0, 1, Parcel(), &reply, true);
    agent->sendToHandler(2, 1, Parcel(), &reply, true);
    for (const std::string& e : events()) {
        check(e.find("Failed to store the error row") == std::string::npos, "forwarded: " + e);
        check(e.find("before the agent") == std::string::npos, "stored: " + e);
    }
    _exit(ok ? 0 : 1);
}

} // namespace

TEST(KelvoAgentProcessTest, OperatorRequestsAndErrorRowsThroughTheProcessWideAgent) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(runProcessWideAgent(), ::testing::ExitedWithCode(0), "");
}

TEST_F(KelvoAgentTest, AnUnusableDatabaseIsMovedAsideAndTheProcessEnds) {
    mRoot->writeFile(KelvoStorage::kDatabasePath, std::string(8192, '\x5a'));
    mRoot->writeFile(std::string(KelvoStorage::kDatabasePath) + "-journal", "stale");
    sp<KelvoAgent> agent = makeAgent();
    LogCapture log;
    agent->initiate();
    EXPECT_EQ(0, gExitStatus.load());
    EXPECT_TRUE(log.contains("Failed to start storage", ANDROID_LOG_ERROR));
    // Neither the file nor its journal is left for the next start.
    EXPECT_NE(0, access((mRoot->path() + KelvoStorage::kDatabasePath).c_str(), F_OK));
    EXPECT_NE(0, access((mRoot->path() + KelvoStorage::kDatabasePath + "-journal").c_str(), F_OK));
    // The unusable file was kept aside in the backup folder.
    EXPECT_FALSE(kelvo::test::listDir(mRoot->path() + "/data/log/kelvo/backup", "kelvo-.*").empty());
}
