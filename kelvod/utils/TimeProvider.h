#pragma once

#include <stdint.h>

namespace kelvo {

enum time_type {
    TIME_TYPE_WALL = 0,      // CLOCK_REALTIME (through the platform's wall clock)
    TIME_TYPE_MONOTONIC = 1, // CLOCK_MONOTONIC
};

enum time_format {
    TIME_FORMAT_DATE = 0,     // "%Y-%m-%d %H:%M:%S"
    TIME_FORMAT_DURATION = 1, // "DD-HH:MM:SS.mmm"
};

// A point of the wall clock with the local offset fixed at construction.
// The only way daemon code reads the wall clock.
class TimeProvider {
public:
    // Milliseconds of the chosen clock; -3 for an unknown type.
    static int64_t getCurrentTime(int type);
    // Where TIME_TYPE_MONOTONIC reads its milliseconds; null for the clock.
    using MonotonicSource = int64_t (*)();
    // Replaces the monotonic clock so that spans measured on it can be
    // driven by a test; null gives the clock back.
    static void setMonotonicSource(MonotonicSource source);
    static int getHour(int64_t ms, bool local);

    TimeProvider();
    TimeProvider(int64_t seconds, int64_t nanoseconds);
    explicit TimeProvider(int64_t ms);

    int64_t getTimeMs() const;
    int64_t getSeconds() const { return mSeconds; }
    int64_t getNanoseconds() const { return mNanoseconds; }
    int32_t getLocalOffset() const { return mLocalOffset; }
    int getHour(bool local) const;
    // Start of the local day / hour, in seconds.
    int64_t startOfDay() const;
    int64_t startOfHour() const;
    // Formats into the object's buffer and returns it.
    const char* toString(int format, bool local);

private:
    void normalise();
    void computeLocalOffset();

    int64_t mSeconds;
    int64_t mNanoseconds;
    int32_t mLocalOffset;
    // Large enough for any duration, negative ones included.
    char mText[32];
};

} // namespace kelvo
