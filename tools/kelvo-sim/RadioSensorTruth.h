#pragma once

#include <stdint.h>

#include <map>
#include <set>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "Scenario.h"

namespace kelvo {
namespace sim {

// Bluetooth discovery and transfers and the sensors of the simulated phone:
// turns their scenario steps into the framework's log-device records and
// keeps the truth the daemon should account from them: per application the
// Bluetooth time and energy by activity (0 discovery, charged to the
// requesting process's package; 1 sending and 2 receiving, charged to the
// settings application) and the sensor time and energy by sensor type (the
// type's power shared among the connections that hold it at once). Times are
// scenario milliseconds.
class RadioSensorTruth {
public:
    struct Figures {
        int64_t ms = 0;
        double energy = 0;
    };
    // (application, activity or sensor type)
    using Key = std::pair<std::string, int32_t>;

    static constexpr const char* kTransferPackage = "com.android.settings";

    // The step's words after "at <time>" for the verbs "bluetooth" and
    // "sensor": 1 parsed into the step, 0 another verb, -1 a bad line.
    static int32_t parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                             std::string* reason);

    RadioSensorTruth(const Scenario& scenario, const std::string& configPath);

    // Plays one step; true with the record's tag and text when it is one of
    // this model's.
    bool apply(const Scenario::Step& step, int64_t ms, std::string* tag, std::string* text);
    void advanceTo(int64_t ms);
    // The system's sleep: sensors other than the wake-up types (17, 19,
    // 65545) are cut out of a sleep the daemon counts, one that a wake-up
    // ends before the resume.
    void suspend(int64_t ms);
    void wakeup(int64_t ms);
    void resume(int64_t ms);
    // Media played on Bluetooth (activity 3): the audio model's truth.
    void setMedia(const std::string& package, int64_t ms);
    // Audio on the powered outputs (earpiece, loudspeaker): the audio
    // model's truth, shown beside raw_applications_audio.
    void setAudio(const std::string& package, int64_t ms, double energy);
    // The report's section: per application and activity or sensor type the
    // truth beside what the daemon attributed (raw_applications_bluetooth
    // and _sensor of the database, foreground plus background, charging
    // included).
    std::string report(const std::string& databasePath) const;

    const std::map<Key, Figures>& bluetooth() const { return mBluetooth; }
    const std::map<Key, Figures>& sensors() const { return mSensors; }

private:
    std::string packageOf(int32_t pid, int32_t* uid) const;

    const Scenario& mScenario;
    std::map<int32_t, int32_t> mBluetoothPower;  // by activity, mA
    std::map<int32_t, int32_t> mSensorPower;     // by type, 0.1 mA
    int64_t mNowMs = 0;
    // The discovery's and the transfer's charged name (empty when off) and
    // the transfer's activity.
    std::string mDiscovery;
    std::string mTransfer;
    int32_t mTransferType = 0;
    // Enabled sensors: (type, package, connection).
    std::set<std::tuple<int32_t, std::string, std::string>> mEnabled;
    std::map<Key, Figures> mBluetooth;
    std::map<Key, Figures> mSensors;
    std::map<Key, Figures> mAudio;
    // While asleep, the non-wake-up sensors' figures wait here until the
    // resume tells whether the sleep counts.
    bool mAsleep = false;
    bool mWoken = false;
    std::map<Key, Figures> mSleeping;
};

}  // namespace sim
}  // namespace kelvo
