#include "handlers/components/AudioHandler.h"

#include <inttypes.h>
#include <media/AudioSystem.h>
#include <stdio.h>

#include <algorithm>
#include <limits>
#include <string>
#include <vector>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "handlers/SystemHandler.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/LoggerMessage.h"
#include "utils/PackageProperty.h"
#include "utils/TimeProvider.h"

using android::Parcel;
using android::String8;

namespace kelvo {

const char* const AudioHandler::kCallPackage = "com.android.incallui";

namespace {

constexpr int64_t kDayMs = 86400000;
constexpr int32_t kIdleStream = 12;
constexpr int32_t kSubtypeSession = 0;
constexpr int32_t kSubtypeSmartPa = 1;
constexpr int32_t kHeadsetDeviceSize = 100;
constexpr const char* kSmartPaKey = "getSmartPAPOWER";
constexpr const char* kHeadsetCountName = "headset_count";
constexpr const char* kLauncher = "com.tovaro.android.launcher";
// Largest accepted amplifier energy per millisecond of the span read.
constexpr int64_t kMaxSpeakerPerMs = 100000000;
constexpr int64_t kMaxReceiverPerMs = 400000;

const table_attribute kRawApplications = {"1.1", 1, kFamilyRawApplicationsCount,
                                          kFamilyRawApplicationsColumns, "raw_applications_audio"};
const table_attribute kRawComponent = {"1.1", 1, kFamilyRawComponentCount,
                                       kFamilyRawComponentColumns, "raw_component_audio"};
const table_attribute kHourlyApplications = {"1.0", 1, kFamilyHourlyApplicationsCount,
                                             kFamilyHourlyApplicationsColumns,
                                             "hourly_applications_audio"};
const table_attribute kHourlyComponent = {"1.0", 1, kFamilyHourlyComponentCount,
                                          kFamilyHourlyComponentColumns, "hourly_component_audio"};

const column_attribute kDeviceColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "stream"}, {COLUMN_INT, "device"}};
const column_attribute kVolumeColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "stream"}, {COLUMN_INT, "volume"}};
const column_attribute kSessionColumns[] = {{COLUMN_TIME, "timestamp"}, {COLUMN_INT, "session"},
                                            {COLUMN_TEXT, "name"},      {COLUMN_INT, "uid"},
                                            {COLUMN_INT, "pid"},        {COLUMN_INT, "state"}};
const column_attribute kPlayColumns[] = {{COLUMN_TIME, "timestamp"},
                                         {COLUMN_INT, "session"},
                                         {COLUMN_INT, "stream"},
                                         {COLUMN_INT, "state"}};
const column_attribute kHeadsetColumns[] = {{COLUMN_TIME, "timestamp"},
                                            {COLUMN_INT, "state"},
                                            {COLUMN_INT, "microphone"},
                                            {COLUMN_TEXT, "device"}};
const column_attribute kSmartPaColumns[] = {{COLUMN_TIME, "timestamp"},
                                            {COLUMN_LONG, "speaker"},
                                            {COLUMN_LONG, "receiver"},
                                            {COLUMN_INT, "volume"}};

const table_attribute kDeviceTable = {"1.0", 1, 3, kDeviceColumns, "raw_audio_device"};
const table_attribute kVolumeTable = {"1.0", 1, 3, kVolumeColumns, "raw_audio_volume"};
const table_attribute kSessionTable = {"1.0", 1, 6, kSessionColumns, "raw_audio_session"};
const table_attribute kPlayTable = {"1.0", 1, 4, kPlayColumns, "raw_audio_session_play"};
const table_attribute kHeadsetTable = {"1.1", 1, 4, kHeadsetColumns, "raw_audio_headset"};
const table_attribute kSmartPaTable = {"1.1", 1, 4, kSmartPaColumns, "raw_audio_smartpa_value"};
const table_attribute* const kOwnTables[] = {&kDeviceTable, &kVolumeTable,  &kSessionTable,
                                             &kPlayTable,   &kHeadsetTable, &kSmartPaTable};

const component_family kFamily = {
    "audio",
    &kRawApplications,
    &kRawComponent,
    &kHourlyApplications,
    &kHourlyComponent,
    APPS_AUDIO,
    20,
    21,
};

bool needsPower(uint32_t device) {
    return (device & AudioHandler::kDevicePowered) != 0;
}

bool isBluetooth(uint32_t device) {
    return (device & AudioHandler::kDeviceBluetooth) != 0;
}

bool validStream(int32_t stream) {
    return stream >= 0 && stream < AudioHandler::kStreamCount;
}

// energy x scale / 1024 without losing the product to an overflow.
int64_t rescale(int64_t energy, int64_t scale) {
    __int128 value = static_cast<__int128>(energy) * scale / 1024;
    if (value > std::numeric_limits<int64_t>::max()) {
        return std::numeric_limits<int64_t>::max();
    }
    if (value < std::numeric_limits<int64_t>::min()) {
        return std::numeric_limits<int64_t>::min();
    }
    return static_cast<int64_t>(value);
}

// An unsigned 32-bit value ("%u" text); letters, a sign or a value beyond
// 32 bits fail with -2.
int32_t parseUnsigned(const char* text, const char* key, const char* nextKey, uint32_t* out) {
    long long value = std::numeric_limits<long long>::min();
    int32_t ret = parseMessage(text, key, nextKey, "%lld", &value, sizeof(value));
    if (ret < 0) {
        return ret;
    }
    if (value < 0 || value > 0xFFFFFFFFLL) {
        return -2;
    }
    *out = static_cast<uint32_t>(value);
    return 0;
}

int64_t addSaturated(int64_t a, int64_t b) {
    int64_t sum = 0;
    if (__builtin_add_overflow(a, b, &sum)) {
        return b > 0 ? std::numeric_limits<int64_t>::max() : std::numeric_limits<int64_t>::min();
    }
    return sum;
}

int32_t refuse(int32_t code) {
    HealthCounters::add(Health::LoggerMessageRefused);
    return code;
}

}  // namespace

AudioHandler::AudioHandler()
    : ComponentHandler("AudioHandler", ACCOUNTER_AUDIO, kElector, {&kFamily},
                       {POLICY_AUDIO, "Audio", {1, kPolicySmartPa}}),
      mScreenOn(true),
      mChargerOnline(false),
      mPhoneState(0),
      mPhoneDevice(0),
      mInCallStream(kIdleStream),
      mHeadsetCount(0),
      mLastPollingTime(TimeProvider::getCurrentTime(TIME_TYPE_WALL)),
      mComponentEnd(0),
      mComponentDurations{},
      mBaseEnergy(0),
      mSpeakerEnergy(0),
      mReceiverEnergy(0),
      mCachedTotal(0),
      mForeground(kLauncher),
      mLastPaRead(-1) {
    for (int32_t s = 0; s < kStreamCount; ++s) {
        mStreams[s] = {s == 0 ? kDeviceReceiver : kDevicePowered, 1};
    }
}

const component_family& AudioHandler::family() {
    return kFamily;
}

void AudioHandler::addSchemaTable() {
    ComponentHandler::addSchemaTable();
    for (const table_attribute* table : kOwnTables) {
        addSchema(*table);
    }
}

void AudioHandler::cleanTables(int64_t time) {
    ComponentHandler::cleanTables(time);
    for (const table_attribute* table : kOwnTables) {
        cleanObsoleteEntries(table->name, time, "timestamp");
    }
}

void AudioHandler::setupListeners(Parcel& out) {
    static const int32_t kNotifications[] = {
        NOTIFICATION_DATA_POLLING,
        NOTIFICATION_DAWN_UPLOADING,
        NOTIFICATION_DAILY_UPLOADING,
        NOTIFICATION_HOURLY_UPLOADING,
        NOTIFICATION_APPLICATIONS_ACCOUNTING,
        NOTIFICATION_COMPONENT_ACCOUNTING,
        NOTIFICATION_SCREEN_STATE_CHANGED,
        NOTIFICATION_FOREGROUND_CHANGED,
        NOTIFICATION_CHARGER_ONLINE_CHANGED,
        NOTIFICATION_ABNORMALITY_THERMAL,
        NOTIFICATION_FORCE_BALANCE,
        NOTIFICATION_VM_DIED,
        NOTIFICATION_DAILY_TICK,
        NOTIFICATION_PHONE_STATE_CHANGED,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    addLibraryListener(mAccounterType, out);
}

void AudioHandler::registerDispatcherTag() {
    static const struct {
        const char* name;
        int32_t index;
    } kTags[] = {
        {"KELVO_TAG_AUDIO_DEVICE", TAG_AUDIO_DEVICE},
        {"KELVO_TAG_AUDIO_VOLUME", TAG_AUDIO_VOLUME},
        {"KELVO_TAG_AUDIO_SESSION_ACQUIRE", TAG_AUDIO_SESSION_ACQUIRE},
        {"KELVO_TAG_AUDIO_SESSION_RELEASE", TAG_AUDIO_SESSION_RELEASE},
        {"KELVO_TAG_AUDIO_SESSION_START", TAG_AUDIO_SESSION_START},
        {"KELVO_TAG_AUDIO_SESSION_STOP", TAG_AUDIO_SESSION_STOP},
        {"KELVO_TAG_AUDIO_HEADSET", TAG_AUDIO_HEADSET},
    };
    for (const auto& tag : kTags) {
        Dispatcher::getInstance()->registerTag({tag.name, tag.index}, this);
    }
}

void AudioHandler::setCandidateElector() {
    Parcel candidates;
    static const int32_t kCandidates[] = {
        CANDIDATE_HOURLY_TICK,   VOTE_APPLICATIONS_ACCOUNTING, VOTE_COMPONENT_ACCOUNTING,
        CANDIDATE_HOURLY_UPLOAD, kCandidateDailyTick,          CANDIDATE_DAILY_UPLOAD,
        CANDIDATE_DAWN_UPLOAD,
    };
    for (int32_t c : kCandidates) {
        candidates.writeInt32(c);
    }
    setElector(mElector, candidates);
}

int32_t AudioHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    switch (tag) {
        case TAG_AUDIO_DEVICE:
            return handleDevice(time, text);
        case TAG_AUDIO_VOLUME:
            return handleVolume(time, text);
        case TAG_AUDIO_SESSION_ACQUIRE:
            return handleAcquire(time, text);
        case TAG_AUDIO_SESSION_RELEASE:
            return handleRelease(time, text);
        case TAG_AUDIO_SESSION_START:
            return handlePlay(time, text, true);
        case TAG_AUDIO_SESSION_STOP:
            return handlePlay(time, text, false);
        case TAG_AUDIO_HEADSET:
            return handleHeadset(time, text);
        default:
            KLOGE("Unknown message tag: %d", tag);
            return -3;
    }
}

int32_t AudioHandler::handleDevice(int64_t time, const char* text) {
    int32_t stream = 0;
    uint32_t device = 0;
    int32_t ret = parseInt(text, "stream=", "device=", INT32_MIN, &stream);
    if (ret < 0) {
        KLOGE("Failed to parse stream, ret: %d", ret);
        return refuse(-19);
    }
    ret = parseUnsigned(text, "device=", nullptr, &device);
    if (ret < 0) {
        KLOGE("Failed to parse device, ret: %d", ret);
        return refuse(-19);
    }
    if (!validStream(stream)) {
        KLOGE("Invalid stream id: %d", stream);
        return refuse(-9);
    }
    // With nothing playing on the built-in output, the loudspeaker alone
    // stands for the built-in output as a whole.
    if (mComponent.count == 0 && device == kDeviceSpeaker) {
        device = kDevicePowered;
    }
    if (mStreams[stream].device == device) {
        return 0;
    }
    KLOGD("timestamp: %lld, device: %u, stream: %d", static_cast<long long>(time), device, stream);
    mStreams[stream].device = device;
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(stream);
    row.writeInt32(static_cast<int32_t>(device));
    insertEntries(kDeviceTable, row, 1, false);
    updateActiveStreams(time, stream);
    return 0;
}

int32_t AudioHandler::handleVolume(int64_t time, const char* text) {
    int32_t stream = 0;
    int32_t volume = 0;
    if (parseInt(text, "stream=", "volume=", INT32_MIN, &stream) < 0 ||
        parseInt(text, "volume=", nullptr, INT32_MIN, &volume) < 0) {
        KLOGE("Failed to parse volume message: %s", text);
        return refuse(-19);
    }
    if (!validStream(stream)) {
        KLOGE("Invalid stream id: %d", stream);
        return refuse(-9);
    }
    if (volume < 0) {
        KLOGE("Invalid volume: %d", volume);
        return refuse(-9);
    }
    mStreams[stream].volume = volume;
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(stream);
    row.writeInt32(volume);
    insertEntries(kVolumeTable, row, 1, false);
    updateActiveStreams(time, stream);
    return 0;
}

int32_t AudioHandler::handleAcquire(int64_t time, const char* text) {
    int32_t id = 0;
    int32_t pid = 0;
    int32_t uid = 0;
    int32_t ret = parseInt(text, "session=", "pid=", INT32_MIN, &id);
    if (ret < 0) {
        KLOGE("Failed to parse session, ret: %d", ret);
        return refuse(-19);
    }
    ret = parseInt(text, "pid=", "uid=", INT32_MIN, &pid);
    if (ret < 0) {
        KLOGE("Failed to parse pid, ret: %d", ret);
        return refuse(-19);
    }
    ret = parseInt(text, "uid=", nullptr, INT32_MIN, &uid);
    if (ret < 0) {
        KLOGE("Failed to parse uid, ret: %d", ret);
        return refuse(-19);
    }
    if (uid < 0 || pid < 0) {
        KLOGE("Invalid uid or pid: %d, %d", uid, pid);
        return refuse(-9);
    }
    String8 name;
    if (PackageProperty::getInstance()->queryPackageByUidAndPid(uid, pid, name) < 0 ||
        name.isEmpty()) {
        KLOGE("Failed to get package name by uid and pid: %d, %d", uid, pid);
        return refuse(-2);
    }
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(id);
    row.writeString8(name);
    row.writeInt32(uid);
    row.writeInt32(pid);
    row.writeInt32(1);
    insertEntries(kSessionTable, row, 1, false);

    auto it = mSessions.find(id);
    if (it != mSessions.end()) {
        session_data& session = it->second;
        if (session.reference >= 1) {
            // The framework reuses ids: a playing session stays with whoever
            // started it.
            KLOGI("Session %d playing for %s kept from %s", id, session.name.c_str(), name.c_str());
            return 0;
        }
        session.uid = uid;
        session.pid = pid;
        session.name = name;
        return 0;
    }
    if (mSessions.size() >= kMaxSessions) {
        HealthCounters::add(Health::HandlerStateCapped);
        KLOGE("Cached session data size too big(%zu), now clear it", mSessions.size());
        // Nothing stays charged and no span stays open for a session that
        // is no longer known.
        for (auto& entry : mSessions) {
            if (entry.second.reference >= 1) {
                stopSession(time, entry.first, entry.second);
            }
        }
        flushCachedAccounts(time);
        // The next rows start where these end.
        mLastPollingTime = time;
        mSessions.clear();
    }
    mSessions[id] = {uid, pid, kIdleStream, 0, 0, name};
    return 0;
}

int32_t AudioHandler::handleRelease(int64_t time, const char* text) {
    int32_t id = 0;
    int32_t pid = 0;
    if (parseInt(text, "session=", "pid=", INT32_MIN, &id) < 0) {
        KLOGE("Failed to parse session, ret: %d", -2);
        return refuse(-19);
    }
    if (parseInt(text, "pid=", nullptr, INT32_MIN, &pid) < 0) {
        KLOGE("Failed to parse pid, ret: %d", -2);
        return refuse(-19);
    }
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(id);
    row.writeString8(String8("NULL"));
    row.writeInt32(-1);
    row.writeInt32(pid);
    row.writeInt32(0);
    insertEntries(kSessionTable, row, 1, false);
    auto it = mSessions.find(id);
    if (it == mSessions.end()) {
        KLOGD("Session not found: %d", id);
        return refuse(-4);
    }
    if (it->second.pid != pid) {
        KLOGI("Session %d belongs to pid %d, not %d", id, it->second.pid, pid);
        return refuse(-4);
    }
    if (it->second.reference >= 1) {
        KLOGI("Stop session before release it: %d, %d", id, pid);
        stopSession(time, id, it->second);
    }
    mSessions.erase(it);
    return 0;
}

int32_t AudioHandler::handlePlay(int64_t time, const char* text, bool start) {
    int32_t id = 0;
    int32_t stream = 0;
    if (parseInt(text, "session=", "stream=", INT32_MIN, &id) < 0 ||
        parseInt(text, "stream=", nullptr, INT32_MIN, &stream) < 0) {
        KLOGE("Failed to parse session message: %s", text);
        return refuse(-19);
    }
    if (!validStream(stream)) {
        KLOGE("Invalid stream id: %d", stream);
        return refuse(-9);
    }
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(id);
    row.writeInt32(stream);
    row.writeInt32(start ? 1 : 0);
    insertEntries(kPlayTable, row, 1, false);
    if (start) {
        return startSession(time, id, stream);
    }
    auto it = mSessions.find(id);
    if (it == mSessions.end()) {
        KLOGE("session and stream not found: %d %d", id, stream);
        return refuse(-4);
    }
    session_data& session = it->second;
    if (session.reference < 1) {
        KLOGI("Session not playing: %d, stream: %d", id, stream);
        return refuse(0);
    }
    if (session.reference >= 2) {
        --session.reference;
        return 0;
    }
    stopSession(time, id, session);
    return 0;
}

int32_t AudioHandler::startSession(int64_t time, int32_t id, int32_t stream) {
    auto it = mSessions.find(id);
    if (it == mSessions.end()) {
        KLOGE("session and stream not found: %d %d", id, stream);
        return refuse(-4);
    }
    session_data& session = it->second;
    if (session.reference >= 1) {
        ++session.reference;
        KLOGD("session already started reference: %d, session: %d, stream: %d", session.reference,
              id, stream);
        return 0;
    }
    // The time before the start is booked with the sessions playing then.
    updateComponentUsage(time);
    session.stream = stream;
    session.reference = 1;
    changeOutput(time, id, session.name, stream, 0, mStreams[stream].device, BLUETOOTH_MEDIA);
    session.device = mStreams[stream].device;
    return 0;
}

void AudioHandler::stopSession(int64_t time, int32_t id, session_data& session) {
    updateComponentUsage(time);
    changeOutput(time, id, session.name, session.stream, session.device, 0, BLUETOOTH_MEDIA);
    session.reference = 0;
}

int32_t AudioHandler::handleHeadset(int64_t time, const char* text) {
    int32_t state = 0;
    int32_t microphone = 0;
    std::string device;
    if (parseInt(text, "state=", "microphone=", INT32_MIN, &state) < 0 ||
        parseInt(text, "microphone=", "device=", INT32_MIN, &microphone) < 0 ||
        parseName(text, "device=", nullptr, &device) < 0) {
        KLOGE("Failed to parse headset message: %s", text);
        return refuse(-19);
    }
    if (state != 0 && state != 1) {
        KLOGE("Invalid state: %d", state);
        return refuse(-9);
    }
    if (microphone != 0 && microphone != 1) {
        KLOGE("Invalid microphone: %d", microphone);
        return refuse(-9);
    }
    device.resize(std::min(device.size(), static_cast<size_t>(kHeadsetDeviceSize - 1)));
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(state);
    row.writeInt32(microphone);
    row.writeString8(String8(device.c_str()));
    insertEntries(kHeadsetTable, row, 1, false);
    if (state == 1 && mHeadsetCount < INT32_MAX) {
        ++mHeadsetCount;
    }
    return 0;
}

void AudioHandler::closeSpan(span_data& span, int64_t time) {
    span.usage += std::max<int64_t>(time - span.start, 0);
    span.start = std::max(span.start, time);
}

bool AudioHandler::checkReferences(int64_t time, uint32_t from) {
    const bool fromPowered = needsPower(from);
    bool consistent = mComponent.count >= 0 && mSpeaker.count >= 0 && mReceiver.count >= 0 &&
                      mSpeaker.count <= mComponent.count && mReceiver.count <= mComponent.count;
    if (fromPowered) {
        consistent = consistent && mComponent.count >= 1 &&
                     (!(from & kDeviceSpeaker) || mSpeaker.count >= 1) &&
                     (!(from & kDeviceReceiver) || mReceiver.count >= 1);
    }
    if (consistent) {
        return true;
    }
    KLOGE(
        "Timestamp: %lld, Device: %u, Component: %d, %lld, %lld, Speaker: %d, %lld, %lld, "
        "Receiver: %d, %lld, %lld",
        static_cast<long long>(time), from, mComponent.count,
        static_cast<long long>(mComponent.start), static_cast<long long>(mComponentEnd),
        mSpeaker.count, static_cast<long long>(mSpeaker.start),
        static_cast<long long>(mSpeaker.usage), mReceiver.count,
        static_cast<long long>(mReceiver.start), static_cast<long long>(mReceiver.usage));
    // What was counted so far is kept up to now; the counts start over.
    updateComponentUsage(time);
    if (mComponent.count > 0) {
        mComponentEnd = time;
    }
    if (mSpeaker.count > 0) {
        closeSpan(mSpeaker, time);
    }
    if (mReceiver.count > 0) {
        closeSpan(mReceiver, time);
    }
    mComponent.count = 0;
    mSpeaker.count = 0;
    mReceiver.count = 0;
    return false;
}

void AudioHandler::moveReferences(int64_t time, uint32_t from, uint32_t to, int32_t stream) {
    const bool fromPowered = needsPower(from);
    const bool toPowered = needsPower(to);
    if (!fromPowered && !toPowered) {
        return;
    }
    updateComponentUsage(time);
    if (!checkReferences(time, from)) {
        // Nothing is left to take away: only the new use is counted.
        from = 0;
    }
    auto move = [&](span_data& span, uint32_t bit) {
        const bool had = (from & bit) != 0;
        const bool has = (to & bit) != 0;
        if (had && !has && --span.count == 0) {
            closeSpan(span, time);
        } else if (!had && has && span.count++ == 0) {
            span.start = time;
        }
    };
    move(mSpeaker, kDeviceSpeaker);
    move(mReceiver, kDeviceReceiver);
    if (!needsPower(from) && toPowered) {
        if (mComponent.count++ == 0) {
            mComponent.start = time;
        }
    } else if (needsPower(from) && !toPowered) {
        if (--mComponent.count == 0) {
            mComponentEnd = time;
            if (mPolicy == kPolicySmartPa) {
                readSmartPa(time, stream);
            }
        }
    }
}

bool AudioHandler::isForeground() const {
    if ((mPhoneState == 1 || mPhoneState == 2) && mForeground == kCallPackage) {
        return true;
    }
    const std::string fg(mForeground.c_str());
    if (fg.empty()) {
        return false;
    }
    for (const auto& entry : mSessions) {
        const session_data& s = entry.second;
        if (s.reference < 1 || s.name.isEmpty()) {
            continue;
        }
        const std::string name(s.name.c_str());
        if (fg.find(name) != std::string::npos || name.find(fg) != std::string::npos) {
            return true;
        }
    }
    return false;
}

void AudioHandler::updateComponentUsage(int64_t time) {
    if (mComponent.count < 1) {
        return;
    }
    const int64_t usage = std::max<int64_t>(time - mComponent.start, 0);
    mComponent.start = std::max(mComponent.start, time);
    if (usage == 0) {
        return;
    }
    const bool foreground = isForeground();
    if (mChargerOnline) {
        mComponentDurations[foreground ? 4 : 5] += usage;
    } else {
        mComponentDurations[mScreenOn ? 2 : 3] += usage;
        mComponentDurations[foreground ? 0 : 1] += usage;
    }
    KLOGD(
        "Timestamp: %lld, Usage: %lld, Charge: fore(%d), back(%d), Discharge: scron(%d) "
        "scroff(%d) fore(%d) back(%d)",
        static_cast<long long>(time), static_cast<long long>(usage), mChargerOnline && foreground,
        mChargerOnline && !foreground, !mChargerOnline && mScreenOn, !mChargerOnline && !mScreenOn,
        !mChargerOnline && foreground, !mChargerOnline && !foreground);
}

void AudioHandler::changeOutput(int64_t time, int32_t id, const String8& name, int32_t stream,
                                uint32_t from, uint32_t to, int32_t notice) {
    const bool fromPowered = needsPower(from);
    const bool toPowered = needsPower(to);
    if (toPowered) {
        sendSessionValue(time, id, to, validStream(stream) ? mStreams[stream].volume : 1);
    }
    if (!fromPowered && toPowered) {
        sendSessionAction(ACTION_ACTIVATE, time, id, name);
    } else if (fromPowered && !toPowered) {
        sendSessionAction(ACTION_DEACTIVATE, time, id, name);
    }
    moveReferences(time, from, to, stream);
    if (isBluetooth(from) != isBluetooth(to)) {
        notifyBluetooth(notice, time, name, isBluetooth(to));
    }
}

void AudioHandler::updateActiveStreams(int64_t time, int32_t stream) {
    const stream_data& data = mStreams[stream];
    updateComponentUsage(time);
    for (auto& entry : mSessions) {
        session_data& session = entry.second;
        if (session.reference < 1 || session.stream != stream) {
            continue;
        }
        KLOGD("session: %d, reference: %d, stream: %d, device: %u, needpower: %d", entry.first,
              session.reference, stream, data.device, needsPower(data.device));
        changeOutput(time, entry.first, session.name, stream, session.device, data.device,
                     BLUETOOTH_MEDIA);
        session.device = data.device;
    }
    if (mPhoneState != 0 && stream == mInCallStream) {
        KLOGD("phonestate: %d, stream: %d, device: %u, needpower: %d", mPhoneState, stream,
              data.device, needsPower(data.device));
        changeOutput(time, kCallSession, String8(kCallPackage), stream, mPhoneDevice, data.device,
                     BLUETOOTH_PHONE);
        mPhoneDevice = data.device;
    }
}

int32_t AudioHandler::sendSessionValue(int64_t time, int32_t id, uint32_t device, int32_t volume) {
    Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt32(kSubtypeSession);
    action.writeInt32(id);
    action.writeInt64(time);
    action.writeInt32(static_cast<int32_t>(device & kDevicePowered));
    action.writeInt32(volume);
    return feedAccounter(action);
}

int32_t AudioHandler::sendSessionAction(int32_t code, int64_t time, int32_t id,
                                        const String8& name) {
    Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(code);
    action.writeInt32(id);
    action.writeInt64(time);
    action.writeString8(name);
    return feedAccounter(action);
}

void AudioHandler::notifyBluetooth(int32_t notice, int64_t time, const String8& name, bool on) {
    Parcel body;
    body.writeInt64(time);
    body.writeString8(name);
    body.writeBool(on);
    int32_t ret =
        KelvoAgent::getInstance()->sendToHandler(HANDLER_BLUETOOTH, notice, body, nullptr, false);
    if (ret < 0) {
        KLOGI("Bluetooth handler not told (%d): %s %d", ret, name.c_str(), on ? 1 : 0);
    }
}

int32_t AudioHandler::onPhoneStateChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = 0;
    int32_t state = 0;
    if (data.readInt64(&time) != android::NO_ERROR || data.readInt32(&state) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid phone state message");
        return -5;
    }
    if (state < 0 || state > 2) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Unknown message state: %d", state);
        return -3;
    }
    const int32_t stream = state == 1 ? 2 : state == 2 ? 0 : kIdleStream;
    const uint32_t device = state == 0 ? 0 : mStreams[stream].device;
    // Whether the call is in front counts for the time before the change.
    updateComponentUsage(time);
    const int32_t oldStream = mInCallStream;
    const bool wasPowered = mPhoneState != 0 && needsPower(mPhoneDevice);
    const uint32_t from = mPhoneState != 0 ? mPhoneDevice : 0;
    mPhoneState = state;
    mInCallStream = stream;
    changeOutput(time, kCallSession, String8(kCallPackage), state != 0 ? stream : oldStream, from,
                 device, BLUETOOTH_PHONE);
    mPhoneDevice = device;
    const bool powered = needsPower(device);
    if (wasPowered != powered) {
        Parcel row;
        row.writeInt64(time);
        row.writeInt32(kCallSession);
        row.writeInt32(powered ? stream : oldStream);
        row.writeInt32(powered ? 1 : 0);
        insertEntries(kPlayTable, row, 1, false);
    }
    return 0;
}

int32_t AudioHandler::onScreenStateChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    bool on = data.readBool();
    KLOGD("timestamp: %lld, state: %d", static_cast<long long>(time), on ? 1 : 0);
    updateComponentUsage(time);
    mScreenOn = on;
    return ComponentHandler::onScreenStateChanged(data);
}

int32_t AudioHandler::onForegroundChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    String8 name = data.readString8();
    KLOGD("timestamp: %lld, name: %s", static_cast<long long>(time), name.c_str());
    updateComponentUsage(time);
    mForeground = name;
    return ComponentHandler::onForegroundChanged(data);
}

int32_t AudioHandler::onChargerOnlineChanged(const Parcel& data) {
    data.setDataPosition(0);
    int64_t time = data.readInt64();
    bool online = data.readBool();
    updateComponentUsage(time);
    mChargerOnline = online;
    return ComponentHandler::onChargerOnlineChanged(data);
}

int32_t AudioHandler::readSmartPa(int64_t time, int32_t stream) {
    const int64_t now = TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC);
    if (mLastPaRead >= 0 && now - mLastPaRead < kPaReadIntervalMs) {
        KLOGD("Skip to access smartpa upTime: %lld, lastAccessTime: %lld",
              static_cast<long long>(now), static_cast<long long>(mLastPaRead));
        return 0;
    }
    const int64_t span =
        std::min(std::max<int64_t>(mLastPaRead >= 0 ? now - mLastPaRead : now, 1), kMaxPaSpanMs);
    mLastPaRead = now;
    String8 answer = android::AudioSystem::getParameters(String8(kSmartPaKey));
    if (answer.isEmpty()) {
        KLOGI("Empty string got from smartpa");
        return -2;
    }
    long long speaker = 0;
    long long receiver = 0;
    if (sscanf(answer.c_str(), "pa1=%lld pa2=%lld", &speaker, &receiver) != 2) {
        speaker = 0;
        if (sscanf(answer.c_str(), "pa2=%lld", &receiver) != 1) {
            HealthCounters::add(Health::DeviceAnswersRefused);
            KLOGE("Failed to parse smartpa value: %s", answer.c_str());
            return -9;
        }
    }
    speaker = std::max(speaker, 0LL);
    receiver = std::max(receiver, 0LL);
    KLOGD("PA raw data: %s, speaker: %lld, receiver: %lld", answer.c_str(), speaker, receiver);
    if (speaker / span > kMaxSpeakerPerMs || receiver / span > kMaxReceiverPerMs) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        KLOGE("Invalid PA value: speaker(%lld), receiver(%lld), deltaTime(%lld)", speaker, receiver,
              static_cast<long long>(span));
        return -9;
    }
    const int32_t volume = validStream(stream) ? mStreams[stream].volume : 1;
    Parcel row;
    row.writeInt64(time);
    row.writeInt64(speaker);
    row.writeInt64(receiver);
    row.writeInt32(volume);
    insertEntries(kSmartPaTable, row, 1, false);
    Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt32(kSubtypeSmartPa);
    action.writeInt32(std::max((volume - 1) / 3, 0));
    action.writeInt64(mSpeaker.usage);
    action.writeInt64(mReceiver.usage);
    action.writeInt64(speaker);
    action.writeInt64(receiver);
    KLOGD("Timestamp: %lld, Volume: %d, Usage: %lld, %lld, Energy: %lld, %lld",
          static_cast<long long>(time), volume, static_cast<long long>(mSpeaker.usage),
          static_cast<long long>(mReceiver.usage), speaker, receiver);
    mSpeaker.usage = 0;
    mReceiver.usage = 0;
    return feedAccounter(action);
}

int32_t AudioHandler::handleComponentResult(const Parcel& data) {
    data.setDataPosition(0);
    int64_t base = 0;
    int64_t speaker = 0;
    int64_t receiver = 0;
    if (data.readInt64(&base) != android::NO_ERROR ||
        data.readInt64(&speaker) != android::NO_ERROR ||
        data.readInt64(&receiver) != android::NO_ERROR) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid audio component result");
        return -2;
    }
    KLOGD("baseEnergy: %lld, speaker: %lld, receiver: %lld", static_cast<long long>(base),
          static_cast<long long>(speaker), static_cast<long long>(receiver));
    if (base < 0 || speaker < 0 || receiver < 0) {
        return 0;
    }
    mBaseEnergy = addSaturated(mBaseEnergy, base);
    mSpeakerEnergy = addSaturated(mSpeakerEnergy, speaker);
    mReceiverEnergy = addSaturated(mReceiverEnergy, receiver);
    return 0;
}

int32_t AudioHandler::handleApplicationResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t header = 0;
    int64_t start = 0;
    int64_t end = 0;
    String8 name;
    int32_t durations[6] = {};
    int64_t energies[6] = {};
    bool ok = data.readInt32(&header) == android::NO_ERROR &&
              data.readInt64(&start) == android::NO_ERROR &&
              data.readInt64(&end) == android::NO_ERROR &&
              data.readString8(&name) == android::NO_ERROR;
    for (int i = 0; ok && i < 6; ++i) {
        ok = data.readInt32(&durations[i]) == android::NO_ERROR &&
             data.readInt64(&energies[i]) == android::NO_ERROR;
    }
    if (!ok) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid audio application result");
        return -2;
    }
    KLOGD("Delta Usage: %d, %d, %d, %d, %d, %d, Energy: %lld, %lld, %lld, %lld, %lld, %lld",
          durations[0], durations[1], durations[2], durations[3], durations[4], durations[5],
          static_cast<long long>(energies[0]), static_cast<long long>(energies[1]),
          static_cast<long long>(energies[2]), static_cast<long long>(energies[3]),
          static_cast<long long>(energies[4]), static_cast<long long>(energies[5]));
    if (mPolicy == kPolicySmartPa) {
        for (int i : {2, 3, 4, 5}) {
            mCachedTotal = addSaturated(mCachedTotal, energies[i]);
        }
    }
    account& cached = mCachedAccounts[name.c_str()];
    for (int i = 0; i < 6; ++i) {
        cached.durations[i] += durations[i];
        cached.energies[i] = addSaturated(cached.energies[i], energies[i]);
    }
    return 0;
}

void AudioHandler::flushCachedAccounts(int64_t time) {
    int64_t scale = -1;
    if (mPolicy == kPolicySmartPa && mCachedTotal >= 1) {
        // The spans still open are measured up to now, and go on.
        if (mSpeaker.count > 0) {
            closeSpan(mSpeaker, time);
        }
        if (mReceiver.count > 0) {
            closeSpan(mReceiver, time);
        }
        readSmartPa(time, 3);
        const int64_t measured =
            addSaturated(addSaturated(mBaseEnergy, mSpeakerEnergy), mReceiverEnergy);
        if (measured >= 1) {
            scale = rescale(measured, 1024 * 1024) / mCachedTotal;
            KLOGD("scale: %lld", static_cast<long long>(scale));
        } else {
            KLOGI("No measured energy for %lld cached: model energies kept",
                  static_cast<long long>(mCachedTotal));
        }
    }
    int64_t sums[6] = {};
    Parcel rows;
    int32_t count = 0;
    for (auto& entry : mCachedAccounts) {
        account& a = entry.second;
        if (scale >= 0) {
            for (int64_t& energy : a.energies) {
                energy = rescale(energy, scale);
            }
        }
        const String8 name(entry.first.c_str());
        if (a.energies[0] + a.energies[1] >= 0) {
            Parcel record;
            record.writeInt64(mLastPollingTime);
            record.writeString8(name);
            record.writeInt32(APPS_AUDIO);
            for (int i = 0; i < 4; ++i) {
                record.writeInt64(a.energies[i]);
            }
            for (int i = 0; i < 4; ++i) {
                record.writeInt32(KelvoUtils::saturateInt32(a.durations[i]));
            }
            AppsAccounting::getInstance()->addAppsData(record);
        }
        rows.writeInt64(mLastPollingTime);
        rows.writeInt64(time);
        rows.writeString8(name);
        for (int i = 0; i < 6; ++i) {
            rows.writeInt32(KelvoUtils::saturateInt32(a.durations[i]));
            rows.writeInt64(a.energies[i]);
            sums[i] = addSaturated(sums[i], a.energies[i]);
        }
        ++count;
    }
    KLOGD("Cached applications data size: %zu", mCachedAccounts.size());
    if (count > 0 && insertEntries(kRawApplications, rows, count, false) < 0) {
        KLOGE("Failed to log applications audio data, ret: %d", -2);
    }
    mCachedAccounts.clear();
    if (mPolicy == kPolicySmartPa) {
        mCachedTotal = 0;
        mBaseEnergy = 0;
        mSpeakerEnergy = 0;
        mReceiverEnergy = 0;
    }

    updateComponentUsage(time);
    bool any = false;
    for (int64_t d : mComponentDurations) {
        any = any || d > 0;
    }
    if (!any) {
        return;
    }
    Parcel row;
    row.writeInt64(mLastPollingTime);
    row.writeInt64(mComponent.count >= 1 ? time : mComponentEnd);
    for (int i = 0; i < 6; ++i) {
        row.writeInt32(KelvoUtils::saturateInt32(mComponentDurations[i]));
        row.writeInt64(sums[i]);
        mComponentDurations[i] = 0;
    }
    insertEntries(kRawComponent, row, 1, false);
}

int32_t AudioHandler::onDataPolling(const Parcel& data) {
    data.setDataPosition(0);
    PollingPayload poll;
    if (PollingPayload::readFrom(data, &poll) < 0) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid data polling message");
        return -5;
    }
    switch (poll.reason) {
        case POLLING_TIME_CHANGED:
            balanceAccounting(poll.time, BALANCE_SPAN, poll.newTime);
            flushCachedAccounts(poll.time);
            mLastPollingTime = poll.newTime;
            for (span_data* span : {&mComponent, &mSpeaker, &mReceiver}) {
                if (span->count > 0) {
                    span->start = poll.newTime;
                }
            }
            return 0;
        case POLLING_HOURLY_TICK:
            balanceAccounting(poll.hour, BALANCE_AT, 0);
            flushCachedAccounts(poll.hour);
            mLastPollingTime = poll.hour;
            voteCandidate(poll.hour, CANDIDATE_HOURLY_TICK, mElector);
            return 0;
        default:
            balanceAccounting(poll.time, BALANCE_AT, 0);
            flushCachedAccounts(poll.time);
            mLastPollingTime = poll.time;
            if (poll.reason == POLLING_CHARGER) {
                updateComponentUsage(poll.time);
                mChargerOnline = poll.online;
            }
            return 0;
    }
}

int32_t AudioHandler::onVmDied(const Parcel& data) {
    data.setDataPosition(0);
    const int64_t time = data.readInt64();
    int32_t ret = ComponentHandler::onVmDied(data);
    for (const auto& entry : mSessions) {
        const session_data& session = entry.second;
        if (session.reference >= 1 && needsPower(session.device)) {
            sendSessionValue(time, entry.first, session.device,
                             validStream(session.stream) ? mStreams[session.stream].volume : 1);
            sendSessionAction(ACTION_ACTIVATE, time, entry.first, session.name);
        }
    }
    if (mPhoneState != 0 && needsPower(mPhoneDevice)) {
        sendSessionValue(time, kCallSession, mPhoneDevice, mStreams[mInCallStream].volume);
        sendSessionAction(ACTION_ACTIVATE, time, kCallSession, String8(kCallPackage));
    }
    return ret;
}

int32_t AudioHandler::onDailyTick(const Parcel& data) {
    data.setDataPosition(0);
    data.readInt64();
    const int64_t hour = data.readInt64();
    if (mHeadsetCount >= 1) {
        // Stored before the vote, so the day's upload finds it.
        Parcel record;
        record.writeInt64(hour);
        record.writeString8(String8(kHeadsetCountName));
        record.writeString8(String8::format("%d", mHeadsetCount));
        Parcel reply;
        int32_t ret = KelvoAgent::getInstance()->sendToHandler(
            HANDLER_SYSTEM, SystemHandler::MESSAGE_MISC_DATA, record, &reply, true);
        if (ret < 0) {
            KLOGE("Failed to sent data to daily misc table: %d", ret);
        } else {
            mHeadsetCount = 0;
        }
    }
    voteCandidate(hour, kCandidateDailyTick, mElector);
    return 0;
}

int32_t AudioHandler::onDailyUploading(const Parcel& data) {
    data.setDataPosition(0);
    float ratio = data.readFloat();
    int64_t end = data.readInt64();
    int32_t ret = setPeriodData(EVENT_DAILY_COMPONENTS, end, kDayMs, ratio);
    // Only the day's own count: an earlier day's row is never sent again.
    String8 sql = String8::format(
        "SELECT value FROM daily_misc_data WHERE name = '%s' AND timestamp > %lld AND "
        "timestamp <= %lld",
        kHeadsetCountName, static_cast<long long>(end - kDayMs), static_cast<long long>(end));
    Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &reply, 1, rows) < 0) {
        KLOGE("Failed to query headset count");
    } else {
        int64_t count = 0;
        for (int32_t r = 0; r < rows; ++r) {
            String8 value;
            if (reply.readString8(&value) != android::NO_ERROR) {
                break;
            }
            count += strtoll(value.c_str(), nullptr, 10);
        }
        if (count >= 1) {
            Parcel users;
            DataUploader::formIntData(kHeadsetCountField, count, users);
            if (setEventData(EVENT_DAILY_USERS, users, true) < 0) {
                KLOGE("Failed to set headset count upload data");
                ret = -23;
            }
        }
    }
    voteCandidate(end, CANDIDATE_DAILY_UPLOAD, mElector);
    return ret;
}

void AudioHandler::dump(String8& out) {
    out.append("======AudioHandler BEGIN======\n");
    out.appendFormat("mPhoneState=%d\n", mPhoneState);
    out.appendFormat("mPhoneDevice=%u\n", mPhoneDevice);
    out.appendFormat("mHeadsetCount=%d\n", mHeadsetCount);
    out.appendFormat("mLastPollingTime=%lld\n", static_cast<long long>(mLastPollingTime));
    out.appendFormat("mComponentData.reference=%d\n", mComponent.count);
    out.appendFormat("mComponentData.start_time=%lld\n", static_cast<long long>(mComponent.start));
    out.appendFormat("mComponentData.end_time=%lld\n", static_cast<long long>(mComponentEnd));
    out.appendFormat("mComponentData.account={%lld, %lld, %lld, %lld, %lld, %lld}\n",
                     static_cast<long long>(mComponentDurations[0]),
                     static_cast<long long>(mComponentDurations[1]),
                     static_cast<long long>(mComponentDurations[2]),
                     static_cast<long long>(mComponentDurations[3]),
                     static_cast<long long>(mComponentDurations[4]),
                     static_cast<long long>(mComponentDurations[5]));
    out.appendFormat("mSpeakerValue=%lld mReceiverValue=%lld mBaseEnergy=%lld\n",
                     static_cast<long long>(mSpeakerEnergy),
                     static_cast<long long>(mReceiverEnergy), static_cast<long long>(mBaseEnergy));
    out.appendFormat("mSpeaker={%d, %lld, %lld} mReceiver={%d, %lld, %lld}\n", mSpeaker.count,
                     static_cast<long long>(mSpeaker.start), static_cast<long long>(mSpeaker.usage),
                     mReceiver.count, static_cast<long long>(mReceiver.start),
                     static_cast<long long>(mReceiver.usage));
    out.appendFormat("mSessionData.size()=%zu\n", mSessions.size());
    out.appendFormat("mCachedAccounts.size()=%zu\n", mCachedAccounts.size());
    out.appendFormat("mStreamData[0..%d]={", kStreamCount - 1);
    for (const stream_data& s : mStreams) {
        out.appendFormat("{%u, %d}, ", s.device, s.volume);
    }
    out.append("}\n");
    out.appendFormat("mSessionData[0..%zu]={\n", mSessions.size());
    for (const auto& entry : mSessions) {
        const session_data& s = entry.second;
        out.appendFormat(
            "   [%d] = {.uid=%d, .pid=%d, .stream=%d, .device=%u, .reference=%d, .name=%s},\n",
            entry.first, s.uid, s.pid, s.stream, s.device, s.reference, s.name.c_str());
    }
    out.append("}\n");
    out.appendFormat("mCachedAccounts[0..%zu]={\n", mCachedAccounts.size());
    for (const auto& entry : mCachedAccounts) {
        const account& a = entry.second;
        out.appendFormat(
            "   [%s] = {.usage=[%lld %lld %lld %lld], .energy=[%lld %lld %lld %lld]}, \n",
            entry.first.c_str(), static_cast<long long>(a.durations[0]),
            static_cast<long long>(a.durations[1]), static_cast<long long>(a.durations[2]),
            static_cast<long long>(a.durations[3]), static_cast<long long>(a.energies[0]),
            static_cast<long long>(a.energies[1]), static_cast<long long>(a.energies[2]),
            static_cast<long long>(a.energies[3]));
    }
    out.append("}\n");
    out.append("======AudioHandler END======\n");
    ComponentHandler::dump(out);
}

}  // namespace kelvo
