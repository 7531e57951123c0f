#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <vector>

#include "Scenario.h"

namespace kelvo {
namespace sim {

// The audio framework of the simulated phone: its verbs ("audio ...",
// "call ...", "smartpa ..."), the log-device records they write, and the
// truth of each application's play time by output with the energy the
// power profile gives it (loudspeaker and earpiece; Bluetooth time has no
// audio energy).
class AudioModel {
public:
    // The profile's audio figures: per output (0 earpiece, 1 loudspeaker)
    // power = intercept + slope x volume, the earpiece's divided by 100.
    struct Profile {
        int32_t slope[2] = {0, 0};
        int32_t intercept[2] = {0, 0};
    };

    struct Figures {
        int64_t ms = 0;
        int64_t energyNumerator = 0;  // power x ms; energy = this / 1000
    };

    // Parses an audio, call or smartpa line into the step; false with the
    // reason for another verb's line too (the caller tries it first).
    static bool isVerb(const std::string& verb);
    static bool parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                          std::string* reason);
    static bool readProfile(const std::string& configPath, Profile* profile);

    AudioModel(const Scenario& scenario, const Profile& profile);

    // The record a step writes (false for none: "smartpa" sets the
    // framework's answer, text, instead).
    bool apply(const Scenario::Step& step, std::string* tag, std::string* text);
    void advanceTo(int64_t ms);
    // The play time on a Bluetooth output per package.
    std::map<std::string, int64_t> bluetoothMs() const;
    // The truth's lines: per application and output (earpiece, speaker,
    // both, bluetooth) the play time and the profile's energy.
    std::string summary() const;
    // The time and energy on the powered outputs per package.
    std::map<std::string, Figures> poweredTruth() const;

private:
    struct Session {
        std::string package;
        int32_t stream = 12;
        int32_t reference = 0;
    };

    int32_t power(uint32_t device, int32_t volume) const;
    // The stream the call plays on while ringing or off-hook.
    int32_t callStream() const;
    // Whether a playing session or the call uses the earpiece or loudspeaker.
    bool builtInInUse() const;

    const Scenario& mScenario;
    Profile mProfile;
    int64_t mNowMs = 0;
    uint32_t mDevice[13];
    int32_t mVolume[13];
    std::map<int32_t, Session> mSessions;
    int32_t mCallState = 0;
    // package -> output ("earpiece", "speaker", "both", "bluetooth") -> figures
    std::map<std::string, std::map<std::string, Figures>> mTruth;
};

}  // namespace sim
}  // namespace kelvo
