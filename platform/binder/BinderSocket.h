#pragma once

// Frame I/O on the transport's Unix stream sockets.

#include <stdint.h>
#include <utils/Errors.h>

#include <string>
#include <vector>

#include "BinderFrame.h"

namespace kelvo {

class BinderSocket {
public:
    // A frame as read: the data is a malloc'd buffer and the descriptors are
    // owned until taken.
    struct Received {
        FrameHeader header = {};
        uint8_t* data = nullptr;
        std::vector<uint8_t> table;
        std::vector<int> fds;

        Received() = default;
        Received(const Received&) = delete;
        Received& operator=(const Received&) = delete;
        ~Received();
        // Gives the data buffer away.
        uint8_t* takeData();
    };

    // Connects to the socket at path and reads its hello within timeoutMs.
    // Returns the connection (close-on-exec, blocking) or -1 with *err:
    // DEAD_OBJECT when nothing serves the path, another status otherwise.
    static int connect(const std::string& path, uint64_t* incarnation, int timeoutMs,
                       android::status_t* err);

    // A listening socket bound at path, readable and writable by everyone.
    // Bound under a temporary name then renamed over path, so a dead
    // server's socket is replaced in one step. -1 with errno on failure.
    static int listenAt(const std::string& path, const std::string& tmpPath);

    static android::status_t sendHello(int fd, uint64_t incarnation);

    // Writes the whole frame; the descriptors go with its first byte.
    static android::status_t send(int fd, const FrameHeader& header, const uint8_t* data,
                                  const std::vector<uint8_t>& table, const std::vector<int>& fds);

    // Reads one whole frame and checks its header and object table.
    // DEAD_OBJECT: the peer closed (or reset) the connection; TIMED_OUT: the
    // frame stalled; BAD_VALUE: a malformed frame (the connection is then
    // out of step and must be closed).
    static android::status_t receive(int fd, Received* out, std::vector<WireObject>* objects);

    // The longest socket path.
    static size_t maxPathLength();
};

} // namespace kelvo
