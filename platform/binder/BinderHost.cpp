#define LOG_TAG "binder"

#include "BinderHost.h"

#include <binder/BpBinder.h>
#include <binder/IPCThreadState.h>
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <log/log.h>
#include <pthread.h>
#include <stdio.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/prctl.h>
#include <sys/random.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstring>
#include <thread>

#include "BinderPeer.h"
#include "BinderSocket.h"
#include "DeathNotifier.h"
#include "kelvo/RootPath.h"

using android::BAD_VALUE;
using android::BpBinder;
using android::FAILED_TRANSACTION;
using android::IBinder;
using android::IPCThreadState;
using android::NAME_NOT_FOUND;
using android::NO_ERROR;
using android::Parcel;
using android::sp;
using android::status_t;

namespace kelvo {

namespace {

// Descriptors of the transport, closed in a forked child. Kept in a plain
// table so the fork handler needs no lock.
constexpr int kMaxTrackedFd = 65536;
std::atomic<uint8_t> gOwnedFds[kMaxTrackedFd];
std::atomic<uint32_t> gGeneration{1};
std::atomic<BinderHost*> gHost{nullptr};

void onForkChild() {
    for (int fd = 0; fd < kMaxTrackedFd; ++fd) {
        if (gOwnedFds[fd].exchange(0) != 0) {
            close(fd);
        }
    }
    gGeneration.fetch_add(1);
    // The parent's state stays behind (its threads do not exist here).
    gHost.store(nullptr);
}

void makeDirs(const std::string& dir) {
    for (size_t pos = dir.find('/', 1); pos != std::string::npos; pos = dir.find('/', pos + 1)) {
        mkdir(dir.substr(0, pos).c_str(), 0755);
    }
    mkdir(dir.c_str(), 0755);
}

} // namespace

uint32_t BinderHost::generation() {
    return gGeneration.load();
}

int BinderHost::adoptFd(int fd) {
    if (fd >= 0 && fd < kMaxTrackedFd) {
        gOwnedFds[fd].store(1);
    }
    return fd;
}

void BinderHost::closeFd(int fd, uint32_t generation) {
    if (fd < 0 || generation != gGeneration.load()) {
        return;  // a forked child closed it already; the number may be reused
    }
    if (fd < kMaxTrackedFd) {
        gOwnedFds[fd].store(0);
    }
    close(fd);
}

BinderHost& BinderHost::self() {
    BinderHost* host = gHost.load(std::memory_order_acquire);
    if (host != nullptr) {
        return *host;
    }
    static std::once_flag atFork;
    std::call_once(atFork, [] { pthread_atfork(nullptr, nullptr, onForkChild); });
    BinderHost* fresh = new BinderHost();
    if (!gHost.compare_exchange_strong(host, fresh)) {
        // Another thread won the race; this one stays unused.
        return *host;
    }
    return *fresh;
}

BinderHost::BinderHost()
    : mGeneration(gGeneration.load()),
      mEpoll(adoptFd(epoll_create1(EPOLL_CLOEXEC))),
      mStopFd(adoptFd(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK))),
      mDeathNotifier(new DeathNotifier(gGeneration.load())),
      mNextKey(1),
      mNextObjectId(1),
      mNextSocketSeq(1),
      mPoolStarted(false),
      mStopping(false),
      mMaxThreads(kDefaultMaxThreads),
      mThreads(0),
      mIdle(0),
      mSpawned(0) {
    struct epoll_event ev = {};
    ev.events = EPOLLIN;
    ev.data.u64 = 0;  // key 0: the stop event
    epoll_ctl(mEpoll, EPOLL_CTL_ADD, mStopFd, &ev);
}

std::string BinderHost::socketDir() {
    return RootPath::resolve("/dev/binder");
}

uint64_t BinderHost::newIncarnation() {
    uint64_t value = 0;
    if (getrandom(&value, sizeof(value), GRND_NONBLOCK) != sizeof(value)) {
        struct timespec ts;
        clock_gettime(CLOCK_MONOTONIC, &ts);
        value = (static_cast<uint64_t>(getpid()) << 40) ^ static_cast<uint64_t>(ts.tv_nsec) ^
                (static_cast<uint64_t>(ts.tv_sec) << 20) ^ mNextKey;
    }
    return value != 0 ? value : 1;
}

// ---------------------------------------------------------------------------
// Sockets this process serves.

status_t BinderHost::listenLocked(const std::string& dir, const std::string& name,
                                  const sp<IBinder>& root, std::shared_ptr<Listener>* out) {
    makeDirs(dir);
    std::string path = dir + "/" + name;
    std::string tmp =
        dir + "/.new-" + std::to_string(getpid()) + "-" + std::to_string(mNextSocketSeq++);
    if (path.size() > BinderSocket::maxPathLength() || tmp.size() > BinderSocket::maxPathLength()) {
        ALOGE("Socket path too long for %s: %s", name.c_str(), path.c_str());
        return BAD_VALUE;
    }
    int fd = BinderSocket::listenAt(path, tmp);
    if (fd < 0) {
        int e = errno;
        ALOGE("Cannot serve %s at %s: %s", name.c_str(), path.c_str(), strerror(e));
        return -e;
    }
    adoptFd(fd);
    auto listener = std::make_shared<Listener>();
    listener->key = mNextKey++;
    listener->fd = fd;
    listener->name = name;
    listener->path = path;
    listener->incarnation = newIncarnation();
    listener->root = root;
    struct stat st = {};
    if (stat(path.c_str(), &st) == 0) {
        listener->dev = st.st_dev;
        listener->ino = st.st_ino;
    }
    auto old = mListenersByPath.find(path);
    if (old != mListenersByPath.end()) {
        // Registered again: the old one goes as if its process had died.
        stopListenerLocked(old->second);
    }
    mListeners[listener->key] = listener;
    mListenersByPath[path] = listener;
    struct epoll_event ev = {};
    ev.events = EPOLLIN | EPOLLONESHOT;
    ev.data.u64 = listener->key;
    epoll_ctl(mEpoll, EPOLL_CTL_ADD, fd, &ev);
    if (!mPoolStarted) {
        // Something to serve: the pool must run for it.
        mPoolStarted = true;
        spawnLocked();
    }
    *out = listener;
    return NO_ERROR;
}

void BinderHost::stopListenerLocked(std::shared_ptr<Listener> listener) {
    if (listener->stopped) {
        return;
    }
    listener->stopped = true;
    struct stat st = {};
    // The path may belong to a newer server already: remove only our own.
    if (stat(listener->path.c_str(), &st) == 0 && st.st_dev == listener->dev &&
        st.st_ino == listener->ino) {
        unlink(listener->path.c_str());
    }
    auto byPath = mListenersByPath.find(listener->path);
    if (byPath != mListenersByPath.end() && byPath->second == listener) {
        mListenersByPath.erase(byPath);
    }
    if (mEndpoint == listener) {
        mEndpoint.reset();
        mExported.clear();
        mExportIds.clear();
    }
    // The pool closes them when it sees them shut.
    if (listener->fd >= 0) {
        shutdown(listener->fd, SHUT_RDWR);
    }
    for (uint64_t key : listener->connections) {
        auto conn = mConnections.find(key);
        if (conn != mConnections.end() && conn->second->fd >= 0) {
            shutdown(conn->second->fd, SHUT_RDWR);
        }
    }
}

status_t BinderHost::addService(const std::string& name, const sp<IBinder>& service) {
    if (service == nullptr || !BinderFrame::isValidName(name) || name[0] == '.') {
        return BAD_VALUE;
    }
    std::lock_guard<std::mutex> guard(mLock);
    if (mStopping) {
        return android::INVALID_OPERATION;
    }
    std::shared_ptr<Listener> listener;
    return listenLocked(socketDir(), name, service, &listener);
}

status_t BinderHost::stopService(const std::string& name) {
    if (!BinderFrame::isValidName(name) || name[0] == '.') {
        return BAD_VALUE;
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mListenersByPath.find(socketDir() + "/" + name);
    if (it == mListenersByPath.end() || it->second->root == nullptr) {
        return NAME_NOT_FOUND;
    }
    stopListenerLocked(it->second);
    return NO_ERROR;
}

status_t BinderHost::ensureEndpointLocked(const std::string& dir) {
    if (mEndpoint != nullptr && !mEndpoint->stopped &&
        mEndpoint->path.compare(0, dir.size() + 1, dir + "/") == 0) {
        return NO_ERROR;
    }
    if (mEndpoint != nullptr) {
        // The root changed (tests): objects handed out under the old one are
        // gone with it.
        stopListenerLocked(mEndpoint);
    }
    std::string name = ".proc-" + std::to_string(getpid()) + "-" + std::to_string(mNextSocketSeq++);
    return listenLocked(dir, name, nullptr, &mEndpoint);
}

// ---------------------------------------------------------------------------
// Objects in frames.

status_t BinderHost::exportObject(const sp<IBinder>& binder, WireObject* out) {
    if (binder == nullptr) {
        return BAD_VALUE;
    }
    if (BpBinder* proxy = binder->remoteBinder()) {
        out->name = proxy->endpointName();
        out->incarnation = proxy->endpointIncarnation();
        out->id = proxy->objectId();
        return NO_ERROR;
    }
    std::string dir = socketDir();
    std::lock_guard<std::mutex> guard(mLock);
    // A service of ours goes by its service socket, so that its proxies are
    // one and the same wherever the object is met.
    for (const auto& entry : mListenersByPath) {
        const std::shared_ptr<Listener>& listener = entry.second;
        if (listener->root == binder && !listener->stopped &&
            listener->path.compare(0, dir.size() + 1, dir + "/") == 0) {
            out->name = listener->name;
            out->incarnation = listener->incarnation;
            out->id = 0;
            return NO_ERROR;
        }
    }
    status_t err = ensureEndpointLocked(dir);
    if (err != NO_ERROR) {
        return err;
    }
    uint64_t id;
    auto known = mExportIds.find(binder.get());
    if (known != mExportIds.end()) {
        id = known->second;
    } else {
        id = mNextObjectId++;
        mExportIds[binder.get()] = id;
        mExported[id] = binder;
    }
    out->name = mEndpoint->name;
    out->incarnation = mEndpoint->incarnation;
    out->id = id;
    return NO_ERROR;
}

sp<IBinder> BinderHost::importObject(const WireObject& object) {
    std::string dir = socketDir();
    {
        std::lock_guard<std::mutex> guard(mLock);
        auto own = mListenersByPath.find(dir + "/" + object.name);
        if (own != mListenersByPath.end() && own->second->incarnation == object.incarnation) {
            // One of ours: the object itself.
            if (object.id == 0) {
                return own->second->root;
            }
            auto exported = mExported.find(object.id);
            return exported != mExported.end() ? exported->second : nullptr;
        }
    }
    return peerFor(dir, object.name, object.incarnation)->proxyFor(object.id);
}

std::shared_ptr<BinderPeer> BinderHost::peerFor(const std::string& dir, const std::string& name,
                                                uint64_t incarnation) {
    std::string path = dir + "/" + name;
    std::string key = path + "#" + std::to_string(incarnation);
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mPeers.find(key);
    if (it != mPeers.end()) {
        if (std::shared_ptr<BinderPeer> peer = it->second.lock()) {
            return peer;
        }
    }
    // Forget peers nobody holds any more.
    for (auto p = mPeers.begin(); p != mPeers.end();) {
        p = p->second.expired() ? mPeers.erase(p) : std::next(p);
    }
    auto peer = std::make_shared<BinderPeer>(path, name, incarnation, mGeneration);
    mPeers[key] = peer;
    return peer;
}

sp<IBinder> BinderHost::checkService(const std::string& name) {
    if (!BinderFrame::isValidName(name) || name[0] == '.') {
        return nullptr;
    }
    std::string dir = socketDir();
    uint64_t incarnation = 0;
    status_t err = NO_ERROR;
    int fd = BinderSocket::connect(dir + "/" + name, &incarnation, kHelloTimeoutMs, &err);
    if (fd < 0) {
        return nullptr;
    }
    std::shared_ptr<BinderPeer> peer = peerFor(dir, name, incarnation);
    peer->adoptConnection(fd);
    return peer->proxyFor(0);
}

std::vector<std::string> BinderHost::listServices() {
    std::vector<std::string> names;
    std::string dir = socketDir();
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return names;
    }
    while (struct dirent* ent = readdir(d)) {
        std::string name = ent->d_name;
        if (name.empty() || name[0] == '.' || !BinderFrame::isValidName(name)) {
            continue;
        }
        uint64_t incarnation = 0;
        status_t err = NO_ERROR;
        int fd = BinderSocket::connect(dir + "/" + name, &incarnation, 1000, &err);
        if (fd >= 0) {
            close(fd);
            names.push_back(name);
        }
    }
    closedir(d);
    std::sort(names.begin(), names.end());
    return names;
}

// ---------------------------------------------------------------------------
// The pool.

void BinderHost::startPool() {
    std::lock_guard<std::mutex> guard(mLock);
    if (!mPoolStarted) {
        mPoolStarted = true;
        spawnLocked();
    }
}

void BinderHost::setMaxThreads(size_t maxThreads) {
    std::lock_guard<std::mutex> guard(mLock);
    mMaxThreads = maxThreads < 1 ? 1 : maxThreads;
}

void BinderHost::spawnLocked() {
    if (mStopping) {
        return;
    }
    size_t number = ++mSpawned;
    mThreads++;
    std::thread([this, number] {
        char name[16];
        snprintf(name, sizeof(name), "binder:%d_%zX", static_cast<int>(getpid()), number);
        prctl(PR_SET_NAME, name, 0, 0, 0);
        serve(false);
    }).detach();
}

void BinderHost::joinPool() {
    serve(true);
    // Let the other threads leave their loops (a transaction under way ends
    // first), but never wait long: the process is stopping.
    std::unique_lock<std::mutex> lock(mLock);
    mThreadsChanged.wait_for(lock, std::chrono::seconds(1), [this] { return mThreads == 0; });
}

void BinderHost::stopPool() {
    std::lock_guard<std::mutex> guard(mLock);
    mStopping = true;
    uint64_t one = 1;
    // Level-triggered and never read: it wakes every thread, now and later.
    ssize_t ignored = write(mStopFd, &one, sizeof(one));
    (void)ignored;
}

void BinderHost::serve(bool joined) {
    for (;;) {
        {
            std::lock_guard<std::mutex> guard(mLock);
            if (mStopping) {
                break;
            }
            mIdle++;
        }
        struct epoll_event ev = {};
        int n = epoll_wait(mEpoll, &ev, 1, -1);
        {
            std::lock_guard<std::mutex> guard(mLock);
            mIdle--;
            if (mStopping) {
                break;
            }
            // Keep one thread waiting while this one works, so nested calls
            // back into this process find a thread.
            if (n > 0 && mIdle == 0 && mThreads < mMaxThreads) {
                spawnLocked();
            }
        }
        if (n > 0 && ev.data.u64 != 0) {
            handleEvent(ev.data.u64);
        }
    }
    std::lock_guard<std::mutex> guard(mLock);
    if (!joined) {
        mThreads--;
    }
    mThreadsChanged.notify_all();
}

void BinderHost::rearm(int fd, uint64_t key) {
    struct epoll_event ev = {};
    ev.events = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;
    ev.data.u64 = key;
    // Under the lock: the thread that takes the next event (and may close the
    // descriptor) takes the lock once its wait returns, so all this thread
    // did with the descriptor happens before.
    std::lock_guard<std::mutex> guard(mLock);
    epoll_ctl(mEpoll, EPOLL_CTL_MOD, fd, &ev);
}

void BinderHost::handleEvent(uint64_t key) {
    std::shared_ptr<Listener> listener;
    std::shared_ptr<Connection> conn;
    {
        std::lock_guard<std::mutex> guard(mLock);
        auto l = mListeners.find(key);
        if (l != mListeners.end()) {
            listener = l->second;
        } else {
            auto c = mConnections.find(key);
            if (c != mConnections.end()) {
                conn = c->second;
            }
        }
    }
    if (listener != nullptr) {
        handleListener(listener);
    } else if (conn != nullptr) {
        handleConnection(conn);
    }
}

void BinderHost::handleListener(const std::shared_ptr<Listener>& listener) {
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (listener->stopped) {
            epoll_ctl(mEpoll, EPOLL_CTL_DEL, listener->fd, nullptr);
            closeFd(listener->fd, mGeneration);
            listener->fd = -1;
            mListeners.erase(listener->key);
            return;
        }
    }
    for (;;) {
        int fd = accept4(listener->fd, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED) {
                continue;
            }
            break;  // EAGAIN: nothing more waits
        }
        adoptFd(fd);
        struct ucred cred = {};
        socklen_t len = sizeof(cred);
        struct timeval tv = {kFrameTimeoutMs / 1000, (kFrameTimeoutMs % 1000) * 1000};
        if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0 ||
            setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv)) != 0 ||
            setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)) != 0 ||
            BinderSocket::sendHello(fd, listener->incarnation) != NO_ERROR) {
            closeFd(fd, mGeneration);
            continue;
        }
        std::lock_guard<std::mutex> guard(mLock);
        if (listener->stopped) {
            closeFd(fd, mGeneration);
            continue;
        }
        auto conn = std::make_shared<Connection>();
        conn->key = mNextKey++;
        conn->fd = fd;
        conn->listener = listener;
        conn->pid = cred.pid;
        conn->uid = cred.uid;
        mConnections[conn->key] = conn;
        listener->connections.push_back(conn->key);
        struct epoll_event ev = {};
        ev.events = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;
        ev.data.u64 = conn->key;
        epoll_ctl(mEpoll, EPOLL_CTL_ADD, fd, &ev);
    }
    struct epoll_event ev = {};
    ev.events = EPOLLIN | EPOLLONESHOT;
    ev.data.u64 = listener->key;
    std::lock_guard<std::mutex> guard(mLock);  // as in rearm
    epoll_ctl(mEpoll, EPOLL_CTL_MOD, listener->fd, &ev);
}

void BinderHost::closeConnection(const std::shared_ptr<Connection>& conn) {
    std::lock_guard<std::mutex> guard(mLock);
    if (conn->fd < 0) {
        return;
    }
    epoll_ctl(mEpoll, EPOLL_CTL_DEL, conn->fd, nullptr);
    closeFd(conn->fd, mGeneration);
    conn->fd = -1;
    mConnections.erase(conn->key);
    auto& keys = conn->listener->connections;
    keys.erase(std::remove(keys.begin(), keys.end(), conn->key), keys.end());
}

sp<IBinder> BinderHost::targetFor(const std::shared_ptr<Connection>& conn, uint64_t id) {
    if (id == 0) {
        return conn->listener->root;
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mExported.find(id);
    return it != mExported.end() ? it->second : nullptr;
}

status_t BinderHost::execute(const sp<IBinder>& target, uint32_t code, const Parcel& data,
                             Parcel* reply, uint32_t flags, pid_t pid, uid_t uid) {
    IPCThreadState* ipc = IPCThreadState::self();
    bool had = false;
    pid_t oldPid = 0;
    uid_t oldUid = 0;
    ipc->setCallingIdentity(pid, uid, &had, &oldPid, &oldUid);
    status_t err = target->transact(code, data, reply, flags);
    ipc->restoreIdentity(had, oldPid, oldUid);
    return err;
}

void BinderHost::handleConnection(const std::shared_ptr<Connection>& conn) {
    bool stopped = false;
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (conn->fd < 0) {
            return;
        }
        stopped = conn->listener->stopped;
    }
    if (stopped) {
        closeConnection(conn);
        return;
    }
    BinderSocket::Received frame;
    std::vector<WireObject> objects;
    status_t err = BinderSocket::receive(conn->fd, &frame, &objects);
    if (err == NO_ERROR && frame.header.kind != BinderFrame::kTransaction) {
        err = BAD_VALUE;
    }
    if (err != NO_ERROR) {
        if (err != android::DEAD_OBJECT) {
            ALOGW("Closing a connection of pid %d to %s: %s frame", static_cast<int>(conn->pid),
                  conn->listener->name.c_str(), err == android::TIMED_OUT ? "stalled" : "malformed");
        }
        closeConnection(conn);
        return;
    }
    const FrameHeader header = frame.header;
    auto data = std::make_unique<Parcel>();
    err = BinderFrame::fillParcel(data.get(), frame.takeData(), header.dataSize, objects, &frame.fds,
                                  [this](const WireObject& w) { return importObject(w); });
    sp<IBinder> target;
    if (err == NO_ERROR) {
        target = targetFor(conn, header.target);
        if (target == nullptr) {
            err = NAME_NOT_FOUND;
        }
    }
    if ((header.flags & IBinder::FLAG_ONEWAY) != 0) {
        bool run = false;
        IBinder* key = target.get();
        if (err == NO_ERROR) {
            std::lock_guard<std::mutex> guard(mLock);
            AsyncQueue& queue = mAsync[key];
            AsyncWork work;
            work.target = target;
            work.code = header.code;
            work.flags = header.flags;
            work.data = std::move(data);
            work.pid = conn->pid;
            work.uid = conn->uid;
            queue.items.push_back(std::move(work));
            if (!queue.running) {
                queue.running = true;
                run = true;
            }
        }
        // Read the next frame of this connection only once this one is queued:
        // one-way calls keep their order.
        rearm(conn->fd, conn->key);
        if (run) {
            drain(key);
        }
        return;
    }
    Parcel reply;
    status_t status = err;
    if (err == NO_ERROR) {
        status = execute(target, header.code, *data, &reply, header.flags, conn->pid, conn->uid);
    }
    data.reset();
    target.clear();
    sendReply(conn, status, reply);
}

void BinderHost::sendReply(const std::shared_ptr<Connection>& conn, status_t status,
                           const Parcel& reply) {
    FrameHeader header = {};
    header.magic = BinderFrame::kMagic;
    header.kind = BinderFrame::kReply;
    std::vector<uint8_t> table;
    std::vector<int> fds;
    status_t err =
        reply.dataSize() <= BinderFrame::kMaxDataSize
            ? BinderFrame::encodeObjects(
                  reply, [this](const sp<IBinder>& b, WireObject* w) { return exportObject(b, w); },
                  &table, &fds)
            : FAILED_TRANSACTION;
    const uint8_t* bytes = reply.data();
    if (err != NO_ERROR) {
        ALOGE("Reply of %zu bytes to pid %d cannot be sent (%d)", reply.dataSize(),
              static_cast<int>(conn->pid), err);
        status = FAILED_TRANSACTION;
        table.clear();
        fds.clear();
        bytes = nullptr;
        header.dataSize = 0;
    } else {
        header.dataSize = static_cast<uint32_t>(reply.dataSize());
    }
    header.code = static_cast<uint32_t>(status);
    header.tableSize = static_cast<uint32_t>(table.size());
    if (BinderSocket::send(conn->fd, header, bytes, table, fds) != NO_ERROR) {
        closeConnection(conn);
        return;
    }
    rearm(conn->fd, conn->key);
}

void BinderHost::drain(IBinder* key) {
    for (;;) {
        AsyncWork work;
        {
            std::lock_guard<std::mutex> guard(mLock);
            auto it = mAsync.find(key);
            if (it == mAsync.end()) {
                return;
            }
            if (it->second.items.empty()) {
                mAsync.erase(it);
                return;
            }
            work = std::move(it->second.items.front());
            it->second.items.pop_front();
        }
        Parcel scratch;
        execute(work.target, work.code, *work.data, &scratch, work.flags, work.pid, work.uid);
    }
}

} // namespace kelvo
