#pragma once

#include <sys/types.h>

#include <map>
#include <string>

namespace kelvo {
namespace sim {

// The daemon as a child process in a process group of its own, so a Ctrl-C
// at the terminal reaches only the simulator, which then stops the daemon in
// order. The child also gets SIGTERM when the simulator dies.
class DaemonProcess {
public:
    DaemonProcess() = default;
    ~DaemonProcess();
    DaemonProcess(const DaemonProcess&) = delete;
    DaemonProcess& operator=(const DaemonProcess&) = delete;

    // Starts the program with these extra environment variables, its
    // standard error (and output) appended to logPath. false with the reason.
    bool start(const std::string& program, const std::map<std::string, std::string>& env,
               const std::string& logPath, std::string* error);
    // True while the child has not ended.
    bool running();
    // SIGTERM, then up to graceMs for the orderly stop; then SIGKILL to the
    // whole group. Returns the exit status (128 + signal when killed; -1 when
    // never started).
    int stop(int graceMs);
    pid_t pid() const { return mPid; }

private:
    pid_t mPid = -1;
    int mStatus = -1;
};

}  // namespace sim
}  // namespace kelvo
