#pragma once

#include <stdint.h>

#include <string>

namespace kelvo {
namespace sim {

// The report's battery and abnormality sections: what the battery model
// drew beside the discharge the daemon measured from the power-supply files
// (raw_component_battery), the hourly energy compensation that set the one
// against the energy the accounters modelled (debug_energy_compensation),
// and every abnormality event uploaded during the run.
class BatteryReport {
public:
    struct Model {
        int32_t capacityMah = 0;
        int32_t startLevel = 0;
        int32_t endLevel = 0;
        double drawnMah = 0;    // by the load while discharging
        double chargedMah = 0;  // by the charger
    };

    BatteryReport(std::string databasePath, std::string eventsPath, const Model& model)
        : mDatabasePath(std::move(databasePath)),
          mEventsPath(std::move(eventsPath)),
          mModel(model) {}

    // The two sections as text; a database that cannot be read is said so.
    std::string build() const;

private:
    void describeBattery(std::string* out) const;
    void describeAbnormalities(std::string* out) const;

    std::string mDatabasePath;
    std::string mEventsPath;
    Model mModel;
};

}  // namespace sim
}  // namespace kelvo
