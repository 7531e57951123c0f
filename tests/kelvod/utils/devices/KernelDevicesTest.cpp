#include <errno.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "FakeDriverReporter.h"
#include "FakeKernelDriver.h"
#include "HealthCounters.h"
#include "common/RecordingHandler.h"
#include "common/TestEnv.h"
#include "core/BufferedLogServer.h"
#include "utils/devices/DpmDevice.h"
#include "utils/devices/KelvoDevice.h"

using namespace kelvo;
using kelvo::fake::FakeDriverReporter;
using kelvo::fake::FakeKernelDriver;
using kelvo::test::LogCapture;
using kelvo::test::TempRoot;
using Device = FakeKernelDriver::Device;

namespace {

class KernelDevicesTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(mDriver.start()); }

    TempRoot mRoot;
    FakeKernelDriver mDriver;
};

} // namespace

TEST(KernelDevicesAbsentTest, EveryOperationFailsToOpen) {
    TempRoot root;
    LogCapture log;
    gpu_info_t gpu;
    uint32_t brightness = 0;
    std::string name;
    std::vector<dpm_ip_record_t> records;
    dpm_ddr_data_t ddr;
    dev_transmit_t transmit = KelvoDevice::makeTransmit(1, 0);
    std::vector<std::function<int()>> operations = {
            [] { return KelvoDevice::setGpuEnable(true); },
            [&] { return KelvoDevice::getGpuInfo(&gpu); },
            [&] { return KelvoDevice::requestPidCpuTime(&transmit); },
            [&] { return KelvoDevice::getProcessName(1, "init", &name); },
            [] { return KelvoDevice::requestUeventInfo(5); },
            [&] { return KelvoDevice::getBrightnessInfo(&brightness); },
            [&] { return KelvoDevice::requestBinderStats(&transmit); },
            [] { return DpmDevice::getVersion(); },
            [&] { return DpmDevice::getIpData(4, &records); },
            [&] { return DpmDevice::getDdrData(4, &ddr); },
    };
    for (size_t i = 0; i < operations.size(); ++i) {
        EXPECT_EQ(-10, operations[i]()) << "operation " << i;
    }
    EXPECT_EQ(7u, log.count("# Failed to open device: /dev/kelvo"));
    EXPECT_EQ(3u, log.count("# Failed to open device: /dev/dpm_ldm"));
    EXPECT_EQ(7u, log.count("# Failed to open /dev/kelvo: " + std::string(strerror(ENOENT))));
    EXPECT_EQ(3u, log.count("# Failed to open /dev/dpm_ldm: " + std::string(strerror(ENOENT))));
    EXPECT_FALSE(DpmDevice::isReady());
}

// Each request reaches the driver with its number and exactly the bytes of
// its layout, whatever size its number encodes.
TEST_F(KernelDevicesTest, RequestBytes) {
    gpu_info_t gpu;
    std::string name;
    std::vector<dpm_ip_record_t> records;
    dpm_ddr_data_t ddr;
    mDriver.update([](FakeKernelDriver::State& s) { s.processNames[42] = "system_server"; });
    dev_transmit_t transmit = KelvoDevice::makeTransmit(0x0102030405060708LL, 3);
    std::vector<uint8_t> pidCpuTime = {12, 0, 0, 0, 8, 7, 6, 5, 4, 3, 2, 1, 3, 0, 0, 0};
    std::vector<uint8_t> nameBlock(72, 0);
    nameBlock[4] = 42;
    memcpy(&nameBlock[8], "a_very_long_thr", 15);  // 15 characters and a terminator
    std::vector<uint8_t> ipData(8 + 3 * 96, 0);
    ipData[0] = 3;

    struct Case {
        std::function<int()> call;
        Device device;
        uint32_t request;
        std::vector<uint8_t> bytes;
    };
    std::vector<Case> cases = {
            {[] { return KelvoDevice::setGpuEnable(true); }, Device::Kelvo, 0x40016B01u, {1}},
            {[&] { return KelvoDevice::getGpuInfo(&gpu); }, Device::Kelvo, 0x80046B02u,
             std::vector<uint8_t>(484, 0)},
            {[&] { return KelvoDevice::requestPidCpuTime(&transmit); }, Device::Kelvo,
             0x40046B03u, pidCpuTime},
            {[&] { return KelvoDevice::getProcessName(42, "a_very_long_thread", &name); },
             Device::Kelvo, 0xC0046B04u, nameBlock},
            {[] { return KelvoDevice::requestKworkerInfo(0x1122334455667788LL); }, Device::Kelvo,
             0x40086B06u, {0x88, 0x77, 0x66, 0x55, 0x44, 0x33, 0x22, 0x11}},
            {[] { return KelvoDevice::enablePidCpuTime(false); }, Device::Kelvo, 0x40016B0Au, {0}},
            {[&] { return KelvoDevice::requestBinderStats(&transmit); }, Device::Kelvo,
             0x40046B0Du, pidCpuTime},
            {[] { return DpmDevice::setPeriod(1000); }, Device::Dpm, 0x40046B03u,
             {0xe8, 0x03, 0, 0}},
            {[] { return DpmDevice::getPeriod(7); }, Device::Dpm, 0xC0046B06u, {7, 0, 0, 0}},
            {[&] { return DpmDevice::getIpData(3, &records); }, Device::Dpm, 0x80086B05u, ipData},
            {[&] { return DpmDevice::getDdrData(4, &ddr); }, Device::Dpm, 0xC0006B08u,
             std::vector<uint8_t>(2 * (64 + 4 * 8), 0)},
    };
    for (size_t i = 0; i < cases.size(); ++i) {
        mDriver.clearRequests();
        EXPECT_GE(cases[i].call(), 0) << "case " << i;
        std::vector<FakeKernelDriver::Request> got = mDriver.requests();
        ASSERT_EQ(1u, got.size()) << "case " << i;
        EXPECT_EQ(cases[i].device, got[0].device) << "case " << i;
        EXPECT_EQ(cases[i].request, got[0].request) << "case " << i;
        EXPECT_EQ(cases[i].bytes, got[0].argument) << "case " << i;
    }
    EXPECT_FALSE(mDriver.state().flags[KelvoDevice::kEnablePidCpuTime]);
    EXPECT_EQ(1000, mDriver.state().period);
}

// What the driver answers reads back field by field, the DDR blocks at the
// offsets the announced step count gives.
TEST_F(KernelDevicesTest, AnswersReadBack) {
    mDriver.update([&](FakeKernelDriver::State& s) {
        s.brightness = 180;
        s.gpuSteps = {{200000, 10, 20}, {400000, 30, 40}};
        s.ips = {{"DSS", {1, 2, 3, 4}}, {std::string(64, 'n'), {5, 6, 7, 0x0b0a}}};
        s.ddrNames = {"DDR_FREQ_FLUX", "DDR_FREQ_TIME"};
        s.ddrValues = {std::vector<int64_t>{1, 2, 3}, std::vector<int64_t>{4, 5, 6}};
    });
    uint32_t brightness = 0;
    ASSERT_EQ(0, KelvoDevice::getBrightnessInfo(&brightness));
    EXPECT_EQ(180u, brightness);
    gpu_info_t gpu;
    ASSERT_EQ(0, KelvoDevice::getGpuInfo(&gpu));
    ASSERT_EQ(2, gpu.count);
    // The steps are packed: read them by value.
    int64_t frequency = gpu.entries[1].frequency;
    int64_t idleUs = gpu.entries[1].idleUs;
    EXPECT_EQ(400000, frequency);
    EXPECT_EQ(40, idleUs);
    EXPECT_EQ(2, DpmDevice::getIpCount());
    std::vector<dpm_ip_record_t> records;
    ASSERT_EQ(0, DpmDevice::getIpData(8, &records));
    ASSERT_EQ(2u, records.size());
    EXPECT_EQ(0x0b, records[1].bytes[89]);  // the idle time's second byte
    EXPECT_EQ('n', records[1].bytes[63]);    // a name that fills its field
    ASSERT_EQ(3, DpmDevice::getDdrFreqCount());
    dpm_ddr_data_t ddr;
    ASSERT_EQ(0, DpmDevice::getDdrData(3, &ddr));
    EXPECT_EQ("DDR_FREQ_FLUX", ddr.names[0]);
    EXPECT_EQ("DDR_FREQ_TIME", ddr.names[1]);
    EXPECT_EQ((std::vector<int64_t>{1, 2, 3}), ddr.values[0]);
    EXPECT_EQ((std::vector<int64_t>{4, 5, 6}), ddr.values[1]);
}

// Names fill their field without a terminator; they end at the field.
TEST_F(KernelDevicesTest, NamesBoundedByTheirField) {
    mDriver.update([](FakeKernelDriver::State& s) {
        s.processNames[1] = std::string(48, 'p');
        s.processNames[2] = std::string(60, 'q');
        s.processNames[3] = "";
        s.ddrNames = {std::string(64, 'x'), "DDR_FREQ_TIME"};
        s.ddrValues = {std::vector<int64_t>{9}, std::vector<int64_t>{8}};
    });
    std::string name;
    EXPECT_EQ(0, KelvoDevice::getProcessName(1, "t", &name));
    EXPECT_EQ(std::string(48, 'p'), name);
    EXPECT_EQ(0, KelvoDevice::getProcessName(2, "t", &name));
    EXPECT_EQ(std::string(48, 'q'), name);
    EXPECT_EQ(-2, KelvoDevice::getProcessName(3, "t", &name));
    EXPECT_TRUE(name.empty());
    dpm_ddr_data_t ddr;
    ASSERT_EQ(0, DpmDevice::getDdrData(1, &ddr));
    EXPECT_EQ(std::string(64, 'x'), ddr.names[0]);
    EXPECT_EQ(std::vector<int64_t>{9}, ddr.values[0]);
}

// Counts and values from the kernel are checked before they size anything.
TEST_F(KernelDevicesTest, HostileCounts) {
    struct Case {
        std::function<void(FakeKernelDriver::State&)> set;
        std::function<int()> call;
        int expected;
    };
    gpu_info_t gpu;
    std::vector<dpm_ip_record_t> records;
    dpm_ddr_data_t ddr;
    std::vector<Case> cases = {
            {[](auto& s) { s.gpuCount = 21; }, [&] { return KelvoDevice::getGpuInfo(&gpu); }, -2},
            {[](auto& s) { s.gpuCount = -1; }, [&] { return KelvoDevice::getGpuInfo(&gpu); }, -2},
            {[](auto& s) { s.gpuCount = 20; }, [&] { return KelvoDevice::getGpuInfo(&gpu); }, 0},
            {[](auto& s) { s.version = -3; }, [] { return DpmDevice::getVersion(); }, -2},
            {[](auto& s) { s.ipCount = 1000000; }, [] { return DpmDevice::getIpCount(); }, 256},
            {[](auto& s) { s.ipCount = -1; }, [] { return DpmDevice::getIpCount(); }, -2},
            {[](auto& s) { s.ipCount = -1; }, [&] { return DpmDevice::getIpData(2, &records); },
             -2},
            {[](auto& s) { s.ipCount = 1000; },
             [&] { return static_cast<int>(DpmDevice::getIpData(2, &records) + records.size()); },
             2},
            {[](auto&) {}, [&] { return DpmDevice::getIpData(257, &records); }, -5},
            {[](auto& s) { s.ddrCount = 33; }, [] { return DpmDevice::getDdrFreqCount(); }, 32},
            {[](auto& s) { s.ddrCount = INT32_MIN; }, [] { return DpmDevice::getDdrFreqCount(); },
             -2},
            {[](auto&) {}, [&] { return DpmDevice::getDdrData(33, &ddr); }, -5},
    };
    for (size_t i = 0; i < cases.size(); ++i) {
        mDriver.update([&](FakeKernelDriver::State& s) {
            s = FakeKernelDriver::State();
            s.ips.resize(4);
            cases[i].set(s);
        });
        // Every refused or capped answer is counted; a good answer or a bad
        // argument of the caller is not.
        uint64_t refused = kelvo::HealthCounters::get(kelvo::Health::DeviceAnswersRefused);
        EXPECT_EQ(cases[i].expected, cases[i].call()) << "case " << i;
        bool counted = cases[i].expected != 0 && cases[i].expected != -5;
        EXPECT_EQ(refused + (counted ? 1 : 0),
                  kelvo::HealthCounters::get(kelvo::Health::DeviceAnswersRefused))
                << "case " << i;
    }
}

// A failed request (an error, a driver hanging up, a character device that
// knows no such request) reports failure and leaves the output as it was.
TEST_F(KernelDevicesTest, FailedRequests) {
    LogCapture log;
    mDriver.update([](FakeKernelDriver::State& s) { s.brightness = 99; });
    mDriver.failRequest(Device::Kelvo, KelvoDevice::kGetBrightnessInfo, EIO);
    mDriver.failRequest(Device::Dpm, DpmDevice::kGetVersion, 0, true);
    uint32_t brightness = 7;
    EXPECT_EQ(-2, KelvoDevice::getBrightnessInfo(&brightness));
    EXPECT_EQ(7u, brightness);
    EXPECT_TRUE(log.contains("KelvoDevice.cpp] getBrightnessInfo# Failed to get brightness"));
    EXPECT_EQ(-2, DpmDevice::getVersion());
    EXPECT_TRUE(log.contains("getVersion# Failed to get version"));
    EXPECT_TRUE(DpmDevice::isReady());

    mDriver.stop();
    ASSERT_EQ(0, symlink("/dev/null", (mRoot.path() + "/dev/kelvo").c_str()));
    EXPECT_EQ(-2, KelvoDevice::getBrightnessInfo(&brightness));
    EXPECT_TRUE(log.contains("Failed to ioctl: -1(" + std::string(strerror(ENOTTY)) + ")"));
}

// Every served report request comes back later from "kelvo_driver" with its
// report's magic, the request's time and reason, then the supplied body; a
// failed request gets no report.
TEST_F(KernelDevicesTest, ReportRequestsAnsweredAsTheDriversBufferedLogClient) {
    android::sp<BufferedLogServer> server = new BufferedLogServer("ReportServer", 2000);
    ASSERT_EQ(0, server->start());
    android::sp<test::EntryRecorder> recorder = new test::EntryRecorder();
    android::sp<LogReceiver> receiver = new LogReceiver(recorder);
    for (int32_t magic = 0; magic < 4; ++magic) {
        ASSERT_EQ(0, server->registerLogReceiver(receiver, android::String8("kelvo_driver"), magic));
    }
    FakeDriverReporter reporter(mDriver);
    reporter.setBodyProvider([](const FakeDriverReporter::Report& r) {
        return r.magic == FakeDriverReporter::MAGIC_BINDER_STATS ? std::string("\x00\xff", 2) : "";
    });
    reporter.start();
    mDriver.failRequest(Device::Kelvo, KelvoDevice::kRequestUeventInfo, EIO);
    auto echo = [](int32_t magic, int64_t time, int32_t reason) {
        std::string bytes(12, '\0');
        memcpy(&bytes[0], &time, 8);
        memcpy(&bytes[8], &reason, 4);
        return "kelvo_driver:" + std::to_string(magic) + ":" + bytes;
    };
    dev_transmit_t cpu = KelvoDevice::makeTransmit(-5, 3);
    dev_transmit_t binder = KelvoDevice::makeTransmit(0x0102030405060708LL, 4);
    EXPECT_EQ(0, KelvoDevice::requestPidCpuTime(&cpu));
    EXPECT_EQ(0, KelvoDevice::requestKworkerInfo(3600000));
    EXPECT_EQ(-2, KelvoDevice::requestUeventInfo(3600000));
    EXPECT_EQ(0, KelvoDevice::requestBinderStats(&binder));
    std::vector<std::string> expected = {echo(0, -5, 3), echo(1, 3600000, 0),
                                         echo(3, 0x0102030405060708LL, 4) + std::string("\x00\xff", 2)};
    ASSERT_TRUE(kelvo::test::waitFor([&] { return recorder->got().size() >= expected.size(); }));
    EXPECT_EQ(expected, recorder->got());
    EXPECT_EQ(3u, reporter.sent());
    reporter.stop();
    server->stop();
    recorder->requestThreadExit();
    recorder->join();
}
