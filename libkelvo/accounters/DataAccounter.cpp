#include "accounters/DataAccounter.h"

#include "AccounterTypes.h"
#include "LibKelvoLog.h"

using android::NO_ERROR;
using android::Parcel;
using android::String8;

namespace kelvo {

DataAccounter::DataAccounter() : mScreenOn(true), mChargerOnline(false), mInAction(false) {}

DataAccounter::~DataAccounter() = default;

String8 DataAccounter::getForeground() const {
    return mForeground;
}

bool DataAccounter::getScreenState() const {
    return mScreenOn;
}

bool DataAccounter::getChargerState() const {
    return mChargerOnline;
}

void DataAccounter::prepareReply(Parcel& reply) {
    reply.writeInt32(0);
}

int32_t DataAccounter::sendReply(int32_t event, const Parcel& reply) {
    android::sp<LibraryListener> listener;
    {
        std::lock_guard<std::mutex> guard(mListenerLock);
        listener = mListener;
    }
    if (listener == nullptr) {
        LLOGE("Invalid listener");
        return -1;
    }
    reply.setDataPosition(0);
    return listener->handleLibraryEvent(event, reply);
}

void DataAccounter::registerListener(const android::sp<LibraryListener>& listener) {
    android::sp<LibraryListener> old;
    {
        std::lock_guard<std::mutex> guard(mListenerLock);
        old = mListener;
        mListener = listener;
    }
    // The replaced listener is released here, outside the lock.
}

void DataAccounter::unregisterListener() {
    android::sp<LibraryListener> old;
    {
        std::lock_guard<std::mutex> guard(mListenerLock);
        old = mListener;
        mListener.clear();
    }
    // The listener is released here, outside the lock.
}

int32_t DataAccounter::handleAction(const Parcel& action) {
    int32_t code = 0;
    if (action.readInt32(&code) != NO_ERROR) {
        LLOGE("Missing action");
        return -1;
    }
    if (code < ACTION_FOREGROUND || code > ACTION_SET_VALUE) {
        LLOGE("Unknown action: %d", code);
        return -1;
    }
    // An action from inside a listener would change the records an allocator
    // is walking through.
    if (mInAction.exchange(true)) {
        LLOGE("Nested action refused: %d", code);
        return -1;
    }
    int32_t result = dispatchAction(code, action);
    mInAction.store(false);
    return result;
}

int32_t DataAccounter::dispatchAction(int32_t code, const Parcel& action) {
    switch (code) {
        case ACTION_FOREGROUND:
            return onActionForeground(action);
        case ACTION_SCREEN_STATE:
            return onActionScreenState(action);
        case ACTION_CHARGER_ONLINE:
            return onActionChargerOnline(action);
        case ACTION_BALANCE:
            return onActionBalance(action);
        case ACTION_ACTIVATE:
            return onActionActivate(action);
        case ACTION_DEACTIVATE:
            return onActionDeactivate(action);
        case ACTION_DEACTIVATE_ALL:
            return onActionDeactivateAll(action);
        case ACTION_SET_VALUE:
            return onActionSetValue(action);
        default:
            return -1;
    }
}

std::unique_ptr<BaseAllocator> DataAccounter::createAllocators(int32_t key) {
    return nullptr;
}

int32_t DataAccounter::getPowerValue(int32_t key, const Parcel& action, Parcel& power) {
    LLOGI("Please implement this function in subclass");
    return 0;
}

int32_t DataAccounter::getAllocatorKey(const Parcel& action) {
    return 0;
}

int32_t DataAccounter::getBalanceKey(int32_t key) const {
    return key;
}

BaseAllocator* DataAccounter::findAllocator(int32_t key) const {
    auto it = mAllocators.find(key);
    return it == mAllocators.end() ? nullptr : it->second.get();
}

BaseAllocator* DataAccounter::obtainAllocator(int32_t key) {
    BaseAllocator* allocator = findAllocator(key);
    if (allocator != nullptr) {
        return allocator;
    }
    std::unique_ptr<BaseAllocator> created = createAllocators(key);
    if (created == nullptr) {
        LLOGE("Invalid allocator");
        return nullptr;
    }
    allocator = created.get();
    mAllocators.emplace(key, std::move(created));
    return allocator;
}

void DataAccounter::updateAllocators(int64_t timestamp) {
    for (auto& entry : mAllocators) {
        entry.second->updateElement(timestamp);
    }
}

// The state actions close every open interval under the old state before the
// new one is stored, so the time before the timestamp keeps the old state.
int32_t DataAccounter::onActionForeground(const Parcel& action) {
    int64_t timestamp = 0;
    String8 name;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readString8(&name) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    updateAllocators(timestamp);
    mForeground = name;
    return 0;
}

int32_t DataAccounter::moveForegroundElement(int32_t key, const Parcel& action) {
    int64_t timestamp = 0;
    String8 name;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readString8(&name) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    BaseAllocator* allocator = obtainAllocator(key);
    if (allocator == nullptr) {
        return -1;
    }
    // Nothing to report when no element is active yet.
    if (mForeground.size() > 0) {
        allocator->removeElement(mForeground, timestamp);
    }
    if (name.size() > 0 && allocator->addElement(name, timestamp) < 0) {
        LLOGE("Failed to add element");
    }
    updateAllocators(timestamp);
    mForeground = name;
    return 0;
}

int32_t DataAccounter::onActionScreenState(const Parcel& action) {
    int64_t timestamp = 0;
    bool screenOn = false;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readBool(&screenOn) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    updateAllocators(timestamp);
    mScreenOn = screenOn;
    return 0;
}

int32_t DataAccounter::onActionChargerOnline(const Parcel& action) {
    int64_t timestamp = 0;
    bool chargerOnline = false;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readBool(&chargerOnline) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    updateAllocators(timestamp);
    mChargerOnline = chargerOnline;
    return 0;
}

int32_t DataAccounter::onActionBalance(const Parcel& action) {
    int32_t reason = 0;
    if (action.readInt32(&reason) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    int64_t end = 0;
    int64_t newStart = 0;
    if (reason == BALANCE_AT) {
        if (action.readInt64(&end) != NO_ERROR) {
            LLOGE("Invalid parameter");
            return -1;
        }
        newStart = end;
    } else if (reason == BALANCE_SPAN) {
        if (action.readInt64(&end) != NO_ERROR || action.readInt64(&newStart) != NO_ERROR) {
            LLOGE("Invalid parameter");
            return -1;
        }
    } else {
        LLOGE("Unknown balance reason: %d", reason);
        return -1;
    }
    // A listener that refuses one record must not keep the other allocators
    // from being cut at this time.
    int32_t result = 0;
    for (auto& entry : mAllocators) {
        if (entry.second->balanceAccounting(end, newStart, getBalanceKey(entry.first)) < 0) {
            LLOGE("Failed to balance accounting data");
            result = -1;
        }
    }
    return result;
}

int32_t DataAccounter::onActionActivate(const Parcel& action) {
    int32_t key = getAllocatorKey(action);
    if (key < 0) {
        LLOGE("Invalid allocator key: %d", key);
        return -1;
    }
    int64_t timestamp = 0;
    String8 name;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readString8(&name) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    BaseAllocator* allocator = obtainAllocator(key);
    if (allocator == nullptr) {
        return -1;
    }
    if (allocator->addElement(name, timestamp) < 0) {
        LLOGE("Failed to add element");
        return -1;
    }
    return 0;
}

int32_t DataAccounter::onActionDeactivate(const Parcel& action) {
    int32_t key = getAllocatorKey(action);
    BaseAllocator* allocator = findAllocator(key);
    if (allocator == nullptr) {
        LLOGE("Failed to find allocator: %d", key);
        return -1;
    }
    int64_t timestamp = 0;
    String8 name;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readString8(&name) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (allocator->removeElement(name, timestamp) < 0) {
        LLOGE("Failed to remove element");
        return -1;
    }
    return 0;
}

int32_t DataAccounter::onActionDeactivateAll(const Parcel& action) {
    int64_t timestamp = 0;
    if (action.readInt64(&timestamp) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    // An allocator with nothing active answers -1; the others still stop.
    for (auto& entry : mAllocators) {
        if (entry.second->removeAllElements(timestamp) < 0) {
            LLOGE("Failed to remove all elements");
        }
    }
    return 0;
}

int32_t DataAccounter::onActionSetValue(const Parcel& action) {
    int32_t key = getAllocatorKey(action);
    if (key < 0) {
        LLOGE("Invalid allocator key: %d", key);
        return -1;
    }
    BaseAllocator* allocator = obtainAllocator(key);
    if (allocator == nullptr) {
        return -1;
    }
    Parcel power;
    if (getPowerValue(key, action, power) < 0) {
        LLOGE("Failed to get power value");
        return -1;
    }
    power.setDataPosition(0);
    if (allocator->setPowerValue(action, power) < 0) {
        LLOGE("Failed to set power value");
        return -1;
    }
    return 0;
}

} // namespace kelvo
