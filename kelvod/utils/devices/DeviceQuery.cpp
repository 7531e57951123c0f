#include "DeviceQuery.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>

#include "KelvoLog.h"
#include "kelvo/KernelDevice.h"

namespace kelvo {

int openDevice(const char* path, int flags) {
    // The devices are only ever opened read-only; the host layer adds
    // close-on-exec.
    (void)flags;
    int fd = KernelDevice::open(path);
    if (fd < 0) {
        KLOGE("Failed to open %s: %s", path != nullptr ? path : "(null)", strerror(errno));
        return -10;
    }
    return fd;
}

int queryDevice(int fd, uint32_t request, void* arg, size_t size) {
    if (fd < 0) {
        KLOGE("Invalid file descriptor");
        return -10;
    }
    int result = KernelDevice::ioctl(fd, request, arg, size);
    if (result < 0) {
        KLOGE("Failed to ioctl: %d(%s)", result, strerror(errno));
        return -14;
    }
    return 0;
}

void closeDevice(int fd) {
    KernelDevice::close(fd);
}

} // namespace kelvo

namespace kelvo {

int requestDevice(const char* file, const char* func, const char* path, uint32_t request,
                  void* arg, size_t size, const char* failure) {
    int fd = openDevice(path, O_RDONLY);
    if (fd < 0) {
        logErrorLine("[%s] %s# Failed to open device: %s", file, func, path);
        return -10;
    }
    int result = queryDevice(fd, request, arg, size);
    closeDevice(fd);
    if (result != 0) {
        logErrorLine("[%s] %s# %s", file, func, failure);
        return -2;
    }
    return 0;
}

} // namespace kelvo
