// The Wi-Fi accounter through the library's entry: traffic and scan batches
// weighted by the level times, band and totals sent before them, and the
// hotspot's records.

#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

#include "accounters/WifiAccounter.h"
#include "allocators/WifiAccounterData.h"
#include "common/TestEnv.h"
#include "libkelvo/LibraryTestUtil.h"
#include "utils/XmlParser.h"

using namespace kelvo;
using namespace kelvo::test;

namespace {

constexpr int32_t kWifi = ACCOUNTER_WIFI;

// Band 0: per tx packet 2, 4, 6, 8 by level, per rx packet 3, 5, 7, 9 (a
// fifth value and a key other than 0 or 1 count for band 0 and are beyond
// its levels); band 1 ten times that. Fixed band power 40 (the key-9 value
// comes last and counts for band 0), 400 for band 1; scans 25; hotspot 160.
const char* kProfile = R"(<config><element id="0"><component id="5">
  <parameter id="0"><value>160</value></parameter>
  <parameter id="1"><value key="0">2</value><value key="0">4</value><value key="1">20</value>
    <value key="0">6</value><value key="0">8</value><value key="1">40</value><value key="1">60</value>
    <value key="1">80</value><value key="9">1000</value></parameter>
  <parameter id="2"><value key="0">3</value><value key="0">5</value><value key="0">7</value>
    <value key="0">9</value><value key="0">1000</value><value key="1">30</value><value key="1">50</value>
    <value key="1">70</value><value key="1">90</value></parameter>
  <parameter id="3"><value>25</value></parameter>
  <parameter id="4"><value key="0">7</value><value key="1">400</value><value key="9">40</value></parameter>
</component></element></config>)";

struct Entry {
    const char* name;
    int64_t x, y, a, b;  // tx packets, rx packets, tx bytes, rx bytes; scans: x
};

// The background bucket of one application's record.
struct Charged {
    int32_t share;
    int64_t txBytes, rxBytes, energy;
    bool operator==(const Charged& o) const {
        return share == o.share && txBytes == o.txBytes && rxBytes == o.rxBytes &&
               energy == o.energy;
    }
};

void PrintTo(const Charged& c, std::ostream* os) {
    *os << "{share " << c.share << ", tx " << c.txBytes << ", rx " << c.rxBytes << ", energy "
        << c.energy << "}";
}

class WifiAccounterTest : public ::testing::Test {
protected:
    void SetUp() override {
        mRoot.writeFile("/data/misc/kelvo/tv_kelvo_config.xml", kProfile);
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        mListener = listenTo(kWifi);
    }
    void TearDown() override {
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
    }

    static Fields setValue(int32_t subtype) {
        Fields f(kWifi, ACTION_SET_VALUE);
        f.i32(subtype);
        return f;
    }
    static int32_t levels(int64_t l0, int64_t l1, int64_t l2, int64_t l3) {
        return setValue(WIFI_ACTIVITY).i32(4).i64(l0).i64(l1).i64(l2).i64(l3).send();
    }
    static int32_t batch(int32_t subtype, const std::vector<Entry>& entries) {
        Fields f = setValue(subtype);
        f.i64(1000).i32(static_cast<int32_t>(entries.size()));
        for (const Entry& e : entries) {
            f.str(e.name).i32(0);
            if (subtype == WIFI_SCANS) {
                f.i32(static_cast<int32_t>(e.x));
            } else {
                f.i64(e.x).i64(e.y).i64(e.a).i64(e.b);
            }
        }
        return f.send();
    }
    // Balances and reads the applications' record: header 1, count, records.
    std::map<std::string, Charged> balance(int64_t t) {
        const size_t from = mListener->mReplies.size();
        EXPECT_EQ(0, balanceAt(kWifi, t));
        std::map<std::string, Charged> out;
        for (size_t r = from; r < mListener->mReplies.size(); ++r) {
            android::Parcel p;
            const Bytes& bytes = mListener->mReplies[r].bytes;
            p.setData(bytes.data(), bytes.size());
            if (p.readInt32() != WifiAccounter::kTrafficKey) {
                continue;
            }
            for (int32_t n = p.readInt32(); n > 0; --n) {
                p.readInt64();
                p.readInt64();
                std::string name = p.readString8().c_str();
                Charged bucket[BUCKET_COUNT];
                for (Charged& c : bucket) {
                    c = {p.readInt32(), p.readInt64(), p.readInt64(), p.readInt64()};
                }
                out[name] = bucket[BUCKET_BACKGROUND];
            }
        }
        return out;
    }

    TempRoot mRoot;
    LogCapture mLog;
    android::sp<RecordingListener> mListener;
};

// One rule per case: level-time weights (600000 ms at level 0: w = 1/1000),
// the per-hundred fallback without level times or beyond 660000 ms, the
// band's fixed power 40 shared by traffic energy, the whole share for an
// application carrying all the traffic, counts read after the totals held at
// the totals, and products beyond 64 bits.
TEST_F(WifiAccounterTest, TrafficEnergyByLevelTimeAndTotals) {
    struct Case {
        const char* what;
        int64_t levelTime;  // at level 0
        int64_t tx, rx;     // interface totals
        int32_t bandCode;   // -1: none sent
        std::vector<Entry> entries;
        std::map<std::string, Charged> expected;
    } cases[] = {
        // (1000 x 2 + 500 x 3) / 1000 = 3.5.
        {"weighted", 600000, 0, 0, -1, {{"com.a", 1000, 500, 70, 80}}, {{"com.a", {0, 70, 80, 3}}}},
        // No level times: the weakest level, (1000 x 8 + 500 x 9) / 100.
        {"L = 0", 0, 0, 0, -1, {{"com.a", 1000, 500, 1, 2}}, {{"com.a", {0, 1, 2, 125}}}},
        {"L = 660000", 660000, 0, 0, -1, {{"com.a", 1000, 500, 0, 0}}, {{"com.a", {0, 0, 0, 3}}}},
        {"L = 660001", 660001, 0, 0, -1, {{"com.a", 1000, 500, 0, 0}}, {{"com.a", {0, 0, 0, 125}}}},
        // Et = 10.5; the fixed 600000 x 40 / 1000 = 24000 split 3.5 : 7
        // (by the energies before they are truncated to 3 and 7).
        {"two split",
         600000,
         3000,
         1500,
         -1,
         {{"com.a", 1000, 500, 0, 0}, {"com.b", 2000, 1000, 0, 0}},
         {{"com.a", {200000, 0, 0, 3 + 8000}}, {"com.b", {400000, 0, 0, 7 + 16000}}}},
        // Et = 0.6 and the applications' energies 0.4 and 0.2 round to
        // nothing: the fixed power is still shared out whole.
        {"below one unit",
         600000,
         300,
         0,
         -1,
         {{"com.a", 200, 0, 0, 0}, {"com.b", 100, 0, 0, 0}},
         {{"com.a", {400000, 0, 0, 16000}}, {"com.b", {200000, 0, 0, 8000}}}},
        {"one carries all",
         600000,
         3000,
         1500,
         -1,
         {{"com.a", 3000, 1500, 0, 0}},
         {{"com.a", {600000, 0, 0, 10 + 24000}}}},
        // Counts read after the totals: held at the whole.
        {"late counts",
         600000,
         3000,
         1500,
         -1,
         {{"com.a", 3500, 1500, 0, 0}},
         {{"com.a", {600000, 0, 0, 11 + 24000}}}},
        // 600000 x 2e12 x 40 is beyond 64 bits; the fixed part stays 24000.
        {"wide products",
         600000,
         1000000000000000,
         0,
         -1,
         {{"com.a", 1000000000000000, 0, 0, 0}},
         {{"com.a", {600000, 0, 0, 2000000094994 + 24000}}}},
        // Band 1: ten times the powers, fixed power 400; codes 0 (none known)
        // and 3 keep it, code 2 is band 0.
        {"band 1", 600000, 0, 0, 1, {{"com.a", 1000, 500, 0, 0}}, {{"com.a", {0, 0, 0, 35}}}},
        {"code 0", 600000, 0, 0, 0, {{"com.a", 1000, 500, 0, 0}}, {{"com.a", {0, 0, 0, 35}}}},
        {"code 3", 600000, 0, 0, 3, {{"com.a", 1000, 500, 0, 0}}, {{"com.a", {0, 0, 0, 35}}}},
        {"band 0", 600000, 0, 0, 2, {{"com.a", 1000, 500, 0, 0}}, {{"com.a", {0, 0, 0, 3}}}},
    };
    int64_t t = 0;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        if (c.bandCode >= 0) {
            ASSERT_EQ(0, setValue(WIFI_BAND).i32(c.bandCode).send());
        }
        ASSERT_EQ(0, setValue(WIFI_INTERFACE_TRAFFIC).i64(c.tx).i64(c.rx).send());
        ASSERT_EQ(0, levels(c.levelTime, 0, 0, 0));
        ASSERT_EQ(0, batch(WIFI_PACKAGE_TRAFFIC, c.entries));
        EXPECT_EQ(c.expected, balance(t += 3600000));
    }
}

// Totals and level times add up over readings until a traffic batch takes
// them; a refused level reading changes nothing; scans cost 25 each.
TEST_F(WifiAccounterTest, ReadingsAccumulateUntilABatchTakesThem) {
    // 300000 + 300000 ms at level 0, totals 1500 + 3000 (two readings); a
    // count of 3 and a negative time are refused.
    ASSERT_EQ(0, setValue(WIFI_INTERFACE_TRAFFIC).i64(1000).i64(500).send());
    ASSERT_EQ(0, levels(300000, 0, 0, 0));
    ASSERT_EQ(-1, setValue(WIFI_ACTIVITY).i32(3).i64(1).i64(1).i64(1).send());
    ASSERT_EQ(-1, levels(-5, 0, 0, 0));
    ASSERT_EQ(0, setValue(WIFI_INTERFACE_TRAFFIC).i64(2000).i64(1000).send());
    ASSERT_EQ(0, levels(300000, 0, 0, 0));
    ASSERT_EQ(0, batch(WIFI_PACKAGE_TRAFFIC, {{"com.a", 3000, 1500, 0, 0}}));
    // The next batch has nothing left to be weighted by.
    ASSERT_EQ(0, batch(WIFI_PACKAGE_TRAFFIC, {{"com.b", 1000, 500, 0, 0}}));
    ASSERT_EQ(0, batch(WIFI_SCANS, {{"com.b", 3, 0, 0, 0}, {"com.c", 0, 0, 0, 0}}));
    EXPECT_EQ((std::map<std::string, Charged>{{"com.a", {600000, 0, 0, 10 + 24000}},
                                              {"com.b", {0, 0, 0, 125 + 75}},
                                              {"com.c", {0, 0, 0, 0}}}),
              balance(3600000));
}

// Subtypes without an allocator answer 0 from the start; the hotspot's
// records open with 0 also when a framework death stops it after traffic;
// subtype 2 takes no value and subtypes beyond 6 are refused.
TEST_F(WifiAccounterTest, SubtypesAndReplyHeaders) {
    ASSERT_EQ(0, setValue(WIFI_INTERFACE_TRAFFIC).i64(1).i64(1).send());
    ASSERT_EQ(0, setValue(WIFI_BAND).i32(1).send());
    ASSERT_EQ(0, levels(1, 1, 1, 1));
    ASSERT_EQ(0, setValue(WIFI_CHARGER).flag(false).send());
    EXPECT_EQ(-1, setValue(WIFI_HOTSPOT).i64(0).send());
    EXPECT_EQ(-1, setValue(7).i64(0).send());
    EXPECT_EQ(-1, Fields(kWifi, ACTION_ACTIVATE).i32(-1).i64(0).str("wifi_ap").send());
    EXPECT_TRUE(mListener->mReplies.empty());

    ASSERT_EQ(0, Fields(kWifi, ACTION_ACTIVATE).i32(WIFI_HOTSPOT).i64(0).str("wifi_ap").send());
    ASSERT_EQ(0, Fields(kWifi, ACTION_ACTIVATE).i32(WIFI_BAND).i64(0).str("x").send());
    ASSERT_EQ(0, batch(WIFI_SCANS, {{"com.a", 2, 0, 0, 0}}));
    ASSERT_EQ(0, Fields(kWifi, ACTION_DEACTIVATE_ALL).i64(10000).send());
    ASSERT_EQ(1u, mListener->mReplies.size());
    EXPECT_EQ(elementReply(0, 0, 10000, "wifi_ap", screenOnBackground(10000, 1600)),
              mListener->mReplies[0].bytes);
    // The hotspot's balance opens with 0 as well, the applications' with 1.
    ASSERT_EQ(0, Fields(kWifi, ACTION_ACTIVATE).i32(WIFI_HOTSPOT).i64(10000).str("wifi_ap").send());
    EXPECT_EQ((std::map<std::string, Charged>{{"com.a", {0, 0, 0, 50}}}), balance(20000));
    EXPECT_EQ(elementReply(0, 10000, 20000, "wifi_ap", screenOnBackground(10000, 1600)),
              mListener->mReplies[1].bytes);
}

}  // namespace
