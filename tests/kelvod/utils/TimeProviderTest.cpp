#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>

#include "common/TestEnv.h"
#include "kelvo/WallClock.h"
#include "utils/TimeProvider.h"

using kelvo::TimeProvider;
using kelvo::test::LogCapture;

namespace {

constexpr int64_t kDayMs = 86400000;
constexpr int64_t kHourMs = 3600000;
constexpr int64_t kMinuteMs = 60000;

// 2023-11-14 22:13:20 UTC.
constexpr int64_t kInstant = 1700000000;

std::string duration(TimeProvider provider) {
    return provider.toString(kelvo::TIME_FORMAT_DURATION, false);
}

// "D-HH:MM:SS" of a second count, from its day, hour, minute and second.
std::string daysToSeconds(uint64_t seconds) {
    char text[64];
    snprintf(text, sizeof(text), "%" PRIu64 "-%02u:%02u:%02u", seconds / 86400,
             static_cast<unsigned>(seconds % 86400 / 3600),
             static_cast<unsigned>(seconds % 3600 / 60), static_cast<unsigned>(seconds % 60));
    return text;
}

int64_t nowMs(clockid_t clock) {
    struct timespec ts = {};
    clock_gettime(clock, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

// Switches the process time zone for one test and puts the old one back.
class TimeProviderZoneTest : public ::testing::Test {
protected:
    void SetUp() override {
        const char* tz = getenv("TZ");
        mHadZone = tz != nullptr;
        mOldZone = mHadZone ? tz : "";
    }

    void TearDown() override {
        if (mHadZone) {
            setenv("TZ", mOldZone.c_str(), 1);
        } else {
            unsetenv("TZ");
        }
        tzset();
    }

    static void useZone(const char* zone) {
        setenv("TZ", zone, 1);
        tzset();
    }

private:
    bool mHadZone = false;
    std::string mOldZone;
};

TEST(TimeProviderTest, CurrentTimeOfEachClockAndUnknownTypes) {
    const char* offset = getenv("KELVO_CLOCK_OFFSET_MS");
    std::string oldOffset = offset != nullptr ? offset : "";
    unsetenv("KELVO_CLOCK_OFFSET_MS");
    kelvo::WallClock::reloadOffset();

    int64_t wall = TimeProvider::getCurrentTime(kelvo::TIME_TYPE_WALL);
    EXPECT_LE(std::llabs(wall - nowMs(CLOCK_REALTIME)), 2000);
    int64_t mono = TimeProvider::getCurrentTime(kelvo::TIME_TYPE_MONOTONIC);
    EXPECT_LE(std::llabs(mono - nowMs(CLOCK_MONOTONIC)), 2000);
    EXPECT_GE(TimeProvider::getCurrentTime(kelvo::TIME_TYPE_MONOTONIC), mono);

    LogCapture log;
    EXPECT_EQ(-3, TimeProvider::getCurrentTime(2));
    EXPECT_EQ(-3, TimeProvider::getCurrentTime(-1));
    EXPECT_EQ(2u,
              log.count("[TimeProvider.cpp] getCurrentTime# Invalid time type", ANDROID_LOG_ERROR));

    if (offset != nullptr) {
        setenv("KELVO_CLOCK_OFFSET_MS", oldOffset.c_str(), 1);
        kelvo::WallClock::reloadOffset();
    }
}

TEST(TimeProviderTest, DurationsPrintDaysHoursMinutesSecondsAndMilliseconds) {
    EXPECT_EQ("00-00:00:01.500", duration(TimeProvider(1500)));
    EXPECT_EQ("00-00:00:00.000", duration(TimeProvider(0)));
    EXPECT_EQ("01-02:03:04.005",
              duration(TimeProvider(kDayMs + 2 * kHourMs + 3 * kMinuteMs + 4 * 1000 + 5)));
    EXPECT_EQ("123-23:59:59.999", duration(TimeProvider(124 * kDayMs - 1)));
}

TEST(TimeProviderTest, MillisecondsAreRoundedAndNanosecondsNormalised) {
    // 999.6 ms rounds up into the next second.
    EXPECT_EQ("00-00:00:06.000", duration(TimeProvider(5, 999600000)));
    EXPECT_EQ("00-00:00:05.999", duration(TimeProvider(5, 999400000)));
    EXPECT_EQ("00-00:00:00.002", duration(TimeProvider(0, 1500000)));
    EXPECT_EQ("00-00:00:00.001", duration(TimeProvider(0, 1499999)));

    TimeProvider carried(1, 2500000000);
    EXPECT_EQ(3, carried.getSeconds());
    EXPECT_EQ(500000000, carried.getNanoseconds());
    EXPECT_EQ(3500, carried.getTimeMs());

    TimeProvider borrowed(5, -1);
    EXPECT_EQ(4, borrowed.getSeconds());
    EXPECT_EQ(999999999, borrowed.getNanoseconds());
    // The time in milliseconds is cut, not rounded.
    EXPECT_EQ(4999, borrowed.getTimeMs());
}

TEST(TimeProviderTest, NegativeMillisecondsFloorAndPrintWithASign) {
    TimeProvider provider(-1500);
    EXPECT_EQ(-2, provider.getSeconds());
    EXPECT_EQ(500000000, provider.getNanoseconds());
    EXPECT_EQ(-1500, provider.getTimeMs());
    EXPECT_EQ("-00-00:00:01.500", duration(provider));

    EXPECT_EQ("-00-00:00:01.000", duration(TimeProvider(-1000)));
    EXPECT_EQ("-00-00:00:00.001", duration(TimeProvider(-1)));
    EXPECT_EQ("-01-01:00:00.000", duration(TimeProvider(-kDayMs - kHourMs)));
    EXPECT_EQ("-02-03:04:05.678",
              duration(TimeProvider(-(2 * kDayMs + 3 * kHourMs + 4 * kMinuteMs + 5678))));
    // Less than half a millisecond below zero is zero.
    EXPECT_EQ("00-00:00:00.000", duration(TimeProvider(0, -1)));

    // Hours of negative times count back from the end of the day.
    EXPECT_EQ(23, TimeProvider::getHour(-1, false));
    EXPECT_EQ(22, TimeProvider::getHour(-kHourMs - 1, false));
}

TEST(TimeProviderTest, ExtremeValuesStayWithinTheBuffer) {
    const uint64_t maxSeconds = INT64_MAX;

    TimeProvider largest(INT64_MAX, 999999999);
    std::string text = largest.toString(kelvo::TIME_FORMAT_DURATION, false);
    // Rounding up cannot go past the last second.
    EXPECT_EQ(daysToSeconds(maxSeconds) + ".999", text);

    // The most negative second count is one more than the largest.
    TimeProvider smallest(INT64_MIN, 0);
    text = smallest.toString(kelvo::TIME_FORMAT_DURATION, false);
    EXPECT_EQ("-" + daysToSeconds(maxSeconds + 1) + ".000", text);
    EXPECT_LT(text.size(), 32u);

    // Nanoseconds beyond the largest second saturate instead of wrapping.
    TimeProvider saturated(INT64_MAX, 3000000000);
    EXPECT_EQ(INT64_MAX, saturated.getSeconds());
    EXPECT_EQ(999999999, saturated.getNanoseconds());

    // Millisecond extremes come back unchanged.
    EXPECT_EQ(INT64_MAX, TimeProvider(INT64_MAX).getTimeMs());
    EXPECT_EQ(INT64_MIN, TimeProvider(INT64_MIN).getTimeMs());
    text = TimeProvider(INT64_MIN).toString(kelvo::TIME_FORMAT_DURATION, false);
    EXPECT_EQ('-', text[0]);
    EXPECT_LT(text.size(), 32u);

    // No calendar date that far: an empty text, not garbage.
    EXPECT_LT(strlen(largest.toString(kelvo::TIME_FORMAT_DATE, false)), 32u);
    EXPECT_LT(strlen(smallest.toString(kelvo::TIME_FORMAT_DATE, true)), 32u);
}

TEST_F(TimeProviderZoneTest, DatesInUtcAndInTheLocalZone) {
    useZone("CST-8");
    TimeProvider east(kInstant * 1000);
    EXPECT_EQ(28800, east.getLocalOffset());
    EXPECT_EQ("2023-11-14 22:13:20", std::string(east.toString(kelvo::TIME_FORMAT_DATE, false)));
    EXPECT_EQ("2023-11-15 06:13:20", std::string(east.toString(kelvo::TIME_FORMAT_DATE, true)));

    useZone("EST5");
    TimeProvider west(kInstant * 1000);
    EXPECT_EQ(-18000, west.getLocalOffset());
    EXPECT_EQ("2023-11-14 17:13:20", std::string(west.toString(kelvo::TIME_FORMAT_DATE, true)));
    EXPECT_EQ("1969-12-31 19:00:00",
              std::string(TimeProvider(0).toString(kelvo::TIME_FORMAT_DATE, true)));
    // The offset is the one of construction time.
    useZone("CST-8");
    EXPECT_EQ(-18000, west.getLocalOffset());
}

TEST_F(TimeProviderZoneTest, HoursAndStartsOfDayAndHourFollowTheOffset) {
    useZone("CST-8"); // local 2023-11-15 06:13:20
    TimeProvider east(kInstant, 0);
    EXPECT_EQ(22, east.getHour(false));
    EXPECT_EQ(6, east.getHour(true));
    EXPECT_EQ(6, TimeProvider::getHour(kInstant * 1000, true));
    EXPECT_EQ(kInstant - (6 * 3600 + 13 * 60 + 20), east.startOfDay());
    EXPECT_EQ(kInstant - (13 * 60 + 20), east.startOfHour());

    useZone("EST5"); // local 2023-11-14 17:13:20
    TimeProvider west(kInstant, 0);
    EXPECT_EQ(17, west.getHour(true));
    EXPECT_EQ(kInstant - (17 * 3600 + 13 * 60 + 20), west.startOfDay());
    // Just before local midnight still belongs to the old day.
    TimeProvider lateWest(west.startOfDay() - 1, 0);
    EXPECT_EQ(23, lateWest.getHour(true));
    EXPECT_EQ(west.startOfDay() - 86400, lateWest.startOfDay());

    useZone("IST-5:30"); // local 2023-11-15 03:43:20: hours start at :30 UTC
    TimeProvider half(kInstant, 0);
    EXPECT_EQ(19800, half.getLocalOffset());
    EXPECT_EQ(3, half.getHour(true));
    EXPECT_EQ(kInstant - (43 * 60 + 20), half.startOfHour());
    EXPECT_EQ(kInstant - (3 * 3600 + 43 * 60 + 20), half.startOfDay());

    useZone("NST3:30"); // local 2023-11-14 18:43:20
    TimeProvider newfoundland(kInstant, 0);
    EXPECT_EQ(-12600, newfoundland.getLocalOffset());
    EXPECT_EQ(18, newfoundland.getHour(true));
    EXPECT_EQ(kInstant - (18 * 3600 + 43 * 60 + 20), newfoundland.startOfDay());
}

TEST_F(TimeProviderZoneTest, OffsetsBeyondTwelveHoursKeepTheirSign) {
    useZone("<+14>-14"); // local 2023-11-15 12:13:20
    TimeProvider kiritimati(kInstant, 0);
    EXPECT_EQ(14 * 3600, kiritimati.getLocalOffset());
    EXPECT_EQ(12, kiritimati.getHour(true));
    EXPECT_EQ(kInstant - (12 * 3600 + 13 * 60 + 20), kiritimati.startOfDay());

    useZone("<+13>-13");
    EXPECT_EQ(13 * 3600, TimeProvider(kInstant, 0).getLocalOffset());

    useZone("<-12>12"); // local 2023-11-14 10:13:20
    TimeProvider baker(kInstant, 0);
    EXPECT_EQ(-12 * 3600, baker.getLocalOffset());
    EXPECT_EQ(10, baker.getHour(true));
    EXPECT_EQ("2023-11-14 10:13:20", std::string(baker.toString(kelvo::TIME_FORMAT_DATE, true)));
}

} // namespace
