#include "utils/TimeProvider.h"

#include <time.h>

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

inline int64_t floorMod(int64_t a, int64_t b) {
    return a - floorDiv(a, b) * b;
}

} // namespace

int64_t TimeProvider::getCurrentTime(int type) {
    struct timespec ts = {};
    switch (type) {
        case TIME_TYPE_WALL:
            WallClock::getTime(&ts);
            break;
        case TIME_TYPE_MONOTONIC:
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
    mSeconds += floorDiv(mNanoseconds, kNsPerSecond);
    mNanoseconds = floorMod(mNanoseconds, kNsPerSecond);
}

void TimeProvider::computeLocalOffset() {
    // Local time of midnight UTC of this day; the offset lies within
    // -11:59 .. +12:59 and stays fixed for the object's life.
    time_t midnight = static_cast<time_t>(floorDiv(mSeconds, kSecondsPerDay) * kSecondsPerDay);
    struct tm local = {};
    if (localtime_r(&midnight, &local) == nullptr) {
        mLocalOffset = 0;
        return;
    }
    int hour = local.tm_hour <= 12 ? local.tm_hour : local.tm_hour - 24;
    mLocalOffset = (local.tm_min + hour * 60) * 60;
}

int64_t TimeProvider::getTimeMs() const {
    return mSeconds * 1000 + mNanoseconds / 1000000;
}

int TimeProvider::getHour(bool local) const {
    int64_t seconds = mSeconds + (local ? mLocalOffset : 0);
    return static_cast<int>(floorMod(seconds, kSecondsPerDay) / 3600);
}

int TimeProvider::getHour(int64_t ms, bool local) {
    return TimeProvider(ms).getHour(local);
}

int64_t TimeProvider::startOfDay() const {
    return mSeconds - floorMod(mSeconds + mLocalOffset, kSecondsPerDay);
}

int64_t TimeProvider::startOfHour() const {
    return mSeconds - floorMod(mSeconds + mLocalOffset, 3600);
}

const char* TimeProvider::toString(int format, bool local) {
    int64_t seconds = mSeconds;
    int64_t ms = mNanoseconds / 1000000;
    if ((mNanoseconds / 1000) % 1000 >= 500) {
        ms += 1;
    }
    if (ms >= 1000) {
        seconds += 1;
        ms = 0;
    }
    mText[0] = '\0';
    if (format == TIME_FORMAT_DURATION) {
        // A negative duration prints as its magnitude with a leading '-'.
        const char* sign = "";
        if (seconds < 0) {
            sign = "-";
            if (ms > 0) {
                seconds = -(seconds + 1);
                ms = 1000 - ms;
            } else {
                seconds = seconds == INT64_MIN ? INT64_MAX : -seconds;
            }
        }
        snprintf(mText, sizeof(mText), "%s%02" PRId64 "-%02" PRId64 ":%02" PRId64 ":%02" PRId64
                 ".%03" PRId64,
                 sign, seconds / kSecondsPerDay, (seconds / 3600) % 24, (seconds / 60) % 60,
                 seconds % 60, ms);
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
