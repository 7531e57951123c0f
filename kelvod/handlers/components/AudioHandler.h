#pragma once

#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/String8.h>

#include <map>
#include <string>

#include "handlers/components/ComponentHandler.h"

namespace kelvo {

// Audio playback energy per application. The handler follows the sessions
// and streams the audio framework reports, keeps each stream's output device
// and volume, and tells the accounter which session plays on a powered
// output (earpiece 0x1, loudspeaker 0x2) at which volume; playback on a
// Bluetooth output (0x3f0) is handed to the Bluetooth handler instead.
// It also counts the active sessions on the built-in output (the component)
// and the time the loudspeaker and the earpiece were in use.
//
// Results are cached per application and written at each data poll. Under
// policy 2 the measured energy of the amplifiers (the framework's
// "getSmartPAPOWER" parameter) rescales the cached results so they add up
// to what was measured.
class AudioHandler : public ComponentHandler {
public:
    static constexpr uint32_t kElector = 0x20000;
    static constexpr int32_t kPolicySmartPa = 2;
    static constexpr int32_t kStreamCount = 13;
    static constexpr size_t kMaxSessions = 512;
    static constexpr uint32_t kDeviceReceiver = 0x1;
    static constexpr uint32_t kDeviceSpeaker = 0x2;
    static constexpr uint32_t kDevicePowered = 0x3;
    static constexpr uint32_t kDeviceBluetooth = 0x3f0;
    // The in-call pseudo-session and the package it is charged to.
    static constexpr int32_t kCallSession = 1;
    static const char* const kCallPackage;
    // Smart-amplifier reads are at least this far apart (monotonic ms); the
    // span they cover is clamped to [1, kMaxPaSpanMs].
    static constexpr int64_t kPaReadIntervalMs = 60000;
    static constexpr int64_t kMaxPaSpanMs = 600000;
    // The headset count of a day, parameter of the daily users event.
    static constexpr uint32_t kHeadsetCountField = 19;
    static constexpr int32_t kCandidateDailyTick = 5;

    enum audio_tag : int32_t {
        TAG_AUDIO_DEVICE = 0,
        TAG_AUDIO_VOLUME = 1,
        TAG_AUDIO_SESSION_ACQUIRE = 2,
        TAG_AUDIO_SESSION_RELEASE = 3,
        TAG_AUDIO_SESSION_START = 4,
        TAG_AUDIO_SESSION_STOP = 5,
        TAG_AUDIO_HEADSET = 6,
    };

    // Customized messages to the Bluetooth handler: int64 time, String8
    // package, bool on.
    enum bluetooth_notice : int32_t {
        BLUETOOTH_MEDIA = 0,
        BLUETOOTH_PHONE = 1,
    };

    AudioHandler();

    static const component_family& family();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void setupListeners(android::Parcel& out) override;
    void registerDispatcherTag() override;
    void setCandidateElector() override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t onDataPolling(const android::Parcel& data) override;
    int32_t onPhoneStateChanged(const android::Parcel& data) override;
    int32_t onScreenStateChanged(const android::Parcel& data) override;
    int32_t onForegroundChanged(const android::Parcel& data) override;
    int32_t onChargerOnlineChanged(const android::Parcel& data) override;
    int32_t onDailyTick(const android::Parcel& data) override;
    // The accounter drops every element; what still plays is activated
    // again at once, so its charge goes on.
    int32_t onVmDied(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t handleApplicationResult(const android::Parcel& data) override;
    int32_t handleComponentResult(const android::Parcel& data) override;
    void dump(android::String8& out) override;

private:
    struct stream_data {
        uint32_t device;
        int32_t volume;
    };
    struct session_data {
        int32_t uid;
        int32_t pid;
        int32_t stream;
        uint32_t device;
        int32_t reference;
        android::String8 name;
    };
    // A span of use: how many hold it, since when, and the closed time.
    struct span_data {
        int32_t count = 0;
        int64_t start = 0;
        int64_t usage = 0;
    };
    struct account {
        int64_t durations[6] = {};
        int64_t energies[6] = {};
    };

    int32_t handleDevice(int64_t time, const char* text);
    int32_t handleVolume(int64_t time, const char* text);
    int32_t handleAcquire(int64_t time, const char* text);
    int32_t handleRelease(int64_t time, const char* text);
    int32_t handlePlay(int64_t time, const char* text, bool start);
    int32_t handleHeadset(int64_t time, const char* text);
    int32_t startSession(int64_t time, int32_t id, int32_t stream);
    // Ends a session's play whatever its reference (a release, the cap).
    void stopSession(int64_t time, int32_t id, session_data& session);

    // Moves one user of the outputs from the old device to the new one
    // (0 for none): the component, speaker and receiver counts and spans.
    void moveReferences(int64_t time, uint32_t from, uint32_t to, int32_t stream);
    // Whether the counts can take the change; otherwise brings usage and
    // spans up to the time and restarts every count from 0.
    bool checkReferences(int64_t time, uint32_t from);
    void closeSpan(span_data& span, int64_t time);
    void updateComponentUsage(int64_t time);
    bool isForeground() const;

    // The playing sessions of a stream (and the call on its in-call
    // stream) take the stream's device and volume.
    void updateActiveStreams(int64_t time, int32_t stream);
    // One user's change of output: SetValue, Activate or Deactivate, the
    // references and the Bluetooth notice.
    void changeOutput(int64_t time, int32_t id, const android::String8& name, int32_t stream,
                      uint32_t from, uint32_t to, int32_t notice);
    int32_t sendSessionValue(int64_t time, int32_t id, uint32_t device, int32_t volume);
    int32_t sendSessionAction(int32_t action, int64_t time, int32_t id,
                              const android::String8& name);
    void notifyBluetooth(int32_t notice, int64_t time, const android::String8& name, bool on);

    int32_t readSmartPa(int64_t time, int32_t stream);
    void flushCachedAccounts(int64_t time);

    bool mScreenOn;
    bool mChargerOnline;
    int32_t mPhoneState;
    uint32_t mPhoneDevice;
    int32_t mInCallStream;
    int32_t mHeadsetCount;
    int64_t mLastPollingTime;
    stream_data mStreams[kStreamCount];
    std::map<int32_t, session_data> mSessions;
    // The component: active sessions on a powered output.
    span_data mComponent;
    int64_t mComponentEnd;
    int64_t mComponentDurations[6];
    span_data mSpeaker;
    span_data mReceiver;
    int64_t mBaseEnergy;
    int64_t mSpeakerEnergy;
    int64_t mReceiverEnergy;
    int64_t mCachedTotal;
    std::map<std::string, account> mCachedAccounts;
    android::String8 mForeground;
    // Monotonic ms of the last smart-amplifier read; -1 before the first.
    int64_t mLastPaRead;
};

}  // namespace kelvo
