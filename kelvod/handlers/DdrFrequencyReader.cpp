#include "handlers/DdrFrequencyReader.h"

#include <stdio.h>

#include <fstream>

#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

bool DdrFrequencyReader::parseLine(const std::string& line, int64_t* freq, int64_t* time) {
    if (line.size() < 2) {
        return false;
    }
    long long f = -1;
    int consumed = 0;
    if (sscanf(line.c_str() + 1, " %lld:%n", &f, &consumed) != 1 || consumed == 0 || f < 0) {
        return false;
    }
    size_t last = line.find_last_not_of(" \t\r");
    if (last == std::string::npos) {
        return false;
    }
    size_t start = line.find_last_of(" \t:", last);
    start = start == std::string::npos ? 0 : start + 1;
    long long t = -1;
    if (start <= static_cast<size_t>(consumed) || sscanf(line.c_str() + start, "%lld", &t) != 1 ||
        t < 0) {
        KLOGE("Failed to parse duration: %lld", f);
        return false;
    }
    *freq = f;
    *time = t;
    return true;
}

int32_t DdrFrequencyReader::countLevels(const std::string& path) {
    std::ifstream in(path);
    if (!in.is_open()) {
        return -14;
    }
    std::string line;
    int32_t levels = 0;
    while (std::getline(in, line) && levels < kMaxLevels) {
        int64_t freq = 0;
        int64_t time = 0;
        if (parseLine(line, &freq, &time)) {
            ++levels;
        }
    }
    KLOGD("Ddr frequency file line number: %d", levels);
    return levels;
}

int32_t DdrFrequencyReader::read(const std::string& path, bool baselineOnly,
                                 std::vector<std::pair<int64_t, int64_t>>* out) {
    std::ifstream in(path);
    if (!in.is_open()) {
        return -14;
    }
    std::string line;
    int32_t levels = 0;
    while (std::getline(in, line) && levels < kMaxLevels) {
        int64_t freq = 0;
        int64_t time = 0;
        if (!parseLine(line, &freq, &time)) {
            continue;
        }
        ++levels;
        auto it = mResidency.find(freq);
        if (it == mResidency.end()) {
            mResidency[freq] = time;
            if (!baselineOnly && time >= 1) {
                out->emplace_back(freq, time);
            }
            continue;
        }
        int64_t delta = time - it->second;
        it->second = time;
        if (!baselineOnly && delta >= 1) {
            out->emplace_back(freq, delta);
        }
    }
    return 0;
}

}  // namespace kelvo
