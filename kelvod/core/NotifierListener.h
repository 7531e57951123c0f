#pragma once

#include <utils/RefBase.h>

#include "utils/HandlerThread.h"

namespace kelvo {

// One operator's registration with the notifier: the thread that receives
// the notifications it listens for, held weakly so that the registration
// never keeps its operator alive. The owner unregisters it from every type
// (Notifier::unregisterAll) before freeing it.
struct NotifierListener {
    explicit NotifierListener(const android::wp<HandlerThread>& handler) : handler(handler) {}
    android::wp<HandlerThread> handler;
};

} // namespace kelvo
