#include "kelvo/LogDevice.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <string>

namespace kelvo {

namespace {

// Room for a deep burst of records before writers wait (the kernel may cap
// it lower).
constexpr int kReceiveBufferBytes = 4 << 20;

bool makeAddress(const char* path, struct sockaddr_un* addr) {
    size_t len = strlen(path);
    if (len == 0 || len >= sizeof(addr->sun_path)) {
        errno = len == 0 ? ENOENT : ENAMETOOLONG;
        return false;
    }
    memset(addr, 0, sizeof(*addr));
    addr->sun_family = AF_UNIX;
    memcpy(addr->sun_path, path, len + 1);
    return true;
}

// True when a reader is bound to the socket at the path: a datagram socket
// can be connected to it. A socket file left by a reader that has gone
// refuses the connection.
bool isLiveSocket(const struct sockaddr_un& addr) {
    int probe = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (probe < 0) {
        return false;
    }
    bool live = connect(probe, reinterpret_cast<const struct sockaddr*>(&addr), sizeof(addr)) == 0;
    close(probe);
    return live;
}

// Creates the folder that holds the path when it is missing (one level only:
// a missing root stays an error).
void makeParentFolder(const char* path) {
    std::string parent(path);
    size_t slash = parent.find_last_of('/');
    if (slash == std::string::npos || slash == 0) {
        return;
    }
    parent.resize(slash);
    mkdir(parent.c_str(), 0755);
}

void putUint16(uint8_t* at, uint16_t value) {
    at[0] = static_cast<uint8_t>(value);
    at[1] = static_cast<uint8_t>(value >> 8);
}

void putUint32(uint8_t* at, uint32_t value) {
    for (int i = 0; i < 4; ++i) {
        at[i] = static_cast<uint8_t>(value >> (8 * i));
    }
}

} // namespace

int LogDevice::openForReading(const char* path) {
    if (path == nullptr) {
        errno = EINVAL;
        return -1;
    }
    struct sockaddr_un addr;
    if (!makeAddress(path, &addr)) {
        return -1;
    }
    struct stat st;
    if (stat(path, &st) == 0) {
        if (S_ISCHR(st.st_mode)) {
            return open(path, O_RDONLY | O_CLOEXEC);
        }
        if (!S_ISSOCK(st.st_mode)) {
            errno = EEXIST;
            return -1;
        }
        if (isLiveSocket(addr)) {
            errno = EADDRINUSE;
            return -1;
        }
        if (unlink(path) != 0 && errno != ENOENT) {
            return -1;
        }
    } else if (errno == ENOENT) {
        makeParentFolder(path);
    } else {
        return -1;
    }

    int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return -1;
    }
    int size = kReceiveBufferBytes;
    // Best effort: the kernel caps the size at net.core.rmem_max.
    setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &size, sizeof(size));
    if (bind(fd, reinterpret_cast<const struct sockaddr*>(&addr), sizeof(addr)) != 0) {
        int saved = errno;
        close(fd);
        errno = saved;
        return -1;
    }
    return fd;
}

bool LogDevice::fillHeader(uint8_t* header, size_t payloadSize, int32_t pid, int32_t tid,
                           int64_t timeMs) {
    constexpr int64_t kLastMs = static_cast<int64_t>(UINT32_MAX) * 1000 + 999;
    if (header == nullptr || payloadSize > kMaxPayloadSize || timeMs < 0 || timeMs > kLastMs) {
        return false;
    }
    putUint16(header, static_cast<uint16_t>(payloadSize));
    putUint16(header + 2, 0);
    putUint32(header + 4, static_cast<uint32_t>(pid));
    putUint32(header + 8, static_cast<uint32_t>(tid));
    putUint32(header + 12, static_cast<uint32_t>(timeMs / 1000));
    putUint32(header + 16, static_cast<uint32_t>(timeMs % 1000) * 1000000u);
    return true;
}

} // namespace kelvo
