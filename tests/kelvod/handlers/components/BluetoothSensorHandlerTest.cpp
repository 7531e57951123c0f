// The Bluetooth and sensor handlers end to end: records written to the log
// device, notices of the audio and system handlers, the accounting library
// with the sample profile, the real hourly routine, rows and uploads.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include <algorithm>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "KelvoLibEntry.h"
#include "PlatformServices.h"
#include "binder/managers/PackageManager.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/BluetoothHandler.h"
#include "handlers/components/SensorHandler.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "kelvo/ZendrelHost.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "storage/DataUploader.h"
#include "utils/PackageProperty.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using android::String8;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kH = 1796515200000LL + 10 * kHour;  // 2026-12-06 10:00 UTC
constexpr int64_t kT = kH - 20 * 60000;

class RadioSensorTest : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        WallClock::setFixedTimeMs(kT);
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         kelvo::test::readHostFile(KELVO_SAMPLE_CONFIG));
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        Dispatcher::resetForTest();
        HourlyRoutine::setVoteTimeoutMs(0);  // the full minute
        ServiceControl::setServiceWaitMs(300);
        mServices.reset(new PlatformServices());
        ASSERT_EQ(android::NO_ERROR, mServices->startAll());
        mServices->state()->setPackages(10010, {"com.a"});
        PackageProperty::getInstance()->removeUid(10010);
        mRoutine = new HourlyRoutine();
        mBt = new BluetoothHandler();
        mSensor = new SensorHandler();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mBt.get()),
                                    static_cast<StorageOperator*>(mSensor.get()),
                                    static_cast<StorageOperator*>(AppsAccounting::getInstance()),
                                    static_cast<StorageOperator*>(DataUploader::getInstance())}) {
            op->addSchemaTable();
        }
    }
    void SetUp() override {
        kelvo::test::AgentStorageTest::SetUp();
        mRoutine->earlyInitialize();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        mRoutine->initialize();
        for (KelvoOperator* op :
             {static_cast<KelvoOperator*>(mBt.get()), static_cast<KelvoOperator*>(mSensor.get())}) {
            ASSERT_EQ(0, op->earlyInitialize());
            op->initialize();
        }
        ASSERT_EQ(0, Dispatcher::getInstance()->startDispatchMessage());
        mWriter.reset(new LogWriter(RootPath::resolve(KELVO_LOG_DEVICE)));
    }
    void TearDown() override {
        ZendrelHost::clearFailures();
        mWriter.reset();
        Dispatcher::resetForTest();
        for (const sp<KelvoOperator>& op :
             std::vector<sp<KelvoOperator>>{mRoutine.get(), mBt.get(), mSensor.get()}) {
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        AppsAccounting::getInstance()->balanceAccount();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
        WallClock::setFixedTimeMs(-1);
        mServices.reset();
        EXPECT_TRUE(waitFor([] { return !PackageManager::getInstance()->isConnected(); }));
        ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs);
        kelvo::test::AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }

    void notify(KelvoOperator* op, int32_t type, int64_t time) {
        Parcel p;
        p.writeInt64(time);
        op->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, p));
    }
    // Plays steps a second apart from kT; each writes one row of `states`
    // unless it starts with "=". A step is a log record "TAG text", a
    // notice "!CODE a b c" (int64 time, then "a" as text and b as bool for
    // Bluetooth, or a sleep of b ms from a for the sensors), or "vmdied".
    // Ends with a forced balance a minute after the last step.
    int64_t play(KelvoOperator* op, const std::vector<std::string>& steps,
                 const std::string& states) {
        int64_t t = kT;
        size_t expected = 0;
        for (std::string step : steps) {
            t += 1000;
            const bool writes = step[0] != '=';
            if (!writes) step = step.substr(1);
            std::istringstream in(step);
            std::string word;
            in >> word;
            if (word == "vmdied") {
                notify(op, NOTIFICATION_VM_DIED, t);
            } else if (word[0] == '!') {
                Parcel p;
                std::string a;
                int64_t b = 0;
                in >> a >> b;
                if (op == mSensor.get()) {
                    p.writeInt64(t);
                    p.writeInt64(t + b);
                    t += std::max<int64_t>(b, 0);
                } else {
                    p.writeInt64(t);
                    p.writeString8(String8(a.c_str()));
                    p.writeBool(b != 0);
                }
                op->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, std::stoi(word.substr(1)), p));
            } else {
                std::string text;
                std::getline(in >> std::ws, text);
                EXPECT_EQ(0,
                          mWriter->write(LogWriter::PRIORITY_INFO, word.c_str(), text.c_str(), t));
            }
            if (writes) ++expected;
            // Log records arrive on their own thread: let them in before
            // the next notice.
            EXPECT_TRUE(waitFor([&] { return rows("SELECT 1 FROM " + states).size() >= expected; }))
                << step;
        }
        notify(op, NOTIFICATION_FORCE_BALANCE, t + 60000);
        EXPECT_EQ(expected, rows("SELECT 1 FROM " + states).size());
        return t;
    }
    void tick(int64_t hour) {
        const std::string ticks = "SELECT id FROM debug_hourly_tick";
        size_t before = rows(ticks).size();
        WallClock::setFixedTimeMs(hour + 500);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
        // Within the vote time-out: every member voted.
        ASSERT_TRUE(
            waitFor([&] { return rows(ticks).size() > before; }, std::chrono::milliseconds(15000)));
    }

    sp<HourlyRoutine> mRoutine;
    sp<BluetoothHandler> mBt;
    sp<SensorHandler> mSensor;
    std::unique_ptr<LogWriter> mWriter;
    std::unique_ptr<PlatformServices> mServices;
};

struct StepsCase {
    const char* name;
    std::vector<std::string> steps;
    // "type|name|charged ms" of the raw application rows, summed.
    std::vector<std::string> charged;
    friend void PrintTo(const StepsCase& c, std::ostream* os) { *os << c.name; }
};
std::string caseName(const ::testing::TestParamInfo<StepsCase>& info) {
    return info.param.name;
}
const char* kChargedSql =
    "SELECT type, name, SUM(background_duration) FROM %s GROUP BY type, name ORDER BY type, name";

class BluetoothActivityTest : public RadioSensorTest,
                              public ::testing::WithParamInterface<StepsCase> {};

TEST_P(BluetoothActivityTest, EachActivityIsChargedToItsUser) {
    play(mBt.get(), GetParam().steps, "raw_bluetooth_state");
    EXPECT_EQ(GetParam().charged,
              rows(String8::format(kChargedSql, "raw_applications_bluetooth").c_str()));
}

INSTANTIATE_TEST_SUITE_P(
    Steps, BluetoothActivityTest,
    ::testing::Values(
        StepsCase{"discovery_unknown_package",
                  {"KELVO_TAG_BT_DISCOVERY_START uid=10099 pid=4",
                   "=KELVO_TAG_BT_DISCOVERY_START uid=10010 pid=4",  // already on
                   "KELVO_TAG_BT_DISCOVERY_STOP", "KELVO_TAG_BT_DISCOVERY_START uid=abc pid=4",
                   "KELVO_TAG_BT_DISCOVERY_STOP", "=KELVO_TAG_BT_DISCOVERY_STOP"},
                  {"0|Unknow package|3000"}},
        StepsCase{"discovery_known_package",
                  {"KELVO_TAG_BT_DISCOVERY_START uid=10010 pid=4", "KELVO_TAG_BT_DISCOVERY_STOP"},
                  {"0|com.a|1000"}},
        // The stop ends the sending transfer: receiving while on is no change.
        StepsCase{"tx_then_rx_while_on",
                  {"KELVO_TAG_BT_TRANSFER_TX_START", "=KELVO_TAG_BT_TRANSFER_RX_START",
                   "KELVO_TAG_BT_TRANSFER_STOP", "KELVO_TAG_BT_TRANSFER_RX_START",
                   "KELVO_TAG_BT_TRANSFER_STOP"},
                  {"1|com.android.settings|2000", "2|com.android.settings|1000"}},
        // Every notice is a row; the charge ends with the last session.
        StepsCase{"two_media_sessions_of_one_app",
                  {"!0 com.m 1", "!0 com.m 1", "!0 com.m 0", "!0 com.m 0", "!0 com.m 0"},
                  {"3|com.m|3000"}},
        StepsCase{"phone_off_under_another_name",
                  {"!1 com.android.incallui 1", "=!1 com.android.incallui 1", "!1 com.other 0"},
                  {"4|com.android.incallui|2000"}},
        // After the accounter dropped everything, a start is charged again.
        StepsCase{"vm_death_then_start",
                  {"KELVO_TAG_BT_DISCOVERY_START uid=10010 pid=4", "=vmdied",
                   "KELVO_TAG_BT_DISCOVERY_START uid=10010 pid=4", "KELVO_TAG_BT_DISCOVERY_STOP",
                   "!1 com.android.incallui 1", "=vmdied", "!1 com.android.incallui 1",
                   "!1 com.android.incallui 0"},
                  {"0|com.a|2000", "4|com.android.incallui|2000"}}),
    caseName);

class SensorTest : public RadioSensorTest, public ::testing::WithParamInterface<StepsCase> {};

TEST_P(SensorTest, SensorsAreChargedWhileEnabledAndAwake) {
    play(mSensor.get(), GetParam().steps, "raw_sensor_state");
    EXPECT_EQ(GetParam().charged,
              rows(String8::format(kChargedSql, "raw_applications_sensor").c_str()));
}

#define EN "KELVO_TAG_SENSOR_ENABLE uid=10010 "
#define DIS "KELVO_TAG_SENSOR_DISABLE uid=10010 "
INSTANTIATE_TEST_SUITE_P(
    Steps, SensorTest,
    ::testing::Values(
        StepsCase{"enable_twice_disable_once",
                  {EN "name=com.a type=1 connection=c1", EN "name=com.a type=1 connection=c1",
                   DIS "name=com.a type=1 connection=c1",
                   "=KELVO_TAG_SENSOR_ENABLE uid=abc name=com.a type=1 connection=c1",
                   "=" EN "name=com.a type=x connection=c1", "=" EN "name=com.a type=1"},
                  {"1|com.a|2000"}},
        StepsCase{"type_minus_one_ends_every_type",
                  {EN "name=com.a type=1 connection=c1", EN "name=com.a type=4 connection=c1",
                   EN "name=com.a type=4 connection=c2", DIS "name=com.a type=-1 connection=c1",
                   DIS "name=com.a type=4 connection=c2"},
                  {"1|com.a|3000", "4|com.a|4000"}},
        // Asleep a minute: the two users of type 1 and the one of type 4
        // are charged their awake time, the wake-up type 19 the sleep too;
        // the system's own name keeps its connection.
        StepsCase{"resume_cuts_the_sleep",
                  {EN "name=com.a type=1 connection=c1", EN "name=android type=1 connection=c9",
                   EN "name=com.a type=4 connection=c1", EN "name=com.a type=19 connection=c1",
                   "=!0 x 60000", "=!0 x -5", DIS "name=com.a type=-1 connection=c1",
                   DIS "name=android type=1 connection=c9"},
                  {"1|android|c9|6000", "1|com.a|6000", "4|com.a|4000", "19|com.a|63000"}},
        // Dead connections are not revised back to life.
        StepsCase{"vm_death_then_resume",
                  {EN "name=com.a type=1 connection=c1", "=vmdied", "=!0 x 60000"},
                  {"1|com.a|1000"}}),
    caseName);

// An hour of both: the hourly rows by name and type, the component rows
// with the longest row's durations, the uploads; then an hour whose upload
// cannot be handed over still ends its round.
TEST_F(RadioSensorTest, HourlyRowsAndUploads) {
    LogCapture capture;
    auto log = [&](const char* tag, const char* text, int64_t t) {
        ASSERT_EQ(0, mWriter->write(LogWriter::PRIORITY_INFO, tag, text, t));
    };
    log("KELVO_TAG_BT_DISCOVERY_START", "uid=10010 pid=4", kT);
    log("KELVO_TAG_BT_DISCOVERY_STOP", "", kT + 60000);
    log("KELVO_TAG_BT_TRANSFER_RX_START", "", kT);
    log("KELVO_TAG_BT_TRANSFER_STOP", "", kT + 120000);
    log("KELVO_TAG_SENSOR_ENABLE", "uid=10010 name=com.a type=1 connection=c1", kT);
    log("KELVO_TAG_SENSOR_ENABLE", "uid=10010 name=com.a type=4 connection=c1", kT);
    log("KELVO_TAG_SENSOR_DISABLE", "uid=10010 name=com.a type=-1 connection=c1", kT + 30000);
    ASSERT_TRUE(waitFor([&] {
        return rows("SELECT 1 FROM raw_bluetooth_state").size() == 4 &&
               rows("SELECT 1 FROM raw_sensor_state").size() == 3;
    }));
    tick(kH);
    const std::string h = std::to_string(kH);
    EXPECT_EQ((std::vector<std::string>{h + "|com.a|0|60000|720",
                                        h + "|com.android.settings|2|120000|1080"}),
              rows("SELECT timestamp, name, type, background_duration, background_energy FROM "
                   "hourly_applications_bluetooth ORDER BY name"));
    EXPECT_EQ((std::vector<std::string>{"1|com.a|30000|6", "4|com.a|30000|180"}),
              rows("SELECT type, name, background_duration, background_energy FROM "
                   "hourly_applications_sensor ORDER BY type"));
    // Overlapping rows: the longest one's time, every row's energy.
    EXPECT_EQ(std::vector<std::string>{"120000|1800"},
              rows("SELECT background_duration, background_energy FROM "
                   "hourly_component_bluetooth"));
    EXPECT_EQ(std::vector<std::string>{"30000|186"},
              rows("SELECT background_duration, background_energy FROM hourly_component_sensor"));
    Json::Value p;
    for (const Json::Value& e : events()) {
        if (e["event"].asUInt() == EVENT_HOURLY_COMPONENTS) p = e["params"];
    }
    EXPECT_EQ(120000, p["27"]["params"]["7"].asInt64());
    EXPECT_EQ("com.android.settings", p["28"][0]["params"]["3"]["params"]["0"].asString());
    EXPECT_EQ(30000, p["11"][0]["params"]["1"]["params"]["7"].asInt64());
    EXPECT_EQ(186, p["10"]["params"]["6"].asInt64());

    ZendrelHost::failCall(ZendrelHost::CALL_CREATE, EVENT_HOURLY_COMPONENTS);
    log("KELVO_TAG_BT_DISCOVERY_START", "uid=10010 pid=4", kH + 1000);
    log("KELVO_TAG_BT_DISCOVERY_STOP", "", kH + 2000);
    log("KELVO_TAG_SENSOR_ENABLE", "uid=10010 name=com.a type=1 connection=c1", kH + 1000);
    log("KELVO_TAG_SENSOR_DISABLE", "uid=10010 name=com.a type=1 connection=c1", kH + 2000);
    ASSERT_TRUE(waitFor([&] {
        return rows("SELECT 1 FROM raw_bluetooth_state").size() == 6 &&
               rows("SELECT 1 FROM raw_sensor_state").size() == 5;
    }));
    tick(kH + kHour);
    EXPECT_TRUE(capture.contains("Failed to set bluetooth upload data"));
    EXPECT_TRUE(capture.contains("Failed to set sensor upload data"));

    // The day adds up each hour's longest row: 30 s, then 1 s.
    ZendrelHost::clearFailures();
    Parcel day;
    day.writeFloat(1.0f);
    day.writeInt64(kH + kHour);
    mSensor->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_DAILY_UPLOADING, day));
    DataUploader::getInstance()->uploadEvent();
    for (const Json::Value& e : events()) {
        if (e["event"].asUInt() == EVENT_DAILY_COMPONENTS) p = e["params"];
    }
    EXPECT_EQ(31000, p["11"][0]["params"]["1"]["params"]["7"].asInt64());
}

}  // namespace
