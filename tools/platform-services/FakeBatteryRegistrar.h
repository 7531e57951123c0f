#pragma once

#include <mutex>
#include <vector>

#include "FakeService.h"

namespace kelvo {

// "batteryproperties": registers battery listeners (code 1; code 2
// unregisters) and pushes the battery of the state to them, on
// registration and on each change.
class FakeBatteryRegistrar : public FakeService {
public:
    explicit FakeBatteryRegistrar(const std::shared_ptr<PlatformState>& state);

    // Sends the current battery to every listener; a dead one is dropped.
    void pushAll();
    size_t listenerCount();

    // The listener's interface and its one call.
    static constexpr const char16_t* kListenerDescriptor = u"android.os.IBatteryPropertiesListener";
    static constexpr uint32_t kPropertiesChanged = android::IBinder::FIRST_CALL_TRANSACTION;

protected:
    android::status_t handle(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                             uint32_t flags) override;

private:
    android::status_t push(const android::sp<android::IBinder>& listener);

    std::mutex mListenersLock;
    std::vector<android::sp<android::IBinder>> mListeners;
};

} // namespace kelvo
