#pragma once

#include "FakeService.h"

namespace kelvo {

// "permission": the permission check (code 1: String16 permission, int32
// pid, int32 uid -> int32 granted) from the grants of the state.
class FakePermissionService : public FakeService {
public:
    explicit FakePermissionService(const std::shared_ptr<PlatformState>& state);

protected:
    android::status_t handle(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                             uint32_t flags) override;
};

} // namespace kelvo
