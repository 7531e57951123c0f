#pragma once

#include "FakeService.h"

namespace kelvo {

// "activity": the running application processes (codes 77 and 83).
class FakeActivityService : public FakeService {
public:
    explicit FakeActivityService(const std::shared_ptr<PlatformState>& state);

protected:
    android::status_t handle(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                             uint32_t flags) override;
};

} // namespace kelvo
