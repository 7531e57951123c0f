#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <vector>

#include "Scenario.h"

namespace kelvo {
namespace sim {

// The Wi-Fi energy the power profile gives the scenario's traffic, worked out
// from the scenario alone (the daemon's library is not used).
//
// The link's active time per signal level (levels 0 and 1 together, active
// only while the screen is on) and the wlan interface's packets add up until
// a traffic batch weighs them: a batch goes at each of the daemon's reads of
// the counters (its data polls, taken from debug_data_polling, and its screen
// changes) that finds new wlan traffic. Per application and counter set, with
// L the batch's level time (1..660000 ms) and Li per level:
//   e = Σ Li / (L·1000) · (tx·P1[i] + rx·P2[i])   (packets)
//   energy = e + L·P4/1000 · min(e, Et) / Et      (Et: e of the interface)
// and otherwise (tx·P1[3] + rx·P2[3]) / 100. Scans cost P3 each, charged at
// the next read; the hotspot P0 per second on. Without the poll times (no
// database) the whole run is one batch.
class WifiEnergyTruth {
public:
    struct Profile {
        int32_t hotspot = 0;
        int32_t scan = 0;
        int32_t tx[2][4] = {};  // band (0 2.4 GHz, 1 5 GHz), level
        int32_t rx[2][4] = {};
        int32_t bandFixed[2] = {};
    };

    struct Result {
        std::map<int32_t, double> byUid;          // applications
        std::map<std::string, double> byProcess;  // system processes, by name
        double hotspot = 0;                       // "wifi_ap"
        bool perPoll = false;                     // false: the whole run as one batch
        int32_t batches = 0;
    };

    static bool readProfile(const std::string& configPath, Profile* profile);
    // The daemon's polls as ms after the scenario's start (startMs is the
    // daemon's clock then); false when the table cannot be read.
    static bool readPolls(const std::string& dbPath, int64_t startMs, std::vector<int64_t>* polls);

    WifiEnergyTruth(const Scenario& scenario, const Profile& profile)
        : mScenario(scenario), mProfile(profile) {}

    // Plays the scenario's steps up to endMs against the given reads (in
    // any order; empty: one batch at endMs).
    Result compute(std::vector<int64_t> polls, int64_t endMs) const;

private:
    const Scenario& mScenario;
    Profile mProfile;
};

}  // namespace sim
}  // namespace kelvo
