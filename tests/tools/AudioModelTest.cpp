#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "AudioModel.h"

namespace kelvo {
namespace sim {
namespace {

// Music plays 10 s at volume 8 after its stream is sent to the loudspeaker:
// 40 + 6 x 8 = 88 alone, plus (1500 + 20 x 8) / 100 = 16 for the earpiece
// when nothing else held the built-in output at the switch.
TEST(AudioModelTest, SpeakerAloneWhileIdleCountsBothOutputs) {
    const std::vector<std::pair<std::string, int64_t>> cases = {{"", 1040},
                                                                {"at 0 call offhook\n", 880}};
    for (const auto& [before, energy] : cases) {
        Scenario scenario;
        std::string error;
        ASSERT_TRUE(scenario.parse(
            "start 10:00:00\nduration 1:00\napp 10062 m\nprocess 2003 10062 m\n" + before +
                "at 0 audio acquire 41 2003\nat 0 audio volume 3 8\n"
                "at 0 audio device 3 0x2\nat 1 audio start 41 3\n"
                "at 11 audio stop 41 3\n",
            "test", &error))
            << error;
        AudioModel model(scenario, AudioModel::Profile{{20, 6}, {1500, 40}});
        for (const Scenario::Step& step : scenario.steps()) {
            std::string tag;
            std::string text;
            model.advanceTo(step.atMs);
            model.apply(step, &tag, &text);
        }
        EXPECT_EQ(energy, model.poweredTruth()["m"].energyNumerator / 1000) << before;
    }
}

}  // namespace
}  // namespace sim
}  // namespace kelvo
