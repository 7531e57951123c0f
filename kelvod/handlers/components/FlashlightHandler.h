#pragma once

#include <stdint.h>
#include <utils/String8.h>

#include "handlers/components/ComponentHandler.h"

namespace kelvo {

// The flashlight: on and off come from the log device, its user from the
// torch messages (uid and pid) and from the camera handler. A user learnt
// while the light is on takes over at the next change, so an on period is
// charged whole to the user current when it began; the period ends with the
// very name it was started with.
class FlashlightHandler : public ComponentHandler {
public:
    static constexpr uint32_t kElector = 0x80;

    // Tag indexes.
    enum flashlight_tag : int32_t {
        TAG_FLASHLIGHT_OFF = 0,
        TAG_FLASHLIGHT_ON = 1,
        TAG_TORCH_CONNECT = 2,
    };
    // Customized message of the camera handler: String8 the camera's user.
    static constexpr int32_t kCameraUser = 0;

    FlashlightHandler();

    static const component_family& family();
    static const table_attribute& stateTable();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void registerDispatcherTag() override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;

private:
    int32_t changeState(int64_t time, int32_t state);
    int32_t handleTorchUser(const char* text);
    // The user from now on, or from the next change while the light is on.
    void setUser(const android::String8& name);

    int32_t mState;
    android::String8 mCurrentUser;
    android::String8 mPendingUser;
    // The name the running on period was activated with; empty when off or
    // when nobody was known (nothing is charged then).
    android::String8 mChargedUser;
};

}  // namespace kelvo
