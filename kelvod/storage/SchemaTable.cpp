#include "storage/SchemaTable.h"

#include <set>
#include <vector>

#include "KelvoLog.h"
#include "storage/KelvoStorage.h"

namespace kelvo {

namespace {

const column_attribute kVersionColumns[] = {
        {COLUMN_TEXT, "module"},
        {COLUMN_TEXT, "version"},
};

const table_attribute kVersionTable = {"1.0", 0, 2, kVersionColumns, "schema_version"};

} // namespace

const table_attribute& SchemaTable::versionTable() {
    return kVersionTable;
}

SchemaTable::SchemaTable(KelvoStorage* storage) : mStorage(storage) {
    addSchema(kVersionTable);
}

int32_t SchemaTable::addSchema(const table_attribute& table) {
    bool added = false;
    {
        std::lock_guard<std::mutex> guard(mLock);
        added = mTables.emplace(table.name, &table).second;
    }
    // Logged without the lock: an error line may be forwarded to other
    // threads' locks.
    if (!added) {
        KLOGE("Table name %s already exist", table.name);
        return -13;
    }
    return 0;
}

void SchemaTable::clearSchema() {
    std::lock_guard<std::mutex> guard(mLock);
    mTables.clear();
    // The version table is always registered: a later start needs it too.
    mTables.emplace(kVersionTable.name, &kVersionTable);
}

size_t SchemaTable::size() {
    std::lock_guard<std::mutex> guard(mLock);
    return mTables.size();
}

void SchemaTable::makeColumns(const table_attribute& table, android::Parcel* out) {
    out->writeString8(android::String8(table.name));
    out->writeInt32(table.count + table.has_id);
    if (table.has_id == 1) {
        out->writeString8(android::String8("id"));
        out->writeInt32(COLUMN_ID);
    }
    for (int32_t i = 0; i < table.count; ++i) {
        out->writeString8(android::String8(table.columns[i].name));
        out->writeInt32(table.columns[i].type);
    }
}

void SchemaTable::makeVersion(const table_attribute& table, android::Parcel* out) {
    out->writeString8(android::String8(kVersionTable.name));
    out->writeInt32(kVersionTable.count);
    for (int32_t i = 0; i < kVersionTable.count; ++i) {
        out->writeString8(android::String8(kVersionTable.columns[i].name));
        out->writeInt32(kVersionTable.columns[i].type);
    }
    out->writeInt32(1);
    out->writeString8(android::String8(table.name));
    out->writeString8(android::String8(table.version));
}

void SchemaTable::createTables() {
    std::vector<const table_attribute*> tables;
    {
        std::lock_guard<std::mutex> guard(mLock);
        for (const auto& entry : mTables) {
            tables.push_back(entry.second);
        }
    }
    for (const table_attribute* table : tables) {
        android::Parcel create;
        makeColumns(*table, &create);
        create.setDataPosition(0);
        if (mStorage->doCreateTable(create) < 0) {
            KLOGE("Failed to create table: %s", table->name);
            continue;
        }
        android::Parcel version;
        makeVersion(*table, &version);
        mStorage->bufferInsert(
            ParcelMessage(MESSAGE_STORAGE_ENTRY, STORAGE_INSERT_ENTRIES, version));
    }
}

int32_t SchemaTable::checkVersions() {
    android::String8 query("SELECT module, version FROM schema_version");
    android::Parcel reply;
    if (mStorage->runQuery(query, &reply) < 0) {
        KLOGE("Failed to query schema version table");
        return -2;
    }
    return compareVersions(reply);
}

int32_t SchemaTable::compareVersions(const android::Parcel& reply) {
    reply.readInt32(); // column count
    int32_t rows = 0;
    if (reply.readInt32(&rows) != android::NO_ERROR || compareCount(rows) != 0) {
        return -16;
    }
    std::set<std::string> seen;
    for (int32_t i = 0; i < rows; ++i) {
        android::String8 module;
        android::String8 version;
        if (reply.readString8(&module) != android::NO_ERROR ||
            reply.readString8(&version) != android::NO_ERROR) {
            KLOGE("schema mismatch, malformed records");
            return -16;
        }
        if (!seen.insert(module.string()).second) {
            KLOGE("schema mismatch, duplicate records");
            return -16;
        }
        if (compareVersion(module, version) != 0) {
            return -16;
        }
    }
    KLOGD("schema matched with the existing");
    return 0;
}

int32_t SchemaTable::compareCount(int32_t rows) {
    std::lock_guard<std::mutex> guard(mLock);
    if (rows < 0 || static_cast<size_t>(rows) != mTables.size()) {
        KLOGI("schema row count mismatch, old count = %d, new count = %d", rows,
              static_cast<int32_t>(mTables.size()));
        return -16;
    }
    return 0;
}

int32_t SchemaTable::compareVersion(const android::String8& name,
                                    const android::String8& version) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mTables.find(name.string());
    if (it == mTables.end()) {
        KLOGI("schema name mismatch, name: %s, version: %s", name.string(), version.string());
        return -16;
    }
    if (version != it->second->version) {
        KLOGI("schema version mismatch, name: %s, old version: %s, new version: %s",
              name.string(), version.string(), it->second->version);
        return -16;
    }
    return 0;
}

} // namespace kelvo
