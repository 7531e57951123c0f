#include "utils/SystraceDumper.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "KelvoLog.h"
#include "binder/managers/SysinfoManager.h"
#include "core/KelvoAgent.h"
#include "kelvo/RootPath.h"
#include "utils/FileUtils.h"
#include "utils/TimeProvider.h"

namespace kelvo {

namespace {

constexpr int32_t kUserTypeBetaDomestic = 3;
constexpr int32_t kUserTypeBetaOverseas = 5;
constexpr uid_t kSystemUid = 1000;

}  // namespace

std::atomic<int64_t> SystraceDumper::sMinIntervalMs{SystraceDumper::kMinIntervalMs};
std::atomic<SystraceDumper::Clock> SystraceDumper::sClock{nullptr};

SystraceDumper* SystraceDumper::getInstance() {
    static SystraceDumper* instance = new SystraceDumper();
    return instance;
}

SystraceDumper::SystraceDumper() : mDumpCount(-1), mLastTime(monotonicNow()) {}

int64_t SystraceDumper::monotonicNow() {
    Clock clock = sClock.load(std::memory_order_relaxed);
    return clock != nullptr ? clock() : TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC);
}

void SystraceDumper::setMinIntervalMs(int64_t ms) {
    sMinIntervalMs.store(ms > 0 ? ms : kMinIntervalMs, std::memory_order_relaxed);
}

void SystraceDumper::setClockForTest(Clock clock) {
    sClock.store(clock, std::memory_order_relaxed);
}

void SystraceDumper::resetForTest() {
    std::lock_guard<std::mutex> guard(mLock);
    mDumpCount = -1;
    mLastTime = monotonicNow();
}

void SystraceDumper::setDumpCount(int32_t count) {
    std::lock_guard<std::mutex> guard(mLock);
    mDumpCount = count < 0 ? 0 : count;
}

int32_t SystraceDumper::getDumpCount() {
    std::lock_guard<std::mutex> guard(mLock);
    return mDumpCount;
}

int32_t SystraceDumper::initSystraceDir(const char* dir) {
    if (dir == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::string path = RootPath::resolve(dir);
    struct stat st = {};
    if (lstat(path.c_str(), &st) != 0) {
        if (errno != ENOENT || FileUtils::createDirectory(path.c_str(), 0775) < 0 ||
            FileUtils::chownDir(path.c_str(), kSystemUid, kSystemUid) < 0) {
            KLOGE("Failed to create systrace directory");
            return -14;
        }
        return 0;
    }
    if (!S_ISDIR(st.st_mode)) {
        // A link could lead the clean anywhere: whatever holds the name stays.
        KLOGE("Failed to create systrace directory");
        return -14;
    }
    int fd = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    DIR* d = fd < 0 ? nullptr : fdopendir(fd);
    if (d == nullptr) {
        KLOGE("Failed to open directory: %s, error: %s", dir, strerror(errno));
        if (fd >= 0) {
            close(fd);
        }
        return -2;
    }
    while (struct dirent* entry = readdir(d)) {
        struct stat es = {};
        if (strcmp(entry->d_name, ".") == 0 || strcmp(entry->d_name, "..") == 0 ||
            fstatat(fd, entry->d_name, &es, AT_SYMLINK_NOFOLLOW) != 0 || S_ISDIR(es.st_mode)) {
            continue;
        }
        if (unlinkat(fd, entry->d_name, 0) != 0) {
            KLOGE("Failed to remove file: %s, %s", entry->d_name, strerror(errno));
        }
    }
    closedir(d);
    return 0;
}

int32_t SystraceDumper::dumpSystrace(int64_t time, std::string& path) {
    int32_t userType = gLogUserType.load(std::memory_order_relaxed);
    if (userType != kUserTypeBetaDomestic && userType != kUserTypeBetaOverseas) {
        return 0;
    }
    std::lock_guard<std::mutex> guard(mLock);
    int64_t now = monotonicNow();
    if (now - mLastTime < sMinIntervalMs.load(std::memory_order_relaxed)) {
        KLOGI("Too frequently dump: %lld %lld", static_cast<long long>(mLastTime),
              static_cast<long long>(now));
        return 0;
    }
    mLastTime = now;
    int32_t count = mDumpCount < 0 ? 0 : mDumpCount;
    if (count >= kMaxDumps) {
        KLOGI("Invalid dump systrace count: %d", count);
        return -5;
    }
    if (initSystraceDir(kTraceDir) < 0) {
        KLOGE("Failed to clear systrace dir: %s", kTraceDir);
        return -14;
    }
    std::string file = std::string(kTraceDir) + "/systrace" + std::to_string(count) + ".sys";
    if (SysinfoManager::getInstance()->dumpSystrace(file.c_str()) < 0) {
        KLOGE("Failed to dump systrace!");
        return -2;
    }
    // The trace exists: it is counted and handed on whether or not its row
    // can be recorded.
    path = file;
    mDumpCount = count + 1;
    android::Parcel row;
    row.writeInt64(time);
    row.writeString8(android::String8("systrace"));
    row.writeString8(android::String8(std::to_string(count).c_str()));
    if (KelvoAgent::getInstance()->sendToHandler(HANDLER_SYSTEM, kMiscDataRequest, row, nullptr,
                                                 false) < 0) {
        KLOGE("Failed to sent data to common table!");
        return -2;
    }
    KLOGI("Dump systrace success: %lld %s!", static_cast<long long>(time), file.c_str());
    return 0;
}

}  // namespace kelvo
