#pragma once

#include <android/hidl/memory/1.0/IMemory.h>
#include <hidl/HidlSupport.h>
#include <utils/StrongPointer.h>

namespace android {
namespace hardware {

// Maps a block of shared memory. On the host the mapping is a private copy
// of the block, read through its descriptor: what the sender does to the
// block afterwards (writing, shrinking) never reaches it. Its size is what
// was read (at most the descriptor's size at the time of the call). Null
// for a block without a readable regular-file descriptor, or one larger
// than kelvo::kMaxMappedMemoryBytes.
sp<hidl::memory::V1_0::IMemory> mapMemory(const hidl_memory& memory);

} // namespace hardware
} // namespace android

namespace kelvo {
// The largest block the host maps (its copy is held in memory).
constexpr size_t kMaxMappedMemoryBytes = 16 * 1024 * 1024;
} // namespace kelvo
