// One 30-minute abnormality check over a day of raw rows (50000 wake-ups,
// 10000 alarms, 20000 wakelock rows, a few sources of each above the sample
// configuration's thresholds): the time from the check's start to its end on
// the routine's thread, its rows queued, its event and power-log line sent.

#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "routines/AbnormalityRoutine.h"
#include "storage/DataUploader.h"
#include "utils/FileUtils.h"
#include "utils/XmlParser.h"

using android::sp;
using namespace kelvo;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kChecks = 9;
// 2026-12-06 00:00:00 UTC.
constexpr int64_t kDay = 1796515200000LL;
constexpr int64_t kHalfHourMs = 1800000;

// The system handler's tables the checks read.
const kelvo::column_attribute kIrqColumns[] = {{COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"}};
const kelvo::table_attribute kIrq = {"1.0", 1, 2, kIrqColumns, "raw_ap_wake_irq"};
const kelvo::column_attribute kAlarmColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"}, {COLUMN_TEXT, "tag"}, {COLUMN_INT, "count"}};
const kelvo::table_attribute kAlarm = {"1.0", 1, 4, kAlarmColumns, "raw_applications_alarm"};
const kelvo::column_attribute kPartialColumns[] = {{COLUMN_TIME, "timestamp"},
                                                   {COLUMN_INT, "uid"},
                                                   {COLUMN_TEXT, "name"},
                                                   {COLUMN_TEXT, "tag"},
                                                   {COLUMN_LONG, "duration"}};
const kelvo::table_attribute kPartial = {"1.0", 1, 5, kPartialColumns, "raw_partial_wakelock"};
const kelvo::column_attribute kKernelColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"}, {COLUMN_LONG, "duration"}};
const kelvo::table_attribute kKernel = {"1.0", 1, 3, kKernelColumns, "raw_kernel_wakelock"};

// n rows spread evenly over the day, from a recursive counter.
std::string spread(const char* table, const char* columns, const char* values, int n) {
    std::ostringstream sql;
    sql << "WITH RECURSIVE n(i) AS (SELECT 0 UNION ALL SELECT i+1 FROM n WHERE i<" << n - 1
        << ") INSERT INTO " << table << "(timestamp, " << columns << ") SELECT " << kDay
        << " + i * (86400000 / " << n << "), " << values << " FROM n;";
    return sql.str();
}

void BM_AbnormalityCheck(benchmark::State& state) {
    setenv("TZ", "UTC", 1);
    tzset();
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    std::string root = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
    kelvo::RootPath::setRoot(root.c_str());
    std::string config = kelvo::RootPath::resolve("/data/misc/kelvo/tv_kelvo_config.xml");
    kelvo::FileUtils::createDirectory(config.substr(0, config.rfind('/')).c_str(), 0775);
    {
        std::ifstream in(KELVO_SAMPLE_CONFIG);
        std::ofstream out(config);
        out << in.rdbuf();
    }
    kelvo::XmlParser::resetInstance();
    kelvo::WallClock::setFixedTimeMs(kDay + 12 * 3600000LL);
    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<kelvo::AbnormalityRoutine> routine = new kelvo::AbnormalityRoutine();
    routine->addSchemaTable();
    kelvo::DataUploader::getInstance()->addSchemaTable();
    for (const kelvo::table_attribute* t : {&kIrq, &kAlarm, &kPartial, &kKernel}) {
        kelvo::StorageOperator::addSchema(*t);
    }
    if (storage->startConnection() != 0) {
        state.SkipWithError("storage did not start");
        return;
    }
    sqlite3* db = nullptr;
    std::string seed =
        "BEGIN;" + spread("raw_ap_wake_irq", "name", "'irq' || (i % 4)", 50000) +
        spread("raw_applications_alarm", "name, tag, count", "'app' || (i % 5), 'tag', 1", 10000) +
        spread("raw_partial_wakelock", "uid, name, tag, duration",
               "1000 + i % 3, 'proc' || (i % 5), 'tag', 20000", 10000) +
        spread("raw_kernel_wakelock", "name, duration", "'kwl' || (i % 3), 20000", 10000) +
        "COMMIT;";
    if (sqlite3_open((root + kelvo::KelvoStorage::kDatabasePath).c_str(), &db) != SQLITE_OK ||
        sqlite3_exec(db, seed.c_str(), nullptr, nullptr, nullptr) != SQLITE_OK) {
        state.SkipWithError(sqlite3_errmsg(db));
        sqlite3_close(db);
        return;
    }
    sqlite3_close(db);
    routine->earlyInitialize();
    kelvo::KelvoAgent::getInstance()->setRoutineForTest(kelvo::ROUTINE_ABNORMALITY, routine);
    routine->initialize();

    std::vector<double> ms;
    for (auto _ : state) {
        for (int c = 0; c < kChecks; ++c) {
            kelvo::WallClock::setFixedTimeMs(kDay + 12 * 3600000LL + c * kHalfHourMs);
            Clock::time_point start = Clock::now();
            routine->sendMessageSync(kelvo::ParcelMessage(
                kelvo::MESSAGE_TIMER, kelvo::AbnormalityRoutine::kCheckTimerId));
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - start).count());
        }
    }
    std::sort(ms.begin(), ms.end());
    state.counters["abnormality_check_ms"] = ms[ms.size() / 2];

    routine->readyToDestroy();
    routine->requestThreadExit();
    routine->join();
    kelvo::KelvoAgent::getInstance()->setRoutineForTest(kelvo::ROUTINE_ABNORMALITY, nullptr);
    kelvo::Dispatcher::resetForTest();
    kelvo::WallClock::setFixedTimeMs(-1);
    storage->closeConnection();
    std::string cmd = "rm -rf '" + root + "'";
    if (root.rfind("/tmp/kelvo-bench-", 0) == 0 && system(cmd.c_str()) != 0) {
        state.SkipWithError("could not remove the bench root");
    }
}
BENCHMARK(BM_AbnormalityCheck)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
