#include "binder/managers/PackageManager.h"

#include "KelvoLog.h"
#include "binder/managers/ParcelReader.h"
#include "core/Notifier.h"
#include "utils/TimeProvider.h"

namespace kelvo {

PackageManager* PackageManager::getInstance() {
    static PackageManager* instance = new PackageManager();
    return instance;
}

PackageManager::PackageManager() : BaseManager("package") {
    setBinderId();
}

void PackageManager::setBinderId() {
    mPackageInfoCode = 3;
    mPackagesForUidCode = mSdkLevel == 24 ? 33 : 34;
}

int32_t PackageManager::getPackagesForUid(int32_t uid, std::vector<android::String8>& out) {
    std::lock_guard<std::mutex> guard(mLock);
    int32_t ret = getService();
    if (ret != 0) {
        KLOGE("Failed to get package service: %d", ret);
        return -8;
    }
    android::Parcel data;
    android::Parcel reply;
    data.writeInterfaceToken(mDescriptor);
    data.writeInt32(uid);
    android::status_t status = mService->transact(mPackagesForUidCode, data, &reply);
    int32_t exception = status == android::NO_ERROR ? reply.readExceptionCode() : status;
    if (exception != 0) {
        KLOGE("Failed to read from package service: %d", exception);
        return -12;
    }
    std::vector<android::String16> names;
    if (!readString16Array(reply, names)) {
        KLOGE("Failed to read from package service: %d", android::BAD_VALUE);
        return -12;
    }
    for (const android::String16& name : names) {
        if (name.size() > 0) {
            out.push_back(android::String8(name));
        }
    }
    return 0;
}

int32_t PackageManager::getPackageVersion(const android::String8& name, android::Parcel* out) {
    std::lock_guard<std::mutex> guard(mLock);
    int32_t ret = getService();
    if (ret != 0) {
        KLOGE("Failed to get package service: %d", ret);
        return -8;
    }
    android::Parcel data;
    android::Parcel reply;
    data.writeInterfaceToken(mDescriptor);
    data.writeString16(android::String16(name));
    data.writeInt32(0);
    data.writeInt32(0);
    android::status_t status = mService->transact(mPackageInfoCode, data, &reply);
    if (status != android::NO_ERROR || reply.readExceptionCode() != 0) {
        KLOGE("Failed to read from package service: %s", name.string());
        return -12;
    }
    int32_t present = 0;
    if (reply.readInt32(&present) != android::NO_ERROR || present <= 0) {
        KLOGI("No package information result: %s", name.string());
        return -12;
    }
    android::String16 packageName;
    std::vector<android::String16> splits;
    int32_t versionCode = 0;
    android::String16 versionName;
    if (reply.readString16(&packageName) != android::NO_ERROR ||
        !readString16Array(reply, splits) || reply.readInt32(&versionCode) != android::NO_ERROR ||
        reply.readString16(&versionName) != android::NO_ERROR) {
        KLOGE("Failed to read from package service: %s", name.string());
        return -12;
    }
    if (out != nullptr) {
        out->writeInt32(versionCode);
        out->writeString16(versionName);
    }
    return 0;
}

void PackageManager::onServiceDied() {
    // The package service dies only with the framework process.
    android::Parcel body;
    body.writeInt64(TimeProvider::getCurrentTime(TIME_TYPE_WALL));
    Notifier::getInstance()->sendNotification(NOTIFICATION_VM_DIED, body);
}

} // namespace kelvo
