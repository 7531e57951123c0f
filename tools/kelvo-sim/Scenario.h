#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <vector>

#include "BatteryModel.h"
#include "ThermalScene.h"

namespace kelvo {
namespace sim {

// One scenario of the device simulator: the phone's apps and processes, and
// what happens to them over time (docs/simulator.md). A scenario is read
// whole before anything runs; the first bad line refuses it.
class Scenario {
public:
    // A uid and the packages the package service lists for it.
    struct App {
        int32_t uid = 0;
        std::vector<std::string> packages;
    };

    struct Process {
        int32_t pid = 0;
        int32_t uid = 0;
        std::string name;
        // 1: process, 2: kernel thread (the per-process report's name type).
        uint8_t nameType = 1;
        // The package the activity manager lists for the process; empty when
        // it is not an application process.
        std::string package;
    };

    // What a timed line does. Later components add their verbs here.
    enum class Action {
        Load,           // pid, cluster, percent, frequency (kHz, 0: the highest)
        Foreground,     // text: the package
        Screen,         // flag: on
        Charger,        // text: "ac", "usb", "wireless" or "off"
        Battery,        // value: level
        Brightness,     // value: level 0..255
        Ambient,        // value: type (0 auto, 1 manual, 2 app, 3 front), values: six durations
        Gnss,           // flag: start, text: the package
        Flashlight,     // flag: on
        Torch,          // pid: the torch user's process
        System,         // text: the record (SystemScene::parseStep)
        Traffic,        // pid: uid, text: interface, value: counter set, counters
        SystemTraffic,  // pid, text: interface, counters
        Wifi,           // value: record kind, pid: its number (WifiRecords)
        HeldWakelock,   // text: package, tag: the wakelock, value: ms held
        Audio,          // text: "audio <verb>", "call" or "smartpa <answer>" (AudioModel)
        Bluetooth,  // text: discovery-start (pid: the requester), discovery-stop, send, receive, stop
        Sensor,     // flag: enable, pid, value: sensor type (-1 every type), text: connection
        Gpu,        // text: package, frequency: MHz, value: busy ms (GpuLoadTruth)
        Camera,  // text: connect (pid, values: id), configure (values: dual, type, width, height),
                 // unconfigure (values: type), disconnect
        Dpm,     // text: IP block, value: time index, counters[0]: ms (DpmActivity)
        Ddr,     // value: level, counters[0]: seconds, counters[1]: MB (DpmActivity)
        Modem,   // text: the kind (ModemModel::parseStep), value: level, counters[0]: ms
    };

    struct Step {
        int64_t atMs = 0;
        int32_t line = 0;
        Action action = Action::Load;
        int32_t pid = 0;
        int32_t cluster = 0;
        int32_t percent = 0;
        int32_t frequency = 0;
        int32_t value = 0;
        bool flag = false;
        std::string text;
        std::vector<int32_t> values;
        int64_t counters[4] = {};  // traffic: rx bytes, tx bytes, rx packets, tx packets
        std::string tag;
    };

    // Reads a scenario file; false with "<file>:<line>: <reason>" in error.
    bool load(const std::string& path, std::string* error);
    // Reads scenario text; name only labels errors.
    bool parse(const std::string& text, const std::string& name, std::string* error);

    // Simulated local time of day at the beginning, in seconds after midnight.
    int32_t startSecondOfDay() const { return mStartSecondOfDay; }
    const std::string& timeZone() const { return mTimeZone; }
    int64_t durationMs() const { return mDurationMs; }
    // Steps of the timer's resolution: how often counters advance.
    int32_t tickMs() const { return mTickMs; }
    const std::vector<App>& apps() const { return mApps; }
    const std::vector<Process>& processes() const { return mProcesses; }
    // The battery (the defaults without a "battery-model" line).
    const BatteryModel::Config& battery() const { return mBattery; }
    // The audio data-source policy of the root's own configuration (1 the
    // shipped one; 2 the smart amplifier's measured energy).
    int32_t audioPolicy() const { return mAudioPolicy; }
    // What the power-management application answers each day.
    const ThermalScene::Content& pelmora() const { return mPelmora; }
    // In time order (lines of equal time keep their order).
    const std::vector<Step>& steps() const { return mSteps; }

    const App* findApp(int32_t uid) const;
    const Process* findProcess(int32_t pid) const;

    // Cluster layout of the simulated phone (CpuTree::phoneClusters): cores
    // and frequency steps (kHz).
    static constexpr int32_t kClusterCount = 2;
    static const std::vector<int32_t>& clusterFrequencies(int32_t cluster);
    static int32_t clusterCores(int32_t cluster);

private:
    bool parseLine(const std::vector<std::string>& words, std::string* reason);
    bool parseTimed(int64_t atMs, const std::vector<std::string>& words, std::string* reason);
    bool parseComponentStep(const std::vector<std::string>& words, Step* step, std::string* reason);
    bool check(std::string* reason, int32_t* line);

    int32_t mLine = 0;
    int32_t mStartSecondOfDay = -1;
    std::string mTimeZone = "UTC";
    int64_t mDurationMs = -1;
    int32_t mTickMs = 1000;
    std::vector<App> mApps;
    std::vector<Process> mProcesses;
    std::vector<Step> mSteps;
    BatteryModel::Config mBattery;
    int32_t mAudioPolicy = 1;
    ThermalScene::Content mPelmora;
};

}  // namespace sim
}  // namespace kelvo
