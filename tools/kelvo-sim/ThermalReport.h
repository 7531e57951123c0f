#pragma once

#include <string>

namespace kelvo {
namespace sim {

// The report's thermal section: for each high-temperature episode the
// daemon recorded (raw_thermal_abnormality), the usage and energy per
// component it uploaded (event 903002050) beside the simulator's own sums of
// the same rows, scaled by the battery's discharge as the upload is; then
// the daily thermal statistics stored from "Pelmora".
class ThermalReport {
public:
    ThermalReport(std::string databasePath, std::string eventsPath)
        : mDatabasePath(std::move(databasePath)), mEventsPath(std::move(eventsPath)) {}

    std::string build() const;

private:
    std::string mDatabasePath;
    std::string mEventsPath;
};

}  // namespace sim
}  // namespace kelvo
