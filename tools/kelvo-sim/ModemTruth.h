#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <vector>

#include "ModemModel.h"
#include "Scenario.h"

namespace kelvo {
namespace sim {

// The modem energy the power profile (component 8) gives what the simulated
// modem reported, worked out from its answers alone, by the rules the
// daemon's decoders and accounter apply to the records:
//   - each level's time in ms (LTE in 1/8 s, WCDMA transmit counts in
//     10 ms), energy = Σ t_ms × power / 1000 per record and kind,
//     truncated; a level past the configured powers counts 0;
//   - idle: the idle table (key 0) of the LTE (mode 5) and WCDMA (mode 1)
//     modes; voice and data: keys 1 and 2; LTE takes its table from the
//     band flag (1: key 1, else key 2) for both;
//   - a VoLTE call's share of each LTE level is V × x_i / C (the connected
//     time C), the rest is data; the LTE record is refused above 2^29 - 2
//     ticks of connected time.
// The data energy goes to the applications by their cellular ("rmnet")
// packets within each hour, as the daemon's hourly redistribution does;
// only hours whose round ran before the end count.
class ModemTruth {
public:
    struct Profile {
        // mode 0..5, key 0 idle / 1 voice / 2 data, level
        std::vector<int64_t> powers[6][3];
        int64_t special = 0;
    };

    struct Energy {
        int64_t idle = 0;
        int64_t voice = 0;
        int64_t data = 0;
        int64_t idleMs = 0;
        int64_t voiceMs = 0;
        int64_t dataMs = 0;
    };

    struct App {
        int32_t uid = 0;
        int64_t packets = 0;
        int64_t bytes = 0;
        double energy = 0;  // in closed hours
    };

    static bool readProfile(const std::string& configPath, Profile* profile);
    // Energy and times of one answer's residency.
    static Energy energyOf(const ModemModel::Residency& residency, const Profile& profile);

    // startMs: the daemon's clock at the scenario's start; endMs: elapsed
    // time at the end.
    ModemTruth(const Scenario& scenario, const Profile& profile, int64_t startMs, int64_t endMs);

    // Plays the scenario's traffic and the modem's answers.
    void compute(const std::vector<ModemModel::Sent>& sent);

    const Energy& total() const { return mTotal; }
    const std::map<std::string, App>& apps() const { return mApps; }

    // The report's section beside the daemon's rows; empty when the
    // scenario used no modem and no cellular traffic.
    std::string report(const std::string& databasePath, int32_t requests,
                       const std::vector<ModemModel::Sent>& sent,
                       const ModemModel::Residency& pending) const;
    // "component\t<kind>\t<truth ms>\t<truth energy>" and
    // "app\t<name>\t<uid>\t<packets>\t<bytes>\t<truth energy>" lines.
    std::string table() const;

private:
    // The end of the hour the daemon files a time under.
    int64_t hourOf(int64_t elapsedMs, bool request) const;
    std::string appName(int32_t uid) const;

    const Scenario& mScenario;
    Profile mProfile;
    int64_t mStartMs = 0;
    int64_t mEndMs = 0;
    bool mUsed = false;
    Energy mTotal;
    double mOpenHourData = 0;
    std::map<std::string, App> mApps;
};

}  // namespace sim
}  // namespace kelvo
