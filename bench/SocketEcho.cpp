#include "SocketEcho.h"

#include <errno.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>

namespace {

// Reads exactly size bytes; false at the end of the stream or on an error.
bool readFully(int fd, void* buffer, size_t size) {
    char* at = static_cast<char*>(buffer);
    while (size > 0) {
        ssize_t n = read(fd, at, size);
        if (n <= 0 && !(n < 0 && errno == EINTR)) {
            return false;
        }
        at += n > 0 ? n : 0;
        size -= n > 0 ? static_cast<size_t>(n) : 0;
    }
    return true;
}

bool writeFully(int fd, const void* buffer, size_t size) {
    const char* at = static_cast<const char*>(buffer);
    while (size > 0) {
        ssize_t n = write(fd, at, size);
        if (n <= 0 && !(n < 0 && errno == EINTR)) {
            return false;
        }
        at += n > 0 ? n : 0;
        size -= n > 0 ? static_cast<size_t>(n) : 0;
    }
    return true;
}

} // namespace

SocketEcho::SocketEcho(bool process) {
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, mFds) != 0) {
        return;
    }
    if (!process) {
        mServer = std::thread(serve, mFds[1]);
        mOk = true;
        return;
    }
    mChild = fork();
    if (mChild == 0) {
        close(mFds[0]);
        serve(mFds[1]);
        _exit(0);
    }
    mOk = mChild > 0;
}

SocketEcho::~SocketEcho() {
    if (mFds[0] >= 0) {
        shutdown(mFds[0], SHUT_RDWR);
    }
    if (mChild > 0) {
        waitpid(mChild, nullptr, 0);
    }
    if (mServer.joinable()) {
        mServer.join();
    }
    for (int fd : mFds) {
        if (fd >= 0) {
            close(fd);
        }
    }
}

void SocketEcho::serve(int fd) {
    Request request;
    while (readFully(fd, &request, sizeof(request))) {
        int32_t reply = request.seq + 1;
        if (!writeFully(fd, &reply, sizeof(reply))) {
            return;
        }
    }
}

double SocketEcho::roundTripUs() {
    ++mSeq;
    Request request = {mSeq, mSeq};
    int32_t reply = 0;
    auto start = std::chrono::steady_clock::now();
    bool ok = writeFully(mFds[0], &request, sizeof(request)) &&
              readFully(mFds[0], &reply, sizeof(reply)) && reply == request.seq + 1;
    double us =
            std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start)
                    .count();
    return ok ? us : -1;
}
