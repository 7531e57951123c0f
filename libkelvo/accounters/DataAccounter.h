#pragma once

#include <stdint.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>

#include <binder/Parcel.h>
#include <utils/String8.h>
#include <utils/StrongPointer.h>

#include "LibraryListener.h"
#include "allocators/BaseAllocator.h"

namespace kelvo {

// The base of the component accounters. It keeps what every accounter shares
// (the foreground application, the screen and charger states, the allocators
// by key and the result listener), decodes an action parcel and drives the
// allocators. Subclasses decide which allocator a key gets, which key an
// action names and how a SetValue parcel becomes a power description.
//
// One daemon thread drives each accounter, so the accounting state has no
// lock; only the listener, which may be set from another thread, has one.
class DataAccounter {
public:
    DataAccounter();
    virtual ~DataAccounter();

    DataAccounter(const DataAccounter&) = delete;
    DataAccounter& operator=(const DataAccounter&) = delete;

    // The state the allocators sort their intervals by.
    virtual android::String8 getForeground() const;
    virtual bool getScreenState() const;
    virtual bool getChargerState() const;
    // Writes the int32 that opens an element reply.
    virtual void prepareReply(android::Parcel& reply);
    // Hands a record to the listener; -1 when there is none.
    virtual int32_t sendReply(int32_t event, const android::Parcel& reply);

    // Sets or replaces the one listener of this accounter.
    void registerListener(const android::sp<LibraryListener>& listener);
    void unregisterListener();

    // action: positioned at the AccounterAction code. Returns 0 or -1. A
    // listener must not hand a new action to the accounter that called it:
    // such an action is refused.
    int32_t handleAction(const android::Parcel& action);

protected:
    // The allocator of a key seen for the first time; null when the key has
    // none.
    virtual std::unique_ptr<BaseAllocator> createAllocators(int32_t key);
    // Turns the value fields of a SetValue action into the power description
    // handed to the allocator's setPowerValue. Negative on failure.
    virtual int32_t getPowerValue(int32_t key, const android::Parcel& action,
                                  android::Parcel& power);
    // Reads the allocator key fields of Activate, Deactivate and SetValue.
    virtual int32_t getAllocatorKey(const android::Parcel& action);
    // The key a Balance hands to the allocator stored under key.
    virtual int32_t getBalanceKey(int32_t key) const;

    // Each action reads its fields after the action code.
    virtual int32_t onActionForeground(const android::Parcel& action);
    virtual int32_t onActionScreenState(const android::Parcel& action);
    virtual int32_t onActionChargerOnline(const android::Parcel& action);
    virtual int32_t onActionBalance(const android::Parcel& action);
    virtual int32_t onActionActivate(const android::Parcel& action);
    virtual int32_t onActionDeactivate(const android::Parcel& action);
    virtual int32_t onActionDeactivateAll(const android::Parcel& action);
    virtual int32_t onActionSetValue(const android::Parcel& action);

    // The allocator of the key, or null.
    BaseAllocator* findAllocator(int32_t key) const;
    // The allocator of the key, created on first use. A key without an
    // allocator is logged and not stored, so it never stands in the way of
    // the others.
    BaseAllocator* obtainAllocator(int32_t key);
    // Accounts every allocator up to the timestamp under the current state.
    void updateAllocators(int64_t timestamp);
    // A Foreground action of the accounters whose one element is the
    // foreground application: the current foreground's record is reported
    // up to the time, the new name becomes the element, then the state
    // changes. The allocator of the key is created when there is none yet,
    // so a foreground known before any power value is still charged.
    int32_t moveForegroundElement(int32_t key, const android::Parcel& action);

    android::String8 mForeground;
    bool mScreenOn;
    bool mChargerOnline;
    // By key, ascending; never holds null.
    std::map<int32_t, std::unique_ptr<BaseAllocator>> mAllocators;

private:
    int32_t dispatchAction(int32_t code, const android::Parcel& action);

    // Set while an action runs.
    std::atomic<bool> mInAction;
    std::mutex mListenerLock;
    android::sp<LibraryListener> mListener;
};

} // namespace kelvo
