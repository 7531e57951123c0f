#include "accounters/SensorAccounter.h"

#include <limits>
#include <vector>

#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SharedAllocator.h"

using android::NO_ERROR;
using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

String8 elementName(const String8& package, const String8& user) {
    String8 name(package);
    name.append("|");
    name.append(user);
    return name;
}

} // namespace

SensorAccounter::SensorAccounter() : mReplyKey(0) {
    std::vector<config_parameter> parameters;
    if (PowerProfile::readGrouped(PROFILE_SENSOR, -1, false, &parameters) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    for (const config_parameter& parameter : parameters) {
        if (!parameter.values.empty()) {
            mPowers.emplace(parameter.id, parameter.values[0].value);
        }
    }
}

void SensorAccounter::prepareReply(Parcel& reply) {
    reply.writeInt32(mReplyKey);
}

std::unique_ptr<BaseAllocator> SensorAccounter::createAllocators(int32_t key) {
    if (mAllocators.size() >= kMaxSensorTypes) {
        LLOGE("Too many sensor types: %zu, refused: %d", mAllocators.size(), key);
        HealthCounters::add(Health::AccounterStateCapped);
        return nullptr;
    }
    auto it = mPowers.find(key);
    if (it == mPowers.end()) {
        LLOGE("Get power profile failed");
    }
    auto allocator = std::make_unique<SharedAllocator<sensor_accounter_data>>(this);
    PowerProfile::setFixedPower(allocator.get(), it == mPowers.end() ? 0 : it->second);
    return allocator;
}

int32_t SensorAccounter::getAllocatorKey(const Parcel& action) {
    int32_t key = 0;
    if (action.readInt32(&key) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return std::numeric_limits<int32_t>::min();
    }
    mReplyKey = key;
    return key;
}

int32_t SensorAccounter::readUser(const Parcel& action, int64_t* timestamp, String8* package,
                                  String8* user) {
    if (action.readInt64(timestamp) != NO_ERROR || action.readString8(package) != NO_ERROR ||
        action.readString8(user) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    return 0;
}

int32_t SensorAccounter::onActionActivate(const Parcel& action) {
    const int32_t type = getAllocatorKey(action);
    if (type < 0) {
        LLOGE("Invalid allocator key: %d", type);
        return -1;
    }
    int64_t timestamp = 0;
    String8 package;
    String8 user;
    if (readUser(action, &timestamp, &package, &user) < 0) {
        return -1;
    }
    const user_key key(type, package, user);
    auto it = mCounts.find(key);
    if (it != mCounts.end()) {
        if (it->second < std::numeric_limits<int32_t>::max()) {
            ++it->second;
        }
        return 0;
    }
    if (mCounts.size() >= kMaxCountEntries) {
        LLOGE("Too many sensor users: %zu, refused: %s", mCounts.size(),
              elementName(package, user).c_str());
        HealthCounters::add(Health::AccounterStateCapped);
        return -1;
    }
    BaseAllocator* allocator = obtainAllocator(type);
    if (allocator == nullptr) {
        return -1;
    }
    if (allocator->addElement(elementName(package, user), timestamp) < 0) {
        LLOGE("Failed to add element");
        return -1;
    }
    mCounts.emplace(key, 1);
    return 0;
}

int32_t SensorAccounter::removeUser(const user_key& key, int64_t timestamp) {
    const int32_t type = std::get<0>(key);
    BaseAllocator* allocator = findAllocator(type);
    if (allocator == nullptr) {
        LLOGE("Failed to find allocator: %d", type);
        return -1;
    }
    const String8 name = elementName(std::get<1>(key), std::get<2>(key));
    mReplyKey = type;
    if (allocator->removeElement(name, timestamp) < 0) {
        LLOGE("Failed to remove element: %s", name.c_str());
        return -1;
    }
    return 0;
}

int32_t SensorAccounter::onActionDeactivate(const Parcel& action) {
    const int32_t type = getAllocatorKey(action);
    int64_t timestamp = 0;
    String8 package;
    String8 user;
    if (type == std::numeric_limits<int32_t>::min() ||
        readUser(action, &timestamp, &package, &user) < 0) {
        return -1;
    }
    if (type == kAllTypes) {
        // Every registration of the user ends, however many there were.
        int32_t result = -1;
        bool failed = false;
        for (auto it = mCounts.begin(); it != mCounts.end();) {
            if (std::get<1>(it->first) != package || std::get<2>(it->first) != user) {
                ++it;
                continue;
            }
            failed |= removeUser(it->first, timestamp) < 0;
            result = 0;
            it = mCounts.erase(it);
        }
        mReplyKey = kAllTypes;
        if (result < 0) {
            LLOGE("Failed to remove element: %s", elementName(package, user).c_str());
        }
        return failed ? -1 : result;
    }
    auto it = mCounts.find(user_key(type, package, user));
    if (it == mCounts.end()) {
        if (findAllocator(type) == nullptr) {
            LLOGE("Failed to find sensor type: %d", type);
        } else {
            LLOGE("Failed to remove element: %s", elementName(package, user).c_str());
        }
        return -1;
    }
    if (--it->second > 0) {
        return 0;
    }
    const user_key key = it->first;
    mCounts.erase(it);
    return removeUser(key, timestamp);
}

// Every type's records carry that type; no registration survives.
int32_t SensorAccounter::onActionDeactivateAll(const Parcel& action) {
    int64_t timestamp = 0;
    if (action.readInt64(&timestamp) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    for (auto& entry : mAllocators) {
        mReplyKey = entry.first;
        if (entry.second->removeAllElements(timestamp) < 0) {
            LLOGE("Failed to remove all elements");
        }
    }
    mCounts.clear();
    return 0;
}

} // namespace kelvo
