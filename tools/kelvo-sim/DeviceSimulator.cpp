#include "DeviceSimulator.h"

#include <binder/ProcessState.h>
#include <dirent.h>
#include <errno.h>
#include <inttypes.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <fstream>
#include <sstream>

#include "BatteryModel.h"
#include "BatteryReport.h"
#include "ComponentReport.h"
#include "CpuTree.h"
#include "FakeDriverReporter.h"
#include "FakeKernelDriver.h"
#include "PlatformServices.h"
#include "SimReport.h"
#include "ThermalReport.h"
#include "WifiRecords.h"
#include "kelvo/BufferedLogClient.h"
#include "kelvo/KelvoManagerClient.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"

namespace kelvo {
namespace sim {

std::atomic<bool> DeviceSimulator::sStop{false};

namespace {

// After a per-process report the counter files stay as they are for this
// long, so the pass that reads them sees the state the report was cut from.
constexpr int64_t kReportGuardMs = 800;
constexpr int64_t kReadyTimeoutMs = 15000;
constexpr int kStopGraceMs = 15000;
// The idle figures are taken from this long after the start on.
constexpr int64_t kIdleSettleMs = 10000;
constexpr int64_t kHourMs = 3600 * 1000;
// Eight steps of a round, each waiting at most a minute for its votes.
constexpr int64_t kLongestRoundMs = 8 * 60 * 1000;

int64_t monotonicMs() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

int64_t realtimeMs() {
    struct timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

void sleepMs(int64_t ms) {
    if (ms <= 0) {
        return;
    }
    struct timespec ts = {static_cast<time_t>(ms / 1000), static_cast<long>(ms % 1000) * 1000000};
    nanosleep(&ts, nullptr);
}

bool makeDirs(const std::string& path) {
    std::string partial;
    std::stringstream in(path);
    std::string part;
    while (std::getline(in, part, '/')) {
        partial += part + "/";
        if (!part.empty() && mkdir(partial.c_str(), 0755) != 0 && errno != EEXIST) {
            return false;
        }
    }
    return true;
}

bool copyFile(const std::string& from, const std::string& to) {
    struct stat st;
    if (stat(to.c_str(), &st) == 0) {
        return true;  // a file the user put there stays
    }
    std::ifstream in(from, std::ios::binary);
    std::ofstream out(to, std::ios::binary);
    if (!in || !out) {
        return false;
    }
    out << in.rdbuf();
    return static_cast<bool>(out);
}

// Sum of both kinds of context switches over the threads of a process.
int64_t contextSwitches(pid_t pid) {
    std::string dir = "/proc/" + std::to_string(pid) + "/task";
    DIR* tasks = opendir(dir.c_str());
    if (tasks == nullptr) {
        return -1;
    }
    int64_t total = 0;
    while (struct dirent* entry = readdir(tasks)) {
        if (entry->d_name[0] == '.') {
            continue;
        }
        std::ifstream status(dir + "/" + entry->d_name + "/status");
        std::string line;
        while (std::getline(status, line)) {
            if (line.compare(0, 24, "voluntary_ctxt_switches:") == 0 ||
                line.compare(0, 27, "nonvoluntary_ctxt_switches:") == 0) {
                total += atoll(line.substr(line.find(':') + 1).c_str());
            }
        }
    }
    closedir(tasks);
    return total;
}

int64_t residentKb(pid_t pid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.compare(0, 6, "VmRSS:") == 0) {
            return atoll(line.substr(6).c_str());
        }
    }
    return -1;
}

const char* phaseName(int phase) {
    static const char* const kNames[] = {"start", "load", "hourly round", "report"};
    return kNames[phase];
}

}  // namespace

DeviceSimulator::DeviceSimulator(const Scenario& scenario, const Options& options)
    : mScenario(scenario), mOptions(options), mModel(scenario) {}

DeviceSimulator::~DeviceSimulator() {
    stopAll();
}

void DeviceSimulator::requestStop() {
    sStop = true;
}

int64_t DeviceSimulator::simulatedNowMs() const {
    return realtimeMs() + mOffsetMs;
}

// The root's own configuration (/data, which the daemon prefers): the
// sample with the audio component's data-source policy replaced.
bool DeviceSimulator::writeAudioPolicy(const std::string& root, int32_t policy) {
    std::ifstream in(mOptions.configDir + "/tv_kelvo_config.xml");
    std::stringstream text;
    text << in.rdbuf();
    std::string xml = text.str();
    static const std::string kAudio =
        "<!-- audio -->\n        <component id=\"2\">\n            <parameter>1</parameter>";
    size_t at = xml.find(kAudio);
    if (!in || at == std::string::npos || !makeDirs(root + "/data/misc/kelvo")) {
        return false;
    }
    std::string replaced = kAudio;
    replaced.replace(replaced.size() - std::string("1</parameter>").size(), 1,
                     std::to_string(policy));
    xml.replace(at, kAudio.size(), replaced);
    std::ofstream out(root + "/data/misc/kelvo/tv_kelvo_config.xml");
    out << xml;
    return static_cast<bool>(out.flush());
}

bool DeviceSimulator::prepareRoot(std::string* error) {
    if (mOptions.root.empty()) {
        char pattern[] = "/tmp/kelvo-sim-XXXXXX";
        if (mkdtemp(pattern) == nullptr) {
            *error = std::string("cannot create a root under /tmp: ") + strerror(errno);
            return false;
        }
        mOptions.root = pattern;
    }
    const std::string& root = mOptions.root;
    // The report compares this run's rows with this run's truth: rows of an
    // earlier run on the same root (at the same simulated times) would mix in.
    struct stat st;
    if (stat(SimReport::databasePath(root).c_str(), &st) == 0 ||
        stat(SimReport::eventsPath(root).c_str(), &st) == 0) {
        *error = root +
                 " holds the database or the uploaded events of an earlier run; give a "
                 "fresh --root";
        return false;
    }
    for (const char* dir :
         {"/system", "/vendor/etc/xml", "/data/log/kelvo", "/data/property", "/dev", "/sim"}) {
        if (!makeDirs(root + dir)) {
            *error = "cannot create " + root + dir + ": " + strerror(errno);
            return false;
        }
    }
    if (!copyFile(mOptions.configDir + "/build.prop", root + "/system/build.prop") ||
        !copyFile(mOptions.configDir + "/tv_kelvo_config.xml",
                  root + "/vendor/etc/xml/tv_kelvo_config.xml")) {
        *error = "cannot copy the sample configuration from " + mOptions.configDir;
        return false;
    }
    if (mScenario.audioPolicy() != 1 && !writeAudioPolicy(root, mScenario.audioPolicy())) {
        *error = "cannot write the root's configuration with audio policy " +
                 std::to_string(mScenario.audioPolicy()) + " below " + root;
        return false;
    }
    mTree.reset(new CpuTree(root));
    if (!mTree->layout(mModel.clusters()) || !mModel.writeCounters(mTree.get())) {
        *error = "cannot lay out the CPU counters below " + root + ": " + strerror(errno);
        return false;
    }
    // The daemon prefers a configuration under /data to the customised one.
    ComponentTruth::Profile profile;
    std::string config = root + "/data/misc/kelvo/tv_kelvo_config.xml";
    if (stat(config.c_str(), &st) != 0) {
        config = root + "/vendor/etc/xml/tv_kelvo_config.xml";
    }
    if (!ComponentTruth::readProfile(config, &profile)) {
        *error = "cannot read the power profile of " + config;
        return false;
    }
    mComponents.reset(new ComponentTruth(mScenario, profile));
    mSystem.reset(new SystemScene(mScenario, root));
    if (!mSystem->layout()) {
        *error = "cannot lay out the system files below " + root + ": " + strerror(errno);
        return false;
    }
    mTraffic.reset(new TrafficModel(mScenario, root));
    WifiEnergyTruth::readProfile(config, &mWifiProfile);
    if (!mTraffic->write()) {
        *error = "cannot write the traffic counters below " + root + ": " + strerror(errno);
        return false;
    }
    mBattery.reset(new BatteryModel(root, mScenario.battery()));
    if (!mBattery->writeFiles()) {
        *error = "cannot lay out the battery files below " + root + ": " + strerror(errno);
        return false;
    }
    AudioModel::Profile audioProfile;
    AudioModel::readProfile(config, &audioProfile);
    mAudio.reset(new AudioModel(mScenario, audioProfile));
    mRadioSensors.reset(new RadioSensorTruth(mScenario, config));
    mGpu.reset(new GpuLoadTruth(config));
    mCameras.reset(new CameraTruth(mScenario, config));
    mDpm.reset(new DpmActivity(config));
    mModem.reset(new ModemModel(root, [](const std::string& block) {
        return KelvoManagerClient::send(ModemModel::kEventType, block.data(), block.size());
    }));
    ModemTruth::readProfile(config, &mModemProfile);
    if (!mModem->layout()) {
        *error = "cannot create the modem's control file below " + root + ": " + strerror(errno);
        return false;
    }
    mLogPath = root + "/sim/kelvod.log";
    RootPath::setRoot(root.c_str());
    return true;
}

bool DeviceSimulator::startServices(std::string* error) {
    mServices.reset(new PlatformServices());
    const std::shared_ptr<PlatformState>& state = mServices->state();
    for (const Scenario::App& app : mScenario.apps()) {
        state->setPackages(app.uid, app.packages);
    }
    std::vector<PlatformState::Process> processes;
    for (const Scenario::Process& process : mScenario.processes()) {
        if (process.nameType != 1) {
            continue;
        }
        PlatformState::Process entry{process.pid, process.uid, process.name, {}};
        if (!process.package.empty()) {
            entry.packages.push_back(process.package);
        }
        processes.push_back(entry);
    }
    state->setProcesses(processes);
    PlatformState::Battery battery = state->battery();
    battery.level = mBattery->level();
    state->setBattery(battery);
    android::ProcessState::self()->startThreadPool();
    if (mServices->startAll() != android::NO_ERROR) {
        *error = "cannot register the platform services below " + mOptions.root;
        return false;
    }
    mDriver.reset(new fake::FakeKernelDriver());
    if (!mDriver->start()) {
        *error = "cannot serve the kernel devices below " + mOptions.root;
        return false;
    }
    mDriver->setBrightnessSource([this] {
        std::lock_guard<std::mutex> lock(mLock);
        return mComponents->takeAdvancedValue(mModelMs);
    });
    mSystem->configureDriver(*mDriver);
    mDpm->prepare(*mDriver);
    mReporter.reset(new fake::FakeDriverReporter(*mDriver));
    mReporter->setBodyProvider([this](const fake::FakeDriverReporter::Report& report) {
        return report.magic == fake::FakeDriverReporter::MAGIC_PID_CPU_TIME
                   ? answerCpuRequest()
                   : fake::FakeDriverReporter::reportBody(report, mDriver->state());
    });
    mReporter->start();
    if (!mModem->start()) {
        *error = "cannot watch the modem's control file below " + mOptions.root;
        return false;
    }
    mLogWriter.reset(new LogWriter(RootPath::resolve("/dev/tvlog_kelvo")));
    mLogWriter->setTimeout(200);
    return true;
}

bool DeviceSimulator::startDaemon(std::string* error) {
    if (access(mOptions.daemonPath.c_str(), X_OK) != 0) {
        *error = "no daemon to run at " + mOptions.daemonPath + " (build it, or give --daemon)";
        return false;
    }
    std::map<std::string, std::string> env = {
        {"KELVO_ROOT", mOptions.root},
        {"KELVO_CLOCK_OFFSET_MS", std::to_string(mOffsetMs)},
        {"TZ", mScenario.timeZone()},
    };
    return mDaemon.start(mOptions.daemonPath, env, mLogPath, error);
}

bool DeviceSimulator::waitDaemonReady(std::string* error) {
    // Ready once the buffered log socket is there and the daemon's battery
    // listener has registered: the routines and handlers are initialised
    // before that step of the start-up, the dispatcher a moment after.
    std::string socket = RootPath::resolve("/dev/socket/") + BufferedLogClient::kSocketName;
    int64_t deadline = monotonicMs() + kReadyTimeoutMs;
    while (monotonicMs() < deadline) {
        if (!mDaemon.running()) {
            *error = "the daemon ended during its start; see " + mLogPath;
            return false;
        }
        if (sStop) {
            *error = "interrupted";
            return false;
        }
        struct stat st;
        android::sp<FakeBatteryRegistrar> registrar = mServices->batteryRegistrar();
        if (stat(socket.c_str(), &st) == 0 && S_ISSOCK(st.st_mode) && registrar != nullptr &&
            registrar->listenerCount() > 0) {
            sleepMs(300);
            return true;
        }
        sleepMs(50);
    }
    *error = "the daemon did not start within 15 s; see " + mLogPath;
    return false;
}

std::string DeviceSimulator::answerCpuRequest() {
    std::lock_guard<std::mutex> lock(mLock);
    std::string body;
    int32_t state = 1;
    int32_t count = mModel.processCount();
    body.append(reinterpret_cast<const char*>(&state), sizeof(state));
    body.append(reinterpret_cast<const char*>(&count), sizeof(count));
    body += mModel.processRecords();
    mLastSeenMs = mModel.seenMs();
    if (!mHaveBaseline) {
        mBaselineMs = mLastSeenMs;
        mHaveBaseline = true;
    }
    ++mReports;
    mGuardUntilMs = monotonicMs() + kReportGuardMs;
    return body;
}

void DeviceSimulator::writeCounters() {
    std::lock_guard<std::mutex> lock(mLock);
    if (monotonicMs() < mGuardUntilMs) {
        return;
    }
    if (!mModel.writeCounters(mTree.get())) {
        fprintf(stderr, "kelvo-sim: cannot rewrite the counter files: %s\n", strerror(errno));
    }
}

void DeviceSimulator::apply(const Scenario::Step& step) {
    int64_t t = mStartMs + step.atMs;
    int result = 0;
    switch (step.action) {
        case Scenario::Action::Load: {
            std::lock_guard<std::mutex> lock(mLock);
            mModel.setLoad(step.pid, step.cluster, step.percent, step.frequency);
            mBattery->setLoad(step.pid, step.cluster, step.percent);
            return;
        }
        case Scenario::Action::Charger: {
            PlatformState::Battery battery = mServices->state()->battery();
            battery.acOnline = step.text == "ac";
            battery.usbOnline = step.text == "usb";
            battery.wirelessOnline = step.text == "wireless";
            mBattery->setCharger(step.text != "off");
            pushBattery(battery);
            return;
        }
        case Scenario::Action::System: {
            // The sensors' truth follows the sleep the records tell.
            std::lock_guard<std::mutex> lock(mLock);
            const std::string& record = step.text;
            if (record.rfind("KELVO_TAG_KERNEL_SUSPEND\n", 0) == 0) {
                mRadioSensors->suspend(step.atMs);
            } else if (record.rfind("KELVO_TAG_KERNEL_WAKEUP\n", 0) == 0) {
                mRadioSensors->wakeup(step.atMs);
            } else if (record.rfind("KELVO_TAG_KERNEL_RESUME\n", 0) == 0) {
                mRadioSensors->resume(step.atMs);
            }
        }
            result = mSystem->write(*mLogWriter, step.text, t);
            break;
        case Scenario::Action::Wifi: {
            std::string tag;
            std::string text;
            WifiRecords::record(step, &tag, &text);
            result = mLogWriter->write(LogWriter::PRIORITY_INFO, tag.c_str(), text.c_str(), t);
            break;
        }
        case Scenario::Action::Traffic:
        case Scenario::Action::SystemTraffic: {
            std::lock_guard<std::mutex> lock(mLock);
            mTraffic->apply(step);
            if (!mTraffic->write()) {
                fprintf(stderr, "kelvo-sim: cannot rewrite the traffic files: %s\n",
                        strerror(errno));
            }
            return;
        }
        case Scenario::Action::Gpu: {
            // Residency the daemon reads from the kernel driver: no record.
            std::lock_guard<std::mutex> lock(mLock);
            if (mDriver) {
                mGpu->apply(step, *mDriver);
            }
            return;
        }
        case Scenario::Action::Dpm:
        case Scenario::Action::Ddr: {
            // Counters the daemon reads from the power monitor: no record.
            std::lock_guard<std::mutex> lock(mLock);
            if (mDriver) {
                mDpm->apply(step, *mDriver);
            }
            return;
        }
        case Scenario::Action::Modem:
            // Residency the daemon asks the modem for: no record.
            mModem->apply(step);
            return;
        case Scenario::Action::Battery: {
            mBattery->setLevel(step.value);
            pushBattery(mServices->state()->battery());
            return;
        }
        case Scenario::Action::HeldWakelock:
            // What the power-management application writes when it finds
            // a wakelock held too long.
            result = mLogWriter->write(LogWriter::PRIORITY_INFO, "KELVO_TAG_PM_POWER_CONTROL",
                                       ("type=21 package=" + step.text + " reason=" + step.tag +
                                        "#held count=" + std::to_string(step.value))
                                           .c_str(),
                                       t);
            break;
        case Scenario::Action::Audio: {
            std::string tag;
            std::string text;
            bool record = false;
            {
                std::lock_guard<std::mutex> lock(mLock);
                mAudio->advanceTo(mModelMs);
                record = mAudio->apply(step, &tag, &text);
            }
            if (!record) {
                // The amplifiers' next answer to the audio handler.
                mServices->state()->setAudioParameter("getSmartPAPOWER", text);
                return;
            }
            result = mLogWriter->write(LogWriter::PRIORITY_INFO, tag.c_str(), text.c_str(), t);
            break;
        }
        default: {
            // Display, GNSS and flashlight: a log-device record each.
            ComponentTruth::Record record;
            {
                std::lock_guard<std::mutex> lock(mLock);
                bool camera = false;
                if (!mRadioSensors->apply(step, step.atMs, &record.tag, &record.text) &&
                    !(camera = mCameras->apply(step, step.atMs, &record.tag, &record.text)) &&
                    !mComponents->apply(step, &record)) {
                    return;
                }
                if (camera && !mCameras->flashlightUser().empty()) {
                    mComponents->learnTorchUser(step.atMs, mCameras->flashlightUser());
                }
                mBattery->setScreen(mComponents->screenOn());
            }
            result = mLogWriter->write(LogWriter::PRIORITY_INFO, record.tag.c_str(),
                                       record.text.c_str(), t);
            break;
        }
    }
    ++mLogWritten;
    if (result != 0) {
        // No reader on the device, or its queue stayed full.
        ++mLogUnread;
    }
}

void DeviceSimulator::pushBattery(PlatformState::Battery battery) {
    // The daemon reads the gauge when it hears of the change: the files
    // hold the new state first.
    if (!mBattery->writeFiles()) {
        fprintf(stderr, "kelvo-sim: cannot rewrite the battery files: %s\n", strerror(errno));
    }
    battery.level = mBattery->level();
    mServices->state()->setBattery(battery);
}

void DeviceSimulator::advanceTo(int64_t ms) {
    bool levelChanged = false;
    {
        std::lock_guard<std::mutex> lock(mLock);
        mModel.advance(ms - mModelMs);
        if (mSystem) {
            mSystem->advance(ms - mModelMs);
        }
        levelChanged = mBattery->advance(ms - mModelMs);
        mModelMs = ms;
    }
    if (mModem) {
        mModem->advanceTo(ms);
    }
    if (levelChanged) {
        pushBattery(mServices->state()->battery());
    } else if (!mBattery->writeFiles()) {
        fprintf(stderr, "kelvo-sim: cannot rewrite the battery files: %s\n", strerror(errno));
    }
}

int32_t DeviceSimulator::hourlyRoundsFinished() const {
    // Each finished round leaves a debug_hourly_tick row (flushed at once).
    sqlite3* db = nullptr;
    int32_t count = -1;
    std::string path = SimReport::databasePath(mOptions.root);
    if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
        sqlite3_busy_timeout(db, 50);
        sqlite3_stmt* stmt = nullptr;
        if (sqlite3_prepare_v2(db, "SELECT COUNT(*) FROM debug_hourly_tick", -1, &stmt, nullptr) ==
                SQLITE_OK &&
            sqlite3_step(stmt) == SQLITE_ROW) {
            count = sqlite3_column_int(stmt, 0);
        }
        sqlite3_finalize(stmt);
    }
    sqlite3_close(db);
    return count;
}

void DeviceSimulator::updatePhase(int64_t elapsedMs) {
    int32_t finished = hourlyRoundsFinished();
    if (elapsedMs >= mNextHourMs) {
        // A round opens at every full hour; it is over once its row is in
        // debug_hourly_tick (or after the longest round).
        mPhase = Phase::HourlyRound;
        mRoundStartMs = elapsedMs;
        mNextHourMs += kHourMs;
        showProgress(elapsedMs, false);
    }
    if (mPhase == Phase::HourlyRound &&
        (finished > mRoundsBefore || elapsedMs - mRoundStartMs > kLongestRoundMs)) {
        mPhase = Phase::Load;
    }
    if (mPhase != Phase::HourlyRound && finished >= 0) {
        mRoundsBefore = finished;
    }
}

void DeviceSimulator::showProgress(int64_t elapsedMs, bool last) {
    if (!mOptions.progress) {
        return;
    }
    static int64_t sLastLine = -1;
    static Phase sLastPhase = Phase::Start;
    bool tty = isatty(STDERR_FILENO) != 0;
    int64_t second = elapsedMs / 1000;
    // Without a terminal: a line every 10 s and at every change of phase.
    if (!tty && !last && second / 10 == sLastLine && mPhase == sLastPhase) {
        return;
    }
    sLastLine = second / 10;
    sLastPhase = mPhase;
    time_t simulated = static_cast<time_t>(simulatedNowMs() / 1000);
    struct tm parts;
    localtime_r(&simulated, &parts);
    char clock[16];
    strftime(clock, sizeof(clock), "%H:%M:%S", &parts);
    fprintf(stderr, "%s[%3" PRId64 "s / %3" PRId64 "s] %s  phase: %-12s reports: %d%s",
            tty ? "\r" : "", second, mScenario.durationMs() / 1000, clock,
            phaseName(static_cast<int>(mPhase)), mReports.load(), tty && !last ? "" : "\n");
    fflush(stderr);
}

bool DeviceSimulator::play() {
    const std::vector<Scenario::Step>& steps = mScenario.steps();
    size_t next = 0;
    int64_t tick = mScenario.tickMs();
    int64_t begin = monotonicMs();
    int64_t duration = mScenario.durationMs();
    mPhase = Phase::Load;
    while (mModelMs < duration) {
        int64_t target = std::min(mModelMs + tick, duration);
        sleepMs(begin + target - monotonicMs());
        if (sStop) {
            mError = "interrupted";
            return false;
        }
        if (!mDaemon.running()) {
            mError = "the daemon ended during the run; see " + mLogPath;
            return false;
        }
        // Steps take effect at their own time, so the load given is exact
        // whatever the loop's jitter.
        while (next < steps.size() && steps[next].atMs <= target) {
            advanceTo(steps[next].atMs);
            apply(steps[next]);
            ++next;
        }
        advanceTo(target);
        writeCounters();
        if (mOptions.idleFigures && mSwitchesAtStart < 0 && target >= kIdleSettleMs) {
            mRssKb = residentKb(mDaemon.pid());
            mSwitchesAtStart = contextSwitches(mDaemon.pid());
            mSwitchesAtStartMs = monotonicMs();
        }
        updatePhase(target);
        showProgress(target, false);
    }
    while (next < steps.size()) {
        apply(steps[next++]);
    }
    return true;
}

void DeviceSimulator::stopAll() {
    if (mSystem) {
        mSystem->stop();
    }
    if (mThermal) {
        mThermal->stop();
    }
    if (mReporter) {
        mReporter->stop();
    }
    if (mModem) {
        mModem->stop();
    }
    mDaemonStatus = mDaemon.stop(kStopGraceMs);
    if (mDriver) {
        mDriver->stop();
    }
    if (mServices) {
        mServices->stopAll();
    }
}

int DeviceSimulator::finish(bool completed) {
    int64_t switchesAtEnd = -1;
    int64_t endMono = monotonicMs();
    if (mOptions.idleFigures && mSwitchesAtStart >= 0 && mDaemon.running()) {
        switchesAtEnd = contextSwitches(mDaemon.pid());
    }
    int64_t endMs = simulatedNowMs();
    mPhase = Phase::Report;
    showProgress(mModelMs, true);
    stopAll();

    SimReport::Header header;
    header.scenario = mOptions.scenarioPath;
    header.timeZone = mScenario.timeZone();
    header.startMs = mStartMs;
    header.endMs = endMs;
    header.root = mOptions.root;
    header.daemonLog = mLogPath;
    header.daemonStatus = mDaemonStatus;
    header.interrupted = !completed;
    header.logRecordsWritten = mLogWritten;
    header.logRecordsUnread = mLogUnread;
    std::map<std::string, int64_t> truth;
    {
        std::lock_guard<std::mutex> lock(mLock);
        header.reportsAnswered = mReports;
        for (const auto& seen : mLastSeenMs) {
            truth[seen.first] = seen.second - mBaselineMs[seen.first];
        }
        // Without a report the daemon could account nothing: every truth is 0.
        for (const auto& name : mModel.nameUids()) {
            truth.emplace(name.first, 0);
        }
    }
    SimReport report(header, truth, mModel.nameUids());
    std::string components;
    std::string componentTable;
    {
        std::lock_guard<std::mutex> lock(mLock);
        mComponents->advanceTo(mModelMs);
        ComponentReport componentReport(*mComponents, SimReport::databasePath(mOptions.root),
                                        SimReport::eventsPath(mOptions.root));
        componentReport.build(&components);
        componentTable = componentReport.table();
        mAudio->advanceTo(mModelMs);
        components += mAudio->summary();
        mRadioSensors->advanceTo(mModelMs);
        for (const auto& [package, ms] : mAudio->bluetoothMs()) {
            mRadioSensors->setMedia(package, ms);
        }
        for (const auto& [package, figures] : mAudio->poweredTruth()) {
            mRadioSensors->setAudio(package, figures.ms, figures.energyNumerator / 1000.0);
        }
        components += mRadioSensors->report(SimReport::databasePath(mOptions.root));
        if (mScenario.audioPolicy() == 2) {
            components +=
                "  audio policy 2: the daemon rescales the audio energy to the amplifiers' "
                "answers (smartpa lines); the truth's energy is the profile's model\n";
        }
        components += mGpu->report(SimReport::databasePath(mOptions.root));
        mCameras->advanceTo(mModelMs);
        components += mCameras->report(SimReport::databasePath(mOptions.root));
        components += mDpm->report(SimReport::databasePath(mOptions.root),
                                   SimReport::eventsPath(mOptions.root));
    }
    report.addSection(components);
    BatteryReport::Model battery;
    battery.capacityMah = mScenario.battery().capacityMah;
    battery.startLevel = mScenario.battery().startLevel;
    battery.endLevel = mBattery ? mBattery->level() : battery.startLevel;
    battery.drawnMah = mBattery ? mBattery->drawnMah() : 0;
    battery.chargedMah = mBattery ? mBattery->chargedMah() : 0;
    report.addSection(BatteryReport(SimReport::databasePath(mOptions.root),
                                    SimReport::eventsPath(mOptions.root), battery)
                          .build());
    report.addSection(
        ThermalReport(SimReport::databasePath(mOptions.root), SimReport::eventsPath(mOptions.root))
            .build());
    std::string text;
    bool readable = report.build(&text);
    fputs("\n", stdout);
    fputs(text.c_str(), stdout);
    std::ofstream(mOptions.root + "/sim/summary.txt") << text;
    std::ofstream(mOptions.root + "/sim/truth.tsv") << report.truthTable();
    std::ofstream(mOptions.root + "/sim/components.tsv") << componentTable;
    if (mTraffic) {
        mTraffic->setEnergyTruth(wifiEnergyTruth(endMs - mStartMs), mWifiEnergyHeading);
        std::string traffic = mTraffic->summary(SimReport::databasePath(mOptions.root));
        fputs(traffic.c_str(), stdout);
        std::ofstream(mOptions.root + "/sim/summary.txt", std::ios::app) << traffic;
        std::ofstream(mOptions.root + "/sim/traffic-truth.tsv") << mTraffic->truthTable();
    }
    if (mModem) {
        std::string modem = modemReport(endMs - mStartMs);
        fputs(modem.c_str(), stdout);
        std::ofstream(mOptions.root + "/sim/summary.txt", std::ios::app) << modem;
    }
    if (!mError.empty()) {
        fprintf(stderr, "kelvo-sim: %s\n", mError.c_str());
    }
    if (mOptions.idleFigures) {
        if (switchesAtEnd >= 0 && endMono > mSwitchesAtStartMs) {
            fprintf(stderr,
                    "kelvo-sim: %" PRId64 " context switches of the daemon in %" PRId64 " ms\n",
                    switchesAtEnd - mSwitchesAtStart, endMono - mSwitchesAtStartMs);
            printf("daemon_idle_rss_kb %" PRId64 "\n", mRssKb);
            printf("daemon_idle_wakeups_per_min %.1f\n",
                   static_cast<double>(switchesAtEnd - mSwitchesAtStart) * 60000.0 /
                       static_cast<double>(endMono - mSwitchesAtStartMs));
        } else {
            fprintf(stderr, "kelvo-sim: the idle figures need a run longer than %" PRId64 " s\n",
                    kIdleSettleMs / 1000);
            readable = false;
        }
    }
    if (!completed) {
        return sStop ? 130 : 1;
    }
    return readable && mDaemonStatus == 0 ? 0 : 1;
}

int DeviceSimulator::run() {
    std::string error;
    setenv("TZ", mScenario.timeZone().c_str(), 1);
    tzset();
    // The offset that puts the daemon's clock at the scenario's time of day,
    // today in the scenario's zone.
    int64_t now = realtimeMs();
    time_t seconds = static_cast<time_t>(now / 1000);
    struct tm parts;
    localtime_r(&seconds, &parts);
    parts.tm_hour = mScenario.startSecondOfDay() / 3600;
    parts.tm_min = mScenario.startSecondOfDay() / 60 % 60;
    parts.tm_sec = mScenario.startSecondOfDay() % 60;
    parts.tm_isdst = -1;
    mStartMs = static_cast<int64_t>(mktime(&parts)) * 1000;
    mOffsetMs = mStartMs - now;

    showProgress(0, false);
    if (!prepareRoot(&error) || !startServices(&error) || !startDaemon(&error) ||
        !waitDaemonReady(&error)) {
        fprintf(stderr, "\nkelvo-sim: %s\n", error.c_str());
        stopAll();
        if (error == "interrupted") {
            return 130;
        }
        return 1;
    }
    mSystem->startService(mOffsetMs);
    mThermal.reset(new ThermalScene(mScenario.pelmora()));
    mThermal->start();
    // The steps count from here, once the daemon is up.
    mStartMs = simulatedNowMs();
    mNextHourMs = (mStartMs / kHourMs + 1) * kHourMs - mStartMs;
    bool completed = play();
    return finish(completed);
}

}  // namespace sim
}  // namespace kelvo

namespace kelvo {
namespace sim {

WifiEnergyTruth::Result DeviceSimulator::wifiEnergyTruth(int64_t endMs) {
    std::vector<int64_t> polls;
    WifiEnergyTruth::readPolls(SimReport::databasePath(mOptions.root), mStartMs, &polls);
    WifiEnergyTruth::Result truth =
        WifiEnergyTruth(mScenario, mWifiProfile).compute(polls, endMs);
    char text[512];
    snprintf(text, sizeof(text),
             "truth energy = the profile's Wi-Fi energy of the scenario's packets (traffic\n"
             "and scans; the hotspot on its own line), weighed\n%s (%d traffic batches).\n"
             "The daemon times the levels on its own clock as it\n"
             "reads the records, a few ms after the scenario: the two differ by about that.\n",
             truth.perPoll ? "at the daemon's polls (debug_data_polling) and its screen changes"
                           : "as one batch over the whole run (no poll times)",
             truth.batches);
    mWifiEnergyHeading = text;
    return truth;
}

}  // namespace sim
}  // namespace kelvo

namespace kelvo {
namespace sim {

std::string DeviceSimulator::modemReport(int64_t endMs) {
    std::vector<ModemModel::Sent> sent = mModem->sent();
    ModemTruth truth(mScenario, mModemProfile, mStartMs, endMs);
    truth.compute(sent);
    std::ofstream(mOptions.root + "/sim/modem-truth.tsv") << truth.table();
    return truth.report(SimReport::databasePath(mOptions.root), mModem->requests(), sent,
                        mModem->pending());
}

}  // namespace sim
}  // namespace kelvo
