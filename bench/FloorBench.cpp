// The physical floors under the daemon's hand-overs, measured in the same run
// as the figures they bound (idle wake-up latency on a shared machine moves
// every round trip, so a latency means little without its floor):
// - two plain threads passing a token back and forth through an eventfd
//   watched with epoll, the wake-up primitive of libutils' Looper that every
//   handler thread waits on;
// - a request and its reply over a Unix stream socket pair between two
//   threads, the medium of the host binder transport; and the same between
//   two processes, as the binder benchmark's client and service are (a
//   switch between processes costs more than one between threads).
// BenchMain divides the handler and binder round trips by these.

#include <benchmark/benchmark.h>
#include <errno.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstring>
#include <thread>
#include <vector>

using Clock = std::chrono::steady_clock;

namespace {

constexpr int kWarmUp = 500;
constexpr int kRoundTrips = 20000;

double median(std::vector<double>* values) {
    std::nth_element(values->begin(), values->begin() + values->size() / 2, values->end());
    return (*values)[values->size() / 2];
}

// One side's wake-up: an eventfd in an epoll set, as a looper has it.
class WakePort {
public:
    WakePort() {
        mEventFd = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
        mEpollFd = epoll_create1(EPOLL_CLOEXEC);
        struct epoll_event item = {};
        item.events = EPOLLIN;
        item.data.fd = mEventFd;
        mOk = mEventFd >= 0 && mEpollFd >= 0 &&
              epoll_ctl(mEpollFd, EPOLL_CTL_ADD, mEventFd, &item) == 0;
    }
    ~WakePort() {
        close(mEventFd);
        close(mEpollFd);
    }
    WakePort(const WakePort&) = delete;
    WakePort& operator=(const WakePort&) = delete;

    bool ok() const { return mOk; }

    void wake() {
        uint64_t one = 1;
        while (write(mEventFd, &one, sizeof(one)) < 0 && errno == EINTR) {
        }
    }

    // Blocks until woken and consumes the wake-up, as Looper::pollOnce does.
    void wait() {
        struct epoll_event item;
        for (;;) {
            int n = epoll_wait(mEpollFd, &item, 1, -1);
            if (n == 1) {
                uint64_t count;
                if (read(mEventFd, &count, sizeof(count)) == sizeof(count)) {
                    return;
                }
            }
        }
    }

private:
    int mEventFd = -1;
    int mEpollFd = -1;
    bool mOk = false;
};

void BM_RawThreadPingPong(benchmark::State& state) {
    WakePort toPeer;
    WakePort toMain;
    if (!toPeer.ok() || !toMain.ok()) {
        state.SkipWithError("no eventfd or epoll");
        return;
    }
    std::atomic<bool> stopping{false};
    std::thread peer([&] {
        for (;;) {
            toPeer.wait();
            if (stopping.load(std::memory_order_acquire)) {
                return;
            }
            toMain.wake();
        }
    });
    std::vector<double> micros;
    micros.reserve(kRoundTrips);
    for (auto _ : state) {
        for (int i = 0; i < kWarmUp + kRoundTrips; ++i) {
            Clock::time_point start = Clock::now();
            toPeer.wake();
            toMain.wait();
            double us = std::chrono::duration<double, std::micro>(Clock::now() - start).count();
            if (i >= kWarmUp) {
                micros.push_back(us);
            }
        }
    }
    stopping.store(true, std::memory_order_release);
    toPeer.wake();
    peer.join();
    state.counters["raw_thread_pingpong_us_p50"] = median(&micros);
}
BENCHMARK(BM_RawThreadPingPong)->Iterations(1)->UseRealTime();

// A request the size of the binder bench's echo call (an int32 and an
// int64); the reply is one int32.
struct Request {
    int32_t seq;
    int64_t stamp;
};

// Reads exactly size bytes; false at the end of the stream or on an error.
bool readFully(int fd, void* buffer, size_t size) {
    uint8_t* at = static_cast<uint8_t*>(buffer);
    while (size > 0) {
        ssize_t n = read(fd, at, size);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        at += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

bool writeFully(int fd, const void* buffer, size_t size) {
    const uint8_t* at = static_cast<const uint8_t*>(buffer);
    while (size > 0) {
        ssize_t n = write(fd, at, size);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        at += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

// Answers each request with its sequence number plus one until the peer
// closes.
void serveEcho(int fd);

// Request/reply round trips over a socket pair whose other end another
// thread or a child process serves.
void socketRoundTrips(benchmark::State& state, bool process, const char* figure) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) {
        state.SkipWithError("no socket pair");
        return;
    }
    std::thread server;
    pid_t child = -1;
    if (process) {
        child = fork();
        if (child == 0) {
            close(fds[0]);
            serveEcho(fds[1]);
            _exit(0);
        }
        if (child < 0) {
            close(fds[0]);
            close(fds[1]);
            state.SkipWithError("no child");
            return;
        }
    } else {
        server = std::thread(serveEcho, fds[1]);
    }
    std::vector<double> micros;
    micros.reserve(kRoundTrips);
    bool failed = false;
    for (auto _ : state) {
        for (int i = 0; i < kWarmUp + kRoundTrips && !failed; ++i) {
            Request request = {i, i};
            int32_t reply = 0;
            Clock::time_point start = Clock::now();
            failed = !writeFully(fds[0], &request, sizeof(request)) ||
                     !readFully(fds[0], &reply, sizeof(reply)) || reply != i + 1;
            double us = std::chrono::duration<double, std::micro>(Clock::now() - start).count();
            if (i >= kWarmUp) {
                micros.push_back(us);
            }
        }
    }
    shutdown(fds[0], SHUT_RDWR);
    if (child > 0) {
        waitpid(child, nullptr, 0);
    } else {
        server.join();
    }
    close(fds[0]);
    close(fds[1]);
    if (failed) {
        state.SkipWithError("round trip failed");
        return;
    }
    state.counters[figure] = median(&micros);
}

void serveEcho(int fd) {
    Request request;
    while (readFully(fd, &request, sizeof(request))) {
        int32_t reply = request.seq + 1;
        if (!writeFully(fd, &reply, sizeof(reply))) {
            return;
        }
    }
}

void BM_RawUnixSocketRoundTrip(benchmark::State& state) {
    socketRoundTrips(state, false, "raw_unix_socket_roundtrip_us_p50");
}
BENCHMARK(BM_RawUnixSocketRoundTrip)->Iterations(1)->UseRealTime();

void BM_RawUnixSocketProcessRoundTrip(benchmark::State& state) {
    socketRoundTrips(state, true, "raw_unix_socket_process_roundtrip_us_p50");
}
BENCHMARK(BM_RawUnixSocketProcessRoundTrip)->Iterations(1)->UseRealTime();

} // namespace
