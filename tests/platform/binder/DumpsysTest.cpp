// The dumpsys tool against a service of this process.

#include <gtest/gtest.h>
#include <limits.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "common/TestEnv.h"
#include "platform/binder/BinderTestUtil.h"

using android::String16;

namespace {

// dumpsys sits beside the test program in bin/.
std::string dumpsysPath() {
    char self[PATH_MAX] = {};
    ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
    std::string path(self, n > 0 ? static_cast<size_t>(n) : 0);
    return path.substr(0, path.find_last_of('/') + 1) + "dumpsys";
}

// Runs the command; returns its exit status and standard output.
int run(const std::string& command, std::string* out) {
    FILE* p = popen(command.c_str(), "r");
    if (p == nullptr) {
        return -1;
    }
    char buf[256];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), p)) > 0) {
        out->append(buf, n);
    }
    int status = pclose(p);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

class DumpsysTest : public ::testing::Test {
protected:
    void SetUp() override {
        if (access(dumpsysPath().c_str(), X_OK) != 0) {
            GTEST_SKIP() << "dumpsys not built beside the tests";
        }
        ASSERT_EQ(android::NO_ERROR, android::defaultServiceManager()->addService(
                                         String16("test.dumped"), new kelvo::test::TestService()));
    }
    void TearDown() override { kelvo::ServiceControl::stopService(String16("test.dumped")); }

    kelvo::test::TempRoot mRoot;
};

TEST_F(DumpsysTest, DumpWritesToItsStandardOutput) {
    std::string out;
    EXPECT_EQ(0, run(dumpsysPath() + " -r " + mRoot.path() + " test.dumped --log cpu 1", &out));
    EXPECT_EQ("dump of test service: --log cpu 1\n", out);

    out.clear();
    EXPECT_EQ(0, run(dumpsysPath() + " -r " + mRoot.path() + " test.dumped", &out));
    EXPECT_EQ("dump of test service:\n", out);

    // The root may come from the environment too.
    out.clear();
    EXPECT_EQ(0, run("KELVO_ROOT=" + mRoot.path() + " " + dumpsysPath() + " test.dumped -v", &out));
    EXPECT_EQ("dump of test service: -v\n", out);
}

TEST_F(DumpsysTest, UnknownServiceAndBadUsageFail) {
    std::string out;
    EXPECT_EQ(1, run(dumpsysPath() + " -r " + mRoot.path() + " test.absent 2>&1", &out));
    EXPECT_NE(std::string::npos, out.find("Can't find service: test.absent")) << out;
    out.clear();
    EXPECT_EQ(2, run(dumpsysPath() + " -r " + mRoot.path() + " 2>/dev/null", &out));

    out.clear();
    EXPECT_EQ(0, run(dumpsysPath() + " -r " + mRoot.path() + " -l", &out));
    EXPECT_NE(std::string::npos, out.find("  test.dumped\n")) << out;
}

} // namespace
