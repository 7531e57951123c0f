#pragma once

#include <stdint.h>

#include <array>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace kelvo {
namespace fake {

// A stand-in for the kernel drivers behind "/dev/kelvo" and "/dev/dpm_ldm":
// serves both sockets below the root (the "ioctl over a socket" protocol of
// kelvo/KernelDevice.h) from state a test sets, fails chosen requests and
// records every request it got.
class FakeKernelDriver {
public:
    enum class Device { Kelvo, Dpm };

    struct Request {
        Device device;
        uint32_t request;
        std::vector<uint8_t> argument;  // the bytes as they came in
    };

    struct GpuStep {
        int64_t frequency;
        int64_t busyUs;
        int64_t idleUs;
    };

    // What the kernel-worker, uevent and binder statistics reports carry
    // (FakeDriverReporter::reportBody lays them out).
    struct Kworker {
        std::string symbol;
        int64_t count;
        int64_t timeMs;
    };
    struct Uevent {
        std::string devpath;
        int32_t action;
        int32_t count;
    };
    struct BinderCall {
        int32_t serviceUid;
        int32_t servicePid;
        std::string service;
        int32_t clientUid;
        int32_t clientPid;
        std::string client;
        int32_t count;
    };

    // One monitored IP block: its name and its times in ms since the last
    // reset: off, busy, busy at low voltage, idle.
    struct DpmIp {
        std::string name;
        std::array<int64_t, 4> times = {};
    };
    enum DpmTime { DPM_OFF = 0, DPM_BUSY = 1, DPM_BUSY_LOW_VOLTAGE = 2, DPM_IDLE = 3 };

    struct State {
        // "/dev/kelvo"
        std::map<uint32_t, bool> flags;  // the switch requests, by number
        // The GPU residency gathered since the previous read, per frequency
        // step: a read reports it and clears it (the kernel's counters are
        // read-and-clear), so each read gives the increments since the last.
        std::vector<GpuStep> gpuSteps;
        std::optional<int32_t> gpuCount;  // reported instead of the steps' number
        // The advanced brightness of the span since the previous read: each
        // read takes the next of spanBrightness, and `brightness` once they
        // are used up (a level that has not changed since).
        std::deque<uint32_t> spanBrightness;
        uint32_t brightness = 0;
        // Process names by pid; a name of 48 bytes or more fills the field
        // without a terminator.
        std::map<int32_t, std::string> processNames;
        std::vector<Kworker> kworkers;
        std::vector<Uevent> uevents;
        std::vector<BinderCall> binderCalls;
        // "/dev/dpm_ldm"
        int32_t version = 1;
        int32_t enable = 0;
        int32_t period = 0;
        // Answers of the period getter for 0 and 1.
        int32_t minPeriod = 100;
        int32_t maxPeriod = 10000;
        // The monitored blocks in report order (useIpNames fills them from
        // the daemon's tables). Every enable or disable zeroes their times.
        std::vector<DpmIp> ips;
        std::optional<int32_t> ipCount;  // reported instead of the blocks' number
        // Cumulative DDR residency (s) and traffic (MB) per bandwidth level,
        // in the block named "DDR_FREQ_TIME" and the one named
        // "DDR_FREQ_FLUX"; never zeroed.
        std::array<std::string, 2> ddrNames = {"DDR_FREQ_TIME", "DDR_FREQ_FLUX"};
        std::array<std::vector<int64_t>, 2> ddrValues = {std::vector<int64_t>(4, 0),
                                                         std::vector<int64_t>(4, 0)};
        std::optional<int32_t> ddrCount;  // reported instead of the values' number
    };

    // Report requests (per-process CPU time, kernel workers, uevents, binder
    // statistics) are handed to this after they are answered (FakeDriverReporter
    // answers them as the buffered-log client of the driver).
    using RequestListener = std::function<void(const Request&)>;

    FakeKernelDriver() = default;
    ~FakeKernelDriver();
    FakeKernelDriver(const FakeKernelDriver&) = delete;
    FakeKernelDriver& operator=(const FakeKernelDriver&) = delete;

    // Serves "<root>/dev/kelvo" and "<root>/dev/dpm_ldm" under the current
    // root (a stale file at either path is replaced). false when a socket
    // cannot be bound.
    bool start();
    // Stops serving and removes both sockets.
    void stop();

    void update(const std::function<void(State&)>& change);
    State state() const;

    // The request is answered with -1 and the error, or, when hangUp is set,
    // by closing the connection without a reply.
    void failRequest(Device device, uint32_t request, int error, bool hangUp = false);
    void clearFailures();

    std::vector<Request> requests() const;
    void clearRequests();

    void setRequestListener(RequestListener listener);

    // Answers each brightness read once spanBrightness is used up (instead
    // of `brightness`): the simulator's panel. Called under the driver's
    // lock; it must not call back into the driver.
    using BrightnessSource = std::function<uint32_t()>;
    void setBrightnessSource(BrightnessSource source);

    // Adds busy and idle time at one frequency to the residency the next
    // read reports (a new step is appended).
    void addGpuResidency(int64_t frequency, int64_t busyUs, int64_t idleUs);

    // Serves the blocks of the daemon's IP table of the policy (1 or 2),
    // all times zero. false for another policy.
    bool useIpNames(int32_t policy);
    // Adds ms to one time of the named block; false when there is no such
    // block.
    bool addIpTime(const std::string& name, DpmTime which, int64_t ms);
    // Adds residency and traffic to a DDR level; false for a level the
    // driver does not have.
    bool addDdr(int32_t level, int64_t seconds, int64_t flux);

private:
    struct Answer {
        int32_t result = 0;
        int32_t error = 0;
        bool hangUp = false;
    };

    void serve();
    void serveConnection(int fd, Device device);
    // Fills the argument in place for the request.
    Answer answer(Device device, uint32_t request, std::vector<uint8_t>* argument);
    Answer answerKelvo(uint32_t request, std::vector<uint8_t>* argument);
    Answer answerDpm(uint32_t request, std::vector<uint8_t>* argument);

    mutable std::mutex mLock;
    State mState;
    std::map<std::pair<Device, uint32_t>, Answer> mFailures;
    std::vector<Request> mRequests;
    RequestListener mListener;
    BrightnessSource mBrightnessSource;

    std::string mPaths[2];
    int mListenFds[2] = {-1, -1};
    int mStopPipe[2] = {-1, -1};
    std::thread mThread;
};

} // namespace fake
} // namespace kelvo
