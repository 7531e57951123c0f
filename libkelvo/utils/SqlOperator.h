#pragma once

#include <stdint.h>

#include <string>
#include <unordered_map>
#include <vector>

#include <binder/Parcel.h>
#include <utils/String8.h>

struct sqlite3;
struct sqlite3_stmt;

namespace kelvo {

// The library's one SQL connection and the only code that talks SQL. It has
// no lock: only the storage thread reaches it. Statements arrive in parcels
// (see SqlTypes.h for their layouts); each action returns a negative value on
// failure.
class SqlOperator {
public:
    // How long a statement waits for another connection's lock before it
    // fails with SQLITE_BUSY.
    static constexpr int kDefaultBusyTimeoutMs = 2000;
    // Insert statements kept prepared per connection; the daemon has fewer
    // tables. Past it the cache starts again.
    static constexpr size_t kMaxCachedStatements = 256;

    SqlOperator();
    ~SqlOperator();
    SqlOperator(const SqlOperator&) = delete;
    SqlOperator& operator=(const SqlOperator&) = delete;

    // in: C string path of the database file.
    int32_t openConnection(const android::Parcel* in);
    int32_t closeConnection();
    int32_t beginTranscation();
    int32_t commitTranscation();
    int32_t vacuumDatabase();
    // in: create parcel.
    int32_t createTable(const android::Parcel* in);
    // in: insert parcel. 0 for no rows, SQLITE_DONE after one row or more.
    int32_t insertEntries(const android::Parcel* in);
    // in: String8 statement that returns no rows.
    int32_t executeEntry(const android::Parcel* in);
    // in: String8 query; out: column count, row count, then the values.
    int32_t simpleQueryEntries(const android::Parcel* in, android::Parcel* out);
    // in: C string path of the copy.
    int32_t backupCopy(const android::Parcel* in);

    // The busy time-out of connections opened from now on (tests shorten
    // it); 0 or less restores the default.
    static void setBusyTimeoutMs(int ms);

private:
    int32_t translateCreate(const android::Parcel* in, android::String8* statement);
    // Leaves the parcel at the row count.
    int32_t translateInsert(const android::Parcel* in, android::String8* statement,
                            std::vector<int32_t>* types);

    // Runs a statement that returns no rows. A fixed statement (the
    // savepoints of the insert path) keeps its prepared form for the life of
    // the connection.
    int32_t executeStatement(const android::String8& statement, bool fixed = false);
    // Runs an insert statement once per row of the parcel.
    int32_t executeStatement(const android::String8& statement, const std::vector<int32_t>& types,
                             const android::Parcel* in);
    // Runs a query and writes its rows into the reply.
    int32_t executeStatement(const android::String8& statement, android::Parcel* out);

    // Refuses a statement followed by another one, and any statement
    // without a connection.
    int32_t checkStatement(const android::String8& statement);
    int32_t prepareStatement(const android::String8& statement, sqlite3_stmt** stmt);
    // The prepared form of a statement run again and again; null when it
    // does not prepare. Reset after use. Insert statements live in a bounded
    // cache that is emptied when full; fixed statements are never evicted,
    // so preparing one cannot finalize an insert statement in use.
    sqlite3_stmt* cachedStatement(const android::String8& statement, bool fixed);
    void finalizeCachedStatements();
    int32_t bindEntryValues(sqlite3_stmt* stmt, const std::vector<int32_t>& types,
                            const android::Parcel* in);
    int32_t writeColumnValue(sqlite3_stmt* stmt, int32_t column, android::Parcel* out);
    // Rolls back a transaction that was left open.
    void rollbackOpenTranscation();

    sqlite3* mDatabase;
    std::unordered_map<std::string, sqlite3_stmt*> mStatements;
    std::unordered_map<std::string, sqlite3_stmt*> mFixedStatements;
};

} // namespace kelvo
