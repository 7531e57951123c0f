#include <binder/IServiceManager.h>
#include <binder/Parcel.h>
#include <media/AudioSystem.h>
#include <utils/String16.h>

namespace android {

const char16_t* const AudioSystem::kDescriptor = u"android.media.IAudioFlinger";
const char16_t* const AudioSystem::kServiceName = u"media.audio_flinger";

String8 AudioSystem::getParameters(const String8& keys) {
    // checkService does not wait: a framework still starting answers nothing
    // now and the caller asks again later.
    sp<IBinder> binder = defaultServiceManager()->checkService(String16(kServiceName));
    if (binder == nullptr) {
        return String8();
    }
    Parcel data;
    data.writeInterfaceToken(String16(kDescriptor));
    data.writeInt32(0);  // every output
    data.writeString16(String16(keys));
    Parcel reply;
    if (binder->transact(kGetParameters, data, &reply) != NO_ERROR) {
        return String8();
    }
    String16 value;
    if (reply.readString16(&value) != NO_ERROR) {
        return String8();
    }
    return String8(value);
}

}  // namespace android
