#pragma once

#include <binder/IBinder.h>
#include <stdint.h>
#include <utils/String16.h>
#include <utils/String8.h>
#include <utils/StrongPointer.h>

#include <mutex>

namespace kelvo {

class BaseManager;

// Tells its manager that the connected service died.
class MDeathRecipient : public android::IBinder::DeathRecipient {
public:
    explicit MDeathRecipient(BaseManager* manager) : mManager(manager) {}
    void binderDied(const android::wp<android::IBinder>& who) override;

private:
    BaseManager* mManager;
};

// Common base of the platform service clients: looks the service up by name,
// forgets it when it dies and looks it up again on the next use.
class BaseManager {
public:
    explicit BaseManager(const char* name);
    virtual ~BaseManager() = default;

    virtual void onServiceDied() {}
    // Fills the transaction codes for the sdk level.
    virtual void setBinderId() {}

    // 0 when connected; -8 when the service manager or the service is
    // missing. Callers hold mLock.
    int32_t getService();
    // 0 when who was the connected service (now forgotten), else -3.
    int32_t putService(const android::wp<android::IBinder>& who);

    const android::String8& getName() const { return mName; }
    // True while a service is connected (not yet reported dead).
    bool isConnected();

protected:
    int32_t mSdkLevel;
    android::sp<android::IBinder> mService;
    // The descriptor the connected service reports: the token of every
    // request.
    android::String16 mDescriptor;
    std::mutex mLock;
    android::String8 mName;
    android::sp<MDeathRecipient> mDeathRecipient;
    // Set while a client retries in a loop: only its first failure is
    // logged.
    bool mQuietFailures = false;
};

} // namespace kelvo
