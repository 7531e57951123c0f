#include <gtest/gtest.h>

#include <string>

#include "AudioModel.h"

namespace kelvo {
namespace sim {
namespace {

struct TruthCase {
    const char* name;
    const char* steps;
    int64_t musicMs;
    int64_t musicEnergy;
};

void PrintTo(const TruthCase& c, std::ostream* os) {
    *os << c.name;
}

class AudioModelTruthTest : public testing::TestWithParam<TruthCase> {};

// The music session plays 10 s on stream 3 at volume 8. The loudspeaker
// draws 40 + 6 x 8 = 88, the earpiece (1500 + 20 x 8) / 100 = 16; a
// loudspeaker route set while nothing plays on the built-in output counts
// as both outputs (104).
TEST_P(AudioModelTruthTest, PoweredTimeAndEnergy) {
    const TruthCase& c = GetParam();
    Scenario scenario;
    std::string error;
    ASSERT_TRUE(scenario.parse(std::string("start 10:00:00\nduration 1:00\n"
                                           "app 10062 com.example.music\n"
                                           "app 10063 com.example.maps\n"
                                           "process 2003 10062 com.example.music\n"
                                           "process 2004 10063 com.example.maps\n"
                                           "at 0 audio acquire 41 2003\n"
                                           "at 0 audio volume 3 8\n") +
                                   c.steps + "at 11 audio stop 41 3\n",
                               "test", &error))
        << error;
    AudioModel::Profile profile;
    profile.slope[0] = 20;
    profile.intercept[0] = 1500;
    profile.slope[1] = 6;
    profile.intercept[1] = 40;
    AudioModel model(scenario, profile);
    for (const Scenario::Step& step : scenario.steps()) {
        std::string tag;
        std::string text;
        model.advanceTo(step.atMs);
        model.apply(step, &tag, &text);
    }
    model.advanceTo(60000);
    const AudioModel::Figures music = model.poweredTruth()["com.example.music"];
    EXPECT_EQ(c.musicMs, music.ms);
    EXPECT_EQ(c.musicEnergy, music.energyNumerator / 1000);
}

INSTANTIATE_TEST_SUITE_P(
    Routes, AudioModelTruthTest,
    testing::Values(
        TruthCase{"SpeakerWhileIdleIsBoth",
                  "at 0 audio device 3 0x2\nat 1 audio start 41 3\n", 10000, 1040},
        TruthCase{"SpeakerWhilePlayingStaysSpeaker",
                  "at 0 audio acquire 42 2004\nat 0 audio start 42 1\nat 0 audio device 3 0x2\n"
                  "at 1 audio start 41 3\n",
                  10000, 880},
        TruthCase{"SpeakerDuringCallStaysSpeaker",
                  "at 0 call offhook\nat 0 audio device 3 0x2\nat 1 audio start 41 3\n", 10000,
                  880},
        TruthCase{"BackFromBluetoothWhileIdleIsBoth",
                  "at 0 audio device 3 0x80\nat 1 audio start 41 3\nat 6 audio device 3 0x2\n",
                  5000, 520}),
    [](const testing::TestParamInfo<TruthCase>& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace sim
}  // namespace kelvo
