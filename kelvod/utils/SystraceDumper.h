#pragma once

#include <stdint.h>

#include <atomic>
#include <mutex>
#include <string>

namespace kelvo {

// Captures a system trace when an application burns CPU abnormally. Captures
// are rate limited (one a minute on the monotonic clock) and capped (five a
// day); each one empties the trace directory first, asks the system
// information service to write "systrace<count>.sys" there, and records the
// capture as a "systrace" row of daily_misc_data through the system handler.
//
// The system handler sets the count from the database at start and back to
// 0 at its daily tick (setDumpCount, from its own thread): the count and the
// last time are kept under a lock.
class SystraceDumper {
public:
    static constexpr const char* kTraceDir = "/data/log/kelvo/systrace";
    static constexpr int64_t kMinIntervalMs = 60000;
    static constexpr int32_t kMaxDumps = 5;
    // The system handler's request that inserts one daily_misc_data row.
    static constexpr int32_t kMiscDataRequest = 2;

    typedef int64_t (*Clock)();

    static SystraceDumper* getInstance();

    // A negative count counts as 0.
    void setDumpCount(int32_t count);
    int32_t getDumpCount();

    // Makes the directory (mode 0775, owner and group 1000) when nothing has
    // its name, else removes every entry in it that is not a directory; no
    // link is followed and nothing below a sub-directory is touched. A link
    // or a non-directory in its place is left alone. 0; -14 when it cannot
    // be made or is no directory; -2 when it cannot be opened.
    int32_t initSystraceDir(const char* dir);

    // Captures a trace for a request at the wall-clock time. Returns 0 also
    // when it declines (user type, rate limit). When a trace was written,
    // path receives its device path, even if the row could not be sent (-2).
    // -5 at the daily cap, -14 when the directory is unusable, -2 when the
    // service fails.
    int32_t dumpSystrace(int64_t time, std::string& path);

    // Tests: a shorter interval (0 or less restores it) and another
    // monotonic clock (null restores it).
    static void setMinIntervalMs(int64_t ms);
    static void setClockForTest(Clock clock);
    // Tests: the count back to -1 and the last time to now.
    void resetForTest();

private:
    SystraceDumper();
    static int64_t monotonicNow();

    std::mutex mLock;
    int32_t mDumpCount;
    // Monotonic time of the last accepted request.
    int64_t mLastTime;

    static std::atomic<int64_t> sMinIntervalMs;
    static std::atomic<Clock> sClock;
};

}  // namespace kelvo
