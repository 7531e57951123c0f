// The CPU handler on a private root: the counter tree of a two-cluster phone,
// the fake kernel driver, the fake package service, the accounting library
// with the sample profile, the storage thread, and a stand-in hourly routine.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "CpuTree.h"
#include "FakeKernelDriver.h"
#include "HealthCounters.h"
#include "PlatformServices.h"
#include "binder/managers/ActivityManager.h"
#include "binder/managers/PackageManager.h"
#include "core/AppsAccounting.h"
#include "core/BufferedLogServer.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/CpuHandler.h"
#include "kelvo/BufferedLogClient.h"
#include "kelvo/ZendrelHost.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/PackageProperty.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::sp;
using android::String8;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;
using Record = CpuReport::Record;

namespace {

constexpr int64_t kHour = 3600000;
constexpr int64_t kH = 472222LL * kHour;  // an hour boundary
constexpr int64_t kT = kH - kHour + 60000;
constexpr uint32_t kSingle = 10010;  // one package: its uid counter counts
constexpr uint32_t kMulti = 10050;   // two packages: its processes count
const std::vector<std::string> kMultiPackages = {"com.multi.a", "com.multi.b"};

// Records what operators ask of the hourly routine: code, then fields.
class StandInRoutine : public KelvoOperator {
public:
    StandInRoutine() : KelvoOperator("StandInRoutine", -1, 0) {}
    int32_t handleCustomized(int32_t code, const Parcel& data, Parcel*) override {
        std::string r = std::to_string(code);
        if (code == 0 || code == 3) {
            int64_t time = data.readInt64();
            int32_t second = data.readInt32();
            r += " " + std::to_string(time) + " " + std::to_string(second);
            r += " " + std::to_string(code == 0 ? data.readInt32() : data.readInt64());
        } else {
            while (data.dataAvail() >= 4) r += " " + std::to_string(data.readInt32());
        }
        std::lock_guard<std::mutex> guard(mLock);
        mGot.push_back(r);
        return 0;
    }
    bool got(const std::string& r) {
        std::lock_guard<std::mutex> guard(mLock);
        return std::find(mGot.begin(), mGot.end(), r) != mGot.end();
    }

private:
    std::mutex mLock;
    std::vector<std::string> mGot;
};

std::string vote(int64_t time, int32_t candidate) {
    return "0 " + std::to_string(time) + " " + std::to_string(candidate) + " 256";
}

Record proc(uint32_t uid, int32_t pid, int64_t ms, uint8_t type, const std::string& name) {
    return Record{uid, pid, ms * 1000, type, name};
}

class CpuHandlerTest : public kelvo::test::AgentStorageTest {
public:
    void addTables() override {
        ServiceControl::setServiceWaitMs(300);
        mServices.reset(new PlatformServices());
        ASSERT_EQ(android::NO_ERROR, mServices->startAll());
        mServices->state()->setPackages(kSingle, {"com.single"});
        mServices->state()->setPackages(kMulti, kMultiPackages);
        mServices->state()->setPackages(1000, {"android", "com.android.settings"});
        for (uint32_t uid : {0u, 1000u, kSingle, kMulti}) {
            PackageProperty::getInstance()->removeUid(static_cast<int32_t>(uid));
        }
        mRoot->writeFile("/data/misc/kelvo/tv_kelvo_config.xml",
                         kelvo::test::readHostFile(KELVO_SAMPLE_CONFIG));
        XmlParser::resetInstance();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        KelvoLibAgent::getInstance()->start(0);
        mTree.reset(new CpuTree(mRoot->path()));
        ASSERT_TRUE(mTree->layout(CpuTree::phoneClusters()));
        for (const CpuTree::Cluster& c : mTree->clusters())
            mTicks.emplace_back(c.frequencies.size());
        ASSERT_TRUE(mDriver.start());
        // The process-wide server listens below the root of its first start.
        ASSERT_EQ(0, BufferedLogServer::getInstance()->start());
        mRoutine = new StandInRoutine();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, mRoutine);
        CpuHandler::setReportWaitMs(5000);
        // A tick rate that does not divide 1000: 3.33 ms per tick.
        CpuHandler::setClockHz(300);
        mHandler = new CpuHandler();
        ASSERT_EQ(0, mHandler->earlyInitialize());
        mHandler->addSchemaTable();
        AppsAccounting::getInstance()->addSchemaTable();
        DataUploader::getInstance()->addSchemaTable();
    }
    void SetUp() override {
        kelvo::test::AgentStorageTest::SetUp();
        mHandler->initialize();
    }
    void TearDown() override {
        mHandler->readyToDestroy();
        mHandler->requestThreadExit();
        mHandler.clear();
        CpuHandler::setClockHz(0);
        mRoutine->requestThreadExit();
        KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
        mRoutine.clear();
        mDriver.stop();
        KelvoLibAgent::getInstance()->resetAccountersForTest();
        XmlParser::resetInstance();
        mServices.reset();
        EXPECT_TRUE(waitFor([] { return !PackageManager::getInstance()->isConnected(); }));
        EXPECT_TRUE(waitFor([] { return !ActivityManager::getInstance()->isConnected(); }));
        ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs);
        kelvo::test::AgentStorageTest::TearDown();
    }

    // Rewrites every counter from the fixture's state.
    void writeCounters() {
        std::vector<CpuTree::UidTime> uids;
        for (const auto& u : mUidMs) uids.push_back({u.first, u.second * 600, u.second * 400});
        ASSERT_TRUE(mTree->setUidTimes(uids));
        for (size_t c = 0; c < mTicks.size(); ++c)
            ASSERT_TRUE(mTree->setClusterTicks(c, mTicks[c]));
        for (int core = 0; core < 8; ++core) {
            for (int s = 0; s < 2; ++s)
                ASSERT_TRUE(mTree->setIdleTime(core, s, mIdleMs[core][s] * 1000));
        }
    }
    // Spreads ms of busy time over the clusters' lowest steps (10 ms ticks).
    void addLoad(const std::map<uint32_t, uint64_t>& uidMs) {
        for (const auto& u : uidMs) {
            mUidMs[u.first] += u.second;
            mTicks[0][0] += u.second / 10;
            mTicks[1][1] += u.second / 20;
        }
    }
    int32_t notify(int32_t type, const Parcel& body) {
        return mHandler->sendMessageSync(ParcelMessage(MESSAGE_NOTIFICATION, type, body));
    }
    int32_t poll(int32_t reason, int64_t time, int64_t extra = 0, bool online = false) {
        PollingPayload p;
        p.reason = reason;
        p.time = time;
        p.hour = extra;
        p.newTime = extra;
        p.online = online;
        Parcel body;
        p.writeTo(body);
        return notify(NOTIFICATION_DATA_POLLING, body);
    }
    int32_t foreground(int64_t time, const char* name) {
        Parcel body;
        body.writeInt64(time);
        body.writeString8(String8(name));
        return notify(NOTIFICATION_FOREGROUND_CHANGED, body);
    }
    // A report as the buffered log server hands it to the handler.
    int32_t deliver(const std::string& payload) {
        Parcel body;
        body.writeInt64(0);
        body.writeString8(String8(CpuHandler::kDriverName));
        body.writeInt32(CpuHandler::kReportMagic);
        body.writeInt32(static_cast<int32_t>(payload.size()));
        body.write(payload.data(), payload.size());
        return mHandler->sendMessageSync(ParcelMessage(MESSAGE_BUFFERED_LOG, body));
    }
    int32_t report(int64_t time, int32_t mode, const std::vector<Record>& alive,
                   const std::vector<Record>& dead = {}) {
        if (!dead.empty()) deliver(CpuReport::encode(time, mode, 0, dead));
        return deliver(CpuReport::encode(time, mode, 1, alive));
    }
    // One polled pass at t with its report.
    void pass(int64_t time, const std::vector<Record>& alive = {},
              const std::vector<Record>& dead = {}) {
        writeCounters();
        ASSERT_EQ(0, poll(POLLING_THERMAL, time));
        report(time, CpuHandler::MODE_POLL, alive, dead);
    }
    // CPU time per application name over every stored pass.
    std::map<std::string, long long> appTimes() {
        std::map<std::string, long long> out;
        for (const std::string& r : rows("SELECT name, SUM(foreground_time + background_time + "
                                         "charge_foreground_time + charge_background_time) FROM "
                                         "raw_applications_cpu GROUP BY name")) {
            out[r.substr(0, r.find('|'))] = std::stoll(r.substr(r.find('|') + 1));
        }
        return out;
    }

    std::unique_ptr<PlatformServices> mServices;
    std::unique_ptr<CpuTree> mTree;
    fake::FakeKernelDriver mDriver;
    sp<StandInRoutine> mRoutine;
    sp<CpuHandler> mHandler;
    std::map<uint32_t, uint64_t> mUidMs;
    std::vector<std::vector<uint64_t>> mTicks;
    uint64_t mIdleMs[8][2] = {};
};

TEST_F(CpuHandlerTest, ProcessesAndUidsAreChargedToTheirPackages) {
    // uid 0 and 1000 threads share their pool's name; a two-package app's
    // processes are "package-process"; a one-package app counts its uid
    // counter and ignores its processes.
    addLoad({{kSingle, 1000}, {kMulti, 900}, {0, 50}, {1000, 50}});
    std::vector<Record> procs = {
        proc(kSingle, 200, 5000, 1, "com.single"),
        proc(kMulti, 300, 1000, 1, "com.multi.a:remote"),
        proc(0, 10, 100, 2, "kernel_kworker/0:1"),
        proc(0, 11, 100, 2, "kernel_kworker/1:2H"),
        proc(1000, 20, 100, 2, "system_server_Binder:512_3"),
        proc(1000, 21, 100, 1, "surfaceflinger"),
    };
    pass(kT, procs);
    EXPECT_TRUE(rows("SELECT * FROM raw_applications_cpu").empty()) << "baseline pass";
    EXPECT_TRUE(rows("SELECT * FROM raw_cpu_idle_time").empty());
    EXPECT_TRUE(rows("SELECT * FROM raw_cpu_frequencies_time").empty());

    addLoad({{kSingle, 400}});
    mIdleMs[0][0] += 30;
    procs[0].timeUs += 9000000;  // ignored: its uid has one package
    procs[1].timeUs += 300000;
    procs[2].timeUs += 40000;
    procs[3].timeUs += 20000;
    procs[4].timeUs += 70000;
    procs[5].timeUs += 15000;
    pass(kT + 60000, procs);
    std::map<std::string, long long> expected = {
        {"com.single", 400},    {"com.multi.a-com.multi.a:remote", 300},
        {"kernel_kworker", 60}, {"system_server_Binder", 70},
        {"surfaceflinger", 15},
    };
    EXPECT_EQ(expected, appTimes());
    EXPECT_EQ(std::vector<std::string>({"0|30", "1|0"}),
              rows("SELECT cluster, idle_time FROM raw_cpu_idle_time"));
    EXPECT_EQ(1u, rows("SELECT * FROM raw_component_cpu").size());
    // Residency in ms from cumulative ticks at 300 Hz: 200 -> 240 and
    // 99 -> 119 ticks (not 3 ms per tick).
    EXPECT_EQ(std::vector<std::string>({"0|300000|134", "1|652800|66"}),
              rows("SELECT cluster, frequency, time FROM raw_cpu_frequencies_time WHERE time > 0"));

    // The process-name query answers from the pid entries.
    struct Query {
        int32_t uid, pid, result;
        const char* name;
    } queries[] = {{static_cast<int32_t>(kMulti), 300, 0, "com.multi.a-com.multi.a:remote"},
                   {0, 10, 0, "kernel_kworker"},
                   {static_cast<int32_t>(kMulti), 999, -4, ""},
                   {4242, 300, -4, ""}};
    for (const Query& q : queries) {
        Parcel data;
        data.writeInt32(q.uid);
        data.writeInt32(q.pid);
        Parcel reply;
        EXPECT_EQ(q.result, mHandler->sendCustomizedMessage(0, data, &reply, true)) << q.pid;
        reply.setDataPosition(0);
        if (q.result == 0) {
            EXPECT_EQ(q.name, std::string(reply.readString8().string()));
        }
    }
}

TEST_F(CpuHandlerTest, BadReportsAreDroppedAndCounted) {
    pass(kT);
    std::string good = CpuReport::encode(kT, 1, 1, {proc(kMulti, 1, 5, 1, "x")});
    std::string negative = good;
    int32_t minusOne = -1;
    memcpy(&negative[16], &minusOne, 4);
    std::string huge = good;
    int32_t big = 0x7fffffff;
    memcpy(&huge[16], &big, 4);
    struct Case {
        const char* name;
        std::string payload;
    } cases[] = {
        {"short header", good.substr(0, 19)},
        {"count beyond the data", good.substr(0, good.size() - 1)},
        {"negative count", negative},
        {"count that wraps 32 bits", huge},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        uint64_t before = HealthCounters::get(Health::CpuReportsRefused);
        LogCapture log;
        EXPECT_EQ(-5, deliver(c.payload));
        EXPECT_EQ(before + 1, HealthCounters::get(Health::CpuReportsRefused));
        EXPECT_TRUE(log.contains("Invalid data length"));
    }
    // A name filling its whole field is kept to the field.
    std::string full(CpuReport::kNameSize, 'n');
    CpuReport parsed;
    std::string wire = CpuReport::encode(1, 2, 1, {proc(0, 5, 1, 2, full + "overflow")});
    ASSERT_EQ(
        0, CpuReport::parse(reinterpret_cast<const uint8_t*>(wire.data()), wire.size(), &parsed));
    EXPECT_EQ(full, parsed.records.at(0).name);
}

TEST_F(CpuHandlerTest, CounterTroubleNeitherSpikesNorLosesTime) {
    struct Step {
        const char* what;
        std::function<void(CpuHandlerTest&)> change;
        std::map<std::string, long long> apps;  // cumulative, after the pass
        const char* log;
    } steps[] = {
        // No uid counters: the pass fails and stays the baseline, so the
        // next one does not take every uid's total since boot.
        {"unreadable uid counters",
         [](CpuHandlerTest& t) {
             t.addLoad({{kSingle, 100000}});
             t.writeCounters();
             t.mTree->removeFile(CpuTree::uidStatPath());
         },
         {},
         "Failed to get uid cpu time"},
        {"baseline", [](CpuHandlerTest& t) { t.writeCounters(); }, {}, nullptr},
        {"first delta",
         [](CpuHandlerTest& t) {
             t.addLoad({{kSingle, 500}});
             t.writeCounters();
         },
         {{"com.single", 500}},
         nullptr},
        // A counter that went back restarted: all of it is new time.
        {"uid counter reset",
         [](CpuHandlerTest& t) {
             t.mUidMs[kSingle] = 300;
             t.mIdleMs[3][1] = 500;
             t.writeCounters();
         },
         {{"com.single", 800}},
         nullptr},
        // A core going offline keeps its idle value and adds no history
        // when it comes back.
        {"idle file gone",
         [](CpuHandlerTest& t) {
             t.mIdleMs[3][1] = 510;
             t.writeCounters();
             t.mTree->removeFile(CpuTree::idleTimePath(3, 1));
         },
         {{"com.single", 800}},
         nullptr},
        {"idle file back",
         [](CpuHandlerTest& t) {
             t.mIdleMs[3][1] = 520;
             t.writeCounters();
         },
         {{"com.single", 800}},
         nullptr},
        // Boost steps beyond the advertised ones are ignored, not fatal.
        {"extra boost line",
         [](CpuHandlerTest& t) {
             t.addLoad({{kSingle, 200}});
             t.writeCounters();
             std::string text;
             for (size_t i = 0; i < t.mTicks[0].size(); ++i) {
                 text += std::to_string(t.mTree->clusters()[0].frequencies[i]) + " " +
                         std::to_string(t.mTicks[0][i]) + "\n";
             }
             for (int core = 0; core < 4; ++core) {
                 t.mTree->writeFile(CpuTree::timeInStatePath(core), text + "1900800 77\n");
             }
         },
         {{"com.single", 1000}},
         "beyond its 8 steps"},
        {"descending frequencies",
         [](CpuHandlerTest& t) {
             t.addLoad({{kSingle, 100}});
             t.writeCounters();
             for (int core = 4; core < 8; ++core) {
                 t.mTree->writeFile(CpuTree::timeInStatePath(core), "300000 5\n200000 9\n");
             }
         },
         {{"com.single", 1000}},
         "Invalid count or frequencies order"},
        // The refused pass's time comes with the next one.
        {"frequencies fixed",
         [](CpuHandlerTest& t) { t.writeCounters(); },
         {{"com.single", 1100}},
         nullptr},
    };
    uint64_t ignored = HealthCounters::get(Health::CpuCounterLinesIgnored);
    int64_t time = kT;
    for (Step& s : steps) {
        SCOPED_TRACE(s.what);
        s.change(*this);
        LogCapture log;
        ASSERT_EQ(0, poll(POLLING_THERMAL, time));
        report(time, CpuHandler::MODE_POLL, {});
        EXPECT_EQ(s.apps, appTimes());
        if (s.log != nullptr) {
            EXPECT_TRUE(log.contains(s.log));
        }
        time += 60000;
    }
    // Idle rows per pass: the offline core's state counted nothing while it
    // was gone and only its 20 ms once back.
    EXPECT_EQ(std::vector<std::string>({"0", "500", "0", "20", "0", "0"}),
              rows("SELECT idle_time FROM raw_cpu_idle_time WHERE cluster = 0 ORDER BY id"));
    EXPECT_GT(HealthCounters::get(Health::CpuCounterLinesIgnored), ignored);
}

TEST_F(CpuHandlerTest, RefusedPassKeepsItsTimeForTheNextOne) {
    pass(kT);
    addLoad({{kSingle, 300}});
    pass(kT + 60000);
    // A pass earlier than the last one is refused by the accounter.
    addLoad({{kSingle, 200}});
    LogCapture log;
    pass(kT + 30000);
    EXPECT_TRUE(log.contains("Failed to calculate cpu energy"));
    EXPECT_EQ((std::map<std::string, long long>{{"com.single", 300}}), appTimes());
    addLoad({{kSingle, 100}});
    pass(kT + 120000);
    EXPECT_EQ((std::map<std::string, long long>{{"com.single", 600}}), appTimes());
}

TEST_F(CpuHandlerTest, ProcessDeathsReusedPidsAndRemovedPackages) {
    std::vector<Record> procs = {proc(kMulti, 40, 1000, 1, "worker"),
                                 proc(0, 41, 100, 2, "kernel_ksoftirqd/3")};
    pass(kT, procs);
    // pid 40 died after 250 more ms; pid 41 was reused by a new thread
    // (its time went back): all 30 ms of it are new.
    procs[1].timeUs = 30000;
    pass(kT + 60000, {procs[1]}, {proc(kMulti, 40, 1250, 1, "worker")});
    EXPECT_EQ(
        (std::map<std::string, long long>{{"com.multi.a-worker", 250}, {"kernel_ksoftirqd", 30}}),
        appTimes());

    // A removed uid goes at the hourly rows, but its counter baseline stays:
    // when its app comes back, its history is not counted again.
    addLoad({{kSingle, 100}});
    pass(kT + 120000);
    Parcel removed;
    removed.writeInt32(kSingle);
    EXPECT_EQ(0, notify(NOTIFICATION_UID_REMOVED, removed));
    writeCounters();
    ASSERT_EQ(0, poll(POLLING_HOURLY_TICK, kT + 180000, kH));
    report(kH, CpuHandler::MODE_HOURLY, {});
    EXPECT_EQ(-4, notify(NOTIFICATION_UID_REMOVED, removed)) << "purged";
    Parcel added;
    added.writeInt64(kH + 1);
    added.writeInt32(kSingle);
    added.writeString8(String8("com.single"));
    EXPECT_EQ(0, notify(NOTIFICATION_PACKAGE_ADDED, added));
    addLoad({{kSingle, 40}});
    pass(kH + 60000);
    EXPECT_EQ(140, appTimes()["com.single"]);
}

TEST_F(CpuHandlerTest, AnHourlyRoundVotesStoresAndUploads) {
    addLoad({{kSingle, 1000}});
    pass(kT);
    EXPECT_TRUE(waitFor([this] { return mRoutine->got("4 256 1 3 4 6 8"); }))
        << "candidates {1, 3, 4, 6, 8}";
    addLoad({{kSingle, 600}, {kMulti, 300}});
    pass(kT + 60000, {proc(kMulti, 7, 300, 1, "sync")});
    writeCounters();
    ASSERT_EQ(0, poll(POLLING_HOURLY_TICK, kH + 5, kH));
    report(kH, CpuHandler::MODE_HOURLY, {});
    EXPECT_TRUE(waitFor([this] { return mRoutine->got(vote(kH, 1)); }));
    EXPECT_EQ(std::vector<std::string>({"10010|com.single|600", "10050|com.multi.a-sync|300"}),
              rows("SELECT uid, name, foreground_time + background_time FROM "
                   "hourly_applications_cpu WHERE timestamp = " +
                   std::to_string(kH) + " ORDER BY name DESC"));

    Parcel hour;
    hour.writeInt64(kH);
    EXPECT_EQ(0, notify(NOTIFICATION_COMPONENT_ACCOUNTING, hour));
    EXPECT_TRUE(waitFor([this] { return mRoutine->got(vote(kH, 3)); }));
    std::vector<std::string> component =
        rows("SELECT foreground_energy + background_energy FROM hourly_component_cpu");
    ASSERT_EQ(1u, component.size());
    EXPECT_GT(std::stoll(component[0]), 0);
    EXPECT_TRUE(waitFor([&] {
        return mRoutine->got("3 " + std::to_string(kH) + " 256 " + component[0]);
    })) << "compensation";

    Parcel upload;
    upload.writeFloat(0.0f);
    upload.writeInt64(kH);
    EXPECT_EQ(0, notify(NOTIFICATION_HOURLY_UPLOADING, upload));
    EXPECT_EQ(0, notify(NOTIFICATION_DAILY_UPLOADING, upload));
    EXPECT_TRUE(
        waitFor([this] { return mRoutine->got(vote(kH, 4)) && mRoutine->got(vote(kH, 6)); }));
    DataUploader::getInstance()->uploadEvent();
    std::map<uint32_t, Json::Value> sent;
    for (const Json::Value& e : events()) sent[e["event"].asUInt()] = e;
    const Json::Value& hourly = sent[903001060]["params"];
    EXPECT_EQ(903009021u, hourly["6"]["class"].asUInt());
    ASSERT_EQ(2u, hourly["7"].size());
    EXPECT_EQ("com.single", hourly["7"][0]["params"]["3"]["params"]["0"].asString());
    const Json::Value& daily = sent[903001052]["params"];
    EXPECT_EQ(2u, daily["12"].size()) << "idle per cluster";
    EXPECT_EQ(903009029u, daily["12"][0]["class"].asUInt());
    EXPECT_EQ(903009030u, daily["13"][0]["class"].asUInt());
    long long frequencyMs = 0;
    for (const Json::Value& e : daily["13"]) frequencyMs += e["params"]["2"].asInt64();
    EXPECT_EQ(std::stoll(rows("SELECT SUM(time) FROM raw_cpu_frequencies_time")[0]), frequencyMs);
}

TEST_F(CpuHandlerTest, MissingReportsAreAccountedByTheWatchdog) {
    pass(kT);
    CpuHandler::setReportWaitMs(100);
    // The hourly report never comes: the uid counters are accounted at H
    // and the vote is still cast.
    addLoad({{kSingle, 500}, {kMulti, 100}});
    writeCounters();
    uint64_t late = HealthCounters::get(Health::CpuReportsLate);
    ASSERT_EQ(0, poll(POLLING_HOURLY_TICK, kH + 20, kH));
    EXPECT_TRUE(waitFor([this] { return mRoutine->got(vote(kH, 1)); }));
    EXPECT_EQ(late + 1, HealthCounters::get(Health::CpuReportsLate));
    EXPECT_EQ(std::vector<std::string>({std::to_string(kH)}),
              rows("SELECT end_time FROM raw_component_cpu"));
    // Its late report only moves the process baselines.
    CpuHandler::setReportWaitMs(5000);
    report(kH, CpuHandler::MODE_HOURLY, {proc(kMulti, 9, 100, 1, "late")});
    addLoad({{kMulti, 30}});
    pass(kH + 60000, {proc(kMulti, 9, 130, 1, "late")});
    EXPECT_EQ((std::map<std::string, long long>{{"com.single", 500}, {"com.multi.a-late", 30}}),
              appTimes());

    // The report also reaches the handler through the buffered log socket
    // (when this process's server listens below this test's root).
    if (!kelvo::test::hostPathExists(mRoot->path() + "/dev/socket/" +
                                     BufferedLogClient::kSocketName)) {
        return;
    }
    addLoad({{kMulti, 20}});
    writeCounters();
    ASSERT_EQ(0, poll(POLLING_THERMAL, kH + 120000));
    BufferedLogClient client;
    ASSERT_EQ(0, client.connect(CpuHandler::kDriverName));
    ASSERT_EQ(0,
              client.send(CpuHandler::kReportMagic,
                          CpuReport::encode(kH + 120000, 1, 1, {proc(kMulti, 9, 150, 1, "late")})));
    EXPECT_TRUE(waitFor([this] { return appTimes()["com.multi.a-late"] == 50; }));
}

TEST_F(CpuHandlerTest, ATimeChangeKeepsItsOwnNewTime) {
    pass(kT);
    // The clock jumps from kT + 60 s to kT + 600 s; a foreground change on
    // the new clock is asked for before the time-change report comes.
    const int64_t before = kT + 60000;
    const int64_t after = kT + 600000;
    addLoad({{kSingle, 100}});
    writeCounters();
    ASSERT_EQ(0, poll(POLLING_TIME_CHANGED, before, after));
    ASSERT_EQ(0, foreground(after + 5000, "com.single"));
    report(before, CpuHandler::MODE_TIME_CHANGED, {});
    addLoad({{kSingle, 50}});
    writeCounters();
    report(after + 5000, CpuHandler::MODE_FOREGROUND, {});
    EXPECT_EQ(std::vector<std::string>({std::to_string(kT) + "|" + std::to_string(before),
                                        std::to_string(after) + "|" + std::to_string(after + 5000)}),
              rows("SELECT start_time, end_time FROM raw_component_cpu ORDER BY id"));
    EXPECT_EQ(150, appTimes()["com.single"]);
}

}  // namespace
