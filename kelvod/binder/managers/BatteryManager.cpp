#include "binder/managers/BatteryManager.h"

#include <binder/IServiceManager.h>
#include <binder/Parcel.h>

#include <pthread.h>

#include <algorithm>
#include <chrono>
#include <thread>

#include "KelvoLog.h"

namespace kelvo {

namespace {

constexpr uint32_t kRegisterListener = android::IBinder::FIRST_CALL_TRANSACTION;
constexpr int kFirstRetryMs = 100;
constexpr int kMaxRetryMs = 5000;

} // namespace

BatteryManager* BatteryManager::getInstance() {
    static BatteryManager* instance = new BatteryManager();
    return instance;
}

BatteryManager::BatteryManager()
    : BaseManager("batteryproperties"), mRegistered(false), mRetrying(false), mRetryNeeded(false) {}

int32_t BatteryManager::initialize() {
    return registerListener(false);
}

int32_t BatteryManager::registerListener(bool quiet) {
    std::lock_guard<std::mutex> guard(mLock);
    mRegistered = false;
    mQuietFailures = quiet;
    int32_t ret = getService();
    mQuietFailures = false;
    if (ret != 0) {
        if (!quiet) {
            KLOGE("Failed to get battery properties service: %d", ret);
        }
        return -8;
    }
    if (mListener == nullptr) {
        mListener = new BatteryListener();
    }
    android::Parcel data;
    android::Parcel reply;
    data.writeInterfaceToken(mDescriptor);
    data.writeStrongBinder(mListener);
    android::status_t status = mService->transact(kRegisterListener, data, &reply);
    if (status != android::NO_ERROR || reply.readExceptionCode() != 0) {
        if (!quiet) {
            KLOGE("Failed to register battery listener: %d", status);
        }
        return -12;
    }
    mRegistered = true;
    return 0;
}

bool BatteryManager::isRegistered() {
    std::lock_guard<std::mutex> guard(mLock);
    return mRegistered && mService != nullptr;
}

void BatteryManager::onServiceDied() {
    registerInBackground();
}

void BatteryManager::registerInBackground() {
    {
        std::lock_guard<std::mutex> guard(mRetryLock);
        mRetryNeeded = true;
        if (mRetrying) {
            return;
        }
        mRetrying = true;
    }
    // The process's binder state is set up here rather than on the retry
    // thread, which may still be inside a lookup when the process exits.
    android::defaultServiceManager()->checkService(android::String16(mName));
    // The registrar usually comes back a while after it died: a single
    // retry would leave battery and charger notifications stopped for good.
    std::thread(&BatteryManager::retryLoop, this).detach();
}

void BatteryManager::retryLoop() {
    pthread_setname_np(pthread_self(), "BatteryRetry");
    // Only the first failure of the thread is logged: a registrar that stays
    // away does not fill the error log round after round.
    bool quiet = false;
    for (;;) {
        {
            // A death reported while the last round ran needs a new one.
            std::lock_guard<std::mutex> guard(mRetryLock);
            if (!mRetryNeeded) {
                mRetrying = false;
                return;
            }
            mRetryNeeded = false;
        }
        int delayMs = kFirstRetryMs;
        while (registerListener(quiet) != 0) {
            quiet = true;
            std::this_thread::sleep_for(std::chrono::milliseconds(delayMs));
            delayMs = std::min(delayMs * 2, kMaxRetryMs);
        }
    }
}

} // namespace kelvo
