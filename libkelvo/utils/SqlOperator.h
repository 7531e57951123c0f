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

private:
    int32_t translateCreate(const android::Parcel* in, android::String8* statement);
    // Leaves the parcel at the row count.
    int32_t translateInsert(const android::Parcel* in, android::String8* statement,
                            std::vector<int32_t>* types);

    // Runs a statement that returns no rows. A cached statement keeps its
    // prepared form for the life of the connection (the fixed statements of
    // the insert path).
    int32_t executeStatement(const android::String8& statement, bool cached = false);
    // Runs an insert statement once per row of the parcel.
    int32_t executeStatement(const android::String8& statement, const std::vector<int32_t>& types,
                             const android::Parcel* in);
    // Runs a query and writes its rows into the reply.
    int32_t executeStatement(const android::String8& statement, android::Parcel* out);

    // Refuses a statement followed by another one, and any statement
    // without a connection.
    int32_t checkStatement(const android::String8& statement);
    int32_t prepareStatement(const android::String8& statement, sqlite3_stmt** stmt);
    // The prepared form of a statement run again and again (inserts into the
    // same table, savepoints); null when it does not prepare. Reset after use.
    sqlite3_stmt* cachedStatement(const android::String8& statement);
    void finalizeCachedStatements();
    int32_t bindEntryValues(sqlite3_stmt* stmt, const std::vector<int32_t>& types,
                            const android::Parcel* in);
    int32_t writeColumnValue(sqlite3_stmt* stmt, int32_t column, android::Parcel* out);
    // Rolls back a transaction that was left open.
    void rollbackOpenTranscation();

    sqlite3* mDatabase;
    std::unordered_map<std::string, sqlite3_stmt*> mStatements;
};

} // namespace kelvo
