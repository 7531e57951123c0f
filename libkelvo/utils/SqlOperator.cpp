#include "utils/SqlOperator.h"

#include <sqlite3.h>
#include <stdint.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cctype>
#include <cmath>
#include <string>

#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "SqlTypes.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

std::atomic<int> gBusyTimeoutMs{SqlOperator::kDefaultBusyTimeoutMs};

// The fewest bytes one column takes in a create or insert parcel: the name's
// length, its NUL (padded to 4) and the type.
constexpr size_t kMinColumnBytes = 12;

// "YYYY-MM-DD HH:MM:SS" and its NUL.
constexpr size_t kTimeTextSize = 20;

// Every insert parcel of more than one row runs inside this savepoint, so
// that a parcel is stored whole or not at all, inside or outside the
// caller's transaction.
const char* const kInsertSavepoint = "SAVEPOINT kelvo_insert;";
const char* const kInsertRelease = "RELEASE kelvo_insert;";
const char* const kInsertRollback = "ROLLBACK TO kelvo_insert;";

std::string toStdString(const String8& text) {
    return std::string(text.string(), text.size());
}

String8 toString8(const std::string& text) {
    return String8(text.c_str(), text.size());
}

// Reads the table name and the column count that start create and insert
// parcels. The count is checked against the bytes that are left.
int32_t readTableHead(const Parcel* in, std::string* table, int32_t* columns) {
    String8 name;
    if (in->readString8(&name) != android::NO_ERROR) {
        LLOGE("Invalid table name");
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    int32_t count = 0;
    if (in->readInt32(&count) != android::NO_ERROR || count < 0 ||
        static_cast<size_t>(count) > in->dataAvail() / kMinColumnBytes) {
        LLOGE("Invalid column count: %d", count);
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    *table = toStdString(name);
    *columns = count;
    return 0;
}

int32_t readColumn(const Parcel* in, int32_t index, std::string* name, int32_t* type) {
    String8 text;
    if (in->readString8(&text) != android::NO_ERROR || in->readInt32(type) != android::NO_ERROR) {
        LLOGE("Invalid column %d", index);
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    *name = toStdString(text);
    return 0;
}

// The local time of the second that holds the instant (milliseconds, the
// second taken toward zero); "" when it cannot be formatted.
void formatLocalTime(int64_t timeMs, char* buffer, size_t size) {
    buffer[0] = '\0';
    time_t seconds = static_cast<time_t>(timeMs / 1000);
    struct tm local;
    if (localtime_r(&seconds, &local) == nullptr) {
        LLOGE("Failed to convert time: %lld", static_cast<long long>(timeMs));
        return;
    }
    if (strftime(buffer, size, "%Y-%m-%d %H:%M:%S", &local) == 0) {
        LLOGE("Failed to format time: %lld", static_cast<long long>(timeMs));
        buffer[0] = '\0';
    }
}

// True for the declared types SQLite gives text affinity.
bool isTextColumn(const char* declaredType) {
    if (declaredType == nullptr) {
        return false;
    }
    std::string upper(declaredType);
    for (char& c : upper) {
        c = static_cast<char>(toupper(static_cast<unsigned char>(c)));
    }
    return upper.find("CHAR") != std::string::npos || upper.find("TEXT") != std::string::npos ||
           upper.find("CLOB") != std::string::npos;
}

// A real value taken toward zero, held to the int64 range (NaN gives 0).
int64_t truncateReal(double value) {
    if (std::isnan(value)) {
        return 0;
    }
    if (value >= 9223372036854775808.0) {
        return INT64_MAX;
    }
    if (value <= -9223372036854775808.0) {
        return INT64_MIN;
    }
    return static_cast<int64_t>(value);
}

} // namespace

SqlOperator::SqlOperator() : mDatabase(nullptr) {}

void SqlOperator::setBusyTimeoutMs(int ms) {
    gBusyTimeoutMs.store(ms > 0 ? ms : kDefaultBusyTimeoutMs);
}

SqlOperator::~SqlOperator() {
    closeConnection();
}

int32_t SqlOperator::openConnection(const Parcel* in) {
    if (in == nullptr) {
        LLOGE("Invalid parameter");
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    if (mDatabase != nullptr) {
        LLOGE("Database connection already opened");
        return -1;
    }
    in->setDataPosition(0);
    const char* path = in->readCString();
    if (path == nullptr || path[0] == '\0') {
        LLOGE("Invalid file name");
        return -1;
    }
    sqlite3* database = nullptr;
    if (sqlite3_open(path, &database) != SQLITE_OK) {
        LLOGE("Error: %s(%s)", sqlite3_errmsg(database), path);
        sqlite3_close(database);
        return -1;
    }
    // The default rollback journal with full syncs is kept: a transaction
    // reaches the file only through the journal, so a process killed in the
    // middle of a flush leaves a hot journal that the next open rolls back,
    // and every committed flush stays. The database stays a single file for
    // copies and uploads.
    sqlite3_busy_timeout(database, gBusyTimeoutMs.load());
    mDatabase = database;
    if (executeStatement(String8("PRAGMA cache_size=100;")) < 0) {
        // sqlite3_open reads nothing; the pragma is the first read of the
        // file. A file that is no database is not a connection.
        const int error = sqlite3_errcode(database);
        if (error == SQLITE_NOTADB || error == SQLITE_CORRUPT) {
            LLOGE("Error: %s(%s)", sqlite3_errmsg(database), path);
            closeConnection();
            return -1;
        }
    }
    return 0;
}

int32_t SqlOperator::closeConnection() {
    if (mDatabase == nullptr) {
        return 0;
    }
    finalizeCachedStatements();
    if (sqlite3_close(mDatabase) != SQLITE_OK) {
        LLOGE("Error: %s", sqlite3_errmsg(mDatabase));
        return -1;
    }
    mDatabase = nullptr;
    return 0;
}

int32_t SqlOperator::beginTranscation() {
    // A transaction left open (a commit that failed) would make BEGIN fail
    // for every later flush.
    rollbackOpenTranscation();
    if (executeStatement(String8("BEGIN;")) != 0) {
        LLOGE("Failed to begin transcation");
        return -1;
    }
    return 0;
}

int32_t SqlOperator::commitTranscation() {
    if (executeStatement(String8("COMMIT;")) != 0) {
        LLOGE("Failed to commit transcation");
        // A busy commit keeps its transaction open.
        rollbackOpenTranscation();
        return -1;
    }
    return 0;
}

int32_t SqlOperator::vacuumDatabase() {
    if (executeStatement(String8("VACUUM;")) != 0) {
        LLOGE("Failed to vacuum database");
        return -1;
    }
    return 0;
}

void SqlOperator::rollbackOpenTranscation() {
    if (mDatabase == nullptr || sqlite3_get_autocommit(mDatabase) != 0) {
        return;
    }
    LLOGE("Rolling back a transcation left open");
    executeStatement(String8("ROLLBACK;"));
}

int32_t SqlOperator::createTable(const Parcel* in) {
    String8 statement;
    if (translateCreate(in, &statement) < 0) {
        LLOGE("Failed to translate create statement");
        return -1;
    }
    return executeStatement(statement);
}

int32_t SqlOperator::insertEntries(const Parcel* in) {
    String8 statement;
    std::vector<int32_t> types;
    if (translateInsert(in, &statement, &types) < 0) {
        LLOGE("Failed to translate insert statement");
        return -1;
    }
    return executeStatement(statement, types, in);
}

int32_t SqlOperator::executeEntry(const Parcel* in) {
    if (in == nullptr) {
        LLOGE("Invalid parameter");
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    String8 statement;
    if (in->readString8(&statement) != android::NO_ERROR) {
        LLOGE("Invalid statement");
        return -1;
    }
    return executeStatement(statement);
}

int32_t SqlOperator::simpleQueryEntries(const Parcel* in, Parcel* out) {
    if (in == nullptr || out == nullptr) {
        LLOGE("Invalid parameter");
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    String8 query;
    if (in->readString8(&query) != android::NO_ERROR) {
        LLOGE("Invalid query");
        return -1;
    }
    return executeStatement(query, out);
}

int32_t SqlOperator::backupCopy(const Parcel* in) {
    if (in == nullptr) {
        LLOGE("Invalid parameter");
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    if (mDatabase == nullptr) {
        LLOGE("Invalid database connection");
        return -1;
    }
    const char* path = in->readCString();
    if (path == nullptr || path[0] == '\0') {
        LLOGE("Invalid backup copy file name");
        return -1;
    }
    // A failed copy never leaves a file behind that looks like one; a file
    // that was there before is left to its owner (the copy writes it in a
    // transaction, so a failure rolls it back).
    const bool existed = access(path, F_OK) == 0;
    auto discardTarget = [existed](const char* target) {
        if (!existed) {
            unlink(target);
            unlink((std::string(target) + "-journal").c_str());
        }
    };

    sqlite3* target = nullptr;
    if (sqlite3_open(path, &target) != SQLITE_OK) {
        LLOGE("Error: %s(%s)", sqlite3_errmsg(target), path);
        sqlite3_close(target);
        discardTarget(path);
        return -1;
    }
    sqlite3_backup* backup = sqlite3_backup_init(target, "main", mDatabase, "main");
    if (backup == nullptr) {
        LLOGE("Initialize backup copy error: %s", sqlite3_errmsg(target));
        sqlite3_close(target);
        discardTarget(path);
        return -1;
    }
    int32_t result = 0;
    int rc = sqlite3_backup_step(backup, -1);
    if (rc != SQLITE_DONE) {
        LLOGE("Backup copy error: %s", sqlite3_errstr(rc));
        result = -1;
    }
    rc = sqlite3_backup_finish(backup);
    if (rc != SQLITE_OK) {
        LLOGE("Finish Backup copy error: %s", sqlite3_errmsg(target));
        result = -1;
    }
    if (sqlite3_close(target) != SQLITE_OK) {
        LLOGE("Error: %s", sqlite3_errmsg(target));
        result = -1;
    }
    if (result < 0) {
        discardTarget(path);
    }
    return result;
}

int32_t SqlOperator::translateCreate(const Parcel* in, String8* statement) {
    if (in == nullptr) {
        LLOGE("Invalid parameter");
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    std::string table;
    int32_t columns = 0;
    if (readTableHead(in, &table, &columns) < 0) {
        return -1;
    }
    std::string text = "CREATE TABLE " + table + "(";
    for (int32_t i = 0; i < columns; ++i) {
        std::string name;
        int32_t type = 0;
        if (readColumn(in, i, &name, &type) < 0) {
            return -1;
        }
        text += name;
        switch (type) {
            case COLUMN_ID:
                text += " INTEGER PRIMARY KEY";
                break;
            case COLUMN_INT:
            case COLUMN_LONG:
                text += " INTEGER";
                break;
            case COLUMN_TEXT:
                text += " VARCHAR";
                break;
            case COLUMN_TIME:
                text += " INTEGER, formatted_" + name + " VARCHAR";
                break;
            default:
                LLOGE("Unknown value type: %d", type);
                HealthCounters::add(Health::LibraryParcelRefused);
                return -1;
        }
        text += i + 1 < columns ? ", " : ");";
    }
    *statement = toString8(text);
    return 0;
}

int32_t SqlOperator::translateInsert(const Parcel* in, String8* statement,
                                     std::vector<int32_t>* types) {
    if (in == nullptr) {
        LLOGE("Invalid parameter");
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    std::string table;
    int32_t columns = 0;
    if (readTableHead(in, &table, &columns) < 0) {
        return -1;
    }
    std::string names;
    std::string placeholders;
    types->clear();
    for (int32_t i = 0; i < columns; ++i) {
        std::string name;
        int32_t type = 0;
        if (readColumn(in, i, &name, &type) < 0) {
            return -1;
        }
        if (i > 0) {
            names += ", ";
            placeholders += ", ";
        }
        names += name;
        placeholders += "?";
        if (type == COLUMN_TIME) {
            names += ", formatted_" + name;
            placeholders += ", ?";
        }
        types->push_back(type);
    }
    *statement = toString8("INSERT INTO " + table + " (" + names + ") VALUES (" + placeholders +
                           ");");
    return 0;
}

int32_t SqlOperator::checkStatement(const String8& statement) {
    // Only one statement may run: a ';' is allowed only as the last character.
    const char* semicolon = strchr(statement.string(), ';');
    if (semicolon != nullptr && semicolon[1] != '\0') {
        LLOGE("Statement may have injection issue");
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    if (mDatabase == nullptr) {
        LLOGE("Invalid database connection");
        return -1;
    }
    return 0;
}

int32_t SqlOperator::prepareStatement(const String8& statement, sqlite3_stmt** stmt) {
    *stmt = nullptr;
    int rc = sqlite3_prepare_v2(mDatabase, statement.string(), -1, stmt, nullptr);
    if (rc != SQLITE_OK || *stmt == nullptr) {
        // An empty statement prepares to nothing.
        LLOGE("Prepare statement error: %s",
              rc != SQLITE_OK ? sqlite3_errmsg(mDatabase) : "empty statement");
        sqlite3_finalize(*stmt);
        *stmt = nullptr;
        return -1;
    }
    return 0;
}

sqlite3_stmt* SqlOperator::cachedStatement(const String8& statement, bool fixed) {
    std::unordered_map<std::string, sqlite3_stmt*>& cache = fixed ? mFixedStatements : mStatements;
    auto it = cache.find(statement.string());
    if (it != cache.end()) {
        return it->second;
    }
    sqlite3_stmt* stmt = nullptr;
    if (prepareStatement(statement, &stmt) < 0) {
        return nullptr;
    }
    // Only an insert statement is added here, before its caller holds it:
    // emptying the cache never pulls a statement from under a caller.
    if (!fixed && cache.size() >= kMaxCachedStatements) {
        for (auto& entry : cache) {
            sqlite3_finalize(entry.second);
        }
        cache.clear();
    }
    cache.emplace(statement.string(), stmt);
    return stmt;
}

void SqlOperator::finalizeCachedStatements() {
    for (auto* cache : {&mStatements, &mFixedStatements}) {
        for (auto& entry : *cache) {
            sqlite3_finalize(entry.second);
        }
        cache->clear();
    }
}

int32_t SqlOperator::executeStatement(const String8& statement, bool fixed) {
    if (checkStatement(statement) < 0) {
        return -1;
    }
    LLOGD("%s", statement.string());
    sqlite3_stmt* stmt = nullptr;
    if (fixed) {
        stmt = cachedStatement(statement, true);
        if (stmt == nullptr) {
            return -1;
        }
    } else if (prepareStatement(statement, &stmt) < 0) {
        return -1;
    }
    int32_t result = 0;
    if (sqlite3_step(stmt) != SQLITE_DONE) {
        LLOGE("Execute statement error: %s", sqlite3_errmsg(mDatabase));
        result = -1;
    }
    if (fixed) {
        sqlite3_reset(stmt);
    } else {
        sqlite3_finalize(stmt);
    }
    return result;
}

int32_t SqlOperator::executeStatement(const String8& statement, const std::vector<int32_t>& types,
                                      const Parcel* in) {
    if (checkStatement(statement) < 0) {
        return -1;
    }
    LLOGD("%s", statement.string());
    // One prepared form per table, kept for the connection: a flush of many
    // small requests prepares each insert once.
    sqlite3_stmt* stmt = cachedStatement(statement, false);
    if (stmt == nullptr) {
        return -1;
    }
    int32_t rows = 0;
    if (in->readInt32(&rows) != android::NO_ERROR) {
        LLOGE("Missing entry count, statement: %s", statement.string());
        HealthCounters::add(Health::LibraryParcelRefused);
        sqlite3_reset(stmt);
        sqlite3_clear_bindings(stmt);
        return -1;
    }
    if (rows > kMaxInsertRows) {
        LLOGE("Insert entries count(%d) reach limit(%d), statement: %s", rows, kMaxInsertRows,
              statement.string());
        HealthCounters::add(Health::LibraryParcelRefused);
        sqlite3_reset(stmt);
        sqlite3_clear_bindings(stmt);
        return -1;
    }
    if (rows < 1) {
        sqlite3_reset(stmt);
        sqlite3_clear_bindings(stmt);
        return 0;
    }
    // A parcel is stored whole or not at all. One row is atomic by itself;
    // more rows go inside a savepoint. Outside a transaction the savepoint is
    // the transaction: releasing it commits.
    const bool savepoint = rows > 1;
    const bool nested = sqlite3_get_autocommit(mDatabase) == 0;
    if (savepoint && executeStatement(String8(kInsertSavepoint), true) < 0) {
        sqlite3_reset(stmt);
        sqlite3_clear_bindings(stmt);
        return -1;
    }
    int32_t result = SQLITE_DONE;
    for (int32_t i = 0; i < rows; ++i) {
        if (i > 0) {
            sqlite3_reset(stmt);
            sqlite3_clear_bindings(stmt);
        }
        int32_t bound = bindEntryValues(stmt, types, in);
        if (bound < 0) {
            LLOGE("Failed to bind entry values");
            HealthCounters::add(Health::LibraryParcelRefused);
            result = bound;
            break;
        }
        if (sqlite3_step(stmt) != SQLITE_DONE) {
            LLOGE("Execute statement error: %s", sqlite3_errmsg(mDatabase));
            result = -1;
            break;
        }
    }
    sqlite3_reset(stmt);
    sqlite3_clear_bindings(stmt);
    if (!savepoint) {
        return result;
    }
    if (result < 0) {
        executeStatement(String8(kInsertRollback), true);
        executeStatement(String8(kInsertRelease), true);
        if (!nested) {
            rollbackOpenTranscation();
        }
        return result;
    }
    if (executeStatement(String8(kInsertRelease), true) < 0) {
        if (!nested) {
            rollbackOpenTranscation();
        }
        return -1;
    }
    return result;
}

int32_t SqlOperator::executeStatement(const String8& statement, Parcel* out) {
    if (checkStatement(statement) < 0) {
        return -1;
    }
    LLOGD("%s", statement.string());
    sqlite3_stmt* stmt = nullptr;
    if (prepareStatement(statement, &stmt) < 0) {
        return -1;
    }
    const int32_t columns = sqlite3_column_count(stmt);
    const android::status_t written = out->writeInt32(columns);
    const size_t countPosition = out->dataPosition();
    if (written != android::NO_ERROR || out->writeInt32(0) != android::NO_ERROR) {
        LLOGE("Failed to write query reply");
        sqlite3_finalize(stmt);
        return -1;
    }
    int32_t rows = 0;
    int rc = SQLITE_ROW;
    while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
        for (int32_t column = 0; column < columns; ++column) {
            if (writeColumnValue(stmt, column, out) != android::NO_ERROR) {
                LLOGE("Failed to write query reply");
                sqlite3_finalize(stmt);
                return -1;
            }
        }
        ++rows;
    }
    if (rc != SQLITE_DONE) {
        LLOGE("Execute statement error: %s", sqlite3_errmsg(mDatabase));
        sqlite3_finalize(stmt);
        return -1;
    }
    const size_t end = out->dataPosition();
    out->setDataPosition(countPosition);
    out->writeInt32(rows);
    out->setDataPosition(end);
    sqlite3_finalize(stmt);
    return 0;
}

int32_t SqlOperator::bindEntryValues(sqlite3_stmt* stmt, const std::vector<int32_t>& types,
                                     const Parcel* in) {
    if (stmt == nullptr || in == nullptr) {
        LLOGE("Invalid parameter");
        return -1;
    }
    int index = 1;
    for (size_t i = 0; i < types.size(); ++i) {
        const int32_t type = types[i];
        bool present = true;
        int rc = SQLITE_OK;
        switch (type) {
            case COLUMN_INT: {
                int32_t value = 0;
                present = in->readInt32(&value) == android::NO_ERROR;
                if (present) {
                    rc = sqlite3_bind_int(stmt, index++, value);
                }
                break;
            }
            case COLUMN_LONG: {
                int64_t value = 0;
                present = in->readInt64(&value) == android::NO_ERROR;
                if (present) {
                    rc = sqlite3_bind_int64(stmt, index++, value);
                }
                break;
            }
            case COLUMN_TEXT: {
                String8 value;
                present = in->readString8(&value) == android::NO_ERROR;
                if (present) {
                    rc = sqlite3_bind_text(stmt, index++, value.string(), -1, SQLITE_TRANSIENT);
                }
                break;
            }
            case COLUMN_TIME: {
                int64_t timeMs = 0;
                present = in->readInt64(&timeMs) == android::NO_ERROR;
                if (present) {
                    rc = sqlite3_bind_int64(stmt, index++, timeMs);
                }
                if (present && rc == SQLITE_OK) {
                    char text[kTimeTextSize];
                    formatLocalTime(timeMs, text, sizeof(text));
                    rc = sqlite3_bind_text(stmt, index++, text, -1, SQLITE_TRANSIENT);
                }
                break;
            }
            default:
                // Nothing is read for it; its placeholder stays NULL.
                LLOGE("Unknown data type: %d", type);
                index++;
                break;
        }
        if (!present) {
            LLOGE("Missing value of column %zu (type %d)", i, type);
            return -1;
        }
        if (rc != SQLITE_OK) {
            LLOGE("Bind value error: %s", sqlite3_errmsg(mDatabase));
            return -1;
        }
    }
    return 0;
}

int32_t SqlOperator::writeColumnValue(sqlite3_stmt* stmt, int32_t column, Parcel* out) {
    const int type = sqlite3_column_type(stmt, column);
    switch (type) {
        case SQLITE_INTEGER:
            return out->writeInt64(sqlite3_column_int64(stmt, column));
        case SQLITE_TEXT: {
            const unsigned char* text = sqlite3_column_text(stmt, column);
            const int bytes = sqlite3_column_bytes(stmt, column);
            if (text == nullptr || bytes <= 0) {
                return out->writeString8(String8());
            }
            return out->writeString8(
                    String8(reinterpret_cast<const char*>(text), static_cast<size_t>(bytes)));
        }
        case SQLITE_NULL:
            // The reader expects the column's kind, so a NULL still takes one
            // value of it.
            if (isTextColumn(sqlite3_column_decltype(stmt, column))) {
                return out->writeString8(String8());
            }
            return out->writeInt64(0);
        case SQLITE_FLOAT:
            LLOGE("Unsupported type: %d", type);
            return out->writeInt64(truncateReal(sqlite3_column_double(stmt, column)));
        default:
            LLOGE("Unsupported type: %d", type);
            return out->writeString8(String8());
    }
}

} // namespace kelvo
