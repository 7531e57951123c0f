#pragma once

#include "FakeService.h"

namespace kelvo {

// "pmservice": partial wakelock records (code 101) and the note that battery
// statistics were reset (code 102, one-way).
class FakePmService : public FakeService {
public:
    explicit FakePmService(const std::shared_ptr<PlatformState>& state);

protected:
    android::status_t handle(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                             uint32_t flags) override;
};

} // namespace kelvo
