#pragma once

#include <stdint.h>

#include <map>
#include <memory>

#include <binder/Parcel.h>

#include "accounters/DataAccounter.h"

namespace kelvo {

// Bluetooth, by activity (the allocator key, an int32 before the fields of
// Activate, Deactivate and SetValue): media (key 3) is shared among its
// applications, every other activity is held by one application at a time.
// Each activity has the fixed power of its profile parameter. The records
// open with the activity's key.
class BluetoothAccounter : public DataAccounter {
public:
    static constexpr int32_t kSharedKey = 3;
    // Most activities tracked; a new key beyond is refused and counted.
    static constexpr size_t kMaxKeys = 256;

    BluetoothAccounter();

    void prepareReply(android::Parcel& reply) override;

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t getAllocatorKey(const android::Parcel& action) override;
    int32_t onActionDeactivateAll(const android::Parcel& action) override;

private:
    // By activity, the first value of its parameter.
    std::map<int32_t, int32_t> mPowers;
    // The key of the records being reported.
    int32_t mReplyKey;
};

} // namespace kelvo
