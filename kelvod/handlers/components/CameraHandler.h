#pragma once

#include <stdint.h>
#include <utils/String8.h>

#include "handlers/components/ComponentHandler.h"

namespace kelvo {

// The cameras: one connection of the camera service at a time, told by
// connect, configure, unconfigure, capture intent and disconnect records.
// The connection's streams (type, width, height) go to the accounter, which
// charges the application holding the camera; the results come back by
// stream type and are stored per camera: type 1 is the front camera, types
// 0, 2 and 3 (the rear camera and the second streams of a dual connection)
// the rear one. Camera 0's user is told to the flashlight handler.
class CameraHandler : public ComponentHandler {
public:
    static constexpr uint32_t kElector = 0x4;

    // Tag indexes.
    enum camera_tag : int32_t {
        TAG_CONNECT = 0,
        TAG_CONFIG = 1,
        TAG_UNCONFIG = 2,
        TAG_CAPTURE_INTENT = 3,
        TAG_DISCONNECT = 4,
    };
    enum connection_state : int32_t {
        STATE_DISCONNECTED = 0,
        STATE_CONNECTED = 1,
        STATE_CONNECTING = 2,
    };
    // Modes of a connection: one camera of type 0, one of type 1, or two.
    enum camera_mode : int32_t {
        MODE_REAR = 0,
        MODE_FRONT = 1,
        MODE_DUAL = 2,
    };
    // Capture intents written by the handler itself.
    static constexpr int32_t kIntentDisconnected = 10;
    static constexpr int32_t kIntentConnected = 11;
    // Stream types 0..3; type 1 is the front camera.
    static constexpr int32_t kMaxStreamType = 3;
    static constexpr int32_t kFrontType = 1;

    CameraHandler();

    static const component_family& frontFamily();
    static const component_family& rearFamily();
    static const table_attribute& stateTable();
    static const table_attribute& intentTable();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void registerDispatcherTag() override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t handleApplicationResult(const android::Parcel& data) override;
    int32_t onVmDied(const android::Parcel& data) override;

private:
    struct stream {
        int32_t type = 0;
        int32_t width = 0;
        int32_t height = 0;
    };
    struct connection {
        android::String8 name;
        int64_t timestamp = 0;
        int32_t id = 0;
        int32_t mode = MODE_REAR;
        stream first;
        stream second;
    };

    int32_t handleConnect(int64_t time, const char* text);
    int32_t handleIntent(int64_t time, const char* text);
    int32_t handleConfig(int64_t time, int32_t tag, const char* text);
    int32_t handleDisconnect(int64_t time);
    // Ends the running connection at `time` as a disconnect would.
    void closeConnection(int64_t time);
    // Parse a whole configuration or unconfiguration into `c`; the
    // connection itself is left alone on failure.
    int32_t parseConfig(int64_t time, const char* text, connection* c);
    int32_t parseUnconfig(int64_t time, const char* text, connection* c);
    bool isReady() const;
    int32_t sendAction(int32_t action, int64_t time);
    void writeIntent(int64_t time, int32_t intent);
    void writeStateRows();
    void writeStateRow(int32_t type);

    int32_t mState;
    connection mConnection;
};

}  // namespace kelvo
