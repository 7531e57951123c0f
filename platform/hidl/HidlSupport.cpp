#include <hidl/HidlSupport.h>

#include <utility>

namespace android {
namespace hardware {

hidl_handle::hidl_handle(const hidl_handle& other) {
    *this = other;
}

hidl_handle::hidl_handle(hidl_handle&& other) noexcept {
    *this = std::move(other);
}

hidl_handle& hidl_handle::operator=(const hidl_handle& other) {
    if (this != &other) {
        release();
        if (other.mHandle != nullptr) {
            // A clone that fails leaves this handle empty.
            mHandle = native_handle_clone(other.mHandle);
            mOwnsHandle = mHandle != nullptr;
        }
    }
    return *this;
}

hidl_handle& hidl_handle::operator=(hidl_handle&& other) noexcept {
    if (this != &other) {
        release();
        mHandle = other.mHandle;
        mOwnsHandle = other.mOwnsHandle;
        other.mHandle = nullptr;
        other.mOwnsHandle = false;
    }
    return *this;
}

hidl_handle::~hidl_handle() {
    release();
}

void hidl_handle::setTo(native_handle_t* handle, bool shouldOwn) {
    release();
    mHandle = handle;
    mOwnsHandle = shouldOwn;
}

void hidl_handle::release() {
    if (mOwnsHandle && mHandle != nullptr) {
        native_handle_t* handle = const_cast<native_handle_t*>(mHandle);
        native_handle_close(handle);
        native_handle_delete(handle);
    }
    mHandle = nullptr;
    mOwnsHandle = false;
}

hidl_memory::hidl_memory(const hidl_string& name, const native_handle_t* handle, size_t size)
    : mName(name), mHandle(hidl_handle(handle)), mSize(size) {}

hidl_memory::hidl_memory(const hidl_string& name, hidl_handle&& handle, size_t size)
    : mName(name), mHandle(std::move(handle)), mSize(size) {}

} // namespace hardware
} // namespace android
