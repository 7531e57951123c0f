#include "routines/HourlyRoutine.h"

#include <cinttypes>

#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/PackageProperty.h"
#include "utils/TimeProvider.h"
#include "utils/TimerManager.h"

namespace kelvo {

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDayMs = 86400000;
constexpr int64_t kDawnWindowMs = 21600000;
constexpr uint32_t kCompensationParam = 35;
// The abnormality routine's request that starts the check of an hour.
constexpr int32_t kAbnormalityHourRequest = 2;

const column_attribute kTickColumns[] = {
    {COLUMN_TIME, "start_routine"},
    {COLUMN_TIME, "end_routine"},
};
const table_attribute kTickTable = {"1.0", 1, 2, kTickColumns, "debug_hourly_tick"};

const column_attribute kCompensationColumns[] = {
    {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"}, {COLUMN_INT, "battery"},
    {COLUMN_INT, "power_model"}, {COLUMN_INT, "free"},      {COLUMN_INT, "ratio"},
};
const table_attribute kCompensationTable = {"1.1", 1, 6, kCompensationColumns,
                                            "debug_energy_compensation"};

const column_attribute kTvlogColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "tvlog_count"},
};
const table_attribute kTvlogTable = {"1.0", 1, 2, kTvlogColumns, "debug_tvlog_count"};

// The notification that announces each candidate (1 to 8).
const int32_t kCandidateNotifications[HourlyRoutine::kCandidateCount] = {
    NOTIFICATION_HOURLY_TICK,          NOTIFICATION_APPLICATIONS_ACCOUNTING,
    NOTIFICATION_COMPONENT_ACCOUNTING, NOTIFICATION_HOURLY_UPLOADING,
    NOTIFICATION_DAILY_TICK,           NOTIFICATION_DAILY_UPLOADING,
    NOTIFICATION_DIFF_DAY_REBOOT,      NOTIFICATION_DAWN_UPLOADING,
};

const uint32_t kHourlyEvents[] = {EVENT_HOURLY_COMPONENTS, EVENT_HOURLY_APPLICATIONS};
const uint32_t kDailyEvents[] = {EVENT_DAILY_COMPONENTS, EVENT_DAILY_APPLICATIONS,
                                 EVENT_DAILY_SYSTEM, EVENT_DAILY_USERS};
const uint32_t kDawnEvents[] = {EVENT_DAILY_COMPONENTS, EVENT_DAILY_APPLICATIONS};

int64_t now() {
    return TimeProvider::getCurrentTime(TIME_TYPE_WALL);
}

// Start of the local hour of a wall-clock time, in ms.
int64_t hourOf(int64_t time) {
    return TimeProvider(time).startOfHour() * 1000;
}

int64_t saturatingAdd(int64_t a, int64_t b) {
    int64_t sum;
    if (__builtin_add_overflow(a, b, &sum)) {
        HealthCounters::add(Health::ValuesSaturated);
        return b > 0 ? INT64_MAX : INT64_MIN;
    }
    return sum;
}

}  // namespace

std::atomic<int64_t> HourlyRoutine::sVoteTimeoutMs{HourlyRoutine::kVoteTimeoutMs};

void HourlyRoutine::setVoteTimeoutMs(int64_t ms) {
    sVoteTimeoutMs.store(ms > 0 ? ms : kVoteTimeoutMs, std::memory_order_relaxed);
}

HourlyRoutine::HourlyRoutine()
    : KelvoOperator("HourlyRoutine", -1, 0),
      mLastTick(now()),
      mElectors{},
      mCompensationEnabled(false),
      mLastTickCheckPending(true),
      mActiveHour(kNoRound) {}

std::string HourlyRoutine::hourText(int64_t hour) {
    return TimeProvider(hour).toString(TIME_FORMAT_DATE, true);
}

HourlyRoutine::~HourlyRoutine() {
    if (mTimer != nullptr) {
        TimerManager::getInstance()->removeTimer(mTimer);
    }
}

void HourlyRoutine::refused() {
    HealthCounters::add(Health::RoutineRequestsRefused);
}

void HourlyRoutine::addSchemaTable() {
    addSchema(kTickTable);
    addSchema(kCompensationTable);
    addSchema(kTvlogTable);
}

void HourlyRoutine::cleanTables(int64_t time) {
    cleanObsoleteEntries(kTickTable.name, time, "start_routine");
    cleanObsoleteEntries(kCompensationTable.name, time, "end_time");
    cleanObsoleteEntries(kTvlogTable.name, time, "timestamp");
}

int32_t HourlyRoutine::setConfiguration() {
    android::Parcel request;
    request.writeInt32(0);
    android::Parcel reply;
    int32_t enable = 0;
    if (getXmlConfig(CONFIG_SETTINGS, request, &reply) < 0 ||
        reply.readInt32(&enable) != android::NO_ERROR) {
        KLOGE("Failed to get energy compensation settings");
        return -2;
    }
    mCompensationEnabled = enable != 0;
    KLOGD("Energy compensation enable: %d", enable);
    return 0;
}

void HourlyRoutine::setupListeners(android::Parcel& out) {
    addNotifierListener(NOTIFICATION_TIME_CHANGED, out);
    addNotifierListener(NOTIFICATION_BOOT_COMPLETED, out);
    addNotifierListener(NOTIFICATION_SHUT_DOWN, out);
}

int32_t HourlyRoutine::lateInitialize() {
    // Made here, on the routine's own thread: the callback holds the routine.
    mTimer = new TimerCallback(this, kHourlyTimerId);
    return armTimer();
}

int32_t HourlyRoutine::armTimer() {
    if (mTimer == nullptr) {
        return -2;
    }
    int64_t t = now();
    // The next full hour of the wall clock; hourly after that.
    return rearmTimer(mTimer, hourOf(t) + kHourMs - t, kHourMs);
}

int32_t HourlyRoutine::handleTimerRearm(int32_t id) {
    if (id != kHourlyTimerId) {
        return KelvoOperator::handleTimerRearm(id);
    }
    return armTimer();
}

int32_t HourlyRoutine::handleTimerExpired(int32_t id) {
    if (id != kHourlyTimerId) {
        KLOGE("Unknown timer: %d", id);
        return -5;
    }
    return tick();
}

int32_t HourlyRoutine::tick() {
    int64_t t = now();
    armTimer();
    int64_t hour = hourOf(t);
    if (hourOf(mLastTick) == hour) {
        return 0;
    }
    int localHour = TimeProvider::getHour(t, true);
    KLOGI("Hourly routine start at %d o'clock", localHour);
    mLastTick = t;
    int8_t type = localHour == 0 ? ROUND_DAILY : (localHour == 6 ? ROUND_DAWN : ROUND_HOURLY);
    openRound(hour, type, 1);

    android::Parcel row;
    row.writeInt64(hour);
    row.writeInt32(
        KelvoUtils::saturateInt32(static_cast<int64_t>(Dispatcher::getInstance()->getLogCount())));
    insertEntries(kTvlogTable, row, 1, false);
    return 0;
}

int32_t HourlyRoutine::openRound(int64_t hour, int8_t type, int32_t candidate) {
    if (mRounds.count(hour) != 0) {
        // A live round is never opened a second time.
        KLOGI("Voting round of this hour(%s) is already open", hourText(hour).c_str());
        return -13;
    }
    voting_round round = {type, now(), -1, 0, candidate, 0, 0, 0};
    voting_round& added = mRounds.emplace(hour, round).first->second;
    if (mActiveHour == kNoRound) {
        startRound(hour, added);
    } else {
        KLOGI("Voting round of this hour(%s) waits for the round of hour(%s)",
              hourText(hour).c_str(), hourText(mActiveHour).c_str());
    }
    return 0;
}

void HourlyRoutine::startNextRound() {
    if (mActiveHour != kNoRound || mRounds.empty()) {
        return;
    }
    // The earliest waiting hour goes first.
    startRound(mRounds.begin()->first, mRounds.begin()->second);
}

void HourlyRoutine::startRound(int64_t hour, voting_round& round) {
    mActiveHour = hour;
    moveTo(hour, round, round.candidate);
}

void HourlyRoutine::moveTo(int64_t hour, voting_round& round, int32_t candidate) {
    round.candidate = candidate;
    round.pending = mElectors[candidate - 1];
    notifyVoting(kCandidateNotifications[candidate - 1], hour, round);
}

float HourlyRoutine::computeRatio(const voting_round& round) const {
    // No battery measurement, or nothing left once the free energy is taken.
    if (round.battery < 1 || round.battery <= round.free) {
        return 0.0f;
    }
    if (!mCompensationEnabled || round.powerModel < 1) {
        return 1.0f;
    }
    return static_cast<float>(static_cast<double>(round.battery - round.free) /
                              static_cast<double>(round.powerModel));
}

void HourlyRoutine::logCompensation(const char* kind, int64_t start, int64_t hour,
                                    const voting_round& round, float ratio, bool store) {
    KLOGD("%s: battery=%lld, accounting=%lld, free=%lld, ratio=%.3f", kind,
          static_cast<long long>(round.battery), static_cast<long long>(round.powerModel),
          static_cast<long long>(round.free), static_cast<double>(ratio));
    if (!store) {
        return;
    }
    android::Parcel row;
    row.writeInt64(start);
    row.writeInt64(hour);
    row.writeInt32(KelvoUtils::saturateInt32(round.battery));
    row.writeInt32(KelvoUtils::saturateInt32(round.powerModel));
    row.writeInt32(KelvoUtils::saturateInt32(round.free));
    row.writeInt32(KelvoUtils::saturateInt32(static_cast<double>(ratio) * 1000.0));
    insertEntries(kCompensationTable, row, 1, false);
}

void HourlyRoutine::notifyVoting(int32_t notification, int64_t hour, voting_round& round) {
    android::Parcel payload;
    switch (notification) {
        case NOTIFICATION_HOURLY_TICK:
        case NOTIFICATION_DAILY_TICK:
            payload.writeInt64(round.start);
            break;
        case NOTIFICATION_HOURLY_UPLOADING:
        case NOTIFICATION_DAILY_UPLOADING:
        case NOTIFICATION_DAWN_UPLOADING: {
            float ratio = computeRatio(round);
            payload.writeFloat(ratio);
            if (notification == NOTIFICATION_HOURLY_UPLOADING) {
                logCompensation("Hourly", hour - kHourMs, hour, round, ratio, true);
            } else if (notification == NOTIFICATION_DAILY_UPLOADING) {
                logCompensation("Daily", hour - kDayMs, hour, round, ratio, true);
            } else {
                logCompensation("Dawn", hour - kDayMs, hour, round, ratio, false);
            }
            break;
        }
        default:
            break;
    }
    payload.writeInt64(hour);
    sendNotification(notification, payload);

    // The step ends at its time-out; a step nobody registered for ends as
    // soon as the routine's queue reaches it, since no vote can come.
    android::Parcel timeout;
    timeout.writeInt64(hour);
    timeout.writeInt32(round.candidate);
    int64_t delayMs = round.pending == 0 ? 0 : sVoteTimeoutMs.load(std::memory_order_relaxed);
    round.timeout = sendMessageDelayed(
        delayMs * 1000000LL, ParcelMessage(MESSAGE_CUSTOMIZED, REQUEST_VOTE_TIMEOUT, timeout));
}

int32_t HourlyRoutine::handleCustomized(int32_t code, const android::Parcel& data,
                                        android::Parcel* reply) {
    data.setDataPosition(0);
    switch (code) {
        case REQUEST_VOTE:
            return handleVote(data);
        case REQUEST_VOTE_TIMEOUT:
            return handleVoteTimeout(data);
        case REQUEST_OFFSET:
            return handleOffset(reply);
        case REQUEST_COMPENSATION:
            return handleCompensation(data);
        case REQUEST_ELECTOR:
            return handleSetElector(data);
        default:
            KLOGE("Unknown message tag: %d", code);
            refused();
            return -3;
    }
}

int32_t HourlyRoutine::handleVote(const android::Parcel& data) {
    int64_t hour = 0;
    int32_t candidate = 0;
    uint32_t elector = 0;
    if (data.readInt64(&hour) != android::NO_ERROR ||
        data.readInt32(&candidate) != android::NO_ERROR ||
        data.readUint32(&elector) != android::NO_ERROR || candidate < 1 ||
        candidate > kCandidateCount || elector < 1 || elector > kMaxElector) {
        KLOGE("Invalid elector(%u) or candidate(%d)", elector, candidate);
        refused();
        return -5;
    }
    auto it = mRounds.find(hour);
    if (it == mRounds.end()) {
        KLOGI("Elector(%u) is voting for candidate(%d) in a finished or inexistent round(%s)",
              elector, candidate, hourText(hour).c_str());
        refused();
        return -2;
    }
    voting_round& round = it->second;
    if (hour != mActiveHour || candidate != round.candidate) {
        // A waiting round has announced nothing yet: no vote can be for it.
        KLOGE(
            "Elector(%u) is voting for a mismatched candidate(%d, %d) in the voting round of "
            "hour(%s)",
            elector, candidate, hour == mActiveHour ? round.candidate : 0, hourText(hour).c_str());
        refused();
        return -16;
    }
    round.pending &= ~elector;
    if (round.pending != 0) {
        return 0;
    }
    if (round.timeout >= 0) {
        removeMessage(round.timeout);
        round.timeout = -1;
    }
    return updateRound(hour);
}

int32_t HourlyRoutine::handleVoteTimeout(const android::Parcel& data) {
    int64_t hour = data.readInt64();
    int32_t candidate = data.readInt32();
    auto it = mRounds.find(hour);
    if (it == mRounds.end()) {
        KLOGE("Failed to find voting round of this hour(%s)", hourText(hour).c_str());
        return -2;
    }
    voting_round& round = it->second;
    if (hour != mActiveHour || candidate != round.candidate) {
        KLOGD("Stale time-out of candidate(%d) in the round of hour(%s)", candidate,
              hourText(hour).c_str());
        return 0;
    }
    round.timeout = -1;
    if (round.pending != 0) {
        KLOGE("Voting(%u) for candidate(%d) is timeout in the round of this hour(%s)",
              round.pending, round.candidate, hourText(hour).c_str());
    }
    return updateRound(hour);
}

int32_t HourlyRoutine::handleOffset(android::Parcel* reply) {
    if (reply == nullptr) {
        KLOGE("Invalid parameter");
        refused();
        return -5;
    }
    int64_t expire = TimerManager::getInstance()->getExpireTime(mTimer);
    if (expire < 0) {
        // An error code is no time left: the caller gets a failure instead.
        KLOGE("Failed to get the time left of the hourly timer: %lld",
              static_cast<long long>(expire));
        return -2;
    }
    reply->writeInt64(mLastTick);
    reply->writeInt64(expire);
    reply->setDataPosition(0);
    KLOGD("timestamp=%lld, expire=%lld", static_cast<long long>(mLastTick),
          static_cast<long long>(expire));
    return 0;
}

int32_t HourlyRoutine::handleCompensation(const android::Parcel& data) {
    int64_t hour = 0;
    uint32_t elector = 0;
    int64_t energy = 0;
    if (data.readInt64(&hour) != android::NO_ERROR ||
        data.readUint32(&elector) != android::NO_ERROR ||
        data.readInt64(&energy) != android::NO_ERROR) {
        KLOGE("Invalid energy report");
        refused();
        return -5;
    }
    auto it = mRounds.find(hour);
    if (it == mRounds.end()) {
        KLOGE("Failed to find voting round of this hour(%s)", hourText(hour).c_str());
        refused();
        return -2;
    }
    voting_round& round = it->second;
    if (elector == kBatteryElector) {
        round.battery = saturatingAdd(round.battery, energy);
    } else if (energy < 0) {
        round.free = saturatingAdd(round.free, energy == INT64_MIN ? INT64_MAX : -energy);
    } else {
        round.powerModel = saturatingAdd(round.powerModel, energy);
    }
    KLOGD("timestamp=%lld, elector=%u, energy=%lld", static_cast<long long>(hour), elector,
          static_cast<long long>(energy));
    return 0;
}

int32_t HourlyRoutine::handleSetElector(const android::Parcel& data) {
    uint32_t elector = 0;
    if (data.readUint32(&elector) != android::NO_ERROR || elector < 1 || elector > kMaxElector) {
        // A bit no vote can clear would hold every step to its time-out.
        KLOGE("Invalid elector(%u)", elector);
        refused();
        return -5;
    }
    int32_t result = 0;
    while (data.dataAvail() >= sizeof(int32_t)) {
        int32_t candidate = data.readInt32();
        if (candidate < 1 || candidate > kCandidateCount) {
            KLOGE("Unknown candidate: %d", candidate);
            refused();
            result = -3;
            continue;
        }
        mElectors[candidate - 1] |= elector;
    }
    return result;
}

int32_t HourlyRoutine::updateRound(int64_t hour) {
    voting_round& round = mRounds.find(hour)->second;
    switch (round.candidate) {
        case 1:
            forceFlushEntries();
            moveTo(hour, round, 2);
            return 0;
        case 2:
            forceFlushEntries();
            moveTo(hour, round, 3);
            AppsAccounting::getInstance()->balanceAccount();
            return 0;
        case 3:
            forceFlushEntries();
            sendToAbnormality(hour);
            if (checkUpload()) {
                moveTo(hour, round, 4);
                return 0;
            }
            return followType(hour, round, false);
        case 4: {
            float ratio = computeRatio(round);
            if (AppsAccounting::getInstance()->uploadHourlyAppsAccounting(hour, ratio) < 0) {
                KLOGE("Failed to upload houly top application data");
            }
            if (uploadEnergyCompensationData(ratio, EVENT_HOURLY_COMPONENTS) < 0) {
                KLOGE("Failed to upload hourly energy compensation ratio");
            }
            if (uploadEvents(kHourlyEvents, 2, hour - kHourMs, hour) < 0) {
                KLOGE("Failed to upload hourly data");
            }
            return followType(hour, round, true);
        }
        case 5:
        case 7:
            forceFlushEntries();
            if (checkUpload()) {
                updateDailyCompensation(hour, round);
                moveTo(hour, round, 6);
                return 0;
            }
            roundFinished(hour);
            cleanDatabase(hour);
            return 0;
        case 6: {
            float ratio = computeRatio(round);
            if (AppsAccounting::getInstance()->uploadDailyAppsAccounting(hour, ratio) < 0) {
                KLOGE("Failed to upload daily top application data");
            }
            if (uploadEnergyCompensationData(ratio, EVENT_DAILY_COMPONENTS) < 0) {
                KLOGE("Failed to upload daily energy compensation ratio");
            }
            int32_t result = uploadEvents(kDailyEvents, 4, hour - kDayMs, hour);
            if (result < 0) {
                KLOGE("Failed to upload daily data");
            }
            roundFinished(hour);
            cleanDatabase(hour);
            return result;
        }
        case 8: {
            float ratio = computeRatio(round);
            if (AppsAccounting::getInstance()->uploadDawnAppsAccounting(hour, ratio) < 0) {
                KLOGE("Failed to upload dawn top application data");
            }
            if (uploadEnergyCompensationData(ratio, EVENT_DAILY_COMPONENTS) < 0) {
                KLOGE("Failed to upload dawn energy compensation ratio");
            }
            if (uploadEvents(kDawnEvents, 2, hour - kDawnWindowMs, hour) < 0) {
                KLOGE("Failed to upload dawn data");
            }
            roundFinished(hour);
            return 0;
        }
        default:
            KLOGE("Voting for unknown candidate: %d", round.candidate);
            return -3;
    }
}

int32_t HourlyRoutine::followType(int64_t hour, voting_round& round, bool uploaded) {
    switch (round.type) {
        case ROUND_HOURLY:
            roundFinished(hour);
            return 0;
        case ROUND_DAWN:
            if (!uploaded) {
                roundFinished(hour);
                return 0;
            }
            KLOGI("Send dawn uploading notification");
            forceFlushEntries();
            updateDailyCompensation(hour, round);
            moveTo(hour, round, 8);
            return 0;
        case ROUND_DAILY:
            KLOGI("Send daily notification");
            moveTo(hour, round, 5);
            return 0;
        case ROUND_REBOOT:
            KLOGI("Send reboot notification in a different day");
            moveTo(hour, round, 7);
            return 0;
        default:
            KLOGE("Unknown  type: %d", round.type);
            return -3;
    }
}

void HourlyRoutine::roundFinished(int64_t hour) {
    auto it = mRounds.find(hour);
    int64_t start = it->second.start;
    if (it->second.timeout >= 0) {
        removeMessage(it->second.timeout);
    }
    PackageProperty::getInstance()->clearPackageStrategy();
    mRounds.erase(it);
    KLOGD("Voting round of this hour(%s) of is finished", hourText(hour).c_str());
    if (TimeProvider::getHour(start, true) != 0) {
        checkLastTick(start - kHourMs);
    }
    android::Parcel row;
    row.writeInt64(start);
    row.writeInt64(now());
    insertEntries(kTickTable, row, 1, false);
    forceFlushEntries();
    if (mActiveHour == hour) {
        mActiveHour = kNoRound;
    }
    startNextRound();
}

int32_t HourlyRoutine::checkLastTick(int64_t time) {
    if (!mLastTickCheckPending) {
        return 0;
    }
    mLastTickCheckPending = false;
    android::Parcel reply;
    int32_t rows = 0;
    int32_t ret = queryEntriesSimple(
        android::String8("SELECT start_routine FROM debug_hourly_tick ORDER BY id DESC LIMIT 1"),
        &reply, 1, rows);
    if (ret < 0) {
        KLOGE("Failed to query hourly tick: %d", ret);
        return -17;
    }
    int64_t last = 0;
    if (rows < 1 || reply.readInt64(&last) != android::NO_ERROR) {
        return 0;
    }
    // Only an hour after the last round can have been missed.
    if (hourOf(time) <= hourOf(last)) {
        return 0;
    }
    int64_t hour = hourOf(last) + kHourMs;
    if (mRounds.count(hour) != 0) {
        return 0;
    }
    int8_t type = TimeProvider(time).startOfDay() != TimeProvider(last).startOfDay() ? ROUND_REBOOT
                                                                                     : ROUND_HOURLY;
    openRound(hour, type, 2);
    KLOGI("Processing data before last shut down");
    return 0;
}

bool HourlyRoutine::checkUpload() {
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(android::String8("SELECT delta FROM raw_time_changed"), &reply, 1,
                           rows) < 0) {
        KLOGE("Failed to query entries");
        return true;
    }
    for (int32_t i = 0; i < rows; ++i) {
        int64_t delta = 0;
        if (reply.readInt64(&delta) != android::NO_ERROR) {
            break;
        }
        if (delta >= kTimeChangeLimitMs || delta <= -kTimeChangeLimitMs) {
            KLOGE("Time changed more than one hour, data will not be uploaded in this day");
            return false;
        }
    }
    return true;
}

void HourlyRoutine::updateDailyCompensation(int64_t hour, voting_round& round) {
    android::String8 sql = android::String8::format(
        "SELECT SUM(battery), SUM(power_model), SUM(free) FROM debug_energy_compensation "
        "WHERE end_time > %" PRId64 " AND end_time <= %" PRId64,
        hour - kDayMs, hour);
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 3, rows) < 0) {
        KLOGE("Failed to query energy compensation");
        return;
    }
    int64_t sums[3];
    if (rows < 1 || reply.readInt64(&sums[0]) != android::NO_ERROR ||
        reply.readInt64(&sums[1]) != android::NO_ERROR ||
        reply.readInt64(&sums[2]) != android::NO_ERROR) {
        return;
    }
    round.battery = sums[0];
    round.powerModel = sums[1];
    round.free = sums[2];
}

int32_t HourlyRoutine::uploadEnergyCompensationData(float ratio, uint32_t event) {
    if (ratio == 0.0f) {
        return 0;
    }
    android::Parcel data;
    DataUploader::formIntData(kCompensationParam,
                              KelvoUtils::saturateInt32(static_cast<double>(ratio) * 1000.0), data);
    if (DataUploader::getInstance()->setEventData(event, data, true) < 0) {
        KLOGE("Failed to set upload energy compensation");
        return -23;
    }
    return 0;
}

int32_t HourlyRoutine::uploadEvents(const uint32_t* events, size_t count, int64_t start,
                                    int64_t end) {
    android::Parcel stamps;
    DataUploader::formDatetimeData(0, start, stamps);
    DataUploader::formDatetimeData(1, end, stamps);
    int32_t result = 0;
    for (size_t i = 0; i < count; ++i) {
        // Only events that operators filled this round get the stamps.
        if (setEventData(events[i], stamps, false) < 0) {
            result = -23;
        }
    }
    DataUploader::getInstance()->uploadEvent();
    return result;
}

void HourlyRoutine::sendToAbnormality(int64_t hour) {
    android::sp<KelvoAgent> agent = KelvoAgent::getInstance();
    if (agent->getRoutine(ROUTINE_ABNORMALITY) == nullptr) {
        KLOGD("No abnormality routine for hour(%s)", hourText(hour).c_str());
        return;
    }
    android::Parcel data;
    data.writeInt64(hour);
    agent->sendToRoutine(ROUTINE_ABNORMALITY, kAbnormalityHourRequest, data, nullptr, false);
}

int32_t HourlyRoutine::onTimeChanged(const android::Parcel&) {
    AppsAccounting::getInstance()->balanceAccount();
    // A clock set forward past a full hour starts that hour's round now:
    // the timer, re-armed for the new clock, would only fire an hour later.
    if (hourOf(now()) > hourOf(mLastTick)) {
        return tick();
    }
    return armTimer();
}

int32_t HourlyRoutine::onBootCompleted(const android::Parcel& data) {
    int64_t time = 0;
    if (data.readInt64(&time) != android::NO_ERROR) {
        KLOGE("Invalid boot completed notification");
        refused();
        return -5;
    }
    return checkLastTick(time);
}

int32_t HourlyRoutine::onShutDown(const android::Parcel&) {
    AppsAccounting::getInstance()->balanceAccount();
    return forceFlushEntries();
}

}  // namespace kelvo
