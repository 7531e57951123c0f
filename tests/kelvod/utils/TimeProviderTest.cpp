#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

#include <cstring>
#include <string>

#include "utils/TimeProvider.h"

using kelvo::TimeProvider;

namespace {

constexpr int64_t kDayMs = 86400000;
constexpr int64_t kHourMs = 3600000;
constexpr int64_t kMinuteMs = 60000;

// 2023-11-14 22:13:20 UTC.
constexpr int64_t kInstant = 1700000000;

std::string duration(TimeProvider provider) {
    return provider.toString(kelvo::TIME_FORMAT_DURATION, false);
}

// Switches the process time zone for one test, back to none after it.
class TimeProviderZoneTest : public ::testing::Test {
protected:
    void TearDown() override {
        unsetenv("TZ");
        tzset();
    }
    static void useZone(const char* zone) {
        setenv("TZ", zone, 1);
        tzset();
    }
};

TEST(TimeProviderTest, DurationsRoundMillisecondsAndFloorNegativeTimes) {
    struct Case {
        TimeProvider time;
        const char* text;
    } cases[] = {
            {TimeProvider(1500), "00-00:00:01.500"},
            {TimeProvider(kDayMs + 2 * kHourMs + 3 * kMinuteMs + 4 * 1000 + 5), "01-02:03:04.005"},
            {TimeProvider(124 * kDayMs - 1), "123-23:59:59.999"},
            // 999.6 ms rounds up into the next second.
            {TimeProvider(5, 999600000), "00-00:00:06.000"},
            {TimeProvider(0, 1499999), "00-00:00:00.001"},
            {TimeProvider(-1), "-00-00:00:00.001"},
            {TimeProvider(-(2 * kDayMs + 3 * kHourMs + 4 * kMinuteMs + 5678)), "-02-03:04:05.678"},
            // Less than half a millisecond below zero is zero.
            {TimeProvider(0, -1), "00-00:00:00.000"},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(c.text, duration(c.time));
    }

    // The time in milliseconds is cut, not rounded.
    EXPECT_EQ(4999, TimeProvider(5, -1).getTimeMs());
    EXPECT_EQ(3500, TimeProvider(1, 2500000000).getTimeMs());
    EXPECT_EQ(-1500, TimeProvider(-1500).getTimeMs());
    // Hours of negative times count back from the end of the day.
    EXPECT_EQ(22, TimeProvider::getHour(-kHourMs - 1, false));

    // The extremes stay within the text buffer.
    EXPECT_LT(duration(TimeProvider(INT64_MIN, 0)).size(), 32u);
    EXPECT_LT(strlen(TimeProvider(INT64_MAX, 999999999).toString(kelvo::TIME_FORMAT_DATE, false)),
              32u);
}

TEST_F(TimeProviderZoneTest, HoursAndStartsOfDayAndHourFollowTheOffset) {
    struct Case {
        const char* zone;
        int32_t offset;
        int32_t hour;    // local hour of kInstant
        int32_t minutes; // local minutes past that hour
        const char* date;
    } cases[] = {
            {"CST-8", 28800, 6, 13, "2023-11-15 06:13:20"},
            {"EST5", -18000, 17, 13, "2023-11-14 17:13:20"},
            {"IST-5:30", 19800, 3, 43, "2023-11-15 03:43:20"},
            {"NST3:30", -12600, 18, 43, "2023-11-14 18:43:20"},
            {"<+14>-14", 50400, 12, 13, "2023-11-15 12:13:20"},
            {"<-12>12", -43200, 10, 13, "2023-11-14 10:13:20"},
    };
    for (const Case& c : cases) {
        useZone(c.zone);
        TimeProvider t(kInstant, 0);
        EXPECT_EQ(c.offset, t.getLocalOffset()) << c.zone;
        EXPECT_STREQ(c.date, t.toString(kelvo::TIME_FORMAT_DATE, true));
        EXPECT_STREQ("2023-11-14 22:13:20", t.toString(kelvo::TIME_FORMAT_DATE, false));
        EXPECT_EQ(c.hour, t.getHour(true)) << c.zone;
        EXPECT_EQ(c.hour, TimeProvider::getHour(kInstant * 1000, true)) << c.zone;
        EXPECT_EQ(kInstant - (c.minutes * 60 + 20), t.startOfHour()) << c.zone;
        EXPECT_EQ(kInstant - (c.hour * 3600 + c.minutes * 60 + 20), t.startOfDay()) << c.zone;
        // Just before local midnight still belongs to the old day.
        TimeProvider late(t.startOfDay() - 1, 0);
        EXPECT_EQ(23, late.getHour(true)) << c.zone;
        EXPECT_EQ(t.startOfDay() - 86400, late.startOfDay()) << c.zone;
    }
    // The offset is the one of construction time.
    TimeProvider west(kInstant * 1000);
    useZone("CST-8");
    EXPECT_EQ(-43200, west.getLocalOffset());
}

} // namespace
