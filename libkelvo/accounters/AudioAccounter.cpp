#include "accounters/AudioAccounter.h"

#include <limits>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SoleAllocator.h"

using android::NO_ERROR;
using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

// Profile value keys.
constexpr int32_t kKeySlope = 0; // the slope; the value after it is the intercept
constexpr int32_t kKeySmartPa = 1;

constexpr int32_t kDeviceReceiver = 1;
constexpr int32_t kDeviceSpeaker = 2;
constexpr int32_t kDeviceBoth = 3;

int64_t multiplySaturated(int64_t a, int64_t b) {
    int64_t product = 0;
    if (__builtin_mul_overflow(a, b, &product)) {
        return (a < 0) != (b < 0) ? std::numeric_limits<int64_t>::min()
                                  : std::numeric_limits<int64_t>::max();
    }
    return product;
}

// The scale of reading index i of a list; 0 beyond it, negative indexes
// included.
int64_t scaleAt(const std::vector<int32_t>& list, int32_t index) {
    if (index < 0 || static_cast<size_t>(index) >= list.size()) {
        return 0;
    }
    return list[index];
}

} // namespace

AudioAccounter::AudioAccounter() : mSlope{0, 0}, mIntercept{0, 0} {
    loadProfile();
}

void AudioAccounter::loadProfile() {
    std::vector<config_parameter> parameters;
    if (PowerProfile::readGrouped(PROFILE_AUDIO, -1, true, &parameters) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    for (const config_parameter& parameter : parameters) {
        if (parameter.id < 0 || parameter.id >= kOutputs) {
            LLOGE("Invalid device: %d", parameter.id);
            return;
        }
        const int32_t device = parameter.id;
        const std::vector<config_value>& values = parameter.values;
        for (size_t i = 0; i < values.size(); ++i) {
            if (values[i].key == kKeySlope) {
                mSlope[device] = values[i].value;
                if (i + 1 < values.size()) {
                    mIntercept[device] = values[++i].value;
                }
            } else if (values[i].key == kKeySmartPa) {
                mSmartPa[device].push_back(values[i].value);
            } else {
                LLOGE("Unknown audio type: %d", values[i].key);
                return;
            }
        }
    }
}

std::unique_ptr<BaseAllocator> AudioAccounter::createAllocators(int32_t key) {
    if (mAllocators.size() >= kMaxSessions) {
        LLOGE("Audio sessions exceed maximum limit: %zu", mAllocators.size());
        HealthCounters::add(Health::AccounterStateCapped);
        auto oldest = mAllocators.begin();
        closeOpenRecord(oldest->second.get());
        mAllocators.erase(oldest);
    }
    return std::make_unique<SoleAllocator<accounter_data>>(this);
}

int32_t AudioAccounter::getAllocatorKey(const Parcel& action) {
    int32_t key = -1;
    if (action.readInt32(&key) != NO_ERROR) {
        return -1;
    }
    return key;
}

void AudioAccounter::closeOpenRecord(BaseAllocator* allocator) {
    // Answers -1 when no stream is active: nothing to report.
    allocator->removeAllElements(allocator->getLastTimestamp());
}

int32_t AudioAccounter::onActionDeactivate(const Parcel& action) {
    const int32_t key = getAllocatorKey(action);
    int64_t timestamp = 0;
    String8 name;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readString8(&name) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    auto it = mAllocators.find(key);
    if (it == mAllocators.end()) {
        LLOGE("Failed to find allocator: %d", key);
        return -1;
    }
    std::unique_ptr<BaseAllocator> allocator = std::move(it->second);
    mAllocators.erase(it);
    int32_t result = 0;
    if (allocator->removeElement(name, timestamp) < 0) {
        LLOGE("Failed to remove element");
        closeOpenRecord(allocator.get());
        result = -1;
    }
    LLOGD("Delete allocator: %s", name.c_str());
    return result;
}

int32_t AudioAccounter::onActionDeactivateAll(const Parcel& action) {
    int64_t timestamp = 0;
    if (action.readInt64(&timestamp) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    for (auto& entry : mAllocators) {
        if (entry.second->removeAllElements(timestamp) < 0) {
            LLOGE("Failed to remove all elements");
        }
    }
    mAllocators.clear();
    return 0;
}

int32_t AudioAccounter::onActionSetValue(const Parcel& action) {
    int32_t subtype = 0;
    if (action.readInt32(&subtype) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    switch (subtype) {
        case kSubtypeSession:
            return setSessionValue(action);
        case kSubtypeSmartPa:
            return setSmartPaValue(action);
        default:
            LLOGE("Unknown audio subtype: %d", subtype);
            return -1;
    }
}

int32_t AudioAccounter::devicePower(int32_t device, int32_t volume, int64_t* power) const {
    const int64_t receiver = (mIntercept[0] + mSlope[0] * volume) / 100;
    const int64_t speaker = mIntercept[1] + mSlope[1] * volume;
    switch (device) {
        case kDeviceReceiver:
            *power = receiver;
            return 0;
        case kDeviceSpeaker:
            *power = speaker;
            return 0;
        case kDeviceBoth:
            *power = speaker + receiver;
            return 0;
        default:
            LLOGE("Unknown device: %d", device);
            return -1;
    }
}

int32_t AudioAccounter::setSessionValue(const Parcel& action) {
    const int32_t key = getAllocatorKey(action);
    if (key < 0) {
        LLOGE("Invalid allocator key: %d", key);
        return -1;
    }
    int64_t timestamp = 0;
    int32_t device = 0;
    int32_t volume = 0;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readInt32(&device) != NO_ERROR ||
        action.readInt32(&volume) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    // Known before a session is made for it.
    int64_t power = 0;
    if (devicePower(device, volume, &power) < 0) {
        return -1;
    }
    BaseAllocator* allocator = obtainAllocator(key);
    if (allocator == nullptr) {
        return -1;
    }
    Parcel description;
    description.writeInt64(timestamp);
    description.writeInt32(PowerProfile::clampPower(power));
    description.setDataPosition(0);
    if (allocator->setPowerValue(action, description) < 0) {
        LLOGE("Failed to set power value");
        return -1;
    }
    return 0;
}

int32_t AudioAccounter::setSmartPaValue(const Parcel& action) {
    int32_t index = 0;
    int64_t t1 = 0;
    int64_t t2 = 0;
    int64_t x = 0;
    int64_t y = 0;
    if (action.readInt32(&index) != NO_ERROR || action.readInt64(&t1) != NO_ERROR ||
        action.readInt64(&t2) != NO_ERROR || action.readInt64(&x) != NO_ERROR ||
        action.readInt64(&y) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    const int64_t c1 = scaleAt(mSmartPa[1], index);
    const int64_t c0 = scaleAt(mSmartPa[0], index);
    const int64_t energy =
            addSaturated(multiplySaturated(t2, mIntercept[0]) / 100,
                         multiplySaturated(t1, mIntercept[1])) /
            1000;
    Parcel reply;
    reply.writeInt64(energy);
    reply.writeInt64(c1 < 1 ? 0 : x / c1);
    reply.writeInt64(c0 < 1 ? 0 : y / c0);
    sendReply(LIBRARY_EVENT_COMPONENT, reply);
    return 0;
}

} // namespace kelvo
