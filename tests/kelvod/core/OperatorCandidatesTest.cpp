// Every operator that declares an elector for a candidate of the hourly
// rounds listens to the notification that makes it vote for it: otherwise
// that step of every round waits for its time-out.

#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "common/TestEnv.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "handlers/DpmHandler.h"
#include "handlers/SystemHandler.h"
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
#include "handlers/components/ModemHandler.h"
#include "handlers/components/SensorHandler.h"
#include "handlers/components/WifiHandler.h"

using android::Parcel;
using android::sp;
using namespace kelvo;

namespace {

// Stands in for the hourly routine: the candidates declared per elector.
class ElectorCapture : public KelvoOperator {
public:
    ElectorCapture() : KelvoOperator("ElectorCapture", -1, 0) {}
    int32_t handleCustomized(int32_t code, const Parcel& d, Parcel*) override {
        if (code != 4) return 0;
        std::lock_guard<std::mutex> g(mLock);
        uint32_t elector = d.readUint32();
        while (d.dataAvail() >= sizeof(int32_t)) mCandidates[elector].insert(d.readInt32());
        return 0;
    }
    std::map<uint32_t, std::set<int32_t>> take() {
        sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, -1));
        std::lock_guard<std::mutex> g(mLock);
        return std::move(mCandidates);
    }

private:
    std::mutex mLock;
    std::map<uint32_t, std::set<int32_t>> mCandidates;
};

// The notifications after which an elector votes for each candidate; the
// hour's tick also comes as the polling routine's hourly poll.
const std::map<int32_t, std::set<int32_t>> kVoteNotifications = {
    {1, {NOTIFICATION_HOURLY_TICK, NOTIFICATION_DATA_POLLING}},
    {2, {NOTIFICATION_APPLICATIONS_ACCOUNTING}},
    {3, {NOTIFICATION_COMPONENT_ACCOUNTING}},
    {4, {NOTIFICATION_HOURLY_UPLOADING}},
    {5, {NOTIFICATION_DAILY_TICK}},
    {6, {NOTIFICATION_DAILY_UPLOADING}},
    {7, {NOTIFICATION_DIFF_DAY_REBOOT}},
    {8, {NOTIFICATION_DAWN_UPLOADING}},
};

struct OperatorCase {
    const char* name;
    std::function<sp<KelvoOperator>()> make;
};

void PrintTo(const OperatorCase& c, std::ostream* os) {
    *os << c.name;
}

class OperatorCandidatesTest : public ::testing::TestWithParam<OperatorCase> {};

TEST_P(OperatorCandidatesTest, ListensForEveryDeclaredCandidate) {
    kelvo::test::TempRoot root;
    sp<ElectorCapture> hourly = new ElectorCapture();
    KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, hourly);
    sp<KelvoOperator> op = GetParam().make();
    Parcel listeners;
    op->setupListeners(listeners);
    listeners.writeInt32(KelvoOperator::LISTENER_END);
    listeners.setDataPosition(0);
    std::set<int32_t> heard;
    for (int32_t kind = listeners.readInt32(); kind != KelvoOperator::LISTENER_END;
         kind = listeners.readInt32()) {
        if (kind == KelvoOperator::LISTENER_BUFFERED_LOG) listeners.readString8();
        int32_t type = listeners.readInt32();
        if (kind == KelvoOperator::LISTENER_NOTIFIER) heard.insert(type);
    }
    op->setCandidateElector();
    const std::map<uint32_t, std::set<int32_t>> declared = hourly->take();
    for (const auto& [elector, candidates] : declared) {
        for (int32_t candidate : candidates) {
            ASSERT_EQ(1u, kVoteNotifications.count(candidate)) << candidate;
            bool hears = false;
            for (int32_t type : kVoteNotifications.at(candidate)) hears |= heard.count(type) > 0;
            EXPECT_TRUE(hears) << "elector 0x" << std::hex << elector << std::dec
                               << " declares candidate " << candidate
                               << " but hears none of its notifications";
        }
    }
    KelvoAgent::getInstance()->setRoutineForTest(ROUTINE_HOURLY, nullptr);
    for (const sp<KelvoOperator>& t : {op, sp<KelvoOperator>(hourly)}) {
        t->requestThreadExit();
        t->join();
    }
}

template <typename T>
OperatorCase make(const char* name) {
    return {name, [] { return sp<KelvoOperator>(new T()); }};
}

INSTANTIATE_TEST_SUITE_P(
    Operators, OperatorCandidatesTest,
    ::testing::Values(make<SystemHandler>("System"), make<CpuHandler>("Cpu"),
                      make<DisplayHandler>("Display"), make<FlashlightHandler>("Flashlight"),
                      make<CameraHandler>("Camera"), make<GnssHandler>("Gnss"),
                      make<SensorHandler>("Sensor"), make<WifiHandler>("Wifi"),
                      make<BatteryHandler>("Battery"), make<AudioHandler>("Audio"),
                      make<GpuHandler>("Gpu"), make<BluetoothHandler>("Bluetooth"),
                      make<ThermalHandler>("Thermal"), make<ModemHandler>("Modem"),
                      make<DpmHandler>("Dpm")),
    [](const ::testing::TestParamInfo<OperatorCase>& info) { return info.param.name; });

}  // namespace
