#pragma once

namespace android {

class IPCThreadState {
public:
    static IPCThreadState* self();

    // Serves the pool on the calling thread. Returns once the process has been
    // asked to stop (SIGTERM or SIGINT).
    void joinThreadPool(bool isMain = true);

private:
    IPCThreadState() = default;
};

} // namespace android
