#include <gtest/gtest.h>

#include <chrono>
#include <thread>
#include <vector>

#include "common/RecordingHandler.h"
#include "common/TestEnv.h"
#include "core/Notifier.h"
#include "utils/HandlerThread.h"

using android::Parcel;
using android::sp;
using namespace kelvo;
using kelvo::test::LogCapture;
using kelvo::test::waitFor;

namespace {

using ListeningThread = kelvo::test::RecordingHandler;

int32_t notify(Notifier* notifier, int32_t type, int64_t t) {
    Parcel body;
    body.writeInt64(t);
    return notifier->sendNotification(type, body);
}

// Sends a marker of a type only the marker thread listens for, and waits
// until it arrived: everything sent before it has been fanned out by then.
void drain(Notifier* notifier) {
    static sp<ListeningThread> marker = new ListeningThread("NotifyMarker");
    static NotifierListener* listener = new NotifierListener(marker);
    static bool registered = notifier->registerListener(kelvo::NOTIFICATION_DIFF_DAY_REBOOT,
                                                        listener) == 0;
    ASSERT_TRUE(registered);
    size_t before = marker->got().size();
    notify(notifier, kelvo::NOTIFICATION_DIFF_DAY_REBOOT, -1);
    ASSERT_TRUE(waitFor([&] { return marker->got().size() > before; }));
    // Give the listeners a moment to take what was posted before the marker.
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
}

// Unregisters the listeners when the test ends, however it ends: the
// notifier must never keep a record that left the stack.
struct Registered {
    std::vector<NotifierListener*> listeners;
    ~Registered() {
        for (NotifierListener* l : listeners) Notifier::getInstance()->unregisterAll(l);
    }
};

} // namespace

TEST(NotifierTest, FansOutToEveryListenerOfTheTypeInOrder) {
    Notifier* notifier = Notifier::getInstance();
    drain(notifier); // nothing sent by an earlier test arrives here
    sp<ListeningThread> a = new ListeningThread("ListenerA");
    sp<ListeningThread> b = new ListeningThread("ListenerB");
    NotifierListener la(a);
    NotifierListener lb(b);
    Registered cleanup{{&la, &lb}};
    ASSERT_EQ(0, notifier->registerListener(kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, &la));
    ASSERT_EQ(0, notifier->registerListener(kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, &lb));
    ASSERT_EQ(0, notifier->registerListener(kelvo::NOTIFICATION_HOURLY_TICK, &la));

    for (int64_t t = 1; t <= 5; ++t) {
        EXPECT_GE(notify(notifier, kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, t), 0);
    }
    notify(notifier, kelvo::NOTIFICATION_HOURLY_TICK, 100);
    drain(notifier);
    ASSERT_TRUE(waitFor([&] { return a->got().size() == 6 && b->got().size() == 5; }));

    std::vector<kelvo::test::RecordingHandler::Got> gotA = a->got();
    for (int i = 0; i < 5; ++i) {
        EXPECT_EQ(kelvo::MESSAGE_NOTIFICATION, gotA[i].type);
        EXPECT_EQ(kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, gotA[i].what);
        EXPECT_EQ(i + 1, gotA[i].time);
        EXPECT_EQ(i + 1, b->got()[i].time);
    }
    EXPECT_EQ(kelvo::NOTIFICATION_HOURLY_TICK, gotA[5].what);
    EXPECT_EQ(100, gotA[5].time);

    // A listener whose thread ended is skipped without harm to the next one.
    a->requestThreadExit();
    a->join();
    LogCapture log;
    notify(notifier, kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, 9);
    drain(notifier);
    ASSERT_TRUE(waitFor([&] { return b->got().size() == 6; }));
    EXPECT_TRUE(log.contains("ListenerA is not running or is pending to exit"));
    // After unregistering, nothing more arrives.
    notifier->unregisterListener(kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, &lb);
    notify(notifier, kelvo::NOTIFICATION_SCREEN_STATE_CHANGED, 10);
    drain(notifier);
    EXPECT_EQ(6u, b->got().size());
    b->requestThreadExit();
}

TEST(NotifierTest, BadAndDuplicateRegistrationsAreRefused) {
    Notifier* notifier = Notifier::getInstance();
    sp<ListeningThread> a = new ListeningThread("ListenerDup");
    NotifierListener la(a);
    Registered cleanup{{&la}};
    LogCapture log;
    EXPECT_EQ(-5, notifier->registerListener(23, &la));
    EXPECT_EQ(-5, notifier->registerListener(0, nullptr));
    EXPECT_EQ(2u, log.count("registerListener# Invalid parameter", ANDROID_LOG_ERROR));
    ASSERT_EQ(0, notifier->registerListener(kelvo::NOTIFICATION_HOURLY_TICK, &la));
    EXPECT_EQ(-13, notifier->registerListener(kelvo::NOTIFICATION_HOURLY_TICK, &la));
    ASSERT_EQ(0, notifier->registerListener(kelvo::NOTIFICATION_VM_DIED, &la));
    notify(notifier, kelvo::NOTIFICATION_HOURLY_TICK, 77);
    // An unknown type is accepted by the sender and refused on the notifier
    // thread.
    EXPECT_GE(notify(notifier, 30, 1), 0);
    drain(notifier);
    EXPECT_EQ(1u, a->got().size());
    EXPECT_TRUE(log.contains("[Notifier.cpp] notifyAllListeners# Unknown notification type: 30",
                             ANDROID_LOG_ERROR));
    // Unregistered from every type at once.
    notifier->unregisterAll(&la);
    notify(notifier, kelvo::NOTIFICATION_HOURLY_TICK, 78);
    notify(notifier, kelvo::NOTIFICATION_VM_DIED, 79);
    drain(notifier);
    EXPECT_EQ(1u, a->got().size());
    a->requestThreadExit();
}
