// The Wi-Fi handler end to end: its messages and polls, the traffic files
// under a private root, the accounting library with the sample profile, the
// real hourly routine, rows read from the database and the hour's upload.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "PlatformServices.h"
#include "binder/managers/PackageManager.h"
#include "core/AppsAccounting.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/WifiHandler.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/PackageProperty.h"
#include "utils/TimeProvider.h"
#include "utils/TrafficReader.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kH = 1796515200000LL + 10 * kHour;
constexpr int64_t kT = kH - 20 * 60000;

std::atomic<int64_t> gMonotonic{0};
int64_t monotonic() {
    return gMonotonic.load();
}

// Turns the hourly tick into the hour's data poll, as the polling routine.
class TickRelay : public KelvoOperator {
public:
    TickRelay() : KelvoOperator("TickRelay", -1, 0) {}
    void setupListeners(Parcel& out) override {
        addNotifierListener(NOTIFICATION_HOURLY_TICK, out);
    }
    int32_t onHourlyTick(const Parcel& data) override {
        PollingPayload poll;
        poll.reason = POLLING_HOURLY_TICK;
        poll.time = data.readInt64();
        poll.hour = data.readInt64();
        Parcel body;
        poll.writeTo(body);
        return sendNotification(NOTIFICATION_DATA_POLLING, body);
    }
};

// Uid rows of wlan0 (and an rmnet row the reader leaves out): uid, tx and rx
// packets, tx and rx bytes.
void writeTraffic(test::TempRoot& root, int64_t a, int64_t b) {
    auto row = [](const char* iface, int uid, int64_t tp, int64_t rp, int64_t tb, int64_t rb) {
        return std::string("2 ") + iface + " 0x0 " + std::to_string(uid) + " 0 " +
               std::to_string(rb) + " " + std::to_string(rp) + " " + std::to_string(tb) + " " +
               std::to_string(tp) + "\n";
    };
    root.writeFile(TrafficReader::kUidStatsPath,
                   "idx iface acct_tag_hex uid_tag_int cnt_set rx_bytes rx_packets tx_bytes "
                   "tx_packets\n" +
                       row("wlan0", 10010, 10 + a, 10 + a / 2, 700 + 70 * a, 800 + 80 * a) +
                       row("wlan0", 10020, 10 + b, 10 + b / 2, 900 + 100 * b, 900 + 50 * b) +
                       row("rmnet_data0", 10010, 99 + a, 99 + a, 99 + a, 99 + a));
    const int64_t tx = 20 + a + b;
    const int64_t rx = 20 + a / 2 + b / 2;
    root.writeFile(TrafficReader::kInterfaceStatsPath,
                   "wlan0 1 0 0 0 0 " + std::to_string(rx * 100) + " " + std::to_string(rx) + " " +
                       std::to_string(tx * 100) + " " + std::to_string(tx) + "\n");
}

class WifiHandlerTest : public test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        WallClock::setFixedTimeMs(kT);
        TimeProvider::setMonotonicSource(&monotonic);
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         test::readHostFile(KELVO_SAMPLE_CONFIG));
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        HourlyRoutine::setVoteTimeoutMs(0);
        ServiceControl::setServiceWaitMs(300);
        mServices.reset(new PlatformServices());
        ASSERT_EQ(android::NO_ERROR, mServices->startAll());
        mServices->state()->setPackages(10010, {"com.a"});
        mServices->state()->setPackages(10020, {"com.b"});
        mServices->state()->setPackages(10030, {"com.c"});
        for (int32_t uid : {10010, 10020, 10030}) PackageProperty::getInstance()->removeUid(uid);
        writeTraffic(*mRoot, 0, 0);  // the baseline: counted as nothing
        mRoutine = new HourlyRoutine();
        mRelay = new TickRelay();
        mWifi = new WifiHandler();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mWifi.get()),
                                    static_cast<StorageOperator*>(AppsAccounting::getInstance()),
                                    static_cast<StorageOperator*>(DataUploader::getInstance())}) {
            op->addSchemaTable();
        }
    }
    void SetUp() override {
        test::AgentStorageTest::SetUp();
        mRoutine->earlyInitialize();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        mRoutine->initialize();
        for (KelvoOperator* op : {static_cast<KelvoOperator*>(mRelay.get()),
                                  static_cast<KelvoOperator*>(mWifi.get())}) {
            ASSERT_EQ(0, op->earlyInitialize());
            op->initialize();
        }
    }
    void TearDown() override {
        for (const sp<KelvoOperator>& op :
             std::vector<sp<KelvoOperator>>{mRoutine.get(), mRelay.get(), mWifi.get()}) {
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        AppsAccounting::getInstance()->balanceAccount();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
        WallClock::setFixedTimeMs(-1);
        TimeProvider::setMonotonicSource(nullptr);
        mServices.reset();
        EXPECT_TRUE(waitFor([] { return !PackageManager::getInstance()->isConnected(); }));
        ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs);
        test::AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }
    int32_t log(int32_t tag, int64_t time, const char* text) {
        Parcel body;
        body.writeInt64(time);
        body.writeCString(text);
        return mWifi->sendMessageSync(ParcelMessage(MESSAGE_LOGGER, tag, body));
    }
    int32_t notify(int32_t type, int64_t time) {
        Parcel body;
        body.writeInt64(time);
        return mWifi->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, body));
    }
    void tick(int64_t hour) {
        const std::string ticks = "SELECT id FROM debug_hourly_tick";
        size_t before = rows(ticks).size();
        WallClock::setFixedTimeMs(hour + 500);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
        ASSERT_TRUE(
            waitFor([&] { return rows(ticks).size() > before; }, std::chrono::milliseconds(15000)));
    }

    sp<HourlyRoutine> mRoutine;
    sp<TickRelay> mRelay;
    sp<WifiHandler> mWifi;
    std::unique_ptr<PlatformServices> mServices;
};

// Ten minutes active at level 0 on band 0 (profile: tx 6, rx 4 per packet,
// fixed 40): com.a sent 1000 and received 500 packets, com.b twice that, the
// interface 3000 and 1500. Energy 8 and 16, the fixed 600000 x 40 / 1000
// split 8 : 16, scans 25 each (com.a two, com.c one); the hotspot 10 s at
// 160, twice (the second stopped by a framework death).
TEST_F(WifiHandlerTest, TrafficScansAndHotspotThroughTheHour) {
    const uint64_t refused = HealthCounters::get(Health::LoggerMessageRefused);
    gMonotonic = 1000;
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_SIGNAL_LEVEL, kT, "level=0"));
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_ACTIVITY, kT, "activity=1"));
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_BAND, kT, "band=2"));
    // Letters are no band, level or uid (not band 0, level 0 or root).
    EXPECT_EQ(-19, log(WifiHandler::TAG_WIFI_BAND, kT, "band=abc"));
    EXPECT_EQ(-19, log(WifiHandler::TAG_WIFI_SIGNAL_LEVEL, kT, "level=abc"));
    EXPECT_EQ(-19, log(WifiHandler::TAG_WIFI_SCAN_STARTED, kT, "uid=abc"));
    EXPECT_EQ(-9, log(WifiHandler::TAG_WIFI_BAND, kT, "band=3"));
    EXPECT_EQ(refused + 4, HealthCounters::get(Health::LoggerMessageRefused));
    for (const char* uid : {"uid=10010", "uid=10010", "uid=10030"}) {
        ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_SCAN_STARTED, kT + 1000, uid));
    }
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_AP_ON, kT + 2000, ""));
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_AP_OFF, kT + 12000, ""));
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_AP_ON, kT + 20000, ""));
    ASSERT_EQ(0, notify(NOTIFICATION_VM_DIED, kT + 30000));
    // com.c was removed before the poll: its scan is still charged.
    Parcel removed;
    removed.writeInt32(10030);
    ASSERT_EQ(0, mWifi->sendMessageSync(
                     ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_UID_REMOVED, removed)));

    gMonotonic = 601000;
    writeTraffic(*mRoot, 1000, 2000);
    tick(kH);

    const std::string h = std::to_string(kH);
    EXPECT_EQ((std::vector<std::string>{
                  "com.a|200000|70000|80000|8058|200000|8058",
                  "com.b|400000|200000|100000|16016|400000|16016",
                  "com.c|0|0|0|25|0|25",
                  "wifi_ap|10000|0|0|1600|10000|1600",
                  "wifi_ap|10000|0|0|1600|10000|1600",
              }),
              rows("SELECT name, background_duration, background_tx_bytes, background_rx_bytes, "
                   "background_energy, screen_on_duration, screen_on_energy "
                   "FROM raw_applications_wifi ORDER BY name"));
    EXPECT_EQ(std::vector<std::string>{h + "|600000|0|0|0|0"},
              rows("SELECT timestamp, signal_level_0, signal_level_1, signal_level_2, "
                   "signal_level_3, signal_level_4 FROM raw_wifi_activity_duration"));
    EXPECT_EQ(std::vector<std::string>{h + "|wlan0|150000|1500|300000|3000"},
              rows("SELECT timestamp, interface, rx_bytes, rx_packets, tx_bytes, tx_packets "
                   "FROM raw_wifi_interface_traffic"));
    EXPECT_EQ((std::vector<std::string>{h + "|com.a|150000|8058", h + "|com.b|300000|16016",
                                        h + "|com.c|0|25", h + "|wifi_ap|0|3200"}),
              rows("SELECT timestamp, name, background_tx_bytes + background_rx_bytes, "
                   "background_energy FROM hourly_applications_wifi ORDER BY name"));
    EXPECT_EQ(std::vector<std::string>{h + "|27299"},
              rows("SELECT timestamp, background_energy FROM hourly_component_wifi"));
    EXPECT_EQ((std::vector<std::string>{"com.a|10|8058", "com.b|10|16016", "com.c|10|25",
                                        "wifi_ap|10|3200"}),
              rows("SELECT name, component, background_energy FROM "
                   "hourly_applications_accounting ORDER BY name"));

    Json::Value upload;
    for (const Json::Value& e : events()) {
        if (e["event"].asUInt() == EVENT_HOURLY_COMPONENTS) upload = e["params"];
    }
    // Background: tx 14, rx 15, energy 6; the hotspot moved no bytes.
    EXPECT_EQ(270000, upload["25"]["params"]["14"].asInt64());
    EXPECT_EQ(180000, upload["25"]["params"]["15"].asInt64());
    EXPECT_EQ(27299, upload["25"]["params"]["6"].asInt64());
    ASSERT_EQ(2u, upload["26"].size());
    EXPECT_EQ("com.b", upload["26"][0]["params"]["3"]["params"]["0"].asString());
    EXPECT_EQ(8058, upload["26"][1]["params"]["1"]["params"]["6"].asInt64());
}

// Time is booked to the level in force while the link is active; the
// screen going off ends the span and later activity is ignored. Levels 0
// and 1 stay apart in the row.
TEST_F(WifiHandlerTest, ActivitySpansFollowLevelAndScreen) {
    auto screen = [&](int64_t time, bool on) {
        Parcel body;
        body.writeInt64(time);
        body.writeBool(on);
        return mWifi->sendMessageSync(
            ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_SCREEN_STATE_CHANGED, body));
    };
    gMonotonic = 1000;
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_SIGNAL_LEVEL, kT, "level=1"));
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_ACTIVITY, kT, "activity=1"));
    gMonotonic = 11000;
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_SIGNAL_LEVEL, kT + 10000, "level=0"));
    gMonotonic = 31000;
    ASSERT_EQ(0, screen(kT + 30000, false));
    ASSERT_EQ(0, log(WifiHandler::TAG_WIFI_ACTIVITY, kT + 31000, "activity=1"));
    gMonotonic = 91000;
    ASSERT_EQ(0, screen(kT + 90000, true));
    const std::string t = std::to_string(kT);
    EXPECT_EQ((std::vector<std::string>{t + "|1|1", std::to_string(kT + 30000) + "|0|0"}),
              rows("SELECT timestamp, activity, signal_level FROM raw_wifi_activity"));
    EXPECT_EQ(std::vector<std::string>{std::to_string(kT + 30000) + "|20000|10000|0|0|0"},
              rows("SELECT timestamp, signal_level_0, signal_level_1, signal_level_2, "
                   "signal_level_3, signal_level_4 FROM raw_wifi_activity_duration"));
}

// An application list is trusted no further than its count (0 to 5000) and
// its complete rows; other headers are refused.
TEST_F(WifiHandlerTest, ResultsAreCheckedBeforeTheyAreStored) {
    struct Case {
        int32_t header;
        int32_t count;
        int32_t rowsGiven;
        int32_t result;
    } cases[] = {{1, -1, 1, -2}, {1, 5001, 1, -2}, {1, 3, 2, -2}, {1, 1, 1, 0}, {7, 1, 1, -2}};
    const uint64_t refused = HealthCounters::get(Health::LibraryParcelRefused);
    for (const Case& c : cases) {
        Parcel result;
        result.writeInt32(c.header);
        result.writeInt32(c.count);
        for (int32_t r = 0; r < c.rowsGiven; ++r) {
            result.writeInt64(kT);
            result.writeInt64(kT + 1000);
            result.writeString8(android::String8("com.r"));
            for (int i = 0; i < 6; ++i) {
                result.writeInt32(1);
                result.writeInt64(2);
                result.writeInt64(3);
                result.writeInt64(4);
            }
        }
        result.writeInt32(77);  // a cut row
        EXPECT_EQ(c.result, mWifi->handleLibraryEvent(LIBRARY_EVENT_APPLICATION, result));
    }
    EXPECT_EQ(refused + 4, HealthCounters::get(Health::LibraryParcelRefused));
    EXPECT_EQ(std::vector<std::string>{"3"},
              rows("SELECT COUNT(*) FROM raw_applications_wifi WHERE name = 'com.r'"));
}

}  // namespace
