// The audio handler end to end: log-device messages, the accounting library
// with the sample profile, the fake audio framework, the real hourly
// routine, rows read from the database and the uploaded events.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include <atomic>
#include <cstdio>
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
#include "handlers/SystemHandler.h"
#include "handlers/components/AudioHandler.h"
#include "handlers/components/BluetoothHandler.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/PackageProperty.h"
#include "utils/TimeProvider.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using android::String8;
using namespace kelvo;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kMidnight = 1796515200000LL;
constexpr int64_t kH = kMidnight + 10 * kHour;
constexpr int64_t kT = kH - 20 * 60000;

std::atomic<int64_t> gMonotonic{0};
int64_t monotonic() {
    return gMonotonic.load();
}

const column_attribute kMiscColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"}, {COLUMN_TEXT, "value"}};
const table_attribute kMiscTable = {"1.0", 1, 3, kMiscColumns, "daily_misc_data"};

// Stands for the system handler (stores daily records) and the polling
// routine (turns the hourly tick into the hour's data poll).
class Peer : public KelvoOperator {
public:
    Peer() : KelvoOperator("AudioPeer", -1, 0) {}
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
    int32_t handleCustomized(int32_t code, const Parcel& data, Parcel*) override {
        return code == SystemHandler::MESSAGE_MISC_DATA ? insertEntries(kMiscTable, data, 1, false)
                                                        : 0;
    }
};

class AudioHandlerTest : public test::AgentStorageTest {
protected:
    virtual int32_t policy() const { return 1; }
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        WallClock::setFixedTimeMs(kT);
        gMonotonic = 1000000;
        TimeProvider::setMonotonicSource(&monotonic);
        std::string config = test::readHostFile(KELVO_SAMPLE_CONFIG);
        size_t audio = config.find("<component id=\"2\">", config.find("<element id=\"2\">"));
        size_t value = config.find("<parameter>", audio) + 11;
        config.replace(value, 1, std::to_string(policy()));
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml", config);
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        HourlyRoutine::setVoteTimeoutMs(0);
        ServiceControl::setServiceWaitMs(300);
        mServices.reset(new PlatformServices());
        ASSERT_EQ(android::NO_ERROR, mServices->startAll());
        mServices->state()->setPackages(10010, {"com.a"});
        mServices->state()->setPackages(10020, {"com.b"});
        for (int32_t uid : {10010, 10020}) PackageProperty::getInstance()->removeUid(uid);
        mRoutine = new HourlyRoutine();
        mPeer = new Peer();
        mAudio = new AudioHandler();
        mBluetooth = new BluetoothHandler();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mAudio.get()),
                                    static_cast<StorageOperator*>(mBluetooth.get()),
                                    static_cast<StorageOperator*>(AppsAccounting::getInstance()),
                                    static_cast<StorageOperator*>(DataUploader::getInstance())}) {
            op->addSchemaTable();
        }
        StorageOperator::addSchema(kMiscTable);
    }
    void SetUp() override {
        test::AgentStorageTest::SetUp();
        mRoutine->earlyInitialize();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        mRoutine->initialize();
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_SYSTEM, mPeer);
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_BLUETOOTH, mBluetooth);
        for (KelvoOperator* op :
             {static_cast<KelvoOperator*>(mPeer.get()), static_cast<KelvoOperator*>(mAudio.get()),
              static_cast<KelvoOperator*>(mBluetooth.get())}) {
            ASSERT_EQ(0, op->earlyInitialize());
            op->initialize();
        }
    }
    void TearDown() override {
        for (int32_t id : {HANDLER_BLUETOOTH, HANDLER_SYSTEM}) {
            KelvoAgent::getInstance()->setHandlerForTest(id, nullptr);
        }
        for (const sp<KelvoOperator>& op : std::vector<sp<KelvoOperator>>{
                 mRoutine.get(), mPeer.get(), mAudio.get(), mBluetooth.get()}) {
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
    int32_t log(int32_t tag, int64_t dt, const std::string& text) {
        Parcel body;
        body.writeInt64(kT + dt);
        body.writeCString(text.c_str());
        return mAudio->sendMessageSync(ParcelMessage(MESSAGE_LOGGER, tag, body));
    }
    int32_t phone(int64_t dt, int32_t state) {
        Parcel body;
        body.writeInt64(kT + dt);
        body.writeInt32(state);
        body.writeInt32(0);
        return mAudio->sendMessageSync(
            ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_PHONE_STATE_CHANGED, body));
    }
    int32_t poll(int64_t dt) {
        PollingPayload poll;
        poll.time = kT + dt;
        Parcel body;
        poll.writeTo(body);
        return mAudio->sendMessageSync(
            ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_DATA_POLLING, body));
    }
    void tick(int64_t hour) {
        const std::string ticks = "SELECT id FROM debug_hourly_tick";
        size_t before = rows(ticks).size();
        WallClock::setFixedTimeMs(hour + 500);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
        ASSERT_TRUE(
            waitFor([&] { return rows(ticks).size() > before; }, std::chrono::milliseconds(15000)));
    }
    std::string dump() {
        String8 out;
        mAudio->requestDump(out, 5000);
        std::string text(out.c_str());
        return text.substr(0, text.find("======AudioHandler END"));
    }
    // The Bluetooth handler's rows of the notices: time from kT, name,
    // activity, state; once n of them are there.
    std::vector<std::string> bluetooth(size_t n) {
        const std::string sql = "SELECT timestamp - " + std::to_string(kT) +
                                ", name, type, state FROM raw_bluetooth_state ORDER BY rowid";
        waitFor([&] { return rows(sql).size() >= n; });
        return rows(sql);
    }
    Json::Value upload(uint32_t event) {
        Json::Value params;
        for (const Json::Value& e : events()) {
            if (e["event"].asUInt() == event) params = e["params"];
        }
        return params;
    }

    sp<HourlyRoutine> mRoutine;
    sp<Peer> mPeer;
    sp<AudioHandler> mAudio;
    sp<BluetoothHandler> mBluetooth;
    std::unique_ptr<PlatformServices> mServices;
};

class AudioSmartPaTest : public AudioHandlerTest {
protected:
    int32_t policy() const override { return AudioHandler::kPolicySmartPa; }
};

using T = AudioHandler;

// com.a plays 10 min on stream 3 (the loudspeaker, taken as 0x3 while idle:
// 46 + 15 = 61 at volume 1) with a nested start; com.b plays on stream 1
// until the stream moves to a Bluetooth headset. An earpiece call tells the
// Bluetooth handler nothing, a Bluetooth call does.
TEST_F(AudioHandlerTest, PlayTimeThroughTheHourAndBluetoothNotices) {
    for (const char* text : {"stream=3 device=1", "stream=3 device=2"}) {
        ASSERT_EQ(0, log(T::TAG_AUDIO_DEVICE, 0, text));
    }
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_ACQUIRE, 0, "session=10 pid=501 uid=10010"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_ACQUIRE, 0, "session=11 pid=502 uid=10020"));
    for (const char* text : {"session=10 stream=3", "session=10 stream=3", "session=11 stream=1"}) {
        ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_START, 0, text));
    }
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_STOP, 1000, "session=10 stream=3"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_DEVICE, 300000, "stream=1 device=128"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_STOP, 400000, "session=11 stream=1"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_STOP, 600000, "session=10 stream=3"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_RELEASE, 600000, "session=10 pid=501"));
    for (int32_t state : {1, 2, 0}) ASSERT_EQ(0, phone(700000, state));
    ASSERT_EQ(0, log(T::TAG_AUDIO_DEVICE, 800000, "stream=0 device=32"));
    for (int32_t state : {2, 0}) ASSERT_EQ(0, phone(900000, state));
    EXPECT_EQ((std::vector<std::string>{"300000|com.b|3|1", "400000|com.b|3|0",
                                        "900000|com.android.incallui|4|1",
                                        "900000|com.android.incallui|4|0"}),
              bluetooth(4));
    tick(kH);

    const std::string t = std::to_string(kT);
    EXPECT_EQ((std::vector<std::string>{"0|10|com.a|10010|501|1", "600000|10|NULL|-1|501|0"}),
              rows("SELECT timestamp - " + t +
                   ", session, name, uid, pid, state FROM raw_audio_session WHERE session = 10"));
    EXPECT_EQ((std::vector<std::string>{t + "|3|1", t + "|3|3"}),
              rows("SELECT timestamp, stream, device FROM raw_audio_device WHERE stream = 3"));
    EXPECT_EQ((std::vector<std::string>{"com.a|600000|36600|600000|36600",
                                        "com.b|300000|18300|300000|18300"}),
              rows("SELECT name, background_duration, background_energy, screen_on_duration, "
                   "screen_on_energy FROM raw_applications_audio WHERE name IN ('com.a', 'com.b') "
                   "ORDER BY name"));
    // The component's last use was the earpiece call's instant at 700 s.
    EXPECT_EQ(std::vector<std::string>{t + "|" + std::to_string(kT + 700000) + "|600000|54900"},
              rows("SELECT start_time, end_time, screen_on_duration, background_energy "
                   "FROM raw_component_audio"));
    // com.b's 100 s on the headset are the Bluetooth handler's (code 2).
    EXPECT_EQ(
        (std::vector<std::string>{"com.a|0|36600", "com.b|0|18300", "com.b|2|800"}),
        rows("SELECT name, component, background_energy FROM "
             "hourly_applications_accounting WHERE name IN ('com.a', 'com.b') ORDER BY name"));
    EXPECT_EQ(std::vector<std::string>{"54900"},
              rows("SELECT background_energy FROM hourly_component_audio"));
    Json::Value hourly = upload(EVENT_HOURLY_COMPONENTS);
    EXPECT_EQ(54900, hourly["20"]["params"]["6"].asInt64());
    ASSERT_EQ(2u, hourly["21"].size());
    EXPECT_EQ("com.a", hourly["21"][0]["params"]["3"]["params"]["0"].asString());
}

// A framework death ends every accounter element; a session still playing
// is charged on (200 s, not the 100 s before the death).
TEST_F(AudioHandlerTest, PlayingSessionOutlivesFrameworkDeath) {
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_ACQUIRE, 0, "session=10 pid=501 uid=10010"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_START, 0, "session=10 stream=3"));
    Parcel body;
    body.writeInt64(kT + 100000);
    ASSERT_EQ(
        0, mAudio->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, NOTIFICATION_VM_DIED, body)));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_STOP, 200000, "session=10 stream=3"));
    ASSERT_EQ(0, poll(300000));
    EXPECT_EQ(std::vector<std::string>{"com.a|200000|12200"},
              rows("SELECT name, SUM(background_duration), SUM(background_energy) FROM "
                   "raw_applications_audio GROUP BY name"));
}

// Refused messages change nothing: stream ids are 0..12, numbers are
// numbers, every key is there, stops and releases need a known session.
// A stop of a session not playing and a new owner of a playing session
// are taken (0) and change nothing either.
TEST_F(AudioHandlerTest, RefusedMessagesLeaveTheStateAlone) {
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_ACQUIRE, 0, "session=10 pid=501 uid=10010"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_ACQUIRE, 0, "session=11 pid=502 uid=10020"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_START, 0, "session=10 stream=3"));
    const std::string before = dump();
    const uint64_t refused = HealthCounters::get(Health::LoggerMessageRefused);
    const struct {
        int32_t tag;
        const char* text;
        int32_t result;
    } cases[] = {
        {T::TAG_AUDIO_SESSION_START, "session=10 stream=-1", -9},
        {T::TAG_AUDIO_SESSION_STOP, "session=10 stream=13", -9},
        {T::TAG_AUDIO_SESSION_STOP, "session=10 stream=abc", -19},
        {T::TAG_AUDIO_SESSION_STOP, "session=10", -19},
        {T::TAG_AUDIO_SESSION_STOP, "session=99 stream=3", -4},
        {T::TAG_AUDIO_SESSION_STOP, "session=11 stream=3", 0},
        {T::TAG_AUDIO_SESSION_ACQUIRE, "session=10 pid=502 uid=10020", 0},
        {T::TAG_AUDIO_SESSION_RELEASE, "session=10 pid=777", -4},
        {T::TAG_AUDIO_DEVICE, "stream=-1 device=2", -9},
        {T::TAG_AUDIO_DEVICE, "stream=3 device=abc", -19},
        {T::TAG_AUDIO_DEVICE, "stream=3 device=-2", -19},
        {T::TAG_AUDIO_VOLUME, "stream=3 volume=-1", -9},
        {T::TAG_AUDIO_VOLUME, "stream=13 volume=4", -9},
        {T::TAG_AUDIO_SESSION_ACQUIRE, "session=12 pid=abc uid=10010", -19},
        {T::TAG_AUDIO_SESSION_ACQUIRE, "session=12 pid=5 uid=-1", -9},
        {T::TAG_AUDIO_HEADSET, "state=2 microphone=0 device=h", -9},
        {T::TAG_AUDIO_HEADSET, "state=1 microphone=x device=h", -19},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(c.result, log(c.tag, 1000, c.text)) << c.text;
    }
    EXPECT_EQ(refused + sizeof(cases) / sizeof(cases[0]) - 1,
              HealthCounters::get(Health::LoggerMessageRefused));
    EXPECT_EQ(before, dump());
}

// Cached results of 300 and 100 are rescaled to what the amplifiers
// measured (pa1 and pa2 per 1000 units of the profile): both answer forms
// give 200, so 150 and 50; no answer, a garbled or too large one, or a read
// within 60 s of the last keeps the model's energies.
TEST_F(AudioSmartPaTest, MeasuredEnergyRescalesTheCachedResults) {
    const struct {
        const char* answer;
        int64_t advance;
        const char* expected;
        size_t readings;
    } cases[] = {
        {"pa1=150000 pa2=50000", 61000, "150|50", 1},
        {"pa2=200000", 61000, "150|50", 2},
        {"pa2=200000", 1000, "300|100", 2},
        {"", 61000, "300|100", 2},
        {"pa1=abc", 61000, "300|100", 2},
        {"pa1=99999999999999 pa2=0", 61000, "300|100", 2},
        {nullptr, 61000, "300|100", 2},  // no audio framework
    };
    int64_t dt = 0;
    for (const auto& c : cases) {
        if (c.answer != nullptr) {
            mServices->state()->setAudioParameter("getSmartPAPOWER", c.answer);
        } else {
            mServices->state()->setAudioParameter("getSmartPAPOWER", "pa2=200000");
            mServices->stop("media.audio_flinger");
        }
        gMonotonic += c.advance;
        dt += 60000;
        for (const auto& app : {std::make_pair("com.a", 300), std::make_pair("com.b", 100)}) {
            Parcel result;
            result.writeInt32(0);
            result.writeInt64(kT);
            result.writeInt64(kT + dt);
            result.writeString8(String8(app.first));
            for (int i = 0; i < 6; ++i) {
                result.writeInt32(i == 1 || i == 2 ? 1000 : 0);
                result.writeInt64(i == 1 || i == 2 ? app.second : 0);
            }
            ASSERT_EQ(0, mAudio->handleLibraryEvent(LIBRARY_EVENT_APPLICATION, result));
        }
        ASSERT_EQ(0, poll(dt));
        EXPECT_EQ(std::vector<std::string>{c.expected},
                  rows("SELECT GROUP_CONCAT(background_energy, '|') FROM (SELECT "
                       "background_energy FROM raw_applications_audio WHERE end_time = " +
                       std::to_string(kT + dt) + " ORDER BY name)"))
            << (c.answer != nullptr ? c.answer : "no service");
        EXPECT_EQ(c.readings, rows("SELECT speaker FROM raw_audio_smartpa_value").size());
    }
}

// Spans count each part of a play once, the component's in the rows and the
// loudspeaker's and earpiece's (stream 3 is 0x3) in the dump: a poll during
// play restarts the spans at its time, a time before a span's start adds
// nothing, and a second stop (its reference would go below 0) keeps the
// other session counted up to its own stop. Steps in seconds: "+20" starts
// session 20, "-20" stops it, "" polls.
TEST_F(AudioSmartPaTest, SpansCountEachPartOnce) {
    ASSERT_EQ(0, log(T::TAG_AUDIO_DEVICE, 0, "stream=3 device=2"));
    for (const char* id : {"20", "21"}) {
        ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_ACQUIRE, 0,
                         std::string("session=") + id + " pid=501 uid=10010"));
    }
    const struct {
        const char* name;
        std::vector<std::pair<int64_t, std::string>> steps;
        std::vector<std::string> rows;  // end | duration of the component rows
        long long spans;
    } cases[] = {
        {"polls during play",
         {{0, "+20"}, {100, ""}, {250, ""}, {300, "-20"}, {400, ""}},
         {"100|100", "250|150", "300|50"},
         300},
        {"earlier times",
         {{0, "+20"}, {-30, ""}, {60, "-20"}, {100, "+20"}, {80, "-20"}, {200, ""}},
         {"80|60"},  // the row ends at the last stop
         60},
        {"second stop",
         {{0, "+20"}, {0, "+21"}, {100, "-21"}, {150, "-21"}, {200, "-20"}, {300, ""}},
         {"200|200"},
         200},
    };
    auto spans = [&](long long* speaker, long long* receiver) {
        const std::string state = dump();
        return sscanf(state.c_str() + state.find("mSpeaker={"),
                      "mSpeaker={%*[^,], %*[^,], %lld} mReceiver={%*[^,], %*[^,], %lld}", speaker,
                      receiver);
    };
    int64_t base = 0;
    for (const auto& c : cases) {
        base += 1000;
        long long speaker = 0, receiver = 0, speakerAfter = 0, receiverAfter = 0;
        ASSERT_EQ(2, spans(&speaker, &receiver));
        for (const auto& step : c.steps) {
            const int64_t dt = (base + step.first) * 1000;
            const std::string text =
                step.second.empty() ? "" : "session=" + step.second.substr(1) + " stream=3";
            ASSERT_EQ(0, text.empty() ? poll(dt)
                                      : log(step.second[0] == '+' ? T::TAG_AUDIO_SESSION_START
                                                                  : T::TAG_AUDIO_SESSION_STOP,
                                            dt, text))
                << c.name;
        }
        const int64_t start = kT + (base - 500) * 1000;
        EXPECT_EQ(c.rows, rows("SELECT (end_time - " + std::to_string(start) + ") / 1000 - 500, " +
                               "background_duration / 1000 FROM raw_component_audio WHERE " +
                               "end_time > " + std::to_string(start) + " ORDER BY rowid"))
            << c.name;
        ASSERT_EQ(2, spans(&speakerAfter, &receiverAfter));
        EXPECT_EQ(c.spans * 1000, speakerAfter - speaker) << c.name;
        EXPECT_EQ(c.spans * 1000, receiverAfter - receiver) << c.name;
    }
}

// The 513th session stops every playing one at its time (the accounter's
// records close there, the Bluetooth handler hears the end, no span stays
// open) before the map is emptied.
TEST_F(AudioHandlerTest, SessionCapStopsEveryPlayingSession) {
    const uint64_t capped = HealthCounters::get(Health::HandlerStateCapped);
    ASSERT_EQ(0, log(T::TAG_AUDIO_DEVICE, 0, "stream=1 device=128"));
    for (int32_t id = 100; id < 100 + 512; ++id) {
        ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_ACQUIRE, 0,
                         "session=" + std::to_string(id) + " pid=501 uid=10010"));
    }
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_START, 0, "session=100 stream=3"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_START, 0, "session=101 stream=3"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_START, 0, "session=102 stream=1"));
    ASSERT_EQ(0, log(T::TAG_AUDIO_SESSION_ACQUIRE, 60000, "session=9 pid=502 uid=10020"));
    EXPECT_EQ(capped + 1, HealthCounters::get(Health::HandlerStateCapped));
    EXPECT_EQ((std::vector<std::string>{"0|com.a|3|1", "60000|com.a|3|0"}), bluetooth(2));
    const std::string state = dump();
    EXPECT_NE(std::string::npos, state.find("mComponentData.reference=0\n")) << state;
    EXPECT_NE(std::string::npos, state.find("mSessionData.size()=1\n")) << state;
    EXPECT_EQ(std::vector<std::string>{"com.a|120000|7320"},
              rows("SELECT name, SUM(background_duration), SUM(background_energy) FROM "
                   "raw_applications_audio GROUP BY name"));
}

// Headsets plugged in are counted into the day's record before the daily
// vote; the daily upload sends that day's count as parameter 19 of the
// users event, never an earlier day's.
TEST_F(AudioHandlerTest, HeadsetCountReachesTheDailyUpload) {
    const int64_t day = kMidnight + 86400000;
    Parcel old;
    old.writeInt64(day - 2 * 86400000);
    old.writeString8(String8("headset_count"));
    old.writeString8(String8("7"));
    StorageOperator::insertEntries(kMiscTable, old, 1, false);
    for (const char* text : {"state=1 microphone=1 device=h1", "state=0 microphone=0 device=h1",
                             "state=1 microphone=0 device=usb headset"}) {
        ASSERT_EQ(0, log(T::TAG_AUDIO_HEADSET, 0, text));
    }
    tick(day);
    EXPECT_EQ(std::vector<std::string>{"1|0|usb headset"},
              rows("SELECT state, microphone, device FROM raw_audio_headset WHERE device != 'h1'"));
    EXPECT_EQ(std::vector<std::string>{std::to_string(day) + "|2"},
              rows("SELECT timestamp, value FROM daily_misc_data WHERE timestamp > " +
                   std::to_string(day - 86400000)));
    EXPECT_EQ(2, upload(EVENT_DAILY_USERS)["19"].asInt64());
}

}  // namespace
