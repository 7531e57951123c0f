#include "kelvo/StopSignal.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <mutex>

namespace kelvo {

namespace {

int gPipe[2] = {-1, -1};

void onSignal(int signo) {
    int saved = errno;
    unsigned char b = static_cast<unsigned char>(signo);
    if (gPipe[1] >= 0) {
        ssize_t ignored = write(gPipe[1], &b, 1);
        (void)ignored;
    }
    errno = saved;
}

} // namespace

void StopSignal::install() {
    static std::once_flag once;
    std::call_once(once, [] {
        if (pipe2(gPipe, O_CLOEXEC | O_NONBLOCK) != 0) {
            return;
        }
        struct sigaction sa = {};
        sa.sa_handler = onSignal;
        sigemptyset(&sa.sa_mask);
        sa.sa_flags = SA_RESTART;
        sigaction(SIGTERM, &sa, nullptr);
        sigaction(SIGINT, &sa, nullptr);
    });
}

int StopSignal::wait() {
    install();
    for (;;) {
        struct pollfd pfd = {gPipe[0], POLLIN, 0};
        int n = poll(&pfd, 1, -1);
        if (n < 0 && errno != EINTR) {
            return -1;
        }
        unsigned char b = 0;
        if (n > 0 && read(gPipe[0], &b, 1) == 1) {
            return b;
        }
    }
}

void StopSignal::raise(int signo) {
    install();
    onSignal(signo);
}

} // namespace kelvo
