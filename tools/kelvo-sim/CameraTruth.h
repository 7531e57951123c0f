#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <utility>
#include <vector>

#include "Scenario.h"

namespace kelvo {
namespace sim {

// The camera service of the simulated phone: turns the camera steps into the
// framework's connect, configure, unconfigure and disconnect records and
// keeps the truth the daemon should account from them: per application and
// camera (front for stream type 1, rear for types 0, 2 and 3) the time a
// configured stream was open and its energy, the profile's power for the
// stream's size (the nearest listed size) over that time. Times are
// scenario milliseconds.
class CameraTruth {
public:
    struct Figures {
        int64_t ms = 0;
        double energy = 0;
    };
    // (application, "front" or "rear")
    using Key = std::pair<std::string, std::string>;

    // The step's words after "at <time>" for the verb "camera": 1 parsed
    // into the step, 0 another verb, -1 a bad line.
    static int32_t parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                             std::string* reason);

    CameraTruth(const Scenario& scenario, const std::string& configPath);

    // Plays one step; true with the record's tag and text when it is a
    // camera step.
    bool apply(const Scenario::Step& step, int64_t ms, std::string* tag, std::string* text);
    void advanceTo(int64_t ms);
    // The report's section: the truth beside the daemon's raw rows
    // (raw_applications_front_camera and _rear_camera, charging included).
    std::string report(const std::string& databasePath) const;

    const std::map<Key, Figures>& cameras() const { return mCameras; }
    // The package the last step connected to camera 0 (the flashlight's
    // user from then on), or empty.
    const std::string& flashlightUser() const { return mFlashlightUser; }

private:
    struct Size {
        int32_t width = 0;
        int32_t height = 0;
    };
    double powerOf(int32_t type, const Size& size) const;

    const Scenario& mScenario;
    // Per stream type (the profile's camera index), power by width x height.
    std::vector<std::map<int64_t, int32_t>> mPower;
    int64_t mNowMs = 0;
    // The connection's application (empty when none) and its open streams.
    std::string mUser;
    std::map<int32_t, Size> mStreams;
    std::map<Key, Figures> mCameras;
    std::string mFlashlightUser;
};

}  // namespace sim
}  // namespace kelvo
