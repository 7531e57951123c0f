#pragma once

#include <map>
#include <vector>

#include "binder/managers/BaseManager.h"

namespace kelvo {

// Client of the "activity" service: packages of running processes, from a
// process table fetched at most once per 101 ms.
class ActivityManager : public BaseManager {
public:
    static ActivityManager* getInstance();

    // The packages of the process pid when it runs as uid (or as any
    // isolated uid): 0, also when nothing is found; -2 when the table cannot
    // be fetched.
    int32_t getPackagesForPid(int32_t uid, int32_t pid, std::vector<android::String8>& out);

    void setBinderId() override;

private:
    struct ProcessInfo {
        int32_t uid;
        std::vector<android::String8> packages;
    };

    ActivityManager();
    int32_t getRunningAppProcesses(std::map<int32_t, ProcessInfo>& table);

    uint32_t mRunningProcessesCode;
    std::mutex mTableLock;
    std::map<int32_t, ProcessInfo> mProcesses;
    int64_t mLastRefresh;
};

} // namespace kelvo
