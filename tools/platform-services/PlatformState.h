#pragma once

#include <stdint.h>

#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace kelvo {

// What the fake platform services answer, changeable while they run, and
// what they were asked. Every service of one PlatformServices shares one.
class PlatformState {
public:
    struct Process {
        int32_t pid;
        int32_t uid;
        std::string name;
        std::vector<std::string> packages;
    };

    struct Battery {
        bool acOnline = false;
        bool usbOnline = false;
        bool wirelessOnline = false;
        int32_t level = 50;
        int32_t voltage = 3800;
        int32_t temperature = 250;
    };

    // "package"
    void setPackages(int32_t uid, const std::vector<std::string>& packages);
    std::vector<std::string> packages(int32_t uid);
    void setPackageVersion(const std::string& name, int32_t code, const std::string& version);
    bool packageVersion(const std::string& name, int32_t& code, std::string& version);

    // "activity"
    void setProcesses(const std::vector<Process>& processes);
    std::vector<Process> processes();

    // "batteryproperties": the registrar pushes each change to its listeners.
    void setBattery(const Battery& battery);
    Battery battery();

    // "pmservice"
    void setWakelocks(const std::vector<std::string>& records);
    std::vector<std::string> wakelocks();
    void noteReset();
    int32_t resetCount();

    // "SysinfoService": the device paths of the traces written.
    void noteTrace(const std::string& path);
    std::vector<std::string> traces();

    // "permission": an unlisted (permission, uid) is refused.
    void grant(const std::string& permission, int32_t uid, bool granted);
    bool granted(const std::string& permission, int32_t uid);

    // "media.audio_flinger": the answer to a parameter key, empty when unset.
    void setAudioParameter(const std::string& key, const std::string& value);
    std::string audioParameter(const std::string& key);

    // A service answers only after this many milliseconds (a hanging
    // framework).
    void setDelayMs(const std::string& service, int32_t ms);
    int32_t delayMs(const std::string& service);

    // Number of transactions a service received with a code.
    void noteCall(const std::string& service, uint32_t code);
    int32_t calls(const std::string& service, uint32_t code);

    // Called (without the state's lock) after setBattery.
    void setBatteryObserver(std::function<void()> observer);

private:
    std::mutex mLock;
    std::map<int32_t, std::vector<std::string>> mPackages;
    std::map<std::string, std::pair<int32_t, std::string>> mVersions;
    std::vector<Process> mProcesses;
    Battery mBattery;
    std::vector<std::string> mWakelocks;
    int32_t mResets = 0;
    std::vector<std::string> mTraces;
    std::map<std::pair<std::string, int32_t>, bool> mGrants;
    std::map<std::string, std::string> mAudioParameters;
    std::map<std::string, int32_t> mDelays;
    std::map<std::pair<std::string, uint32_t>, int32_t> mCalls;
    std::function<void()> mBatteryObserver;
};

} // namespace kelvo
