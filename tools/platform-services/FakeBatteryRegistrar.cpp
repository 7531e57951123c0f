#include "FakeBatteryRegistrar.h"

namespace kelvo {

FakeBatteryRegistrar::FakeBatteryRegistrar(const std::shared_ptr<PlatformState>& state)
    : FakeService("batteryproperties", u"android.os.IBatteryPropertiesRegistrar", state) {}

android::status_t FakeBatteryRegistrar::handle(uint32_t code, const android::Parcel& data,
                                               android::Parcel* reply, uint32_t /*flags*/) {
    switch (code) {
        case 1:
        case 2: {
            android::sp<android::IBinder> listener;
            if (data.readStrongBinder(&listener) != android::NO_ERROR || listener == nullptr) {
                return android::BAD_VALUE;
            }
            {
                std::lock_guard<std::mutex> guard(mListenersLock);
                for (auto it = mListeners.begin(); it != mListeners.end(); ++it) {
                    if (*it == listener) {
                        mListeners.erase(it);
                        break;
                    }
                }
                if (code == 1) {
                    mListeners.push_back(listener);
                }
            }
            if (code == 1) {
                push(listener);
            }
            reply->writeNoException();
            return android::NO_ERROR;
        }
        default:
            return android::UNKNOWN_TRANSACTION;
    }
}

android::status_t FakeBatteryRegistrar::push(const android::sp<android::IBinder>& listener) {
    PlatformState::Battery battery = mState->battery();
    android::Parcel data;
    data.writeInterfaceToken(android::String16(kListenerDescriptor));
    data.writeInt32(1);  // non-null
    data.writeInt32(battery.acOnline ? 1 : 0);
    data.writeInt32(battery.usbOnline ? 1 : 0);
    data.writeInt32(battery.wirelessOnline ? 1 : 0);
    data.writeInt32(500000);   // max charging current
    data.writeInt32(5000000);  // max charging voltage
    data.writeInt32(battery.acOnline || battery.usbOnline || battery.wirelessOnline ? 2 : 3);
    data.writeInt32(2);  // health: good
    data.writeInt32(1);  // present
    data.writeInt32(battery.level);
    data.writeInt32(battery.voltage);
    data.writeInt32(battery.temperature);
    data.writeInt32(3000000);  // full charge
    data.writeInt32(1500000);  // charge counter
    data.writeString16(android::String16("Li-ion"));
    return listener->transact(kPropertiesChanged, data, nullptr, android::IBinder::FLAG_ONEWAY);
}

void FakeBatteryRegistrar::pushAll() {
    std::vector<android::sp<android::IBinder>> listeners;
    {
        std::lock_guard<std::mutex> guard(mListenersLock);
        listeners = mListeners;
    }
    for (const android::sp<android::IBinder>& listener : listeners) {
        if (push(listener) == android::DEAD_OBJECT) {
            std::lock_guard<std::mutex> guard(mListenersLock);
            for (auto it = mListeners.begin(); it != mListeners.end(); ++it) {
                if (*it == listener) {
                    mListeners.erase(it);
                    break;
                }
            }
        }
    }
}

size_t FakeBatteryRegistrar::listenerCount() {
    std::lock_guard<std::mutex> guard(mListenersLock);
    return mListeners.size();
}

} // namespace kelvo
