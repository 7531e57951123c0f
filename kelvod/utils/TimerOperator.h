#pragma once

#include <stdint.h>
#include <time.h>

namespace kelvo {

// One kernel timer on the boot-time clock, so it keeps counting through
// suspend. The descriptor is non-blocking and closed on exec; it is closed
// when the object goes.
class TimerOperator {
public:
    // firstMs: delay from scheduling to the first expiry. intervalMs: period
    // after that, 0 for a one-shot timer. The timer is not armed yet.
    TimerOperator(int64_t firstMs, int64_t intervalMs);
    ~TimerOperator();

    TimerOperator(const TimerOperator&) = delete;
    TimerOperator& operator=(const TimerOperator&) = delete;

    // The descriptor, negative when it could not be created.
    int32_t getFd() const { return mFd; }

    // Arms the timer: first expiry "first" from now, then every "interval".
    // 0, or -2 when a system call failed.
    int32_t schedule();
    // Replaces both times and arms the timer again from now.
    int32_t reschedule(int64_t firstMs, int64_t intervalMs);
    // Disarms the timer. 0 or -2.
    int32_t cancel();
    // Milliseconds left until the next expiry (0 when disarmed), or -2.
    int64_t getExpire() const;

private:
    static struct timespec toTimespec(int64_t ms);

    int32_t mFd;
    struct timespec mInterval;
    struct timespec mFirst;
};

} // namespace kelvo
