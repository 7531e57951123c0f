#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <vector>

#include "binder/managers/PackageManager.h"
#include "common/TestEnv.h"

using android::String8;
using kelvo::PackageManager;
using kelvo::test::waitFor;

// The program serves the services from another process, as on the phone.
TEST(PlatformServicesProgramTest, ServesPackagesGivenOnTheCommandLine) {
    kelvo::test::TempRoot root;
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        execl(KELVO_PLATFORM_SERVICES, KELVO_PLATFORM_SERVICES, "-r", root.path().c_str(), "-p",
              "10500=com.example.first,com.example.second", static_cast<char*>(nullptr));
        _exit(127);
    }
    std::vector<String8> packages;
    EXPECT_TRUE(waitFor(
        [&] {
            packages.clear();
            return PackageManager::getInstance()->getPackagesForUid(10500, packages) == 0;
        },
        std::chrono::milliseconds(20000)));
    ASSERT_EQ(2u, packages.size());
    EXPECT_STREQ("com.example.second", packages[1].string());

    ASSERT_EQ(0, kill(child, SIGTERM));
    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    EXPECT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
    // The process's death reaches the client.
    EXPECT_TRUE(waitFor([] { return !PackageManager::getInstance()->isConnected(); },
                        std::chrono::milliseconds(20000)));
}
