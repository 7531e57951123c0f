#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <utility>

#include "ComponentTruth.h"

namespace kelvo {
namespace sim {

// The report's part on the display, GNSS and flashlight: per application the
// truth of the scenario beside what the daemon stored in its raw and hourly
// application tables, their fields of the uploaded hourly events, and the
// ambient light written beside the stored.
class ComponentReport {
public:
    ComponentReport(const ComponentTruth& truth, const std::string& databasePath,
                    const std::string& eventsPath);

    // Reads the database and writes the section; false (with the reason in
    // the text) when it cannot be read.
    bool build(std::string* text);
    // component \t name \t truth ms \t attributed ms \t truth energy \t
    // attributed energy ("-" when there is no energy truth), one line per
    // application.
    std::string table() const;

private:
    struct Row {
        ComponentTruth::Figures truth;
        int64_t ms = 0;
        int64_t energy = 0;
        int64_t hourlyMs = 0;
        int64_t hourlyEnergy = 0;
    };
    // By component ("backlight", "gnss", "flashlight"), then by name.
    using Rows = std::map<std::string, std::map<std::string, Row>>;

    bool readDatabase(std::string* error);
    bool energyTruth(const std::string& component) const;
    // The components' fields of every uploaded hourly event.
    void describeHourlyEvents(std::string* out) const;

    const ComponentTruth& mTruth;
    std::string mDatabasePath;
    std::string mEventsPath;
    Rows mRows;
    std::map<int32_t, int64_t> mAmbientStoredMs;
};

}  // namespace sim
}  // namespace kelvo
