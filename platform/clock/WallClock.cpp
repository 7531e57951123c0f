#include "kelvo/WallClock.h"

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstdlib>

namespace kelvo {

namespace {

std::atomic<int64_t> gOffsetMs{0};
std::atomic<bool> gLoaded{false};
// Negative while the clock runs.
std::atomic<int64_t> gFixedMs{-1};

int64_t parseOffset() {
    const char* text = getenv("KELVO_CLOCK_OFFSET_MS");
    if (text == nullptr || text[0] == '\0') {
        return 0;
    }
    errno = 0;
    char* end = nullptr;
    long long v = strtoll(text, &end, 10);
    if (errno != 0 || *end != '\0') {
        return 0;
    }
    return v;
}

} // namespace

void WallClock::reloadOffset() {
    gOffsetMs.store(parseOffset(), std::memory_order_relaxed);
    gLoaded.store(true, std::memory_order_release);
}

void WallClock::setFixedTimeMs(int64_t ms) {
    gFixedMs.store(ms < 0 ? -1 : ms, std::memory_order_release);
}

int WallClock::getTime(struct timespec* ts) {
    if (ts == nullptr) {
        errno = EINVAL;
        return -1;
    }
    int64_t fixed = gFixedMs.load(std::memory_order_acquire);
    if (fixed >= 0) {
        ts->tv_sec = static_cast<time_t>(fixed / 1000);
        ts->tv_nsec = static_cast<long>((fixed % 1000) * 1000000);
        return 0;
    }
    if (!gLoaded.load(std::memory_order_acquire)) {
        reloadOffset();
    }
    if (clock_gettime(CLOCK_REALTIME, ts) != 0) {
        return -1;
    }
    int64_t offset = gOffsetMs.load(std::memory_order_relaxed);
    if (offset == 0) {
        return 0;
    }
    int64_t sec = static_cast<int64_t>(ts->tv_sec) + offset / 1000;
    int64_t nsec = static_cast<int64_t>(ts->tv_nsec) + (offset % 1000) * 1000000;
    if (nsec < 0) {
        nsec += 1000000000;
        sec -= 1;
    } else if (nsec >= 1000000000) {
        nsec -= 1000000000;
        sec += 1;
    }
    ts->tv_sec = static_cast<time_t>(sec);
    ts->tv_nsec = static_cast<long>(nsec);
    return 0;
}

} // namespace kelvo
