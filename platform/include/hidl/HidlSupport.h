#pragma once

// The value types of hardware-binder interfaces: strings, handles (a native
// handle: descriptors and ints) and shared memory blocks.

#include <cutils/native_handle.h>
#include <stddef.h>
#include <stdint.h>

#include <string>

namespace android {
namespace hardware {

class hidl_string {
public:
    hidl_string() = default;
    hidl_string(const char* s) : mText(s != nullptr ? s : "") {}
    hidl_string(const std::string& s) : mText(s) {}

    const char* c_str() const { return mText.c_str(); }
    size_t size() const { return mText.size(); }
    bool empty() const { return mText.empty(); }
    operator std::string() const { return mText; }
    bool operator==(const hidl_string& other) const { return mText == other.mText; }

private:
    std::string mText;
};

// A native handle, owned or borrowed. Copies own a clone of the handle (its
// descriptors duplicated).
class hidl_handle {
public:
    hidl_handle() = default;
    // Borrows the handle: it must outlive this object.
    hidl_handle(const native_handle_t* handle) : mHandle(handle) {}
    hidl_handle(const hidl_handle& other);
    hidl_handle(hidl_handle&& other) noexcept;
    hidl_handle& operator=(const hidl_handle& other);
    hidl_handle& operator=(hidl_handle&& other) noexcept;
    ~hidl_handle();

    // Holds handle; with shouldOwn the handle and its descriptors are closed
    // and freed with this object.
    void setTo(native_handle_t* handle, bool shouldOwn = false);
    const native_handle_t* getNativeHandle() const { return mHandle; }
    operator const native_handle_t*() const { return mHandle; }

private:
    void release();

    const native_handle_t* mHandle = nullptr;
    bool mOwnsHandle = false;
};

// A block of shared memory: its kind ("memfd"), the handle holding its
// descriptor and its size in bytes. A received block's size is that of the
// descriptor itself, never what the sender claimed.
class hidl_memory {
public:
    hidl_memory() = default;
    // Clones the handle (the caller keeps its own).
    hidl_memory(const hidl_string& name, const native_handle_t* handle, size_t size);
    // Takes the handle over.
    hidl_memory(const hidl_string& name, hidl_handle&& handle, size_t size);

    const hidl_string& name() const { return mName; }
    const native_handle_t* handle() const { return mHandle.getNativeHandle(); }
    uint64_t size() const { return mSize; }
    bool valid() const { return mHandle.getNativeHandle() != nullptr; }

private:
    hidl_string mName;
    hidl_handle mHandle;
    uint64_t mSize = 0;
};

} // namespace hardware
} // namespace android
