#pragma once

#include <sys/types.h>

#include <thread>

// The floor of a request with its reply over a Unix stream socket pair, the
// medium of the host binder transport. The other end is served by a thread
// of this process or by a child process (a switch between processes costs
// more than one between threads, and the binder benchmark's service is a
// child) while the object lives.
class SocketEcho {
public:
    explicit SocketEcho(bool process);
    ~SocketEcho();
    SocketEcho(const SocketEcho&) = delete;
    SocketEcho& operator=(const SocketEcho&) = delete;

    bool ok() const { return mOk; }
    // One request of the binder benchmark's echo call size (an int32 and an
    // int64) and its int32 reply; the duration in microseconds, or a
    // negative value when the round trip failed.
    double roundTripUs();

private:
    struct Request {
        int32_t seq;
        int64_t stamp;
    };

    static void serve(int fd);

    int mFds[2] = {-1, -1};
    bool mOk = false;
    pid_t mChild = -1;
    std::thread mServer;
    int32_t mSeq = 0;
};
