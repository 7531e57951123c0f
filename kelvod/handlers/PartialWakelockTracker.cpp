#include "handlers/PartialWakelockTracker.h"

#include <limits.h>
#include <stdio.h>
#include <string.h>

#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

namespace {

// The value after key up to " next" (or the end); npos start when absent.
bool valueOf(const std::string& text, const char* key, const char* next, std::string* out) {
    size_t start = text.find(key);
    if (start == std::string::npos) {
        return false;
    }
    start += strlen(key);
    size_t end = next != nullptr ? text.find(std::string(" ") + next, start) : std::string::npos;
    if (end == std::string::npos) {
        end = text.size();
    }
    // A value ending in a blank before the next key is cut there.
    out->assign(text, start, end - start);
    return true;
}

std::string nameOrNull(std::string value) {
    while (!value.empty() && value.back() == ' ') {
        value.pop_back();
    }
    if (value.empty()) {
        return "NULL";
    }
    if (value.size() >= PartialWakelockTracker::kNameSize) {
        value.resize(PartialWakelockTracker::kNameSize - 1);
        HealthCounters::add(Health::ValuesSaturated);
    }
    return value;
}

}  // namespace

int32_t PartialWakelockTracker::parse(const std::string& text, increment* out) {
    std::string value;
    long long uid = LLONG_MIN;
    if (!valueOf(text, "uid=", "prevent_time=", &value) ||
        sscanf(value.c_str(), "%lld", &uid) != 1 || uid < INT32_MIN || uid > INT32_MAX) {
        KLOGE("Failed to parse uid, ret: %d", -19);
        return -19;
    }
    long long held = -1;
    if (!valueOf(text, "prevent_time=", "ws_name=", &value) ||
        sscanf(value.c_str(), "%lld", &held) != 1 || held < 0) {
        KLOGE("Failed to parse prevent time, ret: %d", -19);
        return -19;
    }
    std::string name;
    std::string tag;
    if (!valueOf(text, "ws_name=", "tag=", &name)) {
        KLOGE("Failed to parse package name, ret: %d", -19);
        return -19;
    }
    valueOf(text, "tag=", nullptr, &tag);
    out->uid = static_cast<int32_t>(uid);
    out->duration = held;
    out->name = nameOrNull(name);
    out->tag = nameOrNull(tag);
    return 0;
}

int32_t PartialWakelockTracker::update(const std::vector<std::string>& texts,
                                       std::vector<increment>* out) {
    std::map<std::string, increment> reading;
    int32_t skipped = 0;
    for (const std::string& text : texts) {
        increment record;
        if (parse(text, &record) < 0) {
            ++skipped;
            continue;
        }
        std::string key = std::to_string(record.uid) + "_" + record.name + "_" + record.tag;
        auto it = reading.find(key);
        if (it == reading.end()) {
            reading.emplace(key, record);
        } else {
            it->second.duration += record.duration;
        }
    }
    if (skipped > 0) {
        HealthCounters::add(Health::SystemReadingsRefused, skipped);
    }
    for (auto& entry : mBaseline) {
        entry.second.seen = false;
    }
    const bool baselineOnly = mBaselineOnly;
    mBaselineOnly = false;
    size_t refused = 0;
    for (const auto& entry : reading) {
        const increment& now = entry.second;
        auto it = mBaseline.find(entry.first);
        if (it == mBaseline.end()) {
            if (!baselineOnly && now.duration < kMinIncrementMs) {
                continue;
            }
            if (mBaseline.size() >= kMaxKeys) {
                ++refused;
                continue;
            }
            mBaseline[entry.first] = {now.duration, true};
            if (!baselineOnly) {
                out->push_back(now);
            }
            continue;
        }
        counted& base = it->second;
        base.seen = true;
        if (now.duration < base.held) {
            base.held = now.duration;
            continue;
        }
        if (now.duration - base.held >= kMinIncrementMs) {
            increment inc = now;
            inc.duration = now.duration - base.held;
            base.held = now.duration;
            out->push_back(inc);
        }
    }
    if (refused > 0) {
        KLOGE("Partial wakelock baseline full, %zu keys not followed", refused);
        HealthCounters::add(Health::SystemReadingsRefused, refused);
    }
    return skipped;
}

void PartialWakelockTracker::prune() {
    for (auto it = mBaseline.begin(); it != mBaseline.end();) {
        it = it->second.seen ? std::next(it) : mBaseline.erase(it);
    }
}

}  // namespace kelvo
