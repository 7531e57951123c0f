#include "kelvo/KernelDevice.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "kelvo/RootPath.h"

namespace kelvo {

namespace {

// Waits until the socket is ready for the events; false with errno set on a
// time-out (ETIMEDOUT) or an error.
bool waitReady(int fd, short events) {
    struct pollfd p = {fd, events, 0};
    int n;
    do {
        n = poll(&p, 1, KernelDevice::kSocketTimeoutMs);
    } while (n < 0 && errno == EINTR);
    if (n == 0) {
        errno = ETIMEDOUT;
        return false;
    }
    return n > 0;
}

bool sendAll(int fd, const uint8_t* data, size_t size) {
    while (size > 0) {
        if (!waitReady(fd, POLLOUT)) {
            return false;
        }
        ssize_t n = send(fd, data, size, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (n < 0) {
            if (errno == EINTR || errno == EAGAIN) {
                continue;
            }
            return false;
        }
        data += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

bool receiveAll(int fd, uint8_t* data, size_t size) {
    while (size > 0) {
        if (!waitReady(fd, POLLIN)) {
            return false;
        }
        ssize_t n = recv(fd, data, size, MSG_DONTWAIT);
        if (n == 0) {
            errno = EIO;
            return false;
        }
        if (n < 0) {
            if (errno == EINTR || errno == EAGAIN) {
                continue;
            }
            return false;
        }
        data += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

int connectSocket(const std::string& path) {
    struct sockaddr_un addr;
    if (path.size() >= sizeof(addr.sun_path)) {
        errno = ENAMETOOLONG;
        return -1;
    }
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return -1;
    }
    if (connect(fd, reinterpret_cast<const struct sockaddr*>(&addr), sizeof(addr)) != 0) {
        int saved = errno;
        ::close(fd);
        errno = saved;
        return -1;
    }
    return fd;
}

int socketRequest(int fd, uint32_t request, void* arg, size_t size) {
    uint8_t header[8];
    KernelDevice::putUint32(header, request);
    KernelDevice::putUint32(header + 4, static_cast<uint32_t>(size));
    if (!sendAll(fd, header, sizeof(header)) ||
        !sendAll(fd, static_cast<const uint8_t*>(arg), size)) {
        return -1;
    }
    uint8_t reply[8];
    if (!receiveAll(fd, reply, sizeof(reply))) {
        return -1;
    }
    // The bytes go to a copy first: a failed or cut reply leaves the
    // caller's argument as it was.
    std::string bytes(size, '\0');
    if (!receiveAll(fd, reinterpret_cast<uint8_t*>(&bytes[0]), size)) {
        return -1;
    }
    int32_t result = static_cast<int32_t>(KernelDevice::getUint32(reply));
    int32_t error = static_cast<int32_t>(KernelDevice::getUint32(reply + 4));
    if (result < 0) {
        errno = error > 0 ? error : EIO;
        return -1;
    }
    if (size > 0) {
        memcpy(arg, bytes.data(), size);
    }
    return result;
}

} // namespace

void KernelDevice::putUint32(uint8_t* at, uint32_t value) {
    for (int i = 0; i < 4; ++i) {
        at[i] = static_cast<uint8_t>(value >> (8 * i));
    }
}

uint32_t KernelDevice::getUint32(const uint8_t* at) {
    uint32_t value = 0;
    for (int i = 0; i < 4; ++i) {
        value |= static_cast<uint32_t>(at[i]) << (8 * i);
    }
    return value;
}

int KernelDevice::open(const char* devicePath) {
    if (devicePath == nullptr) {
        errno = EINVAL;
        return -1;
    }
    std::string path = RootPath::resolve(devicePath);
    struct stat st;
    if (stat(path.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) {
        return connectSocket(path);
    }
    return ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
}

int KernelDevice::ioctl(int fd, uint32_t request, void* arg, size_t size) {
    if (fd < 0) {
        errno = EBADF;
        return -1;
    }
    if ((arg == nullptr && size > 0) || size > kMaxArgumentBytes) {
        errno = EINVAL;
        return -1;
    }
    struct stat st;
    if (fstat(fd, &st) != 0) {
        return -1;
    }
    if (S_ISSOCK(st.st_mode)) {
        return socketRequest(fd, request, arg, size);
    }
    int result;
    do {
        result = ::ioctl(fd, static_cast<unsigned long>(request), arg);
    } while (result < 0 && errno == EINTR);
    return result;
}

void KernelDevice::close(int fd) {
    if (fd >= 0) {
        ::close(fd);
    }
}

} // namespace kelvo
