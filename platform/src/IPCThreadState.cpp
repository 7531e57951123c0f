#include <binder/IPCThreadState.h>

#include "kelvo/StopSignal.h"

namespace android {

IPCThreadState* IPCThreadState::self() {
    static thread_local IPCThreadState state;
    return &state;
}

void IPCThreadState::joinThreadPool(bool isMain) {
    kelvo::StopSignal::wait();
}

} // namespace android
