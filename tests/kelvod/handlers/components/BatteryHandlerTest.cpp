// The battery handler end to end: the simulator's power-supply files, the
// fake registrar's reports and the notifications in; spans, the hour's
// compensation, uploads and the drops the abnormality routine reports out.

#include <gtest/gtest.h>
#include <json/json.h>

#include <mutex>

#include "BatteryModel.h"
#include "FakeBatteryRegistrar.h"
#include "HealthCounters.h"
#include "PlatformState.h"
#include "binder/managers/BatteryListener.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "handlers/components/BatteryHandler.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/AbnormalityRoutine.h"
#include "storage/DataUploader.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kMidnight = 1796515200000LL;  // 2026-12-06 00:00 UTC
constexpr int64_t kH = kMidnight + 10 * kHour;
constexpr int64_t kT = kH - 4 * 60000;

// Stands in for the hourly routine or the system handler: "code:values"
// of each vote (code 0: the candidate), compensation (3: elector=energy) and
// miscellaneous record (2: name=value).
class Capture : public KelvoOperator {
public:
    Capture() : KelvoOperator("Capture", -1, 0) {}
    int32_t handleCustomized(int32_t code, const Parcel& d, Parcel*) override {
        if (code != 0 && code != 2 && code != 3) return 0;  // markers, electors
        int64_t time = d.readInt64();
        std::string s = std::to_string(code) + ":" + std::to_string(time - kT) + ":";
        if (code == 0) s += std::to_string(d.readInt32());
        if (code == 2) {
            s += d.readString8().string();
            s += std::string("=") + d.readString8().string();
        }
        if (code == 3) {
            s += std::to_string(d.readUint32());
            s += "=" + std::to_string(d.readInt64());
        }
        std::lock_guard<std::mutex> g(mLock);
        mGot += (mGot.empty() ? "" : " ") + s;
        return 0;
    }
    std::string got() {
        sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));
        std::lock_guard<std::mutex> g(mLock);
        return mGot;
    }

private:
    std::mutex mLock;
    std::string mGot;
};

class BatteryTest : public kelvo::test::AgentStorageTest {
protected:
    virtual bool micro() { return false; }
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        WallClock::setFixedTimeMs(kT);
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         kelvo::test::readHostFile(KELVO_SAMPLE_CONFIG));
        XmlParser::resetInstance();
        // 3000 mAh at 50 %; 10 mAh a minute either way, whatever the screen.
        BatteryModel::Config config;
        config.micro = micro();
        config.idleMa = 600;
        config.screenMa = 0;
        config.chargeMa = 1200;
        mModel.reset(new BatteryModel(mRoot->path(), config));
        ASSERT_TRUE(mModel->writeFiles());
        mBattery = new BatteryHandler();
        mBattery->addSchemaTable();
        mAbnormality = new AbnormalityRoutine();
        mAbnormality->addSchemaTable();
        DataUploader::getInstance()->addSchemaTable();
    }
    void SetUp() override {
        kelvo::test::AgentStorageTest::SetUp();
        ASSERT_EQ(0, mBattery->earlyInitialize());
        mHourly = new Capture();
        mSystem = new Capture();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mHourly);
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_SYSTEM, mSystem);
        ASSERT_EQ(0, mBattery->initialize());
    }
    void TearDown() override {
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_ABNORMALITY, nullptr);
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_SYSTEM, nullptr);
        mBattery->readyToDestroy();
        for (const sp<KelvoOperator>& op :
             {sp<KelvoOperator>(mBattery), sp<KelvoOperator>(mHourly), sp<KelvoOperator>(mSystem),
              sp<KelvoOperator>(mAbnormality)}) {
            if (op == nullptr) continue;
            op->requestThreadExit();
            op->join();
        }
        XmlParser::resetInstance();
        WallClock::setFixedTimeMs(-1);
        kelvo::test::AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }
    // A notification handled to its end at time t: an upload's ratio
    // first; then each value as the type carries it.
    void notify(int32_t type, int64_t t, std::vector<int64_t> more = {}) {
        Parcel p;
        if (type >= NOTIFICATION_HOURLY_UPLOADING && type <= NOTIFICATION_DAWN_UPLOADING) {
            p.writeFloat(1.0f);
        }
        p.writeInt64(t);
        bool flagFirst = type == NOTIFICATION_SCREEN_STATE_CHANGED ||
                         type == NOTIFICATION_CHARGER_ONLINE_CHANGED;
        bool longs = type == NOTIFICATION_HOURLY_TICK || type == NOTIFICATION_DAILY_TICK ||
                     type == NOTIFICATION_TIME_CHANGED;
        for (size_t i = 0; i < more.size(); ++i) {
            if (flagFirst && i == 0)
                p.writeBool(more[i] != 0);
            else if (longs)
                p.writeInt64(more[i]);
            else
                p.writeInt32(static_cast<int32_t>(more[i]));
        }
        mBattery->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, p));
    }
    void level(int64_t t, int32_t l) {
        notify(NOTIFICATION_BATTERY_LEVEL_CHANGED, t, {l, 3800, 250});
    }
    // Overrides one power-supply file of the model's layout.
    void file(const char* name, const std::string& text) {
        mRoot->writeFile("/" + mModel->folder() + "/" + name, text + "\n");
    }
    std::string dump() {
        android::String8 out;
        mBattery->requestDump(out, 1000);
        return out.string();
    }
    // Each span: start and end after kT, then the gas gauge and level of the
    // four buckets (discharging on, off, charging on, off).
    std::vector<std::string> spans() {
        return rows(
            "SELECT start_time - " + std::to_string(kT) + ", end_time - " + std::to_string(kT) +
            ", discharge_screen_on_gas_gauge, discharge_screen_on_level, "
            "discharge_screen_off_gas_gauge, discharge_screen_off_level, "
            "charge_screen_on_gas_gauge, charge_screen_on_level, charge_screen_off_gas_gauge, "
            "charge_screen_off_level FROM raw_component_battery ORDER BY id");
    }
    Json::Value lastEvent(uint32_t id) {
        DataUploader::getInstance()->uploadEvent();
        Json::Value found;
        for (const Json::Value& e : events())
            found = e["event"].asUInt() == id ? e["params"] : found;
        return found;
    }

    std::unique_ptr<BatteryModel> mModel;
    sp<BatteryHandler> mBattery;
    sp<Capture> mHourly;
    sp<Capture> mSystem;
    sp<AbnormalityRoutine> mAbnormality;
};

// Booted on the charger: the registrar's first report (level, then charger)
// opens a charging span. The screen goes off, the cable out, then in again:
// each change closes one span and opens the next at the same instant. The
// hour closes the last; its discharge is the compensation (mAh x 3600) and
// the hourly upload (gas only: the level did not move).
TEST_F(BatteryTest, SpansFromTheRegistrarThroughTheHour) {
    // Not published: the process-wide battery client of other tests may
    // still look for a registrar.
    auto state = std::make_shared<PlatformState>();
    sp<FakeBatteryRegistrar> registrar = new FakeBatteryRegistrar(state);
    PlatformState::Battery props = state->battery();
    props.acOnline = true;
    state->setBattery(props);
    mModel->setCharger(true);
    sp<BatteryListener> listener = new BatteryListener();
    Parcel reg, reply;
    reg.writeInterfaceToken(android::String16(u"android.os.IBatteryPropertiesRegistrar"));
    reg.writeStrongBinder(listener);
    ASSERT_EQ(android::NO_ERROR, registrar->transact(1, reg, &reply));
    // Both notifications of the first report reach the handler.
    ASSERT_TRUE(waitFor(
        [&] { return dump().find("voltage 3800 temperature 250 charge 1") != std::string::npos; }));
    auto at = [&](int64_t minutes) {
        mModel->advance(60000);
        ASSERT_TRUE(mModel->writeFiles());
        WallClock::setFixedTimeMs(kT + minutes * 60000);
    };
    at(1);
    notify(NOTIFICATION_SCREEN_STATE_CHANGED, kT + 60000, {0});
    at(2);
    mModel->setCharger(false);
    props.acOnline = false;
    state->setBattery(props);
    registrar->pushAll();  // the cable out
    ASSERT_TRUE(waitFor([&] { return spans().size() >= 2; }));
    at(3);
    notify(NOTIFICATION_CHARGER_ONLINE_CHANGED, kT + 180000, {1});  // the forced form
    mModel->setCharger(true);
    at(4);
    notify(NOTIFICATION_HOURLY_TICK, kH - kHour, {kH});
    notify(NOTIFICATION_COMPONENT_ACCOUNTING, kH);
    notify(NOTIFICATION_HOURLY_UPLOADING, kH);
    EXPECT_EQ((std::vector<std::string>{"0|60000|0|0|0|0|10|0|0|0", "60000|120000|0|0|0|0|0|0|10|0",
                                        "120000|180000|0|0|10|0|0|0|0|0",
                                        "180000|240000|0|0|0|0|0|0|10|0"}),
              spans());
    EXPECT_EQ(std::vector<std::string>{"1520|50|3800|1|0"},
              rows("SELECT gas_gauge, level, voltage, charge, screen FROM raw_battery_state WHERE "
                   "timestamp = " +
                   std::to_string(kH)));
    EXPECT_EQ(std::vector<std::string>{"0|0|0|60000|10|0|60000|10|0|120000|20|0"},
              rows("SELECT discharge_screen_on_duration, discharge_screen_on_gas_gauge, "
                   "discharge_screen_on_level, discharge_screen_off_duration, "
                   "discharge_screen_off_gas_gauge, discharge_screen_off_level, "
                   "charge_screen_on_duration, charge_screen_on_gas_gauge, charge_screen_on_level, "
                   "charge_screen_off_duration, charge_screen_off_gas_gauge, "
                   "charge_screen_off_level FROM hourly_component_battery"));
    EXPECT_EQ("0:240000:1 3:240000:64=36000 0:240000:3 0:240000:4", mHourly->got());
    Json::Value p = lastEvent(EVENT_HOURLY_COMPONENTS);
    EXPECT_EQ(10, p["2"].asInt64());
    EXPECT_FALSE(p.isMember("3"));
}

// One discharging span with the screen on after the first report (level 50,
// 1500 mAh): the gauge as the case leaves it, the level reported at its end.
struct NoiseCase {
    const char* name;
    bool micro;
    const char* chargeNow;  // the new charge_now text, or null to remove it
    int32_t level;
    const char* span;  // discharging gas gauge and level
    uint64_t kept;     // values that could not be read
    // charge_now of a second span (screen off), and the hour's compensation
    // over both: the valid spans' discharge x 3600.
    const char* nextChargeNow;
    const char* compensation;
};

void PrintTo(const NoiseCase& c, std::ostream* os) {
    *os << c.name;
}

class BatteryNoiseTest : public BatteryTest, public ::testing::WithParamInterface<NoiseCase> {
protected:
    bool micro() override { return GetParam().micro; }
};

// The tolerance (1/20 of 3000 mAh) holds from the start, a value that cannot
// be read keeps the last good one, and the micro-unit layout derives the
// gauge from the level and the capacity on the first day too.
TEST_P(BatteryNoiseTest, SpansBookNoiseAsZeroAndFailuresAsNothing) {
    const NoiseCase& c = GetParam();
    level(kT, 50);
    const uint64_t kept = HealthCounters::get(Health::BatteryReadingsKept);
    if (c.chargeNow == nullptr) {
        ASSERT_EQ(0, unlink((mRoot->path() + "/" + mModel->folder() + "/charge_now").c_str()));
    } else {
        file("charge_now", c.chargeNow);
    }
    file("capacity", std::to_string(c.level));
    level(kT + 60000, c.level);
    EXPECT_EQ(std::string("0|60000|") + c.span + "|0|0|0|0|0|0", spans().at(0));
    EXPECT_EQ(kept + c.kept, HealthCounters::get(Health::BatteryReadingsKept));
    file("charge_now", c.nextChargeNow);
    notify(NOTIFICATION_SCREEN_STATE_CHANGED, kT + 120000, {0});
    notify(NOTIFICATION_COMPONENT_ACCOUNTING, kH);
    EXPECT_EQ(std::string("3:240000:64=") + c.compensation + " 0:240000:3", mHourly->got());
}

INSTANTIATE_TEST_SUITE_P(
    Cases, BatteryNoiseTest,
    ::testing::Values(
        NoiseCase{"rise_within_tolerance", false, "1649", 50, "0|0", 0, "1639", "36000"},
        NoiseCase{"rise_beyond_tolerance", false, "1650", 50, "-150|0", 0, "1640", "36000"},
        NoiseCase{"level_rise_noise", false, "1490", 54, "10|0", 0, "1480", "72000"},
        NoiseCase{"level_rise_kept", false, "1490", 55, "10|-5", 0, "1480", "36000"},
        NoiseCase{"charge_now_garbage", false, "x12", 49, "0|1", 1, "1490", "36000"},
        NoiseCase{"charge_now_missing", false, nullptr, 49, "0|1", 1, "1490", "36000"},
        NoiseCase{"charge_now_too_large", false, "4294967296", 49, "0|1", 1, "1490", "36000"},
        NoiseCase{"micro_units_day_one", true, "0", 49, "30|1", 0, "0", "108000"}),
    [](const ::testing::TestParamInfo<NoiseCase>& i) { return std::string(i.param.name); });

// The day: capacity and charge count refreshed at the daily tick and sent
// to the system handler; the level distribution has 24 elements, each row
// in its own local hour (midnight is 24), the later row of a repeated hour
// winning and an hour without a row (0, 0).
TEST_F(BatteryTest, DailyStatisticsAndLevelDistribution) {
    const int64_t day = kMidnight + 24 * kHour;
    std::string sql;
    const struct {
        int64_t at;
        int level;
        int charged;
    } kRows[] = {{kMidnight + 3 * kHour, 80, 5},
                 {kMidnight + 10 * kHour, 60, 0},
                 {kMidnight + 10 * kHour + 1800000, 58, 7},  // the clock was set back
                 {day, 40, 9}};
    for (const auto& r : kRows) {
        std::string t = std::to_string(r.at);
        sql +=
            "INSERT INTO hourly_component_battery (timestamp, charge_screen_on_gas_gauge, "
            "charge_screen_off_gas_gauge) VALUES (" +
            t + ", " + std::to_string(r.charged) +
            ", 0); INSERT INTO raw_battery_state (timestamp, level) VALUES (" + t + ", " +
            std::to_string(r.level) + ");";
    }
    ASSERT_EQ(0, kelvo::test::DirectDb(dbPath()).exec(sql));
    notify(NOTIFICATION_DAILY_TICK, day - kHour, {day});
    notify(NOTIFICATION_DAILY_UPLOADING, day);
    const std::string at = std::to_string(day - kT);
    EXPECT_EQ("2:" + at + ":battery_full_capacity=3000 2:" + at + ":battery_charge_count=120",
              mSystem->got());
    Json::Value p = lastEvent(EVENT_DAILY_SYSTEM);
    EXPECT_EQ(3000, p["2"].asInt64());
    EXPECT_EQ(120, p["3"].asInt64());
    ASSERT_EQ(24u, p["23"].size());
    std::string levels;
    for (const Json::Value& e : p["23"]) {
        levels += std::to_string(e["params"]["0"].asInt64()) + "/" +
                  std::to_string(e["params"]["1"].asInt64()) + " ";
    }
    EXPECT_EQ(
        "0/0 0/0 80/5 0/0 0/0 0/0 0/0 0/0 0/0 58/7 0/0 0/0 0/0 0/0 0/0 0/0 0/0 0/0 0/0 "
        "0/0 0/0 0/0 0/0 40/9 ",
        levels);
    EXPECT_EQ("0:" + at + ":5 0:" + at + ":6", mHourly->got());
}

// A level drop and, at the second full charge, a smaller full capacity reach
// the abnormality routine, whose next check reports both.
TEST_F(BatteryTest, DropsReachTheAbnormalityRoutine) {
    ASSERT_EQ(0, mAbnormality->earlyInitialize());
    KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_ABNORMALITY, mAbnormality);
    level(kT, 99);
    level(kT + 1000, 100);  // the first full charge only records the capacity
    level(kT + 2000, 90);
    file("charge_full", "2900");
    level(kT + 3000, 100);
    level(kT + 4000, 100);  // still full: no second check
    mAbnormality->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));
    WallClock::setFixedTimeMs(kT + 60000);
    mAbnormality->sendMessageSync(ParcelMessage(MESSAGE_TIMER, AbnormalityRoutine::kCheckTimerId));
    EXPECT_EQ(3, lastEvent(903002051)["2"].asInt64());  // 100 of 3000 mAh
    EXPECT_EQ(10, lastEvent(903002052)["2"].asInt64());
    EXPECT_EQ(std::vector<std::string>{"2900|100|120|SimCell"},
              rows("SELECT full_capacity, diff_capacity, charge_count, version FROM "
                   "debug_abnormal_battery_capacity"));
}

}  // namespace
