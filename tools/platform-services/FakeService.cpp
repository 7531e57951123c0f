#include "FakeService.h"

#include <chrono>
#include <thread>

namespace kelvo {

FakeService::FakeService(const char* name, const char16_t* descriptor,
                         const std::shared_ptr<PlatformState>& state)
    : mName(name), mDescriptor(descriptor), mState(state) {}

android::status_t FakeService::onTransact(uint32_t code, const android::Parcel& data,
                                          android::Parcel* reply, uint32_t flags) {
    if (code >= android::IBinder::FIRST_CALL_TRANSACTION &&
        code <= android::IBinder::LAST_CALL_TRANSACTION) {
        mState->noteCall(mName, code);
        int32_t delay = mState->delayMs(mName);
        if (delay > 0) {
            std::this_thread::sleep_for(std::chrono::milliseconds(delay));
        }
        if (!data.enforceInterface(mDescriptor)) {
            return android::PERMISSION_DENIED;
        }
        return handle(code, data, reply, flags);
    }
    return android::BBinder::onTransact(code, data, reply, flags);
}

} // namespace kelvo
