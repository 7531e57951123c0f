// Rows through the storage path (insertEntries, buffered, flushed in one
// transaction) against the same rows through a plain prepared INSERT loop in
// one transaction, on the same machine in the same run.

#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "core/KelvoAgent.h"
#include "kelvo/RootPath.h"
#include "storage/StorageOperator.h"

using android::Parcel;
using android::String8;

namespace {

using Clock = std::chrono::steady_clock;

// A realistic raw table: times, a package, a uid, energies and states.
const kelvo::column_attribute kColumns[] = {
        {kelvo::COLUMN_TIME, "start_time"}, {kelvo::COLUMN_TIME, "end_time"},
        {kelvo::COLUMN_TEXT, "name"},       {kelvo::COLUMN_INT, "uid"},
        {kelvo::COLUMN_LONG, "foreground_duration"},
        {kelvo::COLUMN_LONG, "foreground_energy"},
        {kelvo::COLUMN_INT, "state"},       {kelvo::COLUMN_TEXT, "detail"},
};
const kelvo::table_attribute kTable = {"1.0", 1, 8, kColumns, "raw_applications_bench"};

constexpr int kRows = 60000;

void writeRow(Parcel* p, int64_t i) {
    p->writeInt64(1700000000000LL + i * 1000);
    p->writeInt64(1700000000000LL + i * 1000 + 900);
    p->writeString8(String8("com.example.application.name"));
    p->writeInt32(10000 + static_cast<int32_t>(i % 60));
    p->writeInt64(900);
    p->writeInt64(i * 17);
    p->writeInt32(static_cast<int32_t>(i % 2));
    p->writeString8(String8("screen_on"));
}

std::string makeRoot() {
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    char* dir = mkdtemp(tmpl);
    return dir != nullptr ? dir : "/tmp";
}

void removeRoot(const std::string& root) {
    if (root.rfind("/tmp/kelvo-bench-", 0) == 0) {
        std::string cmd = "rm -rf '" + root + "'";
        int ignored = system(cmd.c_str());
        (void)ignored;
    }
}

// Rows per second through StorageOperator::insertEntries, `perCall` rows per
// call, until the final flush has committed them.
double storageRate(int perCall) {
    android::sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    std::string root = makeRoot();
    kelvo::RootPath::setRoot(root.c_str());
    kelvo::StorageOperator::addSchema(kTable);
    if (storage->startConnection() != 0) {
        return -1;
    }
    Clock::time_point start = Clock::now();
    for (int i = 0; i < kRows; i += perCall) {
        Parcel rows;
        for (int r = 0; r < perCall; ++r) {
            writeRow(&rows, i + r);
        }
        kelvo::StorageOperator::insertEntries(kTable, rows, perCall, false);
    }
    kelvo::StorageOperator::forceFlushEntries();
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    storage->closeConnection();
    removeRoot(root);
    return kRows / seconds;
}

// The same rows with one prepared statement in one transaction.
double rawRate() {
    std::string root = makeRoot();
    std::string path = root + "/raw.db";
    sqlite3* db = nullptr;
    sqlite3_open(path.c_str(), &db);
    sqlite3_exec(db,
                 "CREATE TABLE raw_applications_bench(id INTEGER PRIMARY KEY, start_time INTEGER, "
                 "formatted_start_time VARCHAR, end_time INTEGER, formatted_end_time VARCHAR, "
                 "name VARCHAR, uid INTEGER, foreground_duration INTEGER, foreground_energy "
                 "INTEGER, state INTEGER, detail VARCHAR);",
                 nullptr, nullptr, nullptr);
    Clock::time_point start = Clock::now();
    sqlite3_exec(db, "BEGIN;", nullptr, nullptr, nullptr);
    sqlite3_stmt* stmt = nullptr;
    sqlite3_prepare_v2(db,
                       "INSERT INTO raw_applications_bench (start_time, formatted_start_time, "
                       "end_time, formatted_end_time, name, uid, foreground_duration, "
                       "foreground_energy, state, detail) VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?);",
                       -1, &stmt, nullptr);
    for (int64_t i = 0; i < kRows; ++i) {
        int64_t startMs = 1700000000000LL + i * 1000;
        char startText[20];
        char endText[20];
        time_t s = static_cast<time_t>(startMs / 1000);
        time_t e = static_cast<time_t>((startMs + 900) / 1000);
        struct tm tmValue;
        strftime(startText, sizeof(startText), "%Y-%m-%d %H:%M:%S", localtime_r(&s, &tmValue));
        strftime(endText, sizeof(endText), "%Y-%m-%d %H:%M:%S", localtime_r(&e, &tmValue));
        sqlite3_bind_int64(stmt, 1, startMs);
        sqlite3_bind_text(stmt, 2, startText, -1, SQLITE_TRANSIENT);
        sqlite3_bind_int64(stmt, 3, startMs + 900);
        sqlite3_bind_text(stmt, 4, endText, -1, SQLITE_TRANSIENT);
        sqlite3_bind_text(stmt, 5, "com.example.application.name", -1, SQLITE_TRANSIENT);
        sqlite3_bind_int(stmt, 6, 10000 + static_cast<int>(i % 60));
        sqlite3_bind_int64(stmt, 7, 900);
        sqlite3_bind_int64(stmt, 8, i * 17);
        sqlite3_bind_int(stmt, 9, static_cast<int>(i % 2));
        sqlite3_bind_text(stmt, 10, "screen_on", -1, SQLITE_TRANSIENT);
        sqlite3_step(stmt);
        sqlite3_reset(stmt);
        sqlite3_clear_bindings(stmt);
    }
    sqlite3_finalize(stmt);
    sqlite3_exec(db, "COMMIT;", nullptr, nullptr, nullptr);
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    sqlite3_close(db);
    removeRoot(root);
    return kRows / seconds;
}

void BM_StorageVsRawSqlite(benchmark::State& state) {
    double storage = 0;
    double storageSingle = 0;
    double raw = 0;
    for (auto _ : state) {
        raw = rawRate();
        storage = storageRate(10);
        storageSingle = storageRate(1);
    }
    if (storage < 0 || storageSingle < 0) {
        state.SkipWithError("storage did not start");
        return;
    }
    state.counters["raw_sqlite_rows_per_s"] = raw;
    state.counters["storage_rows_per_s"] = storage;
    state.counters["storage_vs_raw_sqlite_ratio"] = storage / raw;
    state.counters["storage_single_row_calls_rows_per_s"] = storageSingle;
    state.counters["storage_single_row_calls_vs_raw_ratio"] = storageSingle / raw;
}
BENCHMARK(BM_StorageVsRawSqlite)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

} // namespace
