#define LOG_TAG "hwbinder"

#include "HidlHost.h"

#include <binder/IBinder.h>
#include <errno.h>
#include <log/log.h>
#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/prctl.h>
#include <sys/random.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <cstring>

#include "../binder/BinderSocket.h"
#include "kelvo/RootPath.h"

using android::BAD_TYPE;
using android::BAD_VALUE;
using android::DEAD_OBJECT;
using android::NO_ERROR;
using android::Parcel;
using android::sp;
using android::status_t;

namespace kelvo {

namespace {

std::atomic<HidlHost*> gHost{nullptr};

void onForkChild() {
    // The parent's threads do not exist here: a child starts afresh.
    gHost.store(nullptr);
}

void makeDirs(const std::string& dir) {
    for (size_t pos = dir.find('/', 1); pos != std::string::npos; pos = dir.find('/', pos + 1)) {
        mkdir(dir.substr(0, pos).c_str(), 0755);
    }
    mkdir(dir.c_str(), 0755);
}

bool setTimeouts(int fd, int ms) {
    struct timeval tv = {ms / 1000, (ms % 1000) * 1000};
    return setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv)) == 0 &&
           setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)) == 0;
}

uint64_t newIncarnation() {
    uint64_t value = 0;
    if (getrandom(&value, sizeof(value), GRND_NONBLOCK) != sizeof(value)) {
        value = (static_cast<uint64_t>(getpid()) << 32) ^ static_cast<uint64_t>(time(nullptr));
    }
    return value != 0 ? value : 1;
}

// Hardware-binder frames carry descriptors only.
status_t refuseBinder(const sp<android::IBinder>&, WireObject*) {
    return BAD_TYPE;
}

sp<android::IBinder> noBinder(const WireObject&) {
    return nullptr;
}

// Sends parcel as a frame of kind on fd.
status_t sendParcel(int fd, uint16_t kind, uint32_t code, const Parcel& parcel) {
    std::vector<uint8_t> table;
    std::vector<int> fds;
    status_t err = BinderFrame::encodeObjects(parcel, refuseBinder, &table, &fds);
    if (err != NO_ERROR) {
        return err;
    }
    if (parcel.dataSize() > BinderFrame::kMaxDataSize) {
        return android::FAILED_TRANSACTION;
    }
    FrameHeader header = {};
    header.magic = BinderFrame::kMagic;
    header.kind = kind;
    header.code = code;
    header.dataSize = static_cast<uint32_t>(parcel.dataSize());
    header.tableSize = static_cast<uint32_t>(table.size());
    return BinderSocket::send(fd, header, parcel.data(), table, fds);
}

// Reads one frame of kind into parcel; *code gets its code.
status_t receiveParcel(int fd, uint16_t kind, uint32_t* code, Parcel* parcel) {
    BinderSocket::Received frame;
    std::vector<WireObject> objects;
    status_t err = BinderSocket::receive(fd, &frame, &objects);
    if (err != NO_ERROR) {
        return err;
    }
    if (frame.header.kind != kind || frame.header.flags != 0 || frame.header.target != 0) {
        return BAD_VALUE;
    }
    for (const WireObject& object : objects) {
        if (object.kind != BinderFrame::kObjectFd) {
            return BAD_TYPE;
        }
    }
    *code = frame.header.code;
    return BinderFrame::fillParcel(parcel, frame.takeData(), frame.header.dataSize, objects,
                                   &frame.fds, noBinder);
}

} // namespace

HidlHost::Listener::~Listener() {
    if (fd >= 0) {
        close(fd);
    }
}

HidlHost& HidlHost::self() {
    HidlHost* host = gHost.load(std::memory_order_acquire);
    if (host != nullptr) {
        return *host;
    }
    static std::once_flag atFork;
    std::call_once(atFork, [] { pthread_atfork(nullptr, nullptr, onForkChild); });
    HidlHost* fresh = new HidlHost();
    if (!gHost.compare_exchange_strong(host, fresh)) {
        return *host;  // another thread won; this one stays unused
    }
    return *fresh;
}

HidlHost::HidlHost()
    : mWakeFd(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)), mChanges(0), mThreadCount(1), mStarted(0) {}

std::string HidlHost::socketPath(const std::string& interface, const std::string& instance) {
    return RootPath::resolve("/dev/binder") + "/.hw-" + interface + "-" + instance;
}

void HidlHost::setThreadCount(size_t count) {
    std::lock_guard<std::mutex> guard(mLock);
    mThreadCount = count < 1 ? 1 : (count > kMaxThreads ? kMaxThreads : count);
}

status_t HidlHost::registerService(const std::string& interface, const std::string& instance,
                                   const sp<HidlStub>& stub) {
    if (stub == nullptr || interface.empty() || instance.empty() ||
        instance.find('/') != std::string::npos) {
        return BAD_VALUE;
    }
    std::string path = socketPath(interface, instance);
    std::string dir = path.substr(0, path.rfind('/'));
    std::lock_guard<std::mutex> guard(mLock);
    makeDirs(dir);
    std::string tmp = dir + "/.new-hw-" + std::to_string(getpid()) + "-" + std::to_string(mChanges);
    if (path.size() > BinderSocket::maxPathLength() || tmp.size() > BinderSocket::maxPathLength()) {
        ALOGE("Socket path too long for %s/%s: %s", interface.c_str(), instance.c_str(),
              path.c_str());
        return BAD_VALUE;
    }
    int fd = BinderSocket::listenAt(path, tmp);
    if (fd < 0) {
        int e = errno;
        ALOGE("Cannot serve %s/%s at %s: %s", interface.c_str(), instance.c_str(), path.c_str(),
              strerror(e));
        return -e;
    }
    auto listener = std::make_shared<Listener>();
    listener->fd = fd;
    listener->incarnation = newIncarnation();
    listener->stub = stub;
    // A thread still polling the one replaced keeps it open until it looks
    // again; nobody reaches it at the path any more.
    mListeners[interface + "/" + instance] = listener;
    ++mChanges;
    while (mStarted < mThreadCount) {
        size_t index = ++mStarted;
        std::thread([this, index] {
            std::string name = "hwbinder:" + std::to_string(index);
            prctl(PR_SET_NAME, name.c_str(), 0, 0, 0);
            serve();
        }).detach();
    }
    wake();
    return NO_ERROR;
}

void HidlHost::wake() {
    uint64_t one = 1;
    ssize_t ignored = write(mWakeFd, &one, sizeof(one));
    (void)ignored;
}

void HidlHost::serve() {
    uint64_t seen = UINT64_MAX;
    std::vector<std::shared_ptr<Listener>> listeners;
    std::vector<struct pollfd> fds;
    for (;;) {
        {
            std::lock_guard<std::mutex> guard(mLock);
            if (seen != mChanges) {
                seen = mChanges;
                listeners.clear();
                for (const auto& entry : mListeners) {
                    listeners.push_back(entry.second);
                }
            }
        }
        fds.assign(1, {mWakeFd, POLLIN, 0});
        for (const auto& listener : listeners) {
            fds.push_back({listener->fd, POLLIN, 0});
        }
        // The time-out makes every thread see a change another one woke for.
        int n = poll(fds.data(), fds.size(), 1000);
        if (n <= 0) {
            continue;
        }
        if (fds[0].revents != 0) {
            uint64_t count = 0;
            ssize_t ignored = read(mWakeFd, &count, sizeof(count));
            (void)ignored;
        }
        for (size_t i = 1; i < fds.size(); ++i) {
            if (fds[i].revents == 0) {
                continue;
            }
            // The listening socket does not block: the other thread may
            // have taken the connection.
            int conn = accept4(listeners[i - 1]->fd, nullptr, nullptr, SOCK_CLOEXEC);
            if (conn >= 0) {
                serveConnection(conn, listeners[i - 1]);
                close(conn);
            }
        }
    }
}

void HidlHost::serveConnection(int fd, const std::shared_ptr<Listener>& listener) {
    // A caller that stalls holds this thread at most the frame time-out.
    if (!setTimeouts(fd, kFrameTimeoutMs) ||
        BinderSocket::sendHello(fd, listener->incarnation) != NO_ERROR) {
        return;
    }
    Parcel data;
    uint32_t code = 0;
    status_t err = receiveParcel(fd, BinderFrame::kTransaction, &code, &data);
    if (err != NO_ERROR) {
        if (err != DEAD_OBJECT) {
            ALOGW("Dropped a malformed or stalled call: %d", err);
        }
        return;
    }
    data.setDataPosition(0);
    Parcel reply;
    status_t status = listener->stub->onTransact(code, data, &reply);
    if (status != NO_ERROR) {
        reply.freeData();
    }
    sendParcel(fd, BinderFrame::kReply, static_cast<uint32_t>(status), reply);
}

int HidlHost::connect(const std::string& interface, const std::string& instance,
                      status_t* err) {
    uint64_t incarnation = 0;
    int fd = BinderSocket::connect(socketPath(interface, instance), &incarnation, kCallTimeoutMs,
                                   err);
    if (fd >= 0 && !setTimeouts(fd, kCallTimeoutMs)) {
        close(fd);
        *err = android::NO_MEMORY;
        return -1;
    }
    return fd;
}

status_t HidlHost::transact(int fd, uint32_t code, const Parcel& data, Parcel* reply) {
    status_t err = sendParcel(fd, BinderFrame::kTransaction, code, data);
    uint32_t status = 0;
    if (err == NO_ERROR) {
        err = receiveParcel(fd, BinderFrame::kReply, &status, reply);
    }
    close(fd);
    if (err != NO_ERROR) {
        return err;
    }
    reply->setDataPosition(0);
    return static_cast<status_t>(status);
}

} // namespace kelvo
