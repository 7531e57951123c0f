#include "BatteryModel.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>

#include "CpuTree.h"

namespace kelvo {

namespace {

bool parseNumber(const std::string& text, int64_t low, int64_t high, int32_t* out) {
    if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos ||
        text.size() > 9) {
        return false;
    }
    int64_t value = atoll(text.c_str());
    if (value < low || value > high) {
        return false;
    }
    *out = static_cast<int32_t>(value);
    return true;
}

}  // namespace

bool BatteryModel::parse(const std::vector<std::string>& words, Config* out, std::string* reason) {
    Config config;
    const std::string usage =
        "expected \"battery-model <capacity mAh> <level>% [micro] [idle|screen|little|big|charge "
        "<mA>]...\" with a capacity of 100 to 100000 mAh and currents up to 20000 mA";
    if (words.size() < 3 || !parseNumber(words[1], 100, 100000, &config.capacityMah) ||
        words[2].empty() || words[2].back() != '%' ||
        !parseNumber(words[2].substr(0, words[2].size() - 1), 0, 100, &config.startLevel)) {
        *reason = usage;
        return false;
    }
    for (size_t i = 3; i < words.size(); ++i) {
        if (words[i] == "micro") {
            config.micro = true;
            continue;
        }
        int32_t* target = words[i] == "idle"     ? &config.idleMa
                          : words[i] == "screen" ? &config.screenMa
                          : words[i] == "little" ? &config.clusterMa[0]
                          : words[i] == "big"    ? &config.clusterMa[1]
                          : words[i] == "charge" ? &config.chargeMa
                                                 : nullptr;
        if (target == nullptr || i + 1 >= words.size() ||
            !parseNumber(words[i + 1], 0, 20000, target)) {
            *reason = usage;
            return false;
        }
        ++i;
    }
    *out = config;
    return true;
}

BatteryModel::BatteryModel(std::string root, const Config& config)
    : mRoot(std::move(root)),
      mConfig(config),
      mChargeMah(static_cast<double>(config.capacityMah) * config.startLevel / 100.0) {}

std::string BatteryModel::folder() const {
    return mConfig.micro ? "sys/class/power_supply/battery" : "sys/class/power_supply/Battery";
}

void BatteryModel::setLoad(int32_t pid, int32_t cluster, int32_t percent) {
    mLoads[{pid, cluster == 0 ? 0 : 1}] = percent;
}

void BatteryModel::setLevel(int32_t percent) {
    mChargeMah =
        static_cast<double>(mConfig.capacityMah) * std::min(std::max(percent, 0), 100) / 100.0;
}

double BatteryModel::currentMa() const {
    double load = mConfig.idleMa + (mScreenOn ? mConfig.screenMa : 0);
    for (const auto& entry : mLoads) {
        load += mConfig.clusterMa[entry.first.second] * entry.second / 100.0;
    }
    // The charger feeds the load first; a full battery takes nothing.
    if (mCharging) {
        return mChargeMah < mConfig.capacityMah ? mConfig.chargeMa - load : 0;
    }
    return -load;
}

int32_t BatteryModel::level() const {
    // Rounded, as gauges report it: a battery set to a whole level does not
    // fall to the level below at the first drop of charge.
    return static_cast<int32_t>(std::floor(mChargeMah * 100.0 / mConfig.capacityMah + 0.5));
}

bool BatteryModel::advance(int64_t ms) {
    if (ms <= 0) {
        return false;
    }
    int32_t before = level();
    double delta = currentMa() * static_cast<double>(ms) / 3600000.0;
    double next = std::min(std::max(mChargeMah + delta, 0.0), double(mConfig.capacityMah));
    if (next < mChargeMah) {
        mDrawnMah += mChargeMah - next;
    } else {
        mChargedMah += next - mChargeMah;
    }
    mChargeMah = next;
    return level() != before;
}

bool BatteryModel::writeFile(const std::string& name, const std::string& text) const {
    return CpuTree(mRoot).writeFile(folder() + "/" + name, text + "\n");
}

bool BatteryModel::writeFiles() const {
    // The gauge counts in whole units of its layout.
    int64_t scale = mConfig.micro ? 1000 : 1;
    int64_t full = static_cast<int64_t>(mConfig.capacityMah) * scale;
    int64_t now = static_cast<int64_t>(std::floor(mChargeMah * scale));
    int64_t current = static_cast<int64_t>(std::lround(currentMa() * scale));
    return writeFile("charge_full", std::to_string(full)) &&
           writeFile("charge_now", std::to_string(now)) &&
           writeFile("capacity", std::to_string(level())) &&
           writeFile("cycle_count", std::to_string(mConfig.cycleCount)) &&
           writeFile("current_now", std::to_string(current)) &&
           (mConfig.micro || writeFile("brand", mConfig.brand));
}

}  // namespace kelvo
