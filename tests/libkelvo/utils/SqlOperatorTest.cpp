#include <gtest/gtest.h>
#include <sqlite3.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "ErrorLogger.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "SqlTypes.h"
#include "common/TestEnv.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "utils/SqlOperator.h"

using android::Parcel;
using android::String8;
using kelvo::test::LogCapture;
using Rows = std::vector<std::string>;

namespace {

using Columns = std::vector<std::pair<const char*, int32_t>>;

// Hands the parcel over rewound, as the storage thread does.
int32_t run(int32_t action, Parcel* in = nullptr, Parcel* out = nullptr) {
    if (in != nullptr) {
        in->setDataPosition(0);
    }
    return kelvo::doSqliteOperation(action, in, out);
}

int32_t runPath(int32_t action, const std::string& path) {
    Parcel in;
    in.writeCString(path.c_str());
    return run(action, &in);
}

int32_t runSql(int32_t action, const char* sql, Parcel* out = nullptr) {
    Parcel in;
    in.writeString8(String8(sql));
    return run(action, &in, out);
}

// Table name and columns: the head of create and insert parcels.
void writeHead(Parcel& p, const char* table, const Columns& columns) {
    p.writeString8(String8(table));
    p.writeInt32(static_cast<int32_t>(columns.size()));
    for (const auto& column : columns) {
        p.writeString8(String8(column.first));
        p.writeInt32(column.second);
    }
}

int32_t createTable(const char* table, const Columns& columns) {
    Parcel in;
    writeHead(in, table, columns);
    return run(kelvo::SQL_CREATE_TABLE, &in);
}

class SqlOperatorTest : public ::testing::Test {
protected:
    void SetUp() override {
        mPath = mRoot.path() + "/kelvo.db";
        kelvo::SqlOperator::setBusyTimeoutMs(kBusyMs);
        kelvo::HealthCounters::resetForTest();
        ASSERT_EQ(0, runPath(kelvo::SQL_OPEN_CONNECTION, mPath));
    }
    void TearDown() override {
        EXPECT_EQ(0, run(kelvo::SQL_CLOSE_CONNECTION));
        kelvo::SqlOperator::setBusyTimeoutMs(0);
    }
    static constexpr int kBusyMs = 400;
    Rows query(const std::string& sql) { return kelvo::test::DirectDb(mPath).column(sql); }

    kelvo::test::TempRoot mRoot;
    std::string mPath;
};

} // namespace

// The entry refuses unknown actions and missing parcels; library errors stay
// out of the daemon's error table.
TEST_F(SqlOperatorTest, UnknownActionsAndMissingParcelsAreRefused) {
    static std::atomic<int> stored{0};
    stored = 0;
    kelvo::ErrorLogger::setSink([](const Parcel&) { stored++; });
    LogCapture log;
    EXPECT_EQ(-1, run(10));
    EXPECT_EQ(-1, run(-1));
    EXPECT_EQ(1u, log.count("[KelvoLibAgent.cpp] doSqliteOperation# Unknown action: 10",
                            ANDROID_LOG_ERROR));
    EXPECT_TRUE(log.contains("Unknown action: -1", ANDROID_LOG_ERROR));
    for (int32_t action :
         {kelvo::SQL_OPEN_CONNECTION, kelvo::SQL_CREATE_TABLE, kelvo::SQL_INSERT_ENTRIES,
          kelvo::SQL_EXECUTE_ENTRY, kelvo::SQL_SIMPLE_QUERY, kelvo::SQL_BACKUP_COPY}) {
        EXPECT_EQ(-1, run(action)) << action;
    }
    Parcel query;
    query.writeString8(String8("SELECT 1"));
    EXPECT_EQ(-1, run(kelvo::SQL_SIMPLE_QUERY, &query));
    EXPECT_EQ(7u, log.count("Invalid parameter", ANDROID_LOG_ERROR));
    EXPECT_EQ(9u, kelvo::HealthCounters::get(kelvo::Health::LibraryParcelRefused));
    EXPECT_EQ(0, stored.load());
    kelvo::ErrorLogger::setSink(nullptr);
}

// Tables are created as defined; text that holds a second statement is refused.
TEST_F(SqlOperatorTest, CreateTableWritesTheExactDefinition) {
    ASSERT_EQ(0, createTable("raw_screen_state", {{"id", kelvo::COLUMN_ID},
                                                  {"timestamp", kelvo::COLUMN_TIME},
                                                  {"state", kelvo::COLUMN_INT}}));
    ASSERT_EQ(0,
              createTable("apps", {{"name", kelvo::COLUMN_TEXT}, {"bytes", kelvo::COLUMN_LONG}}));
    EXPECT_EQ((Rows{"CREATE TABLE apps(name VARCHAR, bytes INTEGER)",
                    "CREATE TABLE raw_screen_state(id INTEGER PRIMARY KEY, timestamp INTEGER, "
                    "formatted_timestamp VARCHAR, state INTEGER)"}),
              query("SELECT sql FROM sqlite_master ORDER BY name"));

    LogCapture log;
    EXPECT_EQ(-1, createTable("bad_type", {{"a", kelvo::COLUMN_INT}, {"b", 7}}));
    EXPECT_TRUE(log.contains("Unknown value type: 7", ANDROID_LOG_ERROR));
    EXPECT_TRUE(log.contains("Failed to translate create statement", ANDROID_LOG_ERROR));
    EXPECT_EQ(-1, createTable("no_columns", {}));
    EXPECT_TRUE(log.contains("Prepare statement error: ", ANDROID_LOG_ERROR));
    for (int32_t columns : {-1, 3, 1 << 30}) { // counts the parcel does not hold
        Parcel in;
        in.writeString8(String8("bad_count"));
        in.writeInt32(columns);
        in.writeString8(String8("a"));
        in.writeInt32(kelvo::COLUMN_INT);
        EXPECT_EQ(-1, run(kelvo::SQL_CREATE_TABLE, &in)) << columns;
    }
    EXPECT_EQ(Rows{"2"}, query("SELECT count(*) FROM sqlite_master"));

    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "CREATE TABLE x(v INTEGER)"));
    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "INSERT INTO x (v) VALUES (1), (2), (3);"));
    log.clear();
    kelvo::HealthCounters::resetForTest();
    EXPECT_EQ(-1, runSql(kelvo::SQL_EXECUTE_ENTRY, "SELECT 1; DROP TABLE x"));
    Parcel reply;
    EXPECT_EQ(-1, runSql(kelvo::SQL_SIMPLE_QUERY, "SELECT v FROM x; DROP TABLE x;", &reply));
    EXPECT_EQ(0u, reply.dataSize());
    EXPECT_EQ(-1, createTable("y(a INTEGER); DROP TABLE x; --", {{"b", kelvo::COLUMN_INT}}));
    EXPECT_EQ(3u, log.count("Statement may have injection issue", ANDROID_LOG_ERROR));
    EXPECT_EQ(3u, kelvo::HealthCounters::get(kelvo::Health::LibraryParcelRefused));
    EXPECT_EQ(-1, runSql(kelvo::SQL_EXECUTE_ENTRY, ""));
    EXPECT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "DELETE FROM x WHERE v = 1;"));
    EXPECT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "DELETE FROM x WHERE v = 2"));
    EXPECT_EQ(Rows{"3"}, query("SELECT v FROM x"));
}

// Time columns also get the local second as text.
TEST_F(SqlOperatorTest, InsertBindsEveryColumnKindInOrder) {
    const char* saved = getenv("TZ");
    const std::string savedZone = saved != nullptr ? saved : "";
    setenv("TZ", "JST-9", 1); // UTC + 9 h all year
    tzset();
    ASSERT_EQ(0, createTable("t", {{"id", kelvo::COLUMN_ID}, {"ts", kelvo::COLUMN_TIME},
                                   {"name", kelvo::COLUMN_TEXT}, {"x", kelvo::COLUMN_INT},
                                   {"level", kelvo::COLUMN_INT}, {"bytes", kelvo::COLUMN_LONG}}));
    LogCapture log;
    Parcel in;
    // Kind 9 is unknown: nothing is read for it and it stays NULL.
    writeHead(in, "t", {{"ts", kelvo::COLUMN_TIME}, {"name", kelvo::COLUMN_TEXT}, {"x", 9},
                        {"level", kelvo::COLUMN_INT}, {"bytes", kelvo::COLUMN_LONG}});
    const std::vector<int64_t> times = {1500, -1500, 999, INT64_MAX};
    in.writeInt32(static_cast<int32_t>(times.size()));
    const int64_t bytes = (1LL << 40) + 3;
    for (int32_t i = 0; i < 4; ++i) {
        in.writeInt64(times[i]);
        in.writeString8(String8(i == 0 ? "first" : "next"));
        in.writeInt32(-5 - i);
        in.writeInt64(bytes + i);
    }
    EXPECT_EQ(SQLITE_DONE, run(kelvo::SQL_INSERT_ENTRIES, &in));
    Rows rows = query("SELECT id, ts, formatted_ts, name, x, level, bytes FROM t ORDER BY id");
    saved != nullptr ? setenv("TZ", savedZone.c_str(), 1) : unsetenv("TZ");
    tzset();

    EXPECT_EQ(4u, log.count("Unknown data type: 9", ANDROID_LOG_ERROR));
    // Seconds are taken toward zero; a year too long for the text gives "".
    EXPECT_EQ((Rows{"1|1500|1970-01-01 09:00:01|first||-5|" + std::to_string(bytes),
                    "2|-1500|1970-01-01 08:59:59|next||-6|" + std::to_string(bytes + 1),
                    "3|999|1970-01-01 09:00:00|next||-7|" + std::to_string(bytes + 2),
                    "4|" + std::to_string(INT64_MAX) + "||next||-8|" + std::to_string(bytes + 3)}),
              rows);
}

TEST_F(SqlOperatorTest, InsertTakesWholeParcelsUpToTheRowLimit) {
    ASSERT_EQ(0, createTable("t", {{"v", kelvo::COLUMN_INT}, {"name", kelvo::COLUMN_TEXT}}));
    // rows declared, rows written; a negative written count ends the last row
    // after its first value.
    auto insert = [](int32_t declared, int32_t written) {
        Parcel in;
        writeHead(in, "t", {{"v", kelvo::COLUMN_INT}, {"name", kelvo::COLUMN_TEXT}});
        in.writeInt32(declared);
        for (int32_t i = 0; i < std::abs(written); ++i) {
            in.writeInt32(i);
            if (written > 0 || i + 1 < -written) {
                in.writeString8(String8("row"));
            }
        }
        return run(kelvo::SQL_INSERT_ENTRIES, &in);
    };
    EXPECT_EQ(0, insert(0, 0));
    EXPECT_EQ(0, insert(-3, 0));
    EXPECT_EQ(SQLITE_DONE, insert(1, 1));
    EXPECT_EQ(SQLITE_DONE, insert(kelvo::kMaxInsertRows, kelvo::kMaxInsertRows));
    const Rows stored{std::to_string(1 + kelvo::kMaxInsertRows)};
    EXPECT_EQ(stored, query("SELECT count(*) FROM t"));

    LogCapture log;
    EXPECT_EQ(-1, insert(kelvo::kMaxInsertRows + 1, kelvo::kMaxInsertRows + 1));
    EXPECT_TRUE(log.contains("Insert entries count(5001) reach limit(5000), statement: "
                             "INSERT INTO t (v, name) VALUES (?, ?);",
                             ANDROID_LOG_ERROR));
    EXPECT_EQ(-1, insert(3, -3));
    EXPECT_EQ(-1, insert(1, 0));
    EXPECT_EQ(2u, log.count("Failed to bind entry values", ANDROID_LOG_ERROR));
    EXPECT_EQ(stored, query("SELECT count(*) FROM t"));

    // Inside the caller's transaction a refused parcel leaves the rest.
    ASSERT_EQ(0, run(kelvo::SQL_BEGIN_TRANSACTION));
    EXPECT_EQ(SQLITE_DONE, insert(2, 2));
    EXPECT_EQ(-1, insert(2, -2));
    ASSERT_EQ(0, run(kelvo::SQL_COMMIT_TRANSACTION));
    EXPECT_EQ(Rows{std::to_string(3 + kelvo::kMaxInsertRows)}, query("SELECT count(*) FROM t"));
}

TEST_F(SqlOperatorTest, QueryReplyHasOneValuePerColumn) {
    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY,
                        "CREATE TABLE q(i INTEGER, s VARCHAR, r REAL, b BLOB, tail INTEGER)"));
    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY,
                        "INSERT INTO q VALUES (NULL, NULL, 2.75, x'0102', 41), "
                        "(-5, 'five', -2.75, x'', 42), "
                        "(-9223372036854775808, '', 1e300, x'03', 43)"));
    Parcel reply;
    ASSERT_EQ(0, runSql(kelvo::SQL_SIMPLE_QUERY, "SELECT i, s, r, b, tail FROM q ORDER BY tail",
                        &reply));
    EXPECT_EQ(reply.dataSize(), reply.dataPosition());
    reply.setDataPosition(0);
    ASSERT_EQ(5, reply.readInt32());
    ASSERT_EQ(3, reply.readInt32());
    const int64_t ints[] = {0, -5, INT64_MIN};
    const char* texts[] = {"", "five", ""};
    const int64_t reals[] = {2, -2, INT64_MAX};
    for (int row = 0; row < 3; ++row) {
        EXPECT_EQ(ints[row], reply.readInt64()) << row;
        EXPECT_STREQ(texts[row], reply.readString8().string()) << row;
        EXPECT_EQ(reals[row], reply.readInt64()) << row;
        EXPECT_EQ(0u, reply.readString8().size()) << row;
        EXPECT_EQ(41 + row, reply.readInt64()) << row;
    }
    EXPECT_EQ(0u, reply.dataAvail());

    // abs() fails on the third row: the rows so far stay, counted as none.
    LogCapture log;
    Parcel partial;
    EXPECT_EQ(-1, runSql(kelvo::SQL_SIMPLE_QUERY, "SELECT abs(i) FROM q ORDER BY rowid", &partial));
    EXPECT_TRUE(log.contains("Execute statement error: integer overflow", ANDROID_LOG_ERROR));
    partial.setDataPosition(0);
    EXPECT_EQ(1, partial.readInt32());
    EXPECT_EQ(0, partial.readInt32());
    EXPECT_EQ(0, partial.readInt64());
    EXPECT_EQ(5, partial.readInt64());
}

// A backup copy is whole or absent; the connection opens once and only on a
// file.
TEST_F(SqlOperatorTest, BackupCopyAndConnection) {
    LogCapture log;
    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "CREATE TABLE t(v INTEGER)"));
    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "INSERT INTO t (v) VALUES (4), (5)"));
    const std::string copy = mRoot.path() + "/copy.db";
    ASSERT_EQ(0, runPath(kelvo::SQL_BACKUP_COPY, copy));
    EXPECT_EQ((Rows{"4", "5"}), kelvo::test::DirectDb(copy).column("SELECT v FROM t ORDER BY v"));

    const std::string unreachable = mRoot.path() + "/missing/copy.db";
    EXPECT_EQ(-1, runPath(kelvo::SQL_BACKUP_COPY, unreachable));
    EXPECT_NE(0, access(unreachable.c_str(), F_OK));
    EXPECT_EQ(-1, runPath(kelvo::SQL_BACKUP_COPY, ""));
    EXPECT_TRUE(log.contains("Invalid backup copy file name", ANDROID_LOG_ERROR));

    // The source stays locked past the busy time-out: the new file goes.
    const std::string blocked = mRoot.path() + "/blocked.db";
    kelvo::test::DirectDb locker(mPath);
    ASSERT_EQ(SQLITE_OK, locker.exec("BEGIN EXCLUSIVE;"));
    EXPECT_EQ(-1, runPath(kelvo::SQL_BACKUP_COPY, blocked));
    EXPECT_TRUE(log.contains("Backup copy error: ", ANDROID_LOG_ERROR));
    EXPECT_NE(0, access(blocked.c_str(), F_OK));
    ASSERT_EQ(SQLITE_OK, locker.exec("COMMIT;"));

    // A file that was there before is not the copy's to remove.
    mRoot.writeFile("/foreign.db", "somebody's file\n");
    EXPECT_EQ(-1, runPath(kelvo::SQL_BACKUP_COPY, mRoot.path() + "/foreign.db"));
    EXPECT_EQ("somebody's file\n", mRoot.readFile("/foreign.db"));

    EXPECT_EQ(-1, runPath(kelvo::SQL_OPEN_CONNECTION, mRoot.path() + "/other.db"));
    EXPECT_TRUE(log.contains("Database connection already opened", ANDROID_LOG_ERROR));
    EXPECT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "CREATE TABLE still_open(v INTEGER)"));

    EXPECT_EQ(0, run(kelvo::SQL_CLOSE_CONNECTION));
    EXPECT_EQ(0, run(kelvo::SQL_CLOSE_CONNECTION));
    EXPECT_EQ(-1, runSql(kelvo::SQL_EXECUTE_ENTRY, "CREATE TABLE closed(v INTEGER)"));
    EXPECT_EQ(-1, run(kelvo::SQL_BEGIN_TRANSACTION));
    EXPECT_EQ(-1, runPath(kelvo::SQL_BACKUP_COPY, mRoot.path() + "/copy.db"));
    EXPECT_EQ(3u, log.count("Invalid database connection", ANDROID_LOG_ERROR));

    EXPECT_EQ(-1, runPath(kelvo::SQL_OPEN_CONNECTION, ""));
    EXPECT_TRUE(log.contains("Invalid file name", ANDROID_LOG_ERROR));
    const std::string missing = mRoot.path() + "/missing/kelvo.db";
    EXPECT_EQ(-1, runPath(kelvo::SQL_OPEN_CONNECTION, missing));
    EXPECT_TRUE(log.contains("Error: unable to open database file(" + missing + ")"));
    mRoot.writeFile("/garbage.db", std::string(8192, 'Z'));
    EXPECT_EQ(-1, runPath(kelvo::SQL_OPEN_CONNECTION, mRoot.path() + "/garbage.db"));
    EXPECT_TRUE(log.contains("Error: file is not a database(" + mRoot.path() + "/garbage.db)"));
    // A failed open leaves no connection behind.
    ASSERT_EQ(0, runPath(kelvo::SQL_OPEN_CONNECTION, mPath));
    EXPECT_EQ((Rows{"still_open", "t"}), query("SELECT name FROM sqlite_master ORDER BY name"));
    EXPECT_NE(0, access((mRoot.path() + "/other.db").c_str(), F_OK));
}

TEST_F(SqlOperatorTest, TransactionsRecoverFromABusyCommit) {
    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "CREATE TABLE t(v INTEGER)"));
    kelvo::test::DirectDb reader(mPath);
    LogCapture log;
    ASSERT_EQ(0, run(kelvo::SQL_BEGIN_TRANSACTION));
    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "INSERT INTO t (v) VALUES (1)"));
    // The reader's open transaction keeps the commit from writing.
    ASSERT_EQ(SQLITE_OK, reader.exec("BEGIN; SELECT count(*) FROM t;"));
    EXPECT_EQ(-1, run(kelvo::SQL_COMMIT_TRANSACTION));
    EXPECT_TRUE(log.contains("Failed to commit transcation", ANDROID_LOG_ERROR));
    ASSERT_EQ(SQLITE_OK, reader.exec("COMMIT;"));
    // The failed batch gave up its locks at once: others write again.
    EXPECT_EQ(SQLITE_OK, reader.exec("INSERT INTO t (v) VALUES (9)"));

    EXPECT_EQ(0, run(kelvo::SQL_BEGIN_TRANSACTION));
    EXPECT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "INSERT INTO t (v) VALUES (2)"));
    EXPECT_EQ(0, run(kelvo::SQL_COMMIT_TRANSACTION));

    // A transaction left open is rolled back by the next BEGIN.
    ASSERT_EQ(0, run(kelvo::SQL_BEGIN_TRANSACTION));
    ASSERT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "INSERT INTO t (v) VALUES (3)"));
    EXPECT_EQ(-1, run(kelvo::SQL_VACUUM_DATABASE));
    EXPECT_TRUE(log.contains("Failed to vacuum database", ANDROID_LOG_ERROR));
    EXPECT_EQ(0, run(kelvo::SQL_BEGIN_TRANSACTION));
    EXPECT_EQ(0, run(kelvo::SQL_COMMIT_TRANSACTION));
    EXPECT_EQ(0, run(kelvo::SQL_VACUUM_DATABASE));
    EXPECT_EQ((Rows{"2", "9"}), reader.column("SELECT v FROM t ORDER BY v"));

    // A short lock of another writer is waited out.
    ASSERT_EQ(SQLITE_OK, reader.exec("BEGIN IMMEDIATE; DELETE FROM t;"));
    std::thread release([&reader] {
        std::this_thread::sleep_for(std::chrono::milliseconds(kBusyMs / 8));
        reader.exec("COMMIT;");
    });
    EXPECT_EQ(0, runSql(kelvo::SQL_EXECUTE_ENTRY, "INSERT INTO t (v) VALUES (4)"));
    release.join();
    EXPECT_EQ(Rows{"4"}, query("SELECT v FROM t"));
}

TEST_F(SqlOperatorTest, AFullStatementCacheKeepsTheStatementInUse) {
    // Single-row inserts into distinct tables fill the cache exactly; then a
    // parcel of several rows needs its savepoint statement besides the
    // insert statement it holds. Going on past the cache empties it again.
    const size_t full = kelvo::SqlOperator::kMaxCachedStatements;
    auto insert = [](size_t table, int32_t rows) {
        Parcel in;
        writeHead(in, ("t" + std::to_string(table)).c_str(), {{"v", kelvo::COLUMN_INT}});
        in.writeInt32(rows);
        for (int32_t i = 0; i < rows; ++i) {
            in.writeInt32(i);
        }
        return run(kelvo::SQL_INSERT_ENTRIES, &in);
    };
    ASSERT_EQ(0, run(kelvo::SQL_BEGIN_TRANSACTION));
    for (size_t t = 0; t < full + 44; ++t) {
        ASSERT_EQ(0, createTable(("t" + std::to_string(t)).c_str(), {{"v", kelvo::COLUMN_INT}}));
        ASSERT_EQ(SQLITE_DONE, insert(t, 1)) << t;
        if (t + 1 == full) {
            ASSERT_EQ(SQLITE_DONE, insert(t, 3));
        }
    }
    for (size_t t = 0; t < full + 44; ++t) {
        ASSERT_EQ(SQLITE_DONE, insert(t, 2)) << t;
    }
    ASSERT_EQ(0, run(kelvo::SQL_COMMIT_TRANSACTION));
    EXPECT_EQ(Rows{"6"}, query("SELECT count(*) FROM t" + std::to_string(full - 1)));
    EXPECT_EQ(Rows{"3"}, query("SELECT count(*) FROM t" + std::to_string(full + 43)));
}
