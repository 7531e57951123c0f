#pragma once

#include <android/hidl/memory/1.0/IMemory.h>

#include <vector>

namespace kelvo {

// The host's mapping of a shared block: a private copy of its bytes, so a
// sender that rewrites or shrinks the block afterwards cannot reach it.
class MappedMemory : public android::hidl::memory::V1_0::IMemory {
public:
    explicit MappedMemory(std::vector<uint8_t>&& bytes) : mBytes(std::move(bytes)) {}

    android::hardware::Return<void> update() override { return android::hardware::Void(); }
    android::hardware::Return<void> read() override { return android::hardware::Void(); }
    android::hardware::Return<void> commit() override { return android::hardware::Void(); }
    // Never null, even for an empty block.
    android::hardware::Return<void*> getPointer() override {
        return static_cast<void*>(mBytes.empty() ? &mEmpty : mBytes.data());
    }
    android::hardware::Return<uint64_t> getSize() override {
        return static_cast<uint64_t>(mBytes.size());
    }

private:
    std::vector<uint8_t> mBytes;
    uint8_t mEmpty = 0;
};

} // namespace kelvo
