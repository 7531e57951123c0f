#include <gtest/gtest.h>

#include <unistd.h>

#include <chrono>
#include <cstring>
#include <mutex>
#include <thread>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "accounters/DataAccounter.h"
#include "common/TestEnv.h"
#include "core/BufferedLogServer.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/KelvoOperator.h"
#include "core/Notifier.h"

using android::Parcel;
using android::sp;
using android::String8;
using kelvo::KelvoOperator;
using kelvo::ParcelMessage;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

std::mutex gLock;
std::vector<std::string> gCalls;

void note(const std::string& call) {
    std::lock_guard<std::mutex> guard(gLock);
    gCalls.push_back(call);
}

std::vector<std::string> calls() {
    std::lock_guard<std::mutex> guard(gLock);
    return gCalls;
}

size_t countCalls(const std::string& prefix) {
    size_t n = 0;
    for (const std::string& c : calls()) n += c.rfind(prefix, 0) == 0 ? 1 : 0;
    return n;
}

// Records every action it is handed, as "action:<fields>".
class RecordingAccounter : public kelvo::DataAccounter {
public:
    int32_t onActionForeground(const Parcel& a) override {
        int64_t t = a.readInt64();
        note("foreground:" + std::to_string(t) + ":" + a.readString8().string());
        return 0;
    }
    int32_t onActionScreenState(const Parcel& a) override {
        int64_t t = a.readInt64();
        note("screen:" + std::to_string(t) + ":" + std::to_string(a.readBool()));
        return 0;
    }
    int32_t onActionChargerOnline(const Parcel& a) override {
        int64_t t = a.readInt64();
        note("charger:" + std::to_string(t) + ":" + std::to_string(a.readBool()));
        return 0;
    }
    int32_t onActionBalance(const Parcel& a) override {
        int32_t kind = a.readInt32();
        std::string s = "balance:" + std::to_string(kind) + ":" + std::to_string(a.readInt64());
        if (kind == 1) s += ":" + std::to_string(a.readInt64());
        s += a.dataAvail() == 0 ? "" : ":extra";
        note(s);
        return 0;
    }
    int32_t onActionDeactivateAll(const Parcel& a) override {
        note("deactivateAll:" + std::to_string(a.readInt64()));
        // Results come back to the operator through its listener.
        Parcel reply;
        reply.writeInt32(77);
        return sendReply(kelvo::LIBRARY_EVENT_COMPONENT, reply);
    }
};

constexpr int32_t kType = kelvo::ACCOUNTER_GNSS;

// Listens for everything it declares and records what reaches it.
class TestOperator : public KelvoOperator {
public:
    TestOperator(int32_t accounterType, std::vector<int32_t> records)
        : KelvoOperator("TestOperator", accounterType, 0x2), mRecords(std::move(records)) {}

    void setupListeners(Parcel& out) override {
        for (size_t i = 0; i < mRecords.size();) {
            int32_t kind = mRecords[i++];
            switch (kind) {
                case 1: addNotifierListener(mRecords[i++], out); break;
                case 2: addLibraryListener(mRecords[i++], out); break;
                case 3: addBufferedLogReceiver("kelvo_test", mRecords[i++], out); break;
                default: out.writeInt32(kind); break;
            }
        }
    }
    int32_t lateInitialize() override {
        mLateTid = gettid();
        return 5;
    }
    int32_t onHourlyTick(const Parcel& d) override {
        note("hourlyTick:" + std::to_string(d.readInt64()));
        return 8;
    }
    int32_t logApplicationsAccounting(int64_t t) override {
        note("logApps:" + std::to_string(t));
        return 0;
    }
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override {
        note("logger:" + std::to_string(time) + ":" + std::to_string(tag) + ":" + text);
        return 1;
    }
    int32_t handleBufferedLog(const Parcel& d) override {
        d.readInt64();
        std::string name = d.readString8().string();
        int32_t magic = d.readInt32();
        int32_t length = d.readInt32();
        std::string data(static_cast<const char*>(d.readInplace(length)), length);
        note("buffered:" + name + ":" + std::to_string(magic) + ":" + data);
        return 4;
    }
    int32_t handleComponentResult(const Parcel& d) override {
        note("component:" + std::to_string(d.readInt32()));
        return 0;
    }
    int32_t handleCustomized(int32_t code, const Parcel&, Parcel*) override {
        if (code != 99) note("customized:" + std::to_string(code));
        return 0;
    }
    void release() { readyToDestroy(); }

    pid_t mLateTid = 0;

private:
    std::vector<int32_t> mRecords;
};

class KelvoOperatorTest : public ::testing::Test {
protected:
    void SetUp() override {
        {
            std::lock_guard<std::mutex> guard(gLock);
            gCalls.clear();
        }
        kelvo::KelvoLibAgent::getInstance()->setAccounterFactoryForTest(
                kType, [] { return std::unique_ptr<kelvo::DataAccounter>(new RecordingAccounter()); });
    }
    void TearDown() override {
        if (mOperator != nullptr) {
            mOperator->release();
            mOperator->requestThreadExit();
            mOperator->join();
        }
        kelvo::KelvoLibAgent::getInstance()->setAccounterFactoryForTest(kType, nullptr);
        kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    }
    sp<TestOperator> make(int32_t type, std::vector<int32_t> records) {
        mOperator = new TestOperator(type, std::move(records));
        return mOperator;
    }
    // A synchronous round trip: everything posted before it has been handled.
    void settle() { mOperator->sendCustomizedMessage(99, Parcel(), &mScratch, true); }

    sp<TestOperator> mOperator;
    Parcel mScratch;
};

// A body holding one time.
struct TimeBody : Parcel {
    explicit TimeBody(int64_t t) { writeInt64(t); }
};

// A buffered log entry of the test's log: declared length, magic, data.
int32_t sendBuffered(int32_t length, int32_t magic, const std::string& data) {
    std::string entry(8, '\0');
    memcpy(&entry[0], &length, 4);
    memcpy(&entry[4], &magic, 4);
    entry += data;
    return kelvo::BufferedLogServer::getInstance()->sendLogMessage(
            String8("kelvo_test"), reinterpret_cast<const uint8_t*>(entry.data()), entry.size());
}

} // namespace

TEST_F(KelvoOperatorTest, MessagesReachTheirOperations) {
    sp<TestOperator> op = make(-1, {});
    EXPECT_EQ(5, op->initialize());
    // Late initialization ran on the operator's own thread.
    EXPECT_NE(0, op->mLateTid);
    EXPECT_NE(gettid(), op->mLateTid);
    // The internal late-initialize message runs once, however often posted.
    LogCapture log;
    op->mLateTid = 0;
    EXPECT_EQ(-13, op->sendMessageSync(ParcelMessage(100, 0)));
    EXPECT_EQ(0, op->mLateTid);
    EXPECT_TRUE(log.contains("Late initialization already done: TestOperator", ANDROID_LOG_ERROR));

    Parcel logger;
    logger.writeInt64(1234);
    logger.writeCString("brightness=12");
    EXPECT_EQ(1, op->sendMessageSync(ParcelMessage(kelvo::MESSAGE_LOGGER, 7, logger)));
    EXPECT_EQ("logger:1234:7:brightness=12", calls().back());
    // A record without its text is refused, and counted.
    uint64_t refused = kelvo::HealthCounters::get(kelvo::Health::LoggerMessageRefused);
    EXPECT_EQ(-5, op->sendMessageSync(ParcelMessage(kelvo::MESSAGE_LOGGER, 7, TimeBody(1))));
    EXPECT_TRUE(log.contains("Invalid logger message", ANDROID_LOG_ERROR));
    EXPECT_EQ(refused + 1, kelvo::HealthCounters::get(kelvo::Health::LoggerMessageRefused));

    EXPECT_EQ(-3, op->sendMessageSync(ParcelMessage(kelvo::MESSAGE_STORAGE_ENTRY, 0)));
    EXPECT_TRUE(log.contains("Unknown message type: 3", ANDROID_LOG_ERROR));
    EXPECT_EQ(8, op->sendMessageSync(ParcelMessage(kelvo::MESSAGE_NOTIFICATION,
                                                   kelvo::NOTIFICATION_HOURLY_TICK,
                                                   TimeBody(3600000))));
    EXPECT_EQ("hourlyTick:3600000", calls().back());
    EXPECT_EQ(-1, op->sendMessageSync(ParcelMessage(kelvo::MESSAGE_NOTIFICATION, 23)));
    EXPECT_TRUE(log.contains("Unknown message type: 23", ANDROID_LOG_ERROR));

    // Accounting rounds log, then vote to the hourly routine, absent here:
    // one attempt per round.
    op->sendMessageSync(ParcelMessage(kelvo::MESSAGE_NOTIFICATION,
                                      kelvo::NOTIFICATION_APPLICATIONS_ACCOUNTING,
                                      TimeBody(7200000)));
    EXPECT_EQ("logApps:7200000", calls().back());
    EXPECT_EQ(1u, log.count("Invalid routine", ANDROID_LOG_ERROR));
    op->sendMessageSync(ParcelMessage(kelvo::MESSAGE_NOTIFICATION,
                                      kelvo::NOTIFICATION_COMPONENT_ACCOUNTING,
                                      TimeBody(7200000)));
    EXPECT_EQ(2u, log.count("Invalid routine", ANDROID_LOG_ERROR));
    EXPECT_EQ(-5, op->setElector(0x2, Parcel()));
    EXPECT_TRUE(log.contains("Empty candidates", ANDROID_LOG_ERROR));
}

TEST_F(KelvoOperatorTest, StateChangesFeedTheOperatorsAccounter) {
    sp<TestOperator> op = make(kType, {2, kType});
    op->initialize();
    TimeBody fg(100);
    fg.writeString8(String8("com.example.maps"));
    op->sendMessage(ParcelMessage(kelvo::MESSAGE_NOTIFICATION, 0, fg));
    TimeBody screen(200);
    screen.writeBool(false);
    op->sendMessage(ParcelMessage(kelvo::MESSAGE_NOTIFICATION, 1, screen));
    TimeBody charger(300);
    charger.writeBool(true);
    charger.writeInt32(80);
    op->sendMessage(ParcelMessage(kelvo::MESSAGE_NOTIFICATION, 2, charger));
    TimeBody time(400);
    time.writeInt64(450);
    op->sendMessage(ParcelMessage(kelvo::MESSAGE_NOTIFICATION, 16, time));
    op->sendMessage(ParcelMessage(kelvo::MESSAGE_NOTIFICATION, 18, TimeBody(500)));
    op->sendMessage(ParcelMessage(kelvo::MESSAGE_NOTIFICATION, 17, TimeBody(600)));
    op->sendMessage(ParcelMessage(kelvo::MESSAGE_NOTIFICATION, 21, TimeBody(700)));
    settle();
    EXPECT_EQ((std::vector<std::string>{"foreground:100:com.example.maps", "screen:200:0",
                                        "charger:300:1", "balance:1:400:450", "balance:0:500",
                                        "balance:0:600", "deactivateAll:700", "component:77"}),
              calls());
}

TEST_F(KelvoOperatorTest, ListenerRecordsRegisterUntilAnUnknownOne) {
    LogCapture log;
    // Notification type 8, buffered log magic 5, then an unknown record 7
    // and a library record after it that must not be registered.
    sp<TestOperator> op = make(kType, {1, 8, 3, 5, 7, 2, kType});
    op->initialize();
    EXPECT_TRUE(log.contains("Unknown listener type: 7", ANDROID_LOG_ERROR));

    kelvo::Notifier::getInstance()->sendNotification(kelvo::NOTIFICATION_HOURLY_TICK,
                                                     TimeBody(42));
    EXPECT_TRUE(waitFor([] { return countCalls("hourlyTick:42") == 1; }));

    EXPECT_EQ(0, sendBuffered(3, 5, "abc"));
    EXPECT_TRUE(waitFor([] { return countCalls("buffered:kelvo_test:5:abc") == 1; }));
    // A length beyond what arrived is refused, nothing posted.
    uint64_t refused = kelvo::HealthCounters::get(kelvo::Health::BufferedEntryRefused);
    sendBuffered(64, 5, "abc");
    EXPECT_EQ(refused + 1, kelvo::HealthCounters::get(kelvo::Health::BufferedEntryRefused));

    // The library record after the unknown one was never registered.
    Parcel action;
    action.writeInt32(kType);
    action.writeInt32(kelvo::ACTION_DEACTIVATE_ALL);
    action.writeInt64(9);
    kelvo::setDataAccounter(action);
    settle();
    EXPECT_EQ(0u, countCalls("component:"));
    EXPECT_EQ(1u, countCalls("buffered:"));

    // After release nothing reaches the operator any more.
    op->release();
    kelvo::Notifier::getInstance()->sendNotification(kelvo::NOTIFICATION_HOURLY_TICK,
                                                     TimeBody(43));
    EXPECT_EQ(-4, sendBuffered(64, 5, "abc"));
    EXPECT_EQ(refused + 2, kelvo::HealthCounters::get(kelvo::Health::BufferedEntryRefused));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    settle();
    EXPECT_EQ(0u, countCalls("hourlyTick:43"));
}

TEST_F(KelvoOperatorTest, RegistrationsDoNotKeepAnOperatorAlive) {
    android::wp<TestOperator> weak;
    {
        sp<TestOperator> op = new TestOperator(kType, {1, 8, 2, kType, 3, 6});
        op->initialize();
        weak = op;
        op->requestThreadExit();
        op->join();
    }
    // Never released: the registrations alone must not hold it (its thread
    // lets go just after join returns).
    EXPECT_TRUE(waitFor([&] { return weak.promote() == nullptr; }));
    // What it registered is harmless, and gone once its destructor, which
    // runs on the thread that let go last, has finished.
    kelvo::Notifier::getInstance()->sendNotification(kelvo::NOTIFICATION_HOURLY_TICK,
                                                     TimeBody(44));
    EXPECT_TRUE(waitFor([] { return sendBuffered(0, 6, "") == -4; }));
}

TEST_F(KelvoOperatorTest, DelayedCustomizedMessagesComeLateOrNotAtAllOnceRemoved) {
    sp<TestOperator> op = make(-1, {});
    auto start = std::chrono::steady_clock::now();
    int32_t kept = op->sendCustomizedMessageDelayed(5, Parcel(), 100);
    int32_t removed = op->sendCustomizedMessageDelayed(6, Parcel(), 50);
    ASSERT_GE(kept, 0);
    ASSERT_GE(removed, 0);
    EXPECT_EQ(0, op->removeMessage(removed));
    EXPECT_EQ(-5, op->sendCustomizedMessageDelayed(7, Parcel(), -1));
    ASSERT_TRUE(kelvo::test::waitFor([] { return !calls().empty(); }));
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(100));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(std::vector<std::string>{"customized:5"}, calls());
}
