#include "storage/StorageOperator.h"

#include <cinttypes>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/KelvoAgent.h"
#include "storage/KelvoStorage.h"
#include "utils/KelvoUtils.h"

namespace kelvo {

StorageOperator::~StorageOperator() {}

void StorageOperator::addSchemaTable() {}

void StorageOperator::cleanTables(int64_t time) {}

android::sp<KelvoStorage> StorageOperator::storage() {
    android::sp<KelvoStorage> s = KelvoAgent::getInstance()->getStorage();
    if (s == nullptr) {
        KLOGE("Invalid database storage");
    }
    return s;
}

int32_t StorageOperator::addSchema(const table_attribute& table) {
    android::sp<KelvoStorage> s = storage();
    return s == nullptr ? -7 : s->addSchema(table);
}

int32_t StorageOperator::insertEntries(const table_attribute& table, const android::Parcel& rows,
                                       int32_t count, bool fromCurrent) {
    android::sp<KelvoStorage> s = storage();
    if (s == nullptr) {
        return -7;
    }
    size_t start = fromCurrent ? rows.dataPosition() : 0;
    if (count < 1 || rows.dataSize() == 0 || start >= rows.dataSize()) {
        return 0;
    }
    if (count > kMaxInsertRows) {
        KLOGE("Insert entries count(%d) reach limit(%d), table: %s", count, kMaxInsertRows,
              table.name);
        HealthCounters::add(Health::StorageEntryRefused);
        return -5;
    }
    android::Parcel insert;
    insert.writeString8(android::String8(table.name));
    insert.writeInt32(table.count);
    for (int32_t i = 0; i < table.count; ++i) {
        insert.writeString8(android::String8(table.columns[i].name));
        insert.writeInt32(table.columns[i].type);
    }
    insert.writeInt32(count);
    insert.appendFrom(&rows, start, rows.dataSize() - start);
    return s->insertEntries(insert) < 0 ? -2 : 0;
}

int32_t StorageOperator::queryEntriesSimple(const android::String8& sql, android::Parcel* reply,
                                            int32_t columns, int32_t& rows) {
    if (columns < 1 || reply == nullptr || sql.isEmpty()) {
        KLOGE("Invalid parameter");
        HealthCounters::add(Health::StorageEntryRefused);
        return -5;
    }
    android::sp<KelvoStorage> s = storage();
    if (s == nullptr) {
        return -7;
    }
    int32_t ret = s->queryEntries(sql, reply);
    if (ret < 0) {
        KLOGE("Failed to query entries");
        return ret;
    }
    int32_t resultColumns = reply->readInt32();
    if (resultColumns != columns) {
        KLOGE("Mismatch columns: %d, %d", resultColumns, columns);
        return -16;
    }
    int32_t resultRows = -1;
    if (reply->readInt32(&resultRows) != android::NO_ERROR || resultRows < 0) {
        KLOGE("Invalid rows: %d", resultRows);
        return -9;
    }
    rows = resultRows;
    return 0;
}

int32_t StorageOperator::forceFlushEntries() {
    android::sp<KelvoStorage> s = storage();
    return s == nullptr ? -7 : s->flushAllEntries();
}

int32_t StorageOperator::cleanDatabase(int64_t time) {
    android::sp<KelvoStorage> s = storage();
    if (s == nullptr) {
        return -7;
    }
    return s->cleanDatabase(time) < 0 ? -2 : 0;
}

int32_t StorageOperator::updateEntries(const table_attribute& table, const android::Parcel& row,
                                       const char* condition) {
    int32_t ret = deleteEntries(table.name, condition);
    if (ret < 0) {
        KLOGE("Failed to delete entry");
        // A delete that only timed out is still queued and runs before the
        // insert (the storage thread keeps the order): queue the row anyway,
        // so it is not lost. Any other failure keeps the old row.
        if (ret != -1) {
            return -17;
        }
    }
    return insertEntries(table, row, 1, false);
}

int32_t StorageOperator::deleteEntries(const char* table, const char* condition) {
    if (table == nullptr || condition == nullptr) {
        KLOGE("Invalid parameter");
        HealthCounters::add(Health::StorageEntryRefused);
        return -5;
    }
    android::sp<KelvoStorage> s = storage();
    if (s == nullptr) {
        return -7;
    }
    s->flushAllEntries();
    return s->executeEntry(android::String8::format("DELETE FROM %s WHERE %s", table, condition),
                           true);
}

int32_t StorageOperator::cleanObsoleteEntries(const char* table, int64_t time,
                                              const char* column) {
    if (table == nullptr || column == nullptr) {
        KLOGE("Invalid parameter");
        HealthCounters::add(Health::StorageEntryRefused);
        return -5;
    }
    android::sp<KelvoStorage> s = storage();
    if (s == nullptr) {
        return -7;
    }
    return s->executeEntry(android::String8::format("DELETE FROM %s WHERE %s <= %" PRId64, table,
                                                    column, time),
                           false) < 0
            ? -2
            : 0;
}

int32_t StorageOperator::cleanAllEntries(const char* table) {
    if (table == nullptr) {
        KLOGE("Invalid parameter");
        HealthCounters::add(Health::StorageEntryRefused);
        return -5;
    }
    android::sp<KelvoStorage> s = storage();
    if (s == nullptr) {
        return -7;
    }
    return s->executeEntry(android::String8::format("DELETE FROM %s", table), false) < 0 ? -2 : 0;
}

int32_t StorageOperator::logSimpleQueryResult(const table_attribute& table,
                                              const android::Parcel& reply, int64_t time) {
    if (reply.dataSize() == 0) {
        return 0;
    }
    reply.setDataPosition(0);
    int32_t columns = reply.readInt32();
    if (columns != table.count - 1) {
        KLOGE("Table column count not match");
        return 0;
    }
    int32_t count = 0;
    if (reply.readInt32(&count) != android::NO_ERROR || count < 0) {
        KLOGE("Invalid rows: %d", count);
        return -9;
    }
    android::Parcel rows;
    for (int32_t r = 0; r < count; ++r) {
        for (int32_t c = 0; c < table.count; ++c) {
            android::status_t status = android::NO_ERROR;
            switch (table.columns[c].type) {
                case COLUMN_INT: {
                    int64_t v = 0;
                    status = reply.readInt64(&v);
                    rows.writeInt32(static_cast<int32_t>(v));
                    break;
                }
                case COLUMN_LONG: {
                    int64_t v = 0;
                    status = reply.readInt64(&v);
                    rows.writeInt64(v);
                    break;
                }
                case COLUMN_TEXT: {
                    android::String8 v;
                    status = reply.readString8(&v);
                    rows.writeString8(v);
                    break;
                }
                case COLUMN_TIME:
                    rows.writeInt64(time);
                    break;
                default:
                    KLOGE("Unknown storage type: %d", table.columns[c].type);
                    break;
            }
            if (status != android::NO_ERROR) {
                // The reply holds fewer values than it announced: keep
                // nothing rather than rows shifted out of their columns.
                KLOGE("Invalid rows: %d", count);
                return -9;
            }
        }
    }
    return insertEntries(table, rows, count, false);
}

} // namespace kelvo
