#pragma once

#include <stdint.h>

#include <atomic>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "Scenario.h"
#include "SystemFiles.h"

namespace kelvo {

class LogWriter;

namespace fake {
class FakeKernelDriver;
}  // namespace fake

namespace sim {

// The system side of the simulated phone: its files (memory, wakeup sources,
// DDR residency, the charger's high-impedance switch), the system records of
// the scenario's verbs written to the log device (suspend, wake-up, resume,
// alarms, packages, time changes, boot and shut-down), the kernel driver's
// worker, uevent and binder reports, and the framework's buffered-log client
// "KelvoService", which answers the daemon's requests for the daily
// statistics, the mobile phone data and the package versions.
class SystemScene {
public:
    static constexpr const char* kServiceName = "KelvoService";
    enum Request : int32_t {
        REQUEST_DAILY_STATISTICS = 0,
        REQUEST_MOBILE_PHONE = 1,
        REQUEST_PACKAGE_VERSIONS = 2,
    };

    // Reads a timed system verb: 1 with the record to write (the tag, a
    // newline, the text) in record; 0 when the verb is not a system verb; -1
    // with the reason of a bad line.
    static int parseStep(const std::vector<std::string>& words, std::string* record,
                         std::string* reason);

    SystemScene(const Scenario& scenario, const std::string& root);
    ~SystemScene();

    // Lays out the files (before the daemon starts). False with errno set.
    bool layout();
    // The kernel workers, uevents and binder calls the driver reports: calls
    // between each application process and the first system process.
    void configureDriver(fake::FakeKernelDriver& driver) const;
    // Starts the "KelvoService" client, once the daemon listens; its clock
    // is the host's plus the daemon's offset.
    void startService(int64_t clockOffsetMs);
    void stop();
    // Adds simulated time to the file counters.
    bool advance(int64_t ms);
    // Writes one record of parseStep at the simulated time; the writer's
    // result.
    int write(LogWriter& writer, const std::string& record, int64_t timeMs);

    // The record bodies (docs/system-records.md).
    static std::string dailyStatistics(int64_t dayMs);
    static std::string mobilePhone();
    static std::string packageVersions(const std::vector<Scenario::App>& apps);

private:
    void serve();

    const Scenario& mScenario;
    SystemFiles mFiles;
    std::atomic<bool> mStop{false};
    int64_t mClockOffsetMs = 0;
    std::thread mThread;
};

}  // namespace sim
}  // namespace kelvo
