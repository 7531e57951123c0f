#include <gtest/gtest.h>
#include <unistd.h>

#include "HealthCounters.h"
#include "common/TestEnv.h"
#include "utils/TrafficReader.h"

namespace kelvo {
namespace {

const char* const kUidTitle =
    "idx iface acct_tag_hex uid_tag_int cnt_set rx_bytes rx_packets "
    "tx_bytes tx_packets\n";

std::string uidRow(const std::string& iface, const char* tag, int uid, int set, long long bytes) {
    return "2 " + iface + " " + tag + " " + std::to_string(uid) + " " + std::to_string(set) + " " +
           std::to_string(bytes) + " " + std::to_string(bytes / 100) + " " +
           std::to_string(bytes / 2) + " " + std::to_string(bytes / 200) + "\n";
}

std::string pidRow(int uid, int pid, const char* name, long long bytes) {
    return "wlan0\t" + std::to_string(uid) + "\t" + std::to_string(pid) + "\t" + name + "\t" +
           std::to_string(bytes) + "\t" + std::to_string(bytes) + "\t" +
           std::to_string(bytes / 100) + "\t" + std::to_string(bytes / 100) + "\n";
}

// Rx bytes handed out per "uid/set/iface".
std::map<std::string, int64_t> uidBytes(TrafficReader& reader) {
    std::vector<traffic_data> out;
    EXPECT_EQ(0, reader.getUidTrafficData(&out));
    std::map<std::string, int64_t> bytes;
    for (const traffic_data& d : out) {
        bytes[std::to_string(d.uid) + "/" + std::to_string(d.counter) + "/" + d.interface] +=
            d.rxBytes;
    }
    return bytes;
}

using Bytes = std::map<std::string, int64_t>;

TEST(TrafficReaderTest, BadLinesAreSkippedAndRowsFiltered) {
    test::TempRoot root;
    test::LogCapture log;
    auto write = [&](long long grow, bool newcomer) {
        root.writeFile(TrafficReader::kUidStatsPath,
                       kUidTitle + uidRow("wlan0", "0x0", 10010, 1, 1000 + grow) +
                           uidRow("wlan" + std::string(296, 'x'), "0x0", 10012, 1, 5000 + grow) +
                           "3 wlan0 0x0 " + std::string(600, '7') + "\n" +
                           "4 wlan0 zz 10013 0 1 1 1 1\n" +
                           uidRow("wlan0", "0x0", 10011, 0, 2000 + grow) +
                           uidRow("wlan0", "0x100000000", 10010, 1, 9000 + grow) +
                           uidRow("rmnet_data0", "0x0", 10010, 0, 3000 + grow) +
                           (newcomer ? uidRow("wlan0", "0x0", 10014, 0, 800) : ""));
    };
    TrafficReader wlan("wlan");
    TrafficReader rmnet("rmnet");
    write(0, false);
    ASSERT_EQ(0, wlan.getUidTrafficData(nullptr));
    ASSERT_EQ(0, rmnet.getUidTrafficData(nullptr));
    uint64_t refused = HealthCounters::get(Health::TrafficReadingsRefused);
    log.clear();
    // Both readings had skipped lines: the newcomer may have been behind one
    // of them, so it only sets its baseline.
    write(400, true);
    EXPECT_EQ((Bytes{{"10010/1/wlan0", 400}, {"10011/0/wlan0", 400}}), uidBytes(wlan));
    EXPECT_EQ((Bytes{{"10010/0/rmnet_data0", 400}}), uidBytes(rmnet));
    EXPECT_EQ(2u, log.count("Skipped 3 malformed and 0 invalid lines of uid traffic"));
    EXPECT_EQ(refused + 6, HealthCounters::get(Health::TrafficReadingsRefused));
    write(500, true);
    EXPECT_EQ((Bytes{{"10010/1/wlan0", 100}, {"10011/0/wlan0", 100}}), uidBytes(wlan));
}

TEST(TrafficReaderTest, BaselineIsTheFirstReadingThatSucceeds) {
    test::TempRoot root;
    test::LogCapture log;
    TrafficReader reader("wlan");
    EXPECT_EQ(-14, reader.getUidTrafficData(nullptr));
    EXPECT_EQ(-14, reader.getInterfaceTrafficData(nullptr));
    std::vector<traffic_data> uids;
    EXPECT_EQ(-14, reader.getUidTrafficData(&uids));
    EXPECT_EQ(1u, log.count("Failed to open /proc/net/xt_qtaguid/stats"));
    root.writeFile(TrafficReader::kUidStatsPath,
                   kUidTitle + uidRow("wlan0", "0x0", 10010, 1, 900000000));
    root.writeFile(TrafficReader::kInterfaceStatsPath,
                   "wlan0 1 0 0 0 0 900000000 90000 800000000 80000\n");
    EXPECT_TRUE(uidBytes(reader).empty());
    std::vector<interface_traffic_data> ifaces;
    EXPECT_EQ(0, reader.getInterfaceTrafficData(&ifaces));
    EXPECT_TRUE(ifaces.empty());
    // Now complete and baselined: a newcomer counts from zero.
    root.writeFile(TrafficReader::kUidStatsPath, kUidTitle +
                                                     uidRow("wlan0", "0x0", 10010, 1, 900000100) +
                                                     uidRow("wlan0", "0x0", 10020, 0, 700));
    EXPECT_EQ((Bytes{{"10010/1/wlan0", 100}, {"10020/0/wlan0", 700}}), uidBytes(reader));
    root.writeFile(TrafficReader::kUidStatsPath, "");
    EXPECT_EQ(-10, reader.getUidTrafficData(&uids));
}

TEST(TrafficReaderTest, CounterSemantics) {
    test::TempRoot root;
    root.writeFile(TrafficReader::kPidStatsPath, "title\n");
    int lookups = 0;
    TrafficReader reader("wlan", [&](int32_t uid, int32_t pid, std::string* name) {
        ++lookups;
        *name = uid == 1000 && pid == 77 ? "system_server" : "";
        return name->empty() ? -4 : 0;
    });
    ASSERT_TRUE(reader.hasProcessStats());
    auto step = [&](long long a, long long b, long long app, int active, long long iface,
                    long long server) {
        root.writeFile(TrafficReader::kPidStatsPath,
                       "title\n" + pidRow(0, 0, "netd", a) + pidRow(0, 0, "netd", b) +
                           pidRow(1000, 77, "", server) + pidRow(1000, 77, "", server));
        root.writeFile(TrafficReader::kUidStatsPath, kUidTitle +
                                                         uidRow("wlan0", "0x0", 10010, 1, app) +
                                                         uidRow("wlan0", "0x0", 1000, 0, 5000) +
                                                         uidRow("wlan0", "0x0", 101000, 0, 5000));
        auto four = [](long long b, long long p) {
            return " " + std::to_string(b) + " " + std::to_string(p) + " " + std::to_string(b) +
                   " " + std::to_string(p);
        };
        root.writeFile(TrafficReader::kInterfaceStatsPath, "wlan0 " + std::to_string(active) +
                                                               four(iface / 2, iface / 20) +
                                                               four(iface, iface / 10) + "\n");
    };
    auto poll = [&]() {
        Bytes got = uidBytes(reader);
        std::vector<pid_traffic_data> pids;
        EXPECT_EQ(0, reader.getPidTrafficData(&pids));
        for (const pid_traffic_data& d : pids) got[d.name] += d.rxBytes;
        std::vector<interface_traffic_data> ifaces;
        EXPECT_EQ(0, reader.getInterfaceTrafficData(&ifaces));
        for (const interface_traffic_data& d : ifaces) got[d.interface] += d.txBytes;
        return got;
    };
    step(1000, 1000, 1000, 1, 1000, 600);
    poll();
    lookups = 0;
    // Two processes of one name are one sum; the system uid of every user is
    // left to the process view; one lookup per (uid, pid) and reading.
    step(1100, 1200, 1500, 1, 1400, 700);
    EXPECT_EQ((Bytes{{"10010/1/wlan0", 500}, {"netd", 300}, {"system_server", 200}, {"wlan0", 400}}),
              poll());
    EXPECT_EQ(1, lookups);
    // One netd ended, the app's counter went backwards, the interface went
    // inactive (its stored totals): nothing goes out.
    step(1100, 0, 900, 0, 3000, 700);
    EXPECT_TRUE(poll().empty());
    // The survivor and the app count from their new readings.
    step(1200, 0, 1000, 0, 3100, 700);
    EXPECT_EQ((Bytes{{"10010/1/wlan0", 100}, {"netd", 100}, {"wlan0", 50}}), poll());
    // A removed uid's counters are not counted again at its next sighting.
    reader.removeUid(10010);
    step(1200, 0, 2000, 0, 3100, 700);
    EXPECT_TRUE(poll().empty());
    step(1200, 0, 2100, 0, 3100, 700);
    EXPECT_EQ((Bytes{{"10010/1/wlan0", 100}}), poll());
}

TEST(TrafficReaderTest, LinkedProcessFileIsNotRead) {
    test::TempRoot root;
    root.writeFile("/data/netstat", "title\n" + pidRow(0, 0, "netd", 1000));
    test::makeHostDirs(root.path() + "/proc/net/proc_netstat");
    ASSERT_EQ(0, symlink((root.path() + "/data/netstat").c_str(),
                         (root.path() + TrafficReader::kPidStatsPath).c_str()));
    root.writeFile(TrafficReader::kUidStatsPath, kUidTitle + uidRow("wlan0", "0x0", 1000, 0, 100));
    TrafficReader reader("wlan");
    EXPECT_FALSE(reader.hasProcessStats());
    std::vector<pid_traffic_data> pids;
    EXPECT_EQ(0, reader.getPidTrafficData(&pids));
    EXPECT_EQ(0u, reader.processKeys());
    EXPECT_EQ(0, reader.getUidTrafficData(nullptr));
    EXPECT_EQ(1u, reader.uidKeys());
}

}  // namespace
}  // namespace kelvo
