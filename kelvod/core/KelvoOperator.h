#pragma once

#include <stdint.h>

#include <atomic>
#include <functional>
#include <memory>
#include <utility>
#include <vector>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "LibraryListener.h"
#include "core/LogReceiver.h"
#include "core/NotifierListener.h"
#include "storage/StorageOperator.h"
#include "utils/HandlerThread.h"
#include "utils/TimerCallback.h"

namespace kelvo {

class KelvoOperator;

// Hands an accounter's results back to the operator that owns its type. The
// library keeps the listener, the listener only a weak reference to the
// operator: a registration never keeps an operator alive.
class MyLibraryListener : public LibraryListener {
public:
    explicit MyLibraryListener(const android::wp<KelvoOperator>& op) : mOperator(op) {}
    int32_t handleLibraryEvent(int32_t event, const android::Parcel& reply) override;

private:
    android::wp<KelvoOperator> mOperator;
};

// Base of every handler and routine: one worker thread and its own tables.
// It fixes the start-up protocol, turns incoming messages into the named
// operations below, feeds the operator's accounter on foreground, screen and
// charger changes, and offers voting, uploading and messaging to the others.
class KelvoOperator : public HandlerThread, public StorageOperator {
public:
    // Kinds of the listener records written by setupListeners.
    enum listener_record : int32_t {
        LISTENER_END = 0,
        LISTENER_NOTIFIER = 1,     // int32 notification type
        LISTENER_LIBRARY = 2,      // int32 accounter type
        LISTENER_BUFFERED_LOG = 3, // String8 sender name, int32 entry type
    };
    // Vote kinds of the hourly rounds.
    enum vote_kind : int32_t {
        VOTE_APPLICATIONS_ACCOUNTING = 2,
        VOTE_COMPONENT_ACCOUNTING = 3,
    };

    KelvoOperator(const char* name, int32_t accounterType, uint32_t elector);
    ~KelvoOperator() override;

    // Start-up, on the main thread while the operator's thread idles.
    // earlyInitialize ends the thread and returns -2 when the operator's
    // component is not supported.
    int32_t earlyInitialize();
    // Listeners, dispatcher tags, electors, then lateInitialize on the
    // operator's own thread.
    int32_t initialize();
    void readyToDestroy();

    int32_t getAccounterType() const { return mAccounterType; }
    uint32_t getElector() const { return mElector; }

    // Sending.
    int32_t sendLoggerMessage(int32_t tag, const android::Parcel& data);
    int32_t sendNotification(int32_t type, const android::Parcel& data);
    int32_t sendCustomizedMessage(int32_t code, const android::Parcel& data,
                                  android::Parcel* reply, bool sync);
    int32_t voteCandidate(int64_t time, int32_t kind, uint32_t elector);
    int32_t setElector(uint32_t elector, const android::Parcel& candidates);
    int32_t updateCompensation(int64_t time, uint32_t kind, int64_t value);
    int32_t balanceAccounting(int64_t time, int32_t kind, int64_t time2);
    int32_t setEventData(uint32_t event, const android::Parcel& data, bool create);
    int32_t setAndUploadEvent(uint32_t event, const android::Parcel& data, bool create);
    // A result of this operator's accounter (0 application, 1 component).
    int32_t handleLibraryEvent(int32_t event, const android::Parcel& data);

    // Listener records, written inside setupListeners.
    static void addNotifierListener(int32_t type, android::Parcel& out);
    static void addLibraryListener(int32_t type, android::Parcel& out);
    static void addBufferedLogReceiver(const char* name, int32_t type, android::Parcel& out);

    virtual int32_t lateInitialize();
    // The base prints the process-wide self-health counters; an override
    // adds its own state and calls it.
    virtual void dump(android::String8& out);
    virtual int32_t onForegroundChanged(const android::Parcel& data);
    virtual int32_t onScreenStateChanged(const android::Parcel& data);
    virtual int32_t onChargerOnlineChanged(const android::Parcel& data);
    virtual int32_t onBatteryLevelChanged(const android::Parcel& data);
    virtual int32_t onDataPolling(const android::Parcel& data);
    virtual int32_t onUidRemoved(const android::Parcel& data);
    virtual int32_t onPackageRemoved(const android::Parcel& data);
    virtual int32_t onPackageAdded(const android::Parcel& data);
    virtual int32_t onHourlyTick(const android::Parcel& data);
    virtual int32_t onDailyTick(const android::Parcel& data);
    virtual int32_t onPhoneStateChanged(const android::Parcel& data);
    virtual int32_t onApplicationsAccounting(const android::Parcel& data);
    virtual int32_t onComponentAccounting(const android::Parcel& data);
    virtual int32_t onHourlyUploading(const android::Parcel& data);
    virtual int32_t onDailyUploading(const android::Parcel& data);
    virtual int32_t onDawnUploading(const android::Parcel& data);
    virtual int32_t onTimeChanged(const android::Parcel& data);
    virtual int32_t onAbnormalityThermal(const android::Parcel& data);
    virtual int32_t onForceBalance(const android::Parcel& data);
    virtual int32_t onBootCompleted(const android::Parcel& data);
    virtual int32_t onShutDown(const android::Parcel& data);
    virtual int32_t onVmDied(const android::Parcel& data);
    virtual int32_t onDiffDayReboot(const android::Parcel& data);
    virtual int32_t logApplicationsAccounting(int64_t time);
    virtual int32_t logComponentAccounting(int64_t time);
    virtual void setupListeners(android::Parcel& out);
    virtual void registerDispatcherTag();
    virtual void setCandidateElector();
    virtual int32_t checkEnable();
    virtual int32_t setConfiguration();
    virtual int32_t handleTimerExpired(int32_t id);
    // Called kTimerRetryDelayMs after rearmTimer could neither re-arm nor
    // add a timer of this operator: compute the times again and re-arm.
    virtual int32_t handleTimerRearm(int32_t id);
    virtual int32_t handleLogger(int64_t time, int32_t tag, const char* text);
    virtual int32_t handleBufferedLog(const android::Parcel& data);
    virtual int32_t handleCustomized(int32_t code, const android::Parcel& data,
                                     android::Parcel* reply);
    virtual int32_t handleApplicationResult(const android::Parcel& data);
    virtual int32_t handleComponentResult(const android::Parcel& data);

    int32_t handleParcelMessage(const ParcelMessage& msg) override;

    static constexpr int64_t kTimerRetryDelayMs = 10000;
    // Shortens the delay of that retry (tests); 0 or less restores it.
    static void setTimerRetryDelayMs(int64_t ms);

protected:
    // Re-arms one of this operator's timers (TimerManager::rearmTimer); when
    // that fails it logs, counts, and asks for handleTimerRearm(id) later,
    // so a timer is never silently lost.
    int32_t rearmTimer(const android::sp<TimerCallback>& callback, int64_t firstMs,
                       int64_t intervalMs);
    int32_t handleNotification(int32_t type, const android::Parcel& data);
    // Builds an action for this operator's accounter and hands it over.
    int32_t feedAccounter(const android::Parcel& action);
    int32_t feedStateChange(int32_t actionCode, const android::Parcel& data, bool named);

    int32_t mAccounterType;
    uint32_t mElector;

private:
    void registerListeners();
    void unregisterListeners();
    // Walks the records of setupListeners until the end or an unknown one.
    void forEachListenerRecord(
            const std::function<void(int32_t kind, const android::String8& name, int32_t type)>&
                    visit);

    std::unique_ptr<NotifierListener> mNotifierListener;
    // Set on the operator's thread once lateInitialize ran: it runs once.
    bool mLateInitialized = false;
    android::sp<MyLibraryListener> mLibraryListener;
    android::sp<LogReceiver> mLogReceiver;
    // Sender names and entry types registered with the buffered log server.
    std::vector<std::pair<android::String8, int32_t>> mBufferedLogKeys;

    static std::atomic<int64_t> sTimerRetryDelayMs;
};

} // namespace kelvo
