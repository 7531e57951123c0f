#include <gtest/gtest.h>

#include <atomic>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "ErrorLogger.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "SqlTypes.h"
#include "common/TestEnv.h"

using kelvo::test::LogCapture;

namespace {

std::atomic<int> gStoredErrors{0};

void countingSink(const android::Parcel&) {
    gStoredErrors++;
}

} // namespace

TEST(KelvoLibEntryTest, UnknownActionsAndMissingParcelsAreRefused) {
    gStoredErrors = 0;
    kelvo::ErrorLogger::setSink(countingSink);
    kelvo::HealthCounters::resetForTest();
    LogCapture log;
    EXPECT_EQ(-1, kelvo::doSqliteOperation(10, nullptr, nullptr));
    EXPECT_EQ(-1, kelvo::doSqliteOperation(-1, nullptr, nullptr));
    EXPECT_EQ(1u, log.count("[KelvoLibAgent.cpp] doSqliteOperation# Unknown action: 10",
                            ANDROID_LOG_ERROR));
    EXPECT_TRUE(log.contains("Unknown action: -1", ANDROID_LOG_ERROR));

    for (int32_t action :
         {kelvo::SQL_OPEN_CONNECTION, kelvo::SQL_CREATE_TABLE, kelvo::SQL_INSERT_ENTRIES,
          kelvo::SQL_EXECUTE_ENTRY, kelvo::SQL_SIMPLE_QUERY, kelvo::SQL_BACKUP_COPY}) {
        EXPECT_EQ(-1, kelvo::doSqliteOperation(action, nullptr, nullptr)) << action;
    }
    android::Parcel query;
    query.writeString8(android::String8("SELECT 1"));
    query.setDataPosition(0);
    EXPECT_EQ(-1, kelvo::doSqliteOperation(kelvo::SQL_SIMPLE_QUERY, &query, nullptr));
    EXPECT_EQ(7u, log.count("Invalid parameter", ANDROID_LOG_ERROR));
    EXPECT_EQ(9u, kelvo::HealthCounters::get(kelvo::Health::LibraryParcelRefused));
    // Library errors stay out of the daemon's error table.
    EXPECT_EQ(0, gStoredErrors.load());
    kelvo::ErrorLogger::setSink(nullptr);
}
