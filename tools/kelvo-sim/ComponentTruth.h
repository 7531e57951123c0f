#pragma once

#include <stdint.h>

#include <map>
#include <set>
#include <string>

#include "Scenario.h"

namespace kelvo {
namespace sim {

// The display, GNSS and flashlight of the simulated phone: turns the
// scenario's steps into the log-device records the framework writes for
// them, and keeps the truth the daemon should account from those records:
// per application the time in front with the screen on and its backlight
// energy, GNSS time and energy (shared among the users at once), flashlight
// time and energy (the torch user current when the flashlight came on). It
// also plays the panel's advanced brightness statistics.
//
// Times are scenario milliseconds; energies are in the power profile's unit
// x ms / 1000, summed exactly (the daemon truncates every interval).
class ComponentTruth {
public:
    // The power profile's figures the truth uses.
    struct Profile {
        int32_t slope = 0;  // backlight: power = (intercept + slope x level) / 100
        int32_t intercept = 0;
        int32_t gnssPower = 0;
        int32_t flashlightPower = 0;
        // The display's data-source policy: under 2 the backlight is charged
        // from the panel's advanced values, whose energy has no truth here.
        int32_t displayPolicy = 1;
    };

    struct Figures {
        int64_t ms = 0;
        int64_t energyNumerator = 0;  // power x ms; energy = this / 1000
        int64_t energy() const { return energyNumerator / 1000; }
    };

    // What a step writes to the log device.
    struct Record {
        std::string tag;
        std::string text;
    };

    // The level "screen on" gives before any "brightness" step.
    static constexpr int32_t kDefaultLevel = 128;
    // The daemon's foreground when the screen comes on with nothing in front.
    static constexpr const char* kLauncher = "com.tovaro.android.launcher";
    static constexpr const char* kScreenOff = "screen_off";
    static constexpr uint32_t kMaxAdvancedValue = 10000;

    ComponentTruth(const Scenario& scenario, const Profile& profile);

    // Reads the figures from a configuration file; false (and the defaults)
    // when it cannot be read.
    static bool readProfile(const std::string& configPath, Profile* profile);

    // Plays one step at its time; true with the record to write when the
    // step is one of this model's (foreground, screen, brightness, ambient,
    // gnss, flashlight, torch).
    bool apply(const Scenario::Step& step, Record* record);
    bool screenOn() const { return mScreenOn; }
    // A user of the flashlight learnt elsewhere (the camera's): from now on,
    // or from the next switch while the light is on.
    void learnTorchUser(int64_t ms, const std::string& package);
    // Brings the truth up to the time (the end of the run).
    void advanceTo(int64_t ms);

    // The advanced brightness of the span since the previous read, up to the
    // time: the mean backlight level over the span in 1/10000 of full
    // brightness (0 while the screen is off).
    uint32_t takeAdvancedValue(int64_t ms);

    const Profile& profile() const { return mProfile; }
    const std::map<std::string, Figures>& backlight() const { return mBacklight; }
    const std::map<std::string, Figures>& gnss() const { return mGnss; }
    const std::map<std::string, Figures>& flashlight() const { return mFlashlight; }
    // Ambient light written per type (0 auto, 1 manual, 2 app, 3 front), ms.
    const std::map<int32_t, int64_t>& ambientMs() const { return mAmbientMs; }

private:
    int32_t levelPower(int32_t level) const;
    void setLevel(int32_t level);
    void changeForeground(const std::string& name);
    void setFlashlight(bool on);

    const Scenario& mScenario;
    Profile mProfile;
    int64_t mNowMs = 0;

    // Display, as the daemon sees it: the screen is off and "screen_off" in
    // front until the first level above 0.
    bool mScreenOn = false;
    int32_t mLevel = 0;
    int32_t mOnLevel = kDefaultLevel;  // the level "screen on" restores
    std::string mForeground = kScreenOff;
    int64_t mAdvancedFromMs = 0;
    int64_t mAdvancedSum = 0;  // level x ms since the last read

    std::set<std::string> mGnssUsers;

    bool mFlashOn = false;
    std::string mTorchUser;    // charged from the next switch-on
    std::string mPendingUser;  // learnt while on: takes over at the next switch
    std::string mChargedUser;  // charged for the current on period

    std::map<std::string, Figures> mBacklight;
    std::map<std::string, Figures> mGnss;
    std::map<std::string, Figures> mFlashlight;
    std::map<int32_t, int64_t> mAmbientMs;
};

}  // namespace sim
}  // namespace kelvo
