// The GPU handler end to end: the fake kernel driver's residency, the
// accounting library with the sample profile (260 MHz 120, 480 MHz 210 per
// busy second), the real hourly routine, rows and uploaded events.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include <functional>

#include "FakeKernelDriver.h"
#include "HealthCounters.h"
#include "core/AppsAccounting.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/GpuHandler.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/XmlParser.h"
#include "utils/devices/KelvoDevice.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using Driver = kelvo::fake::FakeKernelDriver;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kH = 1796515200000LL + 10 * kHour;
constexpr int64_t kT = kH - 20 * 60000;
constexpr int64_t kLow = 260000000, kHigh = 480000000;

// Turns the hourly tick into the hour's data poll, as the polling routine.
class Poller : public KelvoOperator {
public:
    Poller() : KelvoOperator("GpuPoller", -1, 0) {}
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

class GpuHandlerTest : public test::AgentStorageTest {
protected:
    void addTables() override {
        WallClock::setFixedTimeMs(kT);
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         test::readHostFile(KELVO_SAMPLE_CONFIG));
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        HourlyRoutine::setVoteTimeoutMs(0);  // the full minute
        mRoutine = new HourlyRoutine();
        mPoller = new Poller();
        mGpu = new GpuHandler();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mGpu.get()),
                                    static_cast<StorageOperator*>(AppsAccounting::getInstance()),
                                    static_cast<StorageOperator*>(DataUploader::getInstance())}) {
            op->addSchemaTable();
        }
    }
    void SetUp() override {
        test::AgentStorageTest::SetUp();
        ASSERT_TRUE(mDriver.start());
        mDriver.addGpuResidency(kLow, 9000000, 0);  // before the start: nobody's
        mRoutine->earlyInitialize();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        mRoutine->initialize();
        for (KelvoOperator* op : {static_cast<KelvoOperator*>(mPoller.get()),
                                  static_cast<KelvoOperator*>(mGpu.get())}) {
            ASSERT_EQ(0, op->earlyInitialize());
            op->initialize();
        }
        ASSERT_TRUE(waitFor([&] { return mDriver.state().gpuSteps.empty(); }));
    }
    void TearDown() override {
        for (const sp<KelvoOperator>& op :
             std::vector<sp<KelvoOperator>>{mRoutine.get(), mPoller.get(), mGpu.get()}) {
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        AppsAccounting::getInstance()->balanceAccount();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
        WallClock::setFixedTimeMs(-1);
        mDriver.stop();
        test::AgentStorageTest::TearDown();
    }
    int32_t notify(int32_t type, const Parcel& body) {
        return mGpu->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, body));
    }
    void foreground(int64_t dt, const char* name) {
        Parcel p;
        p.writeInt64(kT + dt);
        p.writeString8(android::String8(name));
        notify(NOTIFICATION_FOREGROUND_CHANGED, p);
    }
    void screen(int64_t dt, bool on) {
        Parcel p;
        p.writeInt64(kT + dt);
        p.writeBool(on);
        notify(NOTIFICATION_SCREEN_STATE_CHANGED, p);
    }
    void poll(int64_t dt, int32_t reason = POLLING_PERIODIC) {
        PollingPayload poll;
        poll.reason = reason;
        poll.time = poll.hour = kT + dt;
        Parcel body;
        poll.writeTo(body);
        notify(NOTIFICATION_DATA_POLLING, body);
    }
    void tick(int64_t hour) {
        const std::string ticks = "SELECT id FROM debug_hourly_tick";
        size_t before = rows(ticks).size();
        WallClock::setFixedTimeMs(hour + 500);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
        ASSERT_TRUE(
            waitFor([&] { return rows(ticks).size() > before; }, std::chrono::milliseconds(15000)));
    }
    std::vector<std::string> charged() {
        return rows(
            "SELECT name, SUM(usage), SUM(energy) FROM raw_applications_gpu WHERE "
            "energy > 0 GROUP BY name");
    }

    Driver mDriver;
    sp<HourlyRoutine> mRoutine;
    sp<Poller> mPoller;
    sp<GpuHandler> mGpu;
};

// com.a in front, then com.b, then the screen off: readings at the poll and
// at each change. A timer poll with the screen off reads nothing; the hourly
// poll reads (for "screen_off"), balances and votes. The hour's rows leave
// "screen_off" out; the day's frequency distribution is an event of its own.
TEST_F(GpuHandlerTest, ReadingsThroughTheHourAndDay) {
    EXPECT_TRUE(mDriver.state().flags[KelvoDevice::kSetGpuEnable]);
    foreground(0, "com.a");
    screen(0, true);
    mDriver.addGpuResidency(kLow, 2000000, 1000000);
    mDriver.addGpuResidency(kHigh, 1000000, 0);
    poll(60000);
    mDriver.addGpuResidency(kHigh, 4000000, 0);
    foreground(120000, "com.b");
    mDriver.addGpuResidency(kLow, 1000000, 0);
    screen(180000, false);
    foreground(180000, "screen_off");
    mDriver.addGpuResidency(kLow, 3000000, 0);
    poll(240000);
    EXPECT_EQ(1u, mDriver.state().gpuSteps.size());  // not read
    auto started = std::chrono::steady_clock::now();
    tick(kH);
    EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(10));
    EXPECT_TRUE(mDriver.state().gpuSteps.empty());

    EXPECT_EQ((std::vector<std::string>{"com.a|7000|1290", "com.b|1000|120", "screen_off|3000|360"}),
              charged());
    EXPECT_EQ((std::vector<std::string>{"com.a|7000|1290", "com.b|1000|120"}),
              rows("SELECT name, usage, energy FROM hourly_applications_gpu ORDER BY name"));
    EXPECT_EQ(std::vector<std::string>{"8000|1410"},
              rows("SELECT usage, energy FROM hourly_component_gpu"));
    AppsAccounting::getInstance()->balanceAccount();
    EXPECT_EQ((std::vector<std::string>{"com.a|1290", "com.b|120"}),
              rows("SELECT name, foreground_energy FROM hourly_applications_accounting WHERE "
                   "component = 8 ORDER BY name"));
    Json::Value hourly, daily, frequencies;
    for (const Json::Value& e : events())
        if (e["event"].asUInt() == EVENT_HOURLY_COMPONENTS) hourly = e["params"];
    EXPECT_EQ(8000, hourly["12"]["params"]["5"].asInt64());
    EXPECT_EQ(1410, hourly["12"]["params"]["0"].asInt64());
    ASSERT_EQ(2u, hourly["13"].size());
    EXPECT_EQ("com.a", hourly["13"][0]["params"]["3"]["params"]["0"].asString());

    Parcel day;
    day.writeFloat(1.0f);
    day.writeInt64(kH);
    notify(NOTIFICATION_DAILY_UPLOADING, day);
    DataUploader::getInstance()->uploadEvent();
    for (const Json::Value& e : events()) {
        if (e["event"].asUInt() == EVENT_DAILY_COMPONENTS) daily = e["params"];
        if (e["event"].asUInt() == EVENT_DAILY_SYSTEM) frequencies = e["params"];
    }
    EXPECT_EQ(8000, daily["12"]["params"]["1"].asInt64());
    EXPECT_FALSE(daily.isMember("14") || frequencies.isMember("12") || frequencies.isMember("13"));
    ASSERT_EQ(2u, frequencies["14"].size());
    EXPECT_EQ(kLow, frequencies["14"][0]["params"]["1"].asInt64());
    EXPECT_EQ(6000, frequencies["14"][0]["params"]["3"].asInt64());
    EXPECT_EQ(1000, frequencies["14"][0]["params"]["4"].asInt64());
    EXPECT_EQ(5000, frequencies["14"][1]["params"]["3"].asInt64());
}

// A reading that fails or is refused at com.a's leaving: the change still
// goes through, so com.b's reading is charged to com.b. Bad steps alone are
// dropped.
struct ReadingCase {
    const char* name;
    std::function<void(Driver&)> arrange;
    std::vector<std::string> charged;
    uint64_t refused;
    friend void PrintTo(const ReadingCase& c, std::ostream* os) { *os << c.name; }
};

class GpuReadingTest : public GpuHandlerTest, public ::testing::WithParamInterface<ReadingCase> {};

TEST_P(GpuReadingTest, ForegroundChangeSurvivesTheReading) {
    const uint64_t refused = HealthCounters::get(Health::DeviceAnswersRefused);
    foreground(0, "com.a");
    GetParam().arrange(mDriver);
    foreground(60000, "com.b");
    mDriver.clearFailures();
    mDriver.update([](Driver::State& s) { s.gpuCount.reset(); });
    mDriver.addGpuResidency(kHigh, 1000000, 0);
    poll(120000, POLLING_HOURLY_TICK);
    EXPECT_EQ(HealthCounters::get(Health::DeviceAnswersRefused), refused + GetParam().refused);
    EXPECT_EQ(GetParam().charged, charged());
}

INSTANTIATE_TEST_SUITE_P(
    Readings, GpuReadingTest,
    ::testing::Values(ReadingCase{"count_21",
                                  [](Driver& d) { d.update([](auto& s) { s.gpuCount = 21; }); },
                                  {"com.b|1000|210"},
                                  1},
                      ReadingCase{"count_minus_1",
                                  [](Driver& d) { d.update([](auto& s) { s.gpuCount = -1; }); },
                                  {"com.b|1000|210"},
                                  1},
                      ReadingCase{"count_0",
                                  [](Driver& d) { d.update([](auto& s) { s.gpuCount = 0; }); },
                                  {"com.b|1000|210"},
                                  0},
                      ReadingCase{"device_fails",
                                  [](Driver& d) {
                                      d.failRequest(Driver::Device::Kelvo, KelvoDevice::kGetGpuInfo,
                                                    EIO);
                                  },
                                  {"com.b|1000|210"},
                                  0},
                      ReadingCase{"bad_steps",
                                  [](Driver& d) {
                                      d.addGpuResidency(0, 1000000, 0);
                                      d.addGpuResidency(kHigh, -1, 0);
                                      d.addGpuResidency(kLow, 1000000, -1);
                                      d.addGpuResidency(360000000, 1000000, 0);
                                  },
                                  {"com.a|1000|160", "com.b|1000|210"},
                                  3}),
    [](const ::testing::TestParamInfo<ReadingCase>& i) { return i.param.name; });

}  // namespace
