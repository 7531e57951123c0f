#pragma once

// The process's side of the host hardware-binder transport: the services it
// serves, each a socket under <root>/dev/binder/, its own small thread pool
// (apart from the binder pool) and the client's one-call connections. Frames
// are the binder transport's (BinderFrame, BinderSocket); a connection
// carries one transaction and its reply, then closes.

#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/Errors.h>
#include <utils/RefBase.h>

#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace kelvo {

// What answers the calls of one service.
class HidlStub : public virtual android::RefBase {
public:
    // data is positioned at its start; descriptors in it are valid for the
    // call only.
    virtual android::status_t onTransact(uint32_t code, const android::Parcel& data,
                                         android::Parcel* reply) = 0;
};

class HidlHost {
public:
    static constexpr size_t kMaxThreads = 2;
    // How long a server waits for a call's frame, and for its reply to go.
    static constexpr int kFrameTimeoutMs = 5000;
    // How long a client waits for the hello and for the reply.
    static constexpr int kCallTimeoutMs = 10000;

    static HidlHost& self();

    // <root>/dev/binder/.hw-<interface>-<instance>.
    static std::string socketPath(const std::string& interface, const std::string& instance);

    void setThreadCount(size_t count);

    // Serves the stub at the interface's instance, replacing what this
    // process served there before (whatever the root then). Starts the pool.
    android::status_t registerService(const std::string& interface, const std::string& instance,
                                      const android::sp<HidlStub>& stub);

    // Client: a connection to the instance, its hello read; -1 with *err
    // (DEAD_OBJECT when nothing serves it).
    static int connect(const std::string& interface, const std::string& instance,
                       android::status_t* err);
    // Sends one call on the connection and reads its reply; closes fd.
    static android::status_t transact(int fd, uint32_t code, const android::Parcel& data,
                                      android::Parcel* reply);

private:
    struct Listener {
        int fd = -1;
        uint64_t incarnation = 0;
        android::sp<HidlStub> stub;
        ~Listener();
    };

    HidlHost();
    ~HidlHost() = delete;

    void serve();
    void serveConnection(int fd, const std::shared_ptr<Listener>& listener);
    void wake();

    const int mWakeFd;
    std::mutex mLock;
    // By interface and instance.
    std::map<std::string, std::shared_ptr<Listener>> mListeners;
    uint64_t mChanges;
    size_t mThreadCount;
    size_t mStarted;
};

} // namespace kelvo
