// The cost of one state action (a foreground change) handed to an accounter
// through setDataAccounter, per element it touches: the sensor accounter
// holds 32 sensor types of 8 users each, and every type's shared allocator
// closes the interval of each of its users under the old foreground.
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
#include "core/KelvoLibAgent.h"
#include "kelvo/RootPath.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::String8;
using Clock = std::chrono::steady_clock;

namespace {

constexpr int32_t kType = kelvo::ACCOUNTER_SENSOR;
constexpr int32_t kSensorTypes = 32;
constexpr int32_t kUsersPerType = 8;
constexpr int32_t kElements = kSensorTypes * kUsersPerType;
constexpr int kActionsPerBatch = 1000;

class NullListener : public kelvo::LibraryListener {
public:
    int32_t handleLibraryEvent(int32_t event, const Parcel& reply) override { return 0; }
};

// A private root holding a profile made of the given components; the
// accounters read it when they are created. Empty on failure.
std::string writeProfile(const std::string& components) {
    char tmpl[] = "/tmp/kelvo-bench-profile-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        return "";
    }
    std::string root = tmpl;
    std::string xml = "<config><element id=\"0\">" + components + "</element></config>";
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

// Uses the profile at root until it goes out of scope, then removes it.
class ProfileRoot {
public:
    explicit ProfileRoot(const std::string& components)
        : mSavedRoot(kelvo::RootPath::root()), mRoot(writeProfile(components)) {
        if (!mRoot.empty()) {
            kelvo::RootPath::setRoot(mRoot.c_str());
        }
        kelvo::XmlParser::resetInstance();
        kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    }
    ~ProfileRoot() {
        kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
        kelvo::RootPath::setRoot(mSavedRoot.c_str());
        kelvo::XmlParser::resetInstance();
        if (!mRoot.empty()) {
            std::string cmd = "rm -rf '" + mRoot + "'";
            int ignored = system(cmd.c_str());
            (void)ignored;
        }
    }
    bool ok() const { return !mRoot.empty(); }

private:
    std::string mSavedRoot;
    std::string mRoot;
};

std::string sensorProfile() {
    std::string xml = "<component id=\"7\">";
    for (int32_t type = 0; type < kSensorTypes; ++type) {
        xml += "<parameter id=\"" + std::to_string(type) + "\"><value>" +
               std::to_string(2 + type) + "</value></parameter>";
    }
    return xml + "</component>";
}

bool setUpAccounter() {
    if (kelvo::registerLibraryListener(kType, new NullListener()) != 0) {
        return false;
    }
    for (int32_t type = 0; type < kSensorTypes; ++type) {
        for (int32_t i = 0; i < kUsersPerType; ++i) {
            char package[32];
            char user[32];
            snprintf(package, sizeof(package), "com.vendor.app%02d", i);
            snprintf(user, sizeof(user), "listener%d", type);
            Parcel activate;
            activate.writeInt32(kType);
            activate.writeInt32(kelvo::ACTION_ACTIVATE);
            activate.writeInt32(type);
            activate.writeInt64(0);
            activate.writeString8(String8(package));
            activate.writeString8(String8(user));
            if (kelvo::setDataAccounter(activate) != 0) {
                return false;
            }
        }
    }
    return true;
}

void BM_AccounterStateChange(benchmark::State& state) {
    ProfileRoot profile(sensorProfile());
    if (!profile.ok() || !setUpAccounter()) {
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

// The CPU profile of the benchmark's shape.
std::string cpuProfile() {
    std::string xml = "<component id=\"3\">";
    for (int32_t c = 0; c < kClusters; ++c) {
        xml += "<parameter id=\"" + std::to_string(c) + "\">";
        for (int32_t f = 0; f < kSteps; ++f) {
            xml += "<value>" + std::to_string(20 + 10 * c + 5 * f) + "</value>";
        }
        xml += "</parameter>";
    }
    return xml + "<parameter id=\"100\"><value>4</value></parameter></component>";
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
    ProfileRoot profile(cpuProfile());
    if (!profile.ok()) {
        state.SkipWithError("writing the profile failed");
        return;
    }
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
    if (failed || usPerPass.empty()) {
        state.SkipWithError("a CPU pass failed");
        return;
    }
    std::sort(usPerPass.begin(), usPerPass.end());
    state.counters["cpu_accounting_us_per_pass"] = usPerPass[usPerPass.size() / 2];
}
BENCHMARK(BM_CpuAccounterPass)->MinTime(1.0)->UseRealTime();

} // namespace
