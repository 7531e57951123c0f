#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstring>
#include <mutex>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "common/RecordingHandler.h"
#include "common/TestEnv.h"
#include "core/BufferedLogServer.h"
#include "kelvo/BufferedLogClient.h"

using android::sp;
using android::String8;
using kelvo::BufferedLogClient;
using kelvo::BufferedLogServer;
using kelvo::Health;
using kelvo::HealthCounters;
using kelvo::test::EntryRecorder;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

// Shortened stand-in of the server's read and write time-out.
constexpr int kIoTimeoutMs = 300;

class BufferedLogServerTest : public ::testing::Test {
protected:
    void SetUp() override {
        mServer = new BufferedLogServer("BufLogTest", kIoTimeoutMs);
        ASSERT_EQ(0, mServer->start());
        mRecorder = new EntryRecorder();
        sp<kelvo::LogReceiver> receiver = new kelvo::LogReceiver(mRecorder);
        for (auto key : {std::make_pair("kelvo_driver", 0), std::make_pair("kelvo_driver", 1),
                         std::make_pair("Pelmora", 0)}) {
            ASSERT_EQ(0, mServer->registerLogReceiver(receiver, String8(key.first), key.second));
        }
    }
    void TearDown() override {
        mServer->stop();
        mRecorder->requestThreadExit();
        mRecorder->join();
    }
    bool gotCount(size_t n) {
        return waitFor([&] { return mRecorder->got().size() >= n; });
    }

    kelvo::test::TempRoot mRoot;
    sp<BufferedLogServer> mServer;
    sp<EntryRecorder> mRecorder;
};

}  // namespace

TEST_F(BufferedLogServerTest, ClientsAreAuthenticatedByTheirExactName) {
    LogCapture log;
    BufferedLogClient first;
    ASSERT_EQ(0, first.connect("kelvo_driver"));
    ASSERT_EQ(0, first.send(1, "a"));
    ASSERT_TRUE(gotCount(1));
    // Parts of a name, a longer one, a taken one and one past 64 bytes.
    uint64_t refused = HealthCounters::get(Health::BufferedClientRefused);
    for (const std::string& name : std::vector<std::string>{"driver", "kelvo_driver1",
                                                            "kelvo_driver", std::string(65, 'x')}) {
        BufferedLogClient other;
        ASSERT_EQ(0, other.connect(name));
        EXPECT_TRUE(other.waitClosed(5000)) << name;
    }
    EXPECT_EQ(2u, log.count("No receiver to receive message of type(", ANDROID_LOG_ERROR));
    EXPECT_TRUE(log.contains("There is already one client for this type(kelvo_driver)"));
    EXPECT_TRUE(log.contains("Invalid message length: 65", ANDROID_LOG_ERROR));
    EXPECT_EQ(refused + 3, HealthCounters::get(Health::BufferedClientRefused));
    ASSERT_EQ(0, first.send(0, "b"));
    ASSERT_TRUE(gotCount(2));
    EXPECT_EQ((std::vector<std::string>{"kelvo_driver:1:a", "kelvo_driver:0:b"}), mRecorder->got());
}

TEST_F(BufferedLogServerTest, EntriesWrittenBeforeCloseArriveWholeAndInOrder) {
    std::string big(100 * 1024, '\0');
    for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>(i * 7);
    BufferedLogClient client;
    ASSERT_EQ(0, client.connect("kelvo_driver"));
    std::string all = BufferedLogClient::encode(0, nullptr, 0) +
                      BufferedLogClient::encode(1, big.data(), big.size()) +
                      BufferedLogClient::encode(0, "\x01\x00\xff\x7f", 4);
    ASSERT_EQ(0, client.sendRaw(all.data(), all.size()));
    client.close();
    ASSERT_TRUE(gotCount(3));
    EXPECT_EQ((std::vector<std::string>{"kelvo_driver:0:", "kelvo_driver:1:" + big,
                                        std::string("kelvo_driver:0:\x01\x00\xff\x7f", 19)}),
              mRecorder->got());
}

TEST_F(BufferedLogServerTest, BadEntriesDisconnectOnlyTheirClient) {
    BufferedLogClient pelmora;
    ASSERT_EQ(0, pelmora.connect("Pelmora"));
    struct Case {
        int32_t length;
        int32_t magic;
        const char* error;
    };
    const int32_t cap = static_cast<int32_t>(BufferedLogServer::kMaxEntryLength);
    for (Case c : {Case{4, 5,
                        "No receiver to receive message (name=kelvo_driver5, "
                        "type=kelvo_driver, magic=5)"},
                   Case{-1, 0, "Invalid message length: -1"},
                   Case{INT32_MAX, 0, "Invalid message length: 2147483647"},
                   Case{cap + 1, 0, "Invalid message length: 1048577"}}) {
        LogCapture log;
        uint64_t refused = HealthCounters::get(Health::BufferedEntryRefused);
        BufferedLogClient driver;
        ASSERT_EQ(0, driver.connect("kelvo_driver"));
        // Only the header: a length the server accepted would wait for data.
        int32_t header[3] = {c.length, c.magic, 0};
        ASSERT_EQ(0, driver.sendRaw(header, c.length == 4 ? 12 : 8));
        EXPECT_TRUE(driver.waitClosed(5000)) << c.error;
        EXPECT_TRUE(log.contains(c.error, ANDROID_LOG_ERROR)) << c.error;
        EXPECT_EQ(refused + 1, HealthCounters::get(Health::BufferedEntryRefused)) << c.error;
    }
    ASSERT_EQ(0, pelmora.send(0, "still here"));
    ASSERT_TRUE(gotCount(1));
    EXPECT_EQ("Pelmora:0:still here", mRecorder->got().back());
}

TEST_F(BufferedLogServerTest, StalledClientHoldsOthersUpOnlyForTheTimeOut) {
    BufferedLogClient stalled;
    ASSERT_EQ(0, stalled.connect("kelvo_driver"));
    ASSERT_EQ(0, stalled.sendRaw("\x10\x00", 2));
    BufferedLogClient other;
    ASSERT_EQ(0, other.connect("Pelmora"));
    ASSERT_EQ(0, other.send(0, "x"));
    EXPECT_TRUE(waitFor([&] { return mRecorder->got().size() == 1; },
                        std::chrono::milliseconds(4 * kIoTimeoutMs)));
    EXPECT_TRUE(stalled.waitClosed(kIoTimeoutMs));
}

TEST_F(BufferedLogServerTest, RequestsReachTheNamedClientOrFail) {
    LogCapture log;
    BufferedLogClient pelmora;
    ASSERT_EQ(0, pelmora.connect("Pelmora"));
    ASSERT_EQ(0, pelmora.send(0, "hello"));
    ASSERT_TRUE(gotCount(1));
    ASSERT_EQ(0, mServer->requestLogMessage(String8("Pelmora"), 3, "\x00zz", 3));
    int32_t magic = 0;
    std::string data;
    ASSERT_EQ(0, pelmora.receive(&magic, &data, 5000));
    EXPECT_EQ(3, magic);
    EXPECT_EQ(std::string("\x00zz", 3), data);

    EXPECT_EQ(-10, mServer->requestLogMessage(String8("KelvoService"), 0, "x", 1));
    EXPECT_TRUE(log.contains("Failed to find client for (KelvoService)", ANDROID_LOG_ERROR));

    // Pelmora never reads: the socket fills, the write times out, and the
    // client is shut down.
    std::string big(BufferedLogServer::kMaxEntryLength, 'b');
    int32_t ret = 0;
    for (int i = 0; i < 8 && ret == 0; ++i) {
        ret = mServer->requestLogMessage(String8("Pelmora"), 0, big.data(), big.size());
    }
    EXPECT_EQ(-14, ret);
    EXPECT_TRUE(log.contains("Failed to write: ", ANDROID_LOG_ERROR));
    EXPECT_TRUE(
        waitFor([&] { return mServer->requestLogMessage(String8("Pelmora"), 0, "x", 1) == -10; }));
}

TEST_F(BufferedLogServerTest, UntrustedPeersAndClientsOverTheCapAreRefused) {
    uint64_t refused = HealthCounters::get(Health::BufferedClientRefused);
    std::vector<std::unique_ptr<BufferedLogClient>> quiet;
    for (size_t i = 0; i < BufferedLogServer::kMaxUnauthenticatedClients; ++i) {
        quiet.emplace_back(new BufferedLogClient());
        ASSERT_EQ(0, quiet.back()->connect(""));
    }
    // Each refused client is counted; the line is written once a minute.
    LogCapture capLog;
    for (int i = 0; i < 2; ++i) {
        BufferedLogClient extra;
        ASSERT_EQ(0, extra.connect(""));
        EXPECT_TRUE(extra.waitClosed(5000));
    }
    EXPECT_FALSE(quiet.front()->waitClosed(50));
    EXPECT_EQ(1u, capLog.count("Too many clients", ANDROID_LOG_ERROR));
    quiet.clear();
    if (getuid() == 0) {
        // A peer of another user, connected from a child process; it is
        // refused before it could name itself.
        LogCapture log;
        chmod(mRoot.path().c_str(), 0755);
        pid_t child = fork();
        if (child == 0) {
            BufferedLogClient untrusted;
            _exit(setuid(4242) == 0 && untrusted.connect("") == 0 && untrusted.waitClosed(5000) ? 0
                                                                                                : 1);
        }
        int status = -1;
        ASSERT_EQ(child, waitpid(child, &status, 0));
        EXPECT_EQ(0, status);
        EXPECT_TRUE(log.contains("Refused client of uid 4242", ANDROID_LOG_ERROR));
        EXPECT_EQ(refused + 3, HealthCounters::get(Health::BufferedClientRefused));
    }
}

TEST_F(BufferedLogServerTest, BrokenListeningSocketIsReplaced) {
    LogCapture log;
    int old = mServer->getListenFd();
    mServer->handleEvent(old, android::Looper::EVENT_ERROR, nullptr);
    EXPECT_TRUE(log.contains("occurs unexpected events", ANDROID_LOG_ERROR));
    ASSERT_GE(mServer->getListenFd(), 0);
    BufferedLogClient client;
    ASSERT_EQ(0, client.connect("Pelmora"));
    ASSERT_EQ(0, client.send(0, "again"));
    ASSERT_TRUE(gotCount(1));
}
