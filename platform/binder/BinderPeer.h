#pragma once

// The client side of one socket of another process (or of a service of this
// one): its connections, its proxies and whether it is still alive. One
// incarnation of a socket: when the server restarts at the same path, the
// old peer stays dead and the new one is another peer.

#include <binder/BpBinder.h>
#include <binder/Parcel.h>
#include <stdint.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace kelvo {

class BinderPeer : public std::enable_shared_from_this<BinderPeer> {
public:
    // Idle two-way connections kept for reuse.
    static constexpr size_t kMaxIdleConnections = 8;

    BinderPeer(const std::string& path, const std::string& name, uint64_t incarnation,
               uint32_t generation);
    ~BinderPeer();
    BinderPeer(const BinderPeer&) = delete;
    BinderPeer& operator=(const BinderPeer&) = delete;

    const std::string& path() const { return mPath; }
    const std::string& name() const { return mName; }
    uint64_t incarnation() const { return mIncarnation; }
    bool isAlive() const;

    android::status_t transact(uint64_t target, uint32_t code, const android::Parcel& data,
                               android::Parcel* reply, uint32_t flags);

    // Keeps a connection made by a lookup for the next call.
    void adoptConnection(int fd);

    // The one proxy of object id here.
    android::sp<android::IBinder> proxyFor(uint64_t id);
    void forgetProxy(uint64_t id, const android::BpBinder* proxy);
    std::vector<android::sp<android::BpBinder>> proxies();

    // Opens the connection whose closing tells that the peer died.
    android::status_t watch();

    // Marks the peer dead (once) and has its proxies' recipients told.
    void markDead();

private:
    // A new connection to this very incarnation, or -1 with *err.
    int connect(android::status_t* err);
    int takeConnection(android::status_t* err);
    void returnConnection(int fd);
    void dropConnection(int fd);

    const std::string mPath;
    const std::string mName;
    const uint64_t mIncarnation;
    const uint32_t mGeneration;

    std::atomic<bool> mDead;
    std::mutex mLock;
    std::vector<int> mIdle;
    bool mWatching;
    std::map<uint64_t, android::wp<android::BpBinder>> mProxies;

    // One-way calls share one connection, so they arrive in order.
    std::mutex mOnewayLock;
    int mOnewayFd;
};

} // namespace kelvo
