#include "routines/PollingRoutine.h"

#include <cutils/properties.h>
#include <errno.h>
#include <stdlib.h>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "utils/TimeProvider.h"
#include "utils/TimerManager.h"

namespace kelvo {

namespace {

const column_attribute kPollingColumns[] = {
        {COLUMN_TIME, "timestamp"},
        {COLUMN_INT, "reason"},
};
const table_attribute kPollingTable = {"1.0", 1, 2, kPollingColumns, "debug_data_polling"};

int64_t now() {
    return TimeProvider::getCurrentTime(TIME_TYPE_WALL);
}

} // namespace

std::atomic<int64_t> PollingRoutine::sSettingFloorMs{PollingRoutine::kSettingFloorMs};

void PollingRoutine::setSettingFloorForTest(int64_t ms) {
    sSettingFloorMs = ms > 0 ? ms : kSettingFloorMs;
}

int64_t PollingRoutine::readSetting(const char* property, int64_t defaultMs) {
    char text[PROPERTY_VALUE_MAX];
    if (property_get(property, text, "") <= 0) {
        return defaultMs;
    }
    // A whole decimal number in 64 bits; anything else (an overflow
    // included) is refused rather than cut down to some other value.
    errno = 0;
    char* end = nullptr;
    long long value = strtoll(text, &end, 10);
    int64_t floor = sSettingFloorMs.load();
    if (errno != 0 || end == text || *end != '\0' || value < floor || value > kMaxSettingMs) {
        HealthCounters::add(Health::SettingsRefused);
        KLOGE("Invalid %s: %s (accepted %lld..%lld), using %lld", property, text,
              static_cast<long long>(floor), static_cast<long long>(kMaxSettingMs),
              static_cast<long long>(defaultMs));
        return defaultMs;
    }
    return value;
}

PollingRoutine::PollingRoutine()
    : KelvoOperator("PollingRoutine", -1, 0),
      mPeriodMs(readSetting(kPeriodProperty, kDefaultPeriodMs)),
      mMinIntervalMs(readSetting(kMinIntervalProperty, kDefaultMinIntervalMs)) {}

void PollingRoutine::onFirstRef() {
    KelvoOperator::onFirstRef();
    mTimer = new TimerCallback(this, kPollingTimerId);
}

PollingRoutine::~PollingRoutine() {
    if (mTimer != nullptr) {
        TimerManager::getInstance()->removeTimer(mTimer);
    }
}

void PollingRoutine::addSchemaTable() {
    addSchema(kPollingTable);
}

void PollingRoutine::cleanTables(int64_t time) {
    cleanObsoleteEntries(kPollingTable.name, time, "timestamp");
}

void PollingRoutine::dump(android::String8& out) {
    int64_t next = TimerManager::getInstance()->getExpireTime(mTimer);
    out.appendFormat("PollingRoutine: period=%lld ms, min interval=%lld ms, last poll=%lld, "
                     "next poll in=%lld ms\n",
                     static_cast<long long>(mPeriodMs), static_cast<long long>(mMinIntervalMs),
                     static_cast<long long>(mLastPoll.load()), static_cast<long long>(next));
    KelvoOperator::dump(out);
}

int32_t PollingRoutine::lateInitialize() {
    // The first add goes through the re-arm helper too: a timer that cannot
    // be made now is retried later instead of never polling.
    return rearmTimer(mTimer, mPeriodMs, mPeriodMs);
}

void PollingRoutine::setupListeners(android::Parcel& out) {
    for (int32_t type : {NOTIFICATION_CHARGER_ONLINE_CHANGED, NOTIFICATION_BATTERY_LEVEL_CHANGED,
                         NOTIFICATION_HOURLY_TICK, NOTIFICATION_TIME_CHANGED,
                         NOTIFICATION_ABNORMALITY_THERMAL, NOTIFICATION_FORCE_BALANCE,
                         NOTIFICATION_SHUT_DOWN}) {
        addNotifierListener(type, out);
    }
}

bool PollingRoutine::isNearHour(int64_t t) {
    android::Parcel request;
    android::Parcel reply;
    int32_t ret = KelvoAgent::getInstance()->sendToRoutine(ROUTINE_HOURLY, kHourlyOffsetRequest,
                                                           request, &reply, true);
    int64_t lastTick = 0;
    int64_t left = 0;
    reply.setDataPosition(0);
    if (ret >= 0 && (reply.readInt64(&lastTick) != android::NO_ERROR ||
                     reply.readInt64(&left) != android::NO_ERROR)) {
        ret = -5;
    }
    // A negative time left is an error code of the hourly timer, not a
    // distance: taken as near it would stop these polls for good.
    if (ret >= 0 && left < 0) {
        ret = static_cast<int32_t>(left < INT32_MIN ? INT32_MIN : left);
    }
    if (ret < 0) {
        KLOGE("Failed to get timeout offset of houly timer: %d", ret);
        return false;
    }
    if (left < kNearHourMs) {
        return true;
    }
    // A clock set back puts t before the last tick: that says nothing about
    // the distance to it.
    return t >= lastTick && t - lastTick < kNearHourMs;
}

bool PollingRoutine::shouldPoll(int64_t t) {
    return !isNearHour(t) && t - mLastPoll.load() > mMinIntervalMs;
}

int32_t PollingRoutine::notifyPolling(const PollingPayload& payload, bool restartTimer) {
    android::Parcel body;
    payload.writeTo(body);
    body.setDataPosition(0);
    int32_t ret = sendNotification(NOTIFICATION_DATA_POLLING, body);
    if (restartTimer) {
        rearmTimer(mTimer, mPeriodMs, mPeriodMs);
    }
    KLOGI("Polling routine start, timestamp: %lld, reason: %d",
          static_cast<long long>(payload.time), payload.reason);
    android::Parcel row;
    row.writeInt64(payload.time);
    row.writeInt32(payload.reason);
    insertEntries(kPollingTable, row, 1, false);
    // After a clock change the next polls are measured on the new clock.
    mLastPoll = payload.reason == POLLING_TIME_CHANGED ? now() : payload.time;
    return ret < 0 ? ret : 0;
}

int32_t PollingRoutine::pollAt(const android::Parcel& data, int32_t reason, bool restartTimer) {
    PollingPayload payload;
    payload.reason = reason;
    if (data.readInt64(&payload.time) != android::NO_ERROR) {
        KLOGE("Invalid notification for polling reason: %d", reason);
        return -5;
    }
    return notifyPolling(payload, restartTimer);
}

int32_t PollingRoutine::handleTimerExpired(int32_t id) {
    if (id != kPollingTimerId) {
        KLOGE("Unknown timer: %d", id);
        return -3;
    }
    int64_t t = now();
    if (!shouldPoll(t)) {
        return 0;
    }
    PollingPayload payload;
    payload.reason = POLLING_PERIODIC;
    payload.time = t;
    return notifyPolling(payload, false);
}

int32_t PollingRoutine::handleTimerRearm(int32_t id) {
    if (id != kPollingTimerId) {
        return KelvoOperator::handleTimerRearm(id);
    }
    return rearmTimer(mTimer, mPeriodMs, mPeriodMs);
}

int32_t PollingRoutine::onBatteryLevelChanged(const android::Parcel& data) {
    int64_t t = 0;
    if (data.readInt64(&t) != android::NO_ERROR) {
        KLOGE("Invalid notification for polling reason: %d", POLLING_BATTERY_LEVEL);
        return -5;
    }
    if (!shouldPoll(t)) {
        return 0;
    }
    PollingPayload payload;
    payload.reason = POLLING_BATTERY_LEVEL;
    payload.time = t;
    return notifyPolling(payload, true);
}

int32_t PollingRoutine::onHourlyTick(const android::Parcel& data) {
    PollingPayload payload;
    payload.reason = POLLING_HOURLY_TICK;
    if (data.readInt64(&payload.time) != android::NO_ERROR ||
        data.readInt64(&payload.hour) != android::NO_ERROR) {
        KLOGE("Invalid notification for polling reason: %d", payload.reason);
        return -5;
    }
    return notifyPolling(payload, true);
}

int32_t PollingRoutine::onTimeChanged(const android::Parcel& data) {
    PollingPayload payload;
    payload.reason = POLLING_TIME_CHANGED;
    if (data.readInt64(&payload.time) != android::NO_ERROR ||
        data.readInt64(&payload.newTime) != android::NO_ERROR) {
        KLOGE("Invalid notification for polling reason: %d", payload.reason);
        return -5;
    }
    return notifyPolling(payload, true);
}

int32_t PollingRoutine::onChargerOnlineChanged(const android::Parcel& data) {
    PollingPayload payload;
    payload.reason = POLLING_CHARGER;
    if (data.readInt64(&payload.time) != android::NO_ERROR ||
        data.readBool(&payload.online) != android::NO_ERROR) {
        KLOGE("Invalid notification for polling reason: %d", payload.reason);
        return -5;
    }
    return notifyPolling(payload, false);
}

int32_t PollingRoutine::onAbnormalityThermal(const android::Parcel& data) {
    return pollAt(data, POLLING_THERMAL, true);
}

int32_t PollingRoutine::onForceBalance(const android::Parcel& data) {
    return pollAt(data, POLLING_FORCE_BALANCE, true);
}

int32_t PollingRoutine::onShutDown(const android::Parcel& data) {
    int32_t ret = pollAt(data, POLLING_SHUT_DOWN, false);
    // The base writes what is buffered, the last poll's row included.
    KelvoOperator::onShutDown(data);
    return ret;
}

} // namespace kelvo
