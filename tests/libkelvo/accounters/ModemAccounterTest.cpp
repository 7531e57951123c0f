// The modem accounter through the library's entry: residencies per module
// and level turned into the component record, and the data energy split
// among applications by their packets.

#include <gtest/gtest.h>

#include <limits>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "common/TestEnv.h"
#include "libkelvo/LibraryTestUtil.h"
#include "utils/XmlParser.h"

using namespace kelvo;
using namespace kelvo::test;

namespace {

constexpr int32_t kModem = ACCOUNTER_MODEM;
constexpr int32_t kMax = std::numeric_limits<int32_t>::max();

// Mode 0 (module 9): idle 10, 20, 30 (three levels only). Mode 1 (modules
// 8, 11): data 1..10 and an eleventh value past the table; Px 7. Mode 5
// (modules 5, 7): voice (key 1) 100, 200; data (key 2) 1000, 2000. Mode 2
// (modules 0, 1): data INT32_MAX at every level; a key 3 outside mode 1 is
// not Px.
const char* kProfile = R"(<config><element id="0"><component id="8">
  <parameter id="0"><value key="0">10</value><value key="0">20</value><value key="0">30</value>
  </parameter>
  <parameter id="1"><value key="2">1</value><value key="2">2</value><value key="2">3</value>
    <value key="2">4</value><value key="2">5</value><value key="2">6</value><value key="2">7</value>
    <value key="2">8</value><value key="2">9</value><value key="2">10</value><value key="2">11</value>
    <value key="3">7</value></parameter>
  <parameter id="2"><value key="2">2147483647</value><value key="2">2147483647</value>
    <value key="2">2147483647</value><value key="2">2147483647</value><value key="2">2147483647</value>
    <value key="2">2147483647</value><value key="2">2147483647</value><value key="2">2147483647</value>
    <value key="2">2147483647</value><value key="3">99</value></parameter>
  <parameter id="5"><value key="1">100</value><value key="1">200</value>
    <value key="2">1000</value><value key="2">2000</value></parameter>
</component></element></config>)";

// One module's line of the component record, by (scenario code, module).
using Line = std::pair<int64_t, int64_t>;  // usage, energy
using Lines = std::map<std::pair<int32_t, int32_t>, Line>;

struct Residency {
    int32_t subtype;  // 0 voice, 1 idle, 2 data
    int32_t module;
    std::vector<int32_t> lte;  // modulation, base usage (module 5 only)
    std::vector<int32_t> times;
    int32_t count = -100;  // level count sent; -100: the number of times
};

class ModemAccounterTest : public ::testing::Test {
protected:
    void SetUp() override {
        mRoot.writeFile("/data/misc/kelvo/tv_kelvo_config.xml", kProfile);
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        mListener = listenTo(kModem);
        mLastBalance = KelvoLibAgent::getInstance()->getSystemBootTime();
    }
    void TearDown() override {
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
    }

    static Fields setValue(int32_t subtype) {
        Fields f(kModem, ACTION_SET_VALUE);
        f.i32(subtype);
        return f;
    }
    static int32_t send(const Residency& r) {
        Fields f = setValue(r.subtype);
        f.i32(r.module);
        for (int32_t v : r.lte) {
            f.i32(v);
        }
        f.i32(r.count == -100 ? static_cast<int32_t>(r.times.size()) : r.count);
        for (int32_t t : r.times) {
            f.i32(t);
        }
        return f.send();
    }
    static int32_t batch(const std::vector<std::pair<const char*, std::vector<int64_t>>>& apps) {
        Fields f = setValue(MODEM_PACKAGE_TRAFFIC);
        f.i64(1000).i32(static_cast<int32_t>(apps.size()));
        for (const auto& app : apps) {
            f.str(app.first).i32(0);
            for (int64_t c : app.second) {
                f.i64(c);
            }
        }
        return f.send();
    }

    // Balances at t and reads the component record (checking its frame) and
    // the applications' background buckets: c1..c4, energy.
    Lines balance(int64_t t, std::map<std::string, std::vector<int64_t>>* apps = nullptr,
                  bool charger = false) {
        const size_t from = mListener->mReplies.size();
        EXPECT_EQ(0, balanceAt(kModem, t));
        Lines lines;
        for (size_t r = from; r < mListener->mReplies.size(); ++r) {
            android::Parcel p;
            const Bytes& bytes = mListener->mReplies[r].bytes;
            p.setData(bytes.data(), bytes.size());
            if (mListener->mReplies[r].event == LIBRARY_EVENT_COMPONENT) {
                EXPECT_EQ(charger, p.readBool());
                for (int32_t code : {1, 0, 2}) {
                    EXPECT_EQ(code, p.readInt32());
                    for (int32_t n = p.readInt32(); n > 0; --n) {
                        EXPECT_EQ(mLastBalance, p.readInt64());
                        EXPECT_EQ(t, p.readInt64());
                        const int32_t module = p.readInt32();
                        const int64_t usage = p.readInt64();
                        lines[{code, module}] = {usage, p.readInt64()};
                    }
                }
                EXPECT_EQ(p.dataSize(), p.dataPosition());
                continue;
            }
            EXPECT_EQ(0, p.readInt32());
            for (int32_t n = p.readInt32(); n > 0; --n) {
                p.readInt64();
                p.readInt64();
                std::string name = p.readString8().c_str();
                for (int32_t b = 0; b < BUCKET_COUNT; ++b) {
                    std::vector<int64_t> bucket;
                    for (int32_t i = 0; i < 5; ++i) {
                        bucket.push_back(p.readInt64());
                    }
                    const int32_t wanted = charger ? BUCKET_CHARGE_BACKGROUND : BUCKET_BACKGROUND;
                    if (apps != nullptr && b == wanted) {
                        (*apps)[name] = bucket;
                    }
                }
            }
        }
        mLastBalance = t;
        return lines;
    }

    TempRoot mRoot;
    LogCapture mLog;
    android::sp<RecordingListener> mListener;
    int64_t mLastBalance = 0;
};

// Each residency alone, then a balance: the line it adds, or its refusal
// with the line logged and nothing recorded.
TEST_F(ModemAccounterTest, ResidencyPerModuleAndLevel) {
    // 9 levels of INT32_MAX ms at INT32_MAX: the sum needs more than 64 bits.
    const int64_t wide = static_cast<int64_t>(static_cast<__int128>(kMax) * kMax * 9 / 1000);
    // code: the scenario code of the one line expected; -1: refused, no line.
    struct Case {
        const char* what;
        Residency r;
        int32_t code;
        int64_t usage, energy;
        const char* logged;
    } cases[] = {
        {"idle, module 9", {1, 9, {}, {100, 200, 300}}, 1, 600, (1000 + 4000 + 9000) / 1000, ""},
        {"a level past the configured powers", {1, 9, {}, {0, 0, 0, 500}}, 1, 500, 0, ""},
        {"negative and zero times skipped", {1, 9, {}, {-50, 0, 1000}}, 1, 1000, 30, ""},
        {"LTE voice, modulation 1: key 1, the base", {0, 5, {1, 500}, {10, 20}}, 0, 500, 5, ""},
        {"LTE data, modulation 0: key 2, base + times", {2, 5, {0, 7}, {1, 2}}, 2, 10, 5, ""},
        {"LTE voice, modulation 0: key 2", {0, 5, {0, 40}, {1, 2}}, 0, 40, 5, ""},
        {"LTE, modulation 3: key 2", {2, 5, {3, 0}, {1}}, 2, 1, 1, "Unknown modulation type: 3"},
        {"module 7: mode 5 by scenario", {2, 7, {}, {1000}}, 2, 1000, 1000, ""},
        {"module 11: Px at every level", {2, 11, {}, {1000, 1000, 1000}}, 2, 3000, 21, ""},
        {"nine levels", {2, 8, {}, std::vector<int32_t>(9, 1000)}, 2, 9000, 45, ""},
        {"sums beyond 64 bits", {2, 0, {}, std::vector<int32_t>(9, kMax)}, 2, 9LL * kMax, wide, ""},
        {"ten levels", {2, 8, {}, std::vector<int32_t>(10, 1)}, -1, 0, 0, "level size: 10"},
        {"negative level count", {2, 8, {}, {}, -1}, -1, 0, 0, "Invalid signal level size: -1"},
        {"module -1", {2, -1, {}, {1000}}, -1, 0, 0, "Invalid module: -1"},
        {"module 12", {2, 12, {}, {1000}}, -1, 0, 0, "Invalid module: 12"},
        {"module 10", {2, 10, {}, {1000}}, -1, 0, 0, "Invalid mode index: -1"},
        {"level count past the data", {2, 8, {}, {1000}, 3}, -1, 0, 0, ""},
    };
    int64_t t = 0;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        mLog.clear();
        EXPECT_EQ(c.code < 0 ? -1 : 0, send(c.r));
        Lines expected;
        if (c.code >= 0) {
            expected[{c.code, c.r.module}] = {c.usage, c.energy};
        }
        EXPECT_EQ(expected, balance(t += 3600000));
        if (*c.logged != '\0') {
            EXPECT_TRUE(mLog.contains(c.logged));
        }
    }
}

// E = 1000 from the data residencies, X = 150 + 50: an application with
// 30 + 20 packets gets 250; more packets than the interface gets 0; c1..c4
// are its counters. After a balance E and X are gone: a batch without a new
// interface reading is charged nothing. Residencies of two actions add up.
TEST_F(ModemAccounterTest, DataEnergySplitByPackets) {
    // Module 7, data: 500 ms at 1000, twice: E = 1000.
    ASSERT_EQ(0, send({MODEM_DATA_RESIDENCY, 7, {}, {500}}));
    ASSERT_EQ(0, send({MODEM_DATA_RESIDENCY, 7, {}, {500}}));
    ASSERT_EQ(0, send({MODEM_IDLE_RESIDENCY, 9, {}, {1000}}));  // not data energy
    ASSERT_EQ(0, setValue(MODEM_INTERFACE_TRAFFIC).i64(150).i64(50).send());
    ASSERT_EQ(0, batch({{"com.a", {30, 20, 3000, 4000}}, {"com.big", {150, 51, 1, 2}}}));
    std::map<std::string, std::vector<int64_t>> apps;
    Lines lines = balance(3600000, &apps);
    EXPECT_EQ((Lines{{{2, 7}, {1000, 1000}}, {{1, 9}, {1000, 10}}}), lines);
    EXPECT_EQ((std::vector<int64_t>{30, 20, 3000, 4000, 250}), apps["com.a"]);
    EXPECT_EQ((std::vector<int64_t>{150, 51, 1, 2, 0}), apps["com.big"]);

    // Charging now (the record opens with it); no subtype 3 since the balance.
    ASSERT_EQ(0, setValue(MODEM_CHARGER).flag(true).send());
    ASSERT_EQ(0, send({MODEM_DATA_RESIDENCY, 7, {}, {500}}));
    ASSERT_EQ(0, batch({{"com.a", {30, 20, 3000, 4000}}}));
    apps.clear();
    balance(7200000, &apps, true);
    EXPECT_EQ((std::vector<int64_t>{30, 20, 3000, 4000, 0}), apps["com.a"]);
    EXPECT_EQ(-1, setValue(6).send());
    EXPECT_TRUE(mLog.contains("Unknown modem subtype: 6"));
}

}  // namespace
