#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <fstream>
#include <set>
#include <sstream>
#include <thread>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "KelvoLibEntry.h"
#include "common/TestEnv.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::String8;
using kelvo::config_parameter;
using kelvo::XmlParser;
using kelvo::test::LogCapture;
using kelvo::test::TempRoot;

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

using Bytes = std::vector<uint8_t>;

Bytes bytesOf(const Parcel& parcel) {
    return Bytes(parcel.data(), parcel.data() + parcel.dataSize());
}

Bytes ints(std::initializer_list<int32_t> values) {
    Parcel parcel;
    for (int32_t value : values) {
        parcel.writeInt32(value);
    }
    return bytesOf(parcel);
}

void simpleRequest(Parcel* request, int32_t component) {
    request->writeInt32(component);
}

void groupedRequest(Parcel* request, int32_t component, int32_t parameter, bool keyed) {
    request->writeInt32(component);
    request->writeInt32(parameter);
    request->writeBool(keyed);
}

std::string readSource(const std::string& relative) {
    std::string here = __FILE__;
    std::string root = here.substr(0, here.rfind("tests/libkelvo/utils/"));
    std::ifstream in(root + relative);
    std::stringstream content;
    content << in.rdbuf();
    return content.str();
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
        Parcel request;
        simpleRequest(&request, component);
        return lookup(element, request, reply);
    }
    int32_t grouped(int32_t element, int32_t component, int32_t parameter, bool keyed,
                    Parcel* reply) {
        Parcel request;
        groupedRequest(&request, component, parameter, keyed);
        return lookup(element, request, reply);
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
    Parcel request;
    simpleRequest(&request, 0);
    ASSERT_EQ(0, kelvo::getXmlConfig(kelvo::CONFIG_COMPONENT_POLICY, request, &reply));
    EXPECT_EQ(ints({2}), bytesOf(reply));

    ASSERT_EQ(0, simple(1000, 0, &reply));
    Parcel texts;
    texts.writeString8(String8("v1.2"));
    texts.writeString8(String8("second text"));
    EXPECT_EQ(bytesOf(texts), bytesOf(reply));
    EXPECT_EQ(0u, reply.dataPosition());
    // No parameter: an empty text list; a parameter without text: failure.
    EXPECT_EQ(0, simple(1000, 1, &reply));
    EXPECT_EQ(0u, reply.dataSize());
    EXPECT_EQ(-1, simple(1000, 2, &reply));
    EXPECT_EQ(1u, mLog.count("getTextParameters# Failed to get parameter of component"));

    // A simple value that is not an integer ends the list; earlier ones stay.
    EXPECT_EQ(0, simple(0, 1, &reply));
    EXPECT_EQ(ints({7}), bytesOf(reply));
    EXPECT_EQ(1u, mLog.count("getSimpleParameters# Failed to get parameter of component",
                             ANDROID_LOG_ERROR));
    // A reused reply holds the latest answer only.
    EXPECT_EQ(-1, simple(9, 0, &reply));
    EXPECT_EQ(0u, reply.dataSize());
}

TEST_F(XmlParserTest, GroupedRepliesKeyedUnkeyedSingleAndMissing) {
    mRoot.writeFile(kDataPath, kTestXml);
    Parcel reply;
    ASSERT_EQ(0, grouped(0, 4, -1, true, &reply));
    EXPECT_EQ(ints({1, 1, 10, 100, 1, 20, -200, -1, 2, 1, 30, 300, -1, -1}), bytesOf(reply));
    EXPECT_EQ(0u, reply.dataPosition());
    ASSERT_EQ(0, grouped(0, 4, -1, false, &reply));
    EXPECT_EQ(ints({1, 1, 100, 1, -200, -1, 2, 1, 300, -1, -1}), bytesOf(reply));
    ASSERT_EQ(0, grouped(0, 4, 2, true, &reply));
    EXPECT_EQ(ints({2, 1, 30, 300, -1, -1}), bytesOf(reply));
    ASSERT_EQ(0, grouped(0, 4, 1, false, &reply));
    EXPECT_EQ(ints({1, 1, 100, 1, -200, -1, -1}), bytesOf(reply));
    // A parameter the component does not have: only the end mark, success.
    ASSERT_EQ(0, grouped(0, 4, 5, true, &reply));
    EXPECT_EQ(ints({-1}), bytesOf(reply));

    // The reader gives the same back.
    std::vector<config_parameter> all = groups(0, 4, -1, true);
    ASSERT_EQ(2u, all.size());
    EXPECT_EQ(20, all[0].values.at(1).key);
    EXPECT_EQ(-200, all[0].values.at(1).value);
    EXPECT_EQ(300, all[1].values.at(0).value);
}

TEST_F(XmlParserTest, BadGroupedValuesEndTheirParameterAndLeaveNoLoneMark) {
    mRoot.writeFile(kDataPath, kTestXml);
    Parcel reply;
    // A keyed request meets a value without key: parameter 1 ends there,
    // parameter 2 still comes.
    ASSERT_EQ(0, grouped(0, 5, -1, true, &reply));
    EXPECT_EQ(ints({1, 1, 0, 11, -1, 2, 1, 1, 21, -1, -1}), bytesOf(reply));
    EXPECT_EQ(1u, mLog.count("Failed to get value attribute key of parameter", ANDROID_LOG_ERROR));
    // Unkeyed, the same values are all fine.
    ASSERT_EQ(0, grouped(0, 5, -1, false, &reply));
    EXPECT_EQ(ints({1, 1, 11, 1, 12, 1, 13, -1, 2, 1, 21, -1, -1}), bytesOf(reply));
    // A value that is not an integer: no "value follows" mark without a value.
    ASSERT_EQ(0, grouped(0, 6, -1, true, &reply));
    EXPECT_EQ(ints({0, 1, 0, 5, -1, 1, 1, 0, 7, -1, -1}), bytesOf(reply));
    EXPECT_EQ(1u, mLog.count("Failed to get value of parameter", ANDROID_LOG_ERROR));
    // A parameter without id, or with the end mark as id, fails the lookup.
    EXPECT_EQ(-1, grouped(0, 7, -1, false, &reply));
    EXPECT_EQ(-1, grouped(0, 8, -1, false, &reply));
    EXPECT_EQ(2u, mLog.count("Failed to get attribute id of parameter", ANDROID_LOG_ERROR));
}

TEST_F(XmlParserTest, TypedElementsRefuseComponentsOutOfRange) {
    mRoot.writeFile(kDataPath, kTestXml);
    Parcel reply;
    EXPECT_EQ(-1, simple(2, 6, &reply));
    EXPECT_EQ(1u, mLog.count("Invalid component policy type: 6", ANDROID_LOG_ERROR));
    EXPECT_EQ(-1, simple(3, 2, &reply));
    EXPECT_EQ(1u, mLog.count("Invalid filter type: 2", ANDROID_LOG_ERROR));
    EXPECT_EQ(-1, simple(4, 1, &reply));
    EXPECT_EQ(1u, mLog.count("Invalid settings type: 1", ANDROID_LOG_ERROR));
    Parcel request;
    simpleRequest(&request, 6);
    EXPECT_EQ(-1, kelvo::getXmlConfig(kelvo::CONFIG_COMPONENT_POLICY, request, &reply));
    EXPECT_EQ(1u, mLog.count("[KelvoLibEntry.cpp] getXmlConfig# Failed to get xml configuation"));

    // Unknown profile components and elements answer with nothing.
    EXPECT_EQ(0, simple(0, 12, &reply));
    EXPECT_EQ(0u, reply.dataSize());
    EXPECT_EQ(1u, mLog.count("Unknown power profile type: 12"));
    EXPECT_EQ(0, simple(7, 0, &reply));
    EXPECT_EQ(0u, reply.dataSize());
    EXPECT_EQ(1u, mLog.count("Unknown element id: 7"));
    // Absent elements and components fail.
    EXPECT_EQ(-1, simple(9, 0, &reply));
    EXPECT_EQ(1u, mLog.count("Failed to parse xml element: 9"));
    EXPECT_EQ(-1, simple(2, 3, &reply));
}

TEST_F(XmlParserTest, EntryAdmitsElementsOneToThousandOnly) {
    mRoot.writeFile(kDataPath, kTestXml);
    Parcel request;
    simpleRequest(&request, 0);
    Parcel reply;
    for (int32_t element : {0, 1001, -1}) {
        EXPECT_EQ(-1, kelvo::getXmlConfig(element, request, &reply)) << element;
        EXPECT_EQ(1u, mLog.count("[KelvoLibEntry.cpp] getXmlConfig# Invalid element: " +
                                 std::to_string(element)))
            << element;
    }
    EXPECT_EQ(0u, reply.dataSize());
    // The library itself reaches element 0; nobody reaches past 1000.
    EXPECT_EQ(0, lookup(0, request, &reply));
    EXPECT_EQ(-1, lookup(1001, request, &reply));
    EXPECT_EQ(1u, mLog.count("getXmlConfig# Invalid element id: 1001"));
    EXPECT_EQ(-1, kelvo::getXmlConfig(1000, request, nullptr));
}

TEST_F(XmlParserTest, IdsThatAreNotIntegersAndShortRequestsFailTheLookup) {
    mRoot.writeFile(kDataPath, R"(<c>
      <element id="1"><component id="0"><parameter id="0"><value>1</value></parameter></component></element>
      <element id="3"><component id="1a"><parameter>1</parameter></component>
                      <component id="0"><parameter>1</parameter></component></element>
      <element><component id="0"><parameter>1</parameter></component></element>
      <element id="2"><component id="0"><parameter>1</parameter></component></element>
    </c>)");
    Parcel reply;
    EXPECT_EQ(-1, simple(2, 0, &reply));
    EXPECT_EQ(1u, mLog.count("Failed to get attribute id of element", ANDROID_LOG_ERROR));
    EXPECT_EQ(-1, simple(3, 0, &reply));
    EXPECT_EQ(1u, mLog.count("Failed to get attribute id of component", ANDROID_LOG_ERROR));
    EXPECT_EQ(0u, reply.dataSize());
    // Elements before the flaw are still found.
    EXPECT_EQ(0, grouped(1, 0, -1, false, &reply));
    EXPECT_EQ(ints({0, 1, 1, -1, -1}), bytesOf(reply));

    Parcel empty;
    EXPECT_EQ(-1, lookup(1, empty, &reply));
    Parcel componentOnly;
    simpleRequest(&componentOnly, 0);
    EXPECT_EQ(-1, lookup(1, componentOnly, &reply));
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
    Parcel marked;
    for (int32_t value : {4, 1, 60, 0, 5, 1, 30, -1, -1}) {
        marked.writeInt32(value);
    }
    ASSERT_EQ(0, XmlParser::readGroupedReply(marked, false, &parameters));
    ASSERT_EQ(2u, parameters.size());
    EXPECT_EQ(60, parameters[0].values[0].value);
    EXPECT_EQ(5, parameters[1].id);
}

TEST_F(XmlParserTest, WithoutAnyFileEveryLookupFails) {
    Parcel reply;
    for (int32_t element : {0, 1, 2, 3, 4, 1000}) {
        EXPECT_EQ(-1, simple(element, 0, &reply)) << element;
        EXPECT_EQ(-1, grouped(element, 3, -1, true, &reply)) << element;
    }
    Parcel request;
    simpleRequest(&request, 0);
    EXPECT_EQ(-1, kelvo::getXmlConfig(kelvo::CONFIG_SETTINGS, request, &reply));
    EXPECT_EQ(0u, reply.dataSize());
    std::vector<config_parameter> parameters;
    EXPECT_EQ(-1, XmlParser::readGroupedReply(reply, true, &parameters));
    EXPECT_EQ(1u, mLog.count("[XmlParser.cpp] XmlParser# Failed to get configuration file"));
    EXPECT_TRUE(mLog.contains("Invalid root element", ANDROID_LOG_ERROR));
}

TEST_F(XmlParserTest, UnusableFirstFileGivesWayToTheLocatedOne) {
    mRoot.writeFile(kVendorPath,
                    "<c><element id=\"4\"><component id=\"0\">"
                    "<parameter>1</parameter></component></element></c>");
    for (const char* first : {"<c><element id=\"4\">", "<?xml version=\"1.0\"?><!-- none -->"}) {
        XmlParser::resetInstance();
        mRoot.writeFile(kDataPath, first);
        Parcel reply;
        ASSERT_EQ(0, simple(4, 0, &reply)) << first;
        EXPECT_EQ(ints({1}), bytesOf(reply));
    }
    EXPECT_EQ(1u, mLog.count("No root element found"));
    EXPECT_EQ(2u, mLog.count("Using xml: " + mRoot.path() + kVendorPath));

    // A located file that is broken too leaves the parser without data.
    XmlParser::resetInstance();
    mRoot.writeFile(kVendorPath, "<c>");
    Parcel reply;
    EXPECT_EQ(-1, simple(4, 0, &reply));
    EXPECT_EQ(1u, mLog.count("Failed to open xml file, running without configuration"));

    // openXmlFile replaces the document.
    EXPECT_EQ(-1, XmlParser::getInstance()->openXmlFile(nullptr));
    std::string good = mRoot.path() + "/good.xml";
    mRoot.writeFile("/good.xml", kTestXml);
    ASSERT_EQ(0, XmlParser::getInstance()->openXmlFile(good.c_str()));
    EXPECT_EQ(0, simple(2, 0, &reply));
}

TEST_F(XmlParserTest, ConcurrentFirstUseSharesOneParser) {
    mRoot.writeFile(kDataPath, kTestXml);
    std::vector<std::thread> threads;
    std::atomic<int> wrong{0};
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&wrong] {
            for (int i = 0; i < 50; ++i) {
                Parcel request;
                groupedRequest(&request, 4, -1, true);
                Parcel reply;
                if (XmlParser::getInstance()->getXmlConfig(0, request, &reply) != 0 ||
                    bytesOf(reply) != ints({1, 1, 10, 100, 1, 20, -200, -1, 2, 1, 30, 300, -1, -1})) {
                    wrong++;
                }
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(0, wrong.load());
    EXPECT_EQ(1u, mLog.count("Using xml:"));
}

size_t valuesWithKey(const config_parameter& parameter, int32_t key) {
    return std::count_if(parameter.values.begin(), parameter.values.end(),
                         [key](const kelvo::config_value& v) { return v.key == key; });
}

// The sample answers every request the library and the daemon make, with
// what each reader needs.
TEST_F(XmlParserTest, SampleConfigurationAnswersEveryReader) {
    std::string sample = readSource("config/tv_kelvo_config.xml");
    ASSERT_FALSE(sample.empty());
    mRoot.writeFile(kDataPath, sample);
    Parcel reply;
    // Brightness slope and intercept; GNSS and flashlight powers.
    for (int32_t component : {0, 1, 2}) {
        ASSERT_EQ(0, simple(0, component, &reply));
        EXPECT_EQ(component == 0 ? 8u : 4u, reply.dataSize());
        EXPECT_GT(reply.readInt32(), 0) << component;
    }
    // CPU: two clusters whose power grows with the frequency, the idle power.
    std::vector<config_parameter> cpu = groups(0, kelvo::PROFILE_CPU, -1, false);
    ASSERT_EQ(3u, cpu.size());
    EXPECT_EQ(100, cpu[2].id);
    for (const config_parameter& p : cpu) {
        ASSERT_FALSE(p.values.empty());
        for (size_t i = 1; i < p.values.size(); ++i) {
            EXPECT_GE(p.values[i].value, p.values[i - 1].value) << p.id;
        }
    }
    // Camera (stream types 0 to 3) and GPU: maps of distinct keys.
    for (int32_t component : {kelvo::PROFILE_CAMERA, kelvo::PROFILE_GPU}) {
        std::vector<config_parameter> maps = groups(0, component, -1, true);
        EXPECT_EQ(component == kelvo::PROFILE_CAMERA ? 4u : 1u, maps.size());
        for (const config_parameter& p : maps) {
            std::set<int32_t> keys;
            for (const kelvo::config_value& v : p.values) {
                EXPECT_GT(v.key, 0);
                keys.insert(v.key);
            }
            EXPECT_EQ(p.values.size(), keys.size()) << component << " " << p.id;
        }
    }
    // Modem: modes 0 to 5, each with idle, voice and data tables of at most
    // ten levels; the special power under mode 1 only.
    std::vector<config_parameter> modes = groups(0, kelvo::PROFILE_MODEM, -1, true);
    ASSERT_EQ(6u, modes.size());
    for (size_t m = 0; m < modes.size(); ++m) {
        EXPECT_EQ(static_cast<int32_t>(m), modes[m].id);
        for (int32_t key : {0, 1, 2}) {
            EXPECT_GE(valuesWithKey(modes[m], key), 1u) << m;
            EXPECT_LE(valuesWithKey(modes[m], key), 10u) << m;
        }
        EXPECT_EQ(m == 1 ? 1u : 0u, valuesWithKey(modes[m], 3)) << m;
    }
    // Audio: receiver and speaker, slope and intercept (key 0) first, then
    // smart-amplifier scales (key 1) that can divide.
    std::vector<config_parameter> outputs = groups(0, kelvo::PROFILE_AUDIO, -1, true);
    ASSERT_EQ(2u, outputs.size());
    for (const config_parameter& p : outputs) {
        ASSERT_GE(p.values.size(), 3u);
        EXPECT_EQ(2u, valuesWithKey(p, 0));
        EXPECT_EQ(0, p.values[0].key);
        for (size_t i = 2; i < p.values.size(); ++i) {
            EXPECT_EQ(1, p.values[i].key);
            EXPECT_GE(p.values[i].value, 1);
        }
    }
    // Wi-Fi, one request per parameter as its accounter makes them: four
    // level weights per band in 1 and 2, one fixed power per band in 4.
    for (int32_t parameter = 0; parameter <= 4; ++parameter) {
        bool keyed = parameter == 1 || parameter == 2 || parameter == 4;
        std::vector<config_parameter> p = groups(0, kelvo::PROFILE_WIFI, parameter, keyed);
        ASSERT_EQ(1u, p.size());
        EXPECT_EQ(parameter, p[0].id);
        for (int32_t band = 0; keyed && band <= 1; ++band) {
            EXPECT_EQ(parameter == 4 ? 1u : 4u, valuesWithKey(p[0], band)) << parameter;
        }
    }
    // Bluetooth activities 0 to 4 and the common sensor types, one by one.
    for (int32_t kind : {0, 1, 2, 3, 4, 101, 102, 104, 105, 108, 117, 119}) {
        int32_t component = kind < 100 ? kelvo::PROFILE_BLUETOOTH : kelvo::PROFILE_SENSOR;
        std::vector<config_parameter> p = groups(0, component, kind % 100, false);
        ASSERT_EQ(1u, p.size()) << kind;
        EXPECT_GT(p[0].values.at(0).value, 0);
    }
    // DPM: four coefficients for each IP block 0 to 32.
    std::vector<config_parameter> blocks = groups(0, kelvo::PROFILE_DPM, -1, false);
    ASSERT_EQ(33u, blocks.size());
    for (size_t i = 0; i < blocks.size(); ++i) {
        EXPECT_EQ(static_cast<int32_t>(i), blocks[i].id);
        EXPECT_EQ(4u, blocks[i].values.size()) << i;
    }

    // What the daemon reads through the entry: thresholds 0 to 9 (two values
    // for 0), a policy each handler runs with, filters, settings, version.
    Parcel request;
    groupedRequest(&request, 0, -1, false);
    ASSERT_EQ(0, kelvo::getXmlConfig(kelvo::CONFIG_ABNORMALITY_THRESHOLD, request, &reply));
    std::vector<config_parameter> thresholds;
    ASSERT_EQ(0, XmlParser::readGroupedReply(reply, false, &thresholds));
    ASSERT_EQ(10u, thresholds.size());
    for (size_t key = 0; key < thresholds.size(); ++key) {
        EXPECT_EQ(static_cast<int32_t>(key), thresholds[key].id);
        EXPECT_GE(thresholds[key].values.size(), key == 0 ? 2u : 1u);
    }
    for (int32_t element : {2, 3, 4}) {
        for (int32_t component = 0; component < (element == 2 ? 6 : element == 3 ? 2 : 1);
             ++component) {
            Parcel simpleReq;
            simpleRequest(&simpleReq, component);
            ASSERT_EQ(0, kelvo::getXmlConfig(element, simpleReq, &reply)) << element;
            EXPECT_EQ(4u, reply.dataSize()) << element << " " << component;
            int32_t value = reply.readInt32();
            EXPECT_TRUE(element != 2 || value == 1 || value == 2) << component;
        }
    }
    Parcel version;
    simpleRequest(&version, 0);
    ASSERT_EQ(0, kelvo::getXmlConfig(kelvo::CONFIG_TEXT, version, &reply));
    EXPECT_GT(reply.readString8().size(), 0u);
    EXPECT_EQ(0u, reply.dataAvail());

    std::string errors;
    for (const kelvo::test::LogLine& line : mLog.lines()) {
        if (line.priority == ANDROID_LOG_ERROR) {
            errors += line.text + "\n";
        }
    }
    EXPECT_EQ("", errors);
}

} // namespace
