#include <chrono>
#include <thread>

#include "HealthCounters.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/StorageOperator.h"
#include "utils/KelvoUtils.h"

using android::Parcel;
using android::String8;
using namespace kelvo;
using namespace kelvo::test;

namespace {

const column_attribute kForegroundColumns[] = {
        {kelvo::COLUMN_TIME, "timestamp"},
        {kelvo::COLUMN_TEXT, "name"},
};
const table_attribute kForeground = {"1.0", 1, 2, kForegroundColumns, "raw_foreground"};

const column_attribute kHourlyColumns[] = {
        {kelvo::COLUMN_TIME, "timestamp"},
        {kelvo::COLUMN_TEXT, "name"},
        {kelvo::COLUMN_INT, "count"},
        {kelvo::COLUMN_LONG, "energy"},
};
const table_attribute kHourly = {"1.0", 1, 4, kHourlyColumns, "hourly_test"};

class StorageOperatorTest : public AgentStorageTest {
protected:
    void addTables() override {
        StorageOperator::addSchema(kForeground);
        StorageOperator::addSchema(kHourly);
        StorageOperator::addSchema(kAbout);
        HealthCounters::resetForTest();
    }
    DirectDb db() const { return DirectDb(dbPath()); }
};

void foregroundRow(Parcel* rows, int64_t time, const char* name) {
    rows->writeInt64(time);
    rows->writeString8(String8(name));
}

// Buffers raw_foreground rows, then writes them when asked to.
void insertForeground(std::initializer_list<std::pair<int64_t, const char*>> rows, bool flush) {
    Parcel p;
    for (const auto& row : rows) {
        foregroundRow(&p, row.first, row.second);
    }
    StorageOperator::insertEntries(kForeground, p, static_cast<int32_t>(rows.size()), false);
    if (flush) {
        StorageOperator::forceFlushEntries();
    }
}

// One about_kelvo_daemon row, replacing the row of its key.
int32_t updateAbout(int64_t time, const char* key, const char* value) {
    Parcel row;
    row.writeInt64(time);
    row.writeString8(String8(key));
    row.writeString8(String8(value));
    String8 condition = String8("key = ") + kelvo::KelvoUtils::quoteSqlText(key);
    return StorageOperator::updateEntries(kAbout, row, condition.string());
}

} // namespace

TEST_F(StorageOperatorTest, InsertsBatchesWithinTheLimit) {
    Parcel empty;
    EXPECT_EQ(0, StorageOperator::insertEntries(kForeground, empty, 3, false));
    Parcel one;
    foregroundRow(&one, 1000, "com.example.a");
    EXPECT_EQ(0, StorageOperator::insertEntries(kForeground, one, 0, false));

    Parcel many;
    for (int i = 0; i < 5000; ++i) foregroundRow(&many, 1000 + i, "com.example.many");
    EXPECT_EQ(0, StorageOperator::insertEntries(kForeground, many, 5000, false));
    LogCapture log;
    foregroundRow(&many, 99999, "com.example.many");
    EXPECT_EQ(-5, StorageOperator::insertEntries(kForeground, many, 5001, false));
    EXPECT_EQ(1u, HealthCounters::get(Health::StorageEntryRefused));
    EXPECT_TRUE(log.contains("Insert entries count(5001) reach limit(5000), table: raw_foreground",
                             ANDROID_LOG_ERROR));

    // From the current position: a prefix the caller has read is skipped.
    Parcel prefixed;
    prefixed.writeInt32(42);
    foregroundRow(&prefixed, 7, "com.example.after");
    prefixed.setDataPosition(0);
    prefixed.readInt32();
    EXPECT_EQ(0, StorageOperator::insertEntries(kForeground, prefixed, 1, true));

    EXPECT_EQ((std::vector<std::string>{"com.example.after|1", "com.example.many|5000"}),
              rows("SELECT name, COUNT(*) FROM raw_foreground GROUP BY name ORDER BY name"));
    EXPECT_EQ(std::vector<std::string>{"7"},
              rows("SELECT timestamp FROM raw_foreground WHERE name = 'com.example.after'"));
}

TEST_F(StorageOperatorTest, DeletesAndCleansOnlyWhatIsOnDisk) {
    insertForeground({{100, "old"}}, true);
    insertForeground({{200, "buffered"}}, false);
    // The buffered old row survives a clean queued right after it.
    EXPECT_EQ(0, StorageOperator::cleanObsoleteEntries("raw_foreground", 500, "timestamp"));
    EXPECT_EQ(std::vector<std::string>{"buffered"}, rows("SELECT name FROM raw_foreground"));

    // A delete flushes first, so buffered rows are subject to it.
    insertForeground({{300, "more"}}, false);
    EXPECT_EQ(0, StorageOperator::deleteEntries("raw_foreground", "timestamp >= 300"));
    EXPECT_EQ(std::vector<std::string>{"buffered"}, db().column("SELECT name FROM raw_foreground"));

    EXPECT_EQ(0, StorageOperator::cleanAllEntries("raw_foreground"));
    EXPECT_EQ(std::vector<std::string>{"0"}, rows("SELECT COUNT(*) FROM raw_foreground"));
}

// Query results come back in their shape and are copied into hourly tables.
TEST_F(StorageOperatorTest, QueriesCheckTheirShapeAndFillHourlyTables) {
    insertForeground({{1000, "a"}, {2000, "a"}, {3000, "b"}}, true);
    Parcel reply;
    int32_t count = -1;
    ASSERT_EQ(0, StorageOperator::queryEntriesSimple(
                         String8("SELECT timestamp, name FROM raw_foreground ORDER BY timestamp"),
                         &reply, 2, count));
    ASSERT_EQ(3, count);
    EXPECT_EQ(1000, reply.readInt64());
    EXPECT_STREQ("a", reply.readString8().string());
    EXPECT_EQ(2000, reply.readInt64());

    Parcel sums;
    ASSERT_EQ(0, StorageOperator::queryEntriesSimple(
                         String8("SELECT name, COUNT(*), SUM(timestamp) FROM raw_foreground "
                                 "GROUP BY name ORDER BY name"),
                         &sums, 3, count));
    EXPECT_EQ(0, StorageOperator::logSimpleQueryResult(kHourly, sums, 3600000));
    EXPECT_EQ((std::vector<std::string>{"3600000 a 2 3000", "3600000 b 1 3000"}),
              rows("SELECT timestamp || ' ' || name || ' ' || count || ' ' || energy FROM "
                   "hourly_test ORDER BY name"));

    LogCapture log;
    Parcel mismatch;
    EXPECT_EQ(-16, StorageOperator::queryEntriesSimple(
                           String8("SELECT id, timestamp, name FROM raw_foreground"), &mismatch, 2,
                           count));
    EXPECT_TRUE(log.contains("Mismatch columns: 3, 2", ANDROID_LOG_ERROR));
    EXPECT_EQ(-5, StorageOperator::queryEntriesSimple(String8(""), &mismatch, 2, count));
    EXPECT_EQ(-5, StorageOperator::queryEntriesSimple(String8("SELECT 1"), nullptr, 1, count));
    EXPECT_EQ(-5, StorageOperator::queryEntriesSimple(String8("SELECT 1"), &mismatch, 0, count));
    EXPECT_EQ(-5, StorageOperator::deleteEntries(nullptr, "1"));
    EXPECT_EQ(-5, StorageOperator::cleanObsoleteEntries("raw_foreground", 1, nullptr));
    EXPECT_EQ(-5, StorageOperator::cleanAllEntries(nullptr));
    EXPECT_EQ(6u, HealthCounters::get(Health::StorageEntryRefused));

    // A result of the wrong shape inserts nothing.
    Parcel wrong;
    ASSERT_EQ(0, StorageOperator::queryEntriesSimple(String8("SELECT name FROM raw_foreground"),
                                                     &wrong, 1, count));
    EXPECT_EQ(0, StorageOperator::logSimpleQueryResult(kHourly, wrong, 7200000));
    EXPECT_TRUE(log.contains("Table column count not match", ANDROID_LOG_ERROR));
    // A reply that announces more rows than it holds stores nothing.
    Parcel truncated;
    truncated.writeInt32(3);
    truncated.writeInt32(2);
    truncated.writeString8(String8("x"));
    truncated.writeInt64(1);
    truncated.writeInt64(2);
    EXPECT_EQ(-9, StorageOperator::logSimpleQueryResult(kHourly, truncated, 7200000));
    EXPECT_EQ(std::vector<std::string>{"2"}, rows("SELECT COUNT(*) FROM hourly_test"));
}

// An update replaces the row of its key, even when its delete timed out.
TEST_F(StorageOperatorTest, UpdateReplacesTheRowOfItsKeyAndQuotesValues) {
    for (const char* value : {"A", "B", "it's C"}) {
        EXPECT_EQ(0, updateAbout(1000, "software_version", value));
    }
    // A key whose value carries a quote is still matched exactly.
    EXPECT_EQ(0, updateAbout(1000, "o'key", "v1"));
    EXPECT_EQ(0, updateAbout(1000, "o'key", "v1"));
    ASSERT_EQ(0, updateAbout(1000, "xml_version", "old"));
    StorageOperator::forceFlushEntries();

    // Another connection holds the database while the update runs, so the
    // storage thread cannot answer before the (shortened) time-out.
    kelvo::HandlerThread::setSyncTimeoutMs(200);
    std::unique_ptr<DirectDb> other(new DirectDb(dbPath()));
    ASSERT_EQ(SQLITE_OK, other->exec("BEGIN EXCLUSIVE"));
    std::thread release([&] {
        std::this_thread::sleep_for(std::chrono::milliseconds(600));
        other->exec("COMMIT");
    });
    EXPECT_EQ(0, updateAbout(2000, "xml_version", "new"));
    release.join();
    kelvo::HandlerThread::setSyncTimeoutMs(0);

    // The queued delete ran before the queued row: exactly the new value.
    EXPECT_EQ(0, StorageOperator::forceFlushEntries());
    EXPECT_EQ((std::vector<std::string>{"o'key|v1", "software_version|it's C", "xml_version|new"}),
              db().column("SELECT key, value FROM about_kelvo_daemon ORDER BY key"));
}
