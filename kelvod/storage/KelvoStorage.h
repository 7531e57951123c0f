#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <atomic>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <vector>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "storage/DatabaseCopier.h"
#include "storage/TableAttribute.h"
#include "utils/HandlerThread.h"

namespace kelvo {

class KelvoAgent;
class SchemaTable;
class StorageManager;

// Entry kinds of MESSAGE_STORAGE_ENTRY messages.
enum storage_entry_type {
    STORAGE_CREATE_TABLE = 0,    // create parcel; synchronous
    STORAGE_INSERT_ENTRIES = 1,  // insert parcel; buffered
    STORAGE_EXECUTE_ENTRY = 2,   // String8 statement
    STORAGE_QUERY_ENTRIES = 3,   // String8 query, reply parcel; synchronous
    STORAGE_FLUSH_ENTRIES = 4,   // synchronous
    STORAGE_CLEAN_DATABASE = 5,  // int64 time ms
    STORAGE_SAMPLING_UPLOAD = 6, // String8 path, String8 extra
    STORAGE_REMOTE_DEBUG = 7,    // int32 action, String8 argument
};

// The one thread that touches the database: every statement, the start-up
// rebuild and the closing included, runs on it. Inserts are buffered and
// written in one transaction when the buffer passes its limits, when the
// periodic flush fires, or when a flush is forced. Until the tables exist
// (before the start, after the close) a flush keeps the buffer.
class KelvoStorage : public HandlerThread, public DatabaseCopier {
public:
    static constexpr const char* kDatabaseDir = "/data/log/kelvo";
    static constexpr const char* kDatabasePath = "/data/log/kelvo/kelvo.db";
    static constexpr const char* kDatabaseName = "kelvo.db";
    static constexpr int64_t kDefaultFlushPeriodNs = 180000000000LL;
    static constexpr int64_t kMaxBufferBytes = 5242880;
    static constexpr size_t kMaxBufferRequests = 300;
    // Longest wait for the start: a rebuild copies and zips the old
    // database first, which may take longer than a synchronous send waits.
    static constexpr int64_t kStartTimeoutMs = 600000;

    // The agent's clean step reaches every owner's cleanTables; null in
    // tests that run the storage alone.
    explicit KelvoStorage(KelvoAgent* agent);
    ~KelvoStorage() override;

    // Opens the database and checks or rebuilds its tables, as one message
    // to the storage thread; waits for its result (kStartTimeoutMs at most).
    int32_t startConnection();
    // Closes the connection on the storage thread; buffered rows stay.
    int32_t closeConnection();
    // The orderly stop: writes the buffered rows, then closes the connection,
    // in one synchronous message (bounded by the synchronous time-out).
    int32_t shutdown();
    int32_t addSchema(const table_attribute& table);

    int32_t createTable(const android::Parcel& data);
    int32_t insertEntries(const android::Parcel& data);
    int32_t executeEntry(const android::String8& sql, bool sync);
    int32_t queryEntries(const android::String8& sql, android::Parcel* reply);
    int32_t flushAllEntries();
    int32_t cleanDatabase(int64_t time);
    int32_t samplingUpload(const android::String8& path, const android::String8& extra);
    int32_t remoteDebug(int32_t action, const android::String8& argument);

    // Online copy of the live database into the path the parcel names (a C
    // string); runs on the storage thread (the file manager calls it there).
    int32_t doBackupCopy(const android::Parcel& data) override;

    int64_t getFlushPeriodNs() const { return mFlushPeriodNs; }

    int32_t handleParcelMessage(const ParcelMessage& msg) override;

private:
    friend class SchemaTable;

    // Every statement goes through here; refused on any other thread.
    int32_t runSql(int32_t action, const android::Parcel* in, android::Parcel* out);
    int32_t doStartConnection();
    int32_t doCloseConnection();
    // A query run on the storage thread itself; the reply is rewound.
    int32_t runQuery(const android::String8& sql, android::Parcel* reply);
    int32_t runStatement(const android::String8& sql);
    // Appends one insert parcel to the buffer without flushing.
    void bufferInsert(const ParcelMessage& msg);
    int64_t getTableCount();
    bool isSoftwareVersionChanged();
    int32_t dropAllTables();
    int32_t dropTables(const android::Parcel& reply);

    int32_t handleEntry(int32_t what, const android::Parcel& data, android::Parcel* reply);
    int32_t handleCustomized(int32_t what);
    int32_t doCreateTable(const android::Parcel& data);
    int32_t doInsertEntries(const ParcelMessage& msg);
    int32_t doExecuteEntry(const android::Parcel& data);
    int32_t doQueryEntries(const android::Parcel& data, android::Parcel* reply);
    int32_t doFlushEntries();
    int32_t doCleanDatabase(const android::Parcel& data);
    int32_t doVacuumDatabase();
    void armFlushTimer();

    KelvoAgent* mAgent;
    std::unique_ptr<SchemaTable> mSchema;
    std::unique_ptr<StorageManager> mManager;
    std::vector<ParcelMessage> mBuffer;
    int64_t mBufferSize;
    int64_t mFlushPeriodNs;
    // Set once the tables exist, cleared by the close: until then rows only
    // wait in the buffer. Storage thread only.
    bool mTablesReady;
    // The pending flush tick, so a second start does not arm a second one.
    // Storage thread only.
    int32_t mFlushTickId;
    // The thread that handles this thread's messages, once it has handled
    // one: the only one allowed to run SQL.
    std::atomic<pid_t> mThreadId;
    // The result of the start, handed back to the thread that waits for it.
    std::mutex mStartLock;
    std::condition_variable mStartCond;
    bool mStartDone = false;
    int32_t mStartResult = -1;
};

} // namespace kelvo
