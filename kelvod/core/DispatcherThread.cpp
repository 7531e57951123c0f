#include "core/DispatcherThread.h"

#include "KelvoLog.h"
#include "core/Dispatcher.h"

namespace kelvo {

DispatcherThread::DispatcherThread(Dispatcher* dispatcher)
    : android::Thread(), mDispatcher(dispatcher) {}

bool DispatcherThread::threadLoop() {
    if (mDispatcher == nullptr) {
        KLOGE("Invalid dispatcher pointer");
        return false;
    }
    int32_t ret = mDispatcher->readLoggerMessage();
    if (ret < 0) {
        KLOGE("Failed to read logger message: %d", ret);
        mDispatcher->closeDevice();
        return false;
    }
    return ret == 0;
}

} // namespace kelvo
