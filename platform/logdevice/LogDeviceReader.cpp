#include "kelvo/LogDeviceReader.h"

#include <errno.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include "kelvo/LogDevice.h"
#include "kelvo/RootPath.h"

namespace kelvo {

LogDeviceReader::~LogDeviceReader() {
    close();
}

int LogDeviceReader::open(const char* devicePath) {
    close();
    if (devicePath == nullptr) {
        mPath.clear();
        errno = EINVAL;
        return -1;
    }
    mPath = RootPath::resolve(devicePath);
    int fd = LogDevice::openForReading(mPath.c_str());
    if (fd < 0) {
        return -1;
    }
    struct stat st;
    mDatagram = fstat(fd, &st) == 0 && S_ISSOCK(st.st_mode);
    mFd = fd;
    return 0;
}

ssize_t LogDeviceReader::read(void* buffer, size_t size) {
    if (mFd < 0) {
        errno = EBADF;
        return -1;
    }
    ssize_t n;
    do {
        n = ::read(mFd, buffer, size);
    } while (n < 0 && errno == EINTR);
    if (n == 0 && !mDatagram) {
        errno = ENODATA;
        return -1;
    }
    return n;
}

void LogDeviceReader::interrupt() {
    if (mDatagram && mFd >= 0) {
        shutdown(mFd, SHUT_RDWR);
    }
}

void LogDeviceReader::close() {
    if (mFd >= 0) {
        ::close(mFd);
        mFd = -1;
    }
    mDatagram = false;
}

} // namespace kelvo
