#include <binder/ProcessState.h>

#include <mutex>

#include "BinderHost.h"
#include "kelvo/StopSignal.h"

namespace android {

namespace {

// A process that uses binder stops cleanly on SIGTERM and SIGINT: install the
// handlers before main, so a request that comes during start-up is kept.
struct StopSignalInit {
    StopSignalInit() { kelvo::StopSignal::install(); }
} gStopSignalInit;

} // namespace

sp<ProcessState> ProcessState::self() {
    static std::mutex lock;
    static sp<ProcessState>* instance = nullptr;
    std::lock_guard<std::mutex> guard(lock);
    if (instance == nullptr) {
        instance = new sp<ProcessState>(new ProcessState());
    }
    return *instance;
}

ProcessState::ProcessState() {}

void ProcessState::startThreadPool() {
    kelvo::BinderHost::self().startPool();
}

status_t ProcessState::setThreadPoolMaxThreadCount(size_t maxThreads) {
    kelvo::BinderHost::self().setMaxThreads(maxThreads);
    return NO_ERROR;
}

} // namespace android
