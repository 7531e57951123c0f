#include "handlers/KernelWakelockReader.h"

#include <errno.h>
#include <inttypes.h>
#include <stdio.h>
#include <string.h>

#include <fstream>

#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

bool KernelWakelockReader::parseLine(const std::string& line, std::string* name, int64_t* count,
                                     int64_t* time) {
    size_t tab = line.find('\t');
    if (tab == std::string::npos || tab == 0) {
        return false;
    }
    size_t end = tab;
    while (end > 0 && (line[end - 1] == ' ' || line[end - 1] == '\t')) {
        --end;
    }
    if (end == 0 || end >= kNameSize) {
        return false;
    }
    name->assign(line, 0, end);
    long long c = -1;
    long long t = -1;
    if (sscanf(line.c_str() + tab, "%lld %*s %*s %*s %*s %lld", &c, &t) != 2 || c < 0 || t < 0 ||
        c > INT32_MAX) {
        return false;
    }
    *count = c;
    *time = t;
    return true;
}

int32_t KernelWakelockReader::read(const std::string& path, std::vector<increment>* out) {
    std::ifstream in(path);
    if (!in.is_open()) {
        // The caller logs it: a missing table repeats at every poll.
        return -14;
    }
    std::string line;
    if (!std::getline(in, line)) {
        KLOGE("Failed to parse kernel wakelock title");
        return -10;
    }
    // The reading, names summed.
    std::map<std::string, sample> reading;
    size_t lines = 0;
    size_t skipped = 0;
    while (std::getline(in, line)) {
        if (++lines > kMaxLines) {
            KLOGE("Too many wakeup sources, rest discarded: %zu", kMaxLines);
            HealthCounters::add(Health::SystemReadingsRefused);
            break;
        }
        if (line.find("Active resource:") != std::string::npos) {
            break;
        }
        std::string name;
        int64_t count = 0;
        int64_t time = 0;
        if (!parseLine(line, &name, &count, &time)) {
            ++skipped;
            continue;
        }
        if (name == "deleted") {
            break;
        }
        sample& s = reading[name];
        s.count += count;
        s.time += time;
    }
    if (skipped > 0) {
        KLOGE("Skipped %zu kernel wakelock lines", skipped);
        HealthCounters::add(Health::SystemReadingsRefused, skipped);
    }
    for (auto& entry : mBaseline) {
        entry.second.seen = false;
    }
    size_t refused = 0;
    for (const auto& entry : reading) {
        const sample& now = entry.second;
        auto it = mBaseline.find(entry.first);
        if (it == mBaseline.end()) {
            if (now.time < kMinIncrementMs) {
                continue;
            }
            if (mBaseline.size() >= kMaxKeys) {
                ++refused;
                continue;
            }
            mBaseline[entry.first] = {now.count, now.time, true};
            out->push_back({entry.first, static_cast<int32_t>(now.count), now.time});
            continue;
        }
        sample& base = it->second;
        base.seen = true;
        if (now.count < base.count || now.time < base.time) {
            // Registered again: counting starts over from this reading.
            base.count = now.count;
            base.time = now.time;
            continue;
        }
        if (now.time - base.time >= kMinIncrementMs) {
            out->push_back(
                {entry.first, static_cast<int32_t>(now.count - base.count), now.time - base.time});
            base.count = now.count;
            base.time = now.time;
        }
    }
    if (refused > 0) {
        KLOGE("Kernel wakelock baseline full, %zu sources not followed", refused);
        HealthCounters::add(Health::SystemReadingsRefused, refused);
    }
    return 0;
}

void KernelWakelockReader::prune() {
    for (auto it = mBaseline.begin(); it != mBaseline.end();) {
        it = it->second.seen ? std::next(it) : mBaseline.erase(it);
    }
}

}  // namespace kelvo
