#pragma once

#include <stdint.h>

#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "FakeKernelDriver.h"
#include "kelvo/BufferedLogClient.h"

namespace kelvo {
namespace fake {

// Answers the report requests a FakeKernelDriver served, later and over the
// buffered log socket, as the driver does on the phone: it is the client
// "kelvo_driver" and sends one entry per request. The entry's magic names the
// report (0 per-process CPU time, 1 kernel workers, 2 uevents, 3 binder
// statistics); its data starts with the request's echo, int64 time and int32
// reason (0 for the kernel-worker and uevent requests, which carry a time
// only), followed by the body the user supplies; without a supplier, the
// driver's kernel workers, uevents or binder calls (reportBody).
class FakeDriverReporter {
public:
    static constexpr const char* kClientName = "kelvo_driver";

    enum Magic : int32_t {
        MAGIC_PID_CPU_TIME = 0,
        MAGIC_KWORKER = 1,
        MAGIC_UEVENT = 2,
        MAGIC_BINDER_STATS = 3,
    };

    // One answered request.
    struct Report {
        uint32_t request;
        int32_t magic;
        int64_t time;
        int32_t reason;
    };

    // The data after the echo for one report.
    using BodyProvider = std::function<std::string(const Report&)>;

    // Takes over the driver's request listener until stop() or destruction.
    explicit FakeDriverReporter(FakeKernelDriver& driver);
    ~FakeDriverReporter();
    FakeDriverReporter(const FakeDriverReporter&) = delete;
    FakeDriverReporter& operator=(const FakeDriverReporter&) = delete;

    // Starts answering. The socket is connected at the first report (the
    // daemon's receivers exist by then) and again after the daemon closed it.
    void start();
    void stop();
    // A null provider sends the driver state's bodies.
    void setBodyProvider(BodyProvider provider);
    // The body after the echo for a kernel-worker, uevent or binder
    // statistics report: int32 n, then n entries of 80, 136 or 116 bytes
    // (texts cut to their fields); empty for the other reports.
    static std::string reportBody(const Report& report, const FakeKernelDriver::State& state);

    // Entries sent, and reports that could not be sent (no server, or the
    // connection failed twice).
    size_t sent() const;
    size_t failed() const;

    // The report magic of a request number; -1 when it asks for no report.
    static int32_t magicOf(uint32_t request);
    // The echo of a request's argument; false when it is too short.
    static bool parseRequest(const FakeKernelDriver::Request& request, Report* report);

private:
    // Shared with the driver's listener, which may still run on the driver's
    // thread while the reporter stops.
    struct Shared {
        std::mutex lock;
        bool active = false;
        BodyProvider body;
        FakeKernelDriver* driver = nullptr;
        BufferedLogClient client;
        bool connected = false;
        size_t sent = 0;
        size_t failed = 0;

        void answer(const FakeKernelDriver::Request& request);
        // Sends one entry, connecting first when needed.
        bool sendLocked(int32_t magic, const std::string& data);
    };

    FakeKernelDriver& mDriver;
    std::shared_ptr<Shared> mShared;
};

} // namespace fake
} // namespace kelvo
