// The root-path resolver and the customisation locator.

#include <gtest/gtest.h>
#include <string.h>
#include <unistd.h>

#include <cust/CustConfig.h>

#include <string>
#include <vector>

#include "common/TestEnv.h"
#include "kelvo/HostProperties.h"
#include "kelvo/Processors.h"
#include "kelvo/RootPath.h"

using kelvo::RootPath;

TEST(RootPathTest, AbsolutePathsGoUnderTheRootAndOthersAreLeftAlone) {
    std::string saved = RootPath::root();
    // Trailing slashes of the root are dropped; "/" and "" are the real
    // root, which adds nothing.
    struct Case {
        const char* root;
        const char* rootSeen;
        const char* path;
        const char* resolved;
    } cases[] = {
            {"/tmp/kr", "/tmp/kr", "/sys/class/power_supply", "/tmp/kr/sys/class/power_supply"},
            {"/tmp/kr", "/tmp/kr", "/", "/tmp/kr/"},
            {"/tmp/kr", "/tmp/kr", "data/x", "data/x"},
            {"/tmp/kr", "/tmp/kr", "./x", "./x"},
            {"/tmp/kr", "/tmp/kr", "", ""},
            {"/tmp/kr", "/tmp/kr", nullptr, ""},
            {"/tmp/kr///", "/tmp/kr", "/vendor/build.prop", "/tmp/kr/vendor/build.prop"},
            {"/", "", "/vendor/build.prop", "/vendor/build.prop"},
            {"", "", "/data/x", "/data/x"},
            {nullptr, "", "/proc/stat", "/proc/stat"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.root ? c.root : "null") + " " + (c.path ? c.path : "null"));
        RootPath::setRoot(c.root);
        EXPECT_EQ(c.rootSeen, RootPath::root());
        EXPECT_EQ(c.resolved, RootPath::resolve(c.path));
    }

    RootPath::setRoot(saved.c_str());
    kelvo::HostProperties::reload();
}

namespace {

constexpr const char* kSuffix = "xml/tv_kelvo_config.xml";

std::string locate(const char* suffix, int type = 0) {
    char buffer[CUST_CFG_PATH_MAX];
    memset(buffer, 'x', sizeof(buffer));
    const char* found = get_one_cfg_file(suffix, buffer, type);
    return found != nullptr ? std::string(found) : std::string("(null)");
}

TEST(CustConfigTest, HighestPriorityExistingCopyWins) {
    kelvo::test::TempRoot root;
    EXPECT_EQ("(null)", locate(kSuffix));
    root.writeFile("/system/etc/xml/tv_kelvo_config.xml", "s");
    EXPECT_EQ(root.path() + "/system/etc/xml/tv_kelvo_config.xml", locate(kSuffix));
    root.writeFile("/vendor/etc/xml/tv_kelvo_config.xml", "v");
    EXPECT_EQ(root.path() + "/vendor/etc/xml/tv_kelvo_config.xml", locate(kSuffix));
    // A directory of that name is no copy.
    root.writeFile("/cust/xml/tv_kelvo_config.xml/inner", "d");
    EXPECT_EQ(root.path() + "/vendor/etc/xml/tv_kelvo_config.xml", locate(kSuffix));
    root.writeFile("/cust/other.xml", "c");
    EXPECT_EQ(root.path() + "/cust/other.xml", locate("other.xml"));
}

TEST(CustConfigTest, RefusesWhatItCannotAnswerExactly) {
    kelvo::test::TempRoot root;
    root.writeFile("/cust/a.xml", "c");
    root.writeFile("/a.xml", "outside");
    EXPECT_EQ("(null)", locate("a.xml", 1));
    EXPECT_EQ("(null)", locate("/a.xml"));
    EXPECT_EQ("(null)", locate("../a.xml"));
    EXPECT_EQ("(null)", locate(""));
    char buffer[CUST_CFG_PATH_MAX];
    EXPECT_EQ(nullptr, get_one_cfg_file(nullptr, buffer, 0));
    EXPECT_EQ(nullptr, get_one_cfg_file("a.xml", nullptr, 0));

    // The winning path fills the buffer exactly, or is not returned at all.
    std::string dir = root.path() + "/cust/";
    size_t fitting = CUST_CFG_PATH_MAX - 1 - dir.size();
    std::string name(fitting, 'n');
    root.writeFile("/cust/" + name, "fits");
    EXPECT_EQ(dir + name, locate(name.c_str()));
    std::string tooLong = name + "n";
    root.writeFile("/cust/" + tooLong, "too long");
    EXPECT_EQ("(null)", locate(tooLong.c_str()));
}

} // namespace

// The processor count comes from the device tree below the root, in order:
// "possible", the cpuN folders, the machine's own count.
TEST(ProcessorsTest, CountComesFromTheRootsTree) {
    struct Case {
        const char* name;
        const char* possible; // nullptr: no file
        std::vector<const char*> folders;
        int32_t expected; // 0: the machine's own count
    } cases[] = {
            {"range", "0-7\n", {"cpu0"}, 8},
            {"list", "0-3,6,8-9\n", {}, 10},
            {"single", "0\n", {}, 1},
            {"bad list falls back to folders", "7-3\n", {"cpu0", "cpu5", "cpufreq", "cpuidle"}, 6},
            {"huge index falls back", "0-100000\n", {"cpu1"}, 2},
            {"folders", nullptr, {"cpu0", "cpu11", "cpux1", "cpu2a"}, 12},
            {"nothing", nullptr, {}, 0},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        kelvo::test::TempRoot root;
        kelvo::test::makeHostDirs(root.path() + "/sys/devices/system/cpu");
        if (c.possible != nullptr) {
            root.writeFile("/sys/devices/system/cpu/possible", c.possible);
        }
        for (const char* f : c.folders) {
            kelvo::test::makeHostDirs(root.path() + "/sys/devices/system/cpu/" + f);
        }
        int32_t expected = c.expected > 0 ? c.expected
                                          : static_cast<int32_t>(sysconf(_SC_NPROCESSORS_CONF));
        EXPECT_EQ(expected, kelvo::Processors::configuredCount());
    }
}
