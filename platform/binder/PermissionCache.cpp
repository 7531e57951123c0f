#include <binder/IPCThreadState.h>
#include <binder/IServiceManager.h>
#include <binder/PermissionCache.h>
#include <utils/String8.h>

#include <map>
#include <mutex>
#include <set>
#include <utility>

namespace android {

namespace {

struct Grants {
    std::mutex lock;
    std::set<std::pair<std::string, uid_t>> granted;
};

Grants& grants() {
    static Grants* g = new Grants();
    return *g;
}

std::string key(const String16& permission) {
    String8 text(permission);
    return std::string(text.string(), text.size());
}

} // namespace

bool PermissionCache::checkPermission(const String16& permission, pid_t pid, uid_t uid) {
    if (uid == 0 || pid == getpid()) {
        return true;
    }
    Grants& g = grants();
    auto entry = std::make_pair(key(permission), uid);
    {
        std::lock_guard<std::mutex> guard(g.lock);
        if (g.granted.count(entry) != 0) {
            return true;
        }
    }
    // Asked without the lock: the answer comes from another process.
    bool granted = android::checkPermission(permission, pid, uid);
    if (granted) {
        std::lock_guard<std::mutex> guard(g.lock);
        g.granted.insert(entry);
    }
    return granted;
}

bool PermissionCache::checkCallingPermission(const String16& permission) {
    return checkCallingPermission(permission, nullptr, nullptr);
}

bool PermissionCache::checkCallingPermission(const String16& permission, int32_t* outPid,
                                             int32_t* outUid) {
    IPCThreadState* ipc = IPCThreadState::self();
    pid_t pid = ipc->getCallingPid();
    uid_t uid = ipc->getCallingUid();
    if (outPid != nullptr) {
        *outPid = pid;
    }
    if (outUid != nullptr) {
        *outUid = static_cast<int32_t>(uid);
    }
    return checkPermission(permission, pid, uid);
}

void PermissionCache::purge() {
    Grants& g = grants();
    std::lock_guard<std::mutex> guard(g.lock);
    g.granted.clear();
}

} // namespace android
