#include "binder/managers/SysinfoManager.h"

#include <binder/Parcel.h>

#include "KelvoLog.h"

namespace kelvo {

namespace {

constexpr uint32_t kDumpSystrace = 5;
constexpr uint32_t kWaitDumpDone = 6;

} // namespace

SysinfoManager* SysinfoManager::getInstance() {
    static SysinfoManager* instance = new SysinfoManager();
    return instance;
}

int32_t SysinfoManager::dumpSystrace(const char* path) {
    if (path == nullptr) {
        KLOGE("Invalid path file: %s", "(null)");
        return -5;
    }
    // Connecting changes the shared connection: under the lock like every
    // other client.
    std::lock_guard<std::mutex> guard(mLock);
    if (getService() != 0) {
        KLOGE("Failed to get sysinfo service");
        return -8;
    }
    android::Parcel data;
    android::Parcel reply;
    data.writeInterfaceToken(mDescriptor);
    data.writeString16(android::String16(path));
    if (mService->transact(kDumpSystrace, data, &reply) != android::NO_ERROR) {
        KLOGE("Failed to dump systrace");
        return -8;
    }
    android::Parcel wait;
    android::Parcel waitReply;
    wait.writeInterfaceToken(mDescriptor);
    if (mService->transact(kWaitDumpDone, wait, &waitReply) != android::NO_ERROR) {
        KLOGE("Failed to wait for dump done");
        return -8;
    }
    return 0;
}

} // namespace kelvo
