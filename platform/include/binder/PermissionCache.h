#pragma once

// Permission checks that remember what was granted: a permission granted to
// a uid stays granted for it until purge(). Refusals are always asked again.

#include <sys/types.h>
#include <utils/String16.h>

namespace android {

class PermissionCache {
public:
    static bool checkCallingPermission(const String16& permission);
    static bool checkCallingPermission(const String16& permission, int32_t* outPid, int32_t* outUid);
    static bool checkPermission(const String16& permission, pid_t pid, uid_t uid);
    // Forgets every remembered grant.
    static void purge();

private:
    PermissionCache() = delete;
};

} // namespace android
