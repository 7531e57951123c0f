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
    auto run = [&](const std::string& args, std::string* out, const char* env = "") {
        out->clear();
        std::string command = std::string(env) + tool + " " + args;
        FILE* p = popen(command.c_str(), "r");
        char buf[256];
        size_t got;
        while (p != nullptr && (got = fread(buf, 1, sizeof(buf), p)) > 0) {
            out->append(buf, got);
        }
        int status = p != nullptr ? pclose(p) : -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    };
    std::string at = "-r " + root.path() + " ";
    std::string out;
    EXPECT_EQ(0, run(at + "test.dumped --log cpu 1", &out));
    EXPECT_EQ("dump of test service: --log cpu 1\n", out);
    EXPECT_EQ(0, run(at + "test.dumped", &out));
    EXPECT_EQ("dump of test service:\n", out);
    // The root may come from the environment too.
    std::string env = "KELVO_ROOT=" + root.path() + " ";
    EXPECT_EQ(0, run("test.dumped -v", &out, env.c_str()));
    EXPECT_EQ("dump of test service: -v\n", out);

    EXPECT_EQ(1, run(at + "test.absent 2>&1", &out));
    EXPECT_NE(std::string::npos, out.find("Can't find service: test.absent")) << out;
    EXPECT_EQ(2, run(at + "2>/dev/null", &out));
    EXPECT_EQ(0, run(at + "-l", &out));
    EXPECT_NE(std::string::npos, out.find("  test.dumped\n")) << out;
    kelvo::ServiceControl::stopService(String16("test.dumped"));
}

} // namespace
