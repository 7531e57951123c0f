// The DPM handler end to end: the fake driver's block times and DDR
// counters, the accounting library with a small profile of its own, the
// real hourly routine, rows, log lines and uploaded events.

#include <gtest/gtest.h>
#include <json/json.h>

#include "FakeKernelDriver.h"
#include "KelvoLog.h"
#include "common/TestEnv.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/DpmHandler.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "libkelvo/LibraryTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/XmlParser.h"
#include "utils/devices/DpmDevice.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using Driver = kelvo::fake::FakeKernelDriver;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kH = 1796515200000LL + 10 * kHour;
constexpr int64_t kT = kH - 20 * 60000;

// DSS 0/10/5/1; DDRC_CH0 has three values (skipped); LP_MCU busy 10; the
// four DDR levels 1/2/3/4 per ms and 1 per MB; DDR_BW has none.
std::string config(int32_t policy) {
    std::string p = "<c><element id=\"0\"><component id=\"11\">";
    auto param = [&](int id, std::vector<int> values) {
        p += "<parameter id=\"" + std::to_string(id) + "\">";
        for (int v : values) p += "<value>" + std::to_string(v) + "</value>";
        p += "</parameter>";
    };
    param(100, {0, 10, 5, 1});
    param(112, {0, 10, 5});
    param(102, {0, 10, 0, 0});
    for (int i = 0; i < 4; ++i) param(10000 + i, {i + 1, 1, i + 1, 1});
    return p + "</component></element><element id=\"2\"><component id=\"4\"><parameter>" +
           std::to_string(policy) + "</parameter></component></element></c>";
}

// Turns the hourly tick into the hour's data poll, as the polling routine.
class Poller : public KelvoOperator {
public:
    Poller() : KelvoOperator("DpmPoller", -1, 0) {}
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

class DpmHandlerTest : public test::AgentStorageTest {
protected:
    virtual int32_t policy() const { return 2; }
    void addTables() override {
        WallClock::setFixedTimeMs(kT);
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml", config(policy()));
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        HourlyRoutine::setVoteTimeoutMs(0);  // the full minute
        mRoutine = new HourlyRoutine();
        mPoller = new Poller();
        mDpm = new DpmHandler();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mDpm.get()),
                                    static_cast<StorageOperator*>(DataUploader::getInstance())}) {
            op->addSchemaTable();
        }
    }
    void SetUp() override {
        test::AgentStorageTest::SetUp();
        ASSERT_TRUE(mDriver.start());
        mDriver.useIpNames(policy());
        mDriver.addIpTime("DSS", Driver::DPM_BUSY, 777);  // before the start: reset away
        mRoutine->earlyInitialize();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        mRoutine->initialize();
        for (KelvoOperator* op : {static_cast<KelvoOperator*>(mPoller.get()),
                                  static_cast<KelvoOperator*>(mDpm.get())}) {
            ASSERT_EQ(0, op->earlyInitialize());
            op->initialize();
        }
        EXPECT_EQ(1000, mDriver.state().period);
    }
    void TearDown() override {
        setLogDebugEnable(false);
        for (const sp<KelvoOperator>& op :
             std::vector<sp<KelvoOperator>>{mRoutine.get(), mPoller.get(), mDpm.get()}) {
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
        WallClock::setFixedTimeMs(-1);
        mDriver.stop();
        test::AgentStorageTest::TearDown();
    }
    void poll(int64_t dt, int32_t reason = POLLING_PERIODIC, bool online = false) {
        PollingPayload poll;
        poll.reason = reason;
        poll.time = poll.hour = kT + dt;
        poll.online = online;
        Parcel body;
        poll.writeTo(body);
        mDpm->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_DATA_POLLING, body));
    }
    void ddr(std::vector<int64_t> times, std::vector<int64_t> flux) {
        mDriver.update([&](Driver::State& s) { s.ddrValues = {times, flux}; });
    }
    std::vector<std::string> rawRows(const std::string& where = "1") {
        return rows(
            "SELECT ip, off_time, busy_time, busy_time_low_voltage, idle_time, energy, "
            "charge_energy FROM raw_component_dpm WHERE " +
            where + " ORDER BY id");
    }

    test::LogCapture mLog;
    Driver mDriver;
    sp<HourlyRoutine> mRoutine;
    sp<Poller> mPoller;
    sp<DpmHandler> mDpm;
};

// One read: every changed block is a row with its energy; unchanged blocks
// are left out; a block without (whole) coefficients counts 0; a product
// past int64 is clamped; charging moves the energy to its own column.
TEST_F(DpmHandlerTest, ReadsBecomeRows) {
    EXPECT_EQ(1u, mLog.count("Invalid dpm power configuration: ip=112, values=3"));
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 2000);
    mDriver.addIpTime("DSS", Driver::DPM_IDLE, 1000);
    mDriver.addIpTime("DDRC_CH0", Driver::DPM_BUSY, 500);
    mDriver.addIpTime("DDR_BW", Driver::DPM_BUSY, 300);
    mDriver.addIpTime("LP_MCU", Driver::DPM_BUSY, 4000000000000000000LL);
    poll(60000);
    EXPECT_EQ((std::vector<std::string>{"32|0|300|0|0|0|0", "100|0|2000|0|1000|21|0",
                                        "102|0|4000000000000000000|0|0|9223372036854775|0",
                                        "112|0|500|0|0|0|0"}),
              rawRows());
    EXPECT_EQ(std::vector<std::string>{std::to_string(kT) + "|" + std::to_string(kT + 60000)},
              rows("SELECT DISTINCT start_time, end_time FROM raw_component_dpm"));
    EXPECT_EQ(0, mDriver.state().ips[1].times[Driver::DPM_BUSY]);  // reset after the read
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 100);
    poll(120000, POLLING_CHARGER, true);  // read before the charger came
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 100);
    poll(180000);
    EXPECT_EQ((std::vector<std::string>{"100|0|100|0|0|1|0", "100|0|100|0|0|0|1"}),
              rawRows("start_time > " + std::to_string(kT)));
}

// The DDR levels: the first read sets the baselines; later reads take the
// increase (a counter below its baseline is taken whole; no increase, no
// record) and file it by the level's bandwidth threshold. Time 10 s and 15000 MB is 1500 MB/s: above
// the threshold 1000 of levels 0 and 1, at most the 2000 of levels 2 and 3.
// A device with 3 levels gives no records and the baselines start again.
TEST_F(DpmHandlerTest, DdrLevels) {
    struct Step {
        std::vector<int64_t> times, flux;
        std::vector<std::string> expected;
    };
    const std::vector<Step> steps = {
        {{5, 5, 5, 5}, {100, 100, 100, 100}, {}},
        {{15, 15, 15, 6},
         {15100, 15100, 15100, 1100},
         {"10000|0|0|10000|15000|25", "10001|0|0|10000|15000|35", "10002|10000|15000|0|0|45",
          "10003|1000|1000|0|0|5"}},
        {{3, 15, 15, 6}, {3000, 15100, 15100, 1100}, {"10000|3000|3000|0|0|6"}},
        {{1, 1, 1}, {1, 1, 1}, {}},
        {{9, 9, 9, 9}, {9, 9, 9, 9}, {}},
        {{10, 9, 9, 9}, {10, 9, 9, 9}, {"10000|1000|1|0|0|1"}},
    };
    for (size_t i = 0; i < steps.size(); ++i) {
        SCOPED_TRACE(i);
        ddr(steps[i].times, steps[i].flux);
        const int64_t dt = 60000 * static_cast<int64_t>(i + 1);
        poll(dt);
        std::vector<std::string> got;
        for (const std::string& r : rawRows("end_time = " + std::to_string(kT + dt)))
            got.push_back(r.substr(0, r.rfind('|')));
        EXPECT_EQ(steps[i].expected, got);
    }
    EXPECT_EQ(1u, mLog.count("Invalid ddr bw count: 3"));
}

// A failed reset keeps the read values as baselines: the next read reports
// only the increase. A failed block read resets nothing, so the next read
// still has the whole span; a failed period getter disables the handler.
TEST_F(DpmHandlerTest, FailedResetOrRead) {
    mDriver.failRequest(Driver::Device::Dpm, DpmDevice::kSetEnable, EIO);
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 1000);
    poll(60000);
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 500);
    poll(120000);
    mDriver.clearFailures();
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 200);
    poll(180000);
    mDriver.failRequest(Driver::Device::Dpm, DpmDevice::kGetIpData, EIO);
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 40);
    poll(240000);
    mDriver.clearFailures();
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 2);
    poll(300000);
    EXPECT_EQ((std::vector<std::string>{"100|0|1000|0|0|10|0", "100|0|500|0|0|5|0",
                                        "100|0|200|0|0|2|0", "100|0|42|0|0|0|0"}),
              rawRows());
    EXPECT_EQ(2u, mLog.count("Failed to reset data"));

    mDriver.failRequest(Driver::Device::Dpm, DpmDevice::kGetPeriod, EIO);
    sp<DpmHandler> other = new DpmHandler();
    EXPECT_EQ(-2, other->earlyInitialize());
    EXPECT_EQ(1u, mLog.count("Failed to get minimum period"));
    mDriver.clearFailures();
    mDriver.update([](Driver::State& s) {
        s.minPeriod = 5000;
        s.maxPeriod = 10;
    });
    sp<DpmHandler> third = new DpmHandler();
    EXPECT_EQ(-2, third->earlyInitialize());
    EXPECT_EQ(1u, mLog.count("Invalid period: maximum=10, minimum=5000"));
}

// A forced read (the query service's) stores at once and moves the start
// of the next read to its own time.
TEST_F(DpmHandlerTest, ForcedReadMovesTheNextStart) {
    WallClock::setFixedTimeMs(kT + 30000);
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 1000);
    Parcel reply;
    EXPECT_EQ(0, mDpm->sendCustomizedMessage(DpmHandler::kCustomizedRead, Parcel(), &reply, true));
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 1000);
    poll(60000);
    EXPECT_EQ(
        (std::vector<std::string>{std::to_string(kT) + "|" + std::to_string(kT + 30000),
                                  std::to_string(kT + 30000) + "|" + std::to_string(kT + 60000)}),
        rows("SELECT start_time, end_time FROM raw_component_dpm ORDER BY id"));
}

// The hourly round: the hour's read, the component accounting and the
// upload, with no elector left waiting for the time-out.
TEST_F(DpmHandlerTest, HourlyRoundCompletes) {
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 3000);
    mDriver.addIpTime("LP_MCU", Driver::DPM_BUSY, 500);
    poll(60000);
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 1000);
    auto started = std::chrono::steady_clock::now();
    WallClock::setFixedTimeMs(kH + 500);
    mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
    ASSERT_TRUE(waitFor([&] { return !rows("SELECT id FROM debug_hourly_tick").empty(); },
                        std::chrono::milliseconds(15000)));
    EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(10));
    EXPECT_EQ((std::vector<std::string>{std::to_string(kH) + "|100|4000|40",
                                        std::to_string(kH) + "|102|500|5"}),
              rows("SELECT timestamp, ip, busy_time, energy FROM hourly_component_dpm ORDER BY "
                   "ip"));
    Json::Value hourly;
    for (const Json::Value& e : events())
        if (e["event"].asUInt() == EVENT_HOURLY_COMPONENTS) hourly = e["params"];
    EXPECT_EQ(45, hourly["33"].asInt64());
    ASSERT_EQ(2u, hourly["34"].size());
    EXPECT_EQ(100, hourly["34"][0]["params"]["0"].asInt64());
    EXPECT_EQ(40, hourly["34"][0]["params"]["5"].asInt64());
    EXPECT_FALSE(mLog.contains("mismatched candidate"));
}

// Policy 1 has no bandwidth levels: the DDR is not read, one debug line per
// read says so, and no name error appears.
class DpmPolicyOneTest : public DpmHandlerTest {
protected:
    int32_t policy() const override { return 1; }
};

TEST_F(DpmPolicyOneTest, DdrSilent) {
    setLogDebugEnable(true);
    mDriver.clearRequests();
    mDriver.addIpTime("DSS", Driver::DPM_BUSY, 1000);
    poll(60000);
    poll(120000);
    for (const Driver::Request& r : mDriver.requests()) {
        EXPECT_NE(DpmDevice::kGetDdrData, r.request);
    }
    EXPECT_EQ(2u, mLog.count("No ddr bandwidth levels under policy 1"));
    EXPECT_FALSE(mLog.contains("Cannot find ip name"));
    EXPECT_EQ(std::vector<std::string>{"0|0|1000|0|0|0|0"}, rawRows());
}

// The accounter takes the records there are, whatever count the action
// claims.
TEST_F(DpmHandlerTest, AccounterRecordsEndWithTheData) {
    sp<test::RecordingListener> listener = new test::RecordingListener();
    KelvoLibAgent* lib = KelvoLibAgent::getInstance();
    lib->registerListener(ACCOUNTER_DPM, listener);
    for (int32_t claimed : {3, -1}) {
        Parcel action;
        for (int32_t v : {int32_t(ACCOUNTER_DPM), int32_t(ACTION_SET_VALUE)}) action.writeInt32(v);
        action.writeInt64(1);
        action.writeInt64(2);
        action.writeBool(false);
        action.writeInt32(claimed);
        action.writeInt32(100);
        for (int64_t t : {0, 1000, 0, 0}) action.writeInt64(t);
        action.setDataPosition(0);
        EXPECT_EQ(claimed < 0 ? -1 : 0, lib->setDataAccounter(action));
    }
    ASSERT_EQ(1u, listener->mReplies.size());
    EXPECT_EQ(1, listener->mReplies[0].bytes[0]);  // one record
}

}  // namespace
