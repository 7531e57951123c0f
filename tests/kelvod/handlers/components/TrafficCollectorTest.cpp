#include <gtest/gtest.h>

#include "HealthCounters.h"
#include "handlers/components/TrafficCollector.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/StorageOperator.h"

namespace kelvo {
namespace {

using android::Parcel;
using android::String8;

constexpr int64_t kT = 1796515200000LL;  // 2026-12-06 00:00 UTC
const char* const kTitle =
    "idx iface acct_tag_hex uid_tag_int cnt_set rx_bytes rx_packets "
    "tx_bytes tx_packets\n";

std::string uidRow(int uid, int set, long long bytes, const char* iface = "wlan0") {
    return "2 " + std::string(iface) + " 0x0 " + std::to_string(uid) + " " + std::to_string(set) +
           " " + std::to_string(bytes) + " " + std::to_string(bytes / 10) + " " +
           std::to_string(bytes * 2) + " " + std::to_string(bytes / 5) + "\n";
}

std::string pidRow(const std::string& iface, const char* name, long long bytes) {
    return iface + "\t0\t0\t" + name + "\t" + std::to_string(bytes) + "\t" + std::to_string(bytes) +
           "\t" + std::to_string(bytes / 10) + "\t" + std::to_string(bytes / 10) + "\n";
}

class TrafficCollectorTest : public test::AgentStorageTest {
protected:
    void addTables() override {
        StorageOperator::addSchema(kRawWifiPackageTraffic);
        StorageOperator::addSchema(kRawWifiInterfaceTraffic);
        mRoot->writeFile(TrafficReader::kPidStatsPath, "title\n");
        mRoot->writeFile(TrafficReader::kUidStatsPath, kTitle);
        mRoot->writeFile(TrafficReader::kInterfaceStatsPath, "wlan0 1 0 0 0 0 10 1 10 1\n");
        mCollector.reset(new TrafficCollector(
            kWifiTrafficConfig,
            [this](const Parcel& p) {
                mActions.push_back(decode(p));
                return 0;
            },
            [](int32_t uid, std::string* name) {
                *name = uid == 10099 ? "" : "app" + std::to_string(uid);
                return name->empty() ? -4 : 0;
            }));
        mCollector->takeBaseline();
    }
    // "subtype: values..." with each record as "name/set/tx packets/rx bytes".
    static std::string decode(const Parcel& p) {
        p.setDataPosition(0);
        EXPECT_EQ(7, p.readInt32());
        EXPECT_EQ(7, p.readInt32());
        int32_t subtype = p.readInt32();
        std::string text = std::to_string(subtype) + ":";
        if (subtype == 0) {
            text += " " + std::to_string(p.readInt64());
            return text + " " + std::to_string(p.readInt64());
        }
        EXPECT_EQ(kT, p.readInt64());
        int32_t n = p.readInt32();
        for (int32_t i = 0; i < n && i < 3; ++i) {
            String8 name = p.readString8();
            int32_t set = p.readInt32();
            int64_t txPackets = p.readInt64();
            p.readInt64();
            p.readInt64();
            text += " " + std::string(name.string()) + "/" + std::to_string(set) + "/" +
                    std::to_string(txPackets) + "/" + std::to_string(p.readInt64());
        }
        return n > 3 ? text + " ... " + std::to_string(n) : text;
    }
    void poll(const std::string& foreground) {
        mActions.clear();
        EXPECT_EQ(0, mCollector->collectInterfaces(kT));
        EXPECT_EQ(0, mCollector->collectSystem(kT, foreground));
        EXPECT_EQ(0, mCollector->collectPackages(kT));
    }

    std::unique_ptr<TrafficCollector> mCollector;
    std::vector<std::string> mActions;
};

TEST_F(TrafficCollectorTest, PollBooksActionsAndRows) {
    test::LogCapture log;
    for (long long grow : {100, 200}) {
        mRoot->writeFile(TrafficReader::kUidStatsPath,
                         kTitle + uidRow(10010, 1, 1000 + grow) + uidRow(10010, 0, 50 + grow) +
                             uidRow(10099, 0, 70 + grow) + uidRow(10011, 1, 90 + grow, "rmnet0"));
        mRoot->writeFile(TrafficReader::kPidStatsPath, "title\n" +
                                                           pidRow("wlan0", "netd", 200 + grow) +
                                                           pidRow("wlan1", "netd", 300 + grow) +
                                                           pidRow("wlan0", "com.fg", 400 + grow));
        mRoot->writeFile(TrafficReader::kInterfaceStatsPath,
                         "wlan0 1 0 0 0 0 " + std::to_string(10 + grow) + " " +
                             std::to_string(grow / 10 + 1) + " " + std::to_string(10 + grow) + " " +
                             std::to_string(grow / 50 + 1) + "\n");
        poll("com.fg");
    }
    // The unknown uid is left out (reported once this hour), the system
    // processes follow the uids, background first.
    EXPECT_EQ((std::vector<std::string>{
                  "0: 2 10",
                  "1: app10010/1/20/100 app10010/0/20/100 netd/0/10/100 ... 5",
              }),
              mActions);
    EXPECT_EQ(1u, log.count("Can not find name for uid=10099", ANDROID_LOG_ERROR));
    EXPECT_EQ((std::vector<std::string>{"2|wlan0|200|20|200|4"}),
              rows("SELECT COUNT(*), interface, SUM(rx_bytes), SUM(rx_packets), SUM(tx_bytes), "
                   "SUM(tx_packets) FROM raw_wifi_interface_traffic"));
    EXPECT_EQ(
        (std::vector<std::string>{"app10010|0|wlan0|250", "app10010|1|wlan0|1200",
                                  "com.fg|0|wlan0|600", "netd|0|wlan0|400", "netd|0|wlan1|500"}),
        rows("SELECT name, foreground, interface, SUM(rx_bytes) FROM "
             "raw_wifi_package_traffic GROUP BY name, foreground, interface"));
    EXPECT_EQ(0u, mCollector->pendingSystemEntries());
}

TEST_F(TrafficCollectorTest, FullBatchIsSentAndSystemOverflowCounted) {
    std::string uids = kTitle;
    for (int uid = 20000; uid < 25000; ++uid) uids += uidRow(uid, 0, 100);
    mRoot->writeFile(TrafficReader::kUidStatsPath, uids);
    std::string pids = "title\n" + pidRow("wlan0", "netd", 500);
    for (int i = 0; i <= 20; ++i) pids += pidRow("wlan" + std::to_string(i), "wide", 500);
    mRoot->writeFile(TrafficReader::kPidStatsPath, pids);
    uint64_t refused = HealthCounters::get(Health::TrafficReadingsRefused);
    poll("");
    ASSERT_EQ(1u, mActions.size());
    EXPECT_NE(std::string::npos, mActions[0].find("... 5000"));
    // 21 interfaces of "wide" and netd, over the batch: counted, not sent.
    EXPECT_EQ(refused + 22, HealthCounters::get(Health::TrafficReadingsRefused));
    EXPECT_EQ(0u, mCollector->pendingSystemEntries());
    EXPECT_EQ(5000u, mCollector->packageLookups());
}

}  // namespace
}  // namespace kelvo
