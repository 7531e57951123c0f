#include "utils/TimeProvider.h"

#include <time.h>

#include <atomic>
#include <cinttypes>
#include <cstdio>

#include "KelvoLog.h"
#include "kelvo/WallClock.h"

namespace kelvo {

namespace {

constexpr int64_t kNsPerSecond = 1000000000;
constexpr int64_t kSecondsPerDay = 86400;

inline int64_t floorDiv(int64_t a, int64_t b) {
    int64_t q = a / b;
    return (a % b != 0 && (a < 0) != (b < 0)) ? q - 1 : q;
}

// Same result as a - floorDiv(a, b) * b, without its overflow near the ends
// of the range.
inline int64_t floorMod(int64_t a, int64_t b) {
    int64_t r = a % b;
    return (r != 0 && (r < 0) != (b < 0)) ? r + b : r;
}

// floorMod(a + offset, b) without computing a + offset.
inline int64_t floorModShifted(int64_t a, int64_t offset, int64_t b) {
    return floorMod(floorMod(a, b) + floorMod(offset, b), b);
}

std::atomic<TimeProvider::MonotonicSource> gMonotonicSource{nullptr};

} // namespace

void TimeProvider::setMonotonicSource(MonotonicSource source) {
    gMonotonicSource.store(source, std::memory_order_release);
}

int64_t TimeProvider::getCurrentTime(int type) {
    struct timespec ts = {};
    switch (type) {
        case TIME_TYPE_WALL:
            WallClock::getTime(&ts);
            break;
        case TIME_TYPE_MONOTONIC:
            if (MonotonicSource source = gMonotonicSource.load(std::memory_order_acquire)) {
                return source();
            }
            clock_gettime(CLOCK_MONOTONIC, &ts);
            break;
        default:
            KLOGE("Invalid time type");
            return -3;
    }
    return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

TimeProvider::TimeProvider() : mSeconds(0), mNanoseconds(0), mLocalOffset(0), mText{} {
    struct timespec ts = {};
    WallClock::getTime(&ts);
    mSeconds = ts.tv_sec;
    mNanoseconds = ts.tv_nsec;
    computeLocalOffset();
}

TimeProvider::TimeProvider(int64_t seconds, int64_t nanoseconds)
    : mSeconds(seconds), mNanoseconds(nanoseconds), mLocalOffset(0), mText{} {
    normalise();
    computeLocalOffset();
}

TimeProvider::TimeProvider(int64_t ms)
    : mSeconds(floorDiv(ms, 1000)),
      mNanoseconds(floorMod(ms, 1000) * 1000000),
      mLocalOffset(0),
      mText{} {
    computeLocalOffset();
}

void TimeProvider::normalise() {
    int64_t carry = floorDiv(mNanoseconds, kNsPerSecond);
    mNanoseconds = floorMod(mNanoseconds, kNsPerSecond);
    if (__builtin_add_overflow(mSeconds, carry, &mSeconds)) {
        // Saturate at the ends of the range.
        mSeconds = carry > 0 ? INT64_MAX : INT64_MIN;
        mNanoseconds = carry > 0 ? kNsPerSecond - 1 : 0;
    }
}

void TimeProvider::computeLocalOffset() {
    // The zone's offset at midnight UTC of this day; it stays fixed for the
    // object's life. Taken from the zone itself rather than from the local
    // time of day, which cannot tell -12:00 from +12:00 and would turn the
    // +13:00 and +14:00 zones into -11:00 and -10:00.
    mLocalOffset = 0;
    int64_t midnight;
    if (__builtin_sub_overflow(mSeconds, floorMod(mSeconds, kSecondsPerDay), &midnight)) {
        return; // before any representable day
    }
    time_t t = static_cast<time_t>(midnight);
    struct tm local = {};
    if (localtime_r(&t, &local) == nullptr) {
        return;
    }
    mLocalOffset = static_cast<int32_t>(local.tm_gmtoff);
}

int64_t TimeProvider::getTimeMs() const {
    int64_t ms;
    if (__builtin_mul_overflow(mSeconds, 1000, &ms) ||
        __builtin_add_overflow(ms, mNanoseconds / 1000000, &ms)) {
        return mSeconds < 0 ? INT64_MIN : INT64_MAX;
    }
    return ms;
}

int TimeProvider::getHour(bool local) const {
    return static_cast<int>(floorModShifted(mSeconds, local ? mLocalOffset : 0, kSecondsPerDay) /
                            3600);
}

int TimeProvider::getHour(int64_t ms, bool local) {
    return TimeProvider(ms).getHour(local);
}

int64_t TimeProvider::startOfDay() const {
    return mSeconds - floorModShifted(mSeconds, mLocalOffset, kSecondsPerDay);
}

int64_t TimeProvider::startOfHour() const {
    return mSeconds - floorModShifted(mSeconds, mLocalOffset, 3600);
}

const char* TimeProvider::toString(int format, bool local) {
    int64_t seconds = mSeconds;
    int64_t ms = mNanoseconds / 1000000;
    if ((mNanoseconds / 1000) % 1000 >= 500) {
        ms += 1;
    }
    if (ms >= 1000) {
        if (seconds == INT64_MAX) {
            ms = 999; // the last representable millisecond
        } else {
            seconds += 1;
            ms = 0;
        }
    }
    mText[0] = '\0';
    if (format == TIME_FORMAT_DURATION) {
        // A negative duration prints as its magnitude with a leading '-'.
        // The magnitude is unsigned so that the most negative value has one.
        const char* sign = "";
        uint64_t magnitude = static_cast<uint64_t>(seconds);
        if (seconds < 0) {
            sign = "-";
            // -(seconds + 1) never overflows.
            magnitude = static_cast<uint64_t>(-(seconds + 1));
            if (ms > 0) {
                ms = 1000 - ms;
            } else {
                magnitude += 1;
            }
        }
        // Bounded: an absurd duration is cut, never overflows the buffer.
        snprintf(mText, sizeof(mText), "%s%02" PRIu64 "-%02" PRIu64 ":%02" PRIu64 ":%02" PRIu64
                 ".%03" PRId64,
                 sign, magnitude / kSecondsPerDay, (magnitude / 3600) % 24, (magnitude / 60) % 60,
                 magnitude % 60, ms);
        return mText;
    }
    time_t t = static_cast<time_t>(seconds);
    struct tm tmValue = {};
    struct tm* ok = local ? localtime_r(&t, &tmValue) : gmtime_r(&t, &tmValue);
    if (ok == nullptr || strftime(mText, sizeof(mText), "%Y-%m-%d %H:%M:%S", &tmValue) == 0) {
        mText[0] = '\0';
    }
    return mText;
}

} // namespace kelvo
