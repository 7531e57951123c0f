#include <binder/ProcessState.h>

#include <mutex>

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

ProcessState::ProcessState() : mThreadPoolStarted(false) {}

void ProcessState::startThreadPool() {
    mThreadPoolStarted = true;
}

} // namespace android
