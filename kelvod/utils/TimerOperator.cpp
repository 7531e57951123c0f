#include "utils/TimerOperator.h"

#include <sys/timerfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "KelvoLog.h"

namespace kelvo {

namespace {

constexpr long kNsPerSecond = 1000000000L;

} // namespace

struct timespec TimerOperator::toTimespec(int64_t ms) {
    struct timespec ts = {};
    ts.tv_sec = static_cast<time_t>(ms / 1000);
    ts.tv_nsec = static_cast<long>((ms - static_cast<int64_t>(ts.tv_sec) * 1000) * 1000000);
    return ts;
}

TimerOperator::TimerOperator(int64_t firstMs, int64_t intervalMs)
    : mFd(-1), mInterval(toTimespec(intervalMs)), mFirst(toTimespec(firstMs)) {
    mFd = timerfd_create(CLOCK_BOOTTIME, TFD_NONBLOCK | TFD_CLOEXEC);
    if (mFd < 0) {
        KLOGE("Failed to create timerfd: %s", strerror(errno));
        mFd = -1;
    }
}

TimerOperator::~TimerOperator() {
    if (mFd >= 0) {
        close(mFd);
        mFd = -1;
    }
}

int32_t TimerOperator::schedule() {
    struct timespec now = {};
    if (clock_gettime(CLOCK_BOOTTIME, &now) != 0) {
        KLOGE("Failed to get clock time: %s", strerror(errno));
        return -2;
    }
    struct itimerspec timerValue = {};
    timerValue.it_interval = mInterval;
    timerValue.it_value.tv_sec = now.tv_sec + mFirst.tv_sec;
    timerValue.it_value.tv_nsec = now.tv_nsec + mFirst.tv_nsec;
    if (timerValue.it_value.tv_nsec >= kNsPerSecond) {
        timerValue.it_value.tv_sec += 1;
        timerValue.it_value.tv_nsec -= kNsPerSecond;
    }
    if (timerfd_settime(mFd, TFD_TIMER_ABSTIME, &timerValue, nullptr) != 0) {
        KLOGE("Failed to set timer: %s", strerror(errno));
        return -2;
    }
    return 0;
}

int32_t TimerOperator::reschedule(int64_t firstMs, int64_t intervalMs) {
    mFirst = toTimespec(firstMs);
    mInterval = toTimespec(intervalMs);
    return schedule();
}

int32_t TimerOperator::cancel() {
    struct itimerspec timerValue = {};
    if (timerfd_settime(mFd, 0, &timerValue, nullptr) != 0) {
        KLOGE("Failed to set timer: %s", strerror(errno));
        return -2;
    }
    return 0;
}

int64_t TimerOperator::getExpire() const {
    struct itimerspec timerValue = {};
    if (timerfd_gettime(mFd, &timerValue) != 0) {
        KLOGE("Failed to get timer: %s", strerror(errno));
        return -2;
    }
    return static_cast<int64_t>(timerValue.it_value.tv_sec) * 1000 + timerValue.it_value.tv_nsec / 1000000;
}

} // namespace kelvo
