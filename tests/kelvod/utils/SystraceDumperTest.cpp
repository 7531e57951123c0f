#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <memory>

#include "KelvoLog.h"
#include "PlatformServices.h"
#include "binder/managers/SysinfoManager.h"
#include "common/TestEnv.h"
#include "core/KelvoAgent.h"
#include "utils/SystraceDumper.h"

using namespace kelvo;
using namespace kelvo::test;

namespace {

std::atomic<int64_t> gMono{0};
int64_t fakeClock() {
    return gMono.load();
}

class SystraceDumperTest : public ::testing::Test {
protected:
    void SetUp() override {
        ServiceControl::setServiceWaitMs(300);
        mServices.reset(new PlatformServices());
        ASSERT_EQ(android::NO_ERROR, mServices->startAll());
        mSavedUserType = gLogUserType.load();
        gLogUserType = 3;
        gMono = 1000000;
        SystraceDumper::setClockForTest(&fakeClock);
        dumper()->resetForTest();
        mDir = mRoot.path() + SystraceDumper::kTraceDir;
    }
    void TearDown() override {
        mServices.reset();
        EXPECT_TRUE(waitFor([] { return !SysinfoManager::getInstance()->isConnected(); }));
        SystraceDumper::setClockForTest(nullptr);
        gLogUserType = mSavedUserType;
        ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs);
    }
    static SystraceDumper* dumper() { return SystraceDumper::getInstance(); }
    // Result and path of a request `afterMs` after the previous one.
    std::string dumpAfter(int64_t afterMs) {
        gMono += afterMs;
        std::string path;
        int32_t ret = dumper()->dumpSystrace(1000, path);
        return std::to_string(ret) + " " + path;
    }

    TempRoot mRoot;
    std::unique_ptr<PlatformServices> mServices;
    std::string mDir;
    int32_t mSavedUserType = -1;
};

// No system handler takes the row in these tests: a written trace still
// counts and is handed back, with -2.
TEST_F(SystraceDumperTest, RateLimitAndDailyCapOnTheMonotonicClock) {
    const std::string t = std::string(" ") + SystraceDumper::kTraceDir + "/systrace";
    dumper()->setDumpCount(-7);  // counts as 0
    LogCapture log;
    EXPECT_EQ("0 ", dumpAfter(59999));  // too soon after start-up
    EXPECT_EQ("-2" + t + "0.sys", dumpAfter(60000));
    EXPECT_EQ("0 ", dumpAfter(30000));
    EXPECT_EQ(2u, log.count("Too frequently dump", ANDROID_LOG_INFO));
    EXPECT_EQ("-2" + t + "1.sys", dumpAfter(30000));
    EXPECT_EQ(std::vector<std::string>{"systrace1.sys"}, listDir(mDir));
    dumper()->setDumpCount(5);
    EXPECT_EQ("-5 ", dumpAfter(60000));
    dumper()->setDumpCount(0);
    EXPECT_EQ("-2" + t + "0.sys", dumpAfter(60000));
    EXPECT_EQ(1, dumper()->getDumpCount());
    // Other user types capture nothing.
    gLogUserType = 1;
    EXPECT_EQ("0 ", dumpAfter(60000));
    EXPECT_EQ(3u, mServices->state()->traces().size());
}

TEST_F(SystraceDumperTest, LinkedOrStoppedTargetsLeaveEverythingInPlace) {
    dumper()->setDumpCount(0);
    // A link in place of the directory is never followed nor replaced.
    std::string elsewhere = mRoot.path() + "/elsewhere";
    writeHostFile(elsewhere + "/keep.txt", "x");
    makeHostDirs(mRoot.path() + "/data/log/kelvo");
    ASSERT_EQ(0, symlink(elsewhere.c_str(), mDir.c_str()));
    EXPECT_EQ("-14 ", dumpAfter(60000));
    EXPECT_EQ(std::vector<std::string>{"keep.txt"}, listDir(elsewhere));
    // In the real directory, sub-directories and what links lead to stay.
    unlink(mDir.c_str());
    writeHostFile(mDir + "/old.sys", "x");
    writeHostFile(mDir + "/sub/inner.sys", "x");
    ASSERT_EQ(0, symlink((elsewhere + "/keep.txt").c_str(), (mDir + "/link").c_str()));
    EXPECT_EQ(0, dumper()->initSystraceDir(SystraceDumper::kTraceDir));
    EXPECT_EQ(std::vector<std::string>{"sub"}, listDir(mDir));
    EXPECT_TRUE(hostPathExists(mDir + "/sub/inner.sys"));
    EXPECT_TRUE(hostPathExists(elsewhere + "/keep.txt"));
    // Without the service nothing is counted.
    ASSERT_EQ(android::NO_ERROR, mServices->stop("SysinfoService"));
    EXPECT_EQ("-2 ", dumpAfter(60000));
    EXPECT_EQ(0, dumper()->getDumpCount());
}

}  // namespace
