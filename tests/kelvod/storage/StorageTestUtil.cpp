#include "kelvod/storage/StorageTestUtil.h"

#include <sstream>

#include "core/KelvoAgent.h"
#include "kelvo/ZendrelHost.h"
#include "storage/DataUploader.h"

namespace kelvo {
namespace test {

DirectDb::DirectDb(const std::string& path) {
    if (sqlite3_open_v2(path.c_str(), &mDb, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
        sqlite3_close(mDb);
        mDb = nullptr;
        return;
    }
    sqlite3_busy_timeout(mDb, 2000);
}

DirectDb::~DirectDb() {
    sqlite3_close(mDb);
}

std::vector<std::string> DirectDb::column(const std::string& sql) const {
    std::vector<std::string> out;
    sqlite3_stmt* stmt = nullptr;
    if (mDb == nullptr || sqlite3_prepare_v2(mDb, sql.c_str(), -1, &stmt, nullptr) != SQLITE_OK) {
        out.push_back(std::string("error: ") + (mDb != nullptr ? sqlite3_errmsg(mDb) : "closed"));
        sqlite3_finalize(stmt);
        return out;
    }
    int rc;
    while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
        std::string row;
        for (int i = 0; i < sqlite3_column_count(stmt); ++i) {
            const unsigned char* text = sqlite3_column_text(stmt, i);
            row += (i > 0 ? "|" : "") +
                   std::string(text != nullptr ? reinterpret_cast<const char*>(text) : "");
        }
        out.push_back(row);
    }
    if (rc != SQLITE_DONE) {
        out.push_back(std::string("error: ") + sqlite3_errmsg(mDb));
    }
    sqlite3_finalize(stmt);
    return out;
}

long long DirectDb::scalar(const std::string& sql) const {
    std::vector<std::string> rows = column(sql);
    if (rows.empty() || rows[0].rfind("error:", 0) == 0) {
        return -1;
    }
    return std::stoll(rows[0]);
}

int DirectDb::exec(const std::string& sql) const {
    return mDb == nullptr ? SQLITE_ERROR : sqlite3_exec(mDb, sql.c_str(), nullptr, nullptr, nullptr);
}

void AgentStorageTest::SetUp() {
    mRoot.reset(new TempRoot());
    mStorage = KelvoAgent::getInstance()->getStorage();
    addTables();
    ASSERT_EQ(0, mStorage->startConnection());
}

void AgentStorageTest::TearDown() {
    DataUploader::getInstance()->uploadEvent();
    mStorage->flushAllEntries();
    mStorage->closeConnection();
    mRoot.reset();
}

std::vector<std::string> AgentStorageTest::rows(const std::string& select) {
    mStorage->flushAllEntries();
    return DirectDb(dbPath()).column(select);
}

std::vector<Json::Value> AgentStorageTest::events() const {
    std::vector<Json::Value> out;
    std::istringstream lines(mRoot->readFile(KELVO_ZENDREL_EVENTS_FILE));
    std::string line;
    while (std::getline(lines, line)) {
        Json::Value value;
        Json::CharReaderBuilder builder;
        std::string errors;
        std::istringstream in(line);
        EXPECT_TRUE(Json::parseFromStream(builder, in, &value, &errors)) << line;
        out.push_back(value);
    }
    return out;
}

} // namespace test
} // namespace kelvo

// Sanitizer builds scribble over freed memory, so that a statement used after
// it was finalized fails at once, even inside the uninstrumented SQLite
// library (the statement-cache test relies on it).
extern "C" const char* __asan_default_options() {
    return "max_free_fill_size=65536";
}
