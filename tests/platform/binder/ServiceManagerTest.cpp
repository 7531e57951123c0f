// Service names, the wait for them, and the dumpsys tool.

#include <gtest/gtest.h>
#include <limits.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <thread>

#include "common/TestEnv.h"
#include "platform/binder/BinderTestUtil.h"

using android::sp;
using android::String16;
using Clock = std::chrono::steady_clock;

namespace {

class ServiceManagerTest : public ::testing::Test {
protected:
    void TearDown() override {
        kelvo::ServiceControl::stopService(String16("test.late"));
    }
    kelvo::test::TempRoot mRoot;
    sp<android::IServiceManager> mManager = android::defaultServiceManager();
};

TEST_F(ServiceManagerTest, GetServiceWaitsForTheNameToAppearOrItsTimeOut) {
    kelvo::test::ServiceWait wait(10000);
    std::thread late([this] {
        std::this_thread::sleep_for(std::chrono::milliseconds(300));
        mManager->addService(String16("test.late"), new kelvo::test::TestService());
    });
    sp<android::IBinder> service = mManager->getService(String16("test.late"));
    late.join();
    ASSERT_NE(nullptr, service);
    EXPECT_EQ(android::NO_ERROR, kelvo::test::echo(service, 1));

    // It gives up after its wait; checkService does not wait.
    kelvo::test::ServiceWait shortWait(300);
    Clock::time_point start = Clock::now();
    EXPECT_EQ(nullptr, mManager->getService(String16("test.missing")));
    Clock::duration waited = Clock::now() - start;
    EXPECT_GE(waited, std::chrono::milliseconds(300));
    EXPECT_LT(waited, std::chrono::seconds(5));

    kelvo::test::ServiceWait longWait(60000);
    start = Clock::now();
    EXPECT_TRUE(mManager->checkService(String16("test.missing")) == nullptr &&
                Clock::now() - start < std::chrono::seconds(5));
}

TEST_F(ServiceManagerTest, NamesThatCannotBeSocketsAreRefused) {
    sp<android::IBinder> service = new kelvo::test::TestService();
    for (const char* bad : {"", "a/b", "../up", ".hidden", "..", "sp ace", "new\nline"}) {
        SCOPED_TRACE(bad);
        EXPECT_EQ(android::BAD_VALUE, mManager->addService(String16(bad), service));
        EXPECT_EQ(nullptr, mManager->checkService(String16(bad)));
    }
    EXPECT_EQ(android::BAD_VALUE,
              mManager->addService(String16(std::string(200, 'n').c_str()), service));
    EXPECT_EQ(android::BAD_VALUE, mManager->addService(String16("test.null"), nullptr));
    // Nothing was created outside the socket folder.
    EXPECT_FALSE(kelvo::test::hostPathExists(mRoot.path() + "/dev/up"));
}

TEST(DumpsysTest, DumpsToItsStandardOutputAndFailsClearly) {
    // dumpsys sits beside the test program in bin/.
    char self[PATH_MAX] = {};
    ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
    std::string tool(self, n > 0 ? static_cast<size_t>(n) : 0);
    tool = tool.substr(0, tool.find_last_of('/') + 1) + "dumpsys";
    if (access(tool.c_str(), X_OK) != 0) {
        GTEST_SKIP() << "dumpsys not built beside the tests";
    }
    kelvo::test::TempRoot root;
    ASSERT_EQ(android::NO_ERROR, android::defaultServiceManager()->addService(
                                     String16("test.dumped"), new kelvo::test::TestService()));
    // Runs dumpsys with the arguments; its exit status and standard output.
    auto run = [&](const std::string& args, std::string* out) {
        out->clear();
        FILE* p = popen((tool + " -r " + root.path() + " " + args).c_str(), "r");
        char buf[256];
        size_t got;
        while (p != nullptr && (got = fread(buf, 1, sizeof(buf), p)) > 0) {
            out->append(buf, got);
        }
        int status = p != nullptr ? pclose(p) : -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    };
    std::string out;
    EXPECT_EQ(0, run("test.dumped --log 'x y' 1", &out));
    EXPECT_EQ("dump of test service: --log x y 1\n", out);
    EXPECT_EQ(1, run("test.absent 2>&1", &out));
    EXPECT_NE(std::string::npos, out.find("Can't find service: test.absent")) << out;
    EXPECT_EQ(0, run("-l", &out));
    EXPECT_NE(std::string::npos, out.find("  test.dumped\n")) << out;
    kelvo::ServiceControl::stopService(String16("test.dumped"));
}

} // namespace
