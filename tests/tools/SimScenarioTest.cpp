#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <fstream>
#include <sstream>
#include <string>

#include "ComponentTruth.h"
#include "CpuTree.h"
#include "DeviceModel.h"
#include "Scenario.h"

namespace kelvo {
namespace sim {
namespace {

const char kHeader[] =
    "start 10:58:30\n"
    "duration 3:00\n"
    "app 10061 com.example.mail\n"
    "app 10070 com.example.browser,com.example.sandbox\n"
    "process 2001 10061 com.example.mail\n"
    "process 2101 10070 renderer\n"
    "process 2102 10070 com.example.browser com.example.browser\n"
    "kthread 301 0 kernel_kworker/0:1\n";

struct Refusal {
    const char* name;
    const char* line;  // appended as line 9
    const char* reason;
};

const Refusal kRefusals[] = {
    {"unknown verb", "at 5 vibrate 80", "unknown verb \"vibrate\""},
    {"unknown declaration", "gnss on", "unknown verb \"gnss\""},
    {"percent over the cluster", "at 5 load 2001 0 401%", "percent of one core"},
    {"cluster out of range", "at 5 load 2001 2 10%", "cluster 0|1"},
    {"frequency not a step", "at 5 load 2001 1 10% 1000", "has no step 1000 kHz"},
    {"undeclared pid", "at 5 load 999 0 10%", "pid 999 is not declared"},
    {"step after the end", "at 3:01 battery 50%", "after the end"},
    {"bad time", "at 1:75 battery 50%", "expected \"at <time>"},
    {"traffic without packets", "at 5 traffic 10061 wlan0 fg 100", "expected \"at <time> traffic"},
    {"system traffic of an app", "at 5 systraffic 2001 wlan0 10 1", "not a declared process"},
    {"battery over 100", "at 5 battery 101%", "level 0..100"},
    {"unknown foreground package", "at 5 foreground com.other", "no app has the package"},
    {"package not of the uid", "process 5 10061 x com.example.browser", "does not have"},
    {"pid declared twice", "process 2001 10061 again", "pid 2001 is declared twice"},
    {"brightness over 255", "at 5 brightness 256", "level 0..255"},
    {"ambient without six durations", "at 5 ambient auto 1 2 3", "six ambient levels"},
    {"gnss of an unknown package", "at 5 gnss start com.other", "no app has the package"},
    {"torch user of a shared uid", "at 5 torch 2101", "app with one package"},
    {"battery model without level", "battery-model 3000", "battery-model <capacity mAh>"},
    {"audio policy 3", "audio-policy 3", "audio-policy 1|2"},
    {"battery model bad current", "battery-model 3000 50% idle -5", "battery-model <capacity mAh>"},
    {"wakelock of no app", "at 5 held-wakelock com.other Tag 20:00", "no app has the package"},
    {"audio start on stream 13", "at 5 audio start 21 13", "stream 0..12"},
    {"call in an unknown state", "at 5 call dialing", "call idle|ringing|offhook"},
    {"discovery without its requester", "at 5 bluetooth discovery start", "bluetooth discovery"},
    {"sensor of an undeclared pid", "at 5 sensor enable 999 1 c1", "pid 999 is not declared"},
    {"sensor enabled for every type", "at 5 sensor enable 2001 -1 c1", "sensor enable|disable"},
    {"gpu busy time below 0", "at 5 gpu com.example.mail 480 -1", "gpu <package> <MHz> <busy ms>"},
    {"single camera of a second stream", "at 5 camera configure 0 2 640 480", "camera connect"},
    {"camera of an undeclared pid", "at 5 camera connect 999 0", "pid 999 is not declared"},
    {"dpm time of no kind", "at 5 dpm DSS hot 3", "dpm <ip-name> off|busy|low|idle"},
    {"ddr level past the four", "at 5 ddr 4 1 100", "ddr <level 0..3>"},
    {"modem level past the lte levels", "at 5 modem lte-tx 8 2", "modem lte-tx <level 0..7>"},
    {"modem idle of no signal level", "at 5 modem idle weakest 2", "idle <weak|mid|strong>"},
    {"modem residency over an hour", "at 5 modem wcdma-data 1 3600.001", "up to 3600"},
    {"call start on no network", "at 5 call start gsm", "call start lte|wcdma"},
    {"modem answer of no fault", "at 5 modem-answer malformed garbage", "modem-answer delay"},
    {"modem answer delay over ten minutes", "at 5 modem-answer delay 601", "modem-answer delay"},
    {"thermal neither enter nor exit", "at 5 thermal hot", "thermal enter|exit"},
    {"shell range without a count", "pelmora-shell Range0", "pelmora-shell <range>=<count>"},
    {"scene with two temperatures", "pelmora-scene a b 38/41 a", "pelmora-scene <package>"},
};

void PrintTo(const Refusal& c, std::ostream* os) {
    *os << c.name;
}

class ScenarioRefusalTest : public ::testing::TestWithParam<Refusal> {};

TEST_P(ScenarioRefusalTest, NamesTheLineAndRunsNothing) {
    Scenario scenario;
    std::string error;
    ASSERT_FALSE(scenario.parse(std::string(kHeader) + GetParam().line + "\n", "s.scn", &error));
    EXPECT_EQ(0u, error.find("s.scn:9: ")) << error;
    EXPECT_NE(std::string::npos, error.find(GetParam().reason)) << error;
    EXPECT_TRUE(scenario.steps().empty());
}

INSTANTIATE_TEST_SUITE_P(Lines, ScenarioRefusalTest, ::testing::ValuesIn(kRefusals),
                         [](const ::testing::TestParamInfo<Refusal>& info) {
                             std::string name;
                             for (const char* p = info.param.name; *p != '\0'; ++p) {
                                 name += isalnum(static_cast<unsigned char>(*p)) ? *p : '_';
                             }
                             return name;
                         });

std::string readFile(const std::string& path) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

// Load moves the counters in whole ticks, fractions carry over, and the
// truth of each name follows the counter the daemon reads for it.
TEST(DeviceModelTest, CountersAndTruthFollowTheLoad) {
    Scenario scenario;
    std::string error;
    ASSERT_TRUE(scenario.parse(kHeader, "s.scn", &error)) << error;
    char dir[] = "/tmp/kelvo-model-XXXXXX";
    ASSERT_NE(nullptr, mkdtemp(dir));
    CpuTree tree(dir);
    DeviceModel model(scenario);
    ASSERT_TRUE(tree.layout(model.clusters()));

    model.setLoad(2001, 0, 25, 576000);  // 2.5 ms per 10 ms
    model.setLoad(2101, 1, 150, 0);      // one and a half big cores
    model.setLoad(301, 0, 5, 576000);
    for (int i = 0; i < 3; ++i) {
        model.advance(333);  // 999 ms in steps that are not whole ticks
    }
    model.advance(1);
    ASSERT_TRUE(model.writeCounters(&tree));
    std::string records = model.processRecords();

    // 250 + 1500 + 50 ms; the uid counter holds user + system µs.
    EXPECT_EQ(1800, model.totalMs());
    EXPECT_NE(std::string::npos,
              readFile(std::string(dir) + "/" + CpuTree::uidStatPath()).find("10061: 166666 83334"));
    ASSERT_EQ(4u * 65, records.size());
    std::map<std::string, int64_t> seen = model.seenMs();
    EXPECT_EQ(250, seen["com.example.mail"]);
    EXPECT_EQ(1500, seen["com.example.browser-renderer"]);
    EXPECT_EQ(0, seen["com.example.browser"]);
    EXPECT_EQ(50, seen["kernel_kworker"]);
    // The little cluster ran at 576000 kHz for the whole second (100 ticks),
    // the big one at its top step.
    EXPECT_NE(std::string::npos,
              readFile(std::string(dir) + "/" + CpuTree::timeInStatePath(0)).find("576000 100\n"));
    EXPECT_NE(std::string::npos,
              readFile(std::string(dir) + "/" + CpuTree::timeInStatePath(4)).find("2457600 100\n"));
    std::string rm = std::string("rm -rf ") + dir;
    ASSERT_EQ(0, system(rm.c_str()));
}

// The truth follows the daemon's rules: the flashlight charges the user known
// when it came on (nobody before a user is known; a user learnt while on, or
// a repeated on, waits for the next real switch), GNSS users share its power,
// the backlight belongs to the foreground at its level's power, and the
// panel's advanced value covers the span since the previous read.
TEST(ComponentTruthTest, FollowsTheDaemonsAccountingRules) {
    Scenario scenario;
    std::string error;
    ASSERT_TRUE(
        scenario.parse(std::string(kHeader) +
                           "app 10062 com.example.music\n"
                           "process 2002 10062 com.example.music\n"
                           "at 0 flashlight on\nat 1 torch 2001\nat 2 flashlight off\n"
                           "at 3 flashlight on\nat 4 torch 2002\nat 5 flashlight on\n"
                           "at 6 flashlight off\n"
                           "at 0 gnss start com.example.mail\nat 2 gnss start com.example.music\n"
                           "at 4 gnss stop com.example.mail\nat 6 gnss stop com.example.music\n"
                           "at 1 brightness 100\nat 2 foreground com.example.mail\n"
                           "at 4 screen off\nat 5 screen on\n",
                       "s.scn", &error))
        << error;
    ComponentTruth::Profile profile;
    profile.slope = 90;
    profile.intercept = 800;  // 98 at level 100
    profile.gnssPower = 35;
    profile.flashlightPower = 180;
    ComponentTruth truth(scenario, profile);
    std::vector<std::string> records;
    for (const Scenario::Step& step : scenario.steps()) {
        ComponentTruth::Record record;
        ASSERT_TRUE(truth.apply(step, &record));
        records.push_back(record.tag + " " + record.text);
    }
    EXPECT_EQ(2801u, truth.takeAdvancedValue(7000));  // mean level 500/7 of 255
    EXPECT_EQ(3921u, truth.takeAdvancedValue(7000));  // an empty span: level 100
    EXPECT_NE(records.end(), std::find(records.begin(), records.end(),
                                       "KELVO_TAG_TORCH_CONNECT uid=10061 pid=2001"));
    // "screen on" restores the last level.
    EXPECT_EQ(2, std::count(records.begin(), records.end(), "KELVO_TAG_BRIGHTNESS brightness=100"));

    auto figures = [](const std::map<std::string, ComponentTruth::Figures>& m) {
        std::string out;
        for (const auto& e : m) {
            out += e.first + " " + std::to_string(e.second.ms) + "/" +
                   std::to_string(e.second.energy()) + "; ";
        }
        return out;
    };
    EXPECT_EQ("com.example.mail 3000/540; ", figures(truth.flashlight()));
    EXPECT_EQ("com.example.mail 4000/105; com.example.music 4000/105; ", figures(truth.gnss()));
    EXPECT_EQ("com.example.mail 2000/196; com.tovaro.android.launcher 3000/294; ",
              figures(truth.backlight()));
}

}  // namespace
}  // namespace sim
}  // namespace kelvo
