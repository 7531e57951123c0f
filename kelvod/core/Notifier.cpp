#include "core/Notifier.h"

#include <algorithm>

#include "KelvoLog.h"
#include "core/NotifierHandler.h"

namespace kelvo {

Notifier* Notifier::getInstance() {
    static std::mutex lock;
    static Notifier* instance = nullptr;
    std::lock_guard<std::mutex> guard(lock);
    if (instance == nullptr) {
        instance = new Notifier();
    }
    return instance;
}

Notifier::Notifier() {
    mHandler = new NotifierHandler(this);
}

int32_t Notifier::registerListener(int32_t type, NotifierListener* listener) {
    if (type < 0 || type >= NOTIFICATION_TYPE_COUNT || listener == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    std::vector<NotifierListener*>& list = mListeners[type];
    if (std::find(list.begin(), list.end(), listener) != list.end()) {
        KLOGI("This listener has already been registered for type(%d)", type);
        return -13;
    }
    list.push_back(listener);
    return 0;
}

void Notifier::unregisterListener(int32_t type, NotifierListener* listener) {
    if (type < 0 || type >= NOTIFICATION_TYPE_COUNT || listener == nullptr) {
        KLOGE("Invalid parameter");
        return;
    }
    std::lock_guard<std::mutex> guard(mLock);
    std::vector<NotifierListener*>& list = mListeners[type];
    auto it = std::find(list.begin(), list.end(), listener);
    if (it != list.end()) {
        list.erase(it);
    }
}

void Notifier::unregisterAll(NotifierListener* listener) {
    if (listener == nullptr) {
        return;
    }
    std::lock_guard<std::mutex> guard(mLock);
    for (std::vector<NotifierListener*>& list : mListeners) {
        list.erase(std::remove(list.begin(), list.end(), listener), list.end());
    }
}

int32_t Notifier::sendNotification(int32_t type, const android::Parcel& body) {
    return mHandler->sendMessage(ParcelMessage(MESSAGE_NOTIFICATION, type, body));
}

int32_t Notifier::notifyAllListeners(int32_t type, const android::Parcel& body) {
    if (type < 0 || type >= NOTIFICATION_TYPE_COUNT) {
        KLOGE("Unknown notification type: %d", type);
        return -3;
    }
    ParcelMessage msg(MESSAGE_NOTIFICATION, type, body);
    std::vector<android::sp<HandlerThread>> targets;
    {
        std::lock_guard<std::mutex> guard(mLock);
        targets.reserve(mListeners[type].size());
        for (NotifierListener* listener : mListeners[type]) {
            android::sp<HandlerThread> handler = listener->handler.promote();
            if (handler != nullptr) {
                targets.push_back(handler);
            }
        }
    }
    // Sent outside the lock: an operator whose last reference goes here is
    // destroyed without the notifier's lock held.
    for (const android::sp<HandlerThread>& handler : targets) {
        handler->sendMessage(msg);
    }
    return 0;
}

} // namespace kelvo
