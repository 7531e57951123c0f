#pragma once

#include <stdint.h>
#include <utils/String8.h>

#include <map>

#include "handlers/components/TypedComponentHandler.h"

namespace kelvo {

// The Bluetooth radio, by activity: discovery (charged to the requesting
// application), file transfers (charged to the settings application), media
// playback and calls over a Bluetooth output (both told by the audio
// handler). Each activity has its own on/off state and the name it is
// charged to; every change writes a raw_bluetooth_state row and goes to the
// accounter, which keeps the periods per activity.
//
// Audio handler side: sendToHandler(HANDLER_BLUETOOTH, kMediaState or
// kPhoneState, parcel) with the parcel int64 time, String8 package, bool on.
// Media notices may repeat: each "on" is one more session of the package,
// and its charge ends with the last "off". A phone notice ends the call under
// the name it began with, whatever name the "off" carries.
class BluetoothHandler : public TypedComponentHandler {
public:
    static constexpr uint32_t kElector = 0x1000;

    // Tag indexes.
    enum bluetooth_tag : int32_t {
        TAG_DISCOVERY_START = 0,
        TAG_DISCOVERY_STOP = 1,
        TAG_TRANSFER_TX_START = 2,
        TAG_TRANSFER_RX_START = 3,
        TAG_TRANSFER_STOP = 4,
    };
    // Customized messages of the audio handler: int64 time, String8
    // package, bool on.
    enum bluetooth_notice : int32_t {
        kMediaState = 0,
        kPhoneState = 1,
    };
    // Activities, the accounter's keys.
    enum activity_type : int32_t {
        ACTIVITY_DISCOVERY = 0,
        ACTIVITY_TX = 1,
        ACTIVITY_RX = 2,
        ACTIVITY_MEDIA = 3,
        ACTIVITY_PHONE = 4,
    };

    static constexpr const char* kUnknownPackage = "Unknow package";
    static constexpr const char* kTransferPackage = "com.android.settings";
    // Packages with media sessions counted at once; a new one beyond is
    // refused and counted.
    static constexpr size_t kMaxMediaPackages = 256;

    BluetoothHandler();

    static const component_family& family();
    static const table_attribute& stateTable();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void registerDispatcherTag() override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t onVmDied(const android::Parcel& data) override;

private:
    struct activity {
        bool on = false;
        int32_t type = -1;
        android::String8 name;
    };

    int32_t handleDiscovery(int64_t time, bool start, const char* text);
    int32_t handleTransfer(int64_t time, int32_t tag);
    int32_t handleMedia(int64_t time, const android::String8& package, bool on);
    int32_t handlePhone(int64_t time, const android::String8& package, bool on);
    // Sets the activity, sends its action and writes its state row.
    void applyChange(activity& a, int64_t time, bool on, int32_t type, const android::String8& name,
                     bool sendAction);
    // The package of a discovery request, or kUnknownPackage.
    android::String8 discoveryPackage(const char* text);

    activity mDiscovery;
    activity mTransfer;
    activity mMedia;
    activity mPhone;
    // Media sessions "on" per package.
    std::map<android::String8, int32_t> mMediaSessions;
};

}  // namespace kelvo
