#pragma once

#include <stdint.h>

#include <array>
#include <map>
#include <string>
#include <vector>

#include "Scenario.h"

namespace kelvo {
namespace fake {
class FakeKernelDriver;
}
namespace sim {

// The power monitor of the simulated phone: "dpm" steps add off, busy,
// low-voltage busy or idle time to one IP block of the kernel driver, "ddr"
// steps add residency and traffic to one DDR bandwidth level. It keeps the
// truth per block: the time driven and its energy from the profile's
// coefficients (ms x coefficient / 1000, the accounter's unit); per DDR
// level the energy of each step's time and traffic by its bandwidth.
class DpmActivity {
public:
    // "dpm <ip-name> off|busy|low|idle <seconds>" (text the name, value the
    // time's index, counters[0] the ms) and "ddr <level> <seconds> <MB>"
    // (value the level, counters[0] the seconds, counters[1] the MB): 1
    // parsed, 0 another verb, -1 a bad line.
    static int32_t parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                             std::string* reason);

    explicit DpmActivity(const std::string& configPath);

    int32_t policy() const { return mPolicy; }
    // Serves the policy's IP names (the daemon's tables) from the driver.
    void prepare(fake::FakeKernelDriver& driver) const;
    // Adds the step's time or traffic to the driver and to the truth.
    void apply(const Scenario::Step& step, fake::FakeKernelDriver& driver);
    // The report's section: the top blocks by the daemon's energy
    // (raw_component_dpm) beside the truth, their folded hourly energy and
    // how many hourly uploads (parameter 34) carried each; nothing when the
    // scenario drove no block.
    std::string report(const std::string& databasePath, const std::string& eventsPath) const;

private:
    struct Truth {
        std::array<int64_t, 4> ms = {};
        int64_t energy = 0;
    };

    int32_t mPolicy = 0;
    std::map<int32_t, std::array<int64_t, 4>> mCoefficients;
    std::map<std::string, Truth> mTruth;  // by block name
    int64_t mDdrSeconds = 0;
    int64_t mDdrFlux = 0;
};

}  // namespace sim
}  // namespace kelvo
