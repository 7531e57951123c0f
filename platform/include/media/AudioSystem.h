#pragma once

#include <utils/String8.h>

namespace android {

// The audio framework's parameter query. On the host it asks the platform
// service "media.audio_flinger" (a fake one in tests and the simulator).
class AudioSystem {
public:
    // The transaction code of the parameter query and the service's
    // interface token.
    static constexpr uint32_t kGetParameters = 1;  // IBinder::FIRST_CALL_TRANSACTION
    static const char16_t* const kDescriptor;
    static const char16_t* const kServiceName;

    // The value of the keys: "key=value" pairs or a bare value, as the
    // framework answers; empty when the service is missing, fails or knows
    // nothing of the keys.
    static String8 getParameters(const String8& keys);
};

}  // namespace android
