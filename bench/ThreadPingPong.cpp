#include "ThreadPingPong.h"

#include <errno.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <chrono>

ThreadPingPong::Port::Port() {
    eventFd = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    epollFd = epoll_create1(EPOLL_CLOEXEC);
    struct epoll_event item = {};
    item.events = EPOLLIN;
    item.data.fd = eventFd;
    ok = eventFd >= 0 && epollFd >= 0 && epoll_ctl(epollFd, EPOLL_CTL_ADD, eventFd, &item) == 0;
}

ThreadPingPong::Port::~Port() {
    close(eventFd);
    close(epollFd);
}

void ThreadPingPong::Port::wake() {
    uint64_t one = 1;
    while (write(eventFd, &one, sizeof(one)) < 0 && errno == EINTR) {
    }
}

void ThreadPingPong::Port::wait() {
    struct epoll_event item;
    for (;;) {
        uint64_t count;
        if (epoll_wait(epollFd, &item, 1, -1) == 1 &&
            read(eventFd, &count, sizeof(count)) == sizeof(count)) {
            return;
        }
    }
}

ThreadPingPong::ThreadPingPong() : mOk(mToPeer.ok && mToCaller.ok) {
    if (!mOk) {
        return;
    }
    mPeer = std::thread([this] {
        for (;;) {
            mToPeer.wait();
            if (mStopping.load(std::memory_order_acquire)) {
                return;
            }
            mToCaller.wake();
        }
    });
}

ThreadPingPong::~ThreadPingPong() {
    if (mPeer.joinable()) {
        mStopping.store(true, std::memory_order_release);
        mToPeer.wake();
        mPeer.join();
    }
}

double ThreadPingPong::roundTripUs() {
    auto start = std::chrono::steady_clock::now();
    mToPeer.wake();
    mToCaller.wait();
    return std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start)
            .count();
}
