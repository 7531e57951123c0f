#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/types.h>
#include <utils/Looper.h>
#include <utils/String8.h>

#include <atomic>
#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "core/LogReceiver.h"
#include "utils/FdObserver.h"

namespace kelvo {

// The local stream socket "KELVO_BUFFERED_LOG" through which other processes
// push binary entries (int32 length, int32 magic, data) to the operators that
// registered for them by sender name and magic, and through which the daemon
// sends entries back to a named sender. A client's first entry is its name.
// The socket and its clients are watched on the server's own thread.
class BufferedLogServer : public android::LooperCallback {
public:
    // Largest data of one entry, and of a name entry.
    static constexpr size_t kMaxEntryLength = 1024 * 1024;
    static constexpr size_t kMaxNameLength = 64;
    // Connected clients at most, and of them not yet named.
    static constexpr size_t kMaxClients = 32;
    static constexpr size_t kMaxUnauthenticatedClients = 8;
    // Longest wait for the rest of an entry, or for room to send one.
    static constexpr int kDefaultIoTimeoutMs = 2000;
    // Most bytes asked of one read.
    static constexpr size_t kReadPieceSize = 20480;
    static constexpr const char* kSocketName = "KELVO_BUFFERED_LOG";

    // The process-wide server, listening from its first use on.
    static BufferedLogServer* getInstance();

    // A server of its own (tests and benchmarks); start() makes it listen.
    BufferedLogServer(const char* threadName, int ioTimeoutMs);
    ~BufferedLogServer() override;

    // Creates the listening socket and watches it. 0; -1 when the socket
    // cannot be created or watched.
    int32_t start();
    // Closes the socket and every client and ends the thread (tests).
    void stop();

    // 0; -5 for a null receiver or an empty name; -13 when the sender and
    // magic are taken.
    int32_t registerLogReceiver(const android::sp<LogReceiver>& receiver,
                                const android::String8& name, int32_t magic);
    int32_t unregisterLogReceiver(const android::String8& name, int32_t magic);
    // Sends one entry to the connected client of that name: 0; -5 for a bad
    // entry; -10 when no such client is connected; -14 when the entry could
    // not be written whole within the time-out (the client is then shut down).
    int32_t requestLogMessage(const android::String8& name, int32_t magic, const void* data,
                              size_t size);
    // Delivers one entry (int32 length, int32 magic, data) of a named sender
    // to its receiver; -4 when nobody receives it. Never called with the
    // server's lock held.
    int32_t sendLogMessage(const android::String8& name, const uint8_t* entry, size_t size);

    int handleEvent(int fd, int events, void* data) override;
    // The listening descriptor; -1 when there is none.
    int getListenFd();

    // Reads one entry from a client socket into entry (header and data). 0;
    // 1 at a clean end of stream before the entry; -14 for a failed or short
    // read or a length above maxLength (nothing is allocated for it).
    static int32_t receiveEntry(int fd, size_t maxLength, std::vector<uint8_t>* entry);

private:
    struct Client {
        std::string name;  // empty until authenticated
    };

    void acceptClient();
    // True when a refusal of the kind lastLogNs stamps may be logged (once
    // a minute per kind).
    bool shouldLogRefusal(std::atomic<nsecs_t>& lastLogNs);
    void recreateListener();
    bool isTrustedPeer(int fd);
    // Reads one entry of the client and hands it on; false when the client
    // must go.
    bool serveClient(int fd);
    int32_t authenticate(int fd, const std::string& name);
    void removeClient(int fd);
    void removeClientLocked(int fd);
    size_t unauthenticatedCountLocked() const;

    // A failed accept that is no fault of the socket waits this long before
    // the next try; refusals are logged at most once an interval.
    static constexpr useconds_t kAcceptBackoffUs = 100000;
    static constexpr nsecs_t kRefusalLogIntervalNs = 60000000000LL;
    std::atomic<nsecs_t> mLastAcceptLogNs{0};
    std::atomic<nsecs_t> mLastCapLogNs{0};
    std::atomic<nsecs_t> mLastPeerLogNs{0};

    const int mIoTimeoutMs;
    const uid_t mOwnUid;
    android::sp<FdObserver> mObserver;
    int mListenFd = -1;
    // Guards the receivers, the clients and the listening descriptor.
    std::mutex mLock;
    std::map<std::pair<std::string, int32_t>, android::sp<LogReceiver>> mReceivers;
    std::map<int, Client> mClients;
    // One request written at a time, so entries never interleave.
    std::mutex mWriteLock;
};

}  // namespace kelvo
