#include "FakePackageService.h"

#include <utils/String8.h>

namespace kelvo {

FakePackageService::FakePackageService(const std::shared_ptr<PlatformState>& state)
    : FakeService("package", u"android.content.pm.IPackageManager", state) {}

android::status_t FakePackageService::handle(uint32_t code, const android::Parcel& data,
                                             android::Parcel* reply, uint32_t /*flags*/) {
    switch (code) {
        case 3: {
            android::String16 name;
            int32_t flags = 0;
            int32_t user = 0;
            if (data.readString16(&name) != android::NO_ERROR ||
                data.readInt32(&flags) != android::NO_ERROR ||
                data.readInt32(&user) != android::NO_ERROR) {
                return android::BAD_VALUE;
            }
            std::string text = android::String8(name).string();
            int32_t versionCode = 0;
            std::string versionName;
            reply->writeNoException();
            if (!mState->packageVersion(text, versionCode, versionName)) {
                reply->writeInt32(0);
                return android::NO_ERROR;
            }
            reply->writeInt32(1);
            reply->writeString16(name);
            reply->writeInt32(0);  // no split names
            reply->writeInt32(versionCode);
            reply->writeString16(android::String16(versionName.c_str()));
            return android::NO_ERROR;
        }
        case 33:
        case 34: {
            int32_t uid = 0;
            if (data.readInt32(&uid) != android::NO_ERROR) {
                return android::BAD_VALUE;
            }
            std::vector<std::string> packages = mState->packages(uid);
            reply->writeNoException();
            if (packages.empty()) {
                reply->writeInt32(-1);
                return android::NO_ERROR;
            }
            reply->writeInt32(static_cast<int32_t>(packages.size()));
            for (const std::string& name : packages) {
                reply->writeString16(android::String16(name.c_str()));
            }
            return android::NO_ERROR;
        }
        default:
            return android::UNKNOWN_TRANSACTION;
    }
}

} // namespace kelvo
