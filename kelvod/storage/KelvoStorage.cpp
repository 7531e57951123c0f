#include "storage/KelvoStorage.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>

#include <cutils/properties.h>

#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/KelvoAgent.h"
#include "kelvo/RootPath.h"
#include "storage/SchemaTable.h"
#include "storage/StorageManager.h"
#include "utils/FileUtils.h"
#include "utils/KelvoUtils.h"
#include "utils/TimeProvider.h"

namespace kelvo {

namespace {

// Customized tags of the storage thread's own messages.
constexpr int32_t kFlushTick = 0;
constexpr int32_t kVacuum = 1;
constexpr int32_t kStart = 2;
constexpr int32_t kClose = 3;
constexpr int32_t kShutdown = 4;
constexpr uid_t kSystemUid = 1000;

int64_t readFlushPeriod() {
    int64_t period = property_get_int64("persist.storage.timer.duration",
                                        KelvoStorage::kDefaultFlushPeriodNs);
    return period < 1000000000LL ? KelvoStorage::kDefaultFlushPeriodNs : period;
}

// Skips the column and row counts of a query reply; false when there is no
// row to read.
bool firstRow(const android::Parcel& reply) {
    int32_t columns = 0;
    int32_t rows = 0;
    return reply.readInt32(&columns) == android::NO_ERROR &&
            reply.readInt32(&rows) == android::NO_ERROR && columns > 0 && rows > 0;
}

// The row count of an insert parcel (after its table name and column list);
// 0 when the head cannot be read. The read position is kept.
int64_t rowsOf(const android::Parcel& insert) {
    size_t saved = insert.dataPosition();
    insert.setDataPosition(0);
    android::String8 text;
    int32_t columns = 0;
    int32_t rows = 0;
    bool ok = insert.readString8(&text) == android::NO_ERROR &&
              insert.readInt32(&columns) == android::NO_ERROR && columns >= 0;
    for (int32_t i = 0; ok && i < columns; ++i) {
        int32_t type = 0;
        ok = insert.readString8(&text) == android::NO_ERROR &&
             insert.readInt32(&type) == android::NO_ERROR;
    }
    ok = ok && insert.readInt32(&rows) == android::NO_ERROR;
    insert.setDataPosition(saved);
    return ok && rows > 0 ? rows : 0;
}

} // namespace

KelvoStorage::KelvoStorage(KelvoAgent* agent)
    : HandlerThread("KelvoStorage", 11),
      mAgent(agent),
      mBufferSize(0),
      mFlushPeriodNs(readFlushPeriod()),
      mTablesReady(false),
      mFlushTickId(-1),
      mThreadId(0) {
    mSchema.reset(new SchemaTable(this));
    mManager.reset(new StorageManager(this));
}

KelvoStorage::~KelvoStorage() {}

int32_t KelvoStorage::addSchema(const table_attribute& table) {
    return mSchema->addSchema(table);
}

int32_t KelvoStorage::startConnection() {
    std::unique_lock<std::mutex> lock(mStartLock);
    mStartDone = false;
    if (sendMessage(ParcelMessage(MESSAGE_CUSTOMIZED, kStart)) < 0) {
        KLOGE("Failed to post the storage start");
        return -2;
    }
    if (!mStartCond.wait_for(lock, std::chrono::milliseconds(kStartTimeoutMs),
                             [this] { return mStartDone; })) {
        KLOGE("Storage start timed out");
        return -1;
    }
    return mStartResult;
}

int32_t KelvoStorage::closeConnection() {
    return sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, kClose));
}

int32_t KelvoStorage::shutdown() {
    return sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, kShutdown));
}

int32_t KelvoStorage::doStartConnection() {
    if (mTablesReady) {
        // Opening again would fail and move the live database aside.
        KLOGI("Database connection already started");
        return 0;
    }
    StorageManager::checkFileSize(kDatabaseDir, kDatabaseName,
                                  StorageManager::getFileSizeThreshold(0));

    std::string dir = RootPath::resolve(kDatabaseDir);
    if (FileUtils::createDirectory(dir.c_str(), 0775) != 0) {
        KLOGE("Failed to create database directory");
        return -14;
    }

    std::string path = RootPath::resolve(kDatabasePath);
    android::Parcel open;
    open.writeCString(path.c_str());
    if (runSql(SQL_OPEN_CONNECTION, &open, nullptr) < 0) {
        KLOGE("Failed to open database connection!");
        mManager->moveDatabase();
        return -17;
    }

    // Failures are logged there and do not stop the start.
    FileUtils::chownDir(dir.c_str(), kSystemUid, kSystemUid);
    FileUtils::chmodFile(dir.c_str(), 0775);
    FileUtils::chmodFile(path.c_str(), 0664);

    int64_t tables = getTableCount();
    KLOGI("Database has %d tables", static_cast<int32_t>(tables));
    if (tables != 0) {
        if (mSchema->checkVersions() == 0 && !isSoftwareVersionChanged()) {
            mSchema->clearSchema();
            mTablesReady = true;
            // Keeping the database must not leave buffered rows without a
            // periodic flush.
            armFlushTimer();
            return 0;
        }
        mManager->cleanDatabase(TimeProvider::getCurrentTime(TIME_TYPE_WALL));
        if (dropAllTables() < 0) {
            KLOGE("Failed to drop all tables");
            return -17;
        }
    }

    mSchema->createTables();
    mTablesReady = true;
    if (doFlushEntries() < 0) {
        KLOGE("Failed to flush all entries!");
        return -17;
    }
    mSchema->clearSchema();
    armFlushTimer();
    return 0;
}

int32_t KelvoStorage::doCloseConnection() {
    // Rows that come later wait in the buffer, as before the start.
    mTablesReady = false;
    if (runSql(SQL_CLOSE_CONNECTION, nullptr, nullptr) < 0) {
        KLOGE("Failed to close database connection!");
        return -17;
    }
    return 0;
}

void KelvoStorage::armFlushTimer() {
    // Runs on the storage thread only, like the tick that re-arms itself, so
    // no second start can race it into two ticks.
    if (mFlushTickId >= 0) {
        removeMessage(mFlushTickId);
    }
    mFlushTickId = sendMessageDelayed(mFlushPeriodNs, ParcelMessage(MESSAGE_CUSTOMIZED, kFlushTick));
}

int32_t KelvoStorage::runSql(int32_t action, const android::Parcel* in, android::Parcel* out) {
    // The one-SQL-thread rule, checked: the connection has no lock.
    if (gettid() != mThreadId.load(std::memory_order_relaxed)) {
        KLOGE("SQL refused off the storage thread: %d", action);
        return -1;
    }
    return doSqliteOperation(action, in, out);
}

int32_t KelvoStorage::runQuery(const android::String8& sql, android::Parcel* reply) {
    android::Parcel data;
    data.writeString8(sql);
    data.setDataPosition(0);
    return doQueryEntries(data, reply);
}

int32_t KelvoStorage::runStatement(const android::String8& sql) {
    android::Parcel data;
    data.writeString8(sql);
    data.setDataPosition(0);
    return doExecuteEntry(data);
}

void KelvoStorage::bufferInsert(const ParcelMessage& msg) {
    mBuffer.push_back(msg);
    mBufferSize += static_cast<int64_t>(msg.getParcel().dataSize());
}

int64_t KelvoStorage::getTableCount() {
    android::Parcel reply;
    if (runQuery(android::String8("SELECT COUNT(*) FROM sqlite_master"), &reply) < 0 ||
        !firstRow(reply)) {
        KLOGE("Failed to query sqlite_master table");
        return -2;
    }
    return reply.readInt64();
}

bool KelvoStorage::isSoftwareVersionChanged() {
    android::String8 sql("SELECT value FROM about_kelvo_daemon WHERE key = ");
    sql.append(KelvoUtils::quoteSqlText("software_version"));
    android::Parcel reply;
    if (runQuery(sql, &reply) < 0) {
        KLOGE("Failed to query software version");
        return false;
    }
    android::String8 stored;
    if (firstRow(reply)) {
        stored = reply.readString8();
    }
    char current[PROPERTY_VALUE_MAX];
    property_get("ro.build.display.id", current, "");
    KLOGI("Software version: %s, current is %s", stored.string(), current);
    return stored != current;
}

int32_t KelvoStorage::dropAllTables() {
    // Tables only: never indexes, views or SQLite's own tables.
    android::Parcel reply;
    if (runQuery(android::String8("SELECT name FROM sqlite_master WHERE type = 'table' AND "
                                  "name NOT LIKE 'sqlite\\_%' ESCAPE '\\'"),
                 &reply) < 0) {
        KLOGE("Failed to query sqlite_master table");
        return -2;
    }
    return dropTables(reply);
}

int32_t KelvoStorage::dropTables(const android::Parcel& reply) {
    int32_t columns = 0;
    int32_t rows = 0;
    if (reply.readInt32(&columns) != android::NO_ERROR ||
        reply.readInt32(&rows) != android::NO_ERROR || columns != 1 || rows < 0) {
        return -2;
    }
    for (int32_t i = 0; i < rows; ++i) {
        android::String8 name;
        if (reply.readString8(&name) != android::NO_ERROR) {
            return -2;
        }
        android::String8 sql("DROP TABLE ");
        sql.append(KelvoUtils::quoteSqlIdentifier(name.string()));
        int32_t ret = runStatement(sql);
        if (ret < 0) {
            KLOGE("Failed to drop table: %s", name.string());
            return ret;
        }
    }
    return 0;
}

int32_t KelvoStorage::createTable(const android::Parcel& data) {
    return sendMessageSync(ParcelMessage(MESSAGE_STORAGE_ENTRY, STORAGE_CREATE_TABLE, data));
}

int32_t KelvoStorage::insertEntries(const android::Parcel& data) {
    return sendMessage(ParcelMessage(MESSAGE_STORAGE_ENTRY, STORAGE_INSERT_ENTRIES, data));
}

int32_t KelvoStorage::executeEntry(const android::String8& sql, bool sync) {
    android::Parcel data;
    data.writeString8(sql);
    ParcelMessage msg(MESSAGE_STORAGE_ENTRY, STORAGE_EXECUTE_ENTRY, data);
    return sync ? sendMessageSync(msg) : sendMessage(msg);
}

int32_t KelvoStorage::queryEntries(const android::String8& sql, android::Parcel* reply) {
    if (reply == nullptr) {
        KLOGE("Invalid reply parcel");
        HealthCounters::add(Health::StorageEntryRefused);
        return -5;
    }
    android::Parcel data;
    data.writeString8(sql);
    return sendMessageSync(ParcelMessage(MESSAGE_STORAGE_ENTRY, STORAGE_QUERY_ENTRIES, data, reply));
}

int32_t KelvoStorage::flushAllEntries() {
    return sendMessageSync(ParcelMessage(MESSAGE_STORAGE_ENTRY, STORAGE_FLUSH_ENTRIES));
}

int32_t KelvoStorage::cleanDatabase(int64_t time) {
    android::Parcel data;
    data.writeInt64(time);
    return sendMessage(ParcelMessage(MESSAGE_STORAGE_ENTRY, STORAGE_CLEAN_DATABASE, data));
}

int32_t KelvoStorage::samplingUpload(const android::String8& path, const android::String8& extra) {
    android::Parcel data;
    data.writeString8(path);
    data.writeString8(extra);
    return sendMessage(ParcelMessage(MESSAGE_STORAGE_ENTRY, STORAGE_SAMPLING_UPLOAD, data));
}

int32_t KelvoStorage::remoteDebug(int32_t action, const android::String8& argument) {
    android::Parcel data;
    data.writeInt32(action);
    data.writeString8(argument);
    return sendMessage(ParcelMessage(MESSAGE_STORAGE_ENTRY, STORAGE_REMOTE_DEBUG, data));
}

int32_t KelvoStorage::handleParcelMessage(const ParcelMessage& msg) {
    mThreadId.store(gettid(), std::memory_order_relaxed);
    switch (msg.type) {
        case MESSAGE_STORAGE_ENTRY:
            if (msg.what == STORAGE_INSERT_ENTRIES) {
                return doInsertEntries(msg);
            }
            return handleEntry(msg.what, msg.getParcel(), msg.getReply());
        case MESSAGE_CUSTOMIZED:
            return handleCustomized(msg.what);
        default:
            KLOGE("Unknow message type: %d", msg.type);
            HealthCounters::add(Health::StorageEntryRefused);
            return -3;
    }
}

int32_t KelvoStorage::handleEntry(int32_t what, const android::Parcel& data,
                                  android::Parcel* reply) {
    switch (what) {
        case STORAGE_CREATE_TABLE:
            return doCreateTable(data);
        case STORAGE_EXECUTE_ENTRY:
            return doExecuteEntry(data);
        case STORAGE_QUERY_ENTRIES:
            return doQueryEntries(data, reply);
        case STORAGE_FLUSH_ENTRIES:
            return doFlushEntries();
        case STORAGE_CLEAN_DATABASE:
            return doCleanDatabase(data);
        case STORAGE_SAMPLING_UPLOAD: {
            android::String8 path = data.readString8();
            android::String8 extra = data.readString8();
            return mManager->samplingUpload(path, extra);
        }
        case STORAGE_REMOTE_DEBUG: {
            int32_t action = data.readInt32();
            android::String8 argument = data.readString8();
            return mManager->remoteDebug(action, argument);
        }
        default:
            KLOGE("Unknow entry type: %d", what);
            HealthCounters::add(Health::StorageEntryRefused);
            return -3;
    }
}

int32_t KelvoStorage::handleCustomized(int32_t what) {
    switch (what) {
        case kFlushTick:
            doFlushEntries();
            mFlushTickId = sendMessageDelayed(mFlushPeriodNs,
                                              ParcelMessage(MESSAGE_CUSTOMIZED, kFlushTick));
            return 0;
        case kVacuum:
            return doVacuumDatabase();
        case kStart: {
            int32_t result = doStartConnection();
            std::lock_guard<std::mutex> guard(mStartLock);
            mStartResult = result;
            mStartDone = true;
            mStartCond.notify_all();
            return result;
        }
        case kClose:
            return doCloseConnection();
        case kShutdown: {
            int32_t flushed = doFlushEntries();
            int32_t closed = doCloseConnection();
            return flushed < 0 ? flushed : closed;
        }
        default:
            KLOGE("Invalid tag: %d", what);
            HealthCounters::add(Health::StorageEntryRefused);
            return -3;
    }
}

int32_t KelvoStorage::doCreateTable(const android::Parcel& data) {
    if (runSql(SQL_CREATE_TABLE, &data, nullptr) < 0) {
        KLOGE("Failed to create table");
        return -17;
    }
    return 0;
}

int32_t KelvoStorage::doInsertEntries(const ParcelMessage& msg) {
    bufferInsert(msg);
    // Before the tables exist, rows only wait.
    if (!mTablesReady) {
        return 0;
    }
    if (mBufferSize > kMaxBufferBytes || mBuffer.size() > kMaxBufferRequests) {
        if (doFlushEntries() < 0) {
            KLOGE("Failed to flush entries when storage buffer reach upper limit");
            return -2;
        }
    }
    return 0;
}

int32_t KelvoStorage::doFlushEntries() {
    if (mBuffer.empty()) {
        mBufferSize = 0;
        return 0;
    }
    // No tables (before the start, after the close): the rows wait for them.
    if (!mTablesReady) {
        HealthCounters::add(Health::InsertsDeferred);
        return 0;
    }
    int64_t rowCount = 0;
    for (const ParcelMessage& request : mBuffer) {
        rowCount += rowsOf(request.getParcel());
    }
    if (runSql(SQL_BEGIN_TRANSACTION, nullptr, nullptr) < 0) {
        mBuffer.clear();
        mBufferSize = 0;
        HealthCounters::add(Health::FlushRowsAbandoned, rowCount);
        KLOGE("Failed to start batch, abandon all entries");
        return -17;
    }
    bool faulty = false;
    for (const ParcelMessage& request : mBuffer) {
        const android::Parcel& rows = request.getParcel();
        rows.setDataPosition(0);
        if (runSql(SQL_INSERT_ENTRIES, &rows, nullptr) < 0) {
            // A parcel is stored whole or not at all.
            int64_t lost = rowsOf(rows);
            HealthCounters::add(Health::FlushRowsAbandoned, lost);
            rowCount -= lost;
            faulty = true;
        }
        mBufferSize -= static_cast<int64_t>(rows.dataSize());
    }
    mBuffer.clear();
    if (mBufferSize != 0) {
        mBufferSize = 0;
        KLOGE("Error occurred while decreasing buffer size");
    }
    if (faulty) {
        KLOGE("Some error occurred while inserting entries");
    }
    if (runSql(SQL_COMMIT_TRANSACTION, nullptr, nullptr) < 0) {
        // The batch is rolled back.
        HealthCounters::add(Health::FlushRowsAbandoned, rowCount);
        doVacuumDatabase();
        KLOGE("Failed to end batch");
        return -17;
    }
    KLOGM(LOG_MODULE_STORAGE, "Flush all entries into database");
    return 0;
}

int32_t KelvoStorage::doVacuumDatabase() {
    if (runSql(SQL_VACUUM_DATABASE, nullptr, nullptr) < 0) {
        KLOGE("Failed to vacuum database");
        return -17;
    }
    KLOGM(LOG_MODULE_STORAGE, "Vacuum database successfully!");
    return 0;
}

int32_t KelvoStorage::doExecuteEntry(const android::Parcel& data) {
    if (runSql(SQL_EXECUTE_ENTRY, &data, nullptr) < 0) {
        KLOGE("Failed to execute entry");
        return -17;
    }
    return 0;
}

int32_t KelvoStorage::doQueryEntries(const android::Parcel& data, android::Parcel* reply) {
    if (runSql(SQL_SIMPLE_QUERY, &data, reply) < 0) {
        KLOGE("Failed to query entries");
        return -17;
    }
    reply->setDataPosition(0);
    return 0;
}

int32_t KelvoStorage::doCleanDatabase(const android::Parcel& data) {
    doFlushEntries();
    int64_t time = data.readInt64();
    mManager->cleanDatabase(time);
    if (mAgent != nullptr) {
        mAgent->cleanTables(time);
    }
    sendMessage(ParcelMessage(MESSAGE_CUSTOMIZED, kVacuum));
    KLOGI("Successfully clean up database");
    return 0;
}

int32_t KelvoStorage::doBackupCopy(const android::Parcel& data) {
    data.setDataPosition(0);
    if (runSql(SQL_BACKUP_COPY, &data, nullptr) < 0) {
        KLOGE("Failed to backup copy");
        return -17;
    }
    return 0;
}

} // namespace kelvo
