#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <vector>

namespace kelvo {
namespace sim {

// The closing report of a run: per application the CPU time the scenario
// gave (the truth) beside what the daemon stored, the component total, the
// hourly event it uploaded and where the files are.
class SimReport {
public:
    struct Header {
        std::string scenario;
        std::string timeZone;
        int64_t startMs = 0;  // simulated wall clock
        int64_t endMs = 0;
        std::string root;
        std::string daemonLog;
        int32_t daemonStatus = 0;
        bool interrupted = false;
        int32_t reportsAnswered = 0;
        int32_t logRecordsWritten = 0;
        int32_t logRecordsUnread = 0;
    };

    // truthMs and uids by accounted name.
    SimReport(const Header& header, const std::map<std::string, int64_t>& truthMs,
              const std::map<std::string, int32_t>& uids);

    // Reads the database and the uploaded-events file below the root and
    // writes the report as text; false (with the reason in the text) when
    // the database cannot be read.
    bool build(std::string* text);
    // A section of another model, printed before the files.
    void addSection(const std::string& text) { mSections.push_back(text); }
    // name \t uid \t truth ms \t attributed ms, one line per application.
    std::string truthTable() const;

    static std::string databasePath(const std::string& root);
    static std::string eventsPath(const std::string& root);

private:
    struct Sums {
        int32_t uid = 0;
        int64_t time[6] = {};    // foreground, background, screen on, screen off,
        int64_t energy[6] = {};  // charge foreground, charge background
        int64_t hourlyTime = 0;
        int64_t hourlyEnergy = 0;
        bool stored = false;
        int64_t total() const { return time[0] + time[1] + time[4] + time[5]; }
        int64_t totalEnergy() const { return energy[0] + energy[1] + energy[4] + energy[5]; }
    };

    bool readDatabase(std::string* error);
    void describeHourlyEvent(std::string* out) const;

    Header mHeader;
    std::map<std::string, int64_t> mTruth;
    std::map<std::string, int32_t> mUids;
    std::map<std::string, Sums> mApps;
    Sums mComponent;
    int64_t mComponentRows = 0;
    // Energy of the passes that gave application time (the rest is idle
    // energy no application shares).
    int64_t mComponentSharedEnergy = 0;
    int64_t mHourlyComponentTime = 0;
    int64_t mHourlyComponentEnergy = 0;
    int64_t mHourlyComponentRows = 0;
    std::vector<std::string> mSections;
};

}  // namespace sim
}  // namespace kelvo
