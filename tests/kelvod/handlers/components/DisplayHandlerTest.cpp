// The display handler end to end: log-device records and notifications in;
// the sample profile (backlight (800 + 90 x level) / 100 per second); rows,
// the foreground and screen notifications others hear, and uploads out.

#include <gtest/gtest.h>
#include <json/json.h>

#include <memory>

#include "FakeKernelDriver.h"
#include "HealthCounters.h"
#include "common/RecordingHandler.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/DisplayHandler.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/DataUploader.h"
#include "utils/XmlParser.h"
#include "utils/devices/KelvoDevice.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kMidnight = 1796515200000LL;  // 2026-12-06 00:00 UTC
constexpr int64_t kH = kMidnight + 10 * kHour;
constexpr int64_t kT = kH - 20 * 60000;

class DisplayTest : public kelvo::test::AgentStorageTest {
protected:
    // The sample configuration with the display's policy.
    virtual int32_t policy() { return 1; }
    void addTables() override {
        WallClock::setFixedTimeMs(kT);
        std::string config = kelvo::test::readHostFile(KELVO_SAMPLE_CONFIG);
        size_t at = config.find("<parameter>1</parameter>", config.find("<element id=\"2\">"));
        config.replace(at, 24, "<parameter>" + std::to_string(policy()) + "</parameter>");
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml", config);
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        Dispatcher::resetForTest();
        DisplayHandler::setForegroundNotificationDelayMs(0);
        mDisplay = new DisplayHandler();
        mDisplay->addSchemaTable();
        AppsAccounting::getInstance()->addSchemaTable();
        DataUploader::getInstance()->addSchemaTable();
    }
    void SetUp() override {
        kelvo::test::AgentStorageTest::SetUp();
        ASSERT_TRUE(mDriver.start());
        ASSERT_EQ(0, mDisplay->earlyInitialize());
        mDisplay->initialize();
        mHeard = new kelvo::test::RecordingHandler("Heard");
        mListener.reset(new NotifierListener(mHeard.get()));
        for (int32_t type : {NOTIFICATION_FOREGROUND_CHANGED, NOTIFICATION_SCREEN_STATE_CHANGED}) {
            Notifier::getInstance()->registerListener(type, mListener.get());
        }
        ASSERT_EQ(0, Dispatcher::getInstance()->startDispatchMessage());
        mWriter.reset(new LogWriter(RootPath::resolve(KELVO_LOG_DEVICE)));
    }
    void TearDown() override {
        mWriter.reset();
        Dispatcher::resetForTest();
        Notifier::getInstance()->unregisterAll(mListener.get());
        mDisplay->readyToDestroy();
        for (const sp<HandlerThread>& t :
             {sp<HandlerThread>(mDisplay.get()), sp<HandlerThread>(mHeard.get())}) {
            t->requestThreadExit();
            t->join();
        }
        AppsAccounting::getInstance()->balanceAccount();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        DisplayHandler::setForegroundNotificationDelayMs(-1);
        XmlParser::resetInstance();
        WallClock::setFixedTimeMs(-1);
        mDriver.stop();
        kelvo::test::AgentStorageTest::TearDown();
    }
    void log(const char* tag, const std::string& text, int64_t time) {
        ASSERT_EQ(0, mWriter->write(LogWriter::PRIORITY_INFO, tag, text.c_str(), time));
    }
    // A notification handled to its end: (an upload's ratio 1), its time,
    // then an int64 or a flag.
    void notify(int32_t type, int64_t time, int64_t second = -1, int flag = -1) {
        Parcel p;
        if (type >= NOTIFICATION_HOURLY_UPLOADING && type <= NOTIFICATION_DAWN_UPLOADING) {
            p.writeFloat(1.0f);
        }
        p.writeInt64(time);
        if (second >= 0) p.writeInt64(second);
        if (flag >= 0) p.writeBool(flag == 1);
        mDisplay->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, p));
    }
    // Records are taken in order: waits for the rows the last ones write.
    void waitRows(const std::string& select, size_t n) {
        ASSERT_TRUE(waitFor([&] { return rows(select).size() >= n; }));
    }
    Json::Value lastEvent(uint32_t id) {
        DataUploader::getInstance()->uploadEvent();
        Json::Value found;
        for (const Json::Value& e : events())
            found = e["event"].asUInt() == id ? e["params"] : found;
        return found;
    }

    fake::FakeKernelDriver mDriver;
    sp<DisplayHandler> mDisplay;
    sp<kelvo::test::RecordingHandler> mHeard;
    std::unique_ptr<NotifierListener> mListener;
    std::unique_ptr<LogWriter> mWriter;
};

// Brightness 120 turns the screen on with the launcher in front; refused
// levels (256, -1, "abc") while it is on write and send nothing; an
// application, then brightness 0. The hour's backlight energy per
// application (116 per second at 120), its accounting and upload.
TEST_F(DisplayTest, ScreenForegroundAndBacklightThroughTheHour) {
    const uint64_t refused = HealthCounters::get(Health::LoggerMessageRefused);
    log("KELVO_TAG_BRIGHTNESS", "brightness=120", kT);
    for (const char* bad : {"brightness=256", "brightness=-1", "brightness=abc"}) {
        log("KELVO_TAG_BRIGHTNESS", bad, kT + 1000);
    }
    log("KELVO_TAG_FOREGROUND_CHANGED", "name=com.a", kT + 60000);
    log("KELVO_TAG_FOREGROUND_CHANGED", "name=com.a", kT + 90000);  // no change
    log("KELVO_TAG_BRIGHTNESS", "brightness=0", kT + 120000);
    waitRows("SELECT id FROM raw_screen_state", 2);
    const std::string t = std::to_string(kT), off = std::to_string(kT + 120000);
    EXPECT_EQ(refused + 3, HealthCounters::get(Health::LoggerMessageRefused));
    // What the others hear: foreground changes (0), screen on and off (1).
    ASSERT_TRUE(waitFor([&] { return mHeard->got().size() >= 5; }));
    std::string heard;
    for (const auto& g : mHeard->got())
        heard += std::to_string(g.what) + "@" + std::to_string(g.time - kT) +
                 (g.what == 1 ? ":" + std::to_string(g.value) + " " : " ");
    EXPECT_EQ("0@0 1@0:1 0@60000 0@120000 1@120000:0 ", heard);
    EXPECT_EQ((std::vector<std::string>{"com.tovaro.android.launcher", "com.a", "screen_off"}),
              rows("SELECT foreground FROM raw_foreground"));
    EXPECT_EQ((std::vector<std::string>{t + "|1", off + "|0"}),
              rows("SELECT timestamp, state FROM raw_screen_state"));
    EXPECT_EQ((std::vector<std::string>{t + "|0|0|0", off + "|120|120000|0"}),
              rows("SELECT timestamp, brightness, duration, charge FROM raw_screen_brightness"));

    notify(NOTIFICATION_HOURLY_TICK, kH - kHour, kH);
    notify(NOTIFICATION_APPLICATIONS_ACCOUNTING, kH);
    notify(NOTIFICATION_COMPONENT_ACCOUNTING, kH);
    notify(NOTIFICATION_HOURLY_UPLOADING, kH);
    AppsAccounting::getInstance()->balanceAccount();
    EXPECT_EQ((std::vector<std::string>{"com.a|60000|6960", "com.tovaro.android.launcher|60000|6960",
                                        "screen_off|1080000|0"}),
              rows("SELECT name, SUM(duration), SUM(energy) FROM hourly_applications_backlight "
                   "GROUP BY name"));
    EXPECT_EQ(std::vector<std::string>{"120000|13920"},
              rows("SELECT duration, energy FROM hourly_component_backlight"));
    EXPECT_EQ((std::vector<std::string>{"com.a|1|6960", "com.tovaro.android.launcher|1|6960"}),
              rows("SELECT name, component, foreground_energy FROM "
                   "hourly_applications_accounting WHERE component = 1 ORDER BY name"));
    Json::Value p = lastEvent(EVENT_HOURLY_COMPONENTS);
    EXPECT_EQ(120000, p["4"]["params"]["5"].asInt64());
    EXPECT_EQ(13920, p["4"]["params"]["0"].asInt64());
    ASSERT_EQ(2u, p["5"].size());  // screen_off is no application
    EXPECT_EQ(6960, p["5"][1]["params"]["1"]["params"]["4"].asInt64());
}

// A charger change splits the span; the daily tick closes the last one,
// which the daily distribution (on battery, lit) counts; ambient levels of
// the auto and front types, a message missing a level refused whole.
TEST_F(DisplayTest, MidnightStatisticsWithChargerSplitAndClosingSpan) {
    const int64_t m = kMidnight + 24 * kHour;
    log("KELVO_TAG_BRIGHTNESS", "brightness=40", m - 600000);
    log("KELVO_TAG_AUTO_AMBIENT_LIGHT", "d0=7 d1=7 d2=7 d4=7 d5=7", m - 500000);
    log("KELVO_TAG_AUTO_AMBIENT_LIGHT", "d0=0 d1=5000 d2=0 d3=0 d4=0 d5=0", m - 500000);
    log("KELVO_TAG_FRONT_AMBIENT_LIGHT", "d0=1000 d1=0 d2=0 d3=0 d4=0 d5=0", m - 500000);
    waitRows("SELECT id FROM raw_ambient_light", 2);
    notify(NOTIFICATION_CHARGER_ONLINE_CHANGED, m - 300000, -1, 1);
    notify(NOTIFICATION_CHARGER_ONLINE_CHANGED, m - 120000, -1, 0);
    // The clock goes back 30 s: the span ends at the old time, the next
    // starts at the new one; a record from before that start is an empty span.
    notify(NOTIFICATION_TIME_CHANGED, m - 60000, m - 90000);
    log("KELVO_TAG_BRIGHTNESS", "brightness=40", m - 100000);
    waitRows("SELECT id FROM raw_screen_brightness", 5);
    notify(NOTIFICATION_DAILY_TICK, m - kHour, m);
    notify(NOTIFICATION_DAILY_UPLOADING, m);
    EXPECT_EQ((std::vector<std::string>{"40|300000|0", "40|180000|1", "40|60000|0", "40|0|0",
                                        "40|90000|0"}),
              rows("SELECT brightness, duration, charge FROM raw_screen_brightness WHERE id > 1"));
    Json::Value p = lastEvent(EVENT_DAILY_SYSTEM);
    ASSERT_EQ(1u, p["10"].size());
    EXPECT_EQ(3, p["10"][0]["params"]["0"].asInt64());  // 40 / 16 + 1
    EXPECT_EQ(450000, p["10"][0]["params"]["1"].asInt64());
    ASSERT_EQ(2u, p["11"].size());  // auto level 1, front level 0 (6)
    EXPECT_EQ(5000, p["11"][0]["params"]["1"].asInt64());
    EXPECT_EQ(6, p["11"][1]["params"]["0"].asInt64());
}

// Policy 2: the backlight follows the device's value per span, scaled by
// 10000 (45 per second at 5000); a value above 10000 is ignored; a charger
// or clock change first closes the span. A device that refuses the
// statistics leaves policy 1: levels, scaled by 100 (116 per second).
struct PolicyCase {
    const char* name;
    bool enableFails;
    const char* energies;  // on battery, on the charger
    friend void PrintTo(const PolicyCase& c, std::ostream* os) { *os << c.name; }
};

class DisplayPolicyTest : public DisplayTest, public ::testing::WithParamInterface<PolicyCase> {
protected:
    int32_t policy() override { return 2; }
    void SetUp() override {
        mDriver.update([](fake::FakeKernelDriver::State& s) {
            s.spanBrightness = {0, 10001};
            s.brightness = 5000;
        });
        if (GetParam().enableFails) {
            mDriver.failRequest(fake::FakeKernelDriver::Device::Kelvo,
                                KelvoDevice::kSetBrightnessInfoEnable, EIO);
        }
        DisplayTest::SetUp();
    }
};

TEST_P(DisplayPolicyTest, BacklightFollowsTheEffectivePolicy) {
    log("KELVO_TAG_BRIGHTNESS", "brightness=120", kT);
    waitRows("SELECT id FROM raw_screen_state", 1);
    notify(NOTIFICATION_FORCE_BALANCE, kT + 60000);
    notify(NOTIFICATION_CHARGER_ONLINE_CHANGED, kT + 120000, -1, 1);
    // Back 90 s: charged up to the old time, then from the new one.
    notify(NOTIFICATION_TIME_CHANGED, kT + 150000, kT + 60000);
    notify(NOTIFICATION_FORCE_BALANCE, kT + 120000);
    EXPECT_EQ(std::vector<std::string>{GetParam().energies},
              rows("SELECT SUM(energy), SUM(charge_energy) FROM raw_applications_backlight"));
}

INSTANTIATE_TEST_SUITE_P(Policies, DisplayPolicyTest,
                         ::testing::Values(PolicyCase{"advanced", false, "2700|4050"},
                                           PolicyCase{"enable_fails", true, "13920|10440"}),
                         [](const ::testing::TestParamInfo<PolicyCase>& i) { return i.param.name; });

}  // namespace
