// The component accounters with the sample profile, through the library's
// entry: action parcels in, records out. Energies are worked out by hand
// from config/tv_kelvo_config.xml.

#include <gtest/gtest.h>

#include <string.h>

#include <limits>
#include <string>
#include <vector>

#include "HealthCounters.h"
#include "common/TestEnv.h"
#include "libkelvo/LibraryTestUtil.h"
#include "utils/XmlParser.h"

using namespace kelvo;
using namespace kelvo::test;

namespace {

constexpr int32_t kMax = std::numeric_limits<int32_t>::max();

class ComponentAccounterTest : public ::testing::Test {
protected:
    void SetUp() override { loadConfig(readHostFile(KELVO_SAMPLE_CONFIG)); }
    void TearDown() override {
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
    }
    void loadConfig(const std::string& xml) {
        mRoot.writeFile("/data/misc/kelvo/tv_kelvo_config.xml", xml);
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
    }
    static int32_t foreground(int32_t type, int64_t t, const char* name) {
        return Fields(type, ACTION_FOREGROUND).i64(t).str(name).send();
    }

    TempRoot mRoot;
    LogCapture mLog;
};

// Fixed powers: flashlight 180, GNSS 35, Bluetooth by kind (0: 12, media 3:
// 8, shared), sensors by type in tenths (gyroscope 4: 60). Ten seconds.
TEST_F(ComponentAccounterTest, FixedPowersComeFromTheProfile) {
    const int32_t bt = ACCOUNTER_BLUETOOTH;
    const int32_t sensor = ACCOUNTER_SENSOR;
    struct Case {
        const char* what;
        int32_t type;
        Fields on;
        Fields off;
        std::vector<Bytes> replies;
    } cases[] = {
        {"flashlight", ACCOUNTER_FLASHLIGHT,
         std::move(Fields(ACCOUNTER_FLASHLIGHT, ACTION_ACTIVATE).i64(0).str("com.a")),
         std::move(Fields(ACCOUNTER_FLASHLIGHT, ACTION_DEACTIVATE).i64(10000).str("com.a")),
         {elementReply(0, 0, 10000, "com.a", screenOnBackground(10000, 1800))}},
        {"gnss", ACCOUNTER_GNSS,
         std::move(Fields(ACCOUNTER_GNSS, ACTION_ACTIVATE).i64(0).str("com.a")),
         std::move(Fields(ACCOUNTER_GNSS, ACTION_DEACTIVATE).i64(10000).str("com.a")),
         {elementReply(0, 0, 10000, "com.a", screenOnBackground(10000, 350)),
          componentReply(0, 0, 10000, screenOnBackground(10000, 350))}},
        {"bluetooth discovery", bt,
         std::move(Fields(bt, ACTION_ACTIVATE).i32(0).i64(0).str("com.a")),
         std::move(Fields(bt, ACTION_DEACTIVATE).i32(0).i64(10000).str("com.a")),
         {elementReply(0, 0, 10000, "com.a", screenOnBackground(10000, 120))}},
        {"bluetooth media", bt, std::move(Fields(bt, ACTION_ACTIVATE).i32(3).i64(0).str("com.a")),
         std::move(Fields(bt, ACTION_DEACTIVATE).i32(3).i64(10000).str("com.a")),
         {elementReply(3, 0, 10000, "com.a", screenOnBackground(10000, 80)),
          componentReply(3, 0, 10000, screenOnBackground(10000, 80))}},
        {"gyroscope", sensor,
         std::move(Fields(sensor, ACTION_ACTIVATE).i32(4).i64(0).str("com.a").str("u")),
         std::move(Fields(sensor, ACTION_DEACTIVATE).i32(4).i64(10000).str("com.a").str("u")),
         {elementReply(4, 0, 10000, "com.a|u", screenOnBackground(10000, 60)),
          componentReply(4, 0, 10000, screenOnBackground(10000, 60))}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        auto listener = listenTo(c.type);
        ASSERT_EQ(0, c.on.send());
        ASSERT_EQ(0, c.off.send());
        EXPECT_EQ(c.replies, replyBytes(*listener));
    }
    // DeactivateAll: each kind's records carry that kind, not the last read.
    KelvoLibAgent::getInstance()->resetAccountersForTest();
    auto listener = listenTo(bt);
    ASSERT_EQ(0, Fields(bt, ACTION_ACTIVATE).i32(0).i64(0).str("com.a").send());
    ASSERT_EQ(0, Fields(bt, ACTION_ACTIVATE).i32(3).i64(0).str("com.b").send());
    ASSERT_EQ(0, Fields(bt, ACTION_ACTIVATE).i32(4).i64(0).str("com.c").send());
    ASSERT_EQ(0, Fields(bt, ACTION_DEACTIVATE_ALL).i64(1000).send());
    EXPECT_EQ((std::vector<Bytes>{elementReply(0, 0, 1000, "com.a", screenOnBackground(1000, 12)),
                                  elementReply(3, 0, 1000, "com.b", screenOnBackground(1000, 8)),
                                  componentReply(3, 0, 1000, screenOnBackground(1000, 8)),
                                  elementReply(4, 0, 1000, "com.c", screenOnBackground(1000, 11))}),
              replyBytes(*listener));
}

// Receiver: (1500 + 20 V) / 100; speaker: 40 + 6 V; both: the sum. One
// session per case, ten seconds at the power set at its start.
TEST_F(ComponentAccounterTest, AudioSessionPowerByDevice) {
    const int32_t audio = ACCOUNTER_AUDIO;
    struct Case {
        int32_t device;
        int32_t volume;
        int32_t result;
        int64_t energy; // -1: no record
    } cases[] = {
        {1, 5, 0, 160}, {2, 5, 0, 700}, {3, 5, 0, 860},
        // 40 + 6 x INT32_MAX needs 64 bits; the power is kept at INT32_MAX.
        {2, kMax, 0, int64_t{kMax} * 10},
        {4, 5, -1, -1}, {0, 5, -1, -1},
    };
    auto listener = listenTo(audio);
    const uint64_t saturated = HealthCounters::get(Health::ValuesSaturated);
    int32_t key = 100;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.device);
        listener->mReplies.clear();
        ++key;
        EXPECT_EQ(c.result,
                  Fields(audio, ACTION_SET_VALUE).i32(0).i32(key).i64(0).i32(c.device)
                          .i32(c.volume).send());
        if (c.energy < 0) {
            // An unknown device makes no session.
            EXPECT_EQ(-1, Fields(audio, ACTION_DEACTIVATE).i32(key).i64(0).str("m").send());
            continue;
        }
        ASSERT_EQ(0, Fields(audio, ACTION_ACTIVATE).i32(key).i64(0).str("com.music").send());
        ASSERT_EQ(0, Fields(audio, ACTION_DEACTIVATE).i32(key).i64(10000).str("com.music").send());
        EXPECT_EQ(std::vector<Bytes>{elementReply(0, 0, 10000, "com.music",
                                                  screenOnBackground(10000, c.energy))},
                  replyBytes(*listener));
    }
    EXPECT_EQ(saturated + 1, HealthCounters::get(Health::ValuesSaturated));
    EXPECT_EQ(-1, Fields(audio, ACTION_SET_VALUE).i32(2).i32(1).send());
    EXPECT_TRUE(mLog.contains("Unknown audio subtype: 2"));
}

// A session that goes for any reason reports what it holds first.
TEST_F(ComponentAccounterTest, AudioSessionsReportBeforeTheyGo) {
    const int32_t audio = ACCOUNTER_AUDIO;
    auto listener = listenTo(audio);
    auto session = [&](int32_t key, int64_t t) {
        return Fields(audio, ACTION_SET_VALUE).i32(0).i32(key).i64(t).i32(2).i32(5).send();
    };
    // Session 1 (70) accounted up to 2000 by its second power value.
    for (int32_t key = 1; key <= 21; ++key) {
        ASSERT_EQ(0, session(key, 0));
        ASSERT_EQ(0, Fields(audio, ACTION_ACTIVATE).i32(key).i64(0).str("com.s").send());
    }
    ASSERT_EQ(0, session(1, 2000));
    const uint64_t capped = HealthCounters::get(Health::AccounterStateCapped);
    ASSERT_EQ(0, session(22, 3000));
    EXPECT_EQ(capped + 1, HealthCounters::get(Health::AccounterStateCapped));
    EXPECT_TRUE(mLog.contains("Audio sessions exceed maximum limit: 21"));
    EXPECT_EQ(std::vector<Bytes>{elementReply(0, 0, 2000, "com.s", screenOnBackground(2000, 140))},
              replyBytes(*listener));
    EXPECT_EQ(-1, Fields(audio, ACTION_DEACTIVATE).i32(1).i64(4000).str("com.s").send());

    // A Deactivate naming another stream: the session's record up to its
    // last accounting goes out, then the session.
    ASSERT_EQ(0, session(2, 2500));
    EXPECT_EQ(-1, Fields(audio, ACTION_DEACTIVATE).i32(2).i64(4000).str("com.other").send());
    EXPECT_EQ(elementReply(0, 0, 2500, "com.s", screenOnBackground(2500, 175)),
              replyBytes(*listener, 1).at(0));
    EXPECT_EQ(-1, Fields(audio, ACTION_DEACTIVATE).i32(2).i64(4000).str("com.s").send());

    // DeactivateAll ends every session (3..21; 22 holds none).
    ASSERT_EQ(0, Fields(audio, ACTION_DEACTIVATE_ALL).i64(5000).send());
    EXPECT_EQ(2u + 19u, listener->mReplies.size());
    EXPECT_EQ(elementReply(0, 0, 5000, "com.s", screenOnBackground(5000, 350)),
              listener->mReplies.back().bytes);
    EXPECT_EQ(-1, Fields(audio, ACTION_DEACTIVATE).i32(3).i64(6000).str("com.s").send());
}

// The smart amplifier reading: ((t2 x B0) / 100 + t1 x B1) / 1000, x / L1[i],
// y / L0[i]; an index beyond the lists (negative included) scales by 0.
TEST_F(ComponentAccounterTest, AudioSmartAmplifierReadings) {
    const int64_t kMax64 = std::numeric_limits<int64_t>::max();
    struct Case {
        int32_t index;
        int64_t t1, t2, x, y;
        int64_t energy, scaledX, scaledY;
    } cases[] = {
        {0, 1000, 2000, 5000, 3000, 70, 5, 3},
        {1, 1000, 2000, 5999, 999, 70, 5, 0},
        {2, 1000, 2000, 5000, 3000, 70, 0, 0},
        {-1, 1000, 2000, 5000, 3000, 70, 0, 0},
        {0, kMax64, kMax64, 0, 0, kMax64 / 1000, 0, 0},
    };
    auto listener = listenTo(ACCOUNTER_AUDIO);
    for (const Case& c : cases) {
        SCOPED_TRACE(c.index);
        listener->mReplies.clear();
        ASSERT_EQ(0, Fields(ACCOUNTER_AUDIO, ACTION_SET_VALUE).i32(1).i32(c.index).i64(c.t1)
                             .i64(c.t2).i64(c.x).i64(c.y).send());
        ASSERT_EQ(1u, listener->mReplies.size());
        EXPECT_EQ(LIBRARY_EVENT_COMPONENT, listener->mReplies[0].event);
        EXPECT_EQ(Fields().i64(c.energy).i64(c.scaledX).i64(c.scaledY).bytes(),
                  listener->mReplies[0].bytes);
    }
}

// (800 + 90 L) / factor; the factor follows the display handler's effective
// policy, else the configured one. One second per case, so the energy is the
// power.
TEST_F(ComponentAccounterTest, BrightnessPowerFollowsTheEffectivePolicy) {
    const int32_t kBacklight = ACCOUNTER_BRIGHTNESS;
    struct Case {
        const char* what;
        int32_t configured;
        int32_t effective; // 0: not set
        int32_t level;
        int32_t result;
        int64_t energy;
    } cases[] = {
        {"configured 1", 1, 0, 255, 0, 237},
        {"configured 2", 2, 0, 255, 0, 2},
        {"driver refused 2", 2, 1, 255, 0, 237},
        {"driver took 2", 1, 2, 255, 0, 2},
        {"unknown effective policy ignored", 1, 3, 255, 0, 237},
        {"off", 1, 0, 0, 0, 0},
        {"S x L needs 64 bits", 1, 0, kMax, 0, 1932735290},
        {"negative level refused", 1, 0, -1, -1, 123},
    };
    const std::string sample = readHostFile(KELVO_SAMPLE_CONFIG);
    const std::string displayPolicy = "<!-- display -->\n        <component id=\"0\">\n"
                                      "            <parameter>1</parameter>";
    ASSERT_NE(std::string::npos, sample.find(displayPolicy));
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        std::string xml = sample;
        std::string policy = displayPolicy;
        policy.replace(policy.size() - 13, 1, std::to_string(c.configured));
        xml.replace(xml.find(displayPolicy), displayPolicy.size(), policy);
        loadConfig(xml);
        auto listener = listenTo(kBacklight);
        if (c.effective != 0) {
            EXPECT_EQ(c.effective == 3 ? -1 : 0, setDisplayEnergyPolicy(c.effective));
        }
        ASSERT_EQ(0, foreground(kBacklight, 0, "com.a"));
        EXPECT_EQ(c.result, Fields(kBacklight, ACTION_SET_VALUE).i64(0).i32(c.level).send());
        ASSERT_EQ(0, foreground(kBacklight, 1000, ""));
        EXPECT_EQ(std::vector<Bytes>{elementReply(0, 0, 1000, "com.a",
                                                  screenOnForeground(1000, c.energy))},
                  replyBytes(*listener));
    }
}

// A foreground known before any level (a restart with the screen on) is
// charged at level 128: (800 + 90 x 128) / 100 = 123. Each change hands the
// screen to the new application.
TEST_F(ComponentAccounterTest, BrightnessFollowsTheForegroundFromTheStart) {
    const int32_t kBacklight = ACCOUNTER_BRIGHTNESS;
    auto listener = listenTo(kBacklight);
    ASSERT_EQ(0, foreground(kBacklight, 0, "com.launcher"));
    ASSERT_EQ(0, foreground(kBacklight, 10000, "com.game"));
    ASSERT_EQ(0, Fields(kBacklight, ACTION_SET_VALUE).i64(12000).i32(0).send());
    ASSERT_EQ(0, Fields(kBacklight, ACTION_BALANCE).i32(BALANCE_AT).i64(15000).send());
    EXPECT_EQ((std::vector<Bytes>{
                      elementReply(0, 0, 10000, "com.launcher", screenOnForeground(10000, 1230)),
                      elementReply(0, 10000, 15000, "com.game", screenOnForeground(5000, 246)),
              }),
              replyBytes(*listener));
}

// Camera powers by stream size (a x b in 64 bits, the nearest listed size
// when not listed); streams add up. The last camera index opens the records
// and keys the balance.
TEST_F(ComponentAccounterTest, CameraPowerFromStreamSizes) {
    const int32_t camera = ACCOUNTER_CAMERA;
    struct Case {
        const char* what;
        std::vector<std::vector<int32_t>> streams; // camera, a, b
        int32_t prefix;
        int64_t energy; // one second
    } cases[] = {
        {"listed size", {{0, 640, 480}}, 0, 180},
        {"nearest size", {{1, 4000, 3000}}, 1, 300},
        {"halfway: the smaller", {{0, 3200, 3171}}, 0, 420},
        // 65536 x 65541 wraps to 327680 in 32 bits, near the smallest size.
        {"product beyond int32", {{0, 65536, 65541}}, 0, 480},
        {"two streams", {{0, 640, 480}, {2, 1280, 720}}, 2, 300},
        {"unknown camera", {{9, 640, 480}, {-1, 640, 480}}, -1, 0},
    };
    // 3200 x 3171 = 10147200 lies halfway between 8294400 (420) and 12000000.
    auto listener = listenTo(camera);
    ASSERT_EQ(0, Fields(camera, ACTION_ACTIVATE).i64(0).str("com.cam").send());
    int64_t t = 0;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        listener->mReplies.clear();
        Fields set(camera, ACTION_SET_VALUE);
        set.i64(t).i32(static_cast<int32_t>(c.streams.size()));
        for (const auto& s : c.streams) set.i32(s[0]).i32(s[1]).i32(s[2]);
        ASSERT_EQ(0, set.send());
        t += 1000;
        ASSERT_EQ(0, Fields(camera, ACTION_BALANCE).i32(BALANCE_AT).i64(t).send());
        EXPECT_EQ(std::vector<Bytes>{elementReply(c.prefix, t - 1000, t, "com.cam",
                                                  screenOnBackground(1000, c.energy))},
                  replyBytes(*listener));
    }
}

// Per step busy x power / 1000 at the nearest listed MHz; the reading is
// charged by the first accounting at its time and by no later one.
TEST_F(ComponentAccounterTest, GpuReadingIsChargedOnce) {
    const int32_t gpu = ACCOUNTER_GPU;
    auto listener = listenTo(gpu);
    auto record = [](int64_t start, int64_t end, const char* name, int32_t duration, int64_t busy,
                     int64_t energy) {
        Fields f;
        f.i32(0).i64(start).i64(end).str(name);
        for (int32_t bucket = 0; bucket < BUCKET_COUNT; ++bucket) {
            const bool used = bucket == BUCKET_FOREGROUND || bucket == BUCKET_SCREEN_ON;
            f.i32(used ? duration : 0).i64(used ? busy : 0).i64(used ? energy : 0);
        }
        return f.bytes();
    };
    ASSERT_EQ(0, foreground(gpu, 0, "com.game"));
    // 480 MHz: 210; 533 MHz is nearer 576 (260); 100 x 210 + 50 x 260 = 34000.
    ASSERT_EQ(0, Fields(gpu, ACTION_SET_VALUE).i64(1000).flag(false).i32(3)
                         .i64(480000000).i64(100).i64(900)
                         .i64(533000000).i64(50).i64(950)
                         .i64(800000000).i64(0).i64(1000).send());
    ASSERT_EQ(0, Fields(gpu, ACTION_BALANCE).i32(BALANCE_AT).i64(1000).send());
    ASSERT_EQ(0, foreground(gpu, 1000, "com.other"));
    EXPECT_EQ((std::vector<Bytes>{record(0, 1000, "com.game", 1000, 150, 34),
                                  record(1000, 1000, "com.game", 0, 0, 0)}),
              replyBytes(*listener));
}

// Counts from the action parcel are held against the bytes that follow.
TEST_F(ComponentAccounterTest, HostileBatchesAreRefusedWhole) {
    const int32_t gpu = ACCOUNTER_GPU;
    const int32_t camera = ACCOUNTER_CAMERA;
    Fields cases[] = {
        std::move(Fields(gpu, ACTION_SET_VALUE).i64(0).flag(false).i32(1000000000)),
        std::move(Fields(gpu, ACTION_SET_VALUE).i64(0).flag(false).i32(-1)),
        std::move(Fields(gpu, ACTION_SET_VALUE).i64(0).flag(false).i32(2).i64(1).i64(1).i64(1)),
        std::move(Fields(gpu, ACTION_SET_VALUE).i64(0)),
        std::move(Fields(camera, ACTION_SET_VALUE).i64(0).i32(kMax)),
        std::move(Fields(camera, ACTION_SET_VALUE).i64(0).i32(-5)),
        std::move(Fields(camera, ACTION_SET_VALUE).i64(0).i32(2).i32(0).i32(640).i32(480)),
        std::move(Fields(ACCOUNTER_SENSOR, ACTION_ACTIVATE).i32(1).i64(0).str("com.a")),
        std::move(Fields(ACCOUNTER_AUDIO, ACTION_SET_VALUE).i32(1).i32(0).i64(1)),
        std::move(Fields(ACCOUNTER_BRIGHTNESS, ACTION_SET_VALUE).i64(0)),
    };
    const uint64_t refused = HealthCounters::get(Health::LibraryParcelRefused);
    for (size_t i = 0; i < sizeof(cases) / sizeof(cases[0]); ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(-1, cases[i].send());
    }
    EXPECT_EQ(refused + 10, HealthCounters::get(Health::LibraryParcelRefused));
    EXPECT_TRUE(mLog.contains("Invalid gpu count: 1000000000"));
    EXPECT_TRUE(mLog.contains("Invalid camera count: 2147483647"));
}

// A user registered twice needs two deactivations; DeactivateAll and a
// type -1 deactivation end every registration, each record carrying its own
// sensor type.
TEST_F(ComponentAccounterTest, SensorUsersAreCountedPerType) {
    const int32_t sensor = ACCOUNTER_SENSOR;
    auto listener = listenTo(sensor);
    auto act = [&](int32_t code, int32_t type, int64_t t, const char* package) {
        return Fields(sensor, code).i32(type).i64(t).str(package).str("u").send();
    };
    // Accelerometer (1): 2, gyroscope (4): 60, in tenths.
    ASSERT_EQ(0, act(ACTION_ACTIVATE, 1, 0, "com.a"));
    ASSERT_EQ(0, act(ACTION_ACTIVATE, 1, 0, "com.a"));
    ASSERT_EQ(0, act(ACTION_ACTIVATE, 4, 0, "com.a"));
    ASSERT_EQ(0, act(ACTION_DEACTIVATE, 1, 5000, "com.a"));
    EXPECT_TRUE(listener->mReplies.empty());
    ASSERT_EQ(0, act(ACTION_DEACTIVATE, -1, 10000, "com.a"));
    EXPECT_EQ((std::vector<Bytes>{
                      elementReply(1, 0, 10000, "com.a|u", screenOnBackground(10000, 2)),
                      componentReply(1, 0, 10000, screenOnBackground(10000, 2)),
                      elementReply(4, 0, 10000, "com.a|u", screenOnBackground(10000, 60)),
                      componentReply(4, 0, 10000, screenOnBackground(10000, 60)),
              }),
              replyBytes(*listener));
    EXPECT_EQ(-1, act(ACTION_DEACTIVATE, 1, 11000, "com.a"));

    listener->mReplies.clear();
    ASSERT_EQ(0, act(ACTION_ACTIVATE, 1, 20000, "com.a"));
    ASSERT_EQ(0, act(ACTION_ACTIVATE, 1, 20000, "com.a"));
    ASSERT_EQ(0, act(ACTION_ACTIVATE, 4, 20000, "com.b"));
    // Type 9 is read last: without their own types every record would carry it.
    ASSERT_EQ(0, act(ACTION_ACTIVATE, 9, 20000, "com.c"));
    ASSERT_EQ(0, Fields(sensor, ACTION_DEACTIVATE_ALL).i64(30000).send());
    std::vector<int32_t> prefixes;
    for (const Reply& r : listener->mReplies) {
        int32_t prefix = 0;
        memcpy(&prefix, r.bytes.data(), sizeof(prefix));
        prefixes.push_back(prefix);
    }
    EXPECT_EQ((std::vector<int32_t>{1, 1, 4, 4, 9, 9}), prefixes);
    // Nothing is left to count down.
    EXPECT_EQ(-1, act(ACTION_DEACTIVATE, 1, 31000, "com.a"));
    EXPECT_TRUE(mLog.contains("Failed to remove element: com.a|u"));
}

// Sensor types, registrations and users of one type are capped.
TEST_F(ComponentAccounterTest, SensorStateIsCapped) {
    const int32_t sensor = ACCOUNTER_SENSOR;
    listenTo(sensor);
    auto activate = [&](int32_t type, int32_t user) {
        return Fields(sensor, ACTION_ACTIVATE).i32(type).i64(0).str("com.a")
                .str(std::to_string(user).c_str()).send();
    };
    const uint64_t capped = HealthCounters::get(Health::AccounterStateCapped);
    for (int32_t type = 0; type < 256; ++type) ASSERT_EQ(0, activate(type, 0));
    EXPECT_EQ(-1, activate(256, 0));
    for (int32_t user = 1; user < 1024; ++user) ASSERT_EQ(0, activate(0, user));
    EXPECT_EQ(-1, activate(0, 1024));
    // 256 + 1023 registrations so far; 2817 more reach 4096.
    for (int32_t n = 0; n < 2817; ++n) ASSERT_EQ(0, activate(1 + n / 1023, 1 + n % 1023));
    EXPECT_EQ(-1, activate(5, 1));
    EXPECT_EQ(capped + 3, HealthCounters::get(Health::AccounterStateCapped));
    EXPECT_TRUE(mLog.contains("Too many sensor types: 256, refused: 256"));
    EXPECT_TRUE(mLog.contains("Too many elements: 1024"));
    EXPECT_TRUE(mLog.contains("Too many sensor users: 4096"));
    // Registered users still count down.
    EXPECT_EQ(0, Fields(sensor, ACTION_DEACTIVATE).i32(0).i64(10).str("com.a").str("7").send());
}

} // namespace
