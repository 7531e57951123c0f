#pragma once

#include <gtest/gtest.h>
#include <json/json.h>
#include <sqlite3.h>

#include <memory>
#include <string>
#include <vector>

#include "common/TestEnv.h"
#include "storage/KelvoStorage.h"

namespace kelvo {
namespace test {

// Reads the database file directly, beside the daemon's own connection.
class DirectDb {
public:
    explicit DirectDb(const std::string& path);
    DirectDb(const DirectDb&) = delete;
    DirectDb& operator=(const DirectDb&) = delete;
    ~DirectDb();
    bool ok() const { return mDb != nullptr; }
    // Every row of the query, its columns as text joined by '|' ("" for
    // NULL); an "error: ..." entry when the query fails.
    std::vector<std::string> column(const std::string& sql) const;
    long long scalar(const std::string& sql) const;
    int exec(const std::string& sql) const;

private:
    sqlite3* mDb = nullptr;
};

// The daemon's key-value table, as its system handler defines it.
inline const column_attribute kAboutColumns[] = {
        {COLUMN_TIME, "timestamp"},
        {COLUMN_TEXT, "key"},
        {COLUMN_TEXT, "value"},
};
inline const table_attribute kAbout = {"1.0", 1, 3, kAboutColumns, "about_kelvo_daemon"};

// The process-wide agent's storage thread, started on a fresh root with the
// tables addTables() registers; stopped after the test.
class AgentStorageTest : public ::testing::Test {
protected:
    void SetUp() override;
    void TearDown() override;
    virtual void addTables() {}

    std::string dbPath() const { return mRoot->path() + KelvoStorage::kDatabasePath; }
    // Rows of the query once the buffered rows are written.
    std::vector<std::string> rows(const std::string& select);
    // The events the uploader has sent so far, in order.
    std::vector<Json::Value> events() const;

    std::unique_ptr<TempRoot> mRoot;
    android::sp<KelvoStorage> mStorage;
};

} // namespace test
} // namespace kelvo
