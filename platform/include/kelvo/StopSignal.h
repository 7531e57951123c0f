#pragma once

namespace kelvo {

// SIGTERM and SIGINT end the process's binder pool. Their handler writes to a
// pipe that the pool waits on, so the request is never lost, whenever it comes.
class StopSignal {
public:
    // Installs the handlers (once).
    static void install();
    // Blocks until a stop was requested; returns the signal number.
    static int wait();
    // Requests a stop as the signal would (tests).
    static void raise(int signo);
};

} // namespace kelvo
