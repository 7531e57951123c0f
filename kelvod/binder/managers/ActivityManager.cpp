#include "binder/managers/ActivityManager.h"

#include <stdlib.h>

#include "KelvoLog.h"
#include "binder/managers/ParcelReader.h"
#include "utils/TimeProvider.h"

namespace kelvo {

namespace {

constexpr int64_t kRefreshMs = 101;
constexpr int32_t kFirstIsolatedUid = 99000;
constexpr int32_t kLastIsolatedUid = 99999;

} // namespace

ActivityManager* ActivityManager::getInstance() {
    static ActivityManager* instance = new ActivityManager();
    return instance;
}

ActivityManager::ActivityManager() : BaseManager("activity"), mLastRefresh(0) {
    setBinderId();
}

void ActivityManager::setBinderId() {
    mRunningProcessesCode = mSdkLevel == 24 ? 83 : 77;
}

int32_t ActivityManager::getPackagesForPid(int32_t uid, int32_t pid,
                                           std::vector<android::String8>& out) {
    std::lock_guard<std::mutex> guard(mTableLock);
    int64_t now = TimeProvider::getCurrentTime(TIME_TYPE_WALL);
    // A table from a service that died since is stale however young it is.
    if (llabs(now - mLastRefresh) >= kRefreshMs || !isConnected()) {
        std::map<int32_t, ProcessInfo> table;
        if (getRunningAppProcesses(table) != 0) {
            KLOGE("Failed to get running app processes from activity manager service");
            mProcesses.clear();
            return -2;
        }
        mProcesses.swap(table);
        mLastRefresh = now;
    }
    auto it = mProcesses.find(pid);
    if (it != mProcesses.end() &&
        (it->second.uid == uid || (uid >= kFirstIsolatedUid && uid <= kLastIsolatedUid))) {
        out.insert(out.end(), it->second.packages.begin(), it->second.packages.end());
    }
    return 0;
}

int32_t ActivityManager::getRunningAppProcesses(std::map<int32_t, ProcessInfo>& table) {
    std::lock_guard<std::mutex> guard(mLock);
    int32_t ret = getService();
    if (ret != 0) {
        KLOGE("Failed to get activity manager service: %d", ret);
        return -8;
    }
    android::Parcel data;
    android::Parcel reply;
    data.writeInterfaceToken(mDescriptor);
    android::status_t status = mService->transact(mRunningProcessesCode, data, &reply);
    if (status != android::NO_ERROR || reply.readExceptionCode() != 0) {
        KLOGE("Failed to read reply");
        return -12;
    }
    // A typed list: int32 count, then per record an int32 non-null marker
    // and the RunningAppProcessInfo fields (docs/architecture.md,
    // "Platform services").
    int32_t count = 0;
    if (reply.readInt32(&count) != android::NO_ERROR) {
        KLOGE("Failed to read reply");
        return -12;
    }
    if (count == -1) {
        return 0;
    }
    if (!countFits(reply, count, sizeof(int32_t))) {
        KLOGE("Failed to read reply");
        return -12;
    }
    for (int32_t i = 0; i < count; ++i) {
        int32_t present = 0;
        if (reply.readInt32(&present) != android::NO_ERROR) {
            KLOGE("Failed to read reply");
            return -12;
        }
        if (present == 0) {
            continue;
        }
        android::String16 processName;
        int32_t pid = 0;
        int32_t uid = 0;
        std::vector<android::String16> packages;
        int32_t flags = 0, trimLevel = 0, importance = 0, lru = 0, reasonCode = 0, reasonPid = 0;
        android::String16 reasonComponent;
        int32_t reasonImportance = 0, processState = 0;
        bool ok = reply.readString16(&processName) == android::NO_ERROR &&
                  reply.readInt32(&pid) == android::NO_ERROR &&
                  reply.readInt32(&uid) == android::NO_ERROR &&
                  readString16Array(reply, packages) &&
                  reply.readInt32(&flags) == android::NO_ERROR &&
                  reply.readInt32(&trimLevel) == android::NO_ERROR &&
                  reply.readInt32(&importance) == android::NO_ERROR &&
                  reply.readInt32(&lru) == android::NO_ERROR &&
                  reply.readInt32(&reasonCode) == android::NO_ERROR &&
                  reply.readInt32(&reasonPid) == android::NO_ERROR;
        if (ok) {
            // The reason component: a null String16, or package and class.
            int32_t length = 0;
            ok = reply.readInt32(&length) == android::NO_ERROR;
            if (ok && length >= 0) {
                reply.setDataPosition(reply.dataPosition() - sizeof(int32_t));
                android::String16 cls;
                ok = reply.readString16(&reasonComponent) == android::NO_ERROR &&
                     reply.readString16(&cls) == android::NO_ERROR;
            }
        }
        ok = ok && reply.readInt32(&reasonImportance) == android::NO_ERROR &&
             reply.readInt32(&processState) == android::NO_ERROR;
        if (!ok) {
            // A broken record ends the table: what follows cannot be trusted.
            KLOGE("Failed to read reply");
            return -12;
        }
        ProcessInfo& info = table[pid];
        info.uid = uid;
        info.packages.clear();
        for (const android::String16& name : packages) {
            if (name.size() > 0) {
                info.packages.push_back(android::String8(name));
            }
        }
    }
    return 0;
}

} // namespace kelvo
