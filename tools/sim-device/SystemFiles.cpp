#include "SystemFiles.h"

#include <errno.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <sstream>

namespace kelvo {

namespace {

constexpr int64_t kLevelPeriodMs = 5000;

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

}  // namespace

SystemFiles::SystemFiles(std::string root)
    : mRoot(std::move(root)),
      mSources(phoneSources()),
      mLevels(phoneDdrLevels()),
      mLevelMs(mLevels.size(), 0) {}

std::vector<SystemFiles::Source> SystemFiles::phoneSources() {
    return {
        {"PowerManagerService.WakeLocks", 300, 4}, {"ipa_ws", 40, 2},     {"ipa_ws", 25, 1},
        {"qcom_rx_wakelock    ", 120, 3},          {"alarmtimer", 10, 1}, {"eventpoll", 2, 1},
    };
}

std::vector<int64_t> SystemFiles::phoneDdrLevels() {
    return {200000000, 400000000, 547000000, 768000000, 1017000000, 1333000000};
}

std::string SystemFiles::wakeupSourcesText(const std::vector<Source>& sources) {
    std::string text =
        "name\t\tactive_count\tevent_count\twakeup_count\texpire_count\tactive_since\t"
        "total_time\tmax_time\tlast_change\tprevent_suspend_time\n";
    char line[256];
    for (const Source& s : sources) {
        snprintf(line, sizeof(line), "%s\t%lld\t\t%lld\t\t0\t\t0\t\t0\t\t%lld\t\t%lld\t\t0\t\t0\n",
                 s.name.c_str(), static_cast<long long>(s.count), static_cast<long long>(s.count),
                 static_cast<long long>(s.totalMs),
                 static_cast<long long>(s.totalMs / (s.count > 0 ? s.count : 1)));
        text += line;
    }
    // What follows "deleted" is the kernel's summary of removed sources.
    text += "deleted\t0\t\t0\t\t0\t\t0\t\t0\t\t0\t\t0\t\t0\t\t0\n";
    text += "removed_source\t1\t\t1\t\t0\t\t0\t\t0\t\t99999\t\t0\t\t0\t\t0\n";
    return text;
}

std::string SystemFiles::transStatText(const std::vector<int64_t>& levels,
                                       const std::vector<int64_t>& timesMs, size_t current) {
    std::string text = "     From  :   To\n           :";
    for (int64_t level : levels) {
        text += " " + std::to_string(level);
    }
    text += "   time(ms)\n";
    for (size_t i = 0; i < levels.size(); ++i) {
        text += (i == current ? "*" : " ") + std::string("  ") + std::to_string(levels[i]) + ":";
        for (size_t j = 0; j < levels.size(); ++j) {
            text += "         " + std::to_string(i == j ? 0 : 1);
        }
        text += "    " + std::to_string(i < timesMs.size() ? timesMs[i] : 0) + "\n";
    }
    text += "Total transition : " + std::to_string(levels.size() * (levels.size() - 1)) + "\n";
    return text;
}

std::string SystemFiles::memInfoText(int64_t freeKb, int64_t availableKb) {
    char text[512];
    snprintf(text, sizeof(text),
             "MemTotal:        5824232 kB\nMemFree:         %8lld kB\nMemAvailable:    %8lld "
             "kB\nBuffers:           51200 kB\nCached:          1630208 kB\n",
             static_cast<long long>(freeKb), static_cast<long long>(availableKb));
    return text;
}

bool SystemFiles::writeFile(const std::string& relative, const std::string& text) const {
    const std::string path = mRoot + "/" + relative;
    if (!makeDirs(path.substr(0, path.find_last_of('/')))) {
        return false;
    }
    const std::string temporary = path + ".tmp";
    FILE* file = fopen(temporary.c_str(), "w");
    if (file == nullptr) {
        return false;
    }
    bool ok = fwrite(text.data(), 1, text.size(), file) == text.size();
    ok = fclose(file) == 0 && ok;
    return ok && rename(temporary.c_str(), path.c_str()) == 0;
}

bool SystemFiles::writeCounters() const {
    const size_t current = static_cast<size_t>(mElapsedMs / kLevelPeriodMs) % mLevels.size();
    return writeFile("proc/wakeup_sources", wakeupSourcesText(mSources)) &&
           writeFile("sys/class/devfreq/ddrfreq/trans_stat",
                     transStatText(mLevels, mLevelMs, current)) &&
           writeFile("proc/meminfo", memInfoText(mFreeKb, mAvailableKb));
}

bool SystemFiles::layout() {
    return writeFile("sys/class/tv_power/charger/charge_data/enable_hiz", "0\n") && writeCounters();
}

void SystemFiles::setMemory(int64_t freeKb, int64_t availableKb) {
    mFreeKb = freeKb;
    mAvailableKb = availableKb;
}

bool SystemFiles::advance(int64_t ms) {
    if (ms <= 0) {
        return true;
    }
    for (Source& s : mSources) {
        s.totalMs += s.msPerSecond * ms / 1000;
        const int64_t before = mElapsedMs / 10000;
        const int64_t after = (mElapsedMs + ms) / 10000;
        s.count += (after - before) * s.activations;
    }
    // The time goes to the level current before the step.
    int64_t left = ms;
    while (left > 0) {
        const size_t current = static_cast<size_t>(mElapsedMs / kLevelPeriodMs) % mLevels.size();
        const int64_t step = std::min(left, kLevelPeriodMs - mElapsedMs % kLevelPeriodMs);
        mLevelMs[current] += step;
        mElapsedMs += step;
        left -= step;
    }
    return writeCounters();
}

}  // namespace kelvo
