#include "binder/managers/BaseManager.h"

#include <binder/IServiceManager.h>
#include <cutils/properties.h>

#include "KelvoLog.h"

namespace kelvo {

void MDeathRecipient::binderDied(const android::wp<android::IBinder>& who) {
    if (mManager == nullptr) {
        KLOGE("Invalid manager");
        return;
    }
    if (mManager->putService(who) == 0) {
        mManager->onServiceDied();
    }
}

BaseManager::BaseManager(const char* name)
    : mSdkLevel(property_get_int32("ro.build.version.sdk", 0)), mName(name) {}

int32_t BaseManager::getService() {
    if (mService != nullptr) {
        return 0;
    }
    android::sp<android::IServiceManager> sm = android::defaultServiceManager();
    if (sm == nullptr) {
        if (!mQuietFailures) {
            KLOGE("Failed to get service manager");
        }
        return -8;
    }
    android::sp<android::IBinder> binder = sm->getService(android::String16(mName));
    if (binder == nullptr) {
        if (!mQuietFailures) {
            KLOGE("Failed to get %s service", mName.string());
        }
        return -8;
    }
    // The token of every request is what the remote reports; a peer that
    // died meanwhile reports nothing.
    android::String16 descriptor = binder->getInterfaceDescriptor();
    if (descriptor.size() == 0 || !binder->isBinderAlive()) {
        if (!mQuietFailures) {
            KLOGE("Failed to get %s service", mName.string());
        }
        return -8;
    }
    setBinderId();
    if (mDeathRecipient == nullptr) {
        mDeathRecipient = new MDeathRecipient(this);
    }
    if (binder->linkToDeath(mDeathRecipient) != android::NO_ERROR) {
        if (!mQuietFailures) {
            KLOGE("Failed to get %s service", mName.string());
        }
        return -8;
    }
    mService = binder;
    mDescriptor = descriptor;
    KLOGI("Get %s service success", mName.string());
    return 0;
}

bool BaseManager::isConnected() {
    std::lock_guard<std::mutex> guard(mLock);
    return mService != nullptr;
}

int32_t BaseManager::putService(const android::wp<android::IBinder>& who) {
    std::lock_guard<std::mutex> guard(mLock);
    if (mService != nullptr && who == mService) {
        mService.clear();
        KLOGE("%s service has died", mName.string());
        return 0;
    }
    KLOGE("Unknown service died");
    return -3;
}

} // namespace kelvo
