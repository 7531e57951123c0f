#include <gtest/gtest.h>

#include "WifiEnergyTruth.h"

namespace kelvo {
namespace sim {
namespace {

struct truth_case {
    const char* name;
    const char* steps;
    std::vector<int64_t> polls;  // empty: the whole run as one batch
    double mail;                 // uid 10061
    double browser;              // uid 10070
    double hotspot;
};

// Energies worked by hand from the profile below (2.4 GHz level 3: tx 4,
// rx 3, fixed 40; 5 GHz level 4: tx 4, fixed 55; the weakest 2.4 GHz level:
// tx 3, rx 2).
TEST(WifiEnergyTruthTest, EnergyPerBatch) {
    WifiEnergyTruth::Profile profile;
    profile.hotspot = 160;
    profile.scan = 25;
    const int32_t tx[2][4] = {{6, 5, 4, 3}, {7, 6, 5, 4}};
    const int32_t rx[2][4] = {{4, 3, 3, 2}, {5, 4, 3, 3}};
    std::copy(&tx[0][0], &tx[0][0] + 8, &profile.tx[0][0]);
    std::copy(&rx[0][0], &rx[0][0] + 8, &profile.rx[0][0]);
    profile.bandFixed[0] = 40;
    profile.bandFixed[1] = 55;
    const truth_case cases[] = {
        // 10 s at level 3: 0.7 and 0.9 by the levels, the 400 fixed split 7:9.
        {"fixed power split by traffic energy",
         "at 0 wifi band 2\nat 0 wifi level 3\nat 0 wifi active\n"
         "at 1 traffic 10061 wlan0 fg 0 100/100\nat 1 traffic 10070 wlan0 bg 0 300\n"
         "at 1 traffic 10070 rmnet_data0 bg 0 900\n",
         {10000},
         175.7,
         225.9,
         0},
        {"no active time: the weakest level per hundred",
         "at 1 traffic 10061 wlan0 fg 0 100/100\n",
         {10000},
         5,
         0,
         0},
        // The read at 2 s finds no traffic: all 10 s weigh the batch at 10 s.
        {"times wait for a batch",
         "at 0 wifi band 1\nat 0 wifi level 4\nat 0 wifi active\n"
         "at 5 traffic 10061 wlan0 fg 0 0/10\n",
         {2000, 10000},
         550.04,
         0,
         0},
        // The screen-off notice at 4.2 s reads the counters and idles the link.
        {"screen off, scans and hotspot",
         "at 0 brightness 100\nat 0 wifi band 2\nat 0 wifi level 3\nat 0 wifi active\n"
         "at 1 traffic 10061 wlan0 fg 0 100/100\nat 1 wifi scan 10061\nat 1 wifi scan 10061\n"
         "at 2 wifi ap-on\nat 4 screen off\nat 5 wifi active\nat 7 wifi ap-off\n"
         "at 8 traffic 10070 wlan0 fg 0 100/100\n",
         {10000},
         50 + 0.7 + 168,
         5,
         800},
        {"whole run",
         "at 0 wifi level 3\nat 0 wifi active\nat 3 wifi idle\n"
         "at 1 traffic 10061 wlan0 fg 0 100/100\n",
         {},
         0.7 + 120,
         0,
         0},
    };
    for (const truth_case& c : cases) {
        SCOPED_TRACE(c.name);
        Scenario scenario;
        std::string error;
        ASSERT_TRUE(scenario.parse(std::string("start 10:00:00\nduration 10\napp 10061 mail\n"
                                               "app 10070 browser\n") +
                                       c.steps,
                                   "test", &error))
            << error;
        WifiEnergyTruth::Result r = WifiEnergyTruth(scenario, profile).compute(c.polls, 10000);
        EXPECT_NEAR(c.mail, r.byUid[10061], 0.001);
        EXPECT_NEAR(c.browser, r.byUid[10070], 0.001);
        EXPECT_NEAR(c.hotspot, r.hotspot, 0.001);
    }
}

}  // namespace
}  // namespace sim
}  // namespace kelvo
