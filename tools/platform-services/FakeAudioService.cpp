#include "FakeAudioService.h"

#include <media/AudioSystem.h>
#include <utils/String16.h>
#include <utils/String8.h>

namespace kelvo {

FakeAudioService::FakeAudioService(const std::shared_ptr<PlatformState>& state)
    : FakeService("media.audio_flinger", android::AudioSystem::kDescriptor, state) {}

android::status_t FakeAudioService::handle(uint32_t code, const android::Parcel& data,
                                           android::Parcel* reply, uint32_t /*flags*/) {
    if (code != android::AudioSystem::kGetParameters) {
        return android::UNKNOWN_TRANSACTION;
    }
    int32_t output = 0;
    android::String16 keys;
    if (data.readInt32(&output) != android::NO_ERROR ||
        data.readString16(&keys) != android::NO_ERROR) {
        return android::BAD_VALUE;
    }
    std::string value = mState->audioParameter(android::String8(keys).string());
    reply->writeString16(android::String16(value.c_str()));
    return android::NO_ERROR;
}

}  // namespace kelvo
