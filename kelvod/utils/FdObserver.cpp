#include "utils/FdObserver.h"

#include "KelvoLog.h"

namespace kelvo {

FdObserver::FdObserver(const char* name) : android::Thread() {
    mLooper = new android::Looper(true);
    if (name != nullptr && name[0] != '\0') {
        mName = name;
    }
}

void FdObserver::onFirstRef() {
    android::Thread::onFirstRef();
    if (!mName.isEmpty()) {
        run(mName.string(), 11);
    }
}

int32_t FdObserver::addFd(int fd, const android::sp<android::LooperCallback>& callback) {
    int ret = mLooper->addFd(fd, android::Looper::POLL_CALLBACK, android::Looper::EVENT_INPUT,
                             callback, nullptr);
    return ret == 1 ? 0 : -2;
}

int32_t FdObserver::removeFd(int fd) {
    return mLooper->removeFd(fd) == 1 ? 0 : -2;
}

void FdObserver::stop() {
    requestExit();
    mLooper->wake();
    join();
}

bool FdObserver::threadLoop() {
    if (mLooper == nullptr) {
        KLOGE("mLooper is NULL");
        return false;
    }
    switch (mLooper->pollOnce(-1)) {
        case android::Looper::POLL_CALLBACK:
            break;
        case android::Looper::POLL_WAKE:
            // A wake is no fault: the looper is woken to stop, or to rebuild
            // its descriptor set after a descriptor went away.
            if (!exitPending()) {
                KLOGD("POLL_WAKE");
            }
            break;
        case android::Looper::POLL_TIMEOUT:
            KLOGE("POLL_TIMEOUT");
            break;
        case android::Looper::POLL_ERROR:
            KLOGE("POLL_ERROR");
            break;
        default:
            KLOGE("default");
            break;
    }
    return true;
}

}  // namespace kelvo
