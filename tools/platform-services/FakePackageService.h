#pragma once

#include "FakeService.h"

namespace kelvo {

// "package": packages of a uid (codes 33 and 34) and package information
// (code 3).
class FakePackageService : public FakeService {
public:
    explicit FakePackageService(const std::shared_ptr<PlatformState>& state);

protected:
    android::status_t handle(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                             uint32_t flags) override;
};

} // namespace kelvo
