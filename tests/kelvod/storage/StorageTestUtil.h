#pragma once

#include <sqlite3.h>

#include <string>
#include <vector>

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
    sqlite3* handle() const { return mDb; }

private:
    sqlite3* mDb = nullptr;
};

} // namespace test
} // namespace kelvo
