#include <binder/IPCThreadState.h>
#include <binder/ProcessState.h>

#include "KelvoLog.h"
#include "core/KelvoAgent.h"

using namespace kelvo;

int main(int argc, char** argv) {
    KLOGI("Kelvo Daemon (Version: %s)", KelvoAgent::kVersion);
    android::sp<KelvoAgent> agent = KelvoAgent::getInstance();
    agent->initiate();
    android::ProcessState::self()->startThreadPool();
    android::IPCThreadState::self()->joinThreadPool(true);
    // The pool returns on an orderly stop (SIGTERM): keep what is buffered.
    agent->stop();
    return 0;
}
