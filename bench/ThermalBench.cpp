// One thermal episode summed and uploaded: the thermal handler's record
// message run to its end (forced flush, the battery and component queries
// over the episode, the scaling and the immediate upload) over a day of
// rows in every component table: a component row every 30 s, and one per
// application (20 of them) every minute. The median of 20 episodes.

#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "core/KelvoAgent.h"
#include "handlers/ThermalHandler.h"
#include "handlers/components/AudioHandler.h"
#include "handlers/components/BatteryHandler.h"
#include "handlers/components/BluetoothHandler.h"
#include "handlers/components/CameraHandler.h"
#include "handlers/components/CpuHandler.h"
#include "handlers/components/DisplayHandler.h"
#include "handlers/components/FlashlightHandler.h"
#include "handlers/components/GnssHandler.h"
#include "handlers/components/GpuHandler.h"
#include "handlers/components/SensorHandler.h"
#include "handlers/components/WifiHandler.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "storage/KelvoStorage.h"

using android::Parcel;
using android::sp;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int64_t kStart = 1796515200000LL;  // 2026-12-06 00:00:00 UTC
constexpr int64_t kDayMs = 86400000;
constexpr int kEpisodes = 20;
constexpr int kApps = 20;

// A day of rows in one raw table: every column gets a small value, times
// follow the schedule.
bool fillTable(sqlite3* db, const std::string& table) {
    std::vector<std::pair<std::string, std::string>> columns;  // name, declared type
    sqlite3_stmt* info = nullptr;
    if (sqlite3_prepare_v2(db, ("PRAGMA table_info(" + table + ")").c_str(), -1, &info, nullptr) !=
        SQLITE_OK) {
        return false;
    }
    while (sqlite3_step(info) == SQLITE_ROW) {
        std::string name = reinterpret_cast<const char*>(sqlite3_column_text(info, 1));
        const unsigned char* type = sqlite3_column_text(info, 2);
        if (name != "id") columns.push_back({name, type != nullptr ? (const char*)type : ""});
    }
    sqlite3_finalize(info);
    if (columns.empty()) {
        return false;
    }
    const bool perApp = table.find("applications") != std::string::npos;
    std::string sql = "INSERT INTO " + table + " (";
    std::string marks;
    for (size_t i = 0; i < columns.size(); ++i) {
        sql += (i > 0 ? ", " : "") + columns[i].first;
        marks += i > 0 ? ", ?" : "?";
    }
    sql += ") VALUES (" + marks + ")";
    sqlite3_stmt* insert = nullptr;
    if (sqlite3_prepare_v2(db, sql.c_str(), -1, &insert, nullptr) != SQLITE_OK) {
        return false;
    }
    const int64_t step = perApp ? 60000 : 30000;
    for (int64_t end = kStart + step; end <= kStart + kDayMs; end += step) {
        for (int app = 0; app < (perApp ? kApps : 1); ++app) {
            for (size_t i = 0; i < columns.size(); ++i) {
                const std::string& name = columns[i].first;
                const int index = static_cast<int>(i) + 1;
                if (name == "start_time") {
                    sqlite3_bind_int64(insert, index, end - step);
                } else if (name == "end_time") {
                    sqlite3_bind_int64(insert, index, end);
                } else if (columns[i].second.find("TEXT") != std::string::npos) {
                    sqlite3_bind_text(insert, index, ("com.bench.app" + std::to_string(app)).c_str(),
                                      -1, SQLITE_TRANSIENT);
                } else {
                    sqlite3_bind_int64(insert, index, 100 + app);
                }
            }
            if (sqlite3_step(insert) != SQLITE_DONE) {
                sqlite3_finalize(insert);
                return false;
            }
            sqlite3_reset(insert);
        }
    }
    sqlite3_finalize(insert);
    return true;
}

void BM_ThermalEpisode(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    char tmpl[] = "/tmp/kelvo-bench-thermal-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        state.SkipWithError("no root");
        return;
    }
    const std::string root = tmpl;
    kelvo::RootPath::setRoot(root.c_str());
    kelvo::WallClock::setFixedTimeMs(kStart + kDayMs);
    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    for (sp<kelvo::KelvoOperator> op : {sp<kelvo::KelvoOperator>(new kelvo::BatteryHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::DisplayHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::CpuHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::GnssHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::SensorHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::GpuHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::CameraHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::FlashlightHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::AudioHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::WifiHandler()),
                                        sp<kelvo::KelvoOperator>(new kelvo::BluetoothHandler())}) {
        op->addSchemaTable();
        op->requestThreadExit();
        op->join();
    }
    sp<kelvo::ThermalHandler> handler = new kelvo::ThermalHandler();
    handler->addSchemaTable();
    bool failed = storage->startConnection() != 0;

    sqlite3* db = nullptr;
    failed |= sqlite3_open((root + kelvo::KelvoStorage::kDatabasePath).c_str(), &db) != SQLITE_OK;
    std::vector<std::string> tables;
    sqlite3_stmt* list = nullptr;
    if (!failed && sqlite3_prepare_v2(db,
                                      "SELECT name FROM sqlite_master WHERE type = 'table' AND "
                                      "(name LIKE 'raw_component_%' OR name LIKE "
                                      "'raw_applications_%')",
                                      -1, &list, nullptr) == SQLITE_OK) {
        while (sqlite3_step(list) == SQLITE_ROW) {
            tables.push_back(reinterpret_cast<const char*>(sqlite3_column_text(list, 0)));
        }
    }
    sqlite3_finalize(list);
    failed |= tables.size() < 10;
    sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr);
    for (const std::string& table : tables) {
        failed |= !fillTable(db, table);
    }
    sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr);
    sqlite3_close(db);

    std::vector<double> ms;
    for (auto _ : state) {
        for (int i = 0; i < kEpisodes && !failed; ++i) {
            // Ten-minute episodes spread over the day.
            Parcel episode;
            const int64_t start = kStart + (i + 1) * (kDayMs / (kEpisodes + 2));
            episode.writeInt64(start);
            episode.writeInt64(start + 600000);
            Clock::time_point begin = Clock::now();
            failed |= handler->sendMessageSync(kelvo::ParcelMessage(
                          kelvo::MESSAGE_CUSTOMIZED, kelvo::ThermalHandler::MESSAGE_RECORD_EPISODE,
                          episode)) < 0;
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - begin).count());
        }
    }
    handler->requestThreadExit();
    handler->join();
    handler.clear();
    storage->closeConnection();
    kelvo::WallClock::setFixedTimeMs(-1);
    kelvo::RootPath::setRoot(savedRoot.c_str());
    std::string cmd = "rm -rf '" + root + "'";
    if (system(cmd.c_str()) != 0 || failed || ms.empty()) {
        state.SkipWithError("a thermal episode failed");
        return;
    }
    std::sort(ms.begin(), ms.end());
    state.counters["thermal_episode_ms"] = ms[ms.size() / 2];
}
BENCHMARK(BM_ThermalEpisode)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
