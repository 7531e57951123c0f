#pragma once

#include "FakeService.h"

namespace kelvo {

// "SysinfoService": code 5 writes a trace to the device path it is given
// (below the root); code 6 waits for it (it is written already).
class FakeSysinfoService : public FakeService {
public:
    explicit FakeSysinfoService(const std::shared_ptr<PlatformState>& state);

protected:
    android::status_t handle(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                             uint32_t flags) override;
};

} // namespace kelvo
