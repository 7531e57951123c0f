#pragma once

#include <binder/Binder.h>
#include <stdint.h>

#include <mutex>

namespace kelvo {

// Receives battery changes from the battery properties registrar and turns
// changes of level and charger into notifications.
class BatteryListener : public android::BBinder {
public:
    static constexpr uint32_t kPropertiesChanged = android::IBinder::FIRST_CALL_TRANSACTION;

    BatteryListener();
    const android::String16& getInterfaceDescriptor() const override { return mDescriptor; }

    // Level notification first when both changed.
    void batteryPropertiesChanged(bool online, int32_t level, int32_t voltage, int32_t temperature);

protected:
    android::status_t onTransact(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                                 uint32_t flags) override;

private:
    android::String16 mDescriptor;
    std::mutex mLock;
    int32_t mLastLevel;
    bool mLastOnline;
};

} // namespace kelvo
