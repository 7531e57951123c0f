// The simulator's system side read back by the daemon's own readers: the
// files it lays out and the record bodies it and the fake driver send.

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "FakeDriverReporter.h"
#include "Scenario.h"
#include "SystemFiles.h"
#include "SystemScene.h"
#include "common/TestEnv.h"
#include "handlers/DdrFrequencyReader.h"
#include "handlers/KernelWakelockReader.h"
#include "handlers/SystemRecords.h"

namespace kelvo {
namespace sim {
namespace {

TEST(SystemSceneTest, FilesReadByTheDaemonsReaders) {
    kelvo::test::TempRoot root;
    SystemFiles files(root.path());
    ASSERT_TRUE(files.layout());
    const std::string sources = root.path() + "/proc/wakeup_sources";
    const std::string ddr = root.path() + "/sys/class/devfreq/ddrfreq/trans_stat";
    KernelWakelockReader kernel;
    std::vector<KernelWakelockReader::increment> got;
    ASSERT_EQ(0, kernel.read(sources, &got));
    EXPECT_TRUE(got.empty());
    ASSERT_EQ(6, DdrFrequencyReader::countLevels(ddr));
    DdrFrequencyReader levels;
    std::vector<std::pair<int64_t, int64_t>> residency;
    ASSERT_EQ(0, levels.read(ddr, true, nullptr));

    // The two ipa_ws sources are summed, the padded name is cut and nothing
    // after "deleted" counts.
    ASSERT_TRUE(files.advance(12000));
    ASSERT_TRUE(files.advance(8000));
    ASSERT_EQ(0, kernel.read(sources, &got));
    std::vector<std::string> names;
    for (const auto& inc : got) {
        names.push_back(inc.name + "|" + std::to_string(inc.count) + "|" + std::to_string(inc.time));
    }
    EXPECT_EQ((std::vector<std::string>{"PowerManagerService.WakeLocks|8|6000", "ipa_ws|6|1300",
                                        "qcom_rx_wakelock|6|2400"}),
              names);
    ASSERT_EQ(0, levels.read(ddr, false, &residency));
    std::vector<int64_t> times;
    for (const auto& r : residency) {
        times.push_back(r.second);
    }
    EXPECT_EQ((std::vector<int64_t>{5000, 5000, 5000, 5000}), times);
}

// What the "KelvoService" client and the fake driver send parses whole.
TEST(SystemSceneTest, BodiesParseAsTheirRecords) {
    SystemRecords::daily_statistics daily;
    ASSERT_EQ(0, SystemRecords::parseDailyStatistics(
                     reinterpret_cast<const uint8_t*>(SystemScene::dailyStatistics(77).data()),
                     SystemRecords::kDailyStatisticsSize, &daily));
    EXPECT_EQ(77, daily.day);
    const std::string phone = SystemScene::mobilePhone();
    std::vector<SystemRecords::mobile_phone> cards;
    ASSERT_EQ(0, SystemRecords::parseMobilePhone(reinterpret_cast<const uint8_t*>(phone.data()),
                                                 phone.size(), &cards));
    EXPECT_EQ(2u, cards.size());
    Scenario::App app;
    app.uid = 10070;
    app.packages = {"com.a", std::string(130, 'p')};
    const std::string packages = SystemScene::packageVersions({app});
    std::vector<SystemRecords::package_version> versions;
    ASSERT_EQ(0, SystemRecords::parsePackageVersions(
                     reinterpret_cast<const uint8_t*>(packages.data()), packages.size(), &versions));
    ASSERT_EQ(2u, versions.size());
    EXPECT_EQ(std::string(128, 'p') + "|1.70", versions[1].name + "|" + versions[1].version);

    fake::FakeKernelDriver::State state;
    state.binderCalls = {{1000, 1, std::string(60, 's'), 10061, 2, "mail", 3}};
    state.uevents = {{"/devices/x", 2, 5}};
    std::string echo(12, '\0');
    fake::FakeDriverReporter::Report report{0, fake::FakeDriverReporter::MAGIC_BINDER_STATS, 0, 0};
    std::string binder = echo + fake::FakeDriverReporter::reportBody(report, state);
    SystemRecords::echo head;
    std::vector<SystemRecords::binder_entry> calls;
    ASSERT_EQ(0, SystemRecords::parseBinderStats(reinterpret_cast<const uint8_t*>(binder.data()),
                                                 binder.size(), &head, &calls));
    ASSERT_EQ(1u, calls.size());
    EXPECT_EQ(std::string(48, 's') + "|mail|3",
              calls[0].service + "|" + calls[0].client + "|" + std::to_string(calls[0].count));
    report.magic = fake::FakeDriverReporter::MAGIC_UEVENT;
    std::string uevent = echo + fake::FakeDriverReporter::reportBody(report, state);
    std::vector<SystemRecords::uevent> uevents;
    ASSERT_EQ(0, SystemRecords::parseUevent(reinterpret_cast<const uint8_t*>(uevent.data()),
                                            uevent.size(), &head, &uevents));
    ASSERT_EQ(1u, uevents.size());
    EXPECT_EQ("/devices/x", uevents[0].devpath);
}

TEST(SystemSceneTest, VerbsBecomeRecords) {
    const std::string header = "start 10:00:00\nduration 60\n";
    Scenario scenario;
    std::string error;
    ASSERT_TRUE(scenario.parse(header + "at 1 suspend\nat 2 wakeup RTC0\nat 3 alarm 10061 com.a 2 "
                                        "sync 3\nat 4 package remove 10061 com.a\n",
                               "s", &error))
        << error;
    std::vector<std::string> records;
    for (const Scenario::Step& step : scenario.steps()) {
        records.push_back(step.text);
    }
    EXPECT_EQ((std::vector<std::string>{
                  "KELVO_TAG_KERNEL_SUSPEND\n", "KELVO_TAG_KERNEL_WAKEUP\nirq=RTC0 gpio=0",
                  "KELVO_TAG_ALARM_TRIGGER\nuid=10061 name=com.a type=2 tag=*walarm*:sync size=3",
                  "KELVO_TAG_PACKAGE_REMOVED\nuid=10061 name=com.a"}),
              records);
    for (const char* bad : {"at 1 alarm 10061 com.a 4 sync 3", "at 1 time_change 1e3",
                            "at 1 suspend now", "at 1 package install 1 com.a"}) {
        EXPECT_FALSE(scenario.parse(header + bad + "\n", "s", &error)) << bad;
    }
}

}  // namespace
}  // namespace sim
}  // namespace kelvo
