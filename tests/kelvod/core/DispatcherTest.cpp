#include <errno.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cstring>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "common/TestEnv.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/KelvoOperator.h"
#include "kelvo/LogDevice.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"

using android::sp;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

constexpr std::chrono::milliseconds kLongWait(20000);

struct Logged {
    int64_t time;
    int32_t tag;
    std::string text;
};

// Registers its tags during initialization, as every handler does, and
// keeps what its handleLogger receives.
class RecordingOperator : public KelvoOperator {
public:
    RecordingOperator(const char* name, std::vector<std::pair<std::string, int32_t>> tags)
        : KelvoOperator(name, -1, 0), mTags(std::move(tags)) {}

    void registerDispatcherTag() override {
        for (const auto& tag : mTags) {
            mResults.push_back(
                Dispatcher::getInstance()->registerTag({tag.first.c_str(), tag.second}, this));
        }
    }

    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override {
        std::lock_guard<std::mutex> guard(mLock);
        mLogged.push_back({time, tag, text});
        return 0;
    }

    std::vector<Logged> logged() {
        std::lock_guard<std::mutex> guard(mLock);
        return mLogged;
    }
    size_t count() { return logged().size(); }
    // "time tag text" of each record received.
    std::vector<std::string> lines() {
        std::vector<std::string> out;
        for (const Logged& l : logged()) {
            out.push_back(std::to_string(l.time) + " " + std::to_string(l.tag) + " " + l.text);
        }
        return out;
    }
    const std::vector<int32_t>& results() const { return mResults; }

private:
    std::vector<std::pair<std::string, int32_t>> mTags;
    std::vector<int32_t> mResults;
    std::mutex mLock;
    std::vector<Logged> mLogged;
};

// Writes v little-endian in `bytes` bytes at `at`.
void put(std::string* s, size_t at, uint32_t v, int bytes) {
    for (int i = 0; i < bytes; ++i) (*s)[at + i] = static_cast<char>((v >> (8 * i)) & 0xff);
}

// A record with the given payload; its header declares `declared` bytes of
// payload (the true size when negative).
std::string rawRecord(const std::string& payload, long declared = -1, uint32_t seconds = 1,
                      uint32_t nanoseconds = 0) {
    std::string record(LogDevice::kHeaderSize, '\0');
    put(&record, 0, static_cast<uint32_t>(declared < 0 ? payload.size() : declared), 2);
    put(&record, 12, seconds, 4);
    put(&record, 16, nanoseconds, 4);
    return record + payload;
}

std::string payload(const std::string& tag, const std::string& text) {
    return std::string("\x04", 1) + tag + std::string(1, '\0') + text + std::string(1, '\0');
}

class DispatcherTest : public ::testing::Test {
protected:
    void SetUp() override {
        mRoot.reset(new kelvo::test::TempRoot());
        Dispatcher::resetForTest();
        mSavedInfo = kelvo::gLogInfoEnable.load();
        kelvo::gLogInfoEnable.store(1);
        mWriter.reset(new LogWriter(kelvo::RootPath::resolve(KELVO_LOG_DEVICE)));
        // A reader that stopped reading fails the test instead of hanging it.
        mWriter->setTimeout(kLongWait.count());
    }
    void TearDown() override {
        Dispatcher::resetForTest();
        for (const sp<RecordingOperator>& op : mOperators) {
            op->requestThreadExit();
            op->join();
        }
        mOperators.clear();
        kelvo::gLogInfoEnable.store(mSavedInfo);
        mWriter.reset();
        mRoot.reset();
    }

    sp<RecordingOperator> makeOperator(const char* name,
                                       std::vector<std::pair<std::string, int32_t>> tags) {
        sp<RecordingOperator> op = new RecordingOperator(name, std::move(tags));
        EXPECT_EQ(0, op->initialize());
        mOperators.push_back(op);
        return op;
    }

    void write(const char* tag, const std::string& text, int64_t timeMs = 1000) {
        ASSERT_EQ(0, mWriter->write(LogWriter::PRIORITY_INFO, tag, text.c_str(), timeMs));
    }
    void writeRaw(const std::string& bytes) {
        ASSERT_EQ(0, mWriter->writeRaw(bytes.data(), bytes.size()));
    }
    // The count follows each hand-over, so the operator may hold a record
    // before it is counted: collects the count until `expected` or time-out.
    static uint32_t logCountReaching(uint32_t expected) {
        uint32_t total = 0;
        waitFor([&] { return (total += Dispatcher::getInstance()->getLogCount()) >= expected; });
        return total;
    }

    std::unique_ptr<kelvo::test::TempRoot> mRoot;
    std::unique_ptr<LogWriter> mWriter;
    std::vector<sp<RecordingOperator>> mOperators;
    int32_t mSavedInfo = 1;
};

} // namespace

TEST_F(DispatcherTest, RecordsReachTheOperatorThatRegisteredTheirTag) {
    sp<RecordingOperator> display = makeOperator(
        "DisplayOp", {{"KELVO_TAG_FOREGROUND_CHANGED", 0}, {"KELVO_TAG_BRIGHTNESS", 1}});
    sp<RecordingOperator> gnss =
        makeOperator("GnssOp", {{"KELVO_TAG_GNSS_START", 0}, {"KELVO_TAG_GNSS_STOP", 1}});
    EXPECT_EQ((std::vector<int32_t>{0, 0}), display->results());
    LogCapture log;
    uint64_t unknown = HealthCounters::get(Health::LogRecordUnknownTag);
    sp<Dispatcher> dispatcher = Dispatcher::getInstance();
    ASSERT_EQ(0, dispatcher->startDispatchMessage());
    // Starting twice changes nothing.
    EXPECT_EQ(0, dispatcher->startDispatchMessage());

    write("KELVO_TAG_BRIGHTNESS", "brightness=120", 1700000000123LL);
    write("KELVO_TAG_GNSS_START", "name=com.example.maps", 1700000000200LL);
    write("KELVO_TAG_NOBODY_LISTENS", "a=1", 1700000000300LL);
    write("KELVO_TAG_FOREGROUND_CHANGED", "name=com.example.app with spaces", 1700000000400LL);
    // A tag that says everything by itself, stamped past 2038 (unsigned
    // seconds in 64 bits).
    write("KELVO_TAG_GNSS_STOP", "", 4294967295LL * 1000 + 999);

    ASSERT_TRUE(waitFor([&] { return display->count() == 2 && gnss->count() == 2; }, kLongWait));
    EXPECT_EQ((std::vector<std::string>{"1700000000123 1 brightness=120",
                                        "1700000000400 0 name=com.example.app with spaces"}),
              display->lines());
    EXPECT_EQ((std::vector<std::string>{"1700000000200 0 name=com.example.maps",
                                        "4294967295999 1 "}),
              gnss->lines());
    // Four forwarded; the unknown tag was dropped without a word, counted.
    EXPECT_EQ(4u, logCountReaching(4));
    EXPECT_EQ(0u, dispatcher->getLogCount());
    EXPECT_EQ(unknown + 1, HealthCounters::get(Health::LogRecordUnknownTag));
    EXPECT_EQ(0u, log.count("KELVO_TAG_NOBODY_LISTENS"));
    EXPECT_EQ(0u, log.count("", ANDROID_LOG_ERROR));
}

TEST_F(DispatcherTest, MalformedRecordsAreCountedAndCostNothingElse) {
    sp<RecordingOperator> op = makeOperator("WakeOp", {{"KELVO_TAG_APP_WAKEUP", 0}});
    LogCapture log;
    uint64_t malformed = HealthCounters::get(Health::LogRecordMalformed);
    ASSERT_EQ(0, Dispatcher::getInstance()->startDispatchMessage());

    const std::string good = payload("KELVO_TAG_APP_WAKEUP", "procname=a");
    const std::vector<std::string> bad = {
        // Headers that do not fit what was read.
        rawRecord(good, static_cast<long>(good.size()) + 1),
        rawRecord(good).substr(0, 10),
        rawRecord(good, -1, 5, 1000000000u),
        // Longer than one read takes.
        rawRecord(std::string(6000, 'x'), 6000),
        // Payloads without a tag or without a text.
        rawRecord(""),
        rawRecord(std::string("\x04\0procname=b\0", 13)),
        rawRecord(std::string("\x04KELVO_TAG_APP_WAKEUP\0", 22)),
        rawRecord(std::string("\x04KELVO_TAG_APP_WAKEUP\0procname=c", 32)),
        // A text of 4096 characters.
        rawRecord(payload("KELVO_TAG_APP_WAKEUP", "procname=" + std::string(4096 - 9, 'n'))),
    };
    int sent = 0;
    for (const std::string& record : bad) {
        write("KELVO_TAG_APP_WAKEUP", "seq=" + std::to_string(sent++));
        writeRaw(record);
    }
    // The longest text a record may carry still arrives whole.
    std::string longest = "seq=" + std::to_string(sent++);
    longest.resize(4095, 'm');
    write("KELVO_TAG_APP_WAKEUP", longest);

    ASSERT_TRUE(waitFor([&] { return op->count() == static_cast<size_t>(sent); }, kLongWait));
    std::vector<Logged> logged = op->logged();
    for (int i = 0; i + 1 < sent; ++i) {
        EXPECT_EQ("seq=" + std::to_string(i), logged[i].text);
    }
    EXPECT_EQ(longest, logged[sent - 1].text);
    EXPECT_EQ(1u, log.count("dispatchMessage# Ignored long message", ANDROID_LOG_INFO));
    // Each bad record is counted; one summary line a minute at most, so a
    // broken writer cannot spend the day's error lines. The thread reads on.
    EXPECT_EQ(malformed + bad.size(), HealthCounters::get(Health::LogRecordMalformed));
    EXPECT_EQ(1u, log.count("noteMalformedRecord# Dropped 1 malformed logger records, last: ",
                            ANDROID_LOG_ERROR));
    EXPECT_EQ(1u, log.count("Dropped ", ANDROID_LOG_ERROR));
    EXPECT_EQ(0u, log.count("Failed to read"));
    write("KELVO_TAG_APP_WAKEUP", "still=reading");
    ASSERT_TRUE(waitFor([&] { return op->count() == static_cast<size_t>(sent) + 1; }, kLongWait));
}

TEST_F(DispatcherTest, RegistrationKeepsTheFirstOperatorAndRefusesBadTags) {
    sp<RecordingOperator> first = makeOperator("FirstOp", {{"KELVO_TAG_WIFI_ON", 0}});
    LogCapture log;
    sp<RecordingOperator> second =
        makeOperator("SecondOp", {{"KELVO_TAG_WIFI_ON", 5}, {"KELVO_TAG_WIFI_OFF", 6}});
    EXPECT_EQ((std::vector<int32_t>{0, 0}), second->results());
    EXPECT_EQ(1u, log.count("Dispatcher.cpp] registerTag# Event(KELVO_TAG_WIFI_ON) has been "
                            "registered",
                            ANDROID_LOG_INFO));

    sp<Dispatcher> dispatcher = Dispatcher::getInstance();
    log.clear();
    EXPECT_EQ(-5, dispatcher->registerTag({"KELVO_TAG_X", 0}, nullptr));
    EXPECT_EQ(-5, dispatcher->registerTag({"", 0}, first));
    EXPECT_EQ(2u, log.count("registerTag# Invalid parameter", ANDROID_LOG_ERROR));
    // Without a record there is nothing to forward.
    EXPECT_EQ(-5, dispatcher->dispatchMessage(nullptr));

    ASSERT_EQ(0, dispatcher->startDispatchMessage());
    write("KELVO_TAG_WIFI_ON", "");
    write("KELVO_TAG_WIFI_OFF", "");
    ASSERT_TRUE(waitFor([&] { return first->count() == 1 && second->count() == 1; }, kLongWait));
    EXPECT_EQ(0, first->logged()[0].tag);
    EXPECT_EQ(6, second->logged()[0].tag);

    // An operator that stopped taking messages: its records are still
    // handed over and counted as forwarded, and as refused.
    EXPECT_EQ(2u, logCountReaching(2));
    second->requestThreadExit();
    second->join();
    uint64_t refused = HealthCounters::get(Health::LoggerMessageRefused);
    write("KELVO_TAG_WIFI_OFF", "");
    write("KELVO_TAG_WIFI_ON", "");
    ASSERT_TRUE(waitFor([&] { return first->count() == 2; }, kLongWait));
    EXPECT_EQ(2u, logCountReaching(2));
    EXPECT_EQ(refused + 1, HealthCounters::get(Health::LoggerMessageRefused));
}

TEST_F(DispatcherTest, WithoutADeviceOrAtItsEndTheDaemonRunsWithoutItsEvents) {
    // Something that is not a device sits at the device's path.
    mRoot->writeFile(KELVO_LOG_DEVICE, "plain file");
    LogCapture log;
    sp<RecordingOperator> op = makeOperator("NoDeviceOp", {{"KELVO_TAG_GNSS_START", 0}});
    EXPECT_EQ((std::vector<int32_t>{0}), op->results());
    EXPECT_EQ(1u, log.count("Dispatcher.cpp] Dispatcher# Failed to open " +
                                kelvo::RootPath::resolve(KELVO_LOG_DEVICE),
                            ANDROID_LOG_ERROR));
    EXPECT_EQ(-2, Dispatcher::getInstance()->startDispatchMessage());
    EXPECT_EQ("plain file", mRoot->readFile(KELVO_LOG_DEVICE));

    // The end of a character device ends the thread: one that is always at
    // its end (the null device's numbers).
    std::string path = kelvo::RootPath::resolve(KELVO_LOG_DEVICE);
    ASSERT_EQ(0, unlink(path.c_str()));
    if (mknod(path.c_str(), S_IFCHR | 0600, makedev(1, 3)) != 0) {
        GTEST_SKIP() << "cannot make a character device here: " << strerror(errno);
    }
    Dispatcher::resetForTest();
    makeOperator("EndOp", {{"KELVO_TAG_GNSS_START", 0}});
    ASSERT_EQ(0, Dispatcher::getInstance()->startDispatchMessage());
    EXPECT_TRUE(
        waitFor([&] { return log.contains("Failed to read logger message: -14"); }, kLongWait));
    EXPECT_EQ(1u, log.count("readLoggerMessage# Failed to read log device: ", ANDROID_LOG_ERROR));
}

TEST_F(DispatcherTest, TheAgentStartsTheDispatcherAfterTheOperatorsRegistered) {
    static sp<RecordingOperator> sDisplay;
    kelvo::KelvoAgent::setHandlerFactory(kelvo::HANDLER_DISPLAY, [] {
        sDisplay = new RecordingOperator("AgentDisplayOp", {{"KELVO_TAG_BRIGHTNESS", 1}});
        return sp<KelvoOperator>(sDisplay);
    });
    sp<kelvo::KelvoAgent> agent = new kelvo::KelvoAgent();
    EXPECT_EQ(0, agent->initiate());
    kelvo::KelvoAgent::setHandlerFactory(kelvo::HANDLER_DISPLAY, nullptr);
    ASSERT_NE(nullptr, sDisplay.get());
    mOperators.push_back(sDisplay);

    write("KELVO_TAG_BRIGHTNESS", "brightness=0", 42);
    EXPECT_TRUE(waitFor([&] { return sDisplay->count() == 1; }, kLongWait));
    EXPECT_EQ(1, sDisplay->logged()[0].tag);
    sDisplay.clear();
    agent->getStorage()->closeConnection();
    agent->getStorage()->requestThreadExit();
}
