#include <gtest/gtest.h>

#include <binder/Parcel.h>

#include "KelvoLibEntry.h"
#include "common/TestEnv.h"
#include "libkelvo/LibraryTestUtil.h"
#include "utils/XmlParser.h"

using android::Parcel;
using kelvo::config_parameter;
using kelvo::XmlParser;
using namespace kelvo::test;

namespace {

constexpr const char* kDataPath = "/data/misc/kelvo/tv_kelvo_config.xml";
constexpr const char* kVendorPath = "/vendor/etc/xml/tv_kelvo_config.xml";

// One component of each kind and each flaw the lookups must survive.
constexpr const char* kTestXml = R"(<?xml version="1.0"?>
<config>
  <element id="0">
    <component id="0"><parameter>30</parameter><parameter> 500 </parameter></component>
    <component id="1"><parameter>7</parameter><parameter>8x</parameter><parameter>9</parameter></component>
    <component id="4">
      <parameter id="1"><value key="10">100</value><value key="20">-200</value></parameter>
      <parameter id="2"><value key="30">300</value></parameter>
    </component>
    <component id="5">
      <parameter id="1"><value key="0">11</value><value>12</value><value key="1">13</value></parameter>
      <parameter id="2"><value key="1">21</value></parameter>
    </component>
    <component id="6">
      <parameter id="0"><value key="0">5</value><value key="0">five</value><value key="0">6</value></parameter>
      <parameter id="1"><value key="0">7</value></parameter>
    </component>
    <component id="7"><parameter><value>1</value></parameter></component>
    <component id="8"><parameter id="-1"><value>1</value></parameter></component>
    <component id="12"><parameter>1</parameter></component>
  </element>
  <element id="2">
    <component id="0"><parameter>2</parameter></component>
    <component id="6"><parameter>1</parameter></component>
  </element>
  <element id="3"><component id="2"><parameter>1</parameter></component></element>
  <element id="4"><component id="1"><parameter>1</parameter></component></element>
  <element id="7"><component id="0"><parameter>1</parameter></component></element>
  <element id="1000">
    <component id="0"><parameter>v1.2</parameter><parameter>second text</parameter></component>
    <component id="1"/>
    <component id="2"><parameter>a</parameter><parameter/></component>
  </element>
</config>
)";

Bytes ints(std::initializer_list<int32_t> values) {
    Fields f;
    for (int32_t value : values) {
        f.i32(value);
    }
    return f.bytes();
}

class XmlParserTest : public ::testing::Test {
protected:
    void SetUp() override { XmlParser::resetInstance(); }
    void TearDown() override { XmlParser::resetInstance(); }

    // A lookup on the library's parser (element 0 included).
    int32_t lookup(int32_t element, const Parcel& request, Parcel* reply) {
        return XmlParser::getInstance()->getXmlConfig(element, request, reply);
    }
    int32_t simple(int32_t element, int32_t component, Parcel* reply) {
        return lookup(element, Fields().i32(component).parcel(), reply);
    }
    int32_t grouped(int32_t element, int32_t component, int32_t parameter, bool keyed,
                    Parcel* reply) {
        return lookup(element, Fields().i32(component).i32(parameter).flag(keyed).parcel(), reply);
    }
    // The parsed answer of a grouped lookup; fails the test on a bad reply.
    std::vector<config_parameter> groups(int32_t element, int32_t component, int32_t parameter,
                                         bool keyed) {
        Parcel reply;
        std::vector<config_parameter> parameters;
        EXPECT_EQ(0, grouped(element, component, parameter, keyed, &reply));
        EXPECT_EQ(0, XmlParser::readGroupedReply(reply, keyed, &parameters));
        return parameters;
    }

    TempRoot mRoot;
    LogCapture mLog;
};

TEST_F(XmlParserTest, SimpleAndTextRepliesHoldOneEntryPerParameter) {
    mRoot.writeFile(kDataPath, kTestXml);
    Parcel reply;
    ASSERT_EQ(0, simple(0, 0, &reply));
    EXPECT_EQ(ints({30, 500}), bytesOf(reply));
    EXPECT_EQ(0u, reply.dataPosition());

    // The daemon's entry answers the same way.
    ASSERT_EQ(0, kelvo::getXmlConfig(kelvo::CONFIG_COMPONENT_POLICY, Fields().i32(0).parcel(),
                                     &reply));
    EXPECT_EQ(ints({2}), bytesOf(reply));

    ASSERT_EQ(0, simple(1000, 0, &reply));
    EXPECT_EQ(Fields().str("v1.2").str("second text").bytes(), bytesOf(reply));
    EXPECT_EQ(0u, reply.dataPosition());
    // No parameter: an empty text list; a parameter without text: failure.
    EXPECT_EQ(0, simple(1000, 1, &reply));
    EXPECT_EQ(0u, reply.dataSize());

    // A simple value that is not an integer ends the list; earlier ones stay.
    EXPECT_EQ(0, simple(0, 1, &reply));
    EXPECT_EQ(ints({7}), bytesOf(reply));
    EXPECT_EQ(1u, mLog.count("getSimpleParameters# Failed to get parameter of component",
                             ANDROID_LOG_ERROR));
}

// Grouped answers: id, then "1, [key,] value" per value, -1 after each
// parameter and once more at the end. A bad value ends its parameter
// without a lone "value follows" mark; the next parameter still comes.
TEST_F(XmlParserTest, GroupedRepliesKeyedUnkeyedSingleMissingAndBad) {
    mRoot.writeFile(kDataPath, kTestXml);
    struct Case {
        int32_t component;
        int32_t parameter;
        bool keyed;
        Bytes answer;
        const char* log;
    };
    const Case cases[] = {
        {4, -1, true, ints({1, 1, 10, 100, 1, 20, -200, -1, 2, 1, 30, 300, -1, -1}), ""},
        {4, -1, false, ints({1, 1, 100, 1, -200, -1, 2, 1, 300, -1, -1}), ""},
        {4, 2, true, ints({2, 1, 30, 300, -1, -1}), ""},
        {4, 1, false, ints({1, 1, 100, 1, -200, -1, -1}), ""},
        {4, 5, true, ints({-1}), ""}, // a parameter the component does not have
        {5, -1, true, ints({1, 1, 0, 11, -1, 2, 1, 1, 21, -1, -1}),
         "Failed to get value attribute key of parameter"},
        {5, -1, false, ints({1, 1, 11, 1, 12, 1, 13, -1, 2, 1, 21, -1, -1}), ""},
        {6, -1, true, ints({0, 1, 0, 5, -1, 1, 1, 0, 7, -1, -1}), "Failed to get value of parameter"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(testing::Message() << c.component << " " << c.parameter << " " << c.keyed);
        mLog.clear();
        Parcel reply;
        ASSERT_EQ(0, grouped(0, c.component, c.parameter, c.keyed, &reply));
        EXPECT_EQ(c.answer, bytesOf(reply));
        EXPECT_EQ(0u, reply.dataPosition());
        if (c.log[0] != '\0') {
            EXPECT_EQ(1u, mLog.count(c.log, ANDROID_LOG_ERROR));
        }
    }
    // The reader gives the same back.
    std::vector<config_parameter> all = groups(0, 4, -1, true);
    ASSERT_EQ(2u, all.size());
    EXPECT_EQ(20, all[0].values.at(1).key);
    EXPECT_EQ(-200, all[0].values.at(1).value);
    EXPECT_EQ(300, all[1].values.at(0).value);
    // A parameter without id, or with the end mark as id, fails the lookup.
    Parcel reply;
    EXPECT_EQ(-1, grouped(0, 7, -1, false, &reply));
    EXPECT_EQ(-1, grouped(0, 8, -1, false, &reply));
    EXPECT_EQ(2u, mLog.count("Failed to get attribute id of parameter", ANDROID_LOG_ERROR));
}

// Every refused lookup says why; unknown profiles and elements answer with
// nothing.
TEST_F(XmlParserTest, RefusedLookupsLeaveAnEmptyReply) {
    mRoot.writeFile(kDataPath, kTestXml);
    struct Case {
        bool entry; // through the daemon's entry, else the library's parser
        int32_t element;
        std::vector<int32_t> request;
        int32_t ret;
        const char* log;
    };
    const Case cases[] = {
        {false, 2, {6}, -1, "Invalid component policy type: 6"},
        {false, 4, {1}, -1, "Invalid settings type: 1"},
        {true, 2, {6}, -1, "[KelvoLibEntry.cpp] getXmlConfig# Failed to get xml configuation"},
        {false, 0, {12}, 0, "Unknown power profile type: 12"},
        {false, 7, {0}, 0, "Unknown element id: 7"},
        {false, 9, {0}, -1, "Failed to parse xml element: 9"},
        {false, 2, {3}, -1, "Failed to parse"},
        {false, 1000, {2}, -1, "getTextParameters# Failed to get parameter of component"},
        // The library reaches element 0; nobody reaches past 1000.
        {true, 0, {0}, -1, "[KelvoLibEntry.cpp] getXmlConfig# Invalid element: 0"},
        {true, 1001, {0}, -1, "[KelvoLibEntry.cpp] getXmlConfig# Invalid element: 1001"},
        {false, 1001, {0}, -1, "getXmlConfig# Invalid element id: 1001"},
        // A short request.
        {false, 1, {0}, -1, ""},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(testing::Message() << c.element << " " << c.log);
        Fields request;
        for (int32_t value : c.request) {
            request.i32(value);
        }
        Parcel reply;
        mLog.clear();
        EXPECT_EQ(c.ret, c.entry ? kelvo::getXmlConfig(c.element, request.parcel(), &reply)
                                 : lookup(c.element, request.parcel(), &reply));
        if (c.ret == 0) {
            EXPECT_EQ(0u, reply.dataSize());
        }
        if (c.log[0] != '\0') {
            EXPECT_EQ(1u, mLog.count(c.log));
        }
    }
    EXPECT_EQ(-1, kelvo::getXmlConfig(1000, Fields().i32(0).parcel(), nullptr));
}

TEST_F(XmlParserTest, CutOrEmptyGroupedRepliesReadAsFailures) {
    mRoot.writeFile(kDataPath, kTestXml);
    Parcel reply;
    ASSERT_EQ(0, grouped(0, 4, -1, true, &reply));
    Bytes full = bytesOf(reply);
    std::vector<config_parameter> parameters;
    for (size_t cut = 0; cut < full.size(); cut += 4) {
        Parcel part;
        part.setData(full.data(), cut);
        parameters.assign(1, config_parameter{7, {}});
        EXPECT_EQ(-1, XmlParser::readGroupedReply(part, true, &parameters)) << cut;
        EXPECT_TRUE(parameters.empty()) << cut;
    }
    // Another mark than 1 ends a parameter's values, as the thresholds'
    // readers have it.
    Fields marked;
    marked.i32(4).i32(1).i32(60).i32(0).i32(5).i32(1).i32(30).i32(-1).i32(-1);
    ASSERT_EQ(0, XmlParser::readGroupedReply(marked.parcel(), false, &parameters));
    ASSERT_EQ(2u, parameters.size());
    EXPECT_EQ(60, parameters[0].values[0].value);
    EXPECT_EQ(5, parameters[1].id);
}

// Without a usable file every lookup fails; an unusable first file gives way
// to the located one.
TEST_F(XmlParserTest, LookupsNeedAUsableFile) {
    Parcel reply;
    for (int32_t element : {0, 1, 2, 3, 4, 1000}) {
        EXPECT_EQ(-1, simple(element, 0, &reply)) << element;
        EXPECT_EQ(-1, grouped(element, 3, -1, true, &reply)) << element;
    }
    EXPECT_EQ(1u, mLog.count("[XmlParser.cpp] XmlParser# Failed to get configuration file"));
    EXPECT_TRUE(mLog.contains("Invalid root element", ANDROID_LOG_ERROR));

    mRoot.writeFile(kVendorPath,
                    "<c><element id=\"4\"><component id=\"0\">"
                    "<parameter>1</parameter></component></element></c>");
    for (const char* first : {"<c><element id=\"4\">", "<?xml version=\"1.0\"?><!-- none -->"}) {
        XmlParser::resetInstance();
        mRoot.writeFile(kDataPath, first);
        ASSERT_EQ(0, simple(4, 0, &reply)) << first;
        EXPECT_EQ(ints({1}), bytesOf(reply));
    }
    EXPECT_EQ(1u, mLog.count("No root element found"));
    EXPECT_EQ(2u, mLog.count("Using xml: " + mRoot.path() + kVendorPath));

    // A located file that is broken too leaves the parser without data.
    XmlParser::resetInstance();
    mRoot.writeFile(kVendorPath, "<c>");
    EXPECT_EQ(-1, simple(4, 0, &reply));
    EXPECT_EQ(1u, mLog.count("Failed to open xml file, running without configuration"));

    // openXmlFile replaces the document. Ids that are not integers fail
    // their lookup; elements before the flaw are still found.
    EXPECT_EQ(-1, XmlParser::getInstance()->openXmlFile(nullptr));
    mRoot.writeFile("/ids.xml", R"(<c>
      <element id="1"><component id="0"><parameter id="0"><value>1</value></parameter></component></element>
      <element id="3"><component id="1a"><parameter>1</parameter></component>
                      <component id="0"><parameter>1</parameter></component></element>
      <element><component id="0"><parameter>1</parameter></component></element>
      <element id="2"><component id="0"><parameter>1</parameter></component></element>
    </c>)");
    ASSERT_EQ(0, XmlParser::getInstance()->openXmlFile((mRoot.path() + "/ids.xml").c_str()));
    EXPECT_EQ(-1, simple(2, 0, &reply));
    EXPECT_EQ(1u, mLog.count("Failed to get attribute id of element", ANDROID_LOG_ERROR));
    EXPECT_EQ(-1, simple(3, 0, &reply));
    EXPECT_EQ(1u, mLog.count("Failed to get attribute id of component", ANDROID_LOG_ERROR));
    EXPECT_EQ(0, grouped(1, 0, -1, false, &reply));
    EXPECT_EQ(ints({0, 1, 1, -1, -1}), bytesOf(reply));
}

// The sample answers every request the library and the daemon make, with
// the shape each reader needs, and without one error line.
TEST_F(XmlParserTest, SampleConfigurationAnswersEveryReader) {
    std::string sample = readHostFile(KELVO_SAMPLE_CONFIG);
    ASSERT_FALSE(sample.empty());
    mRoot.writeFile(kDataPath, sample);
    struct Request {
        int32_t element;
        int32_t component;
        int32_t parameter; // -2: a simple request
        bool keyed;
        size_t groups;     // parameters in the answer (grouped requests)
    };
    std::vector<Request> requests = {
        {0, 0, -2, false, 0}, {0, 1, -2, false, 0}, {0, 2, -2, false, 0},
        {0, kelvo::PROFILE_CPU, -1, false, 3}, {0, kelvo::PROFILE_CAMERA, -1, true, 4},
        {0, kelvo::PROFILE_GPU, -1, true, 1}, {0, kelvo::PROFILE_MODEM, -1, true, 6},
        {0, kelvo::PROFILE_AUDIO, -1, true, 2}, {0, kelvo::PROFILE_DPM, -1, false, 62},
        {1, 0, -1, false, 10}, {1000, 0, -2, false, 0}, {3, 0, -2, false, 0},
        {3, 1, -2, false, 0}, {4, 0, -2, false, 0},
    };
    for (int32_t p = 0; p <= 4; ++p) {
        requests.push_back({0, kelvo::PROFILE_WIFI, p, p == 1 || p == 2 || p == 4, 1});
    }
    for (int32_t kind : {0, 1, 2, 3, 4, 101, 102, 104, 105, 108, 117, 119}) {
        int32_t component = kind < 100 ? kelvo::PROFILE_BLUETOOTH : kelvo::PROFILE_SENSOR;
        requests.push_back({0, component, kind % 100, false, 1});
    }
    for (int32_t component = 0; component < 6; ++component) {
        requests.push_back({2, component, -2, false, 0});
    }
    for (const Request& r : requests) {
        SCOPED_TRACE(testing::Message() << r.element << "/" << r.component << "/" << r.parameter);
        Parcel reply;
        if (r.parameter == -2) {
            ASSERT_EQ(0, simple(r.element, r.component, &reply));
            EXPECT_GT(reply.dataSize(), 0u);
            continue;
        }
        std::vector<config_parameter> groups = this->groups(r.element, r.component, r.parameter,
                                                            r.keyed);
        ASSERT_EQ(r.groups, groups.size());
        for (const config_parameter& g : groups) {
            EXPECT_FALSE(g.values.empty()) << g.id;
        }
    }
    for (const kelvo::test::LogLine& line : mLog.lines()) {
        EXPECT_NE(ANDROID_LOG_ERROR, line.priority) << line.text;
    }
}

} // namespace
