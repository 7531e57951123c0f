// The cost of one Wi-Fi traffic batch of 5000 applications through the
// accounting library: the level times and totals before it and the batch
// weighted by them; apart, the balance that reports the 5000 records.

#include <benchmark/benchmark.h>
#include <binder/Parcel.h>
#include <stdlib.h>
#include <utils/String8.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "AccounterTypes.h"
#include "KelvoLibEntry.h"
#include "LibraryListener.h"
#include "allocators/WifiAccounterData.h"
#include "core/KelvoLibAgent.h"
#include "kelvo/RootPath.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::String8;
using Clock = std::chrono::steady_clock;

namespace {

constexpr int32_t kEntries = 5000;

class CountingListener : public kelvo::LibraryListener {
public:
    int32_t handleLibraryEvent(int32_t event, const Parcel& reply) override {
        ++mReplies;
        return 0;
    }
    int mReplies = 0;
};

std::unique_ptr<Parcel> wifiAction(int32_t action, int32_t subtype) {
    auto p = std::make_unique<Parcel>();
    p->writeInt32(kelvo::ACCOUNTER_WIFI);
    p->writeInt32(action);
    p->writeInt32(subtype);
    return p;
}

std::unique_ptr<Parcel> trafficBatch(const std::vector<String8>& names, int64_t time) {
    auto p = wifiAction(kelvo::ACTION_SET_VALUE, kelvo::WIFI_PACKAGE_TRAFFIC);
    p->writeInt64(time);
    p->writeInt32(kEntries);
    for (int32_t i = 0; i < kEntries; ++i) {
        p->writeString8(names[i]);
        p->writeInt32(i % 2);
        p->writeInt64(100 + i);
        p->writeInt64(200 + i);
        p->writeInt64(150000 + i);
        p->writeInt64(300000 + i);
    }
    return p;
}

void BM_WifiBatch(benchmark::State& state) {
    char tmpl[] = "/tmp/kelvo-bench-wifi-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        state.SkipWithError("no private root");
        return;
    }
    const std::string savedRoot = kelvo::RootPath::root();
    const std::string root = tmpl;
    kelvo::RootPath::setRoot(root.c_str());
    std::string cmd = "mkdir -p '" + root + "/data/misc/kelvo' && cp '" KELVO_SAMPLE_CONFIG "' '" +
                      root + "/data/misc/kelvo/tv_kelvo_config.xml'";
    bool failed = system(cmd.c_str()) != 0;
    kelvo::XmlParser::resetInstance();
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    android::sp<CountingListener> listener = new CountingListener();
    failed |= kelvo::registerLibraryListener(kelvo::ACCOUNTER_WIFI, listener) != 0;

    std::vector<String8> names;
    for (int32_t i = 0; i < kEntries; ++i) {
        char name[48];
        snprintf(name, sizeof(name), "com.vendor.application%04d", i);
        names.emplace_back(name);
    }
    std::vector<double> ms;
    std::vector<double> balanceMs;
    int64_t time = 0;
    for (auto _ : state) {
        state.PauseTiming();
        auto totals = wifiAction(kelvo::ACTION_SET_VALUE, kelvo::WIFI_INTERFACE_TRAFFIC);
        totals->writeInt64(int64_t{kEntries} * 3000);
        totals->writeInt64(int64_t{kEntries} * 3000);
        auto levels = wifiAction(kelvo::ACTION_SET_VALUE, kelvo::WIFI_ACTIVITY);
        levels->writeInt32(4);
        for (int64_t t : {60000, 120000, 90000, 30000}) {
            levels->writeInt64(t);
        }
        auto batch = trafficBatch(names, time += 600000);
        Parcel balance;
        balance.writeInt32(kelvo::ACCOUNTER_WIFI);
        balance.writeInt32(kelvo::ACTION_BALANCE);
        balance.writeInt32(kelvo::BALANCE_AT);
        balance.writeInt64(time);
        state.ResumeTiming();
        Clock::time_point start = Clock::now();
        failed |= kelvo::setDataAccounter(*totals) != 0;
        failed |= kelvo::setDataAccounter(*levels) != 0;
        failed |= kelvo::setDataAccounter(*batch) != 0;
        ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - start).count());
        Clock::time_point balanceStart = Clock::now();
        failed |= kelvo::setDataAccounter(balance) != 0;
        balanceMs.push_back(
            std::chrono::duration<double, std::milli>(Clock::now() - balanceStart).count());
    }
    kelvo::unregisterLibraryListener(kelvo::ACCOUNTER_WIFI);
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    kelvo::XmlParser::resetInstance();
    cmd = "rm -rf '" + root + "'";
    failed |= system(cmd.c_str()) != 0;
    if (failed || ms.empty() || listener->mReplies == 0) {
        state.SkipWithError("a Wi-Fi batch failed");
        return;
    }
    std::sort(ms.begin(), ms.end());
    std::sort(balanceMs.begin(), balanceMs.end());
    state.counters["wifi_batch_5000_ms"] = ms[ms.size() / 2];
    state.counters["wifi_balance_5000_ms"] = balanceMs[balanceMs.size() / 2];
}
BENCHMARK(BM_WifiBatch)->MinTime(1.0)->UseRealTime();

}  // namespace
