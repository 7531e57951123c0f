#pragma once

#include <stdint.h>

#include <map>
#include <memory>
#include <vector>

#include <binder/Parcel.h>

#include "accounters/DataAccounter.h"

namespace kelvo {

// Cameras: one allocator (key 0) held by the application using the camera.
// SetValue carries int64 time, int32 count, then per open stream int32
// camera index, int32 a, int32 b; the power is the sum over the streams of
// their camera's power for the size a x b (the nearest configured size when
// it is not listed). The last camera index opens the records and keys the
// balance.
class CameraAccounter : public DataAccounter {
public:
    CameraAccounter();

    void prepareReply(android::Parcel& reply) override;

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t getPowerValue(int32_t key, const android::Parcel& action,
                          android::Parcel& power) override;
    int32_t getBalanceKey(int32_t key) const override;

private:
    // Per camera index, the power by size.
    std::vector<std::map<int64_t, int32_t>> mCameras;
    int32_t mLastCamera;
};

} // namespace kelvo
