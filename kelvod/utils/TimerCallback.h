#pragma once

#include <stdint.h>
#include <utils/Looper.h>
#include <utils/StrongPointer.h>

#include "utils/HandlerThread.h"

namespace kelvo {

// Turns expiries of one timer into MESSAGE_TIMER messages (what = timer id,
// empty body) for the thread that owns the timer. Runs on the TimerManager
// thread; several expiries seen by one read become one message.
class TimerCallback : public android::LooperCallback {
public:
    TimerCallback(const android::sp<HandlerThread>& target, int32_t id);

    int32_t getId() const { return mId; }

    // 1 keeps the descriptor watched, 0 drops it from the looper.
    int handleEvent(int fd, int events, void* data) override;

private:
    // Weak: an operator keeps its own timer callbacks, so a strong
    // reference back would keep both alive for ever.
    android::wp<HandlerThread> mTarget;
    int32_t mId;
};

} // namespace kelvo
