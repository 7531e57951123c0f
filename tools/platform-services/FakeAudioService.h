#pragma once

#include "FakeService.h"

namespace kelvo {

// "media.audio_flinger": the parameter query (code 1: int32 output, String16
// keys) answers the String16 value the state holds for the keys, empty when
// none was set.
class FakeAudioService : public FakeService {
public:
    explicit FakeAudioService(const std::shared_ptr<PlatformState>& state);

protected:
    android::status_t handle(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                             uint32_t flags) override;
};

}  // namespace kelvo
