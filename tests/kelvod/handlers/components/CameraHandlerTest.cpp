// The camera handler end to end: connection records (through the log device
// or straight to the handler), the flashlight handler learning the camera's
// user, the accounting library with the sample profile, rows and uploads.

#include <gtest/gtest.h>
#include <json/json.h>

#include <map>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/CameraHandler.h"
#include "handlers/components/FlashlightHandler.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/HourlyRoutine.h"
#include "storage/DataUploader.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using kelvo::test::waitFor;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kH = 1796515200000LL + 10 * kHour;  // 2026-12-06 10:00 UTC
constexpr int64_t kT = kH - 20 * 60000;

struct CameraCase {
    const char* name;
    bool viaDevice;
    // "TAG[:code] text" (TAG one of C F U I D, the expected return code
    // when not 0), "vmdied", "on" or "off" (the flashlight); a second apart.
    std::vector<std::string> steps;
    // Rows by second: "s|second|name|state|type|width|height" of the state,
    // then "i|second|intent", then the flashlight's "l|second|name|state".
    std::vector<std::string> rows;
    // "f|name|ms" or "r|name|ms" charged per camera.
    std::vector<std::string> charged;
    friend void PrintTo(const CameraCase& c, std::ostream* os) { *os << c.name; }
};

class CameraFixture : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        WallClock::setFixedTimeMs(kT);
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         kelvo::test::readHostFile(KELVO_SAMPLE_CONFIG));
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        Dispatcher::resetForTest();
        HourlyRoutine::setVoteTimeoutMs(0);
        mRoutine = new HourlyRoutine();
        mCamera = new CameraHandler();
        mFlash = new FlashlightHandler();
        for (StorageOperator* op : {static_cast<StorageOperator*>(mRoutine.get()),
                                    static_cast<StorageOperator*>(mCamera.get()),
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
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_FLASHLIGHT, mFlash);
        mRoutine->initialize();
        for (KelvoOperator* op : {static_cast<KelvoOperator*>(mCamera.get()),
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
        for (const sp<KelvoOperator>& op :
             std::vector<sp<KelvoOperator>>{mRoutine.get(), mCamera.get(), mFlash.get()}) {
            op->readyToDestroy();
            op->requestThreadExit();
            op->join();
        }
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        KelvoAgent::getInstance()->setHandlerForTest(HANDLER_FLASHLIGHT, nullptr);
        AppsAccounting::getInstance()->balanceAccount();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
        WallClock::setFixedTimeMs(-1);
        kelvo::test::AgentStorageTest::TearDown();
    }
    void notify(KelvoOperator* op, int32_t type, int64_t time) {
        Parcel p;
        p.writeInt64(time);
        op->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, p));
    }
    size_t cameraRows() {
        return rows(
                   "SELECT 1 FROM raw_camera_state UNION ALL SELECT 1 FROM "
                   "raw_camera_capture_intent")
            .size();
    }
    void tick(int64_t hour) {
        const std::string ticks = "SELECT id FROM debug_hourly_tick";
        const size_t before = rows(ticks).size();
        WallClock::setFixedTimeMs(hour + 500);
        mRoutine->sendMessage(ParcelMessage(MESSAGE_TIMER, HourlyRoutine::kHourlyTimerId));
        ASSERT_TRUE(
            waitFor([&] { return rows(ticks).size() > before; }, std::chrono::milliseconds(15000)));
    }
    void play(const CameraCase& c) {
        // Tag indexes in the order of the letters.
        static const char* kTags[] = {"CONNECT", "CONFIG", "UNCONFIG", "CAPTURE_INTENT",
                                      "DISCONNECT"};
        int64_t t = kT;
        for (const std::string& step : c.steps) {
            t += 1000;
            std::istringstream in(step);
            std::string word, text;
            in >> word;
            std::getline(in >> std::ws, text);
            const int32_t tag = static_cast<int32_t>(std::string("CFUID").find(word[0]));
            if (word == "vmdied") {
                notify(mCamera.get(), NOTIFICATION_VM_DIED, t);
            } else if (word == "on" || word == "off") {
                Parcel body;
                body.writeInt64(t);
                body.writeCString("");
                mFlash->sendMessageSync(ParcelMessage(MESSAGE_LOGGER, word == "on" ? 1 : 0, body));
            } else if (c.viaDevice) {
                // Every step of a device case writes a row: wait for it.
                const size_t before = cameraRows();
                ASSERT_EQ(0, mWriter->write(LogWriter::PRIORITY_INFO,
                                            ("KELVO_TAG_CAMERA_" + std::string(kTags[tag])).c_str(),
                                            text.c_str(), t));
                ASSERT_TRUE(waitFor([&] { return cameraRows() > before; })) << step;
            } else {
                Parcel body;
                body.writeInt64(t);
                body.writeCString(text.c_str());
                const int32_t code = word.size() > 2 ? std::stoi(word.substr(2)) : 0;
                EXPECT_EQ(code, mCamera->sendMessageSync(ParcelMessage(MESSAGE_LOGGER, tag, body)))
                    << step;
            }
        }
        notify(mCamera.get(), NOTIFICATION_FORCE_BALANCE, t + 60000);
    }
    std::vector<std::string> stateRows() {
        const std::string t = "', (timestamp - " + std::to_string(kT) + ") / 1000, ";
        std::vector<std::string> out;
        for (const std::string& q :
             {"'s" + t + "name, state, type, width, height FROM raw_camera_state",
              "'i" + t + "intent FROM raw_camera_capture_intent",
              "'l" + t + "name, state FROM raw_flashlight_state"}) {
            for (const std::string& row : rows("SELECT " + q + " ORDER BY rowid")) {
                out.push_back(row);
            }
        }
        return out;
    }

    sp<HourlyRoutine> mRoutine;
    sp<CameraHandler> mCamera;
    sp<FlashlightHandler> mFlash;
    std::unique_ptr<LogWriter> mWriter;
};

class CameraTest : public CameraFixture, public ::testing::WithParamInterface<CameraCase> {};

const char* kChargedSql =
    "SELECT 'f', name, SUM(background_duration) FROM raw_applications_front_camera GROUP BY name "
    "UNION ALL SELECT 'r', name, SUM(background_duration) FROM raw_applications_rear_camera "
    "GROUP BY name";

TEST_P(CameraTest, ConnectionsAreRecordedAndCharged) {
    const CameraCase& c = GetParam();
    play(c);
    EXPECT_TRUE(waitFor([&] { return rows(kChargedSql) == c.charged; }));
    EXPECT_EQ(c.charged, rows(kChargedSql));
    EXPECT_EQ(c.rows, stateRows());
}

#define CAM "C id=0 name=com.cam"
#define HD "width=1920 height=1080"
INSTANTIATE_TEST_SUITE_P(
    Steps, CameraTest,
    ::testing::Values(
        CameraCase{"rear_single",
                   true,
                   {CAM, "F dual=0 type=0 " HD, "on", "I intent=16", "I intent=17", "off", "D"},
                   {"s|2|com.cam|1|0|1920|1080", "s|7|com.cam|0|0|1920|1080", "i|1|11", "i|4|16",
                    "i|5|17", "i|7|10", "l|3|com.cam|1", "l|6|com.cam|0"},
                   {"r|com.cam|5000"}},
        // An unknown stream changes nothing; dropping the second falls back to
        // the first alone; dropping the first ends the charge. The accounter
        // reports under the camera of the last stream it was given.
        CameraCase{
            "dual_and_both_unconfigures",
            false,
            {"C id=1 name=com.d", "F dual=1 type=1 " HD, "F dual=1 type=2 width=640 height=480",
             "U type=3", "U type=2", "U type=1", "F dual=1 type=1 " HD, "D"},
            {"s|3|com.d|1|1|1920|1080", "s|3|com.d|1|2|640|480", "s|4|com.d|1|1|1920|1080",
             "s|4|com.d|1|2|640|480", "s|5|com.d|1|1|1920|1080", "s|6|com.d|2|-1|0|0",
             "s|8|com.d|0|1|1920|1080", "s|8|com.d|0|2|0|0", "i|1|11"},
            {"f|com.d|3000"}},
        // A lost disconnect: the next connect ends the old charge.
        CameraCase{
            "connect_while_connected",
            false,
            {CAM, "F dual=0 type=0 " HD, "C id=1 name=com.b", "F dual=0 type=1 " HD, "D"},
            {"s|2|com.cam|1|0|1920|1080", "s|3|com.cam|0|0|1920|1080", "s|4|com.b|1|1|1920|1080",
             "s|5|com.b|0|1|1920|1080", "i|1|11", "i|3|10", "i|3|11", "i|5|10"},
            {"f|com.b|1000", "r|com.cam|1000"}},
        // Refused messages change nothing.
        CameraCase{"refused_messages",
                   false,
                   {"F:-3 dual=0 type=0 " HD, "C:-19 id=x name=com.x", CAM,
                    "F:-19 dual=0 type=0 width=1920", "F:-19 dual=0 type=0 width=-1 height=5",
                    "F:-3 dual=1 type=-1 " HD, "F:-3 dual=1 type=4 " HD, "F:-3 dual=0 type=2 " HD,
                    "F:-3 dual=2 type=0 " HD, "I:-19 intent=abc", "D"},
                   {"s|11|com.cam|0|-1|0|0", "i|3|11"},
                   {}},
        // After the framework's death the open camera is charged again.
        CameraCase{"vm_death_then_again",
                   false,
                   {CAM, "F dual=0 type=0 " HD, "vmdied", "D"},
                   {"s|2|com.cam|1|0|1920|1080", "s|4|com.cam|0|0|1920|1080", "i|1|11", "i|4|10"},
                   {"r|com.cam|2000"}}),
    [](const ::testing::TestParamInfo<CameraCase>& info) { return info.param.name; });

// Results by stream type: the front camera's rows and the rear's (second
// streams included) go their own way through the hour and the upload.
TEST_F(CameraFixture, ResultsAreStoredAndUploadedPerCamera) {
    for (int32_t type : {1, 2, -1, 4}) {
        Parcel result;
        result.writeInt32(type);
        result.writeInt64(kT);
        result.writeInt64(kT + 60000);
        result.writeString8(android::String8(type == 1 ? "com.f" : "com.r"));
        for (int i = 0; i < 6; ++i) {
            result.writeInt32(i == 1 ? 60000 / type : 0);
            result.writeInt64(i == 1 ? 100 * type : 0);
        }
        EXPECT_EQ(type >= 0 && type <= 3 ? 0 : -3,
                  mCamera->handleLibraryEvent(LIBRARY_EVENT_APPLICATION, result))
            << type;
    }
    tick(kH);
    const char* sql = "SELECT name, background_duration, background_energy FROM ";
    EXPECT_EQ(std::vector<std::string>{"com.f|60000|100"},
              rows(std::string(sql) + "hourly_applications_front_camera"));
    EXPECT_EQ(std::vector<std::string>{"com.r|30000|200"},
              rows(std::string(sql) + "hourly_applications_rear_camera"));
    Json::Value p;
    for (const Json::Value& e : events()) {
        if (e["event"].asUInt() == EVENT_HOURLY_COMPONENTS) p = e["params"];
    }
    EXPECT_EQ(60000, p["14"]["params"]["7"].asInt64());
    EXPECT_EQ("com.f", p["15"][0]["params"]["3"]["params"]["0"].asString());
    EXPECT_EQ(30000, p["16"]["params"]["7"].asInt64());
    EXPECT_EQ("com.r", p["17"][0]["params"]["3"]["params"]["0"].asString());
}

}  // namespace
