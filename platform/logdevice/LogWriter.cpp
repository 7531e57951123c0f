#include "kelvo/LogWriter.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <cstring>

#include "kelvo/LogDevice.h"
#include "kelvo/WallClock.h"

namespace kelvo {

namespace {

// Enough for a burst of full-size records before the writer waits.
constexpr int kSendBufferBytes = 1 << 20;

int64_t nowMs() {
    struct timespec ts;
    if (WallClock::getTime(&ts) != 0) {
        return 0;
    }
    return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

} // namespace

LogWriter::LogWriter(const std::string& path)
    : mPath(path), mFd(-1), mSocket(false), mTimeoutMs(0) {}

void LogWriter::setTimeout(int64_t ms) {
    mTimeoutMs = ms > 0 ? ms : 0;
    // Applied when the device is opened next.
    closeDevice();
}

LogWriter::~LogWriter() {
    closeDevice();
}

void LogWriter::closeDevice() {
    if (mFd >= 0) {
        close(mFd);
        mFd = -1;
    }
}

int LogWriter::openDevice() {
    struct stat st;
    if (stat(mPath.c_str(), &st) != 0) {
        return -errno;
    }
    if (S_ISCHR(st.st_mode)) {
        int fd = open(mPath.c_str(), O_WRONLY | O_CLOEXEC);
        if (fd < 0) {
            return -errno;
        }
        mFd = fd;
        mSocket = false;
        return 0;
    }
    struct sockaddr_un addr;
    if (mPath.size() >= sizeof(addr.sun_path)) {
        return -ENAMETOOLONG;
    }
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    memcpy(addr.sun_path, mPath.c_str(), mPath.size() + 1);

    int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return -errno;
    }
    int size = kSendBufferBytes;
    setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &size, sizeof(size));
    if (mTimeoutMs > 0) {
        struct timeval timeout;
        timeout.tv_sec = static_cast<time_t>(mTimeoutMs / 1000);
        timeout.tv_usec = static_cast<suseconds_t>((mTimeoutMs % 1000) * 1000);
        setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof(timeout));
    }
    // Connected once, so each record costs no path lookup.
    if (connect(fd, reinterpret_cast<const struct sockaddr*>(&addr), sizeof(addr)) != 0) {
        int err = errno;
        close(fd);
        return -err;
    }
    mFd = fd;
    mSocket = true;
    return 0;
}

int LogWriter::send(const struct iovec* parts, int count, size_t total) {
    // A second attempt only after the reader went away (it may have been
    // replaced by a new one at the same path).
    for (int attempt = 0; attempt < 2; ++attempt) {
        if (mFd < 0) {
            int err = openDevice();
            if (err < 0) {
                return err;
            }
        }
        ssize_t n;
        do {
            if (mSocket) {
                struct msghdr msg;
                memset(&msg, 0, sizeof(msg));
                msg.msg_iov = const_cast<struct iovec*>(parts);
                msg.msg_iovlen = static_cast<size_t>(count);
                n = sendmsg(mFd, &msg, MSG_NOSIGNAL);
            } else {
                n = writev(mFd, parts, count);
            }
        } while (n < 0 && errno == EINTR);
        if (n >= 0) {
            // A device write takes the record whole or not at all.
            return static_cast<size_t>(n) == total ? 0 : -EIO;
        }
        int err = errno;
        closeDevice();
        if (err != ECONNREFUSED && err != ENOTCONN && err != EPIPE) {
            return -err;
        }
    }
    return -ECONNREFUSED;
}

int LogWriter::write(int priority, const char* tag, const char* text, int64_t timeMs) {
    if (tag == nullptr || text == nullptr || priority < 0 || priority > 255) {
        return -EINVAL;
    }
    size_t tagSize = strlen(tag) + 1;
    size_t textSize = strlen(text) + 1;
    size_t payload = 1 + tagSize + textSize;
    if (payload > LogDevice::kMaxPayloadSize) {
        return -EMSGSIZE;
    }
    uint8_t header[LogDevice::kHeaderSize];
    if (!LogDevice::fillHeader(header, payload, static_cast<int32_t>(getpid()),
                               static_cast<int32_t>(syscall(SYS_gettid)),
                               timeMs < 0 ? nowMs() : timeMs)) {
        return -EINVAL;
    }
    uint8_t prio = static_cast<uint8_t>(priority);
    struct iovec parts[4] = {
        {header, sizeof(header)},
        {&prio, 1},
        {const_cast<char*>(tag), tagSize},
        {const_cast<char*>(text), textSize},
    };
    return send(parts, 4, sizeof(header) + payload);
}

int LogWriter::writeRaw(const void* data, size_t size) {
    if (data == nullptr && size != 0) {
        return -EINVAL;
    }
    struct iovec part = {const_cast<void*>(data), size};
    return send(&part, 1, size);
}

} // namespace kelvo
