#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/uio.h>

#include <string>

namespace kelvo {

// Writes records to the log device at a host path (see LogDevice), as the
// framework and the kernel do on the phone; used by kelvo-log, the simulator,
// the tests and the benchmarks. A writer opens the device on first use and
// keeps it open; after the reader was replaced it reconnects once. One thread
// at a time uses a writer; separate writers may write at the same time.
class LogWriter {
public:
    // Android's log priorities.
    enum Priority {
        PRIORITY_VERBOSE = 2,
        PRIORITY_DEBUG = 3,
        PRIORITY_INFO = 4,
        PRIORITY_WARN = 5,
        PRIORITY_ERROR = 6,
        PRIORITY_FATAL = 7,
    };

    explicit LogWriter(const std::string& path);
    ~LogWriter();
    LogWriter(const LogWriter&) = delete;
    LogWriter& operator=(const LogWriter&) = delete;

    // Writes one record, stamped with timeMs (wall-clock milliseconds) or,
    // when timeMs is negative, with the wall clock now. Blocks while the
    // reader's queue is full. Returns 0, or a negative errno value: -EINVAL
    // for a null tag or text, a priority outside 0..255 or a time the
    // record cannot hold, -EMSGSIZE for a payload over 65535 bytes, or the
    // failure of opening or writing the device (-ECONNREFUSED, -ENOENT: no
    // reader).
    int write(int priority, const char* tag, const char* text, int64_t timeMs = -1);

    // Writes the bytes as one record, as they are (malformed records in
    // tests). Returns 0 or a negative errno value.
    int writeRaw(const void* data, size_t size);

    // Bounds how long a write waits for room in the reader's queue (0, the
    // default: for ever). A write that runs out of time fails with -EAGAIN
    // and leaves nothing behind.
    void setTimeout(int64_t ms);

    const std::string& getPath() const { return mPath; }

private:
    int openDevice();
    void closeDevice();
    int send(const struct iovec* parts, int count, size_t total);

    std::string mPath;
    int mFd;
    bool mSocket;
    int64_t mTimeoutMs;
};

} // namespace kelvo
