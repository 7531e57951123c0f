#include <gtest/gtest.h>

#include <cutils/properties.h>

#include <climits>
#include <cstring>
#include <string>
#include <utility>

#include "common/TestEnv.h"
#include "kelvo/HostProperties.h"
#include "kelvo/RootPath.h"

using kelvo::HostProperties;
using kelvo::test::TempRoot;

namespace {

std::string get(const char* key, const char* defaultValue = nullptr) {
    char value[PROPERTY_VALUE_MAX];
    memset(value, 'Z', sizeof(value));
    int len = property_get(key, value, defaultValue);
    EXPECT_EQ(static_cast<size_t>(len), strlen(value)) << key;
    return value;
}

class PropertiesTest : public ::testing::Test {
protected:
    TempRoot mRoot;
};

} // namespace

TEST_F(PropertiesTest, GetFallsBackToTheDefaultAndCutsAtTheLimit) {
    EXPECT_EQ("fallback", get("kelvo.test.missing", "fallback"));
    EXPECT_EQ("", get("kelvo.test.missing", nullptr));
    EXPECT_EQ("fallback", get(nullptr, "fallback"));

    ASSERT_EQ(0, property_set("kelvo.test.value", "stored"));
    EXPECT_EQ("stored", get("kelvo.test.value", "fallback"));
    // An empty value counts as unset.
    ASSERT_EQ(0, property_set("kelvo.test.value", ""));
    EXPECT_EQ("fallback", get("kelvo.test.value", "fallback"));
    EXPECT_EQ("", get("kelvo.test.value"));

    // A long default is cut at the value limit.
    std::string longDefault(PROPERTY_VALUE_MAX + 40, 'd');
    char value[PROPERTY_VALUE_MAX];
    EXPECT_EQ(PROPERTY_VALUE_MAX - 1,
              property_get("kelvo.test.missing", value, longDefault.c_str()));
    EXPECT_EQ(std::string(PROPERTY_VALUE_MAX - 1, 'd'), std::string(value));

    // Values that bypass the setter's limit are cut the same way.
    std::string longValue(200, 'v');
    HostProperties::setForTest("kelvo.test.long", longValue.c_str());
    EXPECT_EQ(std::string(PROPERTY_VALUE_MAX - 1, 'v'), get("kelvo.test.long"));
}

TEST_F(PropertiesTest, IntegersParseInAnyBaseWithinRange) {
    struct Case {
        const char* text;
        bool fits32;
        int64_t value;
    } cases[] = {
            {"42", true, 42},         {"-17", true, -17},
            {"+5", true, 5},          {"0x10", true, 16},
            {"010", true, 8},         {"2147483647", true, INT32_MAX},
            {"-2147483648", true, INT32_MIN},
            {"2147483648", false, 2147483648LL},
            {"-2147483649", false, -2147483649LL},
            {"9223372036854775807", false, INT64_MAX},
            {"-9223372036854775808", false, INT64_MIN},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.text);
        ASSERT_EQ(0, property_set("kelvo.test.number", c.text));
        EXPECT_EQ(c.value, property_get_int64("kelvo.test.number", 3));
        EXPECT_EQ(c.fits32 ? static_cast<int32_t>(c.value) : 3,
                  property_get_int32("kelvo.test.number", 3));
    }
    // Beyond int64, or not a number at all: the default.
    for (const char* text : {"9223372036854775808", "-9223372036854775809",
                             "99999999999999999999", "abc", "12abc", "1.5", "0x", "", "-"}) {
        SCOPED_TRACE(text);
        ASSERT_EQ(0, property_set("kelvo.test.number", text));
        EXPECT_EQ(-9, property_get_int64("kelvo.test.number", -9));
        EXPECT_EQ(-9, property_get_int32("kelvo.test.number", -9));
    }
    EXPECT_EQ(INT64_MIN, property_get_int64("kelvo.test.unset", INT64_MIN));
}

TEST_F(PropertiesTest, ReadOnlyValuesComeFromTheBuildPropFiles) {
    mRoot.writeFile("/system/build.prop",
                    "# system properties\n"
                    "ro.kelvo.board=alpha\n"
                    "  ro.kelvo.spaced  =  padded value  \n"
                    "#ro.kelvo.commented=1\n"
                    "ro.kelvo.board=second\n"
                    "not a property line\n"
                    "ro.kelvo.both=system\n"
                    "kelvo.plain=system\n"
                    "\n");
    mRoot.writeFile("/vendor/build.prop",
                    "ro.kelvo.both=vendor\n"
                    "ro.kelvo.vendor=v1\n"
                    "kelvo.plain=vendor\n");
    HostProperties::reload();

    EXPECT_EQ("alpha", get("ro.kelvo.board"));
    EXPECT_EQ("padded value", get("ro.kelvo.spaced"));
    EXPECT_EQ("", get("ro.kelvo.commented"));
    EXPECT_EQ("system", get("ro.kelvo.both"));
    EXPECT_EQ("v1", get("ro.kelvo.vendor"));
    // Only read-only properties keep their first definition.
    EXPECT_EQ("vendor", get("kelvo.plain"));

    // A read-only property from the files cannot be changed; another one
    // can be set once, and is gone after a reload.
    EXPECT_EQ(-1, property_set("ro.kelvo.board", "changed"));
    EXPECT_EQ("alpha", get("ro.kelvo.board"));
    EXPECT_EQ(0, property_set("ro.kelvo.once", "first"));
    EXPECT_EQ(-1, property_set("ro.kelvo.once", "second"));
    EXPECT_EQ("first", get("ro.kelvo.once"));

    // The tail of a long comment or value is not read as a line of its own.
    std::string comment = "#" + std::string(1022, 'c') + "ro.kelvo.hidden=1\n";
    std::string value = "ro.kelvo.big=" + std::string(1010, 'v') + "ro.kelvo.tail=2\n";
    mRoot.writeFile("/system/build.prop",
                    comment + value + "ro.kelvo.after=3\n" + std::string(5000, '#') + "\n" +
                            "ro.kelvo.last=4");
    HostProperties::reload();
    EXPECT_EQ("", get("ro.kelvo.once"));
    EXPECT_EQ("", get("ro.kelvo.hidden"));
    EXPECT_EQ("", get("ro.kelvo.tail"));
    EXPECT_EQ("", get("ro.kelvo.big"));
    EXPECT_EQ("3", get("ro.kelvo.after"));
    // The last line needs no newline.
    EXPECT_EQ("4", get("ro.kelvo.last"));
}

TEST_F(PropertiesTest, PersistentValuesSurviveAReload) {
    ASSERT_EQ(0, property_set("persist.kelvo.test", "kept"));
    ASSERT_EQ(0, property_set("kelvo.test.memory", "lost"));
    EXPECT_EQ("kept", mRoot.readFile("/data/property/persist.kelvo.test"));
    EXPECT_FALSE(kelvo::test::hostPathExists(mRoot.path() + "/data/property/kelvo.test.memory"));

    HostProperties::reload();
    EXPECT_EQ("kept", get("persist.kelvo.test"));
    EXPECT_EQ("", get("kelvo.test.memory"));

    // An update replaces the file's content.
    ASSERT_EQ(0, property_set("persist.kelvo.test", "v2"));
    HostProperties::reload();
    EXPECT_EQ("v2", get("persist.kelvo.test"));
    EXPECT_EQ("v2", mRoot.readFile("/data/property/persist.kelvo.test"));

    // Values written into the folder by hand are read as well.
    mRoot.writeFile("/data/property/persist.kelvo.manual", "by hand");
    mRoot.writeFile("/data/property/.temp.persist.kelvo.partial", "ignored");
    HostProperties::reload();
    EXPECT_EQ("by hand", get("persist.kelvo.manual"));
    EXPECT_EQ("", get(".temp.persist.kelvo.partial"));
    EXPECT_EQ("", get("persist.kelvo.partial"));

    // They belong to their root.
    ASSERT_EQ(0, property_set("persist.kelvo.rooted", "here"));
    {
        TempRoot other;
        EXPECT_EQ("", get("persist.kelvo.rooted"));
    }
    // Leaving the inner root resets to the real root; come back to ours.
    kelvo::RootPath::setRoot(mRoot.path().c_str());
    HostProperties::reload();
    EXPECT_EQ("here", get("persist.kelvo.rooted"));
}

TEST_F(PropertiesTest, OverlongKeysAndValuesAreRefused) {
    std::string key(PROPERTY_KEY_MAX - 1, 'k');
    std::string tooLongKey(PROPERTY_KEY_MAX, 'k');
    std::string value(PROPERTY_VALUE_MAX - 1, 'v');
    std::string tooLongValue(PROPERTY_VALUE_MAX, 'v');

    EXPECT_EQ(0, property_set(key.c_str(), "ok"));
    EXPECT_EQ(-1, property_set(tooLongKey.c_str(), "no"));
    EXPECT_EQ("", get(tooLongKey.c_str()));

    EXPECT_EQ(0, property_set("kelvo.test.value", value.c_str()));
    EXPECT_EQ(-1, property_set("kelvo.test.value", tooLongValue.c_str()));
    EXPECT_EQ(value, get("kelvo.test.value"));

    // A refused persistent value leaves no file behind.
    EXPECT_EQ(-1, property_set("persist.kelvo.big", tooLongValue.c_str()));
    EXPECT_FALSE(kelvo::test::hostPathExists(mRoot.path() + "/data/property/persist.kelvo.big"));
    HostProperties::reload();
    EXPECT_EQ("", get("persist.kelvo.big"));

    EXPECT_EQ(-1, property_set("", "empty key"));
    EXPECT_EQ(-1, property_set(nullptr, "null key"));
}
