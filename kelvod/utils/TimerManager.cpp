#include "utils/TimerManager.h"

#include "KelvoLog.h"

namespace kelvo {

std::mutex TimerManager::sInstanceLock;
std::atomic<TimerManager*> TimerManager::sInstance{nullptr};

TimerManager* TimerManager::getInstance() {
    TimerManager* instance = sInstance.load(std::memory_order_acquire);
    if (instance != nullptr) {
        return instance;
    }
    std::lock_guard<std::mutex> guard(sInstanceLock);
    instance = sInstance.load(std::memory_order_relaxed);
    if (instance == nullptr) {
        instance = new TimerManager();
        sInstance.store(instance, std::memory_order_release);
    }
    return instance;
}

TimerManager::TimerManager() : mObserver(new FdObserver("TimerManager")) {}

int32_t TimerManager::addTimer(int64_t firstMs, int64_t intervalMs,
                               const android::sp<TimerCallback>& callback) {
    if (firstMs < 0 || intervalMs < 0 || callback == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    if (mTimers.count(callback) != 0) {
        KLOGI("This callback has been added");
        return -13;
    }
    std::unique_ptr<TimerOperator> timer(new TimerOperator(firstMs, intervalMs));
    int32_t fd = timer->getFd();
    if (fd < 0) {
        KLOGE("Failed to create timer file descriptor");
        return -10;
    }
    int32_t ret = mObserver->addFd(fd, callback);
    if (ret != 0) {
        KLOGE("Failed to add file descriptor to timer thread: %d", ret);
        return -2;
    }
    // Armed only once watched; an expiry arriving before the entry is in the
    // table waits for the lock held here.
    ret = timer->schedule();
    if (ret != 0) {
        KLOGE("Failed to schedule timer: %d", ret);
        mObserver->removeFd(fd);
        return -2;
    }
    mTimers.emplace(callback, std::move(timer));
    return 0;
}

void TimerManager::eraseLocked(TimerMap::iterator it) {
    std::unique_ptr<TimerOperator> timer = std::move(it->second);
    mTimers.erase(it);
    if (timer == nullptr) {
        return;
    }
    timer->cancel();
    // Already gone from the looper when a read failed; nothing to undo then.
    if (mObserver->removeFd(timer->getFd()) != 0) {
        KLOGD("Timer fd %d was not watched", timer->getFd());
    }
    // The descriptor closes with the operator, after the looper let go of it.
}

int32_t TimerManager::removeTimer(const android::sp<TimerCallback>& callback) {
    if (callback == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mTimers.find(callback);
    if (it == mTimers.end()) {
        KLOGI("Can not find timer of callback");
        return 0;
    }
    eraseLocked(it);
    return 0;
}

int32_t TimerManager::rescheduleLocked(TimerMap::iterator it, bool replaceTimes, int64_t firstMs,
                                       int64_t intervalMs) {
    if (it->second == nullptr) {
        KLOGE("Reschedule an invalid timer");
        return -11;
    }
    // Watch the descriptor again: a read failure may have made the looper
    // drop it, and a re-armed timer that nobody watches would never fire.
    int32_t ret = mObserver->addFd(it->second->getFd(), it->first);
    if (ret == 0) {
        ret = replaceTimes ? it->second->reschedule(firstMs, intervalMs) : it->second->schedule();
    }
    if (ret != 0) {
        KLOGE("Failed to reschedule timer: %d", ret);
        eraseLocked(it);
        return -2;
    }
    return 0;
}

int32_t TimerManager::rescheduleTimer(const android::sp<TimerCallback>& callback) {
    if (callback == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mTimers.find(callback);
    if (it == mTimers.end()) {
        KLOGI("Can not find timer of callback");
        return -4;
    }
    return rescheduleLocked(it, false, 0, 0);
}

int32_t TimerManager::rescheduleTimer(int64_t firstMs, int64_t intervalMs,
                                      const android::sp<TimerCallback>& callback) {
    if (firstMs < 0 || intervalMs < 0 || callback == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mTimers.find(callback);
    if (it == mTimers.end()) {
        KLOGI("Can not find timer of callback");
        return -4;
    }
    return rescheduleLocked(it, true, firstMs, intervalMs);
}

int32_t TimerManager::rearmTimer(int64_t firstMs, int64_t intervalMs,
                                 const android::sp<TimerCallback>& callback) {
    if (firstMs < 0 || intervalMs < 0 || callback == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    {
        std::lock_guard<std::mutex> guard(mLock);
        auto it = mTimers.find(callback);
        if (it != mTimers.end() && rescheduleLocked(it, true, firstMs, intervalMs) == 0) {
            return 0;
        }
    }
    // Gone, or erased by the failed reschedule: add it again.
    int32_t ret = addTimer(firstMs, intervalMs, callback);
    if (ret != 0) {
        KLOGE("Failed to add timer %d again: %d", callback->getId(), ret);
    }
    return ret;
}

int64_t TimerManager::getExpireTime(const android::sp<TimerCallback>& callback) {
    if (callback == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mTimers.find(callback);
    if (it == mTimers.end()) {
        KLOGI("Can not find timer of callback");
        return -4;
    }
    if (it->second == nullptr) {
        KLOGE("Reschedule an invalid timer");
        return -11;
    }
    return it->second->getExpire();
}

std::unique_lock<std::mutex> TimerManager::lockRegistered(const TimerCallback* callback, int fd) {
    std::unique_lock<std::mutex> lock(mLock);
    auto it = mTimers.find(callback);
    if (it == mTimers.end() || it->second == nullptr || it->second->getFd() != fd) {
        lock.unlock();
    }
    return lock;
}

} // namespace kelvo
