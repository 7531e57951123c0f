#pragma once

#include <atomic>
#include <thread>

// The floor of a hand-over between two threads: a token passed back and
// forth through an eventfd watched with epoll, the wake-up primitive of
// libutils' Looper that every handler thread waits on. A peer thread answers
// while the object lives.
class ThreadPingPong {
public:
    ThreadPingPong();
    ~ThreadPingPong();
    ThreadPingPong(const ThreadPingPong&) = delete;
    ThreadPingPong& operator=(const ThreadPingPong&) = delete;

    bool ok() const { return mOk; }
    // One round trip; its duration in microseconds.
    double roundTripUs();

private:
    // One side's wake-up: an eventfd in an epoll set, as a looper has it.
    struct Port {
        Port();
        ~Port();
        void wake();
        // Blocks until woken and consumes the wake-up, as Looper::pollOnce does.
        void wait();
        int eventFd = -1;
        int epollFd = -1;
        bool ok = false;
    };

    Port mToPeer;
    Port mToCaller;
    bool mOk;
    std::atomic<bool> mStopping{false};
    std::thread mPeer;
};
