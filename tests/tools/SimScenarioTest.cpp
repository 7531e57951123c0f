#include <gtest/gtest.h>
#include <stdlib.h>

#include <fstream>
#include <sstream>
#include <string>

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
    {"unknown verb", "at 5 brightness 80", "unknown verb \"brightness\""},
    {"unknown declaration", "gnss on", "unknown verb \"gnss\""},
    {"percent over the cluster", "at 5 load 2001 0 401%", "percent of one core"},
    {"cluster out of range", "at 5 load 2001 2 10%", "cluster 0|1"},
    {"frequency not a step", "at 5 load 2001 1 10% 1000", "has no step 1000 kHz"},
    {"undeclared pid", "at 5 load 999 0 10%", "pid 999 is not declared"},
    {"step after the end", "at 3:01 battery 50%", "after the end"},
    {"bad time", "at 1:75 battery 50%", "expected \"at <time>"},
    {"battery over 100", "at 5 battery 101%", "level 0..100"},
    {"unknown foreground package", "at 5 foreground com.other", "no app has the package"},
    {"package not of the uid", "process 5 10061 x com.example.browser", "does not have"},
    {"pid declared twice", "process 2001 10061 again", "pid 2001 is declared twice"},
    {"battery model without level", "battery-model 3000", "battery-model <capacity mAh>"},
    {"battery model bad current", "battery-model 3000 50% idle -5", "battery-model <capacity mAh>"},
    {"wakelock of no app", "at 5 held-wakelock com.other Tag 20:00", "no app has the package"},
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

}  // namespace
}  // namespace sim
}  // namespace kelvo
