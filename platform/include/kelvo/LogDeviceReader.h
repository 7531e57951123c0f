#pragma once

#include <stddef.h>
#include <sys/types.h>

#include <string>

// The device path of the kernel's log device for the daemon's events.
#define KELVO_LOG_DEVICE "/dev/tvlog_kelvo"

namespace kelvo {

// Reads the log device one record per read (the logger entry layout, see
// kelvo/LogDevice.h). Whatever stands behind the path - the kernel's
// character device on the phone, a host stand-in here - the reader sees
// records only: every successful read is one whole record, an empty record
// included, and the end of the device is an error.
//
// One thread reads; another may interrupt or close the reader under a lock of
// its own while no read runs (the dispatcher's stop joins its thread first).
class LogDeviceReader {
public:
    LogDeviceReader() = default;
    ~LogDeviceReader();
    LogDeviceReader(const LogDeviceReader&) = delete;
    LogDeviceReader& operator=(const LogDeviceReader&) = delete;

    // Opens the device at an absolute device path, resolved below the root
    // (kelvo/RootPath.h), for blocking reads. 0, or -1 with errno set;
    // getPath() names the file either way.
    int open(const char* devicePath);
    bool isOpen() const { return mFd >= 0; }
    const std::string& getPath() const { return mPath; }

    // Blocks for the next record and copies at most size bytes of it.
    // Returns the bytes read (0 for an empty record), or -1 with errno set:
    // ENODATA at the end of the device, EBADF when not open. An interrupted
    // read is repeated.
    ssize_t read(void* buffer, size_t size);

    // Makes a read blocked in another thread return at once where the device
    // allows it (the host stand-in); the kernel's device is left to deliver
    // its next record.
    void interrupt();

    void close();

private:
    std::string mPath;
    int mFd = -1;
    // The host stand-in: a datagram socket, where an empty read is an empty
    // record rather than the end of the device.
    bool mDatagram = false;
};

} // namespace kelvo
