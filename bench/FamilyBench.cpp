// One GNSS handler hour over the raw rows of 200 applications: the tick's
// balance, the applications and component accounting queries with their
// hourly rows, and the hourly upload, each step run to its end on the
// handler's thread. The rows are written before the clock starts.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "core/AppsAccounting.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "handlers/components/GnssHandler.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"
#include "storage/DataUploader.h"

using android::Parcel;
using android::sp;
using android::String8;

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kApplications = 200;
constexpr int kHours = 15;
constexpr int64_t kDay = 1796515200000LL;  // 2026-12-06 00:00:00 UTC
constexpr int64_t kHourMs = 3600000;

// The raw rows of one hour ending at `hour`: one per application, and the
// component's.
void writeHour(int64_t hour) {
    const kelvo::component_family& family = kelvo::GnssHandler::family();
    Parcel rows;
    for (int a = 0; a < kApplications; ++a) {
        rows.writeInt64(hour - kHourMs + a * 1000);
        rows.writeInt64(hour - kHourMs + a * 1000 + 60000);
        rows.writeString8(String8(("com.bench.app" + std::to_string(a)).c_str()));
        for (int pair = 0; pair < 6; ++pair) {
            rows.writeInt32(pair == 1 ? 60000 : 0);
            rows.writeInt64(pair == 1 ? 2100 + a : 0);
        }
    }
    kelvo::StorageOperator::insertEntries(*family.rawApplications, rows, kApplications, false);
    Parcel component;
    component.writeInt64(hour - kHourMs);
    component.writeInt64(hour);
    for (int pair = 0; pair < 6; ++pair) {
        component.writeInt32(pair == 1 ? 3600000 : 0);
        component.writeInt64(pair == 1 ? 126000 : 0);
    }
    kelvo::StorageOperator::insertEntries(*family.rawComponent, component, 1, false);
    kelvo::StorageOperator::forceFlushEntries();
}

int32_t notify(const sp<kelvo::GnssHandler>& handler, int32_t type, const Parcel& body) {
    return handler->sendMessageSync(kelvo::ParcelMessage(kelvo::MESSAGE_NOTIFICATION, type, body));
}

void BM_FamilyHour(benchmark::State& state) {
    setenv("TZ", "UTC", 1);
    tzset();
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    std::string root = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
    kelvo::RootPath::setRoot(root.c_str());
    kelvo::WallClock::setFixedTimeMs(kDay + 20 * 60000);
    sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    sp<kelvo::GnssHandler> handler = new kelvo::GnssHandler();
    handler->addSchemaTable();
    kelvo::AppsAccounting::getInstance()->addSchemaTable();
    kelvo::DataUploader::getInstance()->addSchemaTable();
    if (storage->startConnection() != 0) {
        state.SkipWithError("storage did not start");
        return;
    }
    // Votes go to an operator that takes them and does nothing.
    sp<kelvo::KelvoOperator> routine = new kelvo::KelvoOperator("BenchRoutine", -1, 0);
    kelvo::KelvoAgent::getInstance()->setRoutineForTest(kelvo::ROUTINE_HOURLY, routine);
    handler->earlyInitialize();

    std::vector<double> ms;
    for (auto _ : state) {
        for (int h = 0; h < kHours; ++h) {
            int64_t hour = kDay + (h + 1) * kHourMs;
            writeHour(hour);
            Parcel tick, at, upload;
            tick.writeInt64(hour);
            tick.writeInt64(hour);
            at.writeInt64(hour);
            upload.writeFloat(1.0f);
            upload.writeInt64(hour);
            Clock::time_point start = Clock::now();
            notify(handler, kelvo::NOTIFICATION_HOURLY_TICK, tick);
            notify(handler, kelvo::NOTIFICATION_APPLICATIONS_ACCOUNTING, at);
            notify(handler, kelvo::NOTIFICATION_COMPONENT_ACCOUNTING, at);
            notify(handler, kelvo::NOTIFICATION_HOURLY_UPLOADING, upload);
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - start).count());
            kelvo::DataUploader::getInstance()->uploadEvent();
        }
    }
    std::sort(ms.begin(), ms.end());
    state.counters["family_hour_ms"] = ms[ms.size() / 2];

    handler->requestThreadExit();
    handler->join();
    routine->requestThreadExit();
    routine->join();
    kelvo::KelvoAgent::getInstance()->setRoutineForTest(kelvo::ROUTINE_HOURLY, nullptr);
    kelvo::WallClock::setFixedTimeMs(-1);
    storage->closeConnection();
    std::string cmd = "rm -rf '" + root + "'";
    if (root.rfind("/tmp/kelvo-bench-", 0) == 0 && system(cmd.c_str()) != 0) {
        state.SkipWithError("could not remove the bench root");
    }
}
BENCHMARK(BM_FamilyHour)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
