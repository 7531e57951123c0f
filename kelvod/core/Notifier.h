#pragma once

#include <stdint.h>

#include <mutex>
#include <vector>

#include <binder/Parcel.h>
#include <utils/RefBase.h>

#include "core/NotifierListener.h"

namespace kelvo {

class NotifierHandler;

// What a MESSAGE_NOTIFICATION carries in its `what`. Bodies (times in wall ms):
enum notification_type {
    NOTIFICATION_FOREGROUND_CHANGED = 0,     // int64 time, String8 package
    NOTIFICATION_SCREEN_STATE_CHANGED = 1,   // int64 time, bool screen on
    NOTIFICATION_CHARGER_ONLINE_CHANGED = 2, // int64 time, bool online, int32 level,
                                             // int32 voltage, int32 temperature
    NOTIFICATION_BATTERY_LEVEL_CHANGED = 3,  // int64 time, int32 level, voltage, temperature
    NOTIFICATION_DATA_POLLING = 4,           // the polling parcel
    NOTIFICATION_UID_REMOVED = 5,            // int32 uid
    NOTIFICATION_PACKAGE_REMOVED = 6,        // int64 time, int32 uid, String8 package
    NOTIFICATION_PACKAGE_ADDED = 7,          // int64 time, int32 uid, String8 package
    NOTIFICATION_HOURLY_TICK = 8,            // int64 round start, int64 round hour
    NOTIFICATION_DAILY_TICK = 9,             // int64 round start, int64 round hour
    NOTIFICATION_APPLICATIONS_ACCOUNTING = 10, // int64 round hour
    NOTIFICATION_COMPONENT_ACCOUNTING = 11,  // int64 round hour
    NOTIFICATION_HOURLY_UPLOADING = 12,      // float ratio, int64 round hour
    NOTIFICATION_DAILY_UPLOADING = 13,       // float ratio, int64 round hour
    NOTIFICATION_DAWN_UPLOADING = 14,        // float ratio, int64 round hour
    NOTIFICATION_PHONE_STATE_CHANGED = 15,   // int64 time, int32, int32
    NOTIFICATION_TIME_CHANGED = 16,          // int64 time, int64 second time
    NOTIFICATION_ABNORMALITY_THERMAL = 17,   // int64 time
    NOTIFICATION_FORCE_BALANCE = 18,         // int64 current time
    NOTIFICATION_BOOT_COMPLETED = 19,        // int64 time
    NOTIFICATION_SHUT_DOWN = 20,             // int64 time
    NOTIFICATION_VM_DIED = 21,               // int64 current time
    NOTIFICATION_DIFF_DAY_REBOOT = 22,       // int64 round hour
    NOTIFICATION_TYPE_COUNT = 23,
};

// Copies a notification to every operator that listens for its type. Delivery
// runs on the "NotifierHandler" thread, so a sender never waits for listeners.
class Notifier {
public:
    static Notifier* getInstance();

    // 0, -5 for a bad type or listener, -13 when already registered.
    int32_t registerListener(int32_t type, NotifierListener* listener);
    void unregisterListener(int32_t type, NotifierListener* listener);
    // Removes the listener from every type: called before it is freed.
    void unregisterAll(NotifierListener* listener);
    // Returns the message id of the hand-over, or a negative code.
    int32_t sendNotification(int32_t type, const android::Parcel& body);

private:
    friend class NotifierHandler;

    Notifier();
    int32_t notifyAllListeners(int32_t type, const android::Parcel& body);

    android::sp<NotifierHandler> mHandler;
    std::mutex mLock;
    std::vector<NotifierListener*> mListeners[NOTIFICATION_TYPE_COUNT];
};

} // namespace kelvo
