#pragma once

#include <stdint.h>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "AccounterTypes.h"
#include "LibKelvoLog.h"
#include "accounters/DataAccounter.h"
#include "allocators/AccounterData.h"
#include "allocators/BaseAllocator.h"

namespace kelvo {

// One element at a time holds the component and is charged all of its
// energy (the backlight, the flashlight, one audio stream).
template <typename T>
class SoleAllocator : public BaseAllocator {
public:
    explicit SoleAllocator(DataAccounter* owner) : BaseAllocator(owner) {}

    void updateElement(int64_t timestamp) override {
        if (mName.size() > 0) {
            T usage;
            usage.setInterval(mLastTimestamp, timestamp);
            int64_t energy = usage.calculateEnergy(mPowerValue);
            mRecord.account(usage, energy, isForegroundName(mName, mOwner->getForeground()),
                            mOwner->getScreenState(), mOwner->getChargerState());
        }
        if (timestamp > mLastTimestamp) {
            mLastTimestamp = timestamp;
        }
    }

    // A new name replaces the active element; the replaced element's open
    // record is dropped without a reply.
    int32_t addElement(const android::String8& name, int64_t timestamp) override {
        updateElement(timestamp);
        if (name == mName) {
            return 0;
        }
        mName = name;
        mRecord.clearBuckets();
        mRecord.start = timestamp;
        LLOGD("name: %s", mName.c_str());
        return 0;
    }

    int32_t removeElement(const android::String8& name, int64_t timestamp) override {
        if (mName.size() == 0) {
            return -1;
        }
        if (name != mName) {
            LLOGE("Element name %s is not matched with name %s", name.c_str(), mName.c_str());
            return -1;
        }
        return closeElement(timestamp);
    }

    int32_t removeAllElements(int64_t timestamp) override {
        if (mName.size() == 0) {
            return -1;
        }
        return closeElement(timestamp);
    }

    int32_t balanceAccounting(int64_t end, int64_t newStart, int32_t key) override {
        updateElement(end);
        if (mName.size() == 0) {
            return 0;
        }
        android::Parcel reply;
        reply.writeInt32(key);
        mRecord.writeRecord(reply, end, mName);
        mRecord.clearBuckets();
        mRecord.start = newStart;
        updateLastTimestamp(end, newStart);
        return mOwner->sendReply(LIBRARY_EVENT_APPLICATION, reply);
    }

private:
    // Reports the active element's record up to the timestamp and clears it.
    int32_t closeElement(int64_t timestamp) {
        updateElement(timestamp);
        android::Parcel reply;
        mOwner->prepareReply(reply);
        mRecord.writeRecord(reply, timestamp, mName);
        mName = android::String8();
        mRecord.clearBuckets();
        return mOwner->sendReply(LIBRARY_EVENT_APPLICATION, reply);
    }

    android::String8 mName; // empty when no element is active
    element_data<T> mRecord;
};

} // namespace kelvo
