#pragma once

#include <stdint.h>

#include <binder/Parcel.h>
#include <utils/StrongPointer.h>
#include <utils/String8.h>

#include "storage/TableAttribute.h"

namespace kelvo {

class KelvoStorage;

// The way everything that owns tables reaches the database: each operation
// becomes a request to the agent's storage thread. Rows are written by the
// caller as an entry record: one value per listed column in column order
// (int32 for INT, int64 for LONG and TIME, String8 for TEXT), row after row.
class StorageOperator {
public:
    virtual ~StorageOperator();
    // Registers the owner's table definitions.
    virtual void addSchemaTable();
    // Deletes the owner's obsolete rows; runs on the storage thread, so it
    // may use only the asynchronous operations below.
    virtual void cleanTables(int64_t time);

    static int32_t addSchema(const table_attribute& table);
    // Queues rows (buffered; written by the next flush). The rows are read
    // from position 0, or from their current position when fromCurrent.
    static int32_t insertEntries(const table_attribute& table, const android::Parcel& rows,
                                 int32_t count, bool fromCurrent);
    // Runs a query on what is on disk and checks its shape; the reply is left
    // at the first value.
    static int32_t queryEntriesSimple(const android::String8& sql, android::Parcel* reply,
                                      int32_t columns, int32_t& rows);
    static int32_t forceFlushEntries();
    static int32_t cleanDatabase(int64_t time);
    // Replaces the rows matching the condition by the one row given.
    static int32_t updateEntries(const table_attribute& table, const android::Parcel& row,
                                 const char* condition);
    static int32_t deleteEntries(const char* table, const char* condition);
    static int32_t cleanObsoleteEntries(const char* table, int64_t time, const char* column);
    static int32_t cleanAllEntries(const char* table);
    // Copies a query result into a table whose first column is a time
    // column, stamping it with the given time.
    static int32_t logSimpleQueryResult(const table_attribute& table,
                                        const android::Parcel& reply, int64_t time);

private:
    static android::sp<KelvoStorage> storage();
};

} // namespace kelvo
