// The system handler fed through its messages on a private root: rows read
// from the database, log lines and self-health counters.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <vector>

#include "FakeDriverReporter.h"
#include "FakeKernelDriver.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/BufferedLogServer.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "handlers/KernelWakelockReader.h"
#include "handlers/SystemHandler.h"
#include "kelvo/BufferedLogClient.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "routines/PollingPayload.h"
#include "routines/PollingRoutine.h"
#include "storage/DataUploader.h"
#include "utils/PackageProperty.h"
#include "utils/SystraceDumper.h"
#include "utils/XmlParser.h"
#include "utils/devices/KelvoDevice.h"

using android::Parcel;
using android::sp;
using android::String8;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kH = 1796515200000LL + 10 * kHour;  // 2026-12-06 10:00 UTC

// One step: a tag index with its text at an offset from kH, or a
// notification (tag -1: charger online/offline by text "1"/"0").
struct Step {
    int32_t tag;
    int64_t at;
    std::string text;
};

struct Scenario {
    const char* name;
    std::vector<Step> steps;
    std::string query;
    std::vector<std::string> expected;
    friend void PrintTo(const Scenario& s, std::ostream* os) { *os << s.name; }
};

class SystemHandlerTest : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        Dispatcher::resetForTest();
        mHandler = new SystemHandler();
        mHandler->addSchemaTable();
    }
    void SetUp() override {
        ServiceControl::setServiceWaitMs(50);
        kelvo::test::AgentStorageTest::SetUp();
        ASSERT_EQ(0, mHandler->earlyInitialize());
        mHandler->initialize();
    }
    void TearDown() override {
        stopHandler();
        // The process-wide type cache forgets the names the tests record.
        Parcel types;
        for (const char* name : {"t.a", "t'b", "com.typed"}) {
            types.writeString8(String8(name));
        }
        types.setDataPosition(0);
        PackageProperty::getInstance()->removePackageType(types);
        ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs);
        kelvo::test::AgentStorageTest::TearDown();
    }
    void stopHandler() {
        Dispatcher::resetForTest();
        mHandler->readyToDestroy();
        mHandler->requestThreadExit();
        mHandler->join();
    }
    // A new handler over the same database, as after a daemon restart.
    void restart() {
        StorageOperator::forceFlushEntries();
        stopHandler();
        mHandler = new SystemHandler();
        ASSERT_EQ(0, mHandler->earlyInitialize());
        mHandler->initialize();
    }
    void run(const Step& s) {
        if (s.tag < 0) {
            Parcel note;
            note.writeInt64(kH + s.at);
            note.writeBool(s.text == "1");
            mHandler->sendMessageSync(
                ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_CHARGER_ONLINE_CHANGED, note));
            return;
        }
        Parcel body;
        body.writeInt64(kH + s.at);
        body.writeCString(s.text.c_str());
        mHandler->sendMessageSync(ParcelMessage(MESSAGE_LOGGER, s.tag, body));
    }
    void notify(int32_t type, const Parcel& data) {
        mHandler->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, data));
    }

    sp<SystemHandler> mHandler;
};

class SystemScenarioTest : public SystemHandlerTest,
                           public ::testing::WithParamInterface<Scenario> {};

constexpr int32_t S = SystemHandler::TAG_KERNEL_SUSPEND;
constexpr int32_t W = SystemHandler::TAG_KERNEL_WAKEUP;
constexpr int32_t R = SystemHandler::TAG_KERNEL_RESUME;
constexpr int32_t A = SystemHandler::TAG_ALARM_TRIGGER;
constexpr int32_t T = SystemHandler::TAG_TIME_CHANGED;
constexpr int32_t P = SystemHandler::TAG_PACKAGE_ADDED;
constexpr int32_t PR = SystemHandler::TAG_PACKAGE_REMOVED;
const std::string kRtc = "irq=RTC0 gpio=0";

std::string at(int64_t offset) {
    return std::to_string(kH + offset);
}

// Scenarios end with a wait long enough for the 1.5 s RTC check.
TEST_P(SystemScenarioTest, RowsFollowTheRecords) {
    const Scenario& s = GetParam();
    for (const Step& step : s.steps) {
        run(step);
    }
    bool rtc = false;
    for (const Step& step : s.steps) {
        rtc = rtc || step.text == kRtc;
    }
    if (rtc) {
        usleep(1700 * 1000);
        mHandler->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, 99, Parcel()));
    }
    EXPECT_EQ(s.expected, rows(s.query));
}

const char* kSuspends = "SELECT suspend, resume FROM raw_system_suspend ORDER BY suspend";
const char* kAlarms = "SELECT name, tag, count FROM raw_applications_alarm ORDER BY tag";

std::string alarm(const char* name, int type, const char* tag, int size) {
    return "uid=10010 name=" + std::string(name) + " type=" + std::to_string(type) +
           " tag=*walarm*:" + tag + " size=" + std::to_string(size);
}

INSTANTIATE_TEST_SUITE_P(
    Records, SystemScenarioTest,
    ::testing::Values(
        Scenario{"SuspendSplitAtOneHour",
                 {{S, -120000, ""}, {W, 170000, "irq=X gpio=0"}, {R, 180000, ""}},
                 kSuspends,
                 {at(-120000) + "|" + at(0), at(0) + "|" + at(180000)}},
        Scenario{"SuspendSplitAtEveryHour",
                 {{S, -60000, ""}, {W, 2 * kHour, "irq=X gpio=0"}, {R, 2 * kHour + 5, ""}},
                 kSuspends,
                 {at(-60000) + "|" + at(0), at(0) + "|" + at(kHour),
                  at(kHour) + "|" + at(2 * kHour), at(2 * kHour) + "|" + at(2 * kHour + 5)}},
        Scenario{"ResumeWithoutWakeupWritesNothing", {{S, 1000, ""}, {R, 5000, ""}}, kSuspends, {}},
        Scenario{"LostSuspendCountsOnce",
                 {{S, 1000, ""},
                  {W, 4000, "irq=X gpio=0"},
                  {R, 5000, ""},
                  {W, 8000, "irq=X gpio=0"},
                  {R, 9000, ""}},
                 kSuspends,
                 {at(1000) + "|" + at(5000)}},
        Scenario{"RtcChargesTheBatch",
                 {{S, 0, ""},
                  {A, 1000, alarm("com.a", 0, "a1", 3)},
                  {A, 1001, alarm("com.a", 2, "a2", 3)},
                  {A, 1002, alarm("com.b", 0, "b1", 3)},
                  {W, 1500, kRtc}},
                 kAlarms,
                 {"com.a|a1|3", "com.a|a2|3", "com.b|b1|3"}},
        Scenario{"NonWakingAlarmsAreNeverRecorded",
                 {{S, 0, ""},
                  {A, 1000, alarm("com.a", 1, "a1", 2)},
                  {A, 1001, alarm("com.a", 3, "a2", 2)},
                  {W, 1500, kRtc}},
                 kAlarms,
                 {}},
        Scenario{"RtcTooLateLeavesTheBatch",
                 {{S, 0, ""}, {A, 1000, alarm("com.a", 0, "a1", 1)}, {W, 3000, kRtc}},
                 kAlarms,
                 {}},
        Scenario{"ChargingTakesNoAlarms",
                 {{-1, 0, "1"}, {S, 0, ""}, {A, 1000, alarm("com.a", 0, "a1", 1)}, {W, 1500, kRtc}},
                 kAlarms,
                 {}},
        Scenario{"TimeChanges",
                 {{T, 1000, "delta=30000"},
                  {T, 2000, "delta=-5000000"},
                  {T, 3000, "delta=9999999999999999"},
                  {T, 4000, "delta=abc"}},
                 "SELECT old_time, delta FROM raw_time_changed ORDER BY old_time",
                 {at(1000) + "|30010", at(2000) + "|-4999990"}},
        Scenario{"QuotedPackageNames",
                 {{P, 1000, "uid=10010 name=com.keep"},
                  {P, 2000, "uid=10011 name=x'OR'1'='1"},
                  {P, 3000, "uid=10011 name=x'OR'1'='1"},
                  {PR, 4000, "uid=10011 name=x'OR'1'='1"}},
                 "SELECT name FROM raw_package_version UNION ALL "
                 "SELECT name || ':' || state FROM raw_package_state WHERE name = 'com.keep'",
                 {"com.keep", "com.keep:1"}},
        Scenario{"CloudUpdateReplacesItsModule",
                 {{SystemHandler::TAG_CLOUD_UPDATE, 1000, "module=a'b version=1"},
                  {SystemHandler::TAG_CLOUD_UPDATE, 2000, "module=c version=9"},
                  {SystemHandler::TAG_CLOUD_UPDATE, 3000, "module=a'b version=2"}},
                 "SELECT module, version FROM module_cloud_update ORDER BY module",
                 {"a'b|2", "c|9"}},
        Scenario{"StrategyUpdateReplacesItsType",
                 {{SystemHandler::TAG_PM_STRATEGY, 1000, "name=a,b type=1 count=2 update=0"},
                  {SystemHandler::TAG_PM_STRATEGY, 1000, "name=z type=2 count=1 update=0"},
                  {SystemHandler::TAG_PM_STRATEGY, 2000, "name=c,d type=1 count=2 update=1"},
                  {SystemHandler::TAG_PM_STRATEGY, 3000, "name=e,f type=1 count=9 update=1"}},
                 "SELECT name, type FROM raw_pelmora_strategy ORDER BY name",
                 {"c|1", "d|1", "z|2"}},
        Scenario{"LocationCounters",
                 {{SystemHandler::TAG_LOCATION_COUNTER, 1000, "num=2 count=3,7 name=com.a,com.b"},
                  {SystemHandler::TAG_LOCATION_COUNTER, 2000, "num=2 count=1 name=com.c,com.d"},
                  {SystemHandler::TAG_LOCATION_COUNTER, 3000, "num=1 count=-4 name=com.e"},
                  {SystemHandler::TAG_LOCATION_COUNTER, 4000, "num=9999 count=1 name=com.f"}},
                 "SELECT name, count FROM raw_location_counter ORDER BY name",
                 {"com.a|3", "com.b|7"}},
        Scenario{"AppTypesFirstWinsAndForget",
                 {{SystemHandler::TAG_APP_TYPE, 1000, "count=2 flag=1 name=t.a,t'b type=4,8"},
                  {SystemHandler::TAG_APP_TYPE, 2000, "count=1 flag=1 name=t.a type=16"},
                  {SystemHandler::TAG_APP_TYPE, 3000, "count=1 flag=0 name=t'b"},
                  {SystemHandler::TAG_APP_TYPE, 4000, "count=1 flag=2 name=t.c type=1"},
                  {SystemHandler::TAG_APP_TYPE, 5000, "count=2 flag=1 name=t.d,t.e type=1,x"},
                  {SystemHandler::TAG_APP_TYPE, 6000, "count=3 flag=1 name=t.f type=1"}},
                 "SELECT name, type FROM raw_app_type ORDER BY name",
                 {"t.a|4"}},
        Scenario{"SensorHubSourceAndReason",
                 {{SystemHandler::TAG_SENSORHUB_WAKE, 1000, "data=196613"},
                  {SystemHandler::TAG_SENSORHUB_WAKE, 2000, "data=x"}},
                 "SELECT source, reason FROM raw_sensorhub_wake",
                 {"3|5"}}),
    [](const ::testing::TestParamInfo<Scenario>& info) { return std::string(info.param.name); });

// A package added twice keeps one version row: the newest.
TEST_F(SystemHandlerTest, PackageVersionKeepsOneRowPerName) {
    run({P, 1000, "uid=10010 name=com.twice"});
    run({P, 2000, "uid=10010 name=com.twice"});
    EXPECT_EQ(std::vector<std::string>{at(2000)},
              rows("SELECT timestamp FROM raw_package_version WHERE name = 'com.twice'"));
    PackageProperty::getInstance()->removeUid(10010);
    PackageProperty::getInstance()->removeUid(10011);
}

// Error lines forwarded by the agent become rows; a malformed one is counted.
TEST_F(SystemHandlerTest, ErrorLinesAreStored) {
    const uint64_t dropped = HealthCounters::get(Health::ErrorRowsDropped);
    Parcel line;
    line.writeInt64(kH);
    line.writeString8(String8("[X.cpp] f# it's broken"));
    EXPECT_EQ(0, mHandler->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, 3, line)));
    Parcel shortLine;
    shortLine.writeInt32(1);
    EXPECT_EQ(-5, mHandler->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, 3, shortLine)));
    EXPECT_EQ(std::vector<std::string>{at(0) + "|[X.cpp] f# it's broken"},
              rows("SELECT timestamp, error_log FROM debug_error_log"));
    EXPECT_EQ(dropped + 1, HealthCounters::get(Health::ErrorRowsDropped));
}

// A batch closed by its last alarm leaves no time-out behind: no "Invalid
// message id" lines, and a time-out of an incomplete batch drops it.
TEST_F(SystemHandlerTest, AlarmTimeoutIsCancelledOnce) {
    LogCapture capture;
    for (int i = 0; i < 3; ++i) {
        run({S, i * 10000, ""});
        run({A, i * 10000 + 1, alarm("com.a", 0, "t", 1)});
    }
    run({S, 40000, ""});
    run({A, 40001, alarm("com.a", 0, "late", 2)});
    usleep(3300 * 1000);
    run({W, 40100, kRtc});
    usleep(1700 * 1000);
    mHandler->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, 99, Parcel()));
    EXPECT_EQ(0u, capture.count("Invalid message id"));
    EXPECT_TRUE(capture.contains("Receive wakeup alarm delayed message"));
    EXPECT_EQ(std::vector<std::string>{}, rows(kAlarms));
}

// Hourly folding: three alarms of one wake-up share it (333 each); the split
// suspend rows fall in the hour they start in.
TEST_F(SystemHandlerTest, HourlyAccounting) {
    run({S, -kHour + 1000, ""});
    run({A, -kHour + 2000, alarm("com.a", 0, "a1", 3)});
    run({A, -kHour + 2001, alarm("com.a", 0, "a2", 3)});
    run({A, -kHour + 2002, alarm("com.a", 0, "a3", 3)});
    run({W, -kHour + 2500, kRtc});
    usleep(1700 * 1000);
    run({R, -kHour + 2600, ""});
    run({S, -60000, ""});
    run({W, -30000, "irq=X gpio=0"});
    run({R, 60000, ""});
    ASSERT_EQ(3u, rows(kAlarms).size());
    Parcel hour;
    hour.writeInt64(kH);
    notify(NOTIFICATION_APPLICATIONS_ACCOUNTING, hour);
    notify(NOTIFICATION_COMPONENT_ACCOUNTING, hour);
    EXPECT_EQ((std::vector<std::string>{"a1|333", "a2|333", "a3|333"}),
              rows("SELECT tag, count FROM hourly_applications_alarm ORDER BY tag"));
    EXPECT_EQ(std::vector<std::string>{at(0) + "|61600|2"},
              rows("SELECT timestamp, duration, count FROM hourly_system_suspend"));
    EXPECT_EQ((std::vector<std::string>{"RTC0|1", "X|1"}),
              rows("SELECT source, count FROM hourly_wake_up_source ORDER BY source"));
}

// Memory ranges from /proc/meminfo at polls; a missing file is logged once
// an hour.
TEST_F(SystemHandlerTest, MemoryRanges) {
    LogCapture capture;
    PollingPayload poll;
    poll.time = kH + 1000;
    Parcel data;
    poll.writeTo(data);
    notify(NOTIFICATION_DATA_POLLING, data);
    notify(NOTIFICATION_DATA_POLLING, data);
    EXPECT_EQ(1u, capture.count("Failed to open /proc/meminfo"));
    const struct {
        const char* text;
        std::vector<std::string> ranges;
    } kCases[] = {
        {"MemTotal: 8000000 kB\nMemFree: 300000 kB\nMemAvailable: 4194305 kB\n", {"1", "5"}},
        {"MemFree: 262144 kB\nMemAvailable: 1048577 kB\n", {"0", "3"}},
        {"MemFree: 0 kB\nMemAvailable: 600000 kB\n", {}},
    };
    for (const auto& c : kCases) {
        mRoot->writeFile(SystemHandler::kMemInfoPath, c.text);
        poll.time += 1;
        Parcel p;
        poll.writeTo(p);
        notify(NOTIFICATION_DATA_POLLING, p);
        EXPECT_EQ(c.ranges, rows("SELECT range FROM raw_memory_range WHERE timestamp = " +
                                 std::to_string(poll.time) + " ORDER BY type DESC"))
            << c.text;
    }
}

// Kernel wakelock increments, reading after reading.
TEST(KernelWakelockReaderTest, IncrementsBetweenReadings) {
    kelvo::test::TempRoot root;
    const std::string title =
        "name\t\tactive_count\tevent_count\twakeup_count\texpire_count\t"
        "active_since\ttotal_time\tmax_time\tlast_change\tprevent\n";
    auto line = [](const std::string& name, int count, long long time) {
        return name + "\t\t" + std::to_string(count) + "\t\t0\t\t0\t\t0\t\t0\t\t" +
               std::to_string(time) + "\t\t0\t\t0\t\t0\n";
    };
    const struct {
        std::string body;
        std::vector<std::string> increments;  // name|count|time
    } kReadings[] = {
        // New sources count in full from 1000 ms; duplicates are summed;
        // blank padding is cut; an over-long or broken line is skipped.
        {line("a", 1, 600) + line("b", 2, 1500) + line("dup", 1, 700) + line("dup  ", 1, 700) +
             line(std::string(80, 'n'), 1, 5000) + "garbage\n" + line("c", 1, 2000),
         {"b|2|1500", "c|1|2000", "dup|2|1400"}},
        // Growth below 1000 ms waits; "deleted" ends the reading.
        {line("b", 3, 2000) + line("c", 2, 3200) + "deleted\t\t1\t\t0\t\t0\t\t0\t\t0\t\t9\n" +
             line("z", 1, 9000),
         {"c|1|1200"}},
        // A source held 600 ms, then 1300 in all, counts once whole; a count
        // that went down re-baselines without counting.
        {line("b", 4, 2600) + line("c", 1, 3300) + line("a", 1, 1300), {"a|1|1300", "b|2|1100"}},
        {line("c", 2, 4400), {"c|1|1100"}},
    };
    KernelWakelockReader reader;
    const std::string path = root.path() + "/wakeup_sources";
    for (const auto& r : kReadings) {
        kelvo::test::writeHostFile(path, title + r.body);
        std::vector<KernelWakelockReader::increment> out;
        ASSERT_EQ(0, reader.read(path, &out));
        std::vector<std::string> got;
        for (const auto& inc : out) {
            got.push_back(inc.name + "|" + std::to_string(inc.count) + "|" +
                          std::to_string(inc.time));
        }
        EXPECT_EQ(r.increments, got) << r.body;
    }
    EXPECT_EQ(-14, reader.read(root.path() + "/missing", nullptr));
}

}  // namespace

namespace {

// Partial wakelock increments, reading after reading; "U|name|tag|ms".
TEST(PartialWakelockTrackerTest, IncrementsBetweenReadings) {
    auto rec = [](int uid, const std::string& name, const std::string& tag, long long held) {
        return "uid=" + std::to_string(uid) + " prevent_time=" + std::to_string(held) +
               " ws_name=" + name + " tag=" + tag;
    };
    const struct {
        std::vector<std::string> texts;
        std::vector<std::string> increments;
    } kReadings[] = {
        // A restart: the first reading only fills the baseline.
        {{rec(1000, "a", "t", 50000)}, {}},
        // Duplicate keys are summed first; empty names read as NULL; a
        // broken record is skipped; below 1000 ms waits.
        {{rec(1000, "a", "t", 50500), rec(10010, "", "", 700), rec(10010, "", "", 700),
          "uid=x prevent_time=1", rec(10020, "b", "u", 900)},
         {"10010|NULL|NULL|1400"}},
        // Held time that went down re-baselines; growth accumulates.
        {{rec(1000, "a", "t", 51000), rec(10010, "", "", 100), rec(10020, "b", "u", 1900)},
         {"1000|a|t|1000", "10020|b|u|1900"}},
        {{rec(10010, "", "", 1200)}, {"10010|NULL|NULL|1100"}},
    };
    PartialWakelockTracker tracker(true);
    for (const auto& r : kReadings) {
        std::vector<PartialWakelockTracker::increment> out;
        tracker.update(r.texts, &out);
        std::vector<std::string> got;
        for (const auto& inc : out) {
            got.push_back(std::to_string(inc.uid) + "|" + inc.name + "|" + inc.tag + "|" +
                          std::to_string(inc.duration));
        }
        EXPECT_EQ(r.increments, got) << r.texts[0];
    }
}

// DDR residency of twelve levels, the time in the last column beyond 128
// bytes; growth per level between readings.
TEST(DdrFrequencyReaderTest, TwelveLevels) {
    kelvo::test::TempRoot root;
    auto table = [](long long bump) {
        std::string text = "     From  :   To\n           :";
        for (int i = 0; i < 12; ++i) text += "  " + std::to_string((i + 1) * 100000000LL);
        text += "   time(ms)\n";
        for (int i = 0; i < 12; ++i) {
            text += (i == 3 ? "*" : " ") + std::string("  ") +
                    std::to_string((i + 1) * 100000000LL) + ":";
            for (int j = 0; j < 12; ++j) text += "         7";
            text += "    " + std::to_string(1000 * (i + 1) + (i == 11 ? bump : 0)) + "\n";
        }
        return text + "Total transition : 77\n";
    };
    const std::string path = root.path() + "/trans_stat";
    kelvo::test::writeHostFile(path, table(0));
    EXPECT_EQ(12, DdrFrequencyReader::countLevels(path));
    DdrFrequencyReader reader;
    std::vector<std::pair<int64_t, int64_t>> out;
    ASSERT_EQ(0, reader.read(path, false, &out));
    ASSERT_EQ(12u, out.size());
    EXPECT_EQ(std::make_pair(1200000000LL, 12000LL),
              std::make_pair(static_cast<long long>(out[11].first),
                             static_cast<long long>(out[11].second)));
    kelvo::test::writeHostFile(path, table(345));
    out.clear();
    ASSERT_EQ(0, reader.read(path, false, &out));
    ASSERT_EQ(1u, out.size());
    EXPECT_EQ(345, out[0].second);
    EXPECT_EQ(-14, DdrFrequencyReader::countLevels(root.path() + "/none"));
}

}  // namespace

namespace {

// Little-endian record builder.
struct Bytes {
    std::string b;
    template <typename T>
    Bytes& put(T v) {
        b.append(reinterpret_cast<const char*>(&v), sizeof(v));
        return *this;
    }
    Bytes& text(const std::string& s, size_t size) {
        std::string t = s.substr(0, size);
        t.resize(size, '\0');
        b += t;
        return *this;
    }
};

std::string binderEntry(const std::string& service, const std::string& client, int32_t count) {
    Bytes e;
    e.put<int32_t>(1000).put<int32_t>(1).text(service, 48);
    e.put<int32_t>(1001).put<int32_t>(2).text(client, 48).put<int32_t>(count);
    return e.b;
}

// Entries from the kernel driver and the framework: rows they leave, and
// hostile ones refused whole (counted, no rows).
TEST_F(SystemHandlerTest, BufferedRecords) {
    auto send = [this](const char* sender, int32_t magic, const std::string& bytes) {
        Parcel p;
        p.writeInt64(kH);
        p.writeString8(String8(sender));
        p.writeInt32(magic);
        p.writeInt32(static_cast<int32_t>(bytes.size()));
        p.write(bytes.data(), bytes.size());
        return mHandler->sendMessageSync(ParcelMessage(MESSAGE_BUFFERED_LOG, 0, p));
    };
    auto echo = [](int32_t n) { return Bytes().put<int64_t>(kH).put<int32_t>(2).put<int32_t>(n); };
    // A full 48-byte name without its terminator stays within its field.
    const std::string longName(48, 's');
    Bytes binder = echo(3);
    binder.b += binderEntry(longName, "b", 5) + binderEntry(longName, "b", 2) +
                binderEntry("b", longName, 4);
    Bytes kworker = echo(1);
    kworker.text("worker_fn", 64).put<int64_t>(9).put<int64_t>(77);
    Bytes daily;
    daily.put<int32_t>(0).put<int64_t>(kH).put<int64_t>(111).put<int64_t>(222);
    for (int i = 0; i < 8; ++i) daily.put<int32_t>(i);

    Bytes phone;
    phone.put<int32_t>(1).put<int32_t>(0).put<int32_t>(460).put<int32_t>(1).put<int32_t>(3);
    phone.put<int32_t>(1);
    Bytes package;
    package.put<int32_t>(1).text("p'q", 128).text("1.0", 32);

    const uint64_t refused = HealthCounters::get(Health::BufferedEntryRefused);
    const struct {
        const char* sender;
        int32_t magic;
        std::string bytes;
        int32_t result;
    } kEntries[] = {
        {"kelvo_driver", 3, binder.b, 0},
        {"kelvo_driver", 3, echo(4).b + binderEntry("x", "y", 1), -2},  // count beyond entry
        {"kelvo_driver", 3, echo(-1).b, -2},                            // negative count
        {"kelvo_driver", 3, std::string(10, '\0'), -2},                 // short header
        {"kelvo_driver", 1, kworker.b, 0},
        {"kelvo_driver", 1, echo(1000000).b + kworker.b.substr(16), -2},  // huge count
        {"kelvo_driver", 2, echo(0).b, 0},                                // no uevents
        {"KelvoService", 0, daily.b.substr(0, 59), -2},                   // short record
        {"KelvoService", 0, daily.b, 0},
        {"someone", 0, daily.b, -3},
        {"KelvoService", 1, phone.b, 0},
        {"KelvoService", 1, "\x02" + phone.b.substr(1), -2},  // two counted, one sent
        {"KelvoService", 2, package.b, 0},
    };
    for (const auto& e : kEntries) {
        EXPECT_EQ(e.result, send(e.sender, e.magic, e.bytes)) << e.sender << " " << e.magic;
    }
    EXPECT_EQ(refused + 7, HealthCounters::get(Health::BufferedEntryRefused));
    EXPECT_EQ(std::vector<std::string>{longName + "|b|7|4"},
              rows("SELECT service, client, forward, backward FROM raw_binder_stats"));
    EXPECT_EQ(std::vector<std::string>{"0|460|1|3|1"},
              rows("SELECT sub_id, mcc, mnc, data_switch, voice_switch FROM raw_mobile_phone"));
    EXPECT_EQ(std::vector<std::string>{"p'q|1.0"},
              rows("SELECT name, version FROM raw_package_version"));
    EXPECT_EQ(std::vector<std::string>{"worker_fn|9|77"},
              rows("SELECT symbol, count, time FROM raw_kworker"));
    EXPECT_EQ(
        (std::vector<std::string>{"storage_available|222", "storage_free|111", "storage_usb|1"}),
        rows("SELECT name, value FROM daily_misc_data WHERE name IN ('storage_free', "
             "'storage_available', 'storage_usb') ORDER BY name"));
}

}  // namespace

namespace {

// A handler of a log user type that collects kernel statistics, with the
// sample configuration, on a fixed clock.
class SystemLateInitTest : public SystemHandlerTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        WallClock::setFixedTimeMs(kH);
        mUserType = gLogUserType.exchange(3);
        ASSERT_TRUE(mDriver.start());
        // The process-wide server listens below the root of its first start.
        ASSERT_EQ(0, BufferedLogServer::getInstance()->start());
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         kelvo::test::readHostFile(KELVO_SAMPLE_CONFIG));
        XmlParser::resetInstance();
        SystemHandlerTest::addTables();
    }
    void TearDown() override {
        SystemHandlerTest::TearDown();
        gLogUserType = mUserType;
        XmlParser::resetInstance();
        SystraceDumper::getInstance()->resetForTest();
        WallClock::setFixedTimeMs(-1);
        unsetenv("TZ");
        tzset();
    }
    int32_t mUserType = 0;
    fake::FakeKernelDriver mDriver;
};

// A restart takes back today's trace dumps (the daily tick clears them), the
// application types and the configuration's version.
TEST_F(SystemLateInitTest, RestartReadsItsStateBack) {
    for (int64_t t : {kH - 1000, kH - 2000, kH - 11 * kHour}) {
        Parcel misc;
        misc.writeInt64(t);
        misc.writeString8(String8("systrace"));
        misc.writeString8(String8("1"));
        mHandler->sendMessageSync(
            ParcelMessage(MESSAGE_CUSTOMIZED, SystemHandler::MESSAGE_MISC_DATA, misc));
    }
    run({SystemHandler::TAG_APP_TYPE, 0, "count=1 flag=1 name=com.typed type=6"});
    Parcel forget;
    forget.writeString8(String8("com.typed"));
    forget.setDataPosition(0);
    PackageProperty::getInstance()->removePackageType(forget);
    restart();
    EXPECT_EQ(2, SystraceDumper::getInstance()->getDumpCount());
    EXPECT_EQ(6, PackageProperty::getInstance()->getPackageType(String8("com.typed")));
    EXPECT_EQ(std::vector<std::string>{"SIM_1.0.0"},
              rows("SELECT value FROM about_kelvo_daemon WHERE key = 'xml_version'"));
    Parcel day;
    day.writeInt64(kH);
    day.writeInt64(kH);
    notify(NOTIFICATION_DAILY_TICK, day);
    EXPECT_EQ(0, SystraceDumper::getInstance()->getDumpCount());
    EXPECT_TRUE(mDriver.state().flags[KelvoDevice::kSetLogStatsEnable]);
}

// Binder statistics asked at a foreground change and kernel workers asked
// at the hourly tick come back from the driver over the buffered log.
TEST_F(SystemLateInitTest, DriverReportsBecomeRows) {
    if (!kelvo::test::hostPathExists(mRoot->path() + "/dev/socket/" +
                                     BufferedLogClient::kSocketName)) {
        GTEST_SKIP() << "the process-wide buffered log server listens below another root";
    }
    LogCapture capture;
    fake::FakeDriverReporter reporter(mDriver);
    reporter.start();
    mDriver.update([](fake::FakeKernelDriver::State& s) {
        s.binderCalls = {{10020, 11, "com.server", 10030, 22, "com.app", 4},
                         {10030, 22, "com.app", 10020, 11, "com.server", 3},
                         {10020, 11, "com.server", 10030, 22, "com.app", 1}};
        s.kworkers = {{"flush_to_disk", 7, 120}};
    });
    Parcel foreground;
    foreground.writeInt64(kH + 1000);
    foreground.writeString8(String8("com.app"));
    notify(NOTIFICATION_FOREGROUND_CHANGED, foreground);
    Parcel tick;
    tick.writeInt64(kH + 5);
    tick.writeInt64(kH);
    notify(NOTIFICATION_HOURLY_TICK, tick);
    const std::string binder =
        "SELECT end_time, service, client, forward, backward, foreground FROM raw_binder_stats";
    const std::string kworker = "SELECT timestamp, symbol, count, time FROM raw_kworker";
    ASSERT_TRUE(waitFor([&] { return !rows(binder).empty() && !rows(kworker).empty(); }));
    EXPECT_EQ(std::vector<std::string>{at(1000) + "|com.server|com.app|5|3|1"}, rows(binder));
    EXPECT_EQ(std::vector<std::string>{at(0) + "|flush_to_disk|7|120"}, rows(kworker));
    EXPECT_EQ(0u, capture.count("Invalid data length"));
}

}  // namespace

namespace {

// The real hourly and polling routines around the system handler: a round
// it takes part in ends on its votes, not on the one-minute time-out, and
// the hour's wake-ups reach the hourly upload.
class SystemRoundTest : public SystemHandlerTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        WallClock::setFixedTimeMs(kH - 600000);
        SystemHandlerTest::addTables();
        HourlyRoutine::setVoteTimeoutMs(0);
        mRoutine = new HourlyRoutine();
        mPolling = new PollingRoutine();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mPolling.get()),
                                    static_cast<StorageOperator*>(AppsAccounting::getInstance()),
                                    static_cast<StorageOperator*>(DataUploader::getInstance())}) {
            op->addSchemaTable();
        }
    }
    void SetUp() override {
        SystemHandlerTest::SetUp();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_POLLING, mPolling);
        for (const sp<KelvoOperator>& op :
             {sp<KelvoOperator>(mRoutine), sp<KelvoOperator>(mPolling)}) {
            op->earlyInitialize();
            op->initialize();
        }
        // The handler's electors, now that the routine runs.
        mHandler->setCandidateElector();
    }
    void TearDown() override {
        for (const sp<KelvoOperator>& op :
             {sp<KelvoOperator>(mRoutine), sp<KelvoOperator>(mPolling)}) {
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_POLLING, nullptr);
        SystemHandlerTest::TearDown();
        WallClock::setFixedTimeMs(-1);
        unsetenv("TZ");
        tzset();
    }

    sp<HourlyRoutine> mRoutine;
    sp<PollingRoutine> mPolling;
};

TEST_F(SystemRoundTest, RoundEndsOnTheHandlersVotes) {
    run({S, -300000, ""});
    run({W, -200000, "irq=X gpio=0"});
    run({R, -100000, ""});
    const std::string ticks = "SELECT id FROM debug_hourly_tick";
    const uint64_t refused = HealthCounters::get(Health::RoutineRequestsRefused);
    auto started = std::chrono::steady_clock::now();
    WallClock::setFixedTimeMs(kH + 500);
    mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
    ASSERT_TRUE(waitFor([&] { return !rows(ticks).empty(); }, std::chrono::milliseconds(30000)));
    EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(20));
    EXPECT_EQ(refused, HealthCounters::get(Health::RoutineRequestsRefused));
    EXPECT_EQ(std::vector<std::string>{at(0) + "|200000|1"},
              rows("SELECT timestamp, duration, count FROM hourly_system_suspend"));
    bool uploaded = false;
    for (const Json::Value& e : events()) {
        if (e["event"].asUInt() == EVENT_HOURLY_COMPONENTS) {
            uploaded = uploaded || e["params"]["29"][0]["params"]["0"].asString() == "X";
        }
    }
    EXPECT_TRUE(uploaded);
}

}  // namespace
