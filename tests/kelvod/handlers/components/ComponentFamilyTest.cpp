// The GNSS and flashlight handlers end to end: records written to the log
// device, the accounting library with the sample profile (GNSS 35, flashlight
// 180 per second), the real hourly routine, rows read from the database and
// uploads from the events file.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include <chrono>
#include <memory>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "PlatformServices.h"
#include "binder/managers/PackageManager.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/FlashlightHandler.h"
#include "handlers/components/GnssHandler.h"
#include "kelvo/LogDeviceReader.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
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
// 2026-12-06 10:00 UTC: an hour boundary away from the daily and dawn rounds.
constexpr int64_t kH = 1796515200000LL + 10 * kHour;
constexpr int64_t kT = kH - 20 * 60000;

// " HH:00" of an hour in UTC, as upload windows show it.
std::string hourText(int64_t hour) {
    char text[8];
    snprintf(text, sizeof(text), " %02d:00", static_cast<int>(hour % (24 * kHour) / kHour));
    return text;
}

class FamilyTest : public kelvo::test::AgentStorageTest {
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
        mServices->state()->setPackages(10020, {"com.b"});
        for (int32_t uid : {10010, 10020}) PackageProperty::getInstance()->removeUid(uid);
        mRoutine = new HourlyRoutine();
        mGnss = new GnssHandler();
        mFlash = new FlashlightHandler();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mGnss.get()),
                                    static_cast<StorageOperator*>(mFlash.get()),
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
        for (KelvoOperator* op : {static_cast<KelvoOperator*>(mGnss.get()),
                                  static_cast<KelvoOperator*>(mFlash.get())}) {
            ASSERT_EQ(0, op->earlyInitialize());
            op->initialize();
        }
        ASSERT_EQ(0, Dispatcher::getInstance()->startDispatchMessage());
        mWriter.reset(new LogWriter(RootPath::resolve(KELVO_LOG_DEVICE)));
    }
    void TearDown() override {
        mWriter.reset();
        Dispatcher::resetForTest();
        for (const sp<KelvoOperator>& op : operators()) {
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        // The process-wide accounting keeps what it was given: into this
        // test's database, not the next one's.
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
    std::vector<sp<KelvoOperator>> operators() {
        return {mRoutine.get(), mGnss.get(), mFlash.get()};
    }

    void log(const char* tag, const char* text, int64_t time) {
        ASSERT_EQ(0, mWriter->write(LogWriter::PRIORITY_INFO, tag, text, time));
    }
    // Runs the round of the hour `hour` to its end.
    void tick(int64_t hour) {
        const std::string ticks = "SELECT id FROM debug_hourly_tick";
        size_t before = rows(ticks).size();
        WallClock::setFixedTimeMs(hour + 500);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
        ASSERT_TRUE(
            waitFor([&] { return rows(ticks).size() > before; }, std::chrono::milliseconds(15000)));
    }
    // The parameters of the hourly component upload of the hour.
    Json::Value hourlyUpload(int64_t hour) {
        for (const Json::Value& e : events()) {
            if (e["event"].asUInt() == EVENT_HOURLY_COMPONENTS &&
                e["params"]["1"].asString().find(hourText(hour)) != std::string::npos) {
                return e["params"];
            }
        }
        return Json::Value();
    }

    sp<HourlyRoutine> mRoutine;
    sp<GnssHandler> mGnss;
    sp<FlashlightHandler> mFlash;
    std::unique_ptr<LogWriter> mWriter;
    std::unique_ptr<PlatformServices> mServices;
};

// One minute of GNSS by an application with a 208-character name, ten
// seconds of flashlight: the raw row and the profile's energy, the hour's
// rows, the applications accounting, the upload, a round ending on its last
// vote, then an idle hour that writes nothing.
TEST_F(FamilyTest, GnssAndFlashlightThroughTheHour) {
    LogCapture capture;
    const uint64_t refused = HealthCounters::get(Health::LoggerMessageRefused);
    const std::string nav = "com.nav." + std::string(200, 'n');
    log("KELVO_TAG_GNSS_START", "uid=3", kT);  // no name: nothing starts
    log("KELVO_TAG_GNSS_START", ("name=" + nav).c_str(), kT);
    log("KELVO_TAG_GNSS_STOP", ("name=" + nav).c_str(), kT + 60000);
    log("KELVO_TAG_TORCH_CONNECT", "uid=10010 pid=7", kT);
    log("KELVO_TAG_FLASHLIGHT_ON", "", kT + 1000);
    log("KELVO_TAG_FLASHLIGHT_OFF", "", kT + 11000);
    const std::string raw =
        "SELECT name, start_time, end_time, background_duration, "
        "background_energy FROM raw_applications_gnss";
    ASSERT_TRUE(waitFor([&] {
        return rows(raw).size() == 1 && rows("SELECT id FROM raw_applications_flashlight").size();
    }));
    const std::string from = std::to_string(kT), to = std::to_string(kT + 60000);
    EXPECT_EQ(std::vector<std::string>{nav + "|" + from + "|" + to + "|60000|2100"}, rows(raw));
    EXPECT_TRUE(capture.contains("Failed to parse name: -11"));
    EXPECT_EQ(refused + 1, HealthCounters::get(Health::LoggerMessageRefused));

    // Both members vote for every step: the round never waits for the
    // one-minute vote time-out.
    auto started = std::chrono::steady_clock::now();
    tick(kH);
    EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(10));
    const std::string h = std::to_string(kH);
    EXPECT_EQ(std::vector<std::string>{h + "|" + nav + "|60000|2100|60000|2100"},
              rows("SELECT timestamp, name, background_duration, background_energy, "
                   "screen_on_duration, screen_on_energy FROM hourly_applications_gnss"));
    EXPECT_EQ(std::vector<std::string>{h + "|60000|2100"},
              rows("SELECT timestamp, background_duration, background_energy "
                   "FROM hourly_component_gnss"));
    // The flashlight has no component table: its hourly application rows.
    EXPECT_EQ(std::vector<std::string>{h + "|10000|1800"},
              rows("SELECT timestamp, background_duration, background_energy "
                   "FROM hourly_component_flashlight"));
    EXPECT_EQ((std::vector<std::string>{"com.a|6|1800", nav + "|7|2100"}),
              rows("SELECT name, component, background_energy "
                   "FROM hourly_applications_accounting ORDER BY component"));
    Json::Value p = hourlyUpload(kH);
    EXPECT_EQ(60000, p["8"]["params"]["7"].asInt64());
    EXPECT_EQ(2100, p["8"]["params"]["6"].asInt64());
    EXPECT_FALSE(p["8"]["params"].isMember("5"));  // no foreground time: no pair
    ASSERT_EQ(1u, p["9"].size());
    EXPECT_EQ(nav.substr(0, 100), p["9"][0]["params"]["3"]["params"]["0"].asString());
    EXPECT_EQ(2100, p["9"][0]["params"]["1"]["params"]["6"].asInt64());
    EXPECT_EQ(10000, p["18"]["params"]["7"].asInt64());
    EXPECT_EQ("com.a", p["19"][0]["params"]["3"]["params"]["0"].asString());

    // An idle hour: no all-zero rows, no component class, no applications.
    tick(kH + kHour);
    EXPECT_EQ(std::vector<std::string>{h},
              rows("SELECT timestamp FROM hourly_component_gnss UNION ALL "
                   "SELECT timestamp FROM hourly_applications_gnss WHERE timestamp > " +
                   h +
                   " UNION ALL SELECT timestamp FROM hourly_component_flashlight WHERE "
                   "timestamp > " +
                   h));
    p = hourlyUpload(kH + kHour);
    EXPECT_FALSE(p.isMember("8") || p.isMember("9") || p.isMember("18"));
}

// A scenario of flashlight records ("on", "off", "torch uid=..",
// "camera NAME") a second apart from kT, then a forced balance a minute
// later; the state rows it writes and the raw rows (name|duration) it leaves.
struct FlashCase {
    const char* name;
    std::vector<std::string> steps;
    size_t states;
    std::vector<std::string> charged;
    friend void PrintTo(const FlashCase& c, std::ostream* os) { *os << c.name; }
};

class FlashlightUsersTest : public FamilyTest, public ::testing::WithParamInterface<FlashCase> {};

TEST_P(FlashlightUsersTest, EachOnPeriodIsChargedToItsUser) {
    const FlashCase& c = GetParam();
    int64_t t = kT;
    for (const std::string& step : c.steps) {
        t += 1000;
        if (step == "on" || step == "off") {
            log(step == "on" ? "KELVO_TAG_FLASHLIGHT_ON" : "KELVO_TAG_FLASHLIGHT_OFF", "", t);
        } else if (step.rfind("torch ", 0) == 0) {
            log("KELVO_TAG_TORCH_CONNECT", step.substr(6).c_str(), t);
        } else {
            Parcel user;
            user.writeString8(String8(step.substr(7).c_str()));
            mFlash->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, 0, user));
        }
    }
    // Every real change writes a state row: once they are in, all records
    // were handled.
    const std::string states = "SELECT state FROM raw_flashlight_state";
    ASSERT_TRUE(waitFor([&] { return rows(states).size() >= c.states; }));
    Parcel balance;
    balance.writeInt64(t + 60000);
    mFlash->sendMessageSync(
        ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_FORCE_BALANCE, balance));
    EXPECT_EQ(c.charged, rows("SELECT name, background_duration FROM raw_applications_flashlight "
                              "ORDER BY id"));
    EXPECT_EQ(c.states, rows(states).size());
}

INSTANTIATE_TEST_SUITE_P(
    Users, FlashlightUsersTest,
    ::testing::Values(
        FlashCase{"torch_user", {"torch uid=10010 pid=7", "on", "off"}, 2, {"com.a|1000"}},
        FlashCase{"camera_user", {"camera com.cam", "on", "off"}, 2, {"com.cam|1000"}},
        // Nobody known at on: that period charges nobody, the user
        // learnt meanwhile takes the next one.
        FlashCase{"learnt_while_on",
                  {"on", "torch uid=10020 pid=7", "off", "on", "off"},
                  4,
                  {"com.b|1000"}},
        // A repeated on is no change (no state row, no hand-over),
        // and off ends A's period: nobody is charged up to the balance.
        FlashCase{"repeated_on",
                  {"torch uid=10010 pid=7", "on", "torch uid=10020 pid=7", "on", "off"},
                  2,
                  {"com.a|3000"}},
        // Not a number: refused, not read as uid 0 or a stale uid.
        FlashCase{"uid_not_a_number", {"torch uid=abc pid=7", "on", "off"}, 2, {}}),
    [](const ::testing::TestParamInfo<FlashCase>& info) { return info.param.name; });

// The data-source policy of a governed member: read from the configuration,
// accepted per member, 1 when it cannot be read.
class GovernedMember : public ComponentHandler {
public:
    explicit GovernedMember(std::vector<int32_t> accepted)
        : ComponentHandler("GovernedMember", -1, 0x4, {&GnssHandler::family()},
                           {POLICY_CAMERA, "Camera", std::move(accepted)}) {}
};

TEST(ComponentPolicyTest, PolicyAcceptedPerMember) {
    struct Case {
        const char* config;  // camera policy element, "" for none
        std::vector<int32_t> accepted;
        int32_t enabled, policy;
    } cases[] = {
        {"2", {1}, -2, 2},
        {"2", {1, 2}, 0, 2},
        {"1", {1}, 0, 1},
        {"", {1}, 0, 1},  // unreadable: the default
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.config) + " " + std::to_string(c.accepted.size()));
        kelvo::test::TempRoot root;
        std::string element = std::string("<element id=\"2\"><component id=\"5\"><parameter>") +
                              c.config + "</parameter></component></element>";
        root.writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                       "<kelvo_config>" + (c.config[0] ? element : "") + "</kelvo_config>");
        XmlParser::resetInstance();
        LogCapture capture;
        sp<GovernedMember> member = new GovernedMember(c.accepted);
        EXPECT_EQ(c.enabled, member->earlyInitialize());
        EXPECT_EQ(c.policy, member->getPolicy());
        EXPECT_EQ(c.enabled < 0, capture.contains("Camera is not supported: 2"));
        member->requestThreadExit();
        member->join();
    }
    XmlParser::resetInstance();
}

// A two-value member (duration, energy) without a component table: a query
// filter, its own ranking and energy-class pairs, all as parameters.
const column_attribute kTwoRaw[] = {{COLUMN_TIME, "start_time"},
                                    {COLUMN_TIME, "end_time"},
                                    {COLUMN_TEXT, "name"},
                                    {COLUMN_INT, "duration"},
                                    {COLUMN_LONG, "energy"}};
const column_attribute kTwoApps[] = {{COLUMN_TIME, "timestamp"},
                                     {COLUMN_TEXT, "name"},
                                     {COLUMN_INT, "duration"},
                                     {COLUMN_LONG, "energy"}};
const column_attribute kTwoComponent[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "duration"}, {COLUMN_LONG, "energy"}};
const table_attribute kTwoRawTable = {"1.0", 1, 5, kTwoRaw, "raw_applications_two"};
const table_attribute kTwoAppsTable = {"1.0", 1, 4, kTwoApps, "hourly_applications_two"};
const table_attribute kTwoComponentTable = {"1.0", 1, 3, kTwoComponent, "hourly_component_two"};
const upload_pair kTwoPairs[] = {{0, 1, 5, 4}};
component_family twoFamily() {
    component_family f = {
        "two", &kTwoRawTable, nullptr, &kTwoAppsTable, &kTwoComponentTable, APPS_GPU, 12, 13};
    f.uploadPairs = kTwoPairs;
    f.uploadPairCount = 1;
    f.compensationValues[1] = -1;  // the energy alone
    f.filter = "name != 'screen_off'";
    f.rankBy = "SUM(energy)";
    return f;
}
const component_family kTwo = twoFamily();

class TwoValueTest : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        mMember = new ComponentHandler("TwoValueMember", -1, 0x800, {&kTwo});
        mMember->addSchemaTable();
        DataUploader::getInstance()->addSchemaTable();
    }
    void TearDown() override {
        mMember->requestThreadExit();
        mMember->join();
        kelvo::test::AgentStorageTest::TearDown();
    }
    sp<ComponentHandler> mMember;
};

TEST_F(TwoValueTest, VariantsAreParameters) {
    Parcel raw;
    for (auto [name, duration, energy] :
         {std::tuple<const char*, int32_t, int64_t>{"com.a", 100, 50},
          {"screen_off", 1000, 500},
          {"com.b", 200, 10}}) {
        raw.writeInt64(kT);
        raw.writeInt64(kT + duration);
        raw.writeString8(String8(name));
        raw.writeInt32(duration);
        raw.writeInt64(energy);
    }
    ASSERT_EQ(0, StorageOperator::insertEntries(kTwoRawTable, raw, 3, false));
    Parcel at, upload;
    at.writeInt64(kH);
    upload.writeFloat(1.0f);
    upload.writeInt64(kH);
    for (auto [type, body] : {std::pair<int32_t, Parcel*>{NOTIFICATION_APPLICATIONS_ACCOUNTING, &at},
                              {NOTIFICATION_COMPONENT_ACCOUNTING, &at},
                              {NOTIFICATION_HOURLY_UPLOADING, &upload}}) {
        mMember->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, *body));
    }
    EXPECT_EQ((std::vector<std::string>{"com.a|100|50", "com.b|200|10"}),
              rows("SELECT name, duration, energy FROM hourly_applications_two ORDER BY name"));
    EXPECT_EQ(std::vector<std::string>{"300|60"},
              rows("SELECT duration, energy FROM hourly_component_two"));
    DataUploader::getInstance()->uploadEvent();
    ASSERT_FALSE(events().empty());
    Json::Value p = events().back()["params"];
    EXPECT_EQ(300, p["12"]["params"]["5"].asInt64());
    EXPECT_EQ(60, p["12"]["params"]["4"].asInt64());
    ASSERT_EQ(2u, p["13"].size());  // ranked by energy: com.a first
    EXPECT_EQ("com.a", p["13"][0]["params"]["3"]["params"]["0"].asString());
    EXPECT_EQ(10, p["13"][1]["params"]["1"]["params"]["4"].asInt64());
}

}  // namespace
