#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <utility>
#include <vector>

namespace kelvo {

// The simulated phone's battery: a charge that the components' load drains
// and a charger fills, and the power-supply files the daemon reads:
//   sys/class/power_supply/Battery/  charge_full, charge_now (mAh),
//       capacity (%), cycle_count, current_now (mA), brand
//   sys/class/power_supply/battery/  the same in µAh and µA, without brand
// The load is the idle current, plus each cluster's current per busy core,
// plus the screen's while it is on; it drains the battery, or is taken from
// the charger's current while one is online.
// Files are replaced whole. Used by tests and the simulator.
class BatteryModel {
public:
    struct Config {
        int32_t capacityMah = 3000;
        int32_t startLevel = 50;
        bool micro = false;  // the micro-unit layout
        int32_t idleMa = 25;
        int32_t screenMa = 120;
        int32_t clusterMa[2] = {60, 220};  // per busy core
        int32_t chargeMa = 1500;
        int32_t cycleCount = 120;
        std::string brand = "SimCell";
    };

    // "battery-model <capacity mAh> <level>% [micro] [idle|screen|little|big|
    // charge <mA>]...": false with the reason.
    static bool parse(const std::vector<std::string>& words, Config* out, std::string* reason);

    BatteryModel(std::string root, const Config& config);

    // The folder of the configured layout, relative to the root.
    std::string folder() const;

    // The component load: percent of one core busy on a cluster (per
    // process, as the scenario gives it), the screen, the charger.
    void setLoad(int32_t pid, int32_t cluster, int32_t percent);
    void setScreen(bool on) { mScreenOn = on; }
    void setCharger(bool online) { mCharging = online; }
    // Sets the level at once (the charge follows).
    void setLevel(int32_t percent);

    // Drains or charges for ms of simulated time; true when the level (whole
    // percent) changed.
    bool advance(int64_t ms);

    // The present current: negative while discharging (mA).
    double currentMa() const;
    int32_t level() const;
    double chargeMah() const { return mChargeMah; }
    // What the load drew and the charger gave since the start (mAh).
    double drawnMah() const { return mDrawnMah; }
    double chargedMah() const { return mChargedMah; }

    // Rewrites the files of the layout; false with errno set when one could
    // not be written.
    bool writeFiles() const;

private:
    bool writeFile(const std::string& name, const std::string& text) const;

    std::string mRoot;
    Config mConfig;
    double mChargeMah;
    double mDrawnMah = 0;
    double mChargedMah = 0;
    bool mScreenOn = false;
    bool mCharging = false;
    std::map<std::pair<int32_t, int32_t>, int32_t> mLoads;  // (pid, cluster) -> percent
};

}  // namespace kelvo
