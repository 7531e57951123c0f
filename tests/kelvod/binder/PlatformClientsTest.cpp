#include <binder/IServiceManager.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "binder/managers/ActivityManager.h"
#include "binder/managers/BatteryManager.h"
#include "binder/managers/PackageManager.h"
#include "binder/managers/SysinfoManager.h"
#include "binder/managers/WakelockManager.h"
#include "core/Notifier.h"
#include "kelvo/WallClock.h"
#include "kelvod/binder/PlatformServicesFixture.h"
#include "common/RecordingHandler.h"

using android::Parcel;
using android::sp;
using android::String16;
using android::String8;
using namespace kelvo;
using kelvo::test::waitFor;

namespace {

constexpr auto kLong = std::chrono::milliseconds(20000);
// Activity service code of the running processes (sdk level other than 24).
constexpr uint32_t kRunningProcesses = 77;

// The notifications of the types it listens for; value: the battery level,
// or whether a charger is online.
using Collector = test::RecordingHandler;
using Received = test::RecordingHandler::Got;

// One collector for the whole program: the notifier keeps its listeners.
Collector* collector() {
    static sp<Collector> thread = new Collector("PlatformCollector");
    static NotifierListener* listener = [] {
        NotifierListener* l = new NotifierListener(thread);
        for (int32_t type :
             {kelvo::NOTIFICATION_VM_DIED, kelvo::NOTIFICATION_BATTERY_LEVEL_CHANGED,
              kelvo::NOTIFICATION_CHARGER_ONLINE_CHANGED, kelvo::NOTIFICATION_DIFF_DAY_REBOOT}) {
            Notifier::getInstance()->registerListener(type, l);
        }
        return l;
    }();
    (void)listener;
    return thread.get();
}

size_t countOf(int32_t type) {
    return collector()->count(kelvo::MESSAGE_NOTIFICATION, type);
}

// Everything sent before returns has reached the collector.
void drain() {
    size_t before = countOf(kelvo::NOTIFICATION_DIFF_DAY_REBOOT);
    Parcel body;
    body.writeInt64(-1);
    Notifier::getInstance()->sendNotification(kelvo::NOTIFICATION_DIFF_DAY_REBOOT, body);
    ASSERT_TRUE(waitFor(
        [&] { return countOf(kelvo::NOTIFICATION_DIFF_DAY_REBOOT) > before; }, kLong));
}

void setClockOffset(int64_t ms) {
    setenv("KELVO_CLOCK_OFFSET_MS", std::to_string(ms).c_str(), 1);
    kelvo::WallClock::reloadOffset();
}

class PlatformClientsTest : public kelvo::test::PlatformServicesFixture {
protected:
    void TearDown() override {
        setClockOffset(0);
        PlatformServicesFixture::TearDown();
    }
};

} // namespace

TEST_F(PlatformClientsTest, PackageServiceDeathSendsOneVmDiedAndReconnects) {
    collector();
    state().setPackages(10210, {"com.example.before"});
    std::vector<String8> packages;
    ASSERT_EQ(0, PackageManager::getInstance()->getPackagesForUid(10210, packages));
    drain();
    collector()->clear();

    ASSERT_EQ(android::NO_ERROR, mServices->stop("package"));
    ASSERT_TRUE(waitFor([] { return countOf(kelvo::NOTIFICATION_VM_DIED) >= 1; }, kLong));
    ASSERT_EQ(android::NO_ERROR, mServices->start("package"));
    state().setPackages(10210, {"com.example.after"});
    packages.clear();
    ASSERT_EQ(0, PackageManager::getInstance()->getPackagesForUid(10210, packages));
    ASSERT_EQ(1u, packages.size());
    EXPECT_STREQ("com.example.after", packages[0].string());
    drain();
    EXPECT_EQ(1u, countOf(kelvo::NOTIFICATION_VM_DIED));
}

TEST_F(PlatformClientsTest, ProcessTableIsFetchedOncePer101Ms) {
    ActivityManager* am = ActivityManager::getInstance();
    state().setProcesses({{7001, 10300, "com.example.a", {"com.example.a"}},
                          {7002, 10301, "com.example.b", {"com.example.b", "com.example.b2"}}});
    setClockOffset(0);
    auto start = std::chrono::steady_clock::now();
    std::vector<String8> out;
    ASSERT_EQ(0, am->getPackagesForPid(10300, 7001, out));
    ASSERT_EQ(1u, out.size());
    EXPECT_STREQ("com.example.a", out[0].string());
    int32_t first = state().calls("activity", kRunningProcesses);

    // 50 ms later on the wall clock, whatever time really passed.
    auto elapsed = std::chrono::duration_cast<std::chrono::milliseconds>(
                       std::chrono::steady_clock::now() - start)
                       .count();
    setClockOffset(50 - elapsed);
    out.clear();
    ASSERT_EQ(0, am->getPackagesForPid(10301, 7002, out));
    EXPECT_EQ(2u, out.size());
    EXPECT_EQ(first, state().calls("activity", kRunningProcesses));
    // A clock set back 50 ms is no reason to refresh either.
    setClockOffset(-50 - elapsed);
    out.clear();
    ASSERT_EQ(0, am->getPackagesForPid(10301, 7002, out));
    EXPECT_EQ(first, state().calls("activity", kRunningProcesses));

    // 101 ms after the refresh the table is fetched again.
    state().setProcesses({{7003, 10302, "com.example.c", {"com.example.c"}}});
    setClockOffset(101);
    out.clear();
    ASSERT_EQ(0, am->getPackagesForPid(10302, 7003, out));
    ASSERT_EQ(1u, out.size());
    EXPECT_STREQ("com.example.c", out[0].string());
    EXPECT_EQ(first + 1, state().calls("activity", kRunningProcesses));

    // Another uid's pid gives nothing, an isolated uid takes the process's.
    setClockOffset(300);
    out.clear();
    EXPECT_EQ(0, am->getPackagesForPid(10999, 7003, out));
    EXPECT_TRUE(out.empty());
    EXPECT_EQ(0, am->getPackagesForPid(99001, 7003, out));
    EXPECT_EQ(1u, out.size());

    // A missing activity service empties the table.
    ASSERT_EQ(android::NO_ERROR, mServices->stop("activity"));
    ASSERT_TRUE(waitFor([am] { return !am->isConnected(); }, kLong));
    out.clear();
    EXPECT_EQ(-2, am->getPackagesForPid(10302, 7003, out));
    EXPECT_TRUE(out.empty());
}

TEST_F(PlatformClientsTest, BatteryRegistrationIsRetriedAndSendsLevelBeforeCharger) {
    collector();
    BatteryManager* battery = BatteryManager::getInstance();
    ASSERT_EQ(0, battery->initialize());
    ASSERT_TRUE(waitFor([battery] { return battery->isRegistered(); }, kLong));
    ASSERT_EQ(android::NO_ERROR, mServices->stop("batteryproperties"));
    ASSERT_TRUE(waitFor([battery] { return !battery->isRegistered(); }, kLong));
    // Long enough for the first retries to fail.
    std::this_thread::sleep_for(std::chrono::milliseconds(800));
    EXPECT_FALSE(battery->isRegistered());
    ASSERT_EQ(android::NO_ERROR, mServices->start("batteryproperties"));
    ASSERT_TRUE(waitFor([battery] { return battery->isRegistered(); }, kLong));

    PlatformState::Battery props = state().battery();
    props.level = 38;
    props.acOnline = false;
    props.usbOnline = true;
    state().setBattery(props);
    ASSERT_TRUE(waitFor(
        [] { return countOf(kelvo::NOTIFICATION_CHARGER_ONLINE_CHANGED) >= 1; }, kLong));
    drain();
    std::vector<Received> got;
    for (const Received& r : collector()->got()) {
        if (r.what != kelvo::NOTIFICATION_DIFF_DAY_REBOOT) got.push_back(r);
    }
    ASSERT_LE(2u, got.size());
    EXPECT_EQ(kelvo::NOTIFICATION_BATTERY_LEVEL_CHANGED, got[got.size() - 2].what);
    EXPECT_EQ(38, got[got.size() - 2].value);
    EXPECT_EQ(kelvo::NOTIFICATION_CHARGER_ONLINE_CHANGED, got.back().what);
    EXPECT_EQ(1, got.back().value);

    // The same values again send nothing.
    collector()->clear();
    state().setBattery(props);
    drain();
    EXPECT_EQ(0u, countOf(kelvo::NOTIFICATION_BATTERY_LEVEL_CHANGED));
    EXPECT_EQ(0u, countOf(kelvo::NOTIFICATION_CHARGER_ONLINE_CHANGED));
    props.usbOnline = false;
    state().setBattery(props);
}

namespace {

// A "pmservice" that claims more records than its reply holds.
class LyingPmService : public android::BBinder {
public:
    const String16& getInterfaceDescriptor() const override { return mDescriptor; }

protected:
    android::status_t onTransact(uint32_t code, const Parcel& data, Parcel* reply,
                                 uint32_t flags) override {
        if (code != 101) return android::BBinder::onTransact(code, data, reply, flags);
        reply->writeNoException();
        reply->writeInt32(0x7fffffff);
        reply->writeString16(String16("only one"));
        return android::NO_ERROR;
    }

private:
    String16 mDescriptor{u"vendor.pm.IPmService"};
};

} // namespace

TEST_F(PlatformClientsTest, WakelocksResetNoteTracesAndACountLargerThanTheReply) {
    kelvo::WakelockManager* pm = kelvo::WakelockManager::getInstance();
    state().setWakelocks({"wl1 10010 3 1200", "wl2 1000 1 40"});
    std::vector<String16> out;
    ASSERT_EQ(0, pm->getPartialWakelocks(out));
    ASSERT_EQ(2u, out.size());
    EXPECT_EQ(String16("wl2 1000 1 40"), out[1]);
    ASSERT_EQ(0, pm->noteResetBatteryStats());
    EXPECT_TRUE(waitFor([this] { return state().resetCount() == 1; }, kLong));
    // Traces are written below the root.
    EXPECT_EQ(-5, kelvo::SysinfoManager::getInstance()->dumpSystrace(nullptr));
    mRoot.writeFile("/data/kelvo/trace/.keep", "");
    ASSERT_EQ(0, kelvo::SysinfoManager::getInstance()->dumpSystrace("/data/kelvo/trace/t1.txt"));
    EXPECT_NE("", mRoot.readFile("/data/kelvo/trace/t1.txt"));
    ASSERT_EQ(1u, state().traces().size());
    // A path that would leave the root is refused.
    EXPECT_EQ(-8, kelvo::SysinfoManager::getInstance()->dumpSystrace("/data/../../escape.txt"));
    // A service that claims more records than its reply holds is refused.
    ASSERT_EQ(android::NO_ERROR, mServices->stop("pmservice"));
    ASSERT_TRUE(waitFor([pm] { return !pm->isConnected(); }, kLong));
    sp<LyingPmService> liar = new LyingPmService();
    ASSERT_EQ(android::NO_ERROR,
              android::defaultServiceManager()->addService(String16("pmservice"), liar));
    out.clear();
    EXPECT_EQ(-12, pm->getPartialWakelocks(out));
    EXPECT_TRUE(out.empty());
    ASSERT_EQ(android::NO_ERROR, kelvo::ServiceControl::stopService(String16("pmservice")));
    EXPECT_TRUE(waitFor([pm] { return !pm->isConnected(); }, kLong));
}
