#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>

namespace kelvo {

// A client of the daemon's buffered log socket, as other processes are on the
// phone; used by the tests, the benchmarks and the device simulator. Every
// entry, both ways, is int32 length, int32 magic, then length data bytes, in
// the native byte order; the first entry a client sends is its name. One
// thread at a time uses a client.
class BufferedLogClient {
public:
    static constexpr const char* kSocketName = "KELVO_BUFFERED_LOG";

    BufferedLogClient() = default;
    ~BufferedLogClient();
    BufferedLogClient(const BufferedLogClient&) = delete;
    BufferedLogClient& operator=(const BufferedLogClient&) = delete;

    // Connects to the socket of the current root and, when the name is not
    // empty, sends it as the first entry. 0, or -1 with errno set.
    int connect(const std::string& name);
    // Sends one entry; 0, or -1 with errno set.
    int send(int32_t magic, const void* data, size_t size);
    int send(int32_t magic, const std::string& data) {
        return send(magic, data.data(), data.size());
    }
    // Sends bytes as they are (several entries in one write, or broken ones).
    int sendRaw(const void* data, size_t size);
    // Waits at most timeoutMs for the next entry from the daemon. 0; or -1
    // with errno ETIMEDOUT when none came, ENODATA when the daemon closed the
    // connection.
    int receive(int32_t* magic, std::string* data, int timeoutMs);
    // True when the daemon closes the connection within timeoutMs (entries
    // that arrive meanwhile are skipped).
    bool waitClosed(int timeoutMs);
    void close();
    int fd() const { return mFd; }

    // The wire form of one entry.
    static std::string encode(int32_t magic, const void* data, size_t size);

private:
    // Reads exactly size bytes before the deadline; false with errno set.
    bool readFully(void* buffer, size_t size, int64_t deadlineMs);

    int mFd = -1;
};

}  // namespace kelvo
