#include "core/BufferedLogServer.h"

#include <cutils/sockets.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <cstring>

#include <utils/Timers.h>

#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

namespace {

// The system user of the phone; root and the daemon's own user are trusted too.
constexpr uid_t kSystemUid = 1000;

// Reads until size bytes arrived, the stream ended or a read failed (a
// time-out included); the bytes read, errno set when short.
size_t readFully(int fd, uint8_t* buffer, size_t size) {
    size_t done = 0;
    while (done < size) {
        size_t piece = std::min(size - done, BufferedLogServer::kReadPieceSize);
        ssize_t n = TEMP_FAILURE_RETRY(recv(fd, buffer + done, piece, 0));
        if (n <= 0) {
            if (n == 0) {
                errno = ECONNRESET;
            }
            break;
        }
        done += static_cast<size_t>(n);
    }
    return done;
}

void setTimeout(int fd, int option, int timeoutMs) {
    timeval tv;
    tv.tv_sec = timeoutMs / 1000;
    tv.tv_usec = (timeoutMs % 1000) * 1000;
    setsockopt(fd, SOL_SOCKET, option, &tv, sizeof(tv));
}

}  // namespace

BufferedLogServer* BufferedLogServer::getInstance() {
    static std::mutex lock;
    // Never released: the server lives for the process.
    static android::sp<BufferedLogServer>* instance = nullptr;
    std::lock_guard<std::mutex> guard(lock);
    if (instance == nullptr) {
        instance = new android::sp<BufferedLogServer>(
            new BufferedLogServer("BufferedLogServer", kDefaultIoTimeoutMs));
    }
    return instance->get();
}

BufferedLogServer::BufferedLogServer(const char* threadName, int ioTimeoutMs)
    : mIoTimeoutMs(ioTimeoutMs), mOwnUid(getuid()), mObserver(new FdObserver(threadName)) {}

BufferedLogServer::~BufferedLogServer() {
    stop();
}

int32_t BufferedLogServer::start() {
    std::lock_guard<std::mutex> guard(mLock);
    if (mListenFd >= 0) {
        return 0;
    }
    int fd = socket_local_server(kSocketName, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    if (fd < 0) {
        KLOGE("Failed to create socket local server: %s", strerror(errno));
        return -1;
    }
    fcntl(fd, F_SETFD, FD_CLOEXEC);
    if (mObserver->addFd(fd, this) < 0) {
        KLOGE("Failed to add file descriptor: %d", fd);
        close(fd);
        return -1;
    }
    mListenFd = fd;
    KLOGI("Create buffered log server success");
    return 0;
}

void BufferedLogServer::stop() {
    // The thread goes first: a client it is reading is never closed under it.
    if (mObserver != nullptr) {
        mObserver->stop();
    }
    {
        std::lock_guard<std::mutex> guard(mLock);
        while (!mClients.empty()) {
            removeClientLocked(mClients.begin()->first);
        }
        if (mListenFd >= 0) {
            mObserver->removeFd(mListenFd);
            close(mListenFd);
            mListenFd = -1;
        }
    }
}

void BufferedLogServer::recreateListener() {
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (mListenFd >= 0) {
            mObserver->removeFd(mListenFd);
            close(mListenFd);
            mListenFd = -1;
        }
    }
    start();
}

int32_t BufferedLogServer::registerLogReceiver(const android::sp<LogReceiver>& receiver,
                                               const android::String8& name, int32_t magic) {
    if (receiver == nullptr || name.isEmpty()) {
        KLOGE("Invalid parameter");
        return -5;
    }
    bool added;
    {
        std::lock_guard<std::mutex> guard(mLock);
        added =
            mReceivers.emplace(std::make_pair(std::string(name.string()), magic), receiver).second;
    }
    if (!added) {
        KLOGE("This type(%s) or magic(%d) has been registered", name.string(), magic);
        return -13;
    }
    return 0;
}

int32_t BufferedLogServer::unregisterLogReceiver(const android::String8& name, int32_t magic) {
    std::lock_guard<std::mutex> guard(mLock);
    mReceivers.erase(std::make_pair(std::string(name.string()), magic));
    return 0;
}

int32_t BufferedLogServer::sendLogMessage(const android::String8& name, const uint8_t* entry,
                                          size_t size) {
    int32_t magic = 0;
    if (entry == nullptr || size < 8) {
        HealthCounters::add(Health::BufferedEntryRefused);
        KLOGE("Invalid parameter");
        return -5;
    }
    memcpy(&magic, entry + 4, sizeof(magic));
    android::sp<LogReceiver> receiver;
    {
        std::lock_guard<std::mutex> guard(mLock);
        auto it = mReceivers.find(std::make_pair(std::string(name.string()), magic));
        if (it != mReceivers.end()) {
            receiver = it->second;
        }
    }
    if (receiver == nullptr) {
        HealthCounters::add(Health::BufferedEntryRefused);
        KLOGE("No receiver to receive message (name=%s%d, type=%s, magic=%d)", name.string(), magic,
              name.string(), magic);
        return -4;
    }
    receiver->onLogReceived(name, entry, size);
    return 0;
}

int32_t BufferedLogServer::requestLogMessage(const android::String8& name, int32_t magic,
                                             const void* data, size_t size) {
    if ((data == nullptr && size > 0) || size > kMaxEntryLength || name.isEmpty()) {
        KLOGE("Invalid parameter");
        return -5;
    }
    // The client's socket is written through a duplicate, outside the lock:
    // a client removed meanwhile keeps its socket until the write is done,
    // and its descriptor number is never written into after reuse.
    int fd = -1;
    int clientFd = -1;
    {
        std::lock_guard<std::mutex> guard(mLock);
        for (const auto& client : mClients) {
            if (client.second.name == name.string()) {
                clientFd = client.first;
                fd = fcntl(client.first, F_DUPFD_CLOEXEC, 0);
                break;
            }
        }
    }
    if (fd < 0) {
        KLOGE("Failed to find client for (%s)", name.string());
        return -10;
    }
    std::vector<uint8_t> entry(size + 8);
    int32_t length = static_cast<int32_t>(size);
    memcpy(entry.data(), &length, sizeof(length));
    memcpy(entry.data() + 4, &magic, sizeof(magic));
    if (size > 0) {
        memcpy(entry.data() + 8, data, size);
    }
    size_t written = 0;
    {
        std::lock_guard<std::mutex> guard(mWriteLock);
        while (written < entry.size()) {
            // The socket's send time-out bounds every wait.
            ssize_t n = TEMP_FAILURE_RETRY(
                send(fd, entry.data() + written, entry.size() - written, MSG_NOSIGNAL));
            if (n <= 0) {
                break;
            }
            written += static_cast<size_t>(n);
        }
    }
    if (written < entry.size()) {
        KLOGE("Failed to write: %s", strerror(errno));
        HealthCounters::add(Health::BufferedEntryRefused);
        // Half an entry leaves the stream unusable: the server thread sees
        // the end and removes the client.
        shutdown(fd, SHUT_RDWR);
        close(fd);
        return -14;
    }
    close(fd);
    KLOGM(LOG_MODULE_BUFFEREDLOG, "Send message(%s) to %d", name.string(), clientFd);
    return 0;
}

int32_t BufferedLogServer::receiveEntry(int fd, size_t maxLength, std::vector<uint8_t>* entry) {
    int32_t length = 0;
    size_t n = readFully(fd, reinterpret_cast<uint8_t*>(&length), sizeof(length));
    if (n == 0 && errno == ECONNRESET) {
        return 1;
    }
    if (n < sizeof(length)) {
        HealthCounters::add(Health::BufferedEntryRefused);
        KLOGE("Failed to read message length: %s", strerror(errno));
        return -14;
    }
    // Checked before anything is allocated for it.
    if (length < 0 || static_cast<size_t>(length) > maxLength) {
        HealthCounters::add(Health::BufferedEntryRefused);
        KLOGE("Invalid message length: %d", length);
        return -14;
    }
    KLOGM(LOG_MODULE_BUFFEREDLOG, "Receive message from client(%d), length = %d", fd, length);
    size_t size = static_cast<size_t>(length) + 8;
    entry->assign(size, 0);
    memcpy(entry->data(), &length, sizeof(length));
    n = readFully(fd, entry->data() + 4, size - 4);
    if (n < size - 4) {
        HealthCounters::add(Health::BufferedEntryRefused);
        KLOGE("Failed to read message: %s, read=%zu", strerror(errno), n);
        return -14;
    }
    return 0;
}

int BufferedLogServer::handleEvent(int fd, int events, void*) {
    bool listener;
    {
        std::lock_guard<std::mutex> guard(mLock);
        listener = fd == mListenFd;
        if (!listener && mClients.count(fd) == 0) {
            return 1;  // already removed
        }
    }
    const int failure = android::Looper::EVENT_ERROR | android::Looper::EVENT_HANGUP |
                        android::Looper::EVENT_INVALID;
    if (listener) {
        if ((events & failure) != 0) {
            // The server must outlive a broken socket: make a new one.
            KLOGE("fd %d occurs unexpected events: %d", fd, events);
            recreateListener();
        } else if ((events & android::Looper::EVENT_INPUT) != 0) {
            acceptClient();
        }
        return 1;
    }
    // Input first: what a client wrote before it hung up is read to the end.
    if ((events & android::Looper::EVENT_INPUT) != 0) {
        if (!serveClient(fd)) {
            removeClient(fd);
        }
    } else if ((events & failure) != 0) {
        KLOGE("fd %d occurs unexpected events: %d", fd, events);
        removeClient(fd);
    }
    // Descriptors are removed by removeClient, never by the looper.
    return 1;
}

int BufferedLogServer::getListenFd() {
    std::lock_guard<std::mutex> guard(mLock);
    return mListenFd;
}

bool BufferedLogServer::isTrustedPeer(int fd) {
    ucred cred;
    socklen_t len = sizeof(cred);
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) < 0) {
        KLOGE("Failed to get peer credentials: %s", strerror(errno));
        return false;
    }
    if (cred.uid == 0 || cred.uid == kSystemUid || cred.uid == mOwnUid) {
        return true;
    }
    if (shouldLogRefusal(mLastPeerLogNs)) {
        KLOGE("Refused client of uid %u (pid %d)", cred.uid, cred.pid);
    }
    return false;
}

size_t BufferedLogServer::unauthenticatedCountLocked() const {
    size_t count = 0;
    for (const auto& client : mClients) {
        count += client.second.name.empty() ? 1 : 0;
    }
    return count;
}

bool BufferedLogServer::shouldLogRefusal(std::atomic<nsecs_t>& lastLogNs) {
    // Any local process can connect: refusals are counted, and logged at
    // most once a minute so they cannot spend the day's error lines.
    nsecs_t now = systemTime(SYSTEM_TIME_MONOTONIC);
    nsecs_t last = lastLogNs.load(std::memory_order_relaxed);
    if (last != 0 && now - last < kRefusalLogIntervalNs) {
        return false;
    }
    lastLogNs.store(now, std::memory_order_relaxed);
    return true;
}

void BufferedLogServer::acceptClient() {
    int listenFd;
    {
        std::lock_guard<std::mutex> guard(mLock);
        listenFd = mListenFd;
    }
    int fd = TEMP_FAILURE_RETRY(accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC));
    if (fd < 0) {
        int error = errno;
        HealthCounters::add(Health::BufferedClientRefused);
        if (error == EBADF || error == ENOTSOCK || error == EINVAL) {
            KLOGE("Failed to accept socket client: %s", strerror(error));
            recreateListener();
            return;
        }
        // Out of descriptors, say: the pending connection keeps the socket
        // readable, so back off instead of spinning, and say it once a minute.
        if (shouldLogRefusal(mLastAcceptLogNs)) {
            KLOGE("Failed to accept socket client: %s", strerror(error));
        }
        if (error == EMFILE || error == ENFILE || error == ENOBUFS || error == ENOMEM) {
            usleep(kAcceptBackoffUs);
        }
        return;
    }
    if (!isTrustedPeer(fd)) {
        HealthCounters::add(Health::BufferedClientRefused);
        close(fd);
        return;
    }
    // One stalled client holds the thread up at most this long.
    setTimeout(fd, SO_RCVTIMEO, mIoTimeoutMs);
    setTimeout(fd, SO_SNDTIMEO, mIoTimeoutMs);
    std::lock_guard<std::mutex> guard(mLock);
    if (mClients.size() >= kMaxClients ||
        unauthenticatedCountLocked() >= kMaxUnauthenticatedClients) {
        HealthCounters::add(Health::BufferedClientRefused);
        if (shouldLogRefusal(mLastCapLogNs)) {
            KLOGE("Too many clients: %zu", mClients.size());
        }
        close(fd);
        return;
    }
    mClients[fd] = Client();
    if (mObserver->addFd(fd, this) < 0) {
        KLOGE("Failed to add file descriptor: %d", fd);
        mClients.erase(fd);
        close(fd);
        return;
    }
    KLOGM(LOG_MODULE_BUFFEREDLOG, "A new client is connected: %d", fd);
}

bool BufferedLogServer::serveClient(int fd) {
    std::string name;
    {
        std::lock_guard<std::mutex> guard(mLock);
        auto it = mClients.find(fd);
        if (it == mClients.end()) {
            return false;
        }
        name = it->second.name;
    }
    std::vector<uint8_t> entry;
    int32_t ret = receiveEntry(fd, name.empty() ? kMaxNameLength : kMaxEntryLength, &entry);
    if (ret == 1) {
        KLOGM(LOG_MODULE_BUFFEREDLOG, "Client %d closed the connection", fd);
        return false;
    }
    if (ret < 0) {
        KLOGE("Failed to receive message: %d", ret);
        return false;
    }
    if (name.empty()) {
        std::string claimed(reinterpret_cast<const char*>(entry.data()) + 8, entry.size() - 8);
        {
            std::lock_guard<std::mutex> guard(mLock);
            ret = authenticate(fd, claimed);
        }
        if (ret < 0) {
            HealthCounters::add(Health::BufferedClientRefused);
            KLOGE("Failed to authenticate client(%d): %d", fd, ret);
            return false;
        }
        return true;
    }
    // Delivered outside the lock: sendLogMessage takes it itself.
    ret = sendLogMessage(android::String8(name.c_str()), entry.data(), entry.size());
    if (ret < 0) {
        KLOGE("Failed to send message to receiver: %d", ret);
        return false;
    }
    return true;
}

int32_t BufferedLogServer::authenticate(int fd, const std::string& name) {
    if (fd < 0 || name.empty() || name.find('\0') != std::string::npos) {
        KLOGE("Invalid parameter");
        return -5;
    }
    // Names are matched whole: a name is accepted when some receiver of any
    // magic is registered for exactly that name.
    auto it = mReceivers.lower_bound(std::make_pair(name, INT32_MIN));
    if (it == mReceivers.end() || it->first.first != name) {
        KLOGE("No receiver to receive message of type(%s)", name.c_str());
        return -4;
    }
    for (const auto& client : mClients) {
        if (client.first != fd && client.second.name == name) {
            KLOGE("There is already one client for this type(%s)", name.c_str());
            return -2;
        }
    }
    mClients[fd].name = name;
    KLOGI("Authenticate a new client success: %d, %s", fd, name.c_str());
    return 0;
}

void BufferedLogServer::removeClient(int fd) {
    std::lock_guard<std::mutex> guard(mLock);
    removeClientLocked(fd);
}

void BufferedLogServer::removeClientLocked(int fd) {
    // Erased, unwatched, then closed: nobody finds the number once it can be
    // reused.
    if (mClients.erase(fd) > 0) {
        mObserver->removeFd(fd);
        close(fd);
    }
}

}  // namespace kelvo
