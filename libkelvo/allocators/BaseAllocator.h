#pragma once

#include <stdint.h>

#include <binder/Parcel.h>
#include <utils/String8.h>

namespace kelvo {

class DataAccounter;

// Turns the power a component drew into energy per element (application,
// stream, sensor user) and for the component, sorted into the six buckets of
// AccounterData.h. Each accounter owns its allocators by key and drives them
// from its own thread; an allocator calls back its owner for the current
// foreground, screen and charger state and hands finished records to the
// owner's sendReply.
class BaseAllocator {
public:
    explicit BaseAllocator(DataAccounter* owner);
    virtual ~BaseAllocator();

    BaseAllocator(const BaseAllocator&) = delete;
    BaseAllocator& operator=(const BaseAllocator&) = delete;

    // Accounts the open records up to the timestamp under the current state.
    virtual void updateElement(int64_t timestamp);
    virtual int32_t addElement(const android::String8& name, int64_t timestamp);
    virtual int32_t removeElement(const android::String8& name, int64_t timestamp);
    virtual int32_t removeAllElements(int64_t timestamp);
    // Reports the open records up to end and starts them again at newStart.
    virtual int32_t balanceAccounting(int64_t end, int64_t newStart, int32_t key);
    // power: int64 time, then the power description. The interval up to that
    // time is accounted with the old power, then the description is replaced.
    virtual int32_t setPowerValue(const android::Parcel& action, const android::Parcel& power);

    // Moves the accounting start after a balance. A balance at one time that
    // this allocator has already passed changes nothing; otherwise the start
    // becomes newStart, so a gap between end and newStart stays unaccounted.
    void updateLastTimestamp(int64_t end, int64_t newStart);

    int64_t getLastTimestamp() const { return mLastTimestamp; }

protected:
    DataAccounter* mOwner; // not owned; outlives its allocators
    // The end of the last accounted interval.
    int64_t mLastTimestamp;
    // The current power description, read from position 0.
    android::Parcel mPowerValue;
};

} // namespace kelvo
