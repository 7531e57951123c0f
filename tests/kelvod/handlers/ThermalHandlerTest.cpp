// The thermal handler: episodes from its log tags to the rows and the upload
// of each component's usage and energy, the daily tick and the daily
// statistics "Pelmora" answers over the buffered log, and the votes.

#include <gtest/gtest.h>
#include <json/json.h>
#include <time.h>
#include <utils/String16.h>

#include <map>
#include <mutex>
#include <thread>

#include "HealthCounters.h"
#include "core/BufferedLogServer.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "handlers/ThermalHandler.h"
#include "handlers/components/BatteryHandler.h"
#include "handlers/components/CpuHandler.h"
#include "handlers/components/DisplayHandler.h"
#include "handlers/components/GnssHandler.h"
#include "kelvo/BufferedLogClient.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/DataUploader.h"
#include "utils/TimeProvider.h"

using android::Parcel;
using android::sp;
using android::String8;
using namespace kelvo;

namespace {

constexpr int64_t kMin = 60000;
constexpr int64_t kDay = 86400000;
constexpr int64_t kT0 = 1796515200000LL + 10 * 3600000;  // 2026-12-06 10:00 UTC
constexpr int64_t kDelayMs = 150;

// Stands in for the hourly routine: "candidate@time" of each vote.
class VoteCapture : public KelvoOperator {
public:
    VoteCapture() : KelvoOperator("VoteCapture", -1, 0) {}
    int32_t handleCustomized(int32_t code, const Parcel& d, Parcel*) override {
        if (code != 0) return 0;
        int64_t time = d.readInt64();
        std::lock_guard<std::mutex> g(mLock);
        mVotes.push_back(std::to_string(d.readInt32()) + "@" + std::to_string(time));
        return 0;
    }
    std::vector<std::string> votes() {
        sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));
        std::lock_guard<std::mutex> g(mLock);
        return mVotes;
    }

private:
    std::mutex mLock;
    std::vector<std::string> mVotes;
};

std::string date(int64_t t) {
    return TimeProvider(t).toString(TIME_FORMAT_DATE, true);
}

class ThermalTest : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", mZone, 1);
        tzset();
        WallClock::setFixedTimeMs(kT0);
        ThermalHandler::setDelaysForTest(kDelayMs, kDelayMs);
        ASSERT_EQ(0, BufferedLogServer::getInstance()->start());
        // The component tables the episode is summed from, as their owners
        // define them.
        for (sp<KelvoOperator> op :
             {sp<KelvoOperator>(new BatteryHandler()), sp<KelvoOperator>(new DisplayHandler()),
              sp<KelvoOperator>(new CpuHandler()), sp<KelvoOperator>(new GnssHandler())}) {
            op->addSchemaTable();
            op->requestThreadExit();
            op->join();
        }
        mThermal = new ThermalHandler();
        mThermal->addSchemaTable();
        DataUploader::getInstance()->addSchemaTable();
    }
    void SetUp() override {
        kelvo::test::AgentStorageTest::SetUp();
        mHourly = new VoteCapture();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mHourly);
        ASSERT_EQ(0, mThermal->earlyInitialize());
        mThermal->initialize();
        mRefused = HealthCounters::get(Health::ThermalInputRefused);
    }
    void TearDown() override {
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        for (sp<KelvoOperator> op : {sp<KelvoOperator>(mThermal), sp<KelvoOperator>(mHourly)}) {
            op->requestThreadExit();
            op->join();
        }
        mThermal->readyToDestroy();
        Dispatcher::resetForTest();
        ThermalHandler::setDelaysForTest(0, 0);
        WallClock::setFixedTimeMs(-1);
        kelvo::test::AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }
    void trigger(int32_t tag, int64_t t) {
        Parcel p;
        p.writeInt64(t);
        p.writeCString("reason=cpu");
        mThermal->sendMessageSync(ParcelMessage(MESSAGE_LOGGER, tag, p));
    }
    void dailyTick(int64_t hour) {
        Parcel p;
        p.writeInt64(hour + 500);
        p.writeInt64(hour);
        mThermal->sendMessage(ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_DAILY_TICK, p));
    }
    // Waits for the delayed work (episode records, answer time-outs).
    void settle() {
        std::this_thread::sleep_for(std::chrono::milliseconds(3 * kDelayMs));
        mThermal->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));
    }
    std::vector<Json::Value> uploads(uint32_t id) {
        std::vector<Json::Value> out;
        for (const Json::Value& e : events()) {
            if (e["event"].asUInt() == id) out.push_back(e["params"]);
        }
        return out;
    }
    int64_t refused() { return HealthCounters::get(Health::ThermalInputRefused) - mRefused; }
    // Names itself "Pelmora" and waits until the server knows it.
    void connectPelmora(BufferedLogClient& client) {
        if (!kelvo::test::hostPathExists(mRoot->path() + "/dev/socket/" +
                                         BufferedLogClient::kSocketName)) {
            GTEST_SKIP() << "the process-wide buffered log server listens below another root";
        }
        ASSERT_EQ(0, client.connect(ThermalHandler::kSender));
        ASSERT_TRUE(kelvo::test::waitFor([] {
            int32_t probe = 0;
            return BufferedLogServer::getInstance()->requestLogMessage(
                       String8(ThermalHandler::kSender), 7, &probe, sizeof(probe)) == 0;
        }));
        int32_t magic = 0;
        std::string data;
        ASSERT_EQ(0, client.receive(&magic, &data, 2000));
    }

    const char* mZone = "UTC";
    sp<ThermalHandler> mThermal;
    sp<VoteCapture> mHourly;
    uint64_t mRefused = 0;
};

struct EpisodeCase {
    const char* name;
    bool charging;
    std::vector<std::pair<int32_t, int64_t>> triggers;  // tag, time after kT0
    std::vector<std::pair<int64_t, int64_t>> episodes;  // uploaded windows
    int64_t refused;
    int64_t display, cpu, gnss;  // energies of the first upload
};

void PrintTo(const EpisodeCase& c, std::ostream* os) {
    *os << c.name;
}

class EpisodeTest : public ThermalTest, public ::testing::WithParamInterface<EpisodeCase> {};

// Rows of the first window (0, 10 min]: the battery gave 5 mAh (18000 after
// × 3600); accounted were display 6000, CPU 12000 and GNSS 6000, so the
// factor is 0.75. Rows on the window's edges outside it count nothing.
TEST_P(EpisodeTest, UploadsEachEpisodeOverItsWindow) {
    const EpisodeCase& c = GetParam();
    kelvo::test::DirectDb db(dbPath());
    auto insert = [&db](const std::string& table, std::string columns, int64_t end,
                        const std::string& values) {
        db.exec("INSERT INTO " + table + " (start_time, end_time, " + columns + ") VALUES (" +
                std::to_string(end - kMin) + "," + std::to_string(end) + "," + values + ")");
    };
    // The four usage buckets' (usage, energy) columns.
    auto both = [](const char* unit) {
        std::string out;
        for (const char* b :
             {"foreground_", "background_", "charge_foreground_", "charge_background_"}) {
            out += std::string(out.empty() ? "" : ", ") + b + unit + ", " + b + "energy";
        }
        return out;
    };
    for (int64_t end : {kT0, kT0 + 10 * kMin, kT0 + 10 * kMin + 1}) {
        const std::string k = end == kT0 + 10 * kMin ? "" : "000";  // outside rows are large
        insert("raw_component_battery",
               "discharge_screen_on_gas_gauge, discharge_screen_off_gas_gauge, "
               "discharge_screen_on_level, discharge_screen_off_level, charge_screen_on_duration, "
               "charge_screen_off_duration",
               end, std::string("3, 2, 1, 1, ") + (c.charging ? "1000" : "0") + ", 0");
        insert("raw_applications_backlight",
               "name, duration, energy, charge_duration, charge_energy", end,
               "'a', 600000, 6000" + k + ", 0, 0");
        insert("raw_component_cpu", both("time"), end,
               "300000, 10000" + k + ", 100000, 2000, 0, 0, 0, 0");
        insert("raw_component_gnss", both("duration"), end,
               "200000, 4000" + k + ", 0, 2000, 0, 0, 0, 0");
    }
    for (const auto& [tag, t] : c.triggers) trigger(tag, kT0 + t);
    settle();
    std::vector<std::string> windows;
    for (const auto& [start, end] : c.episodes) {
        windows.push_back(std::to_string(kT0 + start) + "|" + std::to_string(kT0 + end));
    }
    EXPECT_EQ(windows, rows("SELECT start_time, end_time FROM raw_thermal_abnormality"));
    std::vector<Json::Value> up = uploads(EVENT_THERMAL_ABNORMALITY);
    ASSERT_EQ(c.episodes.size(), up.size());
    for (size_t i = 0; i < up.size(); ++i) {
        EXPECT_EQ(date(kT0 + c.episodes[i].first), up[i]["0"].asString());
        EXPECT_EQ(date(kT0 + c.episodes[i].second), up[i]["1"].asString());
    }
    if (!up.empty()) {
        EXPECT_EQ(c.display, up[0]["4"].asInt64());
        EXPECT_EQ(c.cpu, up[0]["6"].asInt64());
        EXPECT_EQ(c.gnss, up[0]["8"].asInt64());
    }
    EXPECT_EQ(c.refused, refused());
}

constexpr int32_t kIn = ThermalHandler::TAG_HIGH_TEMP_ENTER;
constexpr int32_t kOut = ThermalHandler::TAG_HIGH_TEMP_EXIT;

// clang-format off
INSTANTIATE_TEST_SUITE_P(Thermal, EpisodeTest, ::testing::Values(
    EpisodeCase{"Scaled", false, {{kIn, 0}, {kOut, 10 * kMin}}, {{0, 10 * kMin}}, 0, 4500, 9000, 4500},
    EpisodeCase{"ChargingUnscaled", true, {{kIn, 0}, {kOut, 10 * kMin}}, {{0, 10 * kMin}}, 0,
                6000, 12000, 6000},
    // The next episode starts before the first is summed.
    EpisodeCase{"EnterSoonAfterExit", false,
                {{kIn, 0}, {kOut, 10 * kMin}, {kIn, 10 * kMin + 30000}, {kOut, 12 * kMin}},
                {{0, 10 * kMin}, {10 * kMin + 30000, 12 * kMin}}, 0, 4500, 9000, 4500},
    // The second enter is too near; its exit then finds no episode.
    EpisodeCase{"EntersFiveMinutesApart", false,
                {{kIn, 0}, {kOut, kMin}, {kIn, 5 * kMin}, {kOut, 6 * kMin}}, {{0, kMin}}, 2, 0, 0, 0},
    EpisodeCase{"ClockSetBack", false,
                {{kIn, 0}, {kOut, kMin}, {kIn, -60 * kMin}, {kOut, -50 * kMin}},
                {{0, kMin}, {-60 * kMin, -50 * kMin}}, 0, 0, 0, 0}),
    [](const ::testing::TestParamInfo<EpisodeCase>& info) { return info.param.name; });
// clang-format on

// Ten episodes a day; the eleventh waits for the next day.
TEST_F(ThermalTest, EleventhEpisodeWaitsForTheNextDay) {
    dailyTick(kT0 - 10 * 3600000);
    for (int64_t i = 0; i < 11; ++i) {
        trigger(kIn, kT0 + i * 11 * kMin);
        trigger(kOut, kT0 + i * 11 * kMin + kMin);
    }
    dailyTick(kT0 + 14 * 3600000);
    trigger(kIn, kT0 + 14 * 3600000 + kMin);
    trigger(kOut, kT0 + 14 * 3600000 + 2 * kMin);
    settle();
    EXPECT_EQ(11u, rows("SELECT id FROM raw_thermal_abnormality").size());
    EXPECT_EQ(2, refused());  // the eleventh enter and its exit
}

// The midnight round cleans the day's rows after the daily step: an episode
// that ended before the tick is summed before the vote.
TEST_F(ThermalTest, DailyVoteWaitsForTheEpisodeBeforeIt) {
    ThermalHandler::setDelaysForTest(1000, kDelayMs);
    trigger(kIn, kT0);
    trigger(kOut, kT0 + kMin);
    dailyTick(kT0 + 14 * 3600000);
    mThermal->sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));
    EXPECT_TRUE(mHourly->votes().empty());
    ASSERT_TRUE(kelvo::test::waitFor([&] { return mHourly->votes().size() == 1; }));
    EXPECT_EQ(1u, uploads(EVENT_THERMAL_ABNORMALITY).size());
}

// Pelmora answers the daily request with the entry the case builds; the
// rows, the uploads and the one vote of the day.
struct AnswerCase {
    const char* name;
    std::function<void(Parcel&, int64_t day)> body;
    size_t applications, shell, scenes;
    std::map<std::string, int64_t> shellCounts;  // uploaded, by parameter
    int64_t refused;
};

void PrintTo(const AnswerCase& c, std::ostream* os) {
    *os << c.name;
}

class AnswerTest : public ThermalTest, public ::testing::WithParamInterface<AnswerCase> {};

void pairs(Parcel& p, const std::vector<std::pair<const char*, int32_t>>& list, int32_t extra = 0) {
    Parcel section;
    for (const auto& [range, count] : list) {
        section.writeString16(android::String16(range));
        section.writeInt32(count);
    }
    p.writeInt32(static_cast<int32_t>(section.dataSize()) + extra);
    p.write(section.data(), section.dataSize());
}

void scene(Parcel& p) {
    p.writeInt64(kT0 - kMin);
    p.writeInt64(kT0);
    p.writeString16(android::String16("com.game"));
    p.writeString16(android::String16("com.home"));
    for (int32_t v : {38, 41, 45}) p.writeInt32(v);
    p.writeInt64(kT0 - 30000);
    for (int32_t i = 0; i < 2 + 20 + 2; ++i) p.writeInt32(100 + i);
    for (const char* top : {"com.game", "com.video", "com.maps"}) {
        p.writeString16(android::String16(top));
    }
    p.writeInt32(39);
    p.writeInt32(40);
}

TEST_P(AnswerTest, StoresWhatFitsAndVotesOnce) {
    const AnswerCase& c = GetParam();
    BufferedLogClient pelmora;
    connectPelmora(pelmora);
    if (IsSkipped() || HasFatalFailure()) return;
    int32_t magic = -1;
    std::string request;
    const int64_t day = kT0 - 10 * 3600000;
    dailyTick(day);
    ASSERT_EQ(0, pelmora.receive(&magic, &request, 2000));
    ASSERT_EQ(sizeof(int64_t), request.size());
    int64_t asked = 0;
    memcpy(&asked, request.data(), sizeof(asked));
    EXPECT_EQ(day, asked);
    Parcel answer;
    c.body(answer, day);
    ASSERT_EQ(0, pelmora.send(0, answer.data(), answer.dataSize()));
    ASSERT_TRUE(kelvo::test::waitFor([&] { return !mHourly->votes().empty(); }));
    settle();
    EXPECT_EQ(std::vector<std::string>{"5@" + std::to_string(day)}, mHourly->votes());
    EXPECT_EQ(c.applications, rows("SELECT name FROM daily_thermal_applications").size());
    EXPECT_EQ(c.shell, rows("SELECT count FROM daily_thermal_shell").size());
    EXPECT_EQ(c.scenes, rows("SELECT top_time FROM raw_thermal_heat_scene").size());
    std::vector<Json::Value> scenes = uploads(EVENT_THERMAL_SCENE);
    EXPECT_EQ(c.scenes, scenes.size());
    // The scene's values (100 + their place after the top time) where each belongs.
    const std::map<std::string, int64_t> kPlaces = {{"4", 45},   {"6", 100},  {"8", 102},
                                                    {"26", 120}, {"28", 121}, {"30", 123},
                                                    {"31", 40},  {"32", 39}};
    for (const auto& [param, value] : kPlaces) {
        if (!scenes.empty()) {
            EXPECT_EQ(value, scenes[0][param].asInt64()) << param;
        }
    }
    if (!scenes.empty()) {
        EXPECT_EQ("com.video", scenes[0]["27"]["params"]["11"]["params"]["0"].asString());
    }
    std::vector<Json::Value> shell = uploads(EVENT_THERMAL_SHELL);
    ASSERT_EQ(c.shellCounts.empty() ? 0u : 1u, shell.size());
    std::map<std::string, int64_t> counts;
    for (const std::string& id :
         shell.empty() ? std::vector<std::string>() : shell[0].getMemberNames()) {
        if (shell[0][id].isIntegral()) counts[id] = shell[0][id].asInt64();
    }
    EXPECT_EQ(c.shellCounts, counts);
    EXPECT_EQ(c.refused, refused());
}

void full(Parcel& p, int64_t day) {
    p.writeInt64(day);
    p.writeInt32(0);
    p.writeInt32(2);
    p.writeString16(android::String16("com.game"));
    pairs(p, {{"Range3", 4}, {"Range4", 1}});
    p.writeString16(android::String16("com.maps"));
    pairs(p, {{"Range3", 2}});
    p.writeInt32(1);
    // Range21 and a name of another form are stored but not uploaded.
    pairs(p, {{"Range0", 5}, {"Range20", 1}, {"Range21", 7}, {"Hot", 2}});
    p.writeInt32(2);
    p.writeInt32(1);
    scene(p);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Thermal, AnswerTest, ::testing::Values(
    AnswerCase{"ThreeTables", full, 3, 4, 1, {{"1", 5}, {"21", 1}}, 2},
    AnswerCase{"OtherDay", [](Parcel& p, int64_t day) { full(p, day - kDay); }, 0, 0, 0, {}, 1},
    AnswerCase{"CountPastTheData", [](Parcel& p, int64_t day) {
        p.writeInt64(day); p.writeInt32(2); p.writeInt32(1000); scene(p);
    }, 0, 0, 0, {}, 1},
    AnswerCase{"LengthPastTheEnd", [](Parcel& p, int64_t day) {
        p.writeInt64(day); p.writeInt32(1); pairs(p, {{"Range1", 3}}, 64);
    }, 0, 0, 0, {}, 1},
    AnswerCase{"UnknownBlockEndsTheEntry", [](Parcel& p, int64_t day) {
        p.writeInt64(day); p.writeInt32(1); pairs(p, {{"Range1", 3}});
        p.writeInt32(9); p.writeInt32(1); pairs(p, {{"Range2", 3}});
    }, 0, 1, 0, {{"2", 3}}, 1}),
    [](const ::testing::TestParamInfo<AnswerCase>& info) { return info.param.name; });
// clang-format on

// A 23-hour day (clocks forward) is a day: its tick asks again. A second
// tick in one day votes at once; without an answer the vote comes after
// the wait.
class DstTest : public ThermalTest {
protected:
    void addTables() override {
        mZone = "CET-1CEST,M3.5.0,M10.5.0/3";
        ThermalTest::addTables();
    }
};

TEST_F(DstTest, ShortDayIsANewDay) {
    BufferedLogClient pelmora;
    connectPelmora(pelmora);
    if (IsSkipped() || HasFatalFailure()) return;
    struct tm day = {};
    day.tm_year = 2026 - 1900;
    day.tm_mon = 2;
    day.tm_mday = 29;  // the last Sunday of March
    day.tm_isdst = -1;
    const int64_t first = static_cast<int64_t>(mktime(&day)) * 1000;
    day.tm_mday = 30;
    day.tm_isdst = -1;
    const int64_t second = static_cast<int64_t>(mktime(&day)) * 1000;
    ASSERT_EQ(23 * 3600000, second - first);
    std::vector<int64_t> asked;
    for (int64_t tick : {first, first + 3600000, second}) {
        dailyTick(tick);
        int32_t magic = 0;
        std::string request;
        if (pelmora.receive(&magic, &request, 300) == 0 && request.size() == sizeof(int64_t)) {
            asked.push_back(0);
            memcpy(&asked.back(), request.data(), sizeof(int64_t));
        }
        settle();
    }
    EXPECT_EQ((std::vector<int64_t>{first, second}), asked);
    EXPECT_EQ((std::vector<std::string>{"5@" + std::to_string(first),
                                        "5@" + std::to_string(first + 3600000),
                                        "5@" + std::to_string(second)}),
              mHourly->votes());
}

}  // namespace
