#pragma once

#include <stdint.h>

#include <map>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "accounters/DataAccounter.h"
#include "allocators/AccounterData.h"
#include "allocators/BaseAllocator.h"

namespace kelvo {

// Every active element is charged the whole interval and an equal share of
// its energy (GNSS users, sensor users). A component record spans from the
// first element's arrival to the last one's departure, cut at every balance.
template <typename T>
class SharedAllocator : public BaseAllocator {
public:
    // Most elements at once: names come from log text, and every interval
    // walks them all. A new name beyond is refused and counted.
    static constexpr size_t kMaxElements = 1024;

    explicit SharedAllocator(DataAccounter* owner) : BaseAllocator(owner) {}

    void updateElement(int64_t timestamp) override {
        if (!mElements.empty()) {
            T usage;
            usage.setInterval(mLastTimestamp, timestamp);
            int64_t energy = usage.calculateEnergy(mPowerValue);
            const android::String8 foreground = mOwner->getForeground();
            const bool screenOn = mOwner->getScreenState();
            const bool chargerOnline = mOwner->getChargerState();
            const int64_t count = static_cast<int64_t>(mElements.size());
            // Signed: a negative energy stays negative.
            const int64_t share = energy / count;
            int64_t foregroundCount = 0;
            for (auto& entry : mElements) {
                bool foregroundElement = isForegroundName(entry.first, foreground);
                if (foregroundElement) {
                    ++foregroundCount;
                }
                entry.second.account(usage, share, foregroundElement, screenOn, chargerOnline);
            }
            accountComponent(usage, energy, foregroundCount, count, screenOn, chargerOnline);
        }
        if (timestamp > mLastTimestamp) {
            mLastTimestamp = timestamp;
        }
    }

    // A name already present keeps its record.
    int32_t addElement(const android::String8& name, int64_t timestamp) override {
        updateElement(timestamp);
        if (mElements.find(name) != mElements.end()) {
            return 0;
        }
        if (mElements.size() >= kMaxElements) {
            LLOGE("Too many elements: %zu, refused: %s", mElements.size(), name.c_str());
            HealthCounters::add(Health::AccounterStateCapped);
            return -1;
        }
        element_data<T> record;
        record.start = timestamp;
        mElements.emplace(name, record);
        LLOGD("name: %s", name.c_str());
        if (mElements.size() == 1) {
            mComponent.start = timestamp;
        }
        return 0;
    }

    // Reports the element's record and, when it was the last one, the
    // component's. -1 when the name is unknown or the listener refused a
    // record (the element is gone all the same).
    int32_t removeElement(const android::String8& name, int64_t timestamp) override {
        auto it = mElements.find(name);
        if (it == mElements.end()) {
            LLOGE("Cannot find element: %s", name.c_str());
            return -1;
        }
        updateElement(timestamp);
        const int32_t prefix = replyPrefix();
        android::Parcel reply;
        reply.writeInt32(prefix);
        it->second.writeRecord(reply, timestamp, it->first);
        int32_t result = mOwner->sendReply(LIBRARY_EVENT_APPLICATION, reply) < 0 ? -1 : 0;
        mElements.erase(it);
        LLOGD("name: %s", name.c_str());
        if (mElements.empty() && sendComponent(prefix, timestamp) < 0) {
            result = -1;
        }
        return result;
    }

    int32_t removeAllElements(int64_t timestamp) override {
        if (mElements.empty()) {
            return 0;
        }
        updateElement(timestamp);
        const int32_t prefix = replyPrefix();
        int32_t result = 0;
        for (const auto& entry : mElements) {
            android::Parcel reply;
            reply.writeInt32(prefix);
            entry.second.writeRecord(reply, timestamp, entry.first);
            if (mOwner->sendReply(LIBRARY_EVENT_APPLICATION, reply) < 0) {
                result = -1;
            }
        }
        mElements.clear();
        if (sendComponent(prefix, timestamp) < 0) {
            result = -1;
        }
        return result;
    }

    // With no element nothing is sent, not even the component record.
    int32_t balanceAccounting(int64_t end, int64_t newStart, int32_t key) override {
        updateElement(end);
        if (mElements.empty()) {
            return 0;
        }
        int32_t result = 0;
        for (auto& entry : mElements) {
            android::Parcel reply;
            reply.writeInt32(key);
            entry.second.writeRecord(reply, end, entry.first);
            if (mOwner->sendReply(LIBRARY_EVENT_APPLICATION, reply) < 0) {
                result = -1;
            }
            entry.second.clearBuckets();
            entry.second.start = newStart;
        }
        if (sendComponent(key, end) < 0) {
            result = -1;
        }
        mComponent.start = newStart;
        updateLastTimestamp(end, newStart);
        return result;
    }

private:
    // The component takes the whole interval; its foreground share is the
    // part of the foreground elements among all.
    void accountComponent(const T& usage, int64_t energy, int64_t foregroundCount, int64_t count,
                          bool screenOn, bool chargerOnline) {
        const int32_t foregroundBucket =
                chargerOnline ? BUCKET_CHARGE_FOREGROUND : BUCKET_FOREGROUND;
        const int32_t backgroundBucket =
                chargerOnline ? BUCKET_CHARGE_BACKGROUND : BUCKET_BACKGROUND;
        if (foregroundCount > 0) {
            T shareUsage = usage.portion(foregroundCount, count);
            int64_t shareEnergy = scaleValue(energy, foregroundCount, count);
            mComponent.add(foregroundBucket, shareUsage, shareEnergy);
            mComponent.add(backgroundBucket, usage - shareUsage, energy - shareEnergy);
        } else {
            mComponent.add(backgroundBucket, usage, energy);
        }
        if (!chargerOnline) {
            mComponent.add(screenOn ? BUCKET_SCREEN_ON : BUCKET_SCREEN_OFF, usage, energy);
        }
    }

    int32_t sendComponent(int32_t prefix, int64_t end) {
        android::Parcel reply;
        reply.writeInt32(prefix);
        mComponent.writeComponentRecord(reply, end);
        mComponent.clearBuckets();
        return mOwner->sendReply(LIBRARY_EVENT_COMPONENT, reply);
    }

    int32_t replyPrefix() {
        android::Parcel scratch;
        mOwner->prepareReply(scratch);
        scratch.setDataPosition(0);
        return scratch.readInt32();
    }

    std::map<android::String8, element_data<T>> mElements; // by name, the reply order
    element_data<T> mComponent;
};

} // namespace kelvo
