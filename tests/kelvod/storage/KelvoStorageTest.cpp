#include <gtest/gtest.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "HealthCounters.h"
#include "common/TestEnv.h"
#include "kelvo/HostProperties.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/KelvoStorage.h"
#include "utils/SqlOperator.h"

using android::Parcel;
using android::sp;
using android::String8;
using namespace kelvo;
using namespace kelvo::test;

namespace {

const column_attribute kScreenColumns[] = {
        {kelvo::COLUMN_TIME, "timestamp"},
        {kelvo::COLUMN_INT, "state"},
};
const table_attribute kScreenState = {"1.0", 1, 2, kScreenColumns, "raw_screen_state"};
const table_attribute kScreenStateV11 = {"1.1", 1, 2, kScreenColumns, "raw_screen_state"};
const table_attribute kScreenStateV110 = {"1.10", 1, 2, kScreenColumns, "raw_screen_state"};

// The head of an insert parcel of one row: table name and columns.
void writeHead(Parcel* p, const table_attribute& table) {
    p->writeString8(String8(table.name));
    p->writeInt32(table.count);
    for (int32_t i = 0; i < table.count; ++i) {
        p->writeString8(String8(table.columns[i].name));
        p->writeInt32(table.columns[i].type);
    }
    p->writeInt32(1);
}

void insertScreenRow(KelvoStorage* storage, int64_t time, int32_t state) {
    Parcel p;
    writeHead(&p, kScreenState);
    p.writeInt64(time);
    p.writeInt32(state);
    ASSERT_GE(storage->insertEntries(p), 0);
}

void insertAbout(KelvoStorage* storage, const char* key, const char* value) {
    Parcel p;
    writeHead(&p, kAbout);
    p.writeInt64(1000);
    p.writeString8(String8(key));
    p.writeString8(String8(value));
    ASSERT_GE(storage->insertEntries(p), 0);
}

// Rows of raw_screen_state as the daemon's own connection sees them.
int64_t countThroughStorage(KelvoStorage* storage) {
    Parcel reply;
    if (storage->queryEntries(String8("SELECT COUNT(*) FROM raw_screen_state"), &reply) != 0) {
        return -1;
    }
    reply.readInt32();
    reply.readInt32();
    return reply.readInt64();
}

class KelvoStorageTest : public ::testing::Test {
protected:
    void SetUp() override {
        mRoot.reset(new TempRoot());
        // A lock held by another connection fails fast.
        kelvo::SqlOperator::setBusyTimeoutMs(100);
        HealthCounters::resetForTest();
    }
    void TearDown() override {
        stop();
        kelvo::SqlOperator::setBusyTimeoutMs(0);
        mRoot.reset();
    }

    // A storage thread with the given definitions, started on the root.
    sp<KelvoStorage> start(std::vector<const table_attribute*> tables, int32_t* result = nullptr) {
        stop();
        mStorage = new KelvoStorage(nullptr);
        for (const table_attribute* t : tables) {
            mStorage->addSchema(*t);
        }
        int32_t ret = mStorage->startConnection();
        if (result != nullptr) {
            *result = ret;
        } else {
            EXPECT_EQ(0, ret);
        }
        return mStorage;
    }

    void stop() {
        if (mStorage != nullptr) {
            mStorage->flushAllEntries();
            mStorage->closeConnection();
            mStorage->requestThreadExit();
            mStorage->join();
            mStorage.clear();
        }
    }

    std::string dbPath() const { return mRoot->path() + KelvoStorage::kDatabasePath; }

    std::vector<std::string> backupZips() const {
        std::string dir = mRoot->path() + "/data/log/kelvo/backup";
        return kelvo::test::listDir(dir, ".*\\.zip");
    }

    std::unique_ptr<TempRoot> mRoot;
    sp<KelvoStorage> mStorage;
};

} // namespace

TEST_F(KelvoStorageTest, InsertsStayBufferedUntilTheLimitOrAFlushThatCommits) {
    start({&kScreenState});
    for (int i = 0; i < 300; ++i) {
        insertScreenRow(mStorage.get(), 1000 + i, i % 2);
    }
    // Queries read the disk only: 300 buffered requests are not there yet.
    EXPECT_EQ(0, countThroughStorage(mStorage.get()));
    insertScreenRow(mStorage.get(), 5000, 1);
    EXPECT_EQ(301, countThroughStorage(mStorage.get()));

    insertScreenRow(mStorage.get(), 6000, 0);
    EXPECT_EQ(301, countThroughStorage(mStorage.get()));
    EXPECT_EQ(0, mStorage->flushAllEntries());
    EXPECT_EQ(302, countThroughStorage(mStorage.get()));

    EXPECT_EQ(1, DirectDb(dbPath()).scalar("SELECT COUNT(*) FROM raw_screen_state WHERE "
                                           "timestamp = 5000 AND state = 1"));

    // A failed commit does not poison later flushes.
    insertScreenRow(mStorage.get(), 7000, 1);
    {
        // Another connection reads inside a transaction through the whole
        // flush: the insert gets its write lock, the commit never does.
        DirectDb other(dbPath());
        ASSERT_EQ(SQLITE_OK, other.exec("BEGIN"));
        ASSERT_EQ(302, other.scalar("SELECT COUNT(*) FROM raw_screen_state"));
        EXPECT_EQ(-17, mStorage->flushAllEntries());
        other.exec("COMMIT");
    }
    EXPECT_EQ(1u, HealthCounters::get(Health::FlushRowsAbandoned));
    insertScreenRow(mStorage.get(), 8000, 0);
    EXPECT_EQ(0, mStorage->flushAllEntries());
    insertScreenRow(mStorage.get(), 9000, 0);
    EXPECT_EQ(0, mStorage->flushAllEntries());
    EXPECT_EQ(304, countThroughStorage(mStorage.get()));
}

TEST_F(KelvoStorageTest, KeepsAMatchingDatabaseAndRebuildsOnAnyDifference) {
    struct Step {
        const table_attribute* screen;
        const char* sql; // applied to the file before the start
        const char* build;
        bool kept;
    };
    const Step steps[] = {
        {&kScreenState, nullptr, "BUILD.A", true},
        // A rebuild drops tables, not indexes or SQLite's own tables.
        {&kScreenStateV11,
         "CREATE INDEX idx_state ON raw_screen_state(state); CREATE TABLE legacy(id INTEGER "
         "PRIMARY KEY AUTOINCREMENT, v TEXT); INSERT INTO legacy(v) VALUES ('x')",
         "BUILD.A", false},
        {&kScreenStateV110, nullptr, "BUILD.A", false}, // "1.1" is not "1.10"
        // One version row missing, though every present row matches.
        {&kScreenStateV110, "DELETE FROM schema_version WHERE module = 'about_kelvo_daemon'",
         "BUILD.A", false},
        // The right number of rows, each matching on its own, one module twice.
        {&kScreenStateV110,
         "UPDATE schema_version SET module = 'raw_screen_state', version = '1.10' WHERE module = "
         "'about_kelvo_daemon'",
         "BUILD.A", false},
        {&kScreenStateV110, nullptr, "BUILD.B", false},
    };
    kelvo::HostProperties::setForTest("ro.build.display.id", "BUILD.A");
    start({&kScreenState, &kAbout});
    LogCapture log;
    size_t rebuilds = 0;
    for (const Step& step : steps) {
        SCOPED_TRACE(rebuilds);
        insertScreenRow(mStorage.get(), 1000, 1);
        insertAbout(mStorage.get(), "software_version", "BUILD.A");
        stop();
        if (step.sql != nullptr) {
            ASSERT_EQ(SQLITE_OK, DirectDb(dbPath()).exec(step.sql));
        }
        kelvo::HostProperties::setForTest("ro.build.display.id", step.build);
        // A rebuild (backup, zip, drop, create) outlasts a synchronous send.
        kelvo::HandlerThread::setSyncTimeoutMs(1);
        start({step.screen, &kAbout});
        kelvo::HandlerThread::setSyncTimeoutMs(0);
        rebuilds += step.kept ? 0 : 1;
        EXPECT_EQ(step.kept ? 1 : 0, countThroughStorage(mStorage.get()));
        // One zipped backup per rebuild.
        EXPECT_EQ(rebuilds, backupZips().size());
    }
    EXPECT_TRUE(log.contains("schema mismatch, duplicate records", ANDROID_LOG_ERROR));
    EXPECT_TRUE(log.contains("Software version: BUILD.A, current is BUILD.B", ANDROID_LOG_INFO));
    // One version row for each table and one for the version table itself.
    DirectDb db(dbPath());
    EXPECT_EQ((std::vector<std::string>{"about_kelvo_daemon|1.0", "raw_screen_state|1.10",
                                        "schema_version|1.0"}),
              db.column("SELECT module, version FROM schema_version ORDER BY module"));
    EXPECT_EQ(std::vector<std::string>{}, db.column("SELECT name FROM sqlite_master WHERE name = "
                                                    "'legacy'"));
    struct stat st = {};
    ASSERT_EQ(0, stat(dbPath().c_str(), &st));
    EXPECT_EQ(0664u, st.st_mode & 0777);
}

TEST_F(KelvoStorageTest, FlushPeriodComesFromItsPropertyAndRunsAfterAKeptStart) {
    kelvo::HostProperties::setForTest("persist.storage.timer.duration", "1000000000");
    // The periodic flush also runs after a start that kept the database.
    start({&kScreenState});
    EXPECT_EQ(1000000000LL, mStorage->getFlushPeriodNs());
    stop();
    start({&kScreenState});
    insertScreenRow(mStorage.get(), 1000, 1);
    EXPECT_TRUE(waitFor([&] { return countThroughStorage(mStorage.get()) == 1; },
                        std::chrono::milliseconds(5000)));
}

TEST_F(KelvoStorageTest, RowsWithoutTablesWaitForThem) {
    mStorage = new KelvoStorage(nullptr);
    mStorage->addSchema(kScreenState);
    LogCapture log;
    for (int i = 0; i < 350; ++i) {
        insertScreenRow(mStorage.get(), 1000 + i, 1);
    }
    // Neither the size limit nor a forced flush before the start drops them.
    EXPECT_EQ(0, mStorage->flushAllEntries());
    ASSERT_EQ(0, mStorage->startConnection());
    EXPECT_FALSE(log.contains("reach upper limit"));
    EXPECT_FALSE(log.contains("abandon all entries"));
    EXPECT_EQ(350, countThroughStorage(mStorage.get()));

    // After the close, rows wait for the next start (no flush tick drops them).
    ASSERT_EQ(0, mStorage->closeConnection());
    insertScreenRow(mStorage.get(), 9000, 1);
    EXPECT_EQ(0, mStorage->flushAllEntries());
    EXPECT_EQ(2u, HealthCounters::get(Health::InsertsDeferred));
    mStorage->addSchema(kScreenState);
    ASSERT_EQ(0, mStorage->startConnection());
    EXPECT_EQ(0, mStorage->flushAllEntries());
    EXPECT_EQ(351, countThroughStorage(mStorage.get()));
    EXPECT_EQ(0u, HealthCounters::get(Health::FlushRowsAbandoned));
}

TEST_F(KelvoStorageTest, UnknownRequestsAreRefused) {
    start({&kScreenState});
    LogCapture log;
    Parcel copy;
    copy.writeCString((mRoot->path() + "/copy.db").c_str());
    EXPECT_EQ(-17, mStorage->doBackupCopy(copy));
    EXPECT_TRUE(log.contains("SQL refused off the storage thread: 9", ANDROID_LOG_ERROR));
    EXPECT_FALSE(kelvo::test::hostPathExists(mRoot->path() + "/copy.db"));
    EXPECT_EQ(-5, mStorage->queryEntries(String8("SELECT 1"), nullptr));
    EXPECT_EQ(-3, mStorage->sendMessageSync(kelvo::ParcelMessage(kelvo::MESSAGE_STORAGE_ENTRY, 8)));
    EXPECT_TRUE(log.contains("Unknow entry type: 8", ANDROID_LOG_ERROR));
    EXPECT_EQ(-3, mStorage->sendMessageSync(kelvo::ParcelMessage(kelvo::MESSAGE_CUSTOMIZED, 9)));
    EXPECT_TRUE(log.contains("Invalid tag: 9", ANDROID_LOG_ERROR));
    EXPECT_EQ(-3, mStorage->sendMessageSync(kelvo::ParcelMessage(kelvo::MESSAGE_TIMER, 0)));
    EXPECT_TRUE(log.contains("Unknow message type: 2", ANDROID_LOG_ERROR));
    Parcel reply;
    EXPECT_EQ(-17, mStorage->queryEntries(String8("SELECT * FROM nothing_here"), &reply));
    EXPECT_EQ(-17, mStorage->executeEntry(String8("DELETE FROM raw_screen_state; DROP TABLE x"),
                                          true));
    EXPECT_EQ(4u, HealthCounters::get(Health::StorageEntryRefused));
}
