#pragma once

#include <utils/StrongPointer.h>

#include "utils/HandlerThread.h"

namespace kelvo {

// One operator's registration with the notifier: the thread that receives
// the notifications it listens for.
struct NotifierListener {
    explicit NotifierListener(const android::sp<HandlerThread>& handler) : handler(handler) {}
    android::sp<HandlerThread> handler;
};

} // namespace kelvo
