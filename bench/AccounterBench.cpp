// The cost of one state action (a foreground change) handed to an accounter
// through setDataAccounter, per element it touches: the accounter holds 20
// shared allocators of 10 elements each, and every allocator closes the
// interval of each of its elements under the old foreground.
//
// The cost of one CPU accounting pass: a SetValue over 2 clusters of 20
// frequency steps and 300 applications, from the parcel to the replies.

#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "AccounterTypes.h"
#include "KelvoLibEntry.h"
#include "LibraryListener.h"
#include "accounters/DataAccounter.h"
#include "allocators/AccounterData.h"
#include "allocators/SharedAllocator.h"
#include "core/KelvoLibAgent.h"
#include "kelvo/RootPath.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::String8;
using Clock = std::chrono::steady_clock;

namespace {

constexpr int32_t kType = kelvo::ACCOUNTER_GNSS;
constexpr int32_t kAllocators = 20;
constexpr int32_t kElementsPerAllocator = 10;
constexpr int32_t kElements = kAllocators * kElementsPerAllocator;
constexpr int kActionsPerBatch = 1000;

// One shared allocator per int32 key; SetValue: int64 time, int32 power.
class BenchAccounter : public kelvo::DataAccounter {
protected:
    std::unique_ptr<kelvo::BaseAllocator> createAllocators(int32_t key) override {
        return std::make_unique<kelvo::SharedAllocator<kelvo::accounter_data>>(this);
    }
    int32_t getAllocatorKey(const Parcel& action) override { return action.readInt32(); }
    int32_t getPowerValue(int32_t key, const Parcel& action, Parcel& power) override {
        power.writeInt64(action.readInt64());
        power.writeInt32(action.readInt32());
        return 0;
    }
};

class NullListener : public kelvo::LibraryListener {
public:
    int32_t handleLibraryEvent(int32_t event, const Parcel& reply) override { return 0; }
};

bool setUpAccounter() {
    kelvo::KelvoLibAgent* agent = kelvo::KelvoLibAgent::getInstance();
    agent->resetAccountersForTest();
    agent->setAccounterFactoryForTest(kType, [] { return std::make_unique<BenchAccounter>(); });
    if (kelvo::registerLibraryListener(kType, new NullListener()) != 0) {
        return false;
    }
    for (int32_t key = 0; key < kAllocators; ++key) {
        Parcel power;
        power.writeInt32(kType);
        power.writeInt32(kelvo::ACTION_SET_VALUE);
        power.writeInt32(key);
        power.writeInt64(0);
        power.writeInt32(300 + key);
        if (kelvo::setDataAccounter(power) != 0) {
            return false;
        }
        for (int32_t i = 0; i < kElementsPerAllocator; ++i) {
            char name[48];
            snprintf(name, sizeof(name), "com.vendor.app%02d:worker%d", i, key);
            Parcel activate;
            activate.writeInt32(kType);
            activate.writeInt32(kelvo::ACTION_ACTIVATE);
            activate.writeInt32(key);
            activate.writeInt64(0);
            activate.writeString8(String8(name));
            if (kelvo::setDataAccounter(activate) != 0) {
                return false;
            }
        }
    }
    return true;
}

void BM_AccounterStateChange(benchmark::State& state) {
    if (!setUpAccounter()) {
        state.SkipWithError("setting up the accounter failed");
        return;
    }
    // The foreground moves between applications that hold elements and one
    // that does not.
    const String8 foregrounds[] = {String8("com.vendor.app03"), String8("com.vendor.app07"),
                                   String8("com.browser")};
    std::vector<std::unique_ptr<Parcel>> actions;
    std::vector<double> nsPerElement;
    int64_t now = 1000;
    bool failed = false;
    for (auto _ : state) {
        state.PauseTiming();
        actions.clear();
        for (int i = 0; i < kActionsPerBatch; ++i) {
            auto action = std::make_unique<Parcel>();
            action->writeInt32(kType);
            action->writeInt32(kelvo::ACTION_FOREGROUND);
            action->writeInt64(now += 7);
            action->writeString8(foregrounds[i % 3]);
            actions.push_back(std::move(action));
        }
        state.ResumeTiming();
        Clock::time_point start = Clock::now();
        for (const auto& action : actions) {
            failed |= kelvo::setDataAccounter(*action) != 0;
        }
        double ns = std::chrono::duration<double, std::nano>(Clock::now() - start).count();
        nsPerElement.push_back(ns / kActionsPerBatch / kElements);
    }
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    if (failed || nsPerElement.empty()) {
        state.SkipWithError("a foreground change failed");
        return;
    }
    std::sort(nsPerElement.begin(), nsPerElement.end());
    state.counters["accounter_state_change_ns_per_element"] = nsPerElement[nsPerElement.size() / 2];
}
BENCHMARK(BM_AccounterStateChange)->MinTime(1.0)->UseRealTime();

constexpr int32_t kClusters = 2;
constexpr int32_t kSteps = 20;
constexpr int32_t kApplications = 300;
constexpr int kPassesPerBatch = 100;

// A private root holding a CPU profile of the benchmark's shape; the
// accounter reads it when it is created.
std::string writeCpuProfile() {
    char tmpl[] = "/tmp/kelvo-bench-cpu-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        return "";
    }
    std::string root = tmpl;
    std::string xml = "<config><element id=\"0\"><component id=\"3\">";
    for (int32_t c = 0; c < kClusters; ++c) {
        xml += "<parameter id=\"" + std::to_string(c) + "\">";
        for (int32_t f = 0; f < kSteps; ++f) {
            xml += "<value>" + std::to_string(20 + 10 * c + 5 * f) + "</value>";
        }
        xml += "</parameter>";
    }
    xml += "<parameter id=\"100\"><value>4</value></parameter></component></element></config>";
    std::string dir = root + "/data/misc/kelvo";
    std::string cmd = "mkdir -p '" + dir + "'";
    FILE* file = system(cmd.c_str()) == 0 ? fopen((dir + "/tv_kelvo_config.xml").c_str(), "w")
                                          : nullptr;
    if (file == nullptr) {
        return "";
    }
    fputs(xml.c_str(), file);
    fclose(file);
    return root;
}

std::unique_ptr<Parcel> cpuPass(int64_t end) {
    auto action = std::make_unique<Parcel>();
    action->writeInt32(kelvo::ACCOUNTER_CPU);
    action->writeInt32(kelvo::ACTION_SET_VALUE);
    action->writeInt64(end);
    action->writeInt32(1);
    action->writeBool(true);
    action->writeUint32(kClusters);
    for (int32_t c = 0; c < kClusters; ++c) {
        action->writeUint32(c);
        action->writeUint32(4);
        action->writeInt32(4000);
        action->writeInt32(10000);
        action->writeUint32(kSteps);
        for (int32_t f = 0; f < kSteps; ++f) {
            action->writeInt32(500);
        }
    }
    action->writeInt64(int64_t{kApplications} * 30);
    for (int32_t i = 0; i < kApplications; ++i) {
        char name[48];
        snprintf(name, sizeof(name), "com.vendor.app%03d", i);
        action->writeInt32(10000 + i);
        action->writeString8(String8(name));
        action->writeInt32(30);
    }
    return action;
}

void BM_CpuAccounterPass(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    const std::string root = writeCpuProfile();
    if (root.empty()) {
        state.SkipWithError("writing the profile failed");
        return;
    }
    kelvo::RootPath::setRoot(root.c_str());
    kelvo::XmlParser::resetInstance();
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    bool failed = kelvo::registerLibraryListener(kelvo::ACCOUNTER_CPU, new NullListener()) != 0;
    std::vector<std::unique_ptr<Parcel>> passes;
    std::vector<double> usPerPass;
    int64_t now = 0;
    for (auto _ : state) {
        state.PauseTiming();
        passes.clear();
        for (int i = 0; i < kPassesPerBatch; ++i) {
            passes.push_back(cpuPass(now += 1000));
        }
        state.ResumeTiming();
        Clock::time_point start = Clock::now();
        for (const auto& pass : passes) {
            failed |= kelvo::setDataAccounter(*pass) != 0;
        }
        double us = std::chrono::duration<double, std::micro>(Clock::now() - start).count();
        usPerPass.push_back(us / kPassesPerBatch);
    }
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    kelvo::XmlParser::resetInstance();
    std::string cmd = "rm -rf '" + root + "'";
    if (system(cmd.c_str()) != 0 || failed || usPerPass.empty()) {
        state.SkipWithError("a CPU pass failed");
        return;
    }
    std::sort(usPerPass.begin(), usPerPass.end());
    state.counters["cpu_accounting_us_per_pass"] = usPerPass[usPerPass.size() / 2];
}
BENCHMARK(BM_CpuAccounterPass)->MinTime(1.0)->UseRealTime();

} // namespace
