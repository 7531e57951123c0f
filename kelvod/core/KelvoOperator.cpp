#include "core/KelvoOperator.h"

#include <functional>

#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/BufferedLogServer.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "storage/DataUploader.h"
#include "utils/TimerManager.h"

namespace kelvo {

namespace {

// Runs lateInitialize on the operator's own thread. Internal: never sent by
// anyone but initialize().
constexpr int32_t kLateInitializeMessage = 100;
// what: timer id; sent to itself when a timer could not be re-armed.
constexpr int32_t kTimerRearmMessage = 101;

// Request codes of the hourly routine.
constexpr int32_t kHourlyVote = 0;
constexpr int32_t kHourlyCompensation = 3;
constexpr int32_t kHourlyElector = 4;

} // namespace

int32_t MyLibraryListener::handleLibraryEvent(int32_t event, const android::Parcel& reply) {
    android::sp<KelvoOperator> op = mOperator.promote();
    if (op == nullptr) {
        KLOGE("Invalid handler");
        return -6;
    }
    return op->handleLibraryEvent(event, reply);
}

KelvoOperator::KelvoOperator(const char* name, int32_t accounterType, uint32_t elector)
    : HandlerThread(name, 11), mAccounterType(accounterType), mElector(elector) {}

KelvoOperator::~KelvoOperator() {
    // Released without readyToDestroy: the notifier holds the record by
    // address, so it goes from every type before the record is freed, and
    // the buffered log server lets go of the receiver.
    if (mNotifierListener != nullptr) {
        Notifier::getInstance()->unregisterAll(mNotifierListener.get());
    }
    for (const auto& key : mBufferedLogKeys) {
        BufferedLogServer::getInstance()->unregisterLogReceiver(key.first, key.second);
    }
}

int32_t KelvoOperator::earlyInitialize() {
    setConfiguration();
    int32_t ret = checkEnable();
    if (ret < 0) {
        KLOGE("Check support failed, disable module: %d", mAccounterType);
        requestThreadExit();
        return -2;
    }
    return 0;
}

int32_t KelvoOperator::initialize() {
    registerListeners();
    registerDispatcherTag();
    setCandidateElector();
    // Late initialization touches the operator's state: it runs on the
    // operator's own thread, after everything queued before it.
    return sendMessageSync(ParcelMessage(kLateInitializeMessage, 0));
}

void KelvoOperator::readyToDestroy() {
    unregisterListeners();
}

void KelvoOperator::addNotifierListener(int32_t type, android::Parcel& out) {
    out.writeInt32(LISTENER_NOTIFIER);
    out.writeInt32(type);
}

void KelvoOperator::addLibraryListener(int32_t type, android::Parcel& out) {
    out.writeInt32(LISTENER_LIBRARY);
    out.writeInt32(type);
}

void KelvoOperator::addBufferedLogReceiver(const char* name, int32_t type, android::Parcel& out) {
    out.writeInt32(LISTENER_BUFFERED_LOG);
    out.writeString8(android::String8(name != nullptr ? name : ""));
    out.writeInt32(type);
}

void KelvoOperator::forEachListenerRecord(
        const std::function<void(int32_t kind, const android::String8& name, int32_t type)>& visit) {
    android::Parcel records;
    setupListeners(records);
    records.writeInt32(LISTENER_END);
    records.setDataPosition(0);
    for (;;) {
        int32_t kind = records.readInt32();
        android::String8 name;
        switch (kind) {
            case LISTENER_END:
                return;
            case LISTENER_BUFFERED_LOG:
                name = records.readString8();
                [[fallthrough]];
            case LISTENER_NOTIFIER:
            case LISTENER_LIBRARY:
                visit(kind, name, records.readInt32());
                break;
            default:
                KLOGE("Unknown listener type: %d", kind);
                return;
        }
    }
}

void KelvoOperator::registerListeners() {
    forEachListenerRecord([this](int32_t kind, const android::String8& name, int32_t type) {
        switch (kind) {
            case LISTENER_NOTIFIER:
                if (mNotifierListener == nullptr) {
                    mNotifierListener.reset(new NotifierListener(this));
                }
                if (Notifier::getInstance()->registerListener(type, mNotifierListener.get()) < 0) {
                    KLOGE("Failed to register notification listener: %d", type);
                }
                break;
            case LISTENER_LIBRARY:
                if (mLibraryListener == nullptr) {
                    mLibraryListener = new MyLibraryListener(this);
                }
                if (registerLibraryListener(type, mLibraryListener) < 0) {
                    KLOGE("Failed to register library listener");
                }
                break;
            case LISTENER_BUFFERED_LOG:
                if (mLogReceiver == nullptr) {
                    mLogReceiver = new LogReceiver(this);
                }
                if (BufferedLogServer::getInstance()->registerLogReceiver(mLogReceiver, name,
                                                                          type) < 0) {
                    KLOGE("Failed to register buffered log listener");
                } else {
                    mBufferedLogKeys.emplace_back(name, type);
                }
                break;
        }
    });
}

void KelvoOperator::unregisterListeners() {
    forEachListenerRecord([this](int32_t kind, const android::String8& name, int32_t type) {
        switch (kind) {
            case LISTENER_NOTIFIER:
                if (mNotifierListener != nullptr) {
                    Notifier::getInstance()->unregisterListener(type, mNotifierListener.get());
                }
                break;
            case LISTENER_LIBRARY:
                if (mLibraryListener != nullptr) {
                    unregisterLibraryListener(type);
                }
                break;
            case LISTENER_BUFFERED_LOG:
                if (mLogReceiver != nullptr) {
                    BufferedLogServer::getInstance()->unregisterLogReceiver(name, type);
                }
                break;
        }
    });
    if (mNotifierListener != nullptr) {
        Notifier::getInstance()->unregisterAll(mNotifierListener.get());
    }
    mNotifierListener.reset();
    mBufferedLogKeys.clear();
    mLibraryListener.clear();
    mLogReceiver.clear();
}

int32_t KelvoOperator::sendLoggerMessage(int32_t tag, const android::Parcel& data) {
    return sendMessage(ParcelMessage(MESSAGE_LOGGER, tag, data));
}

int32_t KelvoOperator::sendNotification(int32_t type, const android::Parcel& data) {
    return Notifier::getInstance()->sendNotification(type, data);
}

int32_t KelvoOperator::sendCustomizedMessage(int32_t code, const android::Parcel& data,
                                             android::Parcel* reply, bool sync) {
    if (!sync) {
        return sendMessage(ParcelMessage(MESSAGE_CUSTOMIZED, code, data));
    }
    if (reply == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    return sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, code, data, reply));
}

int32_t KelvoOperator::voteCandidate(int64_t time, int32_t kind, uint32_t elector) {
    android::Parcel vote;
    vote.writeInt64(time);
    vote.writeInt32(kind);
    vote.writeUint32(elector);
    return KelvoAgent::getInstance()->sendToRoutine(ROUTINE_HOURLY, kHourlyVote, vote, nullptr,
                                                    false);
}

int32_t KelvoOperator::setElector(uint32_t elector, const android::Parcel& candidates) {
    if (candidates.dataSize() == 0) {
        KLOGE("Empty candidates");
        return -5;
    }
    android::Parcel data;
    data.writeUint32(elector);
    data.appendFrom(&candidates, 0, candidates.dataSize());
    return KelvoAgent::getInstance()->sendToRoutine(ROUTINE_HOURLY, kHourlyElector, data, nullptr,
                                                    false);
}

int32_t KelvoOperator::updateCompensation(int64_t time, uint32_t kind, int64_t value) {
    android::Parcel data;
    data.writeInt64(time);
    data.writeUint32(kind);
    data.writeInt64(value);
    return KelvoAgent::getInstance()->sendToRoutine(ROUTINE_HOURLY, kHourlyCompensation, data,
                                                    nullptr, false);
}

int32_t KelvoOperator::feedAccounter(const android::Parcel& action) {
    return setDataAccounter(action);
}

int32_t KelvoOperator::balanceAccounting(int64_t time, int32_t kind, int64_t time2) {
    if (mAccounterType == -1) {
        return 0;
    }
    android::Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_BALANCE);
    action.writeInt32(kind);
    action.writeInt64(time);
    if (kind == 1) {
        action.writeInt64(time2);
    }
    return feedAccounter(action);
}

int32_t KelvoOperator::setEventData(uint32_t event, const android::Parcel& data, bool create) {
    if (data.dataSize() == 0) {
        return 0;
    }
    if (DataUploader::getInstance()->setEventData(event, data, create) < 0) {
        KLOGE("Failed to set eventid(%u) data", event);
        return -23;
    }
    return 0;
}

int32_t KelvoOperator::setAndUploadEvent(uint32_t event, const android::Parcel& data,
                                         bool create) {
    if (data.dataSize() == 0) {
        return 0;
    }
    if (DataUploader::getInstance()->setAndUploadEvent(event, data, create) < 0) {
        KLOGE("Failed to set or upload eventid(%u) data", event);
        return -23;
    }
    return 0;
}

int32_t KelvoOperator::handleLibraryEvent(int32_t event, const android::Parcel& data) {
    switch (event) {
        case LIBRARY_EVENT_APPLICATION:
            return handleApplicationResult(data);
        case LIBRARY_EVENT_COMPONENT:
            return handleComponentResult(data);
        default:
            KLOGE("Unknown library event: %d", event);
            return -1;
    }
}

int32_t KelvoOperator::handleParcelMessage(const ParcelMessage& msg) {
    const android::Parcel& body = msg.getParcel();
    switch (msg.type) {
        case MESSAGE_LOGGER: {
            int64_t time = 0;
            const char* text = nullptr;
            if (body.readInt64(&time) != android::NO_ERROR ||
                (text = body.readCString()) == nullptr) {
                HealthCounters::add(Health::LoggerMessageRefused);
                KLOGE("Invalid logger message for tag: %d", msg.what);
                return -5;
            }
            return handleLogger(time, msg.what, text);
        }
        case MESSAGE_NOTIFICATION:
            return handleNotification(msg.what, body);
        case MESSAGE_TIMER:
            return handleTimerExpired(msg.what);
        case MESSAGE_BUFFERED_LOG:
            return handleBufferedLog(body);
        case MESSAGE_CUSTOMIZED:
            return handleCustomized(msg.what, body, msg.getReply());
        case kTimerRearmMessage:
            return handleTimerRearm(msg.what);
        case kLateInitializeMessage:
            if (mLateInitialized) {
                KLOGE("Late initialization already done: %s", getName());
                return -13;
            }
            mLateInitialized = true;
            return lateInitialize();
        default:
            KLOGE("Unknown message type: %d", msg.type);
            return -3;
    }
}

int32_t KelvoOperator::handleNotification(int32_t type, const android::Parcel& data) {
    typedef int32_t (KelvoOperator::*Operation)(const android::Parcel&);
    static const Operation kOperations[NOTIFICATION_TYPE_COUNT] = {
            &KelvoOperator::onForegroundChanged,      &KelvoOperator::onScreenStateChanged,
            &KelvoOperator::onChargerOnlineChanged,   &KelvoOperator::onBatteryLevelChanged,
            &KelvoOperator::onDataPolling,            &KelvoOperator::onUidRemoved,
            &KelvoOperator::onPackageRemoved,         &KelvoOperator::onPackageAdded,
            &KelvoOperator::onHourlyTick,             &KelvoOperator::onDailyTick,
            &KelvoOperator::onApplicationsAccounting, &KelvoOperator::onComponentAccounting,
            &KelvoOperator::onHourlyUploading,        &KelvoOperator::onDailyUploading,
            &KelvoOperator::onDawnUploading,          &KelvoOperator::onPhoneStateChanged,
            &KelvoOperator::onTimeChanged,            &KelvoOperator::onAbnormalityThermal,
            &KelvoOperator::onForceBalance,           &KelvoOperator::onBootCompleted,
            &KelvoOperator::onShutDown,               &KelvoOperator::onVmDied,
            &KelvoOperator::onDiffDayReboot,
    };
    if (type < 0 || type >= NOTIFICATION_TYPE_COUNT) {
        KLOGE("Unknown message type: %d", type);
        return -1;
    }
    data.setDataPosition(0);
    return (this->*kOperations[type])(data);
}

int32_t KelvoOperator::feedStateChange(int32_t actionCode, const android::Parcel& data,
                                       bool named) {
    if (mAccounterType == -1) {
        return 0;
    }
    // Every state notification starts with its time, then the new state: a
    // package name for the foreground, a flag for screen and charger.
    data.setDataPosition(0);
    android::Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(actionCode);
    action.writeInt64(data.readInt64());
    if (named) {
        action.writeString8(data.readString8());
    } else {
        action.writeBool(data.readBool());
    }
    return feedAccounter(action);
}

int32_t KelvoOperator::onForegroundChanged(const android::Parcel& data) {
    return feedStateChange(ACTION_FOREGROUND, data, true);
}

int32_t KelvoOperator::onScreenStateChanged(const android::Parcel& data) {
    return feedStateChange(ACTION_SCREEN_STATE, data, false);
}

int32_t KelvoOperator::onChargerOnlineChanged(const android::Parcel& data) {
    return feedStateChange(ACTION_CHARGER_ONLINE, data, false);
}

int32_t KelvoOperator::onVmDied(const android::Parcel& data) {
    if (mAccounterType == -1) {
        return 0;
    }
    data.setDataPosition(0);
    android::Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_DEACTIVATE_ALL);
    action.writeInt64(data.readInt64());
    return feedAccounter(action);
}

int32_t KelvoOperator::onTimeChanged(const android::Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    int64_t time2 = data.readInt64();
    return balanceAccounting(time, BALANCE_SPAN, time2);
}

int32_t KelvoOperator::onAbnormalityThermal(const android::Parcel& data) {
    data.setDataPosition(0);
    return balanceAccounting(data.readInt64(), BALANCE_AT, 0);
}

int32_t KelvoOperator::onForceBalance(const android::Parcel& data) {
    data.setDataPosition(0);
    return balanceAccounting(data.readInt64(), BALANCE_AT, 0);
}

int32_t KelvoOperator::onShutDown(const android::Parcel& data) {
    data.setDataPosition(0);
    balanceAccounting(data.readInt64(), BALANCE_AT, 0);
    return forceFlushEntries();
}

int32_t KelvoOperator::onApplicationsAccounting(const android::Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    logApplicationsAccounting(time);
    voteCandidate(time, VOTE_APPLICATIONS_ACCOUNTING, mElector);
    return 0;
}

int32_t KelvoOperator::onComponentAccounting(const android::Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    logComponentAccounting(time);
    voteCandidate(time, VOTE_COMPONENT_ACCOUNTING, mElector);
    return 0;
}

int32_t KelvoOperator::onBatteryLevelChanged(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onDataPolling(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onUidRemoved(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onPackageRemoved(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onPackageAdded(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onHourlyTick(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onDailyTick(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onPhoneStateChanged(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onHourlyUploading(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onDailyUploading(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onDawnUploading(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onBootCompleted(const android::Parcel&) { return 0; }
int32_t KelvoOperator::onDiffDayReboot(const android::Parcel&) { return 0; }
int32_t KelvoOperator::logApplicationsAccounting(int64_t) { return 0; }
int32_t KelvoOperator::logComponentAccounting(int64_t) { return 0; }
int32_t KelvoOperator::lateInitialize() { return 0; }
void KelvoOperator::dump(android::String8& out) {
    // What the process dropped, refused or capped, by cause.
    out.append("Self-health counters:\n");
    out.append(HealthCounters::format().c_str());
}
void KelvoOperator::setupListeners(android::Parcel&) {}
void KelvoOperator::registerDispatcherTag() {}
void KelvoOperator::setCandidateElector() {}
int32_t KelvoOperator::checkEnable() { return 0; }
int32_t KelvoOperator::setConfiguration() { return 0; }

int32_t KelvoOperator::rearmTimer(const android::sp<TimerCallback>& callback, int64_t firstMs,
                                  int64_t intervalMs) {
    int32_t ret = TimerManager::getInstance()->rearmTimer(firstMs, intervalMs, callback);
    if (ret == 0) {
        return 0;
    }
    HealthCounters::add(Health::TimerRearmRetries);
    int32_t id = callback != nullptr ? callback->getId() : -1;
    int64_t delay = sTimerRetryDelayMs.load(std::memory_order_relaxed);
    KLOGE("Failed to re-arm timer %d of %s: %d, retrying in %lld ms", id, getName(), ret,
          static_cast<long long>(delay));
    sendMessageDelayed(delay * 1000000LL, ParcelMessage(kTimerRearmMessage, id));
    return ret;
}

std::atomic<int64_t> KelvoOperator::sTimerRetryDelayMs{KelvoOperator::kTimerRetryDelayMs};

void KelvoOperator::setTimerRetryDelayMs(int64_t ms) {
    sTimerRetryDelayMs.store(ms > 0 ? ms : kTimerRetryDelayMs, std::memory_order_relaxed);
}

int32_t KelvoOperator::handleTimerRearm(int32_t id) {
    KLOGI("No timer %d to re-arm in %s", id, getName());
    return 0;
}

int32_t KelvoOperator::handleTimerExpired(int32_t) {
    KLOGI("Receive timer expired message, please implement this function in subclass");
    return 0;
}

int32_t KelvoOperator::handleLogger(int64_t, int32_t, const char*) {
    KLOGI("Receive a logger message, please implement this function in subclass");
    return 0;
}

int32_t KelvoOperator::handleBufferedLog(const android::Parcel&) {
    KLOGI("Please implement this function in subclass");
    return 0;
}

int32_t KelvoOperator::handleCustomized(int32_t, const android::Parcel&, android::Parcel*) {
    KLOGI("Please implement this function in subclass");
    return 0;
}

int32_t KelvoOperator::handleApplicationResult(const android::Parcel&) {
    KLOGI("Please implement this function in subclass");
    return 0;
}

int32_t KelvoOperator::handleComponentResult(const android::Parcel&) {
    KLOGI("Please implement this function in subclass");
    return 0;
}

} // namespace kelvo
