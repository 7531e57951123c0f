// Reads untrusted bytes as the stream of one buffered-log client. Besides the
// sanitizers, checks that every entry read is whole (its declared length plus
// the 8-byte header, within the cap), that the stream is consumed entry by
// entry up to its end or the first refusal, and that the refusal is the
// expected one for what the bytes say.

#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "core/BufferedLogServer.h"

using kelvo::BufferedLogServer;

namespace {

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

// Small enough to sit in the socket's buffer whole.
constexpr size_t kMaxInput = 64 * 1024;

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size > kMaxInput) {
        return 0;
    }
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, fds) < 0) {
        return 0;
    }
    int sndbuf = static_cast<int>(kMaxInput) * 4;
    setsockopt(fds[1], SOL_SOCKET, SO_SNDBUF, &sndbuf, sizeof(sndbuf));
    if (size > 0 && write(fds[1], data, size) != static_cast<ssize_t>(size)) {
        close(fds[0]);
        close(fds[1]);
        return 0;
    }
    close(fds[1]);
    size_t offset = 0;
    // The name entry has its own, smaller cap.
    size_t cap = BufferedLogServer::kMaxNameLength;
    for (;;) {
        std::vector<uint8_t> entry;
        int32_t ret = BufferedLogServer::receiveEntry(fds[0], cap, &entry);
        if (ret != 0) {
            // The end only where an entry would start; a refusal otherwise.
            check(ret == 1 ? offset == size : ret == -14);
            if (ret == -14) {
                int32_t length = 0;
                bool headerThere = size - offset >= 4;
                if (headerThere) {
                    memcpy(&length, data + offset, 4);
                }
                bool whole = headerThere && length >= 0 && static_cast<size_t>(length) <= cap &&
                             size - offset >= static_cast<size_t>(length) + 8;
                check(!whole);
            }
            break;
        }
        int32_t length = 0;
        memcpy(&length, entry.data(), 4);
        check(length >= 0 && static_cast<size_t>(length) <= cap);
        check(entry.size() == static_cast<size_t>(length) + 8);
        check(offset + entry.size() <= size);
        check(memcmp(entry.data(), data + offset, entry.size()) == 0);
        offset += entry.size();
        cap = BufferedLogServer::kMaxEntryLength;
    }
    close(fds[0]);
    return 0;
}
