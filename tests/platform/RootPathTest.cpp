#include <gtest/gtest.h>

#include <string>

#include "kelvo/HostProperties.h"
#include "kelvo/RootPath.h"

using kelvo::RootPath;

namespace {

// Puts the process's root back as it was.
class RootPathTest : public ::testing::Test {
protected:
    void SetUp() override { mSaved = RootPath::root(); }
    void TearDown() override {
        RootPath::setRoot(mSaved.c_str());
        kelvo::HostProperties::reload();
    }

private:
    std::string mSaved;
};

} // namespace

TEST_F(RootPathTest, AbsolutePathsGoUnderTheRoot) {
    RootPath::setRoot("/tmp/kelvo-root");
    EXPECT_EQ("/tmp/kelvo-root", RootPath::root());
    EXPECT_EQ("/tmp/kelvo-root/sys/class/power_supply",
              RootPath::resolve("/sys/class/power_supply"));
    EXPECT_EQ("/tmp/kelvo-root/", RootPath::resolve("/"));
    EXPECT_EQ("/tmp/kelvo-root/data/x", RootPath::resolve(std::string("/data/x")));

    // The real root adds nothing.
    RootPath::setRoot("");
    EXPECT_EQ("", RootPath::root());
    EXPECT_EQ("/data/x", RootPath::resolve("/data/x"));
    RootPath::setRoot(nullptr);
    EXPECT_EQ("/proc/stat", RootPath::resolve("/proc/stat"));
}

TEST_F(RootPathTest, RelativePathsAreLeftAlone) {
    RootPath::setRoot("/tmp/kelvo-root");
    EXPECT_EQ("data/x", RootPath::resolve("data/x"));
    EXPECT_EQ("./x", RootPath::resolve("./x"));
    EXPECT_EQ("", RootPath::resolve(""));
    EXPECT_EQ("", RootPath::resolve(static_cast<const char*>(nullptr)));
}

TEST_F(RootPathTest, TrailingSlashesOfTheRootAreDropped) {
    for (const char* root : {"/tmp/kelvo-root/", "/tmp/kelvo-root///"}) {
        SCOPED_TRACE(root);
        RootPath::setRoot(root);
        EXPECT_EQ("/tmp/kelvo-root", RootPath::root());
        EXPECT_EQ("/tmp/kelvo-root/vendor/build.prop", RootPath::resolve("/vendor/build.prop"));
    }
    // "/" alone is the real root.
    RootPath::setRoot("/");
    EXPECT_EQ("", RootPath::root());
    EXPECT_EQ("/vendor/build.prop", RootPath::resolve("/vendor/build.prop"));
}
