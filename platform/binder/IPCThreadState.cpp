#include <binder/IPCThreadState.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <mutex>
#include <thread>

#include "BinderHost.h"
#include "kelvo/StopSignal.h"

namespace android {

IPCThreadState* IPCThreadState::self() {
    static thread_local IPCThreadState state;
    return &state;
}

IPCThreadState::IPCThreadState() : mHasCaller(false), mCallingPid(0), mCallingUid(0) {}

pid_t IPCThreadState::getCallingPid() const {
    return mHasCaller ? mCallingPid : getpid();
}

uid_t IPCThreadState::getCallingUid() const {
    return mHasCaller ? mCallingUid : getuid();
}

int64_t IPCThreadState::clearCallingIdentity() {
    // uid in the high half, pid in the low half; -1 when there was no caller.
    int64_t token = -1;
    if (mHasCaller) {
        token = static_cast<int64_t>((static_cast<uint64_t>(mCallingUid) << 32) |
                                     static_cast<uint32_t>(mCallingPid));
    }
    mHasCaller = false;
    return token;
}

void IPCThreadState::restoreCallingIdentity(int64_t token) {
    if (token == -1) {
        mHasCaller = false;
        return;
    }
    mHasCaller = true;
    mCallingUid = static_cast<uid_t>(static_cast<uint64_t>(token) >> 32);
    mCallingPid = static_cast<pid_t>(static_cast<uint32_t>(token));
}

void IPCThreadState::setCallingIdentity(pid_t pid, uid_t uid, bool* outHad, pid_t* outPid,
                                        uid_t* outUid) {
    *outHad = mHasCaller;
    *outPid = mCallingPid;
    *outUid = mCallingUid;
    mHasCaller = true;
    mCallingPid = pid;
    mCallingUid = uid;
}

void IPCThreadState::restoreIdentity(bool had, pid_t pid, uid_t uid) {
    mHasCaller = had;
    mCallingPid = pid;
    mCallingUid = uid;
}

void IPCThreadState::joinThreadPool(bool isMain) {
    static std::once_flag stopWatch;
    std::call_once(stopWatch, [] {
        // SIGTERM and SIGINT end the pool, the joined thread included.
        std::thread([] {
            prctl(PR_SET_NAME, "binder:stop", 0, 0, 0);
            kelvo::StopSignal::wait();
            kelvo::BinderHost::self().stopPool();
        }).detach();
    });
    kelvo::BinderHost::self().joinPool();
}

} // namespace android
