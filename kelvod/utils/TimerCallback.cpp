#include "utils/TimerCallback.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>

#include "KelvoLog.h"
#include "utils/TimerManager.h"

namespace kelvo {

TimerCallback::TimerCallback(const android::sp<HandlerThread>& target, int32_t id)
    : mTarget(target), mId(id) {}

int TimerCallback::handleEvent(int fd, int events, void* data) {
    if ((events & (android::Looper::EVENT_ERROR | android::Looper::EVENT_HANGUP |
                   android::Looper::EVENT_INVALID)) != 0) {
        KLOGE("Unexpected events");
        return 0;
    }

    // The timer may have been removed after the looper collected this event,
    // its descriptor closed and the number handed to a new timer. Read only
    // while the manager confirms this callback still owns exactly this
    // descriptor, and keep it confirmed until the message is posted, so no
    // message leaves after removeTimer() returned.
    // Declared before the lock: when this is the last reference, the target
    // goes only after the manager's lock is released.
    android::sp<HandlerThread> target;
    std::unique_lock<std::mutex> registered = TimerManager::getInstance()->lockRegistered(this, fd);
    if (!registered.owns_lock()) {
        KLOGD("Timer %d no longer owns fd %d", mId, fd);
        return 0;
    }

    uint64_t expirations = 0;
    ssize_t n;
    do {
        n = read(fd, &expirations, sizeof(expirations));
    } while (n < 0 && errno == EINTR);
    if (n < 0) {
        if (errno == EAGAIN || errno == EWOULDBLOCK) {
            // Re-armed between the wake-up and the read: nothing expired yet.
            return 1;
        }
        KLOGE("Failed to read: %s", strerror(errno));
        return 0;
    }
    if (n != static_cast<ssize_t>(sizeof(expirations))) {
        KLOGE("Failed to read: %zd of %zu bytes", n, sizeof(expirations));
        return 0;
    }

    if ((events & android::Looper::EVENT_INPUT) != 0) {
        target = mTarget.promote();
        if (target != nullptr) {
            target->sendMessage(ParcelMessage(MESSAGE_TIMER, mId));
        }
    }
    return 1;
}

} // namespace kelvo
