#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <vector>

#include "Scenario.h"

namespace kelvo {
namespace fake {
class FakeKernelDriver;
}
namespace sim {

// The GPU of the simulated phone: each "gpu" step adds busy time at one
// frequency to the kernel driver's residency (which the daemon reads and
// charges to the application in front) and keeps the truth: per
// application the GPU busy time and its energy at the profile's power of
// the nearest frequency step (busy ms x power / 1000, the accounter's unit).
class GpuLoadTruth {
public:
    struct Figures {
        int64_t busyMs = 0;
        int64_t energy = 0;
    };

    // "gpu <package> <MHz> <busy ms>": 1 parsed into the step (text the
    // package, frequency the MHz, value the busy ms), 0 another verb, -1 a
    // bad line.
    static int32_t parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                             std::string* reason);

    explicit GpuLoadTruth(const std::string& configPath);

    // Adds the step's busy time to the driver and to the truth.
    void apply(const Scenario::Step& step, fake::FakeKernelDriver& driver);
    // The report's section: per application the truth beside what the
    // daemon attributed (raw_applications_gpu, usage and energy, charging
    // included); nothing when the scenario used no GPU.
    std::string report(const std::string& databasePath) const;

    const std::map<std::string, Figures>& truth() const { return mTruth; }

private:
    int64_t powerAt(int64_t megahertz) const;

    std::map<int64_t, int64_t> mPowers;  // MHz to power
    std::map<std::string, Figures> mTruth;
};

}  // namespace sim
}  // namespace kelvo
