#include "binder/managers/BatteryListener.h"

#include <binder/Parcel.h>

#include "KelvoLog.h"
#include "core/Notifier.h"
#include "utils/TimeProvider.h"

namespace kelvo {

BatteryListener::BatteryListener()
    : mDescriptor(u"android.os.IBatteryPropertiesListener"), mLastLevel(0), mLastOnline(false) {}

android::status_t BatteryListener::onTransact(uint32_t code, const android::Parcel& data,
                                              android::Parcel* reply, uint32_t flags) {
    if (code != kPropertiesChanged) {
        return android::BBinder::onTransact(code, data, reply, flags);
    }
    if (!data.enforceInterface(mDescriptor)) {
        return android::PERMISSION_DENIED;
    }
    // Battery properties: non-null marker; ac, usb, wireless online; max
    // charging current and voltage; status, health, present; level,
    // voltage, temperature; ... (docs/architecture.md, "Platform services").
    int32_t values[12] = {};
    for (int32_t& value : values) {
        if (data.readInt32(&value) != android::NO_ERROR) {
            KLOGE("Invalid battery properties");
            return android::BAD_VALUE;
        }
    }
    if (values[0] == 0) {
        return android::BAD_VALUE;
    }
    bool online = values[1] != 0 || values[2] != 0 || values[3] != 0;
    batteryPropertiesChanged(online, values[9], values[10], values[11]);
    return android::NO_ERROR;
}

void BatteryListener::batteryPropertiesChanged(bool online, int32_t level, int32_t voltage,
                                               int32_t temperature) {
    // Callbacks may run on several binder threads: one at a time keeps the
    // last values and the order of notifications consistent.
    std::lock_guard<std::mutex> guard(mLock);
    int64_t now = TimeProvider::getCurrentTime(TIME_TYPE_WALL);
    if (level != mLastLevel) {
        mLastLevel = level;
        android::Parcel body;
        body.writeInt64(now);
        body.writeInt32(level);
        body.writeInt32(voltage);
        body.writeInt32(temperature);
        Notifier::getInstance()->sendNotification(NOTIFICATION_BATTERY_LEVEL_CHANGED, body);
    }
    if (online != mLastOnline) {
        mLastOnline = online;
        android::Parcel body;
        body.writeInt64(now);
        body.writeBool(online);
        body.writeInt32(level);
        body.writeInt32(voltage);
        body.writeInt32(temperature);
        Notifier::getInstance()->sendNotification(NOTIFICATION_CHARGER_ONLINE_CHANGED, body);
    }
}

} // namespace kelvo
