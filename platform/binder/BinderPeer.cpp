#define LOG_TAG "binder"

#include "BinderPeer.h"

#include <log/log.h>
#include <unistd.h>

#include "BinderHost.h"
#include "BinderSocket.h"
#include "DeathNotifier.h"

using android::BpBinder;
using android::DEAD_OBJECT;
using android::FAILED_TRANSACTION;
using android::IBinder;
using android::NO_ERROR;
using android::Parcel;
using android::sp;
using android::status_t;
using android::wp;

namespace kelvo {

BinderPeer::BinderPeer(const std::string& path, const std::string& name, uint64_t incarnation,
                       uint32_t generation)
    : mPath(path),
      mName(name),
      mIncarnation(incarnation),
      mGeneration(generation),
      mDead(false),
      mWatching(false),
      mOnewayFd(-1) {}

BinderPeer::~BinderPeer() {
    for (int fd : mIdle) {
        BinderHost::closeFd(fd, mGeneration);
    }
    if (mOnewayFd >= 0) {
        BinderHost::closeFd(mOnewayFd, mGeneration);
    }
    if (mWatching && mGeneration == BinderHost::generation()) {
        BinderHost::self().deathNotifier().wake();
    }
}

bool BinderPeer::isAlive() const {
    return !mDead.load() && mGeneration == BinderHost::generation();
}

int BinderPeer::connect(status_t* err) {
    uint64_t incarnation = 0;
    int fd = BinderSocket::connect(mPath, &incarnation, BinderHost::kHelloTimeoutMs, err);
    if (fd < 0) {
        if (*err == DEAD_OBJECT) {
            markDead();
        }
        return -1;
    }
    if (incarnation != mIncarnation) {
        // Another server took the name: this one is gone.
        close(fd);
        markDead();
        *err = DEAD_OBJECT;
        return -1;
    }
    return BinderHost::adoptFd(fd);
}

int BinderPeer::takeConnection(status_t* err) {
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (!mIdle.empty()) {
            int fd = mIdle.back();
            mIdle.pop_back();
            return fd;
        }
    }
    return connect(err);
}

void BinderPeer::returnConnection(int fd) {
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (!mDead.load() && mIdle.size() < kMaxIdleConnections) {
            mIdle.push_back(fd);
            return;
        }
    }
    dropConnection(fd);
}

void BinderPeer::dropConnection(int fd) {
    BinderHost::closeFd(fd, mGeneration);
}

void BinderPeer::adoptConnection(int fd) {
    returnConnection(BinderHost::adoptFd(fd));
}

status_t BinderPeer::transact(uint64_t target, uint32_t code, const Parcel& data, Parcel* reply,
                              uint32_t flags) {
    if (!isAlive()) {
        return DEAD_OBJECT;
    }
    if (data.dataSize() > BinderFrame::kMaxDataSize) {
        ALOGW("Transaction of %zu bytes to %s is too large", data.dataSize(), mName.c_str());
        return FAILED_TRANSACTION;
    }
    BinderHost& host = BinderHost::self();
    std::vector<uint8_t> table;
    std::vector<int> fds;
    status_t err = BinderFrame::encodeObjects(
        data, [&host](const sp<IBinder>& b, WireObject* w) { return host.exportObject(b, w); },
        &table, &fds);
    if (err != NO_ERROR) {
        return err;
    }
    FrameHeader header = {};
    header.magic = BinderFrame::kMagic;
    header.kind = BinderFrame::kTransaction;
    header.code = code;
    header.flags = flags & IBinder::FLAG_ONEWAY;
    header.target = target;
    header.dataSize = static_cast<uint32_t>(data.dataSize());
    header.tableSize = static_cast<uint32_t>(table.size());

    if ((flags & IBinder::FLAG_ONEWAY) != 0) {
        std::lock_guard<std::mutex> guard(mOnewayLock);
        if (mOnewayFd < 0) {
            mOnewayFd = connect(&err);
            if (mOnewayFd < 0) {
                return err;
            }
        }
        err = BinderSocket::send(mOnewayFd, header, data.data(), table, fds);
        if (err != NO_ERROR) {
            dropConnection(mOnewayFd);
            mOnewayFd = -1;
            markDead();
            return DEAD_OBJECT;
        }
        return NO_ERROR;
    }

    int fd = takeConnection(&err);
    if (fd < 0) {
        return err;
    }
    err = BinderSocket::send(fd, header, data.data(), table, fds);
    if (err != NO_ERROR) {
        dropConnection(fd);
        markDead();
        return DEAD_OBJECT;
    }
    BinderSocket::Received frame;
    std::vector<WireObject> objects;
    err = BinderSocket::receive(fd, &frame, &objects);
    if (err != NO_ERROR || frame.header.kind != BinderFrame::kReply) {
        dropConnection(fd);
        if (err == DEAD_OBJECT) {
            markDead();
            return DEAD_OBJECT;
        }
        ALOGE("Malformed reply from %s (%d)", mName.c_str(), err);
        return FAILED_TRANSACTION;
    }
    returnConnection(fd);
    status_t status = static_cast<status_t>(static_cast<int32_t>(frame.header.code));
    if (reply != nullptr) {
        err = BinderFrame::fillParcel(
            reply, frame.takeData(), frame.header.dataSize, objects, &frame.fds,
            [&host](const WireObject& w) { return host.importObject(w); });
        if (err != NO_ERROR) {
            ALOGE("Reply from %s names objects that cannot be reached", mName.c_str());
            return status != NO_ERROR ? status : FAILED_TRANSACTION;
        }
    }
    return status;
}

sp<IBinder> BinderPeer::proxyFor(uint64_t id) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mProxies.find(id);
    if (it != mProxies.end()) {
        sp<BpBinder> existing = it->second.promote();
        if (existing != nullptr) {
            return existing;
        }
    }
    sp<BpBinder> proxy = new BpBinder(shared_from_this(), id);
    mProxies[id] = proxy;
    return proxy;
}

void BinderPeer::forgetProxy(uint64_t id, const BpBinder* proxy) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mProxies.find(id);
    if (it != mProxies.end() && it->second.unsafe_get() == proxy) {
        mProxies.erase(it);
    }
}

std::vector<sp<BpBinder>> BinderPeer::proxies() {
    std::vector<sp<BpBinder>> out;
    std::lock_guard<std::mutex> guard(mLock);
    for (auto& entry : mProxies) {
        sp<BpBinder> proxy = entry.second.promote();
        if (proxy != nullptr) {
            out.push_back(proxy);
        }
    }
    return out;
}

status_t BinderPeer::watch() {
    if (!isAlive()) {
        return DEAD_OBJECT;
    }
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (mWatching) {
            return NO_ERROR;
        }
        mWatching = true;
    }
    status_t err = NO_ERROR;
    int fd = connect(&err);
    if (fd < 0) {
        std::lock_guard<std::mutex> guard(mLock);
        mWatching = false;
        return err;
    }
    BinderHost::self().deathNotifier().watch(shared_from_this(), fd);
    return NO_ERROR;
}

void BinderPeer::markDead() {
    if (mDead.exchange(true) || mGeneration != BinderHost::generation()) {
        return;
    }
    std::vector<int> idle;
    {
        std::lock_guard<std::mutex> guard(mLock);
        idle.swap(mIdle);
    }
    for (int fd : idle) {
        dropConnection(fd);
    }
    BinderHost::self().deathNotifier().postDeath(shared_from_this());
}

} // namespace kelvo
