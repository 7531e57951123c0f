#pragma once

#include <stdint.h>

#include <utils/RefBase.h>
#include <utils/String8.h>

#include "utils/HandlerThread.h"

namespace kelvo {

// One operator's registration with the buffered log server: the thread that
// receives the entries of the senders it registered for. It holds the thread
// weakly, so the server's registration never keeps an operator alive.
class LogReceiver : public virtual android::RefBase {
public:
    explicit LogReceiver(const android::wp<HandlerThread>& handler) : mHandler(handler) {}

    // Posts one entry (int32 length, int32 magic, data) to the operator as a
    // MESSAGE_BUFFERED_LOG: int64 arrival time ms, String8 client name, int32
    // magic, int32 length, the data bytes.
    int32_t onLogReceived(const android::String8& name, const uint8_t* entry, size_t size);

private:
    android::wp<HandlerThread> mHandler;
};

} // namespace kelvo
