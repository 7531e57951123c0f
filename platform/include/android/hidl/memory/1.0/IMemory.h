#pragma once

#include <android/hidl/base/1.0/IBase.h>
#include <hidl/Status.h>
#include <stdint.h>

namespace android {
namespace hidl {
namespace memory {
namespace V1_0 {

// A mapped block of shared memory. Reads and writes of its bytes go between
// update()/read() and commit().
class IMemory : public base::V1_0::IBase {
public:
    // Opens the block for writing (and reading).
    virtual hardware::Return<void> update() = 0;
    // Opens the block for reading.
    virtual hardware::Return<void> read() = 0;
    // Closes what update() or read() opened.
    virtual hardware::Return<void> commit() = 0;
    // The first byte; valid while this object lives.
    virtual hardware::Return<void*> getPointer() = 0;
    virtual hardware::Return<uint64_t> getSize() = 0;
};

} // namespace V1_0
} // namespace memory
} // namespace hidl
} // namespace android
