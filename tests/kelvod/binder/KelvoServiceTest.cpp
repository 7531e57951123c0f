// The binder service through its binder: who is served, collection paths,
// push messages, and every dumpsys option with its exact text.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "KelvoQueryClient.h"
#include "binder/IKelvoService.h"
#include "common/RecordingHandler.h"
#include "core/Notifier.h"
#include "kelvod/binder/KelvoServiceFixture.h"

using android::sp;
using android::String16;
using namespace kelvo;
using kelvo::test::LogCapture;

namespace {

class KelvoServiceTest : public kelvo::test::KelvoServiceFixture {};

const char kVersionLine[] = "Kelvo Daemon (Version: 000.1.4.0)\n";

TEST_F(KelvoServiceTest, OnlyTheSystemUidIsServedAndDumpNeedsThePermission) {
    SKIP_UNLESS_ROOT();
    LogCapture log;
    // The system uid is served and answered; another uid gets -1 and its
    // query never reaches the query service. The answer may take seconds
    // under the sanitizers; the refused call has none to wait for.
    const std::vector<std::string> calls = {"component", "0", "1", "0", "0", "close"};
    EXPECT_EQ("--\n0\n", asUid(1000, calls, nullptr, 30000));
    EXPECT_EQ("no answer\n--\n-1\n", asUid(1001, calls, nullptr, 1000));
    EXPECT_EQ(2u, log.count("Permission Denial: can't communicate with kelvo, uid=1001",
                            ANDROID_LOG_ERROR));

    // dumpsys: the shell always, others only with the DUMP permission.
    struct Case {
        uid_t uid;
        bool granted;
        bool allowed;
    };
    for (const Case& c :
         {Case{1001, false, false}, Case{1001, true, true}, Case{2000, false, true}}) {
        mState->grant("android.permission.DUMP", c.uid, c.granted);
        pid_t pid = -1;
        std::string out = asUid(c.uid, {"dump", "--version"}, &pid);
        std::string denial =
            "Permission Denial: cannot dump KELVO information from pid=" + std::to_string(pid) +
            ", uid=" + std::to_string(c.uid) + "\n";
        EXPECT_EQ(c.allowed ? kVersionLine : denial, out) << c.uid << " " << c.granted;
        android::PermissionCache::purge();
    }
}

TEST_F(KelvoServiceTest, CollectionPathsAndPushMessagesAreCheckedBeforeForwarding) {
    SKIP_UNLESS_ROOT();
    struct Case {
        const char* message;  // null: a capture of the path
        const char* path;
        int32_t result;
    };
    const std::string deep = std::string(5000, '[') + std::string(5000, ']');
    const std::string sample = R"({"transactionid":"t1","fieldid":903,"extra":"2"})";
    const std::vector<Case> cases = {
        {nullptr, "/data/log/kelvo-collect", 0},
        {nullptr, "/data/log/a..b", 0},
        {nullptr, "/sdcard/log", -2},
        {nullptr, "/data/log/../../etc", -2},
        {nullptr, "/data/log/a/..", -2},
        {nullptr, "/tmp/data/log/x", -2},
        {sample.c_str(), "/data/logx", -2},
        {sample.c_str(), "/data/log/collect", 0},
        {R"({"transactionid":7,"fieldid":903})", "/data/log/collect", 0},
        {R"({"transactionid":"t1","fieldid":904})", "/data/log/collect", -3},
        {R"({"transactionid":"","fieldid":903})", "/data/log/collect", -3},
        {R"([{"transactionid":"t1","fieldid":903}])", "/data/log/collect", -3},
        {R"({"transactionid":"t1","fieldid":1e20})", "/data/log/collect", -3},
        {R"({"transactionid":"t1","fieldid":903,"extra":{}})", "/data/log/collect", -3},
        {R"({"transactionid":"t1","fieldid":903} x)", "/data/log/collect", -3},
        {deep.c_str(), "/data/log/collect", -3},
        {"", "/data/log/collect", -3},
    };
    const std::string collect = mRoot->path() + "/data/log/collect";
    kelvo::test::makeHostDirs(collect);
    chmod(collect.c_str(), 0777);
    LogCapture log;
    uint64_t refused = HealthCounters::get(Health::ServiceRequestsRefused);
    std::vector<std::string> calls;
    for (const Case& c : cases) {
        if (c.message == nullptr) {
            calls.insert(calls.end(), {"capture", c.path});
        } else {
            calls.insert(calls.end(), {"sample", c.message, c.path});
        }
    }
    // Still serving after all that.
    calls.insert(calls.end(), {"open", "1"});
    std::string got = asUid(1000, calls);
    std::string expected;
    size_t refusals = 0;
    for (const Case& c : cases) {
        expected += std::to_string(c.result) + "\n";
        refusals += c.result < 0 ? 1 : 0;
    }
    EXPECT_EQ(expected + "0\n", got);
    EXPECT_EQ(refused + refusals, HealthCounters::get(Health::ServiceRequestsRefused));
    EXPECT_TRUE(log.contains("Invalid field id: 904", ANDROID_LOG_ERROR));
    EXPECT_TRUE(log.contains("Failed to parse transaction id", ANDROID_LOG_ERROR));
    EXPECT_EQ(8u, log.count("Invalid push message", ANDROID_LOG_ERROR));
    // Accepted messages reached the storage, refused paths never did.
    EXPECT_TRUE(kelvo::test::waitFor([&] { return !kelvo::test::listDir(collect).empty(); }));
    EXPECT_FALSE(log.contains("Refuse upload path: /data/log/../../etc"));
}

TEST_F(KelvoServiceTest, DumpsysOptionsPrintTheirExactTexts) {
    const std::string help =
        "Kelvo daemon dumpsys help information\ncommand: dumpsys KelvoService [options]\n"
        "options:\n  --version    -v : show kelvod version\n"
        "  --help       -h : show this help information\n"
        "  --dump       -d : dump message for handlers and routines\n"
        "  --log        -l : log print control\n  --flush      -f : force flush database\n"
        "  --balance    -b : force balance\n  --discharge     : change charging status on/off\n";
    const std::string logUsage = "Usage: dumpsys KelvoService --log [module] [enable]\n";
    const std::string enableError = "Error: [enable] = {0, 1}\n";
    const std::string chargeUsage =
        "Usage: dumpsys KelvoService --discharge [1/0]  1:discharge 0:charge\n";
    const std::string mismatch = "Error: wrong parameter or inconsistent with file\n";
    const char* kSwitch = KelvoService::kChargeSwitchPath;
    struct Case {
        std::vector<std::string> args;
        const char* switchFile;  // null: absent
        std::string output;
        uint32_t mask;   // module mask afterwards
        int32_t online;  // charger notification sent: 1 / 0, -1 none
    };
    const std::vector<Case> cases = {
        {{}, nullptr, "", 0, -1},
        {{"--version"}, nullptr, kVersionLine, 0, -1},
        {{"-v"}, nullptr, kVersionLine, 0, -1},
        {{"--help"}, nullptr, help, 0, -1},
        {{"-h"}, nullptr, help, 0, -1},
        {{"--bogus"}, nullptr, "Unknown argument: --bogus\n", 0, -1},
        {{"--log"}, nullptr, logUsage, 0, -1},
        {{"-l", "cpu"}, nullptr, logUsage, 0, -1},
        {{"--log", "cpu", "2"}, nullptr, enableError, 0, -1},
        {{"--log", "cpu", ""}, nullptr, enableError, 0, -1},
        {{"--log", "cpu", "1"}, nullptr, "", LOG_MODULE_CPU, -1},
        {{"--log", "gpu", "1"}, nullptr, "", LOG_MODULE_CPU | LOG_MODULE_GPU, -1},
        {{"--log", "foo", "1"},
         nullptr,
         "Error: [module] = {module, debug, info, audio, bluetooth, camera, cpu, display, "
         "flashlight, gnss, modem, sensor, wifi, dpm, system, thermal, storage, dispatcher, "
         "bufferedlog}\n",
         LOG_MODULE_CPU | LOG_MODULE_GPU,
         -1},
        {{"--log", "module", "1"}, nullptr, "", LOG_MODULE_ALL, -1},
        {{"--log", "module", "0"}, nullptr, "", 0, -1},
        {{"--flush"}, nullptr, "", 0, -1},
        {{"-b"}, nullptr, "", 0, -1},
        {{"--discharge"}, nullptr, chargeUsage, 0, -1},
        {{"--discharge", "1"}, nullptr, "Error: Failed to open " + std::string(kSwitch) + "\n",
         0, -1},
        {{"--discharge", "1"}, "1\n", "", 0, 0},
        {{"--discharge", "0"}, "0", "", 0, 1},
        {{"--discharge", "1"}, "0\n", mismatch, 0, -1},
        {{"--discharge", "0"}, "", mismatch, 0, -1},
        {{"--discharge", "11"}, "1\n", mismatch, 0, -1},
        {{"--discharge", ""}, "1\n", mismatch, 0, -1},
    };
    sp<kelvo::test::RecordingHandler> charger = new kelvo::test::RecordingHandler("ChargerWatch");
    NotifierListener listener(charger.get());
    Notifier::getInstance()->registerListener(NOTIFICATION_CHARGER_ONLINE_CHANGED, &listener);
    Notifier::getInstance()->registerListener(NOTIFICATION_FORCE_BALANCE, &listener);
    gLogModuleMask = 0;
    for (const Case& c : cases) {
        std::string where = c.args.empty()
                                ? "(none)"
                                : c.args[0] + " " + std::string(c.switchFile ? c.switchFile : "-");
        unlink((mRoot->path() + kSwitch).c_str());
        if (c.switchFile != nullptr) mRoot->writeFile(kSwitch, c.switchFile);
        charger->clear();
        EXPECT_EQ(c.output, dumpOf(mService, c.args)) << where;
        EXPECT_EQ(c.mask, gLogModuleMask.load()) << where;
        // One marker round trip through the notifier thread, then the count.
        Notifier::getInstance()->sendNotification(NOTIFICATION_FORCE_BALANCE, android::Parcel());
        ASSERT_TRUE(kelvo::test::waitFor([&] {
            return charger->count(MESSAGE_NOTIFICATION, NOTIFICATION_FORCE_BALANCE) >=
                   (c.args.size() == 1 && c.args[0] == "-b" ? 2u : 1u);
        }));
        std::vector<int32_t> online;
        for (const auto& g : charger->got()) {
            if (g.what == NOTIFICATION_CHARGER_ONLINE_CHANGED) online.push_back(g.value);
        }
        EXPECT_EQ(c.online < 0 ? std::vector<int32_t>{} : std::vector<int32_t>{c.online}, online)
            << where;
    }
    Notifier::getInstance()->unregisterAll(&listener);
    charger->requestThreadExit();
}

}  // namespace
