#include "binder/managers/WakelockManager.h"

#include <binder/Parcel.h>

#include "KelvoLog.h"
#include "binder/managers/ParcelReader.h"

namespace kelvo {

namespace {

constexpr uint32_t kPartialWakelocks = 101;
constexpr uint32_t kResetBatteryStats = 102;

} // namespace

WakelockManager* WakelockManager::getInstance() {
    static WakelockManager* instance = new WakelockManager();
    return instance;
}

int32_t WakelockManager::getPartialWakelocks(std::vector<android::String16>& out) {
    std::lock_guard<std::mutex> guard(mLock);
    int32_t ret = getService();
    if (ret != 0) {
        KLOGE("Failed to get pmservice: %d", ret);
        return -8;
    }
    android::Parcel data;
    android::Parcel reply;
    data.writeInterfaceToken(mDescriptor);
    data.writeInt32(0);
    android::status_t status = mService->transact(kPartialWakelocks, data, &reply);
    int32_t exception = status == android::NO_ERROR ? reply.readExceptionCode() : status;
    if (exception != 0) {
        KLOGE("Failed to read from pmservice: %d", exception);
        return -12;
    }
    if (!readString16Array(reply, out)) {
        KLOGE("Failed to read from pmservice: %d", android::BAD_VALUE);
        return -12;
    }
    return 0;
}

int32_t WakelockManager::noteResetBatteryStats() {
    std::lock_guard<std::mutex> guard(mLock);
    if (getService() != 0) {
        return -8;
    }
    android::Parcel data;
    data.writeInterfaceToken(mDescriptor);
    mService->transact(kResetBatteryStats, data, nullptr, android::IBinder::FLAG_ONEWAY);
    return 0;
}

} // namespace kelvo
