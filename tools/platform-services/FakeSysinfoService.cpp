#include "FakeSysinfoService.h"

#include <fcntl.h>
#include <kelvo/RootPath.h>
#include <unistd.h>
#include <utils/String8.h>

#include <string>

namespace kelvo {

FakeSysinfoService::FakeSysinfoService(const std::shared_ptr<PlatformState>& state)
    : FakeService("SysinfoService", u"vendor.sysinfo.ISysinfoService", state) {}

android::status_t FakeSysinfoService::handle(uint32_t code, const android::Parcel& data,
                                             android::Parcel* reply, uint32_t /*flags*/) {
    switch (code) {
        case 5: {
            android::String16 path;
            if (data.readString16(&path) != android::NO_ERROR) {
                return android::BAD_VALUE;
            }
            std::string device = android::String8(path).string();
            // Only absolute paths without ".." stay below the root.
            if (device.empty() || device[0] != '/' || device.find("/../") != std::string::npos ||
                (device.size() >= 3 && device.compare(device.size() - 3, 3, "/..") == 0)) {
                return android::BAD_VALUE;
            }
            std::string host = RootPath::resolve(device);
            int fd = open(host.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
            if (fd < 0) {
                return android::UNKNOWN_ERROR;
            }
            static const char kTrace[] = "# tracer: nop\n";
            ssize_t written = write(fd, kTrace, sizeof(kTrace) - 1);
            close(fd);
            if (written != static_cast<ssize_t>(sizeof(kTrace) - 1)) {
                return android::UNKNOWN_ERROR;
            }
            mState->noteTrace(device);
            reply->writeNoException();
            return android::NO_ERROR;
        }
        case 6:
            reply->writeNoException();
            return android::NO_ERROR;
        default:
            return android::UNKNOWN_TRANSACTION;
    }
}

} // namespace kelvo
