#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <binder/Parcel.h>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "common/TestEnv.h"
#include "kelvo/HostProperties.h"

using kelvo::ErrorLogger;
using kelvo::test::LogCapture;
using kelvo::test::TempRoot;

namespace {

struct Stored {
    int64_t time;
    std::string text;
};

std::mutex gStoredLock;
std::vector<Stored> gStored;

void storingSink(const android::Parcel& data) {
    Stored s;
    s.time = data.readInt64();
    s.text = data.readString8().string();
    std::lock_guard<std::mutex> guard(gStoredLock);
    gStored.push_back(s);
}

// An error raised while forwarding an error: it must reach the system log
// without being forwarded again (or looping).
void reenteringSink(const android::Parcel& data) {
    storingSink(data);
    KLOGE("Nested failure while storing");
}

size_t storedCount() {
    std::lock_guard<std::mutex> guard(gStoredLock);
    return gStored.size();
}

class KelvoLogTest : public ::testing::Test {
protected:
    void SetUp() override {
        mSavedDebug = kelvo::gLogDebugEnable.load();
        mSavedInfo = kelvo::gLogInfoEnable.load();
        std::lock_guard<std::mutex> guard(gStoredLock);
        gStored.clear();
    }
    void TearDown() override {
        ErrorLogger::setSink(nullptr);
        ErrorLogger::setCounter(0);
        kelvo::gLogDebugEnable = mSavedDebug;
        kelvo::gLogInfoEnable = mSavedInfo;
        kelvo::gLogModuleMask = 0;
    }
    int32_t mSavedDebug = 1;
    int32_t mSavedInfo = 1;
};

void logSomething() {
    KLOGD("debug line %d", 1);
    KLOGI("info line %d", 2);
    KLOGM(kelvo::LOG_MODULE_CPU, "cpu line %d", 3);
    KLOGM(kelvo::LOG_MODULE_GNSS, "gnss line %d", 4);
}

} // namespace

TEST_F(KelvoLogTest, LinesCarryFileBaseNameFunctionTagAndPriority) {
    kelvo::gLogDebugEnable = 1;
    kelvo::gLogInfoEnable = 1;
    LogCapture log;
    logSomething();
    KLOGE("error line %s", "x");
    std::vector<kelvo::test::LogLine> lines = log.linesWith("[KelvoLogTest.cpp]");
    ASSERT_EQ(3u, lines.size());
    EXPECT_EQ("[KelvoLogTest.cpp] logSomething# debug line 1", lines[0].text);
    EXPECT_EQ(ANDROID_LOG_DEBUG, lines[0].priority);
    EXPECT_EQ("[KelvoLogTest.cpp] logSomething# info line 2", lines[1].text);
    EXPECT_EQ(ANDROID_LOG_INFO, lines[1].priority);
    EXPECT_EQ(ANDROID_LOG_ERROR, lines[2].priority);
    EXPECT_NE(std::string::npos, lines[2].text.find("# error line x"));
    for (const auto& line : lines) {
        EXPECT_EQ("kelvod", line.tag);
    }
}

TEST_F(KelvoLogTest, SwitchesComeFromPropertiesAndOnlyOneMeansOn) {
    TempRoot root;
    struct Case {
        const char* value; // nullptr: property absent
        int32_t expectDebug;
    } cases[] = {{nullptr, 1}, {"1", 1}, {"0", 0}, {"2", 0}, {"abc", 0}, {"01", 1}};
    for (const Case& c : cases) {
        kelvo::HostProperties::reload();
        if (c.value != nullptr) {
            kelvo::HostProperties::setForTest("persist.kelvod.log.debug", c.value);
        }
        kelvo::HostProperties::setForTest("persist.kelvod.log.info", "0");
        kelvo::HostProperties::setForTest("ro.logsystem.usertype", "5");
        kelvo::loadLogSwitches();
        EXPECT_EQ(5, kelvo::gLogUserType.load());
        EXPECT_EQ(c.expectDebug, kelvo::gLogDebugEnable.load()) << (c.value ? c.value : "absent");
        EXPECT_EQ(0, kelvo::gLogInfoEnable.load());
    }
    // Debug off, information off: module lines still appear for set bits only.
    kelvo::gLogDebugEnable = 0;
    LogCapture log;
    kelvo::gLogModuleMask = kelvo::LOG_MODULE_CPU;
    logSomething();
    std::vector<kelvo::test::LogLine> lines = log.linesWith("[KelvoLogTest.cpp]");
    ASSERT_EQ(1u, lines.size());
    EXPECT_EQ("[KelvoLogTest.cpp] logSomething# cpu line 3", lines[0].text);
    EXPECT_EQ(ANDROID_LOG_DEBUG, lines[0].priority);
}

TEST_F(KelvoLogTest, SettersPersistAndReportTheNewState) {
    TempRoot root;
    kelvo::gLogInfoEnable = 1;
    LogCapture log;
    kelvo::setLogDebugEnable(false);
    EXPECT_EQ(0, kelvo::gLogDebugEnable.load());
    EXPECT_EQ("0", root.readFile("/data/property/persist.kelvod.log.debug"));
    EXPECT_TRUE(log.contains("[KelvoLog.h] setLogDebugEnable# Log debug level: 0",
                             ANDROID_LOG_INFO));
    kelvo::setLogDebugEnable(true);
    EXPECT_EQ("1", root.readFile("/data/property/persist.kelvod.log.debug"));

    kelvo::setLogModuleEnable(kelvo::LOG_MODULE_ALL, true);
    kelvo::setLogModuleEnable(kelvo::LOG_MODULE_CPU, false);
    EXPECT_EQ(0x7FFFFu & ~0x10u, kelvo::gLogModuleMask.load());
    EXPECT_TRUE(log.contains("setLogModuleEnable# Log module mask: 524271"));

    // Turning information off is silent; so is everything after it.
    log.clear();
    kelvo::setLogInfoEnable(false);
    EXPECT_EQ("0", root.readFile("/data/property/persist.kelvod.log.info"));
    kelvo::setLogModuleEnable(kelvo::LOG_MODULE_CPU, true);
    EXPECT_EQ(0u, log.linesWith("[KelvoLog.h]").size());
    kelvo::setLogInfoEnable(true);
    EXPECT_TRUE(log.contains("setLogInfoEnable# Log information level: 1"));
}

TEST_F(KelvoLogTest, ErrorsAreStoredUpToTheDailyCapAndAlwaysLogged) {
    ErrorLogger::setSink(storingSink);
    ErrorLogger::setCounter(0);
    LogCapture log;
    uint64_t suppressed = kelvo::HealthCounters::get(kelvo::Health::ErrorLinesSuppressed);
    for (int i = 0; i < 1001; ++i) {
        KLOGE("failure %d", i);
    }
    EXPECT_EQ(1000u, storedCount());
    EXPECT_EQ(1001u, log.count("failure", ANDROID_LOG_ERROR));
    EXPECT_EQ(suppressed + 1, kelvo::HealthCounters::get(kelvo::Health::ErrorLinesSuppressed));
    {
        std::lock_guard<std::mutex> guard(gStoredLock);
        EXPECT_NE(std::string::npos,
                  gStored[0].text.find("[KelvoLogTest.cpp] TestBody# failure 0"));
        EXPECT_NE(std::string::npos, gStored[999].text.find("# failure 999"));
        EXPECT_GT(gStored[0].time, 1500000000000LL);
    }
    // The daily reset opens the store again; negative counters are ignored.
    ErrorLogger::setCounter(-5);
    EXPECT_EQ(1000, ErrorLogger::getCounter());
    ErrorLogger::setCounter(0);
    KLOGE("after reset");
    EXPECT_EQ(1001u, storedCount());
}

TEST_F(KelvoLogTest, CapHoldsUnderConcurrentErrors) {
    ErrorLogger::setSink(storingSink);
    ErrorLogger::setCounter(990);
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([] {
            for (int i = 0; i < 50; ++i) KLOGE("concurrent %d", i);
        });
    }
    for (auto& t : threads) t.join();
    EXPECT_EQ(10u, storedCount());
}

TEST_F(KelvoLogTest, ErrorRaisedWhileForwardingGoesToSystemLogOnly) {
    ErrorLogger::setSink(reenteringSink);
    ErrorLogger::setCounter(0);
    LogCapture log;
    KLOGE("outer failure");
    EXPECT_EQ(1u, storedCount());
    EXPECT_EQ(1, ErrorLogger::getCounter());
    EXPECT_TRUE(log.contains("reenteringSink# Nested failure while storing", ANDROID_LOG_ERROR));
    // The guard is released: the next error is stored again.
    KLOGE("second failure");
    EXPECT_EQ(2u, storedCount());
}

TEST_F(KelvoLogTest, LongErrorLineIsCutToItsBuffer) {
    ErrorLogger::setSink(storingSink);
    std::string big(3000, 'z');
    KLOGE("%s", big.c_str());
    std::lock_guard<std::mutex> guard(gStoredLock);
    ASSERT_EQ(1u, gStored.size());
    EXPECT_EQ(1023u, gStored[0].text.size());
}
