#pragma once

#include <stdint.h>
#include <sys/types.h>

namespace kelvo {
class BinderHost;
} // namespace kelvo

namespace android {

// Per-thread binder state: who is calling the transaction this thread runs.
class IPCThreadState {
public:
    static IPCThreadState* self();

    // The caller's pid and uid as the kernel gave them for its connection
    // (never from the transaction's data); this process's own outside a
    // transaction.
    pid_t getCallingPid() const;
    uid_t getCallingUid() const;

    // Makes the calls below run as this process; the token gives the caller
    // back.
    int64_t clearCallingIdentity();
    void restoreCallingIdentity(int64_t token);

    // Nothing is buffered on the host: kept for callers that flush.
    void flushCommands() {}

    // Serves the pool on the calling thread. Returns once the process has been
    // asked to stop (SIGTERM or SIGINT); the pool's other threads stop too.
    void joinThreadPool(bool isMain = true);

private:
    friend class kelvo::BinderHost;

    IPCThreadState();
    // Set while an incoming transaction runs on this thread.
    void setCallingIdentity(pid_t pid, uid_t uid, bool* outHad, pid_t* outPid, uid_t* outUid);
    void restoreIdentity(bool had, pid_t pid, uid_t uid);

    bool mHasCaller;
    pid_t mCallingPid;
    uid_t mCallingUid;
};

} // namespace android
