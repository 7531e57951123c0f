// One full sampling pass of the CPU handler on a simulated phone: 8 cores in
// two clusters, 300 uids and 1500 processes. The pass is timed from the data
// poll to the end of the report's handling: the request to the kernel
// device, the counter reads, the report's records, the accounting and the
// rows handed to the storage thread. Writing the counters is the device's
// part and is not timed.

#include <benchmark/benchmark.h>
#include <binder/Parcel.h>
#include <binder/ServiceControl.h>
#include <utils/String8.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "CpuTree.h"
#include "FakeKernelDriver.h"
#include "PlatformServices.h"
#include "core/KelvoAgent.h"
#include "core/KelvoLibAgent.h"
#include "core/Notifier.h"
#include "handlers/components/CpuHandler.h"
#include "kelvo/RootPath.h"
#include "routines/PollingPayload.h"
#include "utils/XmlParser.h"

using android::Parcel;
using android::String8;
using Clock = std::chrono::steady_clock;
using kelvo::CpuHandler;
using kelvo::CpuReport;
using kelvo::CpuTree;

namespace {

constexpr int kPasses = 30;

struct Process {
    uint32_t uid;
    int32_t pid;
    uint8_t type;
    std::string name;
};

struct Phone {
    std::vector<CpuTree::UidTime> uids;
    std::vector<Process> processes;
    std::vector<std::vector<uint64_t>> ticks;
    uint64_t idleUs = 0;
    int64_t processUs = 0;
};

// uid 0 with 100 kernel threads, uid 1000 with 112 processes, 250 apps of
// one package with 4 processes each, 48 apps of two packages with 6 each.
Phone makePhone(kelvo::PlatformState& packages) {
    Phone phone;
    int32_t pid = 100;
    auto addUid = [&](uint32_t uid, int count, uint8_t type, const char* prefix) {
        phone.uids.push_back({uid, 0, 0});
        for (int i = 0; i < count; ++i) {
            phone.processes.push_back({uid, pid++, type, prefix + std::to_string(i)});
        }
    };
    addUid(0, 100, CpuReport::NAME_KERNEL_THREAD, "kernel_kworker/");
    packages.setPackages(1000, {"android", "com.android.settings"});
    addUid(1000, 112, CpuReport::NAME_PROCESS, "system_proc");
    for (uint32_t i = 0; i < 250; ++i) {
        packages.setPackages(10000 + i, {"com.vendor.app" + std::to_string(i)});
        addUid(10000 + i, 4, CpuReport::NAME_PROCESS, "app_proc");
    }
    for (uint32_t i = 0; i < 48; ++i) {
        packages.setPackages(10300 + i, {"com.shared" + std::to_string(i) + ".a",
                                         "com.shared" + std::to_string(i) + ".b"});
        addUid(10300 + i, 6, CpuReport::NAME_PROCESS, "shared_proc");
    }
    return phone;
}

// Advances every counter by one interval of load.
bool advance(CpuTree& tree, Phone& phone) {
    for (CpuTree::UidTime& u : phone.uids) {
        u.userUs += 30000;
        u.systemUs += 10000;
    }
    phone.processUs += 8000;
    phone.idleUs += 500000;
    bool ok = tree.setUidTimes(phone.uids);
    for (size_t c = 0; c < phone.ticks.size(); ++c) {
        for (uint64_t& t : phone.ticks[c]) t += 50;
        ok = ok && tree.setClusterTicks(c, phone.ticks[c]);
    }
    for (int core = 0; core < 8; ++core) {
        ok = ok && tree.setIdleTime(core, 0, phone.idleUs) &&
             tree.setIdleTime(core, 1, phone.idleUs);
    }
    return ok;
}

std::string report(const Phone& phone, int64_t time) {
    std::vector<CpuReport::Record> records;
    records.reserve(phone.processes.size());
    for (const Process& p : phone.processes) {
        records.push_back({p.uid, p.pid, phone.processUs, p.type, p.name});
    }
    return CpuReport::encode(time, CpuHandler::MODE_POLL, CpuReport::STATE_ALIVE, records);
}

int32_t runPass(CpuHandler* handler, const std::string& payload, int64_t time) {
    kelvo::PollingPayload poll;
    poll.reason = kelvo::POLLING_THERMAL;
    poll.time = time;
    Parcel body;
    poll.writeTo(body);
    int32_t ret = handler->sendMessageSync(
        kelvo::ParcelMessage(kelvo::MESSAGE_NOTIFICATION, kelvo::NOTIFICATION_DATA_POLLING, body));
    Parcel entry;
    entry.writeInt64(time);
    entry.writeString8(String8(CpuHandler::kDriverName));
    entry.writeInt32(CpuHandler::kReportMagic);
    entry.writeInt32(static_cast<int32_t>(payload.size()));
    entry.write(payload.data(), payload.size());
    int32_t handled =
        handler->sendMessageSync(kelvo::ParcelMessage(kelvo::MESSAGE_BUFFERED_LOG, entry));
    return ret < 0 ? ret : handled;
}

void BM_CpuHandlerPass(benchmark::State& state) {
    const std::string savedRoot = kelvo::RootPath::root();
    char tmpl[] = "/tmp/kelvo-bench-cpuh-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) {
        state.SkipWithError("no root");
        return;
    }
    const std::string root = tmpl;
    kelvo::RootPath::setRoot(root.c_str());
    std::string cmd = "mkdir -p '" + root + "/data/misc/kelvo' && cp '" KELVO_SAMPLE_CONFIG "' '" +
                      root + "/data/misc/kelvo/tv_kelvo_config.xml'";
    bool failed = system(cmd.c_str()) != 0;
    kelvo::XmlParser::resetInstance();
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::KelvoLibAgent::getInstance()->start(0);

    kelvo::ServiceControl::setServiceWaitMs(300);
    auto services = std::make_unique<kelvo::PlatformServices>();
    failed |= services->startAll() != android::NO_ERROR;
    Phone phone = makePhone(*services->state());
    CpuTree tree(root);
    failed |= !tree.layout(CpuTree::phoneClusters());
    for (const CpuTree::Cluster& c : tree.clusters())
        phone.ticks.emplace_back(c.frequencies.size());
    kelvo::fake::FakeKernelDriver driver;
    failed |= !driver.start();

    android::sp<kelvo::KelvoStorage> storage = kelvo::KelvoAgent::getInstance()->getStorage();
    android::sp<CpuHandler> handler = new CpuHandler();
    failed |= handler->earlyInitialize() != 0;
    handler->addSchemaTable();
    failed |= storage->startConnection() != 0;
    handler->initialize();

    std::vector<double> msPerPass;
    int64_t time = 1700000000000;
    // The baseline pass and one more to create every entry.
    for (int i = 0; i < 2 && !failed; ++i) {
        failed |= !advance(tree, phone);
        time += 60000;
        failed |= runPass(handler.get(), report(phone, time), time) < 0;
    }
    for (auto _ : state) {
        for (int i = 0; i < kPasses && !failed; ++i) {
            state.PauseTiming();
            failed |= !advance(tree, phone);
            time += 60000;
            std::string payload = report(phone, time);
            state.ResumeTiming();
            Clock::time_point start = Clock::now();
            failed |= runPass(handler.get(), payload, time) < 0;
            msPerPass.push_back(
                std::chrono::duration<double, std::milli>(Clock::now() - start).count());
        }
    }
    handler->readyToDestroy();
    handler->requestThreadExit();
    handler.clear();
    kelvo::StorageOperator::forceFlushEntries();
    storage->closeConnection();
    driver.stop();
    services.reset();
    kelvo::ServiceControl::setServiceWaitMs(kelvo::ServiceControl::kDefaultServiceWaitMs);
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    kelvo::RootPath::setRoot(savedRoot.c_str());
    kelvo::XmlParser::resetInstance();
    cmd = "rm -rf '" + root + "'";
    if (system(cmd.c_str()) != 0 || failed || msPerPass.empty()) {
        state.SkipWithError("a CPU handler pass failed");
        return;
    }
    std::sort(msPerPass.begin(), msPerPass.end());
    state.counters["cpu_pass_ms"] = msPerPass[msPerPass.size() / 2];
}
BENCHMARK(BM_CpuHandlerPass)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
