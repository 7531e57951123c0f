#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <tuple>
#include <vector>

#include "Scenario.h"
#include "WifiEnergyTruth.h"

namespace kelvo {
namespace sim {

// The simulated phone's network counters, as the kernel shows them:
//   proc/net/xt_qtaguid/stats          per uid, counter set and interface,
//                                      each row also as a tagged copy
//   proc/net/proc_netstat/stats        per system process (uid 0 or 1000)
//   proc/net/xt_qtaguid/iface_stat_all per interface (active, live counters)
// Counters only grow, by the scenario's "traffic" and "systraffic" steps.
// Files are replaced whole (a temporary file renamed over the old one); the
// three exist from the start, with their title lines, so the daemon's
// baseline finds them.
class TrafficModel {
public:
    struct Counters {
        int64_t rxBytes = 0;
        int64_t txBytes = 0;
        int64_t rxPackets = 0;
        int64_t txPackets = 0;
    };

    static std::string uidStatsPath() { return "proc/net/xt_qtaguid/stats"; }
    static std::string processStatsPath() { return "proc/net/proc_netstat/stats"; }
    static std::string interfaceStatsPath() { return "proc/net/xt_qtaguid/iface_stat_all"; }

    // Reads the words of a timed step ("traffic ..." or "systraffic ...",
    // the verb first) into the step; false with the reason.
    static bool parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                          std::string* reason);
    // The step against the declarations; false with the reason.
    static bool checkStep(const Scenario& scenario, const Scenario::Step& step, std::string* reason);

    TrafficModel(const Scenario& scenario, std::string root);

    // Adds a step's counters; true when the step was a traffic step.
    bool apply(const Scenario::Step& step);
    // Rewrites the three files; false with errno set when one cannot be written.
    bool write() const;

    // The truth section of the summary: bytes (rx + tx) the scenario gave
    // each app on Wi-Fi and on the cellular interfaces, beside what the
    // daemon stored, read from the database at dbPath.
    std::string summary(const std::string& dbPath) const;
    // The Wi-Fi energy the profile gives, shown beside the attributed energy;
    // heading says what it models.
    void setEnergyTruth(const WifiEnergyTruth::Result& truth, const std::string& heading) {
        mEnergyTruth = truth;
        mEnergyHeading = heading;
        mHaveEnergyTruth = true;
    }
    // name \t uid \t Wi-Fi bytes \t cellular bytes, one line per app.
    std::string truthTable() const;

private:
    // (uid, interface, counter set)
    using UidKey = std::tuple<int32_t, std::string, int32_t>;
    // (pid, interface)
    using ProcessKey = std::pair<int32_t, std::string>;

    bool writeFile(const std::string& relative, const std::string& text) const;
    std::string appName(int32_t uid) const;

    const Scenario& mScenario;
    std::string mRoot;
    std::map<UidKey, Counters> mUids;
    std::map<ProcessKey, Counters> mProcesses;
    WifiEnergyTruth::Result mEnergyTruth;
    std::string mEnergyHeading;
    bool mHaveEnergyTruth = false;
};

}  // namespace sim
}  // namespace kelvo
