// The manager service, called through its client as vendor processes call
// it, with a stand-in modem handler that records what reaches it.

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "HealthCounters.h"
#include "common/TestEnv.h"
#include "core/KelvoAgent.h"
#include "hidl/KelvoManager.h"
#include "kelvo/KelvoManagerClient.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;
using vendor::tovaro::hardware::kelvo::V1_0::IKelvoManager;
using vendor::tovaro::hardware::kelvo::V1_0::KelvoEvent;

namespace {

std::mutex gLock;
// Each request the stand-in got: its code, then the parcel's bytes.
std::vector<std::pair<int32_t, std::string>> gGot;

std::vector<std::pair<int32_t, std::string>> got() {
    std::lock_guard<std::mutex> guard(gLock);
    return gGot;
}

class ModemStandIn : public KelvoOperator {
public:
    ModemStandIn() : KelvoOperator("ModemStandIn", -1, 0) {}
    int32_t handleCustomized(int32_t code, const Parcel& data, Parcel*) override {
        std::lock_guard<std::mutex> guard(gLock);
        gGot.emplace_back(code, std::string(reinterpret_cast<const char*>(data.data()),
                                            data.dataSize()));
        return 0;
    }
};

sp<KelvoOperator> makeModem() {
    return new ModemStandIn();
}

// int32 size, then the bytes: what the modem handler is to get.
std::string parcelOf(const std::string& bytes) {
    Parcel p;
    p.writeInt32(static_cast<int32_t>(bytes.size()));
    p.write(bytes.data(), bytes.size());
    return std::string(reinterpret_cast<const char*>(p.data()), p.dataSize());
}

class KelvoManagerTest : public ::testing::Test {
protected:
    void SetUp() override {
        for (int i = 0; i < HANDLER_COUNT; ++i) KelvoAgent::setHandlerFactory(i, nullptr);
        for (int i = 0; i < ROUTINE_COUNT; ++i) KelvoAgent::setRoutineFactory(i, nullptr);
        KelvoAgent::setHandlerFactory(HANDLER_MODEM, makeModem);
        mRoot.reset(new test::TempRoot());
        {
            std::lock_guard<std::mutex> guard(gLock);
            gGot.clear();
        }
        mAgent = new KelvoAgent();
        mAgent->initiate();
        ASSERT_NE(nullptr, mAgent->getHandler(HANDLER_MODEM).get());
    }
    void TearDown() override {
        KelvoAgent::setHandlerFactory(HANDLER_MODEM, nullptr);
        sp<KelvoOperator> modem = mAgent->getHandler(HANDLER_MODEM);
        if (modem != nullptr) modem->requestThreadExit();
        mAgent->getStorage()->closeConnection();
        mAgent->getStorage()->requestThreadExit();
        mRoot.reset();
    }
    // Every request posted so far has been handled.
    void drain() {
        Parcel reply;
        mAgent->sendToHandler(HANDLER_MODEM, 99, Parcel(), &reply, true);
    }
    std::unique_ptr<test::TempRoot> mRoot;
    sp<KelvoAgent> mAgent;
};

} // namespace

TEST_F(KelvoManagerTest, TakesModemBlocksAndRefusesBadTypesAndSizes) {
    const std::string block(64, 'm');
    struct Case {
        const char* name;
        int32_t type;
        std::string bytes;
        uint32_t declared;
        int32_t result;
        const char* errorLine;  // null: accepted
        std::string delivered;  // the block's part that reaches the handler
    } cases[] = {
            {"whole block", 100, block, 64, 0, nullptr, block},
            {"size 0", 100, "", 0, 0, nullptr, ""},
            {"size below the block", 100, block, 10, 0, nullptr, block.substr(0, 10)},
            {"type 99", 99, block, 64, -1, "Unknown event type: 99", ""},
            {"size above the block", 100, block, 65, -1, "Event size 65 above the block size 64", ""},
            {"size above the cap", 100, block, KelvoManager::kMaxEventBytes + 1, -1,
             "above the limit", ""},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        {
            std::lock_guard<std::mutex> guard(gLock);
            gGot.clear();
        }
        LogCapture log;
        uint64_t refused = HealthCounters::get(Health::HidlEventsRefused);
        EXPECT_EQ(c.result, KelvoManagerClient::send(c.type, c.bytes.data(), c.bytes.size(),
                                                      c.declared));
        drain();
        std::vector<std::pair<int32_t, std::string>> events;
        for (const auto& g : got()) {
            if (g.first != 99) events.push_back(g);
        }
        if (c.errorLine == nullptr) {
            ASSERT_EQ(1u, events.size());
            EXPECT_EQ(KelvoManager::kModemEventRequest, events[0].first);
            EXPECT_EQ(parcelOf(c.delivered), events[0].second);
            EXPECT_EQ(refused, HealthCounters::get(Health::HidlEventsRefused));
        } else {
            EXPECT_TRUE(events.empty());
            EXPECT_TRUE(log.contains(c.errorLine, ANDROID_LOG_ERROR));
            EXPECT_EQ(refused + 1, HealthCounters::get(Health::HidlEventsRefused));
        }
    }
}

TEST_F(KelvoManagerTest, RefusesMissingMemoryAndAnAbsentHandler) {
    sp<IKelvoManager> service = IKelvoManager::getService("default");
    ASSERT_NE(nullptr, service.get());
    LogCapture log;
    // No descriptor at all, and one that is no memory block.
    KelvoEvent event;
    event.type = 100;
    event.size = 4;
    EXPECT_EQ(-1, static_cast<int32_t>(service->sendKelvoEvent(event)));
    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    ASSERT_EQ(4, write(fds[1], "abcd", 4));
    native_handle_t* handle = native_handle_create(1, 0);
    handle->data[0] = fds[0];
    event.memory = android::hardware::hidl_memory("memfd", handle, 4);
    EXPECT_EQ(-1, static_cast<int32_t>(service->sendKelvoEvent(event)));
    native_handle_delete(handle);
    close(fds[0]);
    close(fds[1]);
    EXPECT_EQ(2u, log.count("Failed to map the event memory", ANDROID_LOG_ERROR));

    // Without a modem handler the event is not taken.
    mAgent->getHandler(HANDLER_MODEM)->requestThreadExit();
    mAgent->setHandlerForTest(HANDLER_MODEM, nullptr);
    EXPECT_EQ(-1, KelvoManagerClient::send(100, "abcd", 4));
    EXPECT_TRUE(log.contains("Modem handler absent (modem disabled)", ANDROID_LOG_INFO));
}

// A sender that shrinks its block while the service copies it: the copy
// stops at the block's end, so the event is either whole or refused.
TEST_F(KelvoManagerTest, ASenderShrinkingItsBlockGetsAWholeEventOrARefusal) {
    const size_t kBytes = 256 * 1024;
    std::string bytes(kBytes, 'x');
    for (int round = 0; round < 20; ++round) {
        int fd = memfd_create("shrinking", MFD_CLOEXEC);
        ASSERT_EQ(static_cast<ssize_t>(kBytes), write(fd, bytes.data(), kBytes));
        sp<IKelvoManager> service = IKelvoManager::getService("default");
        ASSERT_NE(nullptr, service.get());
        KelvoEvent event;
        event.type = 100;
        event.size = kBytes;
        native_handle_t* handle = native_handle_create(1, 0);
        handle->data[0] = fd;
        event.memory = android::hardware::hidl_memory("memfd", handle, kBytes);
        std::thread shrink([&] {
            usleep(static_cast<useconds_t>(round * 50));
            EXPECT_EQ(0, ftruncate(fd, round % 2 == 0 ? 0 : 4096));
        });
        int32_t result = service->sendKelvoEvent(event);
        shrink.join();
        native_handle_delete(handle);
        close(fd);
        EXPECT_TRUE(result == 0 || result == -1) << result;
    }
    drain();
    for (const auto& g : got()) {
        if (g.first == KelvoManager::kModemEventRequest) {
            EXPECT_EQ(parcelOf(bytes), g.second);
        }
    }
}
