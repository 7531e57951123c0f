#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <binder/Parcel.h>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "common/TestEnv.h"

using kelvo::ErrorLogger;
using kelvo::test::LogCapture;

namespace {

std::mutex gStoredLock;
std::vector<std::pair<int64_t, std::string>> gStored;

void storingSink(const android::Parcel& data) {
    int64_t time = data.readInt64();
    std::string text = data.readString8().string();
    std::lock_guard<std::mutex> guard(gStoredLock);
    gStored.emplace_back(time, text);
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
        std::lock_guard<std::mutex> guard(gStoredLock);
        gStored.clear();
        ErrorLogger::setSink(storingSink);
        ErrorLogger::setCounter(0);
    }
    void TearDown() override {
        ErrorLogger::setSink(nullptr);
        ErrorLogger::setCounter(0);
        kelvo::gLogModuleMask = 0;
    }
};

} // namespace

TEST_F(KelvoLogTest, ModuleLinesFollowTheMaskWhateverTheDebugSwitch) {
    int32_t savedDebug = kelvo::gLogDebugEnable.exchange(0);
    LogCapture log;
    kelvo::gLogModuleMask = kelvo::LOG_MODULE_CPU;
    KLOGD("debug line");
    KLOGM(kelvo::LOG_MODULE_CPU, "cpu line %d", 3);
    KLOGM(kelvo::LOG_MODULE_GNSS, "gnss line %d", 4);
    kelvo::gLogDebugEnable = savedDebug;
    std::vector<kelvo::test::LogLine> lines = log.linesWith("[KelvoLogTest.cpp]");
    ASSERT_EQ(1u, lines.size());
    EXPECT_EQ("[KelvoLogTest.cpp] TestBody# cpu line 3", lines[0].text);
    EXPECT_EQ(ANDROID_LOG_DEBUG, lines[0].priority);
    EXPECT_EQ("kelvod", lines[0].tag);
}

TEST_F(KelvoLogTest, ErrorsAreStoredUpToTheDailyCapAndAlwaysLogged) {
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
        EXPECT_EQ("[KelvoLogTest.cpp] TestBody# failure 0", gStored[0].second);
        EXPECT_NE(std::string::npos, gStored[999].second.find("# failure 999"));
        EXPECT_GT(gStored[0].first, 1500000000000LL);
    }
    // The daily reset opens the store again; negative counters are ignored.
    ErrorLogger::setCounter(-5);
    EXPECT_EQ(1000, ErrorLogger::getCounter());
    ErrorLogger::setCounter(0);
    KLOGE("after reset");
    EXPECT_EQ(1001u, storedCount());
}

TEST_F(KelvoLogTest, CapHoldsUnderConcurrentErrors) {
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
    LogCapture log;
    KLOGE("outer failure");
    EXPECT_EQ(1u, storedCount());
    EXPECT_EQ(1, ErrorLogger::getCounter());
    EXPECT_TRUE(log.contains("reenteringSink# Nested failure while storing", ANDROID_LOG_ERROR));
    // The guard is released: the next error is stored again, a long one
    // cut to its buffer.
    KLOGE("%s", std::string(3000, 'z').c_str());
    std::lock_guard<std::mutex> guard(gStoredLock);
    ASSERT_EQ(2u, gStored.size());
    EXPECT_EQ(1023u, gStored[1].second.size());
}
