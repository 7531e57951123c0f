#pragma once

#include <stdint.h>

#include <memory>
#include <vector>

#include <binder/Parcel.h>

#include "accounters/DataAccounter.h"

namespace kelvo {

// Audio: one allocator per playback session (the allocator key is the
// session id), held by the stream's application. SetValue opens with an int32
// subtype:
//   0 session power: int32 session, int64 time, int32 output device, int32
//     volume. Devices: 1 receiver, 2 speaker, 3 both; the power is B + A x V
//     per output, the receiver's in hundredths.
//   1 smart amplifier reading: int32 index, int64 t1, int64 t2, int64 x,
//     int64 y; answered at once with a component record of three int64.
// A session's allocator goes with its Deactivate and with DeactivateAll; the
// oldest-keyed one makes room when kMaxSessions are open. A session that goes
// always reports its open record first.
class AudioAccounter : public DataAccounter {
public:
    static constexpr size_t kMaxSessions = 21;
    static constexpr int32_t kSubtypeSession = 0;
    static constexpr int32_t kSubtypeSmartPa = 1;

    AudioAccounter();

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t getAllocatorKey(const android::Parcel& action) override;
    int32_t onActionDeactivate(const android::Parcel& action) override;
    int32_t onActionDeactivateAll(const android::Parcel& action) override;
    int32_t onActionSetValue(const android::Parcel& action) override;

private:
    // Output devices of the profile: 0 receiver, 1 speaker.
    static constexpr int32_t kOutputs = 2;

    void loadProfile();
    int32_t setSessionValue(const android::Parcel& action);
    int32_t setSmartPaValue(const android::Parcel& action);
    // The power of an output device at a volume; -1 for an unknown device.
    int32_t devicePower(int32_t device, int32_t volume, int64_t* power) const;
    // Reports what the allocator still holds, up to the last time it
    // accounted, before it is deleted.
    void closeOpenRecord(BaseAllocator* allocator);

    int64_t mSlope[kOutputs];
    int64_t mIntercept[kOutputs];
    std::vector<int32_t> mSmartPa[kOutputs];
};

} // namespace kelvo
