#pragma once

#include <stddef.h>
#include <stdint.h>

namespace kelvo {

// The daemon's own kernel statistics devices ("/dev/kelvo", "/dev/dpm_ldm").
// On the phone these are character devices driven by ioctl. On the host the
// path below the root (kelvo/RootPath.h) may instead be a Unix stream socket
// served by a stand-in driver, reached through the "ioctl over a socket"
// protocol below; daemon code sees the same three calls either way.
//
// Protocol (all numbers little-endian), one connection per open descriptor,
// requests one at a time:
//   request: uint32 request number, uint32 argument size, then that many
//            argument bytes (at most kMaxArgumentBytes);
//   reply:   int32 result, int32 errno, then exactly as many bytes as the
//            request carried (the argument after the call).
// A result < 0 is a failed request with that errno. A peer that sends less,
// stalls longer than kSocketTimeoutMs or hangs up fails the request with EIO
// (ETIMEDOUT for a stall).
class KernelDevice {
public:
    static constexpr size_t kMaxArgumentBytes = 64 * 1024;
    static constexpr int kSocketTimeoutMs = 2000;

    // Opens the device at an absolute device path: a character device (or
    // any other file) with O_RDONLY | O_CLOEXEC, a socket by connecting to
    // it. Returns the descriptor, or -1 with errno set (ENOENT when absent).
    static int open(const char* devicePath);

    // Issues one request whose argument is size bytes at arg. Returns the
    // request's result (>= 0), or -1 with errno set.
    static int ioctl(int fd, uint32_t request, void* arg, size_t size);

    static void close(int fd);

    // The protocol's little-endian 32-bit words, shared with the stand-in
    // drivers that serve it.
    static void putUint32(uint8_t* at, uint32_t value);
    static uint32_t getUint32(const uint8_t* at);
};

} // namespace kelvo
