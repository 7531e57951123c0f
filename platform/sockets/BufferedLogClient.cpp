#include "kelvo/BufferedLogClient.h"

#include <cutils/sockets.h>
#include <errno.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

namespace kelvo {

namespace {

int64_t nowMs() {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

}  // namespace

BufferedLogClient::~BufferedLogClient() {
    close();
}

int BufferedLogClient::connect(const std::string& name) {
    close();
    mFd = socket_local_client(kSocketName, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    if (mFd < 0) {
        return -1;
    }
    if (!name.empty() && send(0, name.data(), name.size()) < 0) {
        int saved = errno;
        close();
        errno = saved;
        return -1;
    }
    return 0;
}

std::string BufferedLogClient::encode(int32_t magic, const void* data, size_t size) {
    int32_t length = static_cast<int32_t>(size);
    std::string entry(8, '\0');
    memcpy(&entry[0], &length, 4);
    memcpy(&entry[4], &magic, 4);
    if (size > 0) {
        entry.append(static_cast<const char*>(data), size);
    }
    return entry;
}

int BufferedLogClient::send(int32_t magic, const void* data, size_t size) {
    if (size > INT32_MAX) {
        errno = EINVAL;
        return -1;
    }
    std::string entry = encode(magic, data, size);
    return sendRaw(entry.data(), entry.size());
}

int BufferedLogClient::sendRaw(const void* data, size_t size) {
    const char* p = static_cast<const char*>(data);
    while (size > 0) {
        ssize_t n = ::send(mFd, p, size, MSG_NOSIGNAL);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return -1;
        }
        p += n;
        size -= static_cast<size_t>(n);
    }
    return 0;
}

bool BufferedLogClient::readFully(void* buffer, size_t size, int64_t deadlineMs) {
    char* p = static_cast<char*>(buffer);
    while (size > 0) {
        int64_t left = deadlineMs - nowMs();
        pollfd pfd = {mFd, POLLIN, 0};
        int ready = poll(&pfd, 1, left > 0 ? static_cast<int>(left) : 0);
        if (ready < 0 && errno == EINTR) {
            continue;
        }
        if (ready <= 0) {
            errno = ready == 0 ? ETIMEDOUT : errno;
            return false;
        }
        ssize_t n = ::recv(mFd, p, size, 0);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            errno = n == 0 ? ENODATA : errno;
            return false;
        }
        p += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

int BufferedLogClient::receive(int32_t* magic, std::string* data, int timeoutMs) {
    int64_t deadline = nowMs() + timeoutMs;
    int32_t header[2];
    if (mFd < 0 || !readFully(header, sizeof(header), deadline)) {
        return -1;
    }
    if (header[0] < 0) {
        errno = EPROTO;
        return -1;
    }
    std::string bytes(static_cast<size_t>(header[0]), '\0');
    if (!readFully(&bytes[0], bytes.size(), deadline)) {
        return -1;
    }
    if (magic != nullptr) {
        *magic = header[1];
    }
    if (data != nullptr) {
        data->swap(bytes);
    }
    return 0;
}

bool BufferedLogClient::waitClosed(int timeoutMs) {
    int64_t deadline = nowMs() + timeoutMs;
    char buffer[4096];
    while (mFd >= 0) {
        int64_t left = deadline - nowMs();
        pollfd pfd = {mFd, POLLIN, 0};
        int ready = poll(&pfd, 1, left > 0 ? static_cast<int>(left) : 0);
        if (ready < 0 && errno == EINTR) {
            continue;
        }
        if (ready <= 0) {
            return false;
        }
        ssize_t n = ::recv(mFd, buffer, sizeof(buffer), 0);
        if (n == 0 || (n < 0 && errno != EINTR && errno != EAGAIN)) {
            return true;
        }
    }
    return true;
}

void BufferedLogClient::close() {
    if (mFd >= 0) {
        ::close(mFd);
        mFd = -1;
    }
}

}  // namespace kelvo
