#pragma once

#include <stdint.h>

#include <map>
#include <mutex>
#include <string>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "storage/TableAttribute.h"

namespace kelvo {

class KelvoStorage;

// The registry of table definitions. At start-up it either confirms that the
// database was created from exactly these definitions (schema_version holds
// one row per table with its version) or creates every table anew.
// createTables and checkVersions run on the storage thread (its start-up
// message); the registry's lock is never held while they run SQL or log.
class SchemaTable {
public:
    explicit SchemaTable(KelvoStorage* storage);

    // 0, or -13 when the name is already registered (the first one stays).
    int32_t addSchema(const table_attribute& table);
    void createTables();
    // 0 when schema_version matches the registry exactly, -2 when it cannot be
    // read, -16 on any difference.
    int32_t checkVersions();
    void clearSchema();
    size_t size();

    static const table_attribute& versionTable();

    // The create parcel and the schema_version row of one definition.
    static void makeColumns(const table_attribute& table, android::Parcel* out);
    static void makeVersion(const table_attribute& table, android::Parcel* out);

private:
    int32_t compareVersions(const android::Parcel& reply);
    int32_t compareCount(int32_t rows);
    int32_t compareVersion(const android::String8& name, const android::String8& version);

    KelvoStorage* mStorage;
    std::mutex mLock;
    // Ordered byte-wise by name.
    std::map<std::string, const table_attribute*> mTables;
};

} // namespace kelvo
