#include "BinderSocket.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdio.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

using android::BAD_VALUE;
using android::DEAD_OBJECT;
using android::FAILED_TRANSACTION;
using android::NO_ERROR;
using android::NO_MEMORY;
using android::status_t;
using android::TIMED_OUT;

namespace kelvo {

namespace {

bool fillAddress(const std::string& path, sockaddr_un* addr) {
    memset(addr, 0, sizeof(*addr));
    addr->sun_family = AF_UNIX;
    if (path.empty() || path.size() >= sizeof(addr->sun_path)) {
        return false;
    }
    memcpy(addr->sun_path, path.c_str(), path.size() + 1);
    return true;
}

status_t ioError(int e) {
    if (e == EAGAIN || e == EWOULDBLOCK) {
        return TIMED_OUT;
    }
    return DEAD_OBJECT;
}

// Reads exactly len bytes, collecting any descriptors that come with them.
status_t readFully(int fd, void* buf, size_t len, std::vector<int>* fds) {
    uint8_t* p = static_cast<uint8_t*>(buf);
    size_t got = 0;
    alignas(struct cmsghdr) char control[CMSG_SPACE(BinderFrame::kMaxFds * sizeof(int))];
    while (got < len) {
        struct iovec iov = {p + got, len - got};
        struct msghdr msg = {};
        msg.msg_iov = &iov;
        msg.msg_iovlen = 1;
        msg.msg_control = control;
        msg.msg_controllen = sizeof(control);
        ssize_t n = recvmsg(fd, &msg, MSG_CMSG_CLOEXEC);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        bool truncated = n >= 0 && (msg.msg_flags & MSG_CTRUNC) != 0;
        if (n > 0 || truncated) {
            for (struct cmsghdr* c = CMSG_FIRSTHDR(&msg); c != nullptr; c = CMSG_NXTHDR(&msg, c)) {
                if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) {
                    continue;
                }
                size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
                for (size_t i = 0; i < count; ++i) {
                    int received = -1;
                    memcpy(&received, CMSG_DATA(c) + i * sizeof(int), sizeof(int));
                    fds->push_back(received);
                }
            }
        }
        if (n < 0) {
            return ioError(errno);
        }
        if (n == 0) {
            return DEAD_OBJECT;
        }
        if (truncated || fds->size() > BinderFrame::kMaxFds) {
            return BAD_VALUE;
        }
        got += static_cast<size_t>(n);
    }
    return NO_ERROR;
}

} // namespace

BinderSocket::Received::~Received() {
    free(data);
    for (int fd : fds) {
        if (fd >= 0) {
            close(fd);
        }
    }
}

uint8_t* BinderSocket::Received::takeData() {
    uint8_t* out = data;
    data = nullptr;
    return out;
}

size_t BinderSocket::maxPathLength() {
    return sizeof(sockaddr_un::sun_path) - 1;
}

int BinderSocket::connect(const std::string& path, uint64_t* incarnation, int timeoutMs,
                          status_t* err) {
    sockaddr_un addr;
    if (!fillAddress(path, &addr)) {
        *err = BAD_VALUE;
        return -1;
    }
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        *err = NO_MEMORY;
        return -1;
    }
    int rc;
    do {
        rc = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr));
    } while (rc != 0 && errno == EINTR);
    if (rc != 0) {
        int e = errno;
        close(fd);
        // Nothing listens there (a dead server's socket, or none at all).
        *err = (e == ECONNREFUSED || e == ENOENT || e == ENOTDIR || e == ENOTSOCK || e == EACCES ||
                e == ECONNRESET)
                   ? DEAD_OBJECT
                   : FAILED_TRANSACTION;
        return -1;
    }
    struct pollfd pfd = {fd, POLLIN, 0};
    do {
        rc = poll(&pfd, 1, timeoutMs);
    } while (rc < 0 && errno == EINTR);
    if (rc <= 0) {
        close(fd);
        *err = TIMED_OUT;
        return -1;
    }
    FrameHeader hello = {};
    std::vector<int> fds;
    status_t got = readFully(fd, &hello, sizeof(hello), &fds);
    for (int extra : fds) {
        close(extra);
    }
    if (got != NO_ERROR || !fds.empty() || hello.kind != BinderFrame::kHello ||
        BinderFrame::checkHeader(hello) != NO_ERROR) {
        close(fd);
        *err = got == TIMED_OUT ? TIMED_OUT : DEAD_OBJECT;
        return -1;
    }
    *incarnation = hello.target;
    *err = NO_ERROR;
    return fd;
}

int BinderSocket::listenAt(const std::string& path, const std::string& tmpPath) {
    sockaddr_un addr;
    if (!fillAddress(tmpPath, &addr) || path.size() > maxPathLength()) {
        errno = ENAMETOOLONG;
        return -1;
    }
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0) {
        return -1;
    }
    unlink(tmpPath.c_str());
    if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
        int e = errno;
        close(fd);
        errno = e;
        return -1;
    }
    // Other uids connect too (their calls are told apart by credentials).
    chmod(tmpPath.c_str(), 0666);
    if (listen(fd, 128) != 0 || rename(tmpPath.c_str(), path.c_str()) != 0) {
        int e = errno;
        unlink(tmpPath.c_str());
        close(fd);
        errno = e;
        return -1;
    }
    return fd;
}

status_t BinderSocket::sendHello(int fd, uint64_t incarnation) {
    FrameHeader hello = {};
    hello.magic = BinderFrame::kMagic;
    hello.kind = BinderFrame::kHello;
    hello.code = BinderFrame::kProtocolVersion;
    hello.target = incarnation;
    return send(fd, hello, nullptr, {}, {});
}

status_t BinderSocket::send(int fd, const FrameHeader& header, const uint8_t* data,
                            const std::vector<uint8_t>& table, const std::vector<int>& fds) {
    if (fds.size() > BinderFrame::kMaxFds) {
        return BAD_VALUE;
    }
    struct iovec iov[3];
    size_t iovCount = 0;
    iov[iovCount++] = {const_cast<FrameHeader*>(&header), sizeof(header)};
    if (header.dataSize != 0) {
        iov[iovCount++] = {const_cast<uint8_t*>(data), header.dataSize};
    }
    if (!table.empty()) {
        iov[iovCount++] = {const_cast<uint8_t*>(table.data()), table.size()};
    }
    size_t total = sizeof(header) + header.dataSize + table.size();
    alignas(struct cmsghdr) char control[CMSG_SPACE(BinderFrame::kMaxFds * sizeof(int))];
    size_t sent = 0;
    bool fdsSent = fds.empty();
    while (sent < total) {
        // Skip what is already out.
        struct iovec part[3];
        size_t partCount = 0;
        size_t skip = sent;
        for (size_t i = 0; i < iovCount; ++i) {
            if (skip >= iov[i].iov_len) {
                skip -= iov[i].iov_len;
                continue;
            }
            part[partCount++] = {static_cast<uint8_t*>(iov[i].iov_base) + skip,
                                 iov[i].iov_len - skip};
            skip = 0;
        }
        struct msghdr msg = {};
        msg.msg_iov = part;
        msg.msg_iovlen = partCount;
        if (!fdsSent) {
            size_t bytes = fds.size() * sizeof(int);
            memset(control, 0, sizeof(control));
            msg.msg_control = control;
            msg.msg_controllen = CMSG_SPACE(bytes);
            struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
            c->cmsg_level = SOL_SOCKET;
            c->cmsg_type = SCM_RIGHTS;
            c->cmsg_len = CMSG_LEN(bytes);
            memcpy(CMSG_DATA(c), fds.data(), bytes);
        }
        ssize_t n = sendmsg(fd, &msg, MSG_NOSIGNAL);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return ioError(errno);
        }
        fdsSent = true;
        sent += static_cast<size_t>(n);
    }
    return NO_ERROR;
}

status_t BinderSocket::receive(int fd, Received* out, std::vector<WireObject>* objects) {
    status_t err = readFully(fd, &out->header, sizeof(out->header), &out->fds);
    if (err != NO_ERROR) {
        return err;
    }
    err = BinderFrame::checkHeader(out->header);
    if (err != NO_ERROR) {
        return err;
    }
    if (out->header.dataSize != 0) {
        out->data = static_cast<uint8_t*>(malloc(out->header.dataSize));
        if (out->data == nullptr) {
            return NO_MEMORY;
        }
        err = readFully(fd, out->data, out->header.dataSize, &out->fds);
        if (err != NO_ERROR) {
            return err;
        }
    }
    if (out->header.tableSize != 0) {
        out->table.resize(out->header.tableSize);
        err = readFully(fd, out->table.data(), out->table.size(), &out->fds);
        if (err != NO_ERROR) {
            return err;
        }
    }
    return BinderFrame::parseObjects(out->data, out->header.dataSize, out->table.data(),
                                     out->table.size(), out->fds.size(), objects);
}

} // namespace kelvo
