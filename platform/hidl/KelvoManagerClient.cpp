#include "kelvo/KelvoManagerClient.h"

#include <errno.h>
#include <sys/mman.h>
#include <unistd.h>
#include <vendor/tovaro/hardware/kelvo/1.0/IKelvoManager.h>

using android::sp;
using android::hardware::hidl_handle;
using android::hardware::hidl_memory;
using vendor::tovaro::hardware::kelvo::V1_0::IKelvoManager;
using vendor::tovaro::hardware::kelvo::V1_0::KelvoEvent;

namespace kelvo {

int32_t KelvoManagerClient::send(int32_t type, const void* data, size_t size) {
    if (size > UINT32_MAX) {
        return -EMSGSIZE;
    }
    return send(type, data, size, static_cast<uint32_t>(size));
}

int32_t KelvoManagerClient::send(int32_t type, const void* data, size_t size,
                                 uint32_t declaredSize) {
    if (data == nullptr && size != 0) {
        return -EINVAL;
    }
    int fd = memfd_create("kelvo-event", MFD_CLOEXEC);
    if (fd < 0) {
        return -errno;
    }
    const uint8_t* bytes = static_cast<const uint8_t*>(data);
    size_t done = 0;
    while (done < size) {
        ssize_t n = write(fd, bytes + done, size - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            int e = n < 0 ? errno : EIO;
            close(fd);
            return -e;
        }
        done += static_cast<size_t>(n);
    }
    native_handle_t* handle = native_handle_create(1, 0);
    if (handle == nullptr) {
        close(fd);
        return -ENOMEM;
    }
    handle->data[0] = fd;
    hidl_handle owned;
    owned.setTo(handle, true);  // closes fd when the event goes
    KelvoEvent event;
    event.type = type;
    event.size = declaredSize;
    event.memory = hidl_memory("memfd", std::move(owned), size);

    sp<IKelvoManager> service = IKelvoManager::getService("default");
    if (service == nullptr) {
        return -ECONNREFUSED;
    }
    android::hardware::Return<int32_t> result = service->sendKelvoEvent(event);
    if (!result.isOk()) {
        android::status_t err = result.getStatus().transactionError();
        if (err == android::TIMED_OUT) return -ETIMEDOUT;
        if (err == android::DEAD_OBJECT) return -ECONNRESET;
        return -EIO;
    }
    return result;
}

} // namespace kelvo
