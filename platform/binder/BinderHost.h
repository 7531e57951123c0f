#pragma once

// The process's side of the host binder transport: the sockets it serves
// (one per registered service, one for the objects it hands out), the
// thread pool that serves them, and the peers (other processes' sockets) it
// talks to. A forked child starts afresh: the parent's sockets are closed in
// it, and the parent's proxies are dead there.

#include <binder/IBinder.h>
#include <stdint.h>
#include <sys/types.h>

#include <condition_variable>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "BinderFrame.h"

namespace kelvo {

class BinderPeer;
class DeathNotifier;

class BinderHost {
public:
    static constexpr size_t kDefaultMaxThreads = 15;
    // How long a connection waits for the server's hello.
    static constexpr int kHelloTimeoutMs = 10000;
    // How long a server waits for the rest of a frame that has begun.
    static constexpr int kFrameTimeoutMs = 5000;

    // The state of this process (a fresh one in a forked child).
    static BinderHost& self();
    // Counts forks: transport objects made before a fork are void after it.
    static uint32_t generation();
    // Marks fd as the transport's own (closed in a forked child).
    static int adoptFd(int fd);
    // Closes a descriptor of the transport if it still belongs to this
    // process generation.
    static void closeFd(int fd, uint32_t generation);

    // Services served by this process.
    android::status_t addService(const std::string& name,
                                 const android::sp<android::IBinder>& service);
    android::status_t stopService(const std::string& name);
    // A proxy to whatever serves the name now, or null.
    android::sp<android::IBinder> checkService(const std::string& name);
    std::vector<std::string> listServices();
    static std::string socketDir();

    // Objects in frames.
    android::status_t exportObject(const android::sp<android::IBinder>& binder, WireObject* out);
    android::sp<android::IBinder> importObject(const WireObject& object);

    // The pool.
    void startPool();
    void joinPool();
    void stopPool();
    void setMaxThreads(size_t maxThreads);

    DeathNotifier& deathNotifier() { return *mDeathNotifier; }

    // Runs a transaction on this thread as the caller pid/uid.
    static android::status_t execute(const android::sp<android::IBinder>& target, uint32_t code,
                                     const android::Parcel& data, android::Parcel* reply,
                                     uint32_t flags, pid_t pid, uid_t uid);

private:
    // A socket this process serves.
    struct Listener {
        uint64_t key = 0;
        int fd = -1;
        std::string name;
        std::string path;
        uint64_t incarnation = 0;
        android::sp<android::IBinder> root;  // the service; null for the endpoint
        bool stopped = false;
        dev_t dev = 0;
        ino_t ino = 0;
        std::vector<uint64_t> connections;
    };
    // An accepted connection, with its caller's credentials.
    struct Connection {
        uint64_t key = 0;
        int fd = -1;
        std::shared_ptr<Listener> listener;
        pid_t pid = 0;
        uid_t uid = 0;
    };
    struct AsyncWork {
        android::sp<android::IBinder> target;
        uint32_t code = 0;
        uint32_t flags = 0;
        std::unique_ptr<android::Parcel> data;
        pid_t pid = 0;
        uid_t uid = 0;
    };
    // One-way calls to one object wait here and run one at a time.
    struct AsyncQueue {
        std::deque<AsyncWork> items;
        bool running = false;
    };

    BinderHost();
    ~BinderHost() = delete;  // never destroyed: threads may use it at exit

    std::shared_ptr<BinderPeer> peerFor(const std::string& dir, const std::string& name,
                                        uint64_t incarnation);
    android::status_t listenLocked(const std::string& dir, const std::string& name,
                                   const android::sp<android::IBinder>& root,
                                   std::shared_ptr<Listener>* out);
    // By value: the caller's reference may sit in a map this erases from.
    void stopListenerLocked(std::shared_ptr<Listener> listener);
    android::status_t ensureEndpointLocked(const std::string& dir);
    void spawnLocked();
    void serve(bool joined);
    void handleEvent(uint64_t key);
    void handleListener(const std::shared_ptr<Listener>& listener);
    void handleConnection(const std::shared_ptr<Connection>& conn);
    void closeConnection(const std::shared_ptr<Connection>& conn);
    void rearm(int fd, uint64_t key);
    void drain(android::IBinder* target);
    void sendReply(const std::shared_ptr<Connection>& conn, android::status_t status,
                   const android::Parcel& reply);
    android::sp<android::IBinder> targetFor(const std::shared_ptr<Connection>& conn, uint64_t id);
    uint64_t newIncarnation();

    const uint32_t mGeneration;
    const int mEpoll;
    const int mStopFd;
    DeathNotifier* const mDeathNotifier;

    std::mutex mLock;
    std::condition_variable mThreadsChanged;
    uint64_t mNextKey;
    uint64_t mNextObjectId;
    uint32_t mNextSocketSeq;
    std::map<uint64_t, std::shared_ptr<Listener>> mListeners;
    std::map<uint64_t, std::shared_ptr<Connection>> mConnections;
    // Sockets of this process by path.
    std::map<std::string, std::shared_ptr<Listener>> mListenersByPath;
    std::shared_ptr<Listener> mEndpoint;
    // Objects handed out, kept alive for the life of the endpoint.
    std::map<uint64_t, android::sp<android::IBinder>> mExported;
    std::map<android::IBinder*, uint64_t> mExportIds;
    std::map<android::IBinder*, AsyncQueue> mAsync;
    std::map<std::string, std::weak_ptr<BinderPeer>> mPeers;

    bool mPoolStarted;
    bool mStopping;
    size_t mMaxThreads;
    size_t mThreads;
    size_t mIdle;
    size_t mSpawned;
};

} // namespace kelvo
