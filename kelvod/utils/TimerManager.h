#pragma once

#include <stdint.h>
#include <utils/StrongPointer.h>

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>

#include "utils/FdObserver.h"
#include "utils/TimerCallback.h"
#include "utils/TimerOperator.h"

namespace kelvo {

// Owns every timer of the process. The descriptors are watched by one
// FdObserver thread, "TimerManager"; an expiry becomes a MESSAGE_TIMER message
// posted by the timer's callback to the thread that owns it.
//
// Results: 0 on success, -2 a system call failed, -4 unknown callback,
// -5 bad argument, -10 no descriptor, -11 entry without timer, -13 the
// callback already has a timer.
class TimerManager {
public:
    // Created on first use, never destroyed.
    static TimerManager* getInstance();

    // First expiry firstMs from now, then every intervalMs (0: one-shot).
    int32_t addTimer(int64_t firstMs, int64_t intervalMs,
                     const android::sp<TimerCallback>& callback);
    // Disarms and forgets the timer. An unknown callback is not an error.
    int32_t removeTimer(const android::sp<TimerCallback>& callback);
    // Arms the timer again from now, with its stored or with new times. When
    // arming fails the timer is removed.
    int32_t rescheduleTimer(const android::sp<TimerCallback>& callback);
    int32_t rescheduleTimer(int64_t firstMs, int64_t intervalMs,
                            const android::sp<TimerCallback>& callback);
    // Milliseconds until the next expiry, or a negative result.
    int64_t getExpireTime(const android::sp<TimerCallback>& callback);
    // Arms callback's timer to fire in firstMs, then every intervalMs (0:
    // once). A timer the manager lost (a failed reschedule erases it) or
    // never had is added again with the same times. 0, or the add's error.
    int32_t rearmTimer(int64_t firstMs, int64_t intervalMs,
                       const android::sp<TimerCallback>& callback);

    // For TimerCallback: holds the timer table locked when the callback is
    // still registered with exactly this descriptor; otherwise the returned
    // lock owns nothing. Timers cannot be removed or re-armed while it is
    // held.
    std::unique_lock<std::mutex> lockRegistered(const TimerCallback* callback, int fd);

private:
    // Transparent order: the table is searched by raw callback pointer too.
    using TimerMap =
        std::map<android::sp<TimerCallback>, std::unique_ptr<TimerOperator>, std::less<>>;

    TimerManager();

    int32_t rescheduleLocked(TimerMap::iterator it, bool replaceTimes, int64_t firstMs,
                             int64_t intervalMs);
    // Drops the entry, disarms its timer and stops watching the descriptor.
    void eraseLocked(TimerMap::iterator it);

    static std::mutex sInstanceLock;
    static std::atomic<TimerManager*> sInstance;

    android::sp<FdObserver> mObserver;
    std::mutex mLock;
    TimerMap mTimers;
};

} // namespace kelvo
