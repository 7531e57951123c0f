#include "FakePermissionService.h"

#include <utils/String8.h>

namespace kelvo {

FakePermissionService::FakePermissionService(const std::shared_ptr<PlatformState>& state)
    : FakeService("permission", u"android.os.IPermissionController", state) {}

android::status_t FakePermissionService::handle(uint32_t code, const android::Parcel& data,
                                                android::Parcel* reply, uint32_t /*flags*/) {
    if (code != android::IBinder::FIRST_CALL_TRANSACTION) {
        return android::UNKNOWN_TRANSACTION;
    }
    android::String16 permission;
    int32_t pid = 0;
    int32_t uid = 0;
    if (data.readString16(&permission) != android::NO_ERROR ||
        data.readInt32(&pid) != android::NO_ERROR || data.readInt32(&uid) != android::NO_ERROR) {
        return android::BAD_VALUE;
    }
    reply->writeNoException();
    reply->writeInt32(mState->granted(android::String8(permission).string(), uid) ? 1 : 0);
    return android::NO_ERROR;
}

} // namespace kelvo
