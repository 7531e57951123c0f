#include <gtest/gtest.h>

#include <string>

#include "kelvo/HostProperties.h"
#include "kelvo/RootPath.h"

using kelvo::RootPath;

TEST(RootPathTest, AbsolutePathsGoUnderTheRootAndOthersAreLeftAlone) {
    std::string saved = RootPath::root();
    struct Case {
        const char* root;
        const char* path;
        const char* resolved;
    } cases[] = {
            {"/tmp/kr", "/sys/class/power_supply", "/tmp/kr/sys/class/power_supply"},
            {"/tmp/kr", "/", "/tmp/kr/"},
            {"/tmp/kr", "data/x", "data/x"},
            {"/tmp/kr", "./x", "./x"},
            {"/tmp/kr", "", ""},
            {"/tmp/kr", nullptr, ""},
            // Trailing slashes of the root are dropped; "/" and "" are the
            // real root, which adds nothing.
            {"/tmp/kr///", "/vendor/build.prop", "/tmp/kr/vendor/build.prop"},
            {"/", "/vendor/build.prop", "/vendor/build.prop"},
            {"", "/data/x", "/data/x"},
            {nullptr, "/proc/stat", "/proc/stat"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.root ? c.root : "null") + " " + (c.path ? c.path : "null"));
        RootPath::setRoot(c.root);
        EXPECT_EQ(c.resolved, RootPath::resolve(c.path));
    }
    RootPath::setRoot("/tmp/kr/");
    EXPECT_EQ("/tmp/kr", RootPath::root());
    EXPECT_EQ("/tmp/kr/data/x", RootPath::resolve(std::string("/data/x")));
    RootPath::setRoot("/");
    EXPECT_EQ("", RootPath::root());

    RootPath::setRoot(saved.c_str());
    kelvo::HostProperties::reload();
}
