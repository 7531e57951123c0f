#pragma once

#include <stdint.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "AudioModel.h"
#include "CameraTruth.h"
#include "ComponentTruth.h"
#include "DaemonProcess.h"
#include "DeviceModel.h"
#include "GpuLoadTruth.h"
#include "DpmActivity.h"
#include "ModemModel.h"
#include "ModemTruth.h"
#include "PlatformState.h"
#include "RadioSensorTruth.h"
#include "Scenario.h"
#include "SystemScene.h"
#include "ThermalScene.h"
#include "TrafficModel.h"

namespace kelvo {

class BatteryModel;
class CpuTree;
class LogWriter;
class PlatformServices;

namespace fake {
class FakeKernelDriver;
class FakeDriverReporter;
}  // namespace fake

namespace sim {

// Plays one scenario against the real daemon: lays out the device root,
// serves the kernel devices and the framework services, starts the daemon at
// the scenario's time of day, advances the counters, answers the per-process
// CPU requests, and at the end stops everything and writes the report.
class DeviceSimulator {
public:
    struct Options {
        std::string scenarioPath;
        std::string root;        // empty: a fresh folder under /tmp
        std::string daemonPath;  // the kelvod binary
        std::string configDir;   // build.prop and the sample configuration
        bool progress = true;
        // Prints daemon_idle_rss_kb and daemon_idle_wakeups_per_min, measured
        // from 10 s after the start to the end of the scenario.
        bool idleFigures = false;
    };

    DeviceSimulator(const Scenario& scenario, const Options& options);
    ~DeviceSimulator();

    // Runs the whole scenario; the process exit status: 0 done, 1 failed,
    // 130 interrupted (the report is still written).
    int run();

    // Set from a signal handler: ends the run early, in order.
    static void requestStop();

private:
    enum class Phase { Start, Load, HourlyRound, Report };

    bool writeAudioPolicy(const std::string& root, int32_t policy);

    bool prepareRoot(std::string* error);
    bool startServices(std::string* error);
    bool startDaemon(std::string* error);
    bool waitDaemonReady(std::string* error);
    // Plays the steps; false when the daemon died or a stop was requested.
    bool play();
    void apply(const Scenario::Step& step);
    void advanceTo(int64_t ms);
    void writeCounters();
    // Writes the battery files, then has the registrar push the state.
    void pushBattery(PlatformState::Battery battery);
    // The per-process report of one request (the bytes after the echoed
    // time and mode).
    std::string answerCpuRequest();
    void showProgress(int64_t elapsedMs, bool last);
    void updatePhase(int64_t elapsedMs);
    // Rounds the hourly routine finished so far; -1 when unknown.
    int32_t hourlyRoundsFinished() const;
    void stopAll();
    int finish(bool completed);

    int64_t simulatedNowMs() const;

    const Scenario& mScenario;
    Options mOptions;
    int64_t mOffsetMs = 0;
    int64_t mStartMs = 0;       // simulated wall clock at the beginning
    int64_t mModelMs = 0;       // simulated time played so far
    int64_t mNextHourMs = 0;    // elapsed ms at which the next full hour falls
    int64_t mRoundStartMs = 0;  // elapsed ms at which the current round opened
    int32_t mRoundsBefore = 0;
    Phase mPhase = Phase::Start;
    std::string mLogPath;
    std::string mError;

    std::mutex mLock;  // the model, the guard and the truth, shared with the driver thread
    DeviceModel mModel;
    std::unique_ptr<CpuTree> mTree;
    // The display, GNSS and flashlight with their truth (under mLock: the
    // driver thread reads the panel's advanced brightness).
    std::unique_ptr<ComponentTruth> mComponents;
    std::unique_ptr<TrafficModel> mTraffic;
    // The Wi-Fi energy truth at the end, at the daemon's polls when known.
    WifiEnergyTruth::Result wifiEnergyTruth(int64_t endMs);
    WifiEnergyTruth::Profile mWifiProfile;
    std::string mWifiEnergyHeading;
    std::unique_ptr<BatteryModel> mBattery;  // the play thread's
    // The audio framework with its truth (under mLock).
    std::unique_ptr<AudioModel> mAudio;
    std::unique_ptr<RadioSensorTruth> mRadioSensors;
    std::unique_ptr<GpuLoadTruth> mGpu;  // under mLock
    std::unique_ptr<CameraTruth> mCameras;
    std::unique_ptr<DpmActivity> mDpm;  // under mLock
    // The modem answers the daemon's requests on its own thread.
    std::unique_ptr<ModemModel> mModem;
    ModemTruth::Profile mModemProfile;
    std::string modemReport(int64_t endMs);
    int64_t mGuardUntilMs = 0;  // monotonic: no counter rewrite before
    bool mHaveBaseline = false;
    std::map<std::string, int64_t> mBaselineMs;
    std::map<std::string, int64_t> mLastSeenMs;
    std::atomic<int32_t> mReports{0};  // also read by the progress line

    std::unique_ptr<PlatformServices> mServices;
    std::unique_ptr<fake::FakeKernelDriver> mDriver;
    std::unique_ptr<fake::FakeDriverReporter> mReporter;
    std::unique_ptr<LogWriter> mLogWriter;
    std::unique_ptr<SystemScene> mSystem;
    std::unique_ptr<ThermalScene> mThermal;  // "Pelmora"
    int32_t mLogWritten = 0;
    int32_t mLogUnread = 0;
    DaemonProcess mDaemon;
    int mDaemonStatus = -1;

    // Idle figures.
    int64_t mRssKb = -1;
    int64_t mSwitchesAtStart = -1;
    int64_t mSwitchesAtStartMs = 0;

    static std::atomic<bool> sStop;
};

}  // namespace sim
}  // namespace kelvo
