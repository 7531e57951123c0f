#define LOG_TAG "hwbinder"

#include <errno.h>
#include <hidlmemory/mapping.h>
#include <log/log.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <vector>

#include "MappedMemory.h"

namespace android {
namespace hardware {

sp<hidl::memory::V1_0::IMemory> mapMemory(const hidl_memory& memory) {
    const native_handle_t* handle = memory.handle();
    if (handle == nullptr || handle->numFds < 1 || handle->data[0] < 0) {
        ALOGE("mapMemory: the block has no descriptor");
        return nullptr;
    }
    int fd = handle->data[0];
    struct stat st = {};
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        ALOGE("mapMemory: the descriptor is no memory block");
        return nullptr;
    }
    // The size is the descriptor's own, whatever the sender says.
    if (st.st_size < 0 || static_cast<uint64_t>(st.st_size) > kelvo::kMaxMappedMemoryBytes) {
        ALOGE("mapMemory: a block of %lld bytes is above %zu", static_cast<long long>(st.st_size),
              kelvo::kMaxMappedMemoryBytes);
        return nullptr;
    }
    std::vector<uint8_t> bytes(static_cast<size_t>(st.st_size));
    size_t got = 0;
    while (got < bytes.size()) {
        ssize_t n = pread(fd, bytes.data() + got, bytes.size() - got, static_cast<off_t>(got));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            ALOGE("mapMemory: cannot read the block: %s", strerror(errno));
            return nullptr;
        }
        if (n == 0) {
            break;  // shrunk since fstat: the copy ends where the block now ends
        }
        got += static_cast<size_t>(n);
    }
    bytes.resize(got);
    return new kelvo::MappedMemory(std::move(bytes));
}

} // namespace hardware
} // namespace android
