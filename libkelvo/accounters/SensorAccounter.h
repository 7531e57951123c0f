#pragma once

#include <stdint.h>

#include <map>
#include <memory>
#include <tuple>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "accounters/DataAccounter.h"

namespace kelvo {

// Sensors, by sensor type (the allocator key): the users of one type share
// its fixed power (in tenths of the profile unit). Activate and Deactivate
// carry int32 sensor type, int64 time, String8 package, String8 user; the
// element is "package|user", so it counts as foreground while its package
// is in front. A user may register the same sensor more than once: the
// element stays until as many deactivations came. A deactivation of type -1
// stops the user on every type. The records open with their sensor type.
class SensorAccounter : public DataAccounter {
public:
    static constexpr int32_t kAllTypes = -1;
    // Caps on what log text can make grow; beyond them a new type or
    // registration is refused and counted.
    static constexpr size_t kMaxSensorTypes = 256;
    static constexpr size_t kMaxCountEntries = 4096;

    SensorAccounter();

    void prepareReply(android::Parcel& reply) override;

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t getAllocatorKey(const android::Parcel& action) override;
    int32_t onActionActivate(const android::Parcel& action) override;
    int32_t onActionDeactivate(const android::Parcel& action) override;
    int32_t onActionDeactivateAll(const android::Parcel& action) override;

private:
    // (sensor type, package, user)
    using user_key = std::tuple<int32_t, android::String8, android::String8>;

    // Reads int64 time, String8 package, String8 user after the type.
    static int32_t readUser(const android::Parcel& action, int64_t* timestamp,
                            android::String8* package, android::String8* user);
    // Removes the user's element from its type's allocator, the record
    // opening with that type.
    int32_t removeUser(const user_key& key, int64_t timestamp);

    // By sensor type, the first value of its parameter.
    std::map<int32_t, int32_t> mPowers;
    // Registrations per (type, package, user); never holds 0.
    std::map<user_key, int32_t> mCounts;
    // The key of the records being reported.
    int32_t mReplyKey;
};

} // namespace kelvo
