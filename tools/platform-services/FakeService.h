#pragma once

#include <binder/Binder.h>
#include <binder/Parcel.h>
#include <utils/String16.h>

#include <memory>
#include <string>

#include "PlatformState.h"

namespace kelvo {

// Base of the fake platform services: counts each call, waits the delay
// the state sets for the service, refuses a wrong interface token and hands
// the rest to handle().
class FakeService : public android::BBinder {
public:
    FakeService(const char* name, const char16_t* descriptor,
                const std::shared_ptr<PlatformState>& state);

    const android::String16& getInterfaceDescriptor() const override { return mDescriptor; }
    const std::string& name() const { return mName; }

protected:
    android::status_t onTransact(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                                 uint32_t flags) override;
    virtual android::status_t handle(uint32_t code, const android::Parcel& data,
                                     android::Parcel* reply, uint32_t flags) = 0;

    std::string mName;
    android::String16 mDescriptor;
    std::shared_ptr<PlatformState> mState;
};

} // namespace kelvo
