#pragma once

#include <stddef.h>
#include <stdint.h>

#include "kelvo/LogDeviceReader.h"

namespace kelvo {

// The log device: every read returns one record in the logger entry layout,
// version 1 (little-endian):
//
//   offset 0   uint16  payload length in bytes
//          2   uint16  padding
//          4   int32   process id of the writer
//          8   int32   thread id of the writer
//         12   uint32  seconds of the wall-clock time stamp
//         16   uint32  nanoseconds of the time stamp
//         20   payload: priority byte, tag, NUL, text, NUL
//
// On the phone the path is the kernel's character device. On the host, when
// no character device is there, the reader binds a Unix datagram socket at
// the path and every datagram is one record: writers need no connection, many
// may write at once, and a writer blocks while the reader's queue is full, so
// nothing is dropped. The daemon reads through LogDeviceReader, which hides
// which of the two it is.
class LogDevice {
public:
    static constexpr size_t kHeaderSize = 20;
    // The payload length field is 16 bits wide.
    static constexpr size_t kMaxPayloadSize = 0xFFFF;

    // Opens the device at a host path for blocking reads of one record each.
    // A character device is opened read-only as it is. Otherwise a datagram
    // socket is bound there: a stale socket left by an earlier reader is
    // replaced, a live one (another reader) is refused with EADDRINUSE, and
    // any other kind of file with EEXIST. The parent folder is created when
    // it is missing. Returns the descriptor, or -1 with errno set.
    static int openForReading(const char* path);

    // Fills the 20-byte header. The time must lie between 0 and the last
    // millisecond of an unsigned 32-bit count of seconds; false otherwise.
    static bool fillHeader(uint8_t* header, size_t payloadSize, int32_t pid, int32_t tid,
                           int64_t timeMs);
};

} // namespace kelvo
