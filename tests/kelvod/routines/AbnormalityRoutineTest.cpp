#include <binder/ServiceControl.h>
#include <gtest/gtest.h>

#include <atomic>
#include <memory>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "PlatformServices.h"
#include "binder/managers/PackageManager.h"
#include "binder/managers/SysinfoManager.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "kelvo/PowerLog.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/AbnormalityRoutine.h"
#include "storage/DataUploader.h"
#include "utils/SystraceDumper.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using namespace kelvo::test;

namespace {

constexpr int64_t kT = 1796515200000LL + 10 * 3600000LL;  // 2026-12-06 10:00 UTC
constexpr int64_t kMin = 60000;

// The other operators' tables the checks read (only the columns they need).
#define RAW_TABLE(var, name, ...)                                                           \
    const column_attribute var##Columns[] = {__VA_ARGS__};                                  \
    const table_attribute var = {"1.0", 1, sizeof(var##Columns) / sizeof(column_attribute), \
                                 var##Columns, name}
RAW_TABLE(kIrq, "raw_ap_wake_irq", {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"});
RAW_TABLE(kModem, "raw_modem_wakeup_source", {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "type"});
RAW_TABLE(kAlarm, "raw_applications_alarm", {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
          {COLUMN_TEXT, "tag"}, {COLUMN_INT, "count"});
RAW_TABLE(kKernel, "raw_kernel_wakelock", {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
          {COLUMN_LONG, "duration"});
RAW_TABLE(kPartial, "raw_partial_wakelock", {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "uid"},
          {COLUMN_TEXT, "name"}, {COLUMN_TEXT, "tag"}, {COLUMN_LONG, "duration"});
RAW_TABLE(kLocation, "raw_location_counter", {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
          {COLUMN_INT, "count"});
RAW_TABLE(kFreeze, "raw_freezing_failed", {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"});
RAW_TABLE(kMisc, "daily_misc_data", {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"},
          {COLUMN_TEXT, "value"});

std::atomic<int64_t> gMono{0};
int64_t fakeClock() {
    return gMono.load();
}

// The system handler's part: a daily_misc_data row per request 2.
class MiscHandler : public KelvoOperator {
public:
    MiscHandler() : KelvoOperator("MiscHandler", -1, 0) {}
    int32_t handleCustomized(int32_t code, const Parcel& data, Parcel*) override {
        return code == 2 ? insertEntries(kMisc, data, 1, false) : -3;
    }
};

class AbnormalityRoutineTest : public AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        WallClock::setFixedTimeMs(kT);
        // Key 3 is listed without values.
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         "<kelvo_config><element id=\"1\"><component id=\"0\">"
                         "<parameter id=\"0\"><value>1000</value><value>500</value></parameter>"
                         "<parameter id=\"3\"></parameter>" +
                             param(1, 2) + param(2, 1) + param(4, 3) + param(5, 2) +
                             param(6, 1000) + param(8, 4) + param(9, 10) +
                             "</component></element><element id=\"3\"><component id=\"0\">"
                             "<parameter>42</parameter></component></element></kelvo_config>");
        mRoot->writeFile("/sys/devices/system/cpu/possible", "0-3\n");
        XmlParser::resetInstance();
        ServiceControl::setServiceWaitMs(300);
        mServices.reset(new PlatformServices());
        mServices->startAll();
        mServices->state()->setPackageVersion("com.w", 7, "1.2");
        mRoutine = new AbnormalityRoutine();
        mRoutine->addSchemaTable();
        AppsAccounting::getInstance()->addSchemaTable();
        DataUploader::getInstance()->addSchemaTable();
        for (const table_attribute* t :
             {&kIrq, &kModem, &kAlarm, &kKernel, &kPartial, &kLocation, &kFreeze, &kMisc}) {
            StorageOperator::addSchema(*t);
        }
    }
    void SetUp() override {
        AgentStorageTest::SetUp();
        mRoutine->earlyInitialize();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_ABNORMALITY, mRoutine);
        ASSERT_EQ(0, mRoutine->initialize());
    }
    void TearDown() override {
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_SYSTEM, nullptr);
        for (const sp<KelvoOperator>& op : {sp<KelvoOperator>(mRoutine), mMisc}) {
            if (op == nullptr) continue;
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_ABNORMALITY, nullptr);
        Dispatcher::resetForTest();
        mServices.reset();
        // The clients are process-wide: they see their services go before
        // the next test starts new ones.
        EXPECT_TRUE(waitFor([] { return !PackageManager::getInstance()->isConnected(); }));
        EXPECT_TRUE(waitFor([] { return !SysinfoManager::getInstance()->isConnected(); }));
        ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs);
        WallClock::setFixedTimeMs(-1);
        AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }
    static std::string param(int key, int value) {
        return "<parameter id=\"" + std::to_string(key) + "\"><value>" + std::to_string(value) +
               "</value></parameter>";
    }
    void seed(const std::string& sql) { ASSERT_EQ(0, DirectDb(dbPath()).exec(sql)) << sql; }
    void checkAt(int64_t t) {
        WallClock::setFixedTimeMs(t);
        mRoutine->sendMessageSync(ParcelMessage(MESSAGE_TIMER, AbnormalityRoutine::kCheckTimerId));
    }
    int32_t pelmora(int64_t time, const char* text) {
        Parcel body;
        body.writeInt64(time);
        body.writeCString(text);
        return mRoutine->sendMessageSync(ParcelMessage(MESSAGE_LOGGER, 0, body));
    }
    int32_t request(int32_t code, const Parcel& data) {
        return mRoutine->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, code, data));
    }
    // "event param×elements ..." of every event sent, ';'-separated.
    std::string sent() {
        std::string out;
        for (const Json::Value& e : events()) {
            out += (out.empty() ? "" : ";") + std::to_string(e["event"].asUInt());
            for (const std::string& key : e["params"].getMemberNames()) {
                const Json::Value& v = e["params"][key];
                if (v.isArray()) out += " " + key + "x" + std::to_string(v.size());
            }
        }
        return out;
    }
    // A device that captures traces, a minute after the last capture.
    static void allowTrace() {
        gLogUserType = 3;
        SystraceDumper::setClockForTest(&fakeClock);
        SystraceDumper::getInstance()->resetForTest();
        gMono += SystraceDumper::kMinIntervalMs;
    }
    std::string powerLog() {
        std::string text = mRoot->readFile(KELVO_POWER_LOG_FILE);
        return text.empty() ? text : text.substr(text.find('\t'));
    }

    sp<AbnormalityRoutine> mRoutine;
    sp<KelvoOperator> mMisc;
    std::unique_ptr<PlatformServices> mServices;
};

// Rows seeded ten minutes into the first window; one check at its end: the
// debug rows, the events and the power log.
struct WindowCase {
    const char* name;
    const char* seed;
    const char* debug;  // query of the debug rows
    std::vector<std::string> rows;
    const char* events;
    const char* powerLog;
    friend void PrintTo(const WindowCase& c, std::ostream* os) { *os << c.name; }
};

class AbnormalityWindowTest : public AbnormalityRoutineTest,
                              public ::testing::WithParamInterface<WindowCase> {};

TEST_P(AbnormalityWindowTest, ChecksReportWhatPassesTheThreshold) {
    const WindowCase& c = GetParam();
    std::string sql = c.seed;
    for (size_t at; (at = sql.find("@T")) != std::string::npos;) {
        sql.replace(at, 2, std::to_string(kT + 20 * kMin));
    }
    seed(sql);
    checkAt(kT + 30 * kMin);
    EXPECT_EQ(c.rows, rows(c.debug));
    EXPECT_EQ(c.events, sent());
    EXPECT_EQ(c.powerLog, powerLog());
}

INSTANTIATE_TEST_SUITE_P(
    Checks, AbnormalityWindowTest,
    ::testing::Values(
        WindowCase{"Wakeups",
                   "WITH RECURSIVE n(i) AS (SELECT 1 UNION SELECT i+1 FROM n WHERE i<5) "
                   "INSERT INTO raw_ap_wake_irq(timestamp, name) SELECT @T, 'irqA' FROM n "
                   "UNION ALL SELECT @T, 'GPIO42' FROM n UNION ALL SELECT @T, 'irqB' FROM n "
                   "WHERE i<4",
                   "SELECT source, count FROM debug_abnormal_wakeup",
                   {"irqA|5"},
                   "903002053 2x1",
                   ""},
        WindowCase{"AlarmsButNotTheLocationAlarm",
                   "INSERT INTO raw_applications_alarm(timestamp, name, tag, count) VALUES "
                   "(@T,'com.a','t',1),(@T,'com.a','t',1),(@T,'com.a','t',1),(@T,'com.a','t',2),"
                   "(@T,'android','com.android.internal.location.ALARM_WAKEUP',1),"
                   "(@T,'android','com.android.internal.location.ALARM_WAKEUP',1),"
                   "(@T,'android','com.android.internal.location.ALARM_WAKEUP',1)",
                   "SELECT app, tag, count FROM debug_abnormal_alarm",
                   {"com.a|t|3"},
                   "903002053 4x1",
                   ""},
        WindowCase{"ModemListsEveryTypeOnceTheSumPasses",
                   "INSERT INTO raw_modem_wakeup_source(timestamp, type) VALUES (@T,1),(@T,1),"
                   "(@T,0),(@T,0),(@T,0),(@T,5),(@T,6)",
                   "SELECT source, count FROM debug_abnormal_modem",
                   {"0|3", "1|2", "5|1", "6|1"},
                   "903002053 3x4",
                   ""},
        WindowCase{"ModemOtherTypesAloneAreNoAbnormality",
                   "INSERT INTO raw_modem_wakeup_source(timestamp, type) VALUES (@T,1),(@T,2),"
                   "(@T,3),(@T,4),(@T,4),(@T,4),(@T,4)",
                   "SELECT source, count FROM debug_abnormal_modem",
                   {},
                   "",
                   ""},
        WindowCase{"LocationTopThreeAndTotal",
                   "INSERT INTO raw_location_counter(timestamp, name, count) VALUES "
                   "(@T,'a',5),(@T,'b',4),(@T,'c',2),(@T,'d',1)",
                   "SELECT name, count FROM debug_abnormal_location_counter",
                   {"a|5", "b|4", "c|2", "total|12"},
                   "903002053 7x4",
                   ""},
        WindowCase{
            "WakelocksWithOnePowerLogLine",
            "INSERT INTO raw_kernel_wakelock(timestamp, name, duration) VALUES "
            "(@T,'kwl',5000),(@T,'charge_wakelock',9000),(@T,'small',900);"
            "INSERT INTO raw_partial_wakelock(timestamp, uid, name, tag, duration) "
            "VALUES (@T,1000,'system','tagA',3000),(@T,10050,'app','tagB',8000),"
            "(@T,1000,'system','*alarm*',8000)",
            "SELECT app, tag, duration FROM debug_abnormal_wakelock",
            {"kwl||5000", "system|tagA|3000"},
            "903002053 5x2",
            "\t5\t207\t\twakelock\t0:kernel:kwl:5000:1800000#1000:system:tagA:3000:1800000\n"},
        WindowCase{"FreezeFailedProcesses",
                   "INSERT INTO raw_freezing_failed(timestamp, name) VALUES (@T,'p'),(@T,'p'),"
                   "(@T,'p'),(@T,'q')",
                   "SELECT process, count FROM debug_abnormal_freeze_fail",
                   {"p|3"},
                   "903002056 4x1",
                   ""}),
    [](const ::testing::TestParamInfo<WindowCase>& info) { return info.param.name; });

TEST_F(AbnormalityRoutineTest, WindowsFollowEachOtherSoABoundaryRowCountsOnce) {
    gLogModuleMask |= LOG_MODULE_ABNORMALITY;
    LogCapture log;
    // Rows exactly at the end of the first window.
    seed("INSERT INTO raw_ap_wake_irq(timestamp, name) VALUES (" + std::to_string(kT) +
         ",'irq'),(" + std::to_string(kT) + ",'irq'),(" + std::to_string(kT) + ",'irq'),(" +
         std::to_string(kT) + ",'irq')");
    checkAt(kT);
    checkAt(kT + 30 * kMin);
    // A clock set back restarts the window: the rows are past it.
    checkAt(kT - 60 * kMin);
    EXPECT_EQ(std::vector<std::string>{std::to_string(kT - 30 * kMin) + "|" + std::to_string(kT) +
                                       "|irq|4"},
              rows("SELECT start_time, end_time, source, count FROM debug_abnormal_wakeup"));
    // Key 7 is missing, key 3 is listed without values: each check logs both.
    EXPECT_EQ(6u, log.count("Failed to find abnormality threshold"));
    gLogModuleMask &= ~LOG_MODULE_ABNORMALITY;
}

// One power-management record: its result, the raw rows, the abnormal row,
// the events sent and the row of its own debug table.
struct PelmoraCase {
    const char* name;
    const char* text;
    int32_t result;
    const char* abnormal;  // type|name|reason|count, "" for none
    const char* events;
    const char* debug;
    std::vector<std::string> debugRows;
    friend void PrintTo(const PelmoraCase& c, std::ostream* os) { *os << c.name; }
};

class PelmoraMessageTest : public AbnormalityRoutineTest,
                           public ::testing::WithParamInterface<PelmoraCase> {};

TEST_P(PelmoraMessageTest, RecordsAreStoredAndReportedAtOnce) {
    const PelmoraCase& c = GetParam();
    int32_t saved = gLogUserType;
    allowTrace();
    mMisc = new MiscHandler();
    KelvoAgent::getInstance()->setHandlerForTest(HANDLER_SYSTEM, mMisc);
    EXPECT_EQ(c.result, pelmora(kT, c.text));
    mMisc->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));
    EXPECT_EQ(std::vector<std::string>(c.result == 0, c.text),
              rows("SELECT message FROM raw_pelmora"));
    std::vector<std::string> abnormal;
    if (*c.abnormal != '\0') abnormal.push_back(c.abnormal);
    EXPECT_EQ(abnormal, rows("SELECT type, name, reason, count FROM raw_pelmora_abnormal"));
    EXPECT_EQ(c.events, sent());
    if (c.debug != nullptr) {
        EXPECT_EQ(c.debugRows, rows(c.debug));
    }
    SystraceDumper::setClockForTest(nullptr);
    gLogUserType = saved;
}

const std::string kTs = std::to_string(kT);
INSTANTIATE_TEST_SUITE_P(
    Types, PelmoraMessageTest,
    ::testing::Values(
        PelmoraCase{"FreezeFailure",
                    "type=4 package=com.f count=3 reason=1:binder",
                    0,
                    "4|com.f|binder|3",
                    "",
                    nullptr,
                    {}},
        PelmoraCase{"FreezeFailureNotKept",
                    "type=4 package=com.f count=3 reason=2:binder",
                    0,
                    "",
                    "",
                    nullptr,
                    {}},
        PelmoraCase{"Refused", "type=7 package=com.x", -3, "", "", nullptr, {}},
        PelmoraCase{"Gnss",
                    "type=15 package=com.g count=60000 reason=gps",
                    0,
                    "15|com.g|gps|60000",
                    "903002055 4x1",
                    nullptr,
                    {}},
        PelmoraCase{"ScreenOffDrain",
                    "type=17 package=3500 count=2 reason=modem_log:1|wifi_spot:0",
                    0,
                    "17|3500|modem_log=1 wifi_spot=0|2",
                    "",
                    nullptr,
                    {}},
        // 120 s of CPU over four processors: the window starts 30 s earlier.
        PelmoraCase{
            "CpuWithTrace",
            "type=20 package=com.c usage=80 time=120000 energy=5000",
            0,
            "",
            "903002055 3x1",
            "SELECT start_time, app, usage_rate, bg_usage, bg_energy FROM debug_abnormal_cpu "
            "UNION ALL SELECT timestamp, name, value, '', '' FROM daily_misc_data",
            {std::to_string(kT - 30000) + "|com.c|80|120|5000", kTs + "|systrace|0||"}},
        PelmoraCase{"ApplicationWakelock",
                    "type=21 package=com.w reason=Sync Tag#x count=900000",
                    0,
                    "",
                    "903002053 5x1",
                    "SELECT start_time, app, version, tag, duration FROM debug_abnormal_wakelock",
                    {std::to_string(kT - 900000) + "|com.w|1.2|Sync Tag|900000"}},
        PelmoraCase{"NegativeDurationShiftsNothing",
                    "type=21 package=com.w reason=Sync Tag#x count=-5",
                    0,
                    "",
                    "903002053 5x1",
                    "SELECT start_time, duration FROM debug_abnormal_wakelock",
                    {kTs + "|-5"}},
        PelmoraCase{"WakelockWithoutHash",
                    "type=21 package=com.w reason=Sync count=900000",
                    -19,
                    "",
                    "",
                    nullptr,
                    {}}),
    [](const ::testing::TestParamInfo<PelmoraCase>& info) { return info.param.name; });

TEST_F(AbnormalityRoutineTest, CpuTraceIsAttachedToItsEvent) {
    int32_t saved = gLogUserType;
    allowTrace();
    ASSERT_EQ(0, pelmora(kT, "type=20 package=com.c usage=80 time=120000 energy=5000"));
    // Reported once until the list is emptied.
    ASSERT_EQ(0, pelmora(kT, "type=20 package=com.c usage=80 time=120000 energy=5000"));
    std::vector<Json::Value> sent = events();
    ASSERT_EQ(1u, sent.size());
    EXPECT_EQ("/data/log/kelvo/systrace/systrace0.sys", sent[0]["dynamic_paths"][0].asString());
    EXPECT_TRUE(hostPathExists(mRoot->path() + "/data/log/kelvo/systrace/systrace0.sys"));
    SystraceDumper::setClockForTest(nullptr);
    gLogUserType = saved;
}

TEST_F(AbnormalityRoutineTest, HourlyApplicationsRankByEnergyAndQuoteNames) {
    std::string hour = std::to_string(kT - 5 * kMin);
    std::string sql =
        "INSERT INTO hourly_applications_accounting(timestamp, name, component, "
        "foreground_energy, background_energy) VALUES ";
    for (int app = 0; app < 5; ++app) {
        for (int c = 0; c < 3; ++c) {
            sql += "(" + hour + ",'small" + std::to_string(app) + "'," + std::to_string(c) +
                   ",10,10),";
        }
    }
    seed(sql + "(" + hour + ",'it''s',0,800,600),(" + hour + ",'it''s',11,10,10)");
    Parcel data;
    data.writeInt64(kT);
    LogCapture log;
    ASSERT_EQ(0, request(AbnormalityRoutine::REQUEST_HOURLY_APPLICATIONS, data));
    checkAt(kT + 30 * kMin);
    std::vector<Json::Value> sent = events();
    ASSERT_EQ(1u, sent.size());
    const Json::Value& list = sent[0]["params"]["2"];
    ASSERT_EQ(2u, list.size());
    // Total 1420 with its component 0 (sub-id 11); background 610; the
    // sensor part is left out of both.
    EXPECT_EQ("it's", list[0]["params"]["15"]["params"]["0"].asString());
    EXPECT_EQ(1420, list[0]["params"]["1"].asInt());
    EXPECT_EQ(800, list[0]["params"]["11"]["params"]["4"].asInt());
    EXPECT_EQ(610, list[1]["params"]["2"].asInt());
    EXPECT_EQ(600, list[1]["params"]["11"]["params"]["6"].asInt());
    EXPECT_EQ(3u, list[0]["params"].size());
    EXPECT_FALSE(log.contains("", ANDROID_LOG_ERROR));
}

TEST_F(AbnormalityRoutineTest, LargestBatteryReportAboveTheThresholdIsSentOnce) {
    for (int32_t severity : {2, 1}) {
        Parcel data;
        for (int32_t v : {severity, 4000, -300, 7, 35}) data.writeInt32(v);
        data.writeString8(android::String8("a-very-long-battery-version-text-0123456789"));
        ASSERT_EQ(0, request(AbnormalityRoutine::REQUEST_BATTERY_CAPACITY, data));
    }
    checkAt(kT + 30 * kMin);
    checkAt(kT + 60 * kMin);
    EXPECT_EQ("903002051", sent());
    EXPECT_EQ(std::vector<std::string>{"4000|-300|7|35|a-very-long-battery-version-tex"},
              rows("SELECT full_capacity, diff_capacity, charge_count, temperature, version "
                   "FROM debug_abnormal_battery_capacity"));
}

TEST_F(AbnormalityRoutineTest, CpuHandlerReportPushesUsagesAboveTheLimit) {
    Parcel data;
    for (int i = 0; i < 32; ++i) {
        data.writeInt32(10000 + i);
        data.writeString8(android::String8(("p" + std::to_string(i)).c_str()));
        // Only the first record is above 1.25; the 31st would be too, past the cap.
        data.writeFloat(i == 0 || i == 30 ? 250.0f : 1.25f);
        data.writeInt32(7);
        data.writeInt64(99);
    }
    uint64_t refused = HealthCounters::get(Health::AbnormalityInputRefused);
    ASSERT_EQ(0, request(AbnormalityRoutine::REQUEST_CPU_REPORT, data));
    EXPECT_EQ("\t5\t185\t\tcpu\t10000:p0:2.500:7:99\n", powerLog());
    EXPECT_EQ(refused + 1, HealthCounters::get(Health::AbnormalityInputRefused));
}

}  // namespace
