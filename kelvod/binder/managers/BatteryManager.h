#pragma once

#include "binder/managers/BaseManager.h"
#include "binder/managers/BatteryListener.h"

namespace kelvo {

// Registers the battery listener with "batteryproperties", and again after
// the registrar dies.
class BatteryManager : public BaseManager {
public:
    static BatteryManager* getInstance();

    // 0 once the listener is registered; -8 without the service, -12 when
    // the registrar refuses.
    int32_t initialize();
    // Registers on a thread of its own ("BatteryRetry"): at once, then after
    // 100 ms, doubling up to 5 s, until it succeeds; one such loop at a
    // time, which logs only its first failure.
    void registerInBackground();
    // The registrar died: registers again in the background.
    void onServiceDied() override;

    bool isRegistered();

private:
    BatteryManager();
    void retryLoop();
    int32_t registerListener(bool quiet);

    android::sp<BatteryListener> mListener;
    bool mRegistered;
    std::mutex mRetryLock;
    bool mRetrying;
    bool mRetryNeeded;
};

} // namespace kelvo
