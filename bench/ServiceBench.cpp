// The service side: a component query over all 14 modules with 48 hours of
// hourly rows each, from the request to the listener's answer; and
// `dumpsys KelvoService --dump` through binder with 18 operators, each
// answering on its own thread.

#include <benchmark/benchmark.h>
#include <binder/IServiceManager.h>
#include <binder/ServiceControl.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <vector>

#include "binder/IKelvoListener.h"
#include "binder/KelvoService.h"
#include "core/KelvoAgent.h"
#include "core/QueryService.h"
#include "kelvo/RootPath.h"

using android::Parcel;
using android::sp;
using Clock = std::chrono::steady_clock;

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr int kHours = 48;

class CountingListener : public kelvo::BnKelvoListener {
public:
    void onQueryResponse(const Parcel& response) override {
        std::lock_guard<std::mutex> guard(mLock);
        mBytes = response.dataSize();
        mCount++;
        mCond.notify_all();
    }
    bool waitFor(int count, size_t* bytes) {
        std::unique_lock<std::mutex> lock(mLock);
        bool ok = mCond.wait_for(lock, std::chrono::seconds(10), [&] { return mCount >= count; });
        *bytes = mBytes;
        return ok;
    }

private:
    std::mutex mLock;
    std::condition_variable mCond;
    int mCount = 0;
    size_t mBytes = 0;
};

// A fresh root with the agent's storage started; removed at the end.
class BenchRoot {
public:
    BenchRoot() {
        char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
        mRoot = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
        kelvo::RootPath::setRoot(mRoot.c_str());
        mStorage = kelvo::KelvoAgent::getInstance()->getStorage();
        mOk = mStorage->startConnection() == 0;
    }
    ~BenchRoot() {
        mStorage->closeConnection();
        std::string cmd = "rm -rf '" + mRoot + "'";
        if (mRoot.rfind("/tmp/kelvo-bench-", 0) == 0) {
            int ignored = system(cmd.c_str());
            (void)ignored;
        }
    }
    bool ok() const { return mOk; }
    bool exec(const std::string& sql) const {
        sqlite3* db = nullptr;
        std::string path = kelvo::RootPath::resolve(kelvo::KelvoStorage::kDatabasePath);
        bool ok = sqlite3_open(path.c_str(), &db) == SQLITE_OK &&
                  sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK;
        sqlite3_close(db);
        return ok;
    }

private:
    std::string mRoot;
    sp<kelvo::KelvoStorage> mStorage;
    bool mOk = false;
};

std::string hourlyTables() {
    std::string sql = "BEGIN;";
    auto add = [&sql](const std::string& table, const std::string& columns, int values) {
        sql += "CREATE TABLE " + table + " (timestamp INTEGER, " + columns + ");";
        for (int h = 1; h <= kHours; ++h) {
            sql += "INSERT INTO " + table + " VALUES (" + std::to_string(h * kHourMs);
            for (int v = 0; v < values; ++v) sql += ", " + std::to_string(h * 7 + v);
            sql += ");";
        }
    };
    for (const char* t : {"audio", "bluetooth", "front_camera", "rear_camera", "cpu", "flashlight",
                          "gnss", "modem", "sensor", "wifi"}) {
        add(std::string("hourly_component_") + t,
            "foreground_energy INTEGER, background_energy INTEGER", 2);
    }
    for (const char* t : {"backlight", "gpu", "dpm"}) {
        add(std::string("hourly_component_") + t, "energy INTEGER", 1);
    }
    add("hourly_component_battery",
        "discharge_screen_on_gas_gauge INTEGER, discharge_screen_off_gas_gauge INTEGER", 2);
    return sql + "COMMIT;";
}

void BM_QueryComponent(benchmark::State& state) {
    BenchRoot root;
    if (!root.ok() || !root.exec(hourlyTables())) {
        state.SkipWithError("no database");
        return;
    }
    sp<CountingListener> listener = new CountingListener();
    constexpr int kQueries = 200;
    std::vector<double> ms;
    size_t bytes = 0;
    for (auto _ : state) {
        for (int i = 0; i < kQueries; ++i) {
            Parcel query;
            query.writeInt64(0);
            query.writeInt64(kHours * kHourMs);
            query.writeInt32((1 << kelvo::QueryService::MODULE_COUNT) - 1);
            query.writeInt32(0);
            query.writeStrongBinder(listener);
            Clock::time_point start = Clock::now();
            kelvo::KelvoAgent::getInstance()->requestQuery(kelvo::QueryService::QUERY_COMPONENT,
                                                           query);
            if (!listener->waitFor(i + 1, &bytes)) {
                state.SkipWithError("no answer");
                return;
            }
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - start).count());
        }
    }
    // 13 series of 48 rows and the DPM module's empty block (no handler).
    if (bytes < 13 * kHours * 16) {
        state.SkipWithError("short answer");
        return;
    }
    std::nth_element(ms.begin(), ms.begin() + ms.size() / 2, ms.end());
    state.counters["query_component_ms"] = ms[ms.size() / 2];
}
BENCHMARK(BM_QueryComponent)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

void BM_DumpsysDump(benchmark::State& state) {
    BenchRoot root;
    if (!root.ok()) {
        state.SkipWithError("no database");
        return;
    }
    sp<kelvo::KelvoAgent> agent = kelvo::KelvoAgent::getInstance();
    std::vector<sp<kelvo::KelvoOperator>> operators;
    for (int id = 0; id < kelvo::HANDLER_COUNT + kelvo::ROUTINE_COUNT; ++id) {
        operators.push_back(new kelvo::KelvoOperator("BenchDumper", -1, 0));
        if (id < kelvo::HANDLER_COUNT) {
            agent->setHandlerForTest(id, operators.back());
        } else {
            agent->setRoutineForTest(id - kelvo::HANDLER_COUNT, operators.back());
        }
    }
    android::String16 name(kelvo::KelvoService::kServiceName);
    sp<android::IBinder> service;
    if (kelvo::KelvoService::publish(agent) == android::NO_ERROR) {
        service = android::defaultServiceManager()->getService(name);
    }
    FILE* out = tmpfile();
    if (service == nullptr || out == nullptr) {
        state.SkipWithError("no service");
        return;
    }
    android::Vector<android::String16> args;
    args.add(android::String16("--dump"));
    constexpr int kDumps = 100;
    std::vector<double> ms;
    for (auto _ : state) {
        for (int i = 0; i < kDumps; ++i) {
            rewind(out);
            Clock::time_point start = Clock::now();
            service->dump(fileno(out), args);
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - start).count());
        }
    }
    fseek(out, 0, SEEK_END);
    bool answered = ftell(out) > 0;
    fclose(out);
    service.clear();
    kelvo::ServiceControl::stopService(name);
    for (int id = 0; id < kelvo::HANDLER_COUNT + kelvo::ROUTINE_COUNT; ++id) {
        if (id < kelvo::HANDLER_COUNT) {
            agent->setHandlerForTest(id, nullptr);
        } else {
            agent->setRoutineForTest(id - kelvo::HANDLER_COUNT, nullptr);
        }
        operators[id]->requestThreadExit();
    }
    if (!answered) {
        state.SkipWithError("empty dump");
        return;
    }
    std::nth_element(ms.begin(), ms.begin() + ms.size() / 2, ms.end());
    state.counters["dumpsys_dump_ms"] = ms[ms.size() / 2];
}
BENCHMARK(BM_DumpsysDump)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
