#pragma once

// The service manager. On the host the registry is the file system: a
// registered name is a socket <root>/dev/binder/<name> served by the process
// that added it. Lookups always go through that socket, so a service of this
// very process is also reached through a proxy (and is seen to die when it
// stops).

#include <binder/IInterface.h>
#include <sys/types.h>
#include <utils/Vector.h>

namespace android {

class IServiceManager : public IInterface {
public:
    // Waits for the name to appear (ProcessState::serviceWaitMs(), a few
    // seconds by default); null when it does not.
    virtual sp<IBinder> getService(const String16& name) const = 0;
    // Does not wait: null when nothing serves the name now.
    virtual sp<IBinder> checkService(const String16& name) const = 0;
    // Serves binder under the name from this process (starting the thread
    // pool when needed). A name registered before, by this or a dead
    // process, is replaced. BAD_VALUE for an empty name, one with '/' or
    // starting with '.', or one too long for a socket path.
    virtual status_t addService(const String16& name, const sp<IBinder>& service,
                                bool allowIsolated = false, int dumpsysFlags = 0) = 0;
    // The names that answer now, sorted.
    virtual Vector<String16> listServices(int dumpsysFlags = 0) = 0;

protected:
    IBinder* onAsBinder() override { return nullptr; }
};

sp<IServiceManager> defaultServiceManager();

// Asks the "permission" service whether the process pid of uid holds the
// permission. Root and this very process always do; without the service the
// answer is no.
bool checkPermission(const String16& permission, pid_t pid, uid_t uid);
bool checkCallingPermission(const String16& permission);
bool checkCallingPermission(const String16& permission, int32_t* outPid, int32_t* outUid);

} // namespace android
