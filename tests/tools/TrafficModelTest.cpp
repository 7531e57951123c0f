#include <gtest/gtest.h>

#include "TrafficModel.h"
#include "common/TestEnv.h"
#include "utils/TrafficReader.h"

namespace kelvo {
namespace sim {
namespace {

// What the simulator writes is what the daemon's reader takes: each step's
// counters once (the tagged copies ignored), per interface family.
TEST(TrafficModelTest, ReaderSeesTheScenarioTraffic) {
    test::TempRoot root;
    Scenario scenario;
    std::string error;
    ASSERT_TRUE(
        scenario.parse("start 10:00:00\nduration 1:00\napp 10061 com.example.mail\n"
                       "process 900 1000 system_server\n"
                       "at 5 traffic 10061 wlan0 fg 1000/500 10/5\n"
                       "at 6 traffic 10061 rmnet_data0 bg 300 3\n"
                       "at 7 systraffic 900 wlan0 400/100 4/1\n",
                       "test", &error))
        << error;
    TrafficModel model(scenario, root.path());
    ASSERT_TRUE(model.write());
    TrafficReader wlan("wlan", [](int32_t, int32_t pid, std::string* name) {
        *name = "pid" + std::to_string(pid);
        return 0;
    });
    TrafficReader rmnet("rmnet");
    ASSERT_TRUE(wlan.hasProcessStats());
    ASSERT_EQ(0, wlan.getUidTrafficData(nullptr));
    ASSERT_EQ(0, rmnet.getUidTrafficData(nullptr));
    ASSERT_EQ(0, wlan.getPidTrafficData(nullptr));
    ASSERT_EQ(0, wlan.getInterfaceTrafficData(nullptr));
    for (const Scenario::Step& step : scenario.steps()) {
        ASSERT_TRUE(model.apply(step));
    }
    ASSERT_TRUE(model.write());
    std::vector<traffic_data> uids;
    ASSERT_EQ(0, wlan.getUidTrafficData(&uids));
    ASSERT_EQ(1u, uids.size());
    EXPECT_EQ(1, uids[0].counter);
    EXPECT_EQ(1500, uids[0].rxBytes + uids[0].txBytes);
    uids.clear();
    ASSERT_EQ(0, rmnet.getUidTrafficData(&uids));
    ASSERT_EQ(1u, uids.size());
    EXPECT_EQ(300, uids[0].rxBytes);
    std::vector<pid_traffic_data> pids;
    ASSERT_EQ(0, wlan.getPidTrafficData(&pids));
    ASSERT_EQ(1u, pids.size());
    EXPECT_EQ("pid900", pids[0].name);
    EXPECT_EQ(100, pids[0].txBytes);
    std::vector<interface_traffic_data> ifaces;
    ASSERT_EQ(0, wlan.getInterfaceTrafficData(&ifaces));
    ASSERT_EQ(1u, ifaces.size());
    EXPECT_EQ(1400, ifaces[0].rxBytes);
    EXPECT_EQ("com.example.mail\t10061\t1500\t300\n", model.truthTable());
}

}  // namespace
}  // namespace sim
}  // namespace kelvo
