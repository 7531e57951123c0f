#include "Scenario.h"

#include <errno.h>
#include <stdlib.h>

#include <algorithm>
#include <fstream>
#include <set>
#include <sstream>

#include "AudioModel.h"
#include "CameraTruth.h"
#include "CpuTree.h"
#include "GpuLoadTruth.h"
#include "DpmActivity.h"
#include "ModemModel.h"
#include "RadioSensorTruth.h"
#include "SystemScene.h"
#include "TrafficModel.h"
#include "WifiRecords.h"

namespace kelvo {
namespace sim {

namespace {

// The longest run a scenario may ask for: one day.
constexpr int64_t kMaxDurationMs = 24LL * 3600 * 1000;

bool parseInt(const std::string& text, int64_t low, int64_t high, int64_t* out) {
    if (text.empty()) {
        return false;
    }
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(text.c_str(), &end, 10);
    if (errno != 0 || *end != '\0' || value < low || value > high) {
        return false;
    }
    *out = value;
    return true;
}

bool parseInt32(const std::string& text, int64_t low, int64_t high, int32_t* out) {
    int64_t value = 0;
    if (!parseInt(text, low, high, &value)) {
        return false;
    }
    *out = static_cast<int32_t>(value);
    return true;
}

// "90", "1:30" or "1:02:03" (hours, minutes, seconds) from the start, with an
// optional fraction of a second ("12.5").
bool parseOffset(const std::string& text, int64_t* ms) {
    std::string whole = text;
    int64_t fraction = 0;
    size_t dot = text.find('.');
    if (dot != std::string::npos) {
        std::string digits = text.substr(dot + 1);
        if (digits.empty() || digits.size() > 3 ||
            digits.find_first_not_of("0123456789") != std::string::npos) {
            return false;
        }
        while (digits.size() < 3) {
            digits += '0';
        }
        fraction = atoi(digits.c_str());
        whole = text.substr(0, dot);
    }
    std::vector<std::string> parts;
    std::stringstream in(whole);
    std::string part;
    while (std::getline(in, part, ':')) {
        parts.push_back(part);
    }
    if (parts.empty() || parts.size() > 3 || whole.back() == ':') {
        return false;
    }
    int64_t seconds = 0;
    for (size_t i = 0; i < parts.size(); ++i) {
        int64_t value = 0;
        int64_t high = i == 0 ? kMaxDurationMs / 1000 : 59;
        if (parts[i].find_first_not_of("0123456789") != std::string::npos ||
            !parseInt(parts[i], 0, high, &value)) {
            return false;
        }
        seconds = seconds * 60 + value;
    }
    *ms = seconds * 1000 + fraction;
    return *ms <= kMaxDurationMs;
}

bool isName(const std::string& text) {
    if (text.empty() || text.size() > 47) {
        return false;
    }
    for (char c : text) {
        if (c <= ' ' || c > '~') {
            return false;
        }
    }
    return true;
}

std::vector<std::string> splitList(const std::string& text) {
    std::vector<std::string> items;
    std::stringstream in(text);
    std::string item;
    while (std::getline(in, item, ',')) {
        items.push_back(item);
    }
    return items;
}

}  // namespace

const std::vector<int32_t>& Scenario::clusterFrequencies(int32_t cluster) {
    static const std::vector<CpuTree::Cluster> kClusters = CpuTree::phoneClusters();
    return kClusters[cluster == 0 ? 0 : 1].frequencies;
}

int32_t Scenario::clusterCores(int32_t cluster) {
    static const std::vector<CpuTree::Cluster> kClusters = CpuTree::phoneClusters();
    return static_cast<int32_t>(kClusters[cluster == 0 ? 0 : 1].cores.size());
}

const Scenario::App* Scenario::findApp(int32_t uid) const {
    for (const App& app : mApps) {
        if (app.uid == uid) {
            return &app;
        }
    }
    return nullptr;
}

const Scenario::Process* Scenario::findProcess(int32_t pid) const {
    for (const Process& process : mProcesses) {
        if (process.pid == pid) {
            return &process;
        }
    }
    return nullptr;
}

bool Scenario::load(const std::string& path, std::string* error) {
    std::ifstream in(path);
    if (!in) {
        *error = path + ": cannot be read";
        return false;
    }
    std::stringstream text;
    text << in.rdbuf();
    return parse(text.str(), path, error);
}

bool Scenario::parse(const std::string& text, const std::string& name, std::string* error) {
    *this = Scenario();
    std::stringstream in(text);
    std::string line;
    std::string reason;
    while (std::getline(in, line)) {
        ++mLine;
        size_t hash = line.find('#');
        if (hash != std::string::npos) {
            line.erase(hash);
        }
        std::vector<std::string> words;
        std::stringstream split(line);
        std::string word;
        while (split >> word) {
            words.push_back(word);
        }
        if (!words.empty() && !parseLine(words, &reason)) {
            *error = name + ":" + std::to_string(mLine) + ": " + reason;
            *this = Scenario();
            return false;
        }
    }
    int32_t at = mLine;
    if (!check(&reason, &at)) {
        *error = name + ":" + std::to_string(at) + ": " + reason;
        *this = Scenario();
        return false;
    }
    std::stable_sort(mSteps.begin(), mSteps.end(),
                     [](const Step& a, const Step& b) { return a.atMs < b.atMs; });
    return true;
}

bool Scenario::parseLine(const std::vector<std::string>& words, std::string* reason) {
    const std::string& verb = words[0];
    if (verb == "at") {
        int64_t atMs = 0;
        if (words.size() < 3 || !parseOffset(words[1], &atMs)) {
            *reason = "expected \"at <time> <verb> ...\" with a time like 90, 1:30 or 1:30.5";
            return false;
        }
        return parseTimed(atMs, std::vector<std::string>(words.begin() + 2, words.end()), reason);
    }
    if (verb == "start") {
        int32_t h = 0, m = 0, s = 0;
        char extra = 0;
        if (words.size() != 2 ||
            sscanf(words[1].c_str(), "%2d:%2d:%2d%c", &h, &m, &s, &extra) != 3 || h < 0 || h > 23 ||
            m < 0 || m > 59 || s < 0 || s > 59) {
            *reason = "expected \"start HH:MM:SS\" (time of day)";
            return false;
        }
        mStartSecondOfDay = h * 3600 + m * 60 + s;
        return true;
    }
    if (verb == "timezone") {
        if (words.size() != 2 || words[1].find_first_of("/.") == 0 ||
            words[1].find("..") != std::string::npos) {
            *reason = "expected \"timezone <zone>\", for example UTC or Europe/Paris";
            return false;
        }
        mTimeZone = words[1];
        return true;
    }
    if (verb == "duration") {
        if (words.size() != 2 || !parseOffset(words[1], &mDurationMs) || mDurationMs < 1000) {
            *reason = "expected \"duration <time>\" of at least 1 second and at most 24 hours";
            return false;
        }
        return true;
    }
    if (verb == "tick") {
        if (words.size() != 2 || !parseInt32(words[1], 100, 10000, &mTickMs)) {
            *reason = "expected \"tick <ms>\" between 100 and 10000";
            return false;
        }
        return true;
    }
    if (verb == "app") {
        App app;
        if (words.size() != 3 || !parseInt32(words[1], 0, 0x7FFFFFFF, &app.uid)) {
            *reason = "expected \"app <uid> <package>[,<package>...]\"";
            return false;
        }
        if (findApp(app.uid) != nullptr) {
            *reason = "uid " + words[1] + " is declared twice";
            return false;
        }
        for (const std::string& package : splitList(words[2])) {
            if (!isName(package)) {
                *reason = "bad package name \"" + package + "\" (1 to 47 visible characters)";
                return false;
            }
            app.packages.push_back(package);
        }
        if (app.packages.empty()) {
            *reason = "an app needs at least one package";
            return false;
        }
        mApps.push_back(app);
        return true;
    }
    if (verb == "process" || verb == "kthread") {
        Process process;
        process.nameType = verb == "kthread" ? 2 : 1;
        if ((words.size() != 4 && !(verb == "process" && words.size() == 5)) ||
            !parseInt32(words[1], 1, 0x7FFFFFFF, &process.pid) ||
            !parseInt32(words[2], 0, 0x7FFFFFFF, &process.uid) || !isName(words[3])) {
            *reason = verb == "process" ? "expected \"process <pid> <uid> <name> [<package>]\""
                                        : "expected \"kthread <pid> <uid> <name>\"";
            return false;
        }
        process.name = words[3];
        if (words.size() == 5) {
            if (!isName(words[4])) {
                *reason = "bad package name \"" + words[4] + "\"";
                return false;
            }
            process.package = words[4];
        }
        if (findProcess(process.pid) != nullptr) {
            *reason = "pid " + words[1] + " is declared twice";
            return false;
        }
        mProcesses.push_back(process);
        return true;
    }
    if (verb == "battery-model") {
        return BatteryModel::parse(words, &mBattery, reason);
    }
    if (verb == "audio-policy") {
        if (words.size() != 2 || !parseInt32(words[1], 1, 2, &mAudioPolicy)) {
            *reason = "expected \"audio-policy 1|2\"";
            return false;
        }
        return true;
    }
    if (int pelmora = ThermalScene::parseLine(words, &mPelmora, reason)) {
        return pelmora > 0;
    }
    *reason = "unknown verb \"" + verb + "\"";
    return false;
}

bool Scenario::parseTimed(int64_t atMs, const std::vector<std::string>& words, std::string* reason) {
    Step step;
    step.atMs = atMs;
    step.line = mLine;
    const std::string& verb = words[0];
    if (verb == "load") {
        step.action = Action::Load;
        if ((words.size() != 4 && words.size() != 5) ||
            !parseInt32(words[1], 1, 0x7FFFFFFF, &step.pid) ||
            !parseInt32(words[2], 0, kClusterCount - 1, &step.cluster) || words[3].empty() ||
            words[3].back() != '%' ||
            !parseInt32(words[3].substr(0, words[3].size() - 1), 0,
                        100 * clusterCores(step.cluster), &step.percent) ||
            (words.size() == 5 && !parseInt32(words[4], 1, 0x7FFFFFFF, &step.frequency))) {
            *reason =
                "expected \"at <time> load <pid> <cluster 0|1> <percent>% [<kHz>]\" "
                "with a percent of one core, at most 100 x the cluster's cores";
            return false;
        }
    } else if (verb == "foreground") {
        step.action = Action::Foreground;
        if (words.size() != 2 || !isName(words[1])) {
            *reason = "expected \"at <time> foreground <package>\"";
            return false;
        }
        step.text = words[1];
    } else if (verb == "screen") {
        step.action = Action::Screen;
        if (words.size() != 2 || (words[1] != "on" && words[1] != "off")) {
            *reason = "expected \"at <time> screen on|off\"";
            return false;
        }
        step.flag = words[1] == "on";
    } else if (verb == "charger") {
        step.action = Action::Charger;
        static const std::set<std::string> kKinds = {"ac", "usb", "wireless", "off"};
        if (words.size() != 2 || kKinds.count(words[1]) == 0) {
            *reason = "expected \"at <time> charger ac|usb|wireless|off\"";
            return false;
        }
        step.text = words[1];
    } else if (verb == "battery") {
        step.action = Action::Battery;
        if (words.size() != 2 || words[1].empty() || words[1].back() != '%' ||
            !parseInt32(words[1].substr(0, words[1].size() - 1), 0, 100, &step.value)) {
            *reason = "expected \"at <time> battery <level 0..100>%\"";
            return false;
        }
    } else if (verb == "held-wakelock") {
        step.action = Action::HeldWakelock;
        int64_t heldMs = 0;
        if (words.size() != 4 || !isName(words[1]) || !isName(words[2]) ||
            !parseOffset(words[3], &heldMs) || heldMs < 1 || heldMs > 0x7FFFFFFF) {
            *reason = "expected \"at <time> held-wakelock <package> <tag> <time held>\"";
            return false;
        }
        step.text = words[1];
        step.tag = words[2];
        step.value = static_cast<int32_t>(heldMs);
    } else if (verb == "traffic" || verb == "systraffic") {
        if (!TrafficModel::parseStep(words, &step, reason)) {
            return false;
        }
    } else if (verb == "wifi") {
        if (!WifiRecords::parseStep(words, &step, reason)) {
            return false;
        }
    } else if (int32_t modem = ModemModel::parseStep(words, &step, reason)) {
        if (modem < 0) {
            return false;
        }
    } else if (int system = SystemScene::parseStep(words, &step.text, reason)) {
        if (system < 0) {
            return false;
        }
        step.action = Action::System;
    } else if (int thermal = ThermalScene::parseStep(words, &step.text, reason)) {
        if (thermal < 0) {
            return false;
        }
        step.action = Action::System;
    } else if (AudioModel::isVerb(words[0])) {
        if (!AudioModel::parseStep(words, &step, reason)) {
            return false;
        }
    } else if (!parseComponentStep(words, &step, reason)) {
        return false;
    }
    mSteps.push_back(step);
    return true;
}

// The display's, GNSS's and flashlight's verbs (ComponentTruth plays them).
bool Scenario::parseComponentStep(const std::vector<std::string>& words, Step* step,
                                  std::string* reason) {
    const std::string& verb = words[0];
    if (verb == "brightness") {
        step->action = Action::Brightness;
        if (words.size() != 2 || !parseInt32(words[1], 0, 255, &step->value)) {
            *reason = "expected \"at <time> brightness <level 0..255>\"";
            return false;
        }
    } else if (verb == "ambient") {
        step->action = Action::Ambient;
        static const std::vector<std::string> kTypes = {"auto", "manual", "app", "front"};
        auto type =
            words.size() == 8 ? std::find(kTypes.begin(), kTypes.end(), words[1]) : kTypes.end();
        step->value = static_cast<int32_t>(type - kTypes.begin());
        for (size_t i = 2; type != kTypes.end() && i < words.size(); ++i) {
            int32_t ms = 0;
            if (!parseInt32(words[i], 0, 0x7FFFFFFF, &ms)) {
                break;
            }
            step->values.push_back(ms);
        }
        if (step->values.size() != 6) {
            *reason =
                "expected \"at <time> ambient auto|manual|app|front <ms> <ms> <ms> <ms> <ms> "
                "<ms>\" (the time at each of the six ambient levels)";
            return false;
        }
    } else if (verb == "gnss") {
        step->action = Action::Gnss;
        if (words.size() != 3 || (words[1] != "start" && words[1] != "stop") || !isName(words[2])) {
            *reason = "expected \"at <time> gnss start|stop <package>\"";
            return false;
        }
        step->flag = words[1] == "start";
        step->text = words[2];
    } else if (verb == "flashlight") {
        step->action = Action::Flashlight;
        if (words.size() != 2 || (words[1] != "on" && words[1] != "off")) {
            *reason = "expected \"at <time> flashlight on|off\"";
            return false;
        }
        step->flag = words[1] == "on";
    } else if (verb == "torch") {
        step->action = Action::Torch;
        if (words.size() != 2 || !parseInt32(words[1], 1, 0x7FFFFFFF, &step->pid)) {
            *reason = "expected \"at <time> torch <pid>\"";
            return false;
        }
    } else if (int32_t parsed = RadioSensorTruth::parseStep(words, step, reason); parsed <= 0) {
        if (parsed == 0 && (parsed = CameraTruth::parseStep(words, step, reason)) > 0) {
            return true;
        }
        if (parsed == 0) {
            parsed = GpuLoadTruth::parseStep(words, step, reason);
        }
        if (parsed == 0) {
            parsed = DpmActivity::parseStep(words, step, reason);
        }
        if (parsed == 1) {
            return true;
        }
        if (parsed == 0) {
            *reason = "unknown verb \"" + verb + "\"";
        }
        return false;
    }
    return true;
}

bool Scenario::check(std::string* reason, int32_t* line) {
    if (mStartSecondOfDay < 0) {
        *reason = "the scenario has no \"start HH:MM:SS\" line";
        return false;
    }
    if (mDurationMs < 0) {
        *reason = "the scenario has no \"duration <time>\" line";
        return false;
    }
    for (const Process& process : mProcesses) {
        if (!process.package.empty()) {
            const App* app = findApp(process.uid);
            if (app == nullptr || std::find(app->packages.begin(), app->packages.end(),
                                            process.package) == app->packages.end()) {
                *reason = "process " + std::to_string(process.pid) + " runs package " +
                          process.package + ", which uid " + std::to_string(process.uid) +
                          " does not have";
                return false;
            }
        }
    }
    for (const Step& step : mSteps) {
        *line = step.line;
        if (step.atMs > mDurationMs) {
            *reason = "this step comes after the end of the scenario";
            return false;
        }
        if (!TrafficModel::checkStep(*this, step, reason)) {
            return false;
        }
        if (step.action == Action::Load && findProcess(step.pid) == nullptr) {
            *reason = "pid " + std::to_string(step.pid) + " is not declared";
            return false;
        }
        if (step.action == Action::Load && step.frequency != 0) {
            const std::vector<int32_t>& steps = clusterFrequencies(step.cluster);
            if (std::find(steps.begin(), steps.end(), step.frequency) == steps.end()) {
                *reason = "cluster " + std::to_string(step.cluster) + " has no step " +
                          std::to_string(step.frequency) + " kHz";
                return false;
            }
        }
        const bool requester = step.action == Action::Sensor ||
                               (step.action == Action::Camera && step.text == "connect") ||
                               (step.action == Action::Bluetooth && step.text == "discovery-start");
        if (requester && findProcess(step.pid) == nullptr) {
            *reason = "pid " + std::to_string(step.pid) + " is not declared";
            return false;
        }
        if (step.action == Action::Torch) {
            const Process* process = findProcess(step.pid);
            const App* app = process != nullptr ? findApp(process->uid) : nullptr;
            if (app == nullptr || app->packages.size() != 1) {
                *reason = "the torch user " + std::to_string(step.pid) +
                          " must be a declared process of an app with one package";
                return false;
            }
        }
        if (step.action == Action::Foreground || step.action == Action::Gnss ||
            step.action == Action::HeldWakelock) {
            bool known = step.action == Action::Foreground && step.text == "screen_off";
            for (const App& app : mApps) {
                known = known || std::find(app.packages.begin(), app.packages.end(), step.text) !=
                                     app.packages.end();
            }
            if (!known) {
                *reason = "no app has the package " + step.text;
                return false;
            }
        }
    }
    return true;
}

}  // namespace sim
}  // namespace kelvo
