// The modem handler end to end: polls write the control file under a
// private root, blocks are posted as the manager service posts them, the
// traffic files, the accounting library with the sample profile, the real
// hourly routine, rows read from the database and the hour's upload.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <string.h>

#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "PlatformServices.h"
#include "binder/managers/PackageManager.h"
#include "common/TestEnv.h"
#include "core/AppsAccounting.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/ModemHandler.h"
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

struct Record {
    uint32_t sim;
    uint32_t module;
    std::vector<uint32_t> fields;
    size_t bytes = SIZE_MAX;  // the declared length when not the fields'
};

// The block's bytes: n, data length, then the records.
std::string block(const std::vector<Record>& records, uint32_t count = UINT32_MAX) {
    std::string body;
    auto put = [&body](uint32_t v) { body.append(reinterpret_cast<const char*>(&v), 4); };
    for (const Record& r : records) {
        put(r.bytes != SIZE_MAX ? static_cast<uint32_t>(r.bytes) : 4 * r.fields.size());
        put(r.sim);
        put(r.module);
        for (uint32_t f : r.fields) put(f);
    }
    std::string out;
    uint32_t head[2] = {count != UINT32_MAX ? count : static_cast<uint32_t>(records.size()),
                        static_cast<uint32_t>(body.size())};
    out.append(reinterpret_cast<const char*>(head), 8);
    return out + body;
}

// A PAM wake-up item: type, sender, receiver, message id, count.
Record pam(uint32_t type, uint32_t sim = 0) {
    return {sim, 12, {type, 100, 200, 7, 3}};
}

// rmnet_data0 rows of com.a and com.b (and a wlan0 row the reader leaves
// out): tx and rx packets a/2 each for com.a, b/2 each for com.b.
void writeTraffic(test::TempRoot& root, int64_t a, int64_t b) {
    auto row = [](const char* iface, int uid, int64_t tp, int64_t rp, int64_t tb, int64_t rb) {
        return std::string("2 ") + iface + " 0x0 " + std::to_string(uid) + " 0 " +
               std::to_string(rb) + " " + std::to_string(rp) + " " + std::to_string(tb) + " " +
               std::to_string(tp) + "\n";
    };
    root.writeFile(TrafficReader::kUidStatsPath,
                   "idx iface acct_tag_hex uid_tag_int cnt_set rx_bytes rx_packets tx_bytes "
                   "tx_packets\n" +
                       row("rmnet_data0", 10010, a / 2, a / 2, 100 * a, 10 * a) +
                       row("rmnet_data0", 10020, b / 2, b / 2, 100 * b, 10 * b) +
                       row("wlan0", 10010, 99 + a, 99 + a, 99 + a, 99 + a));
    const int64_t half = (a + b) / 2;
    root.writeFile(TrafficReader::kInterfaceStatsPath,
                   "rmnet_data0 1 0 0 0 0 " + std::to_string(half * 10) + " " +
                       std::to_string(half) + " " + std::to_string(half * 100) + " " +
                       std::to_string(half) + "\n");
}

class ModemHandlerTest : public test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        WallClock::setFixedTimeMs(kT);
        TimeProvider::setMonotonicSource(&monotonic);
        gMonotonic = 1000;
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         test::readHostFile(KELVO_SAMPLE_CONFIG));
        mRoot->writeFile(ModemHandler::kControlPath, "");
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        HourlyRoutine::setVoteTimeoutMs(0);
        ModemHandler::setTimingForTest(0, 50);
        ServiceControl::setServiceWaitMs(300);
        mServices.reset(new PlatformServices());
        ASSERT_EQ(android::NO_ERROR, mServices->startAll());
        mServices->state()->setPackages(10010, {"com.a"});
        mServices->state()->setPackages(10020, {"com.b"});
        for (int32_t uid : {10010, 10020}) PackageProperty::getInstance()->removeUid(uid);
        writeTraffic(*mRoot, 0, 0);  // the baseline: counted as nothing
        mRoutine = new HourlyRoutine();
        mRelay = new TickRelay();
        mModem = new ModemHandler();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mModem.get()),
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
                                  static_cast<KelvoOperator*>(mModem.get())}) {
            ASSERT_EQ(0, op->earlyInitialize());
            op->initialize();
        }
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_MODEM, mModem);
    }
    void TearDown() override {
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_MODEM, nullptr);
        for (const sp<KelvoOperator>& op :
             std::vector<sp<KelvoOperator>>{mRoutine.get(), mRelay.get(), mModem.get()}) {
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
        ModemHandler::setTimingForTest(0, 0);
        mServices.reset();
        EXPECT_TRUE(waitFor([] { return !PackageManager::getInstance()->isConnected(); }));
        ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs);
        test::AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }
    // Posts a block as the manager service does: int32 S, then S bytes.
    int32_t post(const std::string& bytes, int32_t declared = -1) {
        Parcel parcel;
        parcel.writeInt32(declared >= 0 ? declared : static_cast<int32_t>(bytes.size()));
        parcel.write(bytes.data(), bytes.size());
        Parcel reply;
        return KelvoAgent::getInstance()->sendToHandler(
            HANDLER_MODEM, ModemHandler::TAG_MODEM_BLOCK, parcel, &reply, true);
    }
    int32_t poll(int32_t reason, int64_t time, int64_t hour = 0) {
        PollingPayload p;
        p.reason = reason;
        p.time = time;
        p.hour = hour;
        Parcel body;
        p.writeTo(body);
        return mModem->sendMessageSync(
            ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_DATA_POLLING, body));
    }
    // Starts the round of the hour; returns once the modem was asked.
    void tick(int64_t hour) {
        mRoot->writeFile(ModemHandler::kControlPath, "");
        WallClock::setFixedTimeMs(hour + 500);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
        ASSERT_TRUE(waitFor([&] {
            return mRoot->readFile(ModemHandler::kControlPath) == ModemHandler::kModuleList;
        }));
    }
    bool roundDone(size_t rounds) {
        return waitFor([&] { return rows("SELECT id FROM debug_hourly_tick").size() >= rounds; },
                       std::chrono::milliseconds(15000));
    }

    sp<HourlyRoutine> mRoutine;
    sp<TickRelay> mRelay;
    sp<ModemHandler> mModem;
    std::unique_ptr<PlatformServices> mServices;
};

// Each length and count of a block is checked against the bytes there
// before it is used; a record that does not fit, a SIM index of 3 or more
// or an unknown module ends the block after the records before it. A
// decoder's own refusal (a short WCDMA record) skips only that record; a
// long PAM record is stored whole, in inserts the storage takes.
TEST_F(ModemHandlerTest, MalformedBlocksKeepWhatCameBeforeTheFault) {
    Record cut = pam(9);
    cut.bytes = 1000;  // L past the end
    Record wrap = pam(9);
    wrap.bytes = 0xFFFFFFF8u;  // L + 12 would wrap in 32 bits
    Record pam45 = {0, 12, {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12}};
    pam45.bytes = 45;  // two whole items, then five bytes of a third
    std::string pam45Block = block({pam45});
    pam45Block.resize(8 + 12 + 45);
    const struct Case {
        const char* name;
        std::string bytes;
        int32_t declared;
        int32_t result;
        size_t rows;      // PAM rows stored
        uint64_t faults;  // blocks refused or ended early
    } cases[] = {
        {"S below the header", std::string("\x01\x00\x00\x00", 4), -1, -9, 0, 1},
        {"S above the data", block({pam(1)}), 400, -9, 0, 1},
        {"S above the cap", block({pam(1)}), INT32_MAX, -9, 0, 1},
        {"S zero", block({pam(1)}), 0, -9, 0, 1},
        {"n above the records", block({pam(1)}, 3), -1, -3, 1, 1},
        {"L past the end", block({pam(1), cut}), -1, -3, 1, 1},
        {"L wrapping", block({wrap, pam(1)}), -1, -3, 0, 1},
        {"SIM 3", block({pam(1), pam(2, 3), pam(3)}), -1, -3, 1, 1},
        {"module 13", block({pam(1), {0, 13, {1, 2, 3, 4, 5}}, pam(3)}), -1, -3, 1, 1},
        {"module 12 of 45 bytes", pam45Block, -1, 0, 2, 0},
        {"short WCDMA record", block({{1, 11, {1, 2, 3, 4}}, pam(4)}), -1, 0, 1, 0},
        {"6000 PAM items", block({{0, 12, std::vector<uint32_t>(5 * 6000, 1)}}), -1, 0, 6000, 0},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        const uint64_t faults = HealthCounters::get(Health::ModemBlocksRefused);
        const std::string count = "SELECT COUNT(*) FROM raw_modem_pam_wakeup_source";
        const size_t before = std::stoul(rows(count)[0]);
        EXPECT_EQ(c.result, post(c.bytes, c.declared));
        EXPECT_EQ(before + c.rows, std::stoul(rows(count)[0]));
        EXPECT_EQ(faults + c.faults, HealthCounters::get(Health::ModemBlocksRefused));
    }
    // The two items of 45 bytes, stamped at their arrival.
    EXPECT_EQ((std::vector<std::string>{std::to_string(kT) + "|1|2|3|4|5",
                                        std::to_string(kT) + "|6|7|8|9|10"}),
              rows("SELECT timestamp, type, sender_pid, receiver_pid, msg_id, count FROM "
                   "raw_modem_pam_wakeup_source WHERE type IN (1, 6) AND count > 3"));
}

// Answers are stamped with their request's time: the hourly one with its
// hour even when a poll came between, a poll 30 ms after the last one
// after the (shortened) spacing it waited; nothing outstanding: arrival.
TEST_F(ModemHandlerTest, AnswersCarryTheirRequestsTime) {
    ASSERT_EQ(0, poll(POLLING_HOURLY_TICK, kT, kH));
    gMonotonic = 1030;
    ASSERT_EQ(0, poll(POLLING_PERIODIC, kT + 30));
    for (uint32_t type : {1u, 2u, 3u}) {
        ASSERT_EQ(0, post(block({pam(type)})));
    }
    EXPECT_EQ(
        (std::vector<std::string>{std::to_string(kH) + "|1", std::to_string(kT + 30 + 50) + "|2",
                                  std::to_string(kT) + "|3"}),
        rows("SELECT timestamp, type FROM raw_modem_pam_wakeup_source ORDER BY type"));
}

// One hour: LTE and WCDMA records answer the hourly request; com.a moved 50
// and com.b 150 of the interface's 200 packets on rmnet_data0 while the
// WCDMA RRC record's data time (50000 x 10 ms at 2) drew 1000 units: com.a
// gets 250. The LTE RRC idle time (1000 ms at level 0) and the WCDMA call
// time (1000 ms at level 0) come back as modem_idle and modem_voice and are
// uploaded with the call usage.
TEST_F(ModemHandlerTest, RecordsTrafficAndTheHour) {
    std::vector<uint32_t> ltePhy(13, 0);
    std::vector<uint32_t> lteRrc(19, 0);
    lteRrc[3] = 1000;  // idle_time
    lteRrc[4] = 10;    // idle_drx_cnt: 100 ms each
    lteRrc[15] = 10;   // rsrp_weak_cnt
    std::vector<uint32_t> wcdmaPhy(34, 0);
    wcdmaPhy[32] = 100;  // cs_weak_signal_cnt, x 10 ms
    const std::vector<uint32_t> wcdmaRrc = {50000, 0, 0, 0, 0};
    writeTraffic(*mRoot, 50, 150);
    tick(kH);
    ASSERT_EQ(0, post(block({{0, 5, ltePhy}, {0, 7, lteRrc}, {1, 8, wcdmaPhy}, {0, 11, wcdmaRrc}})));
    ASSERT_TRUE(roundDone(1));

    const std::string h = std::to_string(kH);
    EXPECT_EQ(std::vector<std::string>{h + "|0|0|0"},
              rows("SELECT timestamp, sim, band_flag, cdrx_time_cnt FROM raw_modem_lte_phy"));
    EXPECT_EQ(std::vector<std::string>{h + "|1|100"},
              rows("SELECT timestamp, sim, cs_weak_signal_cnt FROM raw_modem_wcdma_phy"));
    EXPECT_EQ(std::vector<std::string>{h + "|50000"},
              rows("SELECT timestamp, fach_time FROM raw_modem_wcdma_rrc"));
    EXPECT_EQ((std::vector<std::string>{"0|8|1000|250", "1|7|1000|8", "2|11|500000|1000"}),
              rows("SELECT type, module, duration, energy FROM raw_component_modem "
                   "WHERE duration > 0 AND end_time = " +
                   h + " ORDER BY type"));
    EXPECT_EQ((std::vector<std::string>{"com.a|5000|500|250", "com.b|15000|1500|750"}),
              rows("SELECT name, background_tx_bytes, background_rx_bytes, background_energy "
                   "FROM raw_applications_modem ORDER BY name"));
    EXPECT_EQ((std::vector<std::string>{h + "|com.a|0|250", h + "|com.b|0|750",
                                        h + "|modem_idle|8|0", h + "|modem_voice|0|250"}),
              rows("SELECT timestamp, name, foreground_energy, background_energy FROM "
                   "hourly_applications_accounting WHERE component = 9 ORDER BY name"));
    EXPECT_EQ(std::vector<std::string>{h + "|8|1250|20000"},
              rows("SELECT timestamp, foreground_energy, background_energy, background_tx_bytes "
                   "FROM hourly_component_modem"));

    Json::Value upload;
    for (const Json::Value& e : events()) {
        if (e["event"].asUInt() == EVENT_HOURLY_COMPONENTS) upload = e["params"];
    }
    // Idle energy moved no bytes and is still in the component class.
    EXPECT_EQ(8, upload["22"]["params"]["4"].asInt64());
    EXPECT_EQ(1250, upload["22"]["params"]["6"].asInt64());
    ASSERT_EQ(2u, upload["23"].size());
    EXPECT_EQ("com.b", upload["23"][0]["params"]["3"]["params"]["0"].asString());
    EXPECT_EQ(1000, upload["24"]["params"]["0"].asInt64());
}

// Without an answer the hour is voted for after the (shortened) time-out;
// the late answer casts no vote and is stamped when it arrives. Its traffic
// came without any data energy and still reaches the applications' rows.
TEST_F(ModemHandlerTest, NoAnswerVotesAndALateOneIsStampedAtArrival) {
    test::LogCapture log;
    ModemHandler::setTimingForTest(200, 50);
    tick(kH);
    ASSERT_TRUE(roundDone(1));
    writeTraffic(*mRoot, 50, 150);
    ASSERT_EQ(0, post(block({pam(1)})));
    EXPECT_EQ(std::vector<std::string>{std::to_string(kH + 500)},
              rows("SELECT timestamp FROM raw_modem_pam_wakeup_source"));
    EXPECT_FALSE(log.contains("mismatched candidate"));
    tick(kH + kHour);
    ASSERT_TRUE(roundDone(2));
    EXPECT_EQ((std::vector<std::string>{"com.a|5000|0", "com.b|15000|0"}),
              rows("SELECT name, background_tx_bytes, background_energy FROM "
                   "raw_applications_modem ORDER BY name"));
}

// The component record opens with the accounter's charger state: call time
// balanced while charging lands in the charge columns and is no
// discharging energy of modem_voice.
TEST_F(ModemHandlerTest, ChargingCallTimeFillsTheChargeColumns) {
    std::vector<uint32_t> wcdmaPhy(34, 0);
    wcdmaPhy[32] = 100;  // cs_weak_signal_cnt, x 10 ms
    PollingPayload charger;
    charger.reason = POLLING_CHARGER;
    charger.time = kT;
    charger.online = true;
    Parcel body;
    charger.writeTo(body);
    ASSERT_EQ(0, mModem->sendMessageSync(
                     ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_DATA_POLLING, body)));
    ASSERT_EQ(0, post(block({{0, 8, wcdmaPhy}})));  // balanced before the charger went on
    ASSERT_EQ(0, post(block({{0, 8, wcdmaPhy}})));
    EXPECT_EQ((std::vector<std::string>{"1000|250|0|0", "0|0|1000|250"}),
              rows("SELECT duration, energy, charge_duration, charge_energy FROM "
                   "raw_component_modem WHERE type = 0 ORDER BY rowid"));
    AppsAccounting::getInstance()->balanceAccount();
    EXPECT_EQ(std::vector<std::string>{"modem_voice|250"},
              rows("SELECT name, background_energy FROM hourly_applications_accounting"));
}

}  // namespace
