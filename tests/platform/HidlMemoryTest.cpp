// Shared memory blocks as a receiver maps them.

#include <gtest/gtest.h>
#include <hidlmemory/mapping.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>
#include <string>

using android::sp;
using android::hardware::hidl_memory;
using android::hardware::mapMemory;
using android::hidl::memory::V1_0::IMemory;

namespace {

// A memfd of n bytes 0, 1, 2 ...; -1 on failure.
int makeBlock(size_t n) {
    int fd = memfd_create("test-block", MFD_CLOEXEC);
    for (size_t i = 0; fd >= 0 && i < n; ++i) {
        uint8_t b = static_cast<uint8_t>(i);
        if (write(fd, &b, 1) != 1) return -1;
    }
    return fd;
}

} // namespace

// The size is the descriptor's own; the copy is private, so a sender that
// shrinks the block after the mapping cannot reach it; a descriptor that is
// no memory block, or none, maps to nothing.
TEST(HidlMemoryTest, MapsAPrivateCopyOfTheBlockAsItIs) {
    struct Case {
        const char* name;
        int blockBytes;  // -1: a pipe; -2: no descriptor
        size_t declared;
        bool mapped;
    } cases[] = {
            {"whole block", 4096, 4096, true},
            {"declared above the block", 10, 1 << 20, true},
            {"empty block", 0, 0, true},
            {"pipe", -1, 16, false},
            {"no descriptor", -2, 16, false},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        int fds[2] = {-1, -1};
        int fd = -1;
        if (c.blockBytes >= 0) {
            fd = makeBlock(static_cast<size_t>(c.blockBytes));
        } else if (c.blockBytes == -1) {
            ASSERT_EQ(0, pipe(fds));
            fd = fds[0];
        }
        native_handle_t* handle = nullptr;
        if (c.blockBytes != -2) {
            handle = native_handle_create(1, 0);
            handle->data[0] = fd;
        }
        hidl_memory memory("memfd", handle, c.declared);
        sp<IMemory> mapped = mapMemory(memory);
        ASSERT_EQ(c.mapped, mapped != nullptr);
        if (mapped != nullptr) {
            ASSERT_EQ(static_cast<uint64_t>(c.blockBytes), static_cast<uint64_t>(mapped->getSize()));
            ASSERT_EQ(0, ftruncate(fd, 0));
            const uint8_t* bytes = static_cast<const uint8_t*>(static_cast<void*>(mapped->getPointer()));
            ASSERT_NE(nullptr, bytes);
            for (int i = 0; i < c.blockBytes; ++i) ASSERT_EQ(static_cast<uint8_t>(i), bytes[i]);
        }
        if (handle != nullptr) native_handle_delete(handle);
        if (fd >= 0) close(fd);
        if (fds[1] >= 0) close(fds[1]);
    }
}
