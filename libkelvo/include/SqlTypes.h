#pragma once

namespace kelvo {

// Column types of table definitions, create parcels and insert parcels.
enum column_type {
    COLUMN_ID = 0,   // " INTEGER PRIMARY KEY"; never sent in a row
    COLUMN_INT = 1,  // " INTEGER"; int32 in a row
    COLUMN_LONG = 2, // " INTEGER"; int64 in a row
    COLUMN_TEXT = 3, // " VARCHAR"; String8 in a row
    COLUMN_TIME = 4, // " INTEGER" plus "formatted_<name> VARCHAR"; int64 ms in a row
};

// Actions of doSqliteOperation.
enum sql_action {
    SQL_OPEN_CONNECTION = 0,  // in: C string path
    SQL_CLOSE_CONNECTION = 1,
    SQL_BEGIN_TRANSACTION = 2,
    SQL_COMMIT_TRANSACTION = 3,
    SQL_VACUUM_DATABASE = 4,
    SQL_CREATE_TABLE = 5,     // in: create parcel
    SQL_INSERT_ENTRIES = 6,   // in: insert parcel
    SQL_EXECUTE_ENTRY = 7,    // in: String8 statement
    SQL_SIMPLE_QUERY = 8,     // in: String8 query; out: query reply
    SQL_BACKUP_COPY = 9,      // in: C string path of the copy
};

// Most rows one insert parcel may carry.
constexpr int kMaxInsertRows = 5000;

} // namespace kelvo
