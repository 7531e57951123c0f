#pragma once

#include <stddef.h>
#include <utils/Errors.h>
#include <utils/RefBase.h>

namespace android {

// The process's binder state: its thread pool. Pool threads ("binder:<pid>_N")
// serve the transactions that reach this process's sockets; one is started
// by startThreadPool (or by the first addService or handed-out object) and
// more are added while every thread is busy, up to the maximum.
class ProcessState : public virtual RefBase {
public:
    static sp<ProcessState> self();

    void startThreadPool();
    // Threads the pool may grow to (default 15), the joined thread excluded.
    status_t setThreadPoolMaxThreadCount(size_t maxThreads);

private:
    ProcessState();
};

} // namespace android
