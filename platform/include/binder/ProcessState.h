#pragma once

#include <utils/RefBase.h>

namespace android {

// The process's binder state. Until the host transport serves transactions,
// the pool has no threads of its own; joining it parks the caller until the
// process is asked to stop (SIGTERM or SIGINT).
class ProcessState : public virtual RefBase {
public:
    static sp<ProcessState> self();

    void startThreadPool();

private:
    ProcessState();
    bool mThreadPoolStarted;
};

} // namespace android
