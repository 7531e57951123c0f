#include "handlers/components/CameraHandler.h"

#include <limits>
#include <string>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "core/KelvoAgent.h"
#include "handlers/components/FlashlightHandler.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

// One table set per camera; the hourly cycle and the uploads run over both,
// front first.
const table_attribute kFrontRawApplications = {"1.1", 1, kFamilyRawApplicationsCount,
                                               kFamilyRawApplicationsColumns,
                                               "raw_applications_front_camera"};
const table_attribute kFrontHourlyApplications = {"1.0", 1, kFamilyHourlyApplicationsCount,
                                                  kFamilyHourlyApplicationsColumns,
                                                  "hourly_applications_front_camera"};
const table_attribute kFrontHourlyComponent = {"1.0", 1, kFamilyHourlyComponentCount,
                                               kFamilyHourlyComponentColumns,
                                               "hourly_component_front_camera"};
const table_attribute kRearRawApplications = {"1.1", 1, kFamilyRawApplicationsCount,
                                              kFamilyRawApplicationsColumns,
                                              "raw_applications_rear_camera"};
const table_attribute kRearHourlyApplications = {"1.0", 1, kFamilyHourlyApplicationsCount,
                                                 kFamilyHourlyApplicationsColumns,
                                                 "hourly_applications_rear_camera"};
const table_attribute kRearHourlyComponent = {"1.0", 1, kFamilyHourlyComponentCount,
                                              kFamilyHourlyComponentColumns,
                                              "hourly_component_rear_camera"};

const column_attribute kStateColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_TEXT, "name"}, {COLUMN_INT, "state"},
    {COLUMN_INT, "type"},       {COLUMN_INT, "width"}, {COLUMN_INT, "height"},
};
const column_attribute kIntentColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "intent"},
};
const table_attribute kStateTable = {"1.0", 1, 6, kStateColumns, "raw_camera_state"};
const table_attribute kIntentTable = {"1.0", 1, 2, kIntentColumns, "raw_camera_capture_intent"};

// Neither camera has a component table: the hour's component sums are those
// of its application rows.
const component_family kFront = {
    "front camera",         &kFrontRawApplications, nullptr, &kFrontHourlyApplications,
    &kFrontHourlyComponent, APPS_FRONT_CAMERA,      14,      15,
};
const component_family kRear = {
    "rear camera",         &kRearRawApplications, nullptr, &kRearHourlyApplications,
    &kRearHourlyComponent, APPS_REAR_CAMERA,      16,      17,
};

constexpr int32_t kNoNumber = std::numeric_limits<int32_t>::min();

}  // namespace

CameraHandler::CameraHandler()
    : ComponentHandler("CameraHandler", ACCOUNTER_CAMERA, kElector, {&kFront, &kRear},
                       {POLICY_CAMERA, "Camera", {1}}),
      mState(STATE_DISCONNECTED) {}

const component_family& CameraHandler::frontFamily() {
    return kFront;
}

const component_family& CameraHandler::rearFamily() {
    return kRear;
}

const table_attribute& CameraHandler::stateTable() {
    return kStateTable;
}

const table_attribute& CameraHandler::intentTable() {
    return kIntentTable;
}

void CameraHandler::addSchemaTable() {
    ComponentHandler::addSchemaTable();
    addSchema(kStateTable);
    addSchema(kIntentTable);
}

void CameraHandler::cleanTables(int64_t time) {
    ComponentHandler::cleanTables(time);
    cleanObsoleteEntries(kStateTable.name, time, "timestamp");
    cleanObsoleteEntries(kIntentTable.name, time, "timestamp");
}

void CameraHandler::registerDispatcherTag() {
    android::sp<Dispatcher> dispatcher = Dispatcher::getInstance();
    dispatcher->registerTag({"KELVO_TAG_CAMERA_CONNECT", TAG_CONNECT}, this);
    dispatcher->registerTag({"KELVO_TAG_CAMERA_CONFIG", TAG_CONFIG}, this);
    dispatcher->registerTag({"KELVO_TAG_CAMERA_UNCONFIG", TAG_UNCONFIG}, this);
    dispatcher->registerTag({"KELVO_TAG_CAMERA_CAPTURE_INTENT", TAG_CAPTURE_INTENT}, this);
    dispatcher->registerTag({"KELVO_TAG_CAMERA_DISCONNECT", TAG_DISCONNECT}, this);
}

int32_t CameraHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    KLOGM(LOG_MODULE_CAMERA, "tag(%d) timestamp(%lld) message(%s)", tag,
          static_cast<long long>(time), text);
    int32_t ret = 0;
    switch (mState) {
        case STATE_DISCONNECTED:
            if (tag == TAG_CONNECT) {
                ret = handleConnect(time, text);
            } else if (tag == TAG_CAPTURE_INTENT) {
                ret = handleIntent(time, text);
            } else {
                KLOGE("Invalid tag: %d", tag);
                ret = -3;
            }
            break;
        case STATE_CONNECTING:
        case STATE_CONNECTED:
            switch (tag) {
                case TAG_CONNECT:
                    // The disconnect of the old connection was lost: end it
                    // here rather than refuse every later connection.
                    KLOGE("Connect while %s: closing %s at %lld",
                          mState == STATE_CONNECTED ? "connected" : "connecting",
                          mConnection.name.c_str(), static_cast<long long>(time));
                    closeConnection(time);
                    ret = handleConnect(time, text);
                    break;
                case TAG_CONFIG:
                case TAG_UNCONFIG:
                    ret = handleConfig(time, tag, text);
                    break;
                case TAG_CAPTURE_INTENT:
                    ret = handleIntent(time, text);
                    break;
                case TAG_DISCONNECT:
                    ret = handleDisconnect(time);
                    break;
                default:
                    KLOGE("Invalid tag: %d", tag);
                    ret = -3;
                    break;
            }
            break;
        default:
            KLOGE("Unknown camera state: %d", mState);
            mState = STATE_DISCONNECTED;
            return -3;
    }
    KLOGM(LOG_MODULE_CAMERA,
          "tag(%d) state(%d) timestamp(%lld) mode(%d) name(%s) width_1(%d) height_1(%d) "
          "width_2(%d) height_2(%d)",
          tag, mState, static_cast<long long>(mConnection.timestamp), mConnection.mode,
          mConnection.name.c_str(), mConnection.first.width, mConnection.first.height,
          mConnection.second.width, mConnection.second.height);
    return ret;
}

int32_t CameraHandler::handleConnect(int64_t time, const char* text) {
    int32_t id = kNoNumber;
    std::string name;
    int32_t ret = parseInt(text, "id=", "name=", kNoNumber, &id);
    if (ret < 0) {
        KLOGE("Failed to parse camera id: %d", ret);
    } else if ((ret = parseName(text, "name=", nullptr, &name)) < 0) {
        KLOGE("Failed to parse name: %d", ret);
    }
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to save connect message parameter: %d", ret);
        return -19;
    }
    mConnection = connection();
    mConnection.name = String8(name.c_str());
    mConnection.timestamp = time;
    mConnection.id = id;
    if (id == 0) {
        Parcel user;
        user.writeString8(mConnection.name);
        KelvoAgent::getInstance()->sendToHandler(HANDLER_FLASHLIGHT, FlashlightHandler::kCameraUser,
                                                 user, nullptr, false);
    }
    writeIntent(time, kIntentConnected);
    mState = STATE_CONNECTING;
    return 0;
}

int32_t CameraHandler::handleIntent(int64_t time, const char* text) {
    int32_t intent = kNoNumber;
    int32_t ret = parseInt(text, "intent=", nullptr, kNoNumber, &intent);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse intent: %d", ret);
        if (mState == STATE_CONNECTED) {
            KLOGE("Failed to save intent message parameter: %d", ret);
        }
        return -19;
    }
    writeIntent(time, intent);
    return 0;
}

int32_t CameraHandler::handleConfig(int64_t time, int32_t tag, const char* text) {
    connection next = mConnection;
    int32_t ret =
        tag == TAG_CONFIG ? parseConfig(time, text, &next) : parseUnconfig(time, text, &next);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to save %s message parameter: %d", tag == TAG_CONFIG ? "config" : "unconfig",
              ret);
        return ret;
    }
    mConnection = next;
    if (mState == STATE_CONNECTED) {
        if (isReady()) {
            sendAction(ACTION_SET_VALUE, time);
        } else {
            mState = STATE_CONNECTING;
            sendAction(ACTION_DEACTIVATE, time);
        }
        writeStateRows();
    } else if (tag == TAG_UNCONFIG) {
        writeStateRows();
    } else if (isReady()) {
        mState = STATE_CONNECTED;
        sendAction(ACTION_SET_VALUE, time);
        sendAction(ACTION_ACTIVATE, time);
        writeStateRows();
    }
    return 0;
}

int32_t CameraHandler::handleDisconnect(int64_t time) {
    closeConnection(time);
    return 0;
}

void CameraHandler::closeConnection(int64_t time) {
    mConnection.timestamp = time;
    const bool connected = mState == STATE_CONNECTED;
    mState = STATE_DISCONNECTED;
    if (connected) {
        writeIntent(time, kIntentDisconnected);
        sendAction(ACTION_DEACTIVATE, time);
    }
    writeStateRows();
    mConnection = connection();
}

int32_t CameraHandler::parseConfig(int64_t time, const char* text, connection* c) {
    int32_t dual = kNoNumber;
    int32_t type = kNoNumber;
    int32_t width = kNoNumber;
    int32_t height = kNoNumber;
    int32_t ret = parseInt(text, "dual=", "type=", kNoNumber, &dual);
    if (ret < 0) {
        KLOGE("Failed to parse dual: %d", ret);
        return -19;
    }
    if ((ret = parseInt(text, "type=", "width=", kNoNumber, &type)) < 0) {
        KLOGE("Failed to parse type: %d", ret);
        return -19;
    }
    if ((ret = parseInt(text, "width=", "height=", kNoNumber, &width)) < 0 || width < 0) {
        KLOGE("Failed to parse width: %d", ret < 0 ? ret : width);
        return -19;
    }
    if ((ret = parseInt(text, "height=", nullptr, kNoNumber, &height)) < 0 || height < 0) {
        KLOGE("Failed to parse height: %d", ret < 0 ? ret : height);
        return -19;
    }
    const stream s = {type, width, height};
    if (dual == 0) {
        if (type != MODE_REAR && type != MODE_FRONT) {
            KLOGE("Invalid type: %d", type);
            return -3;
        }
        // A single camera: no second stream is left over from a dual one.
        c->mode = type;
        c->first = s;
        c->second = stream();
    } else if (dual == 1) {
        if (type < 0 || type > kMaxStreamType) {
            KLOGE("Invalid type: %d", type);
            return -3;
        }
        c->mode = MODE_DUAL;
        (type <= 1 ? c->first : c->second) = s;
    } else {
        KLOGE("Invalid dual mode: %d", dual);
        return -3;
    }
    c->timestamp = time;
    return 0;
}

int32_t CameraHandler::parseUnconfig(int64_t time, const char* text, connection* c) {
    int32_t type = kNoNumber;
    int32_t ret = parseInt(text, "type=", nullptr, kNoNumber, &type);
    if (ret < 0) {
        KLOGE("Failed to parse type: %d", ret);
        return -19;
    }
    stream* cleared = type == c->first.type    ? &c->first
                      : type == c->second.type ? &c->second
                                               : nullptr;
    if (cleared != nullptr) {
        cleared->width = 0;
        cleared->height = 0;
        // Only a stream actually gone ends the dual connection.
        if (c->mode == MODE_DUAL) {
            c->mode = MODE_REAR;
        }
    } else {
        KLOGD("No stream of type %d to unconfigure", type);
    }
    c->timestamp = time;
    return 0;
}

bool CameraHandler::isReady() const {
    const stream& a = mConnection.first;
    const stream& b = mConnection.second;
    switch (mConnection.mode) {
        case MODE_REAR:
        case MODE_FRONT:
            return a.width != 0 && a.height != 0;
        case MODE_DUAL:
            return a.width != 0 && a.height != 0 && b.width != 0 && b.height != 0;
        default:
            KLOGE("Invalid mode: %d", mConnection.mode);
            return false;
    }
}

int32_t CameraHandler::sendAction(int32_t action, int64_t time) {
    int32_t ret = 0;
    if (action == ACTION_ACTIVATE || action == ACTION_DEACTIVATE) {
        ret = sendNamedAction(action, time, mConnection.name);
    } else if (action == ACTION_SET_VALUE) {
        const connection& c = mConnection;
        if (c.mode != MODE_REAR && c.mode != MODE_FRONT && c.mode != MODE_DUAL) {
            KLOGE("Invalid mode: %d", c.mode);
            return -3;
        }
        Parcel parcel;
        parcel.writeInt32(mAccounterType);
        parcel.writeInt32(ACTION_SET_VALUE);
        parcel.writeInt64(time);
        parcel.writeInt32(c.mode == MODE_DUAL ? 2 : 1);
        for (const stream* s : {&c.first, &c.second}) {
            parcel.writeInt32(s->type);
            parcel.writeInt32(s->width);
            parcel.writeInt32(s->height);
            if (c.mode != MODE_DUAL) {
                break;
            }
        }
        ret = feedAccounter(parcel);
    } else {
        KLOGE("Invalid action: %d", action);
        return -3;
    }
    KLOGD(
        "timestamp(%lld) Action(%d) mode(%d) name(%s) width_1(%d) height_1(%d) width_2(%d) "
        "height_2(%d)",
        static_cast<long long>(time), action, mConnection.mode, mConnection.name.c_str(),
        mConnection.first.width, mConnection.first.height, mConnection.second.width,
        mConnection.second.height);
    return ret;
}

void CameraHandler::writeIntent(int64_t time, int32_t intent) {
    Parcel row;
    row.writeInt64(time);
    row.writeInt32(intent);
    insertEntries(kIntentTable, row, 1, false);
}

void CameraHandler::writeStateRows() {
    const connection& c = mConnection;
    switch (c.mode) {
        case MODE_DUAL:
            writeStateRow(c.first.type);
            writeStateRow(c.second.type);
            break;
        case MODE_FRONT:
            writeStateRow(c.first.type);
            break;
        default: {
            bool any = false;
            for (const stream* s : {&c.first, &c.second}) {
                if (s->width != 0 && s->height != 0) {
                    writeStateRow(s->type);
                    any = true;
                }
            }
            if (!any && c.first.width == 0 && c.first.height == 0 && c.second.width == 0 &&
                c.second.height == 0) {
                writeStateRow(-1);
            }
            break;
        }
    }
}

void CameraHandler::writeStateRow(int32_t type) {
    int32_t width = 0;
    int32_t height = 0;
    if (type == 0 || type == 1) {
        width = mConnection.first.width;
        height = mConnection.first.height;
    } else if (type == 2 || type == 3) {
        width = mConnection.second.width;
        height = mConnection.second.height;
    } else if (type != -1) {
        KLOGE("Invalid type: %d", type);
        return;
    }
    Parcel row;
    row.writeInt64(mConnection.timestamp);
    row.writeString8(mConnection.name);
    row.writeInt32(mState);
    row.writeInt32(type);
    row.writeInt32(width);
    row.writeInt32(height);
    insertEntries(kStateTable, row, 1, false);
    KLOGD("Timestamp: %lld, Name: %s, State: %d, Type: %d",
          static_cast<long long>(mConnection.timestamp), mConnection.name.c_str(), mState, type);
}

int32_t CameraHandler::handleApplicationResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t type = 0;
    if (data.readInt32(&type) != android::NO_ERROR) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid camera application result");
        return -2;
    }
    if (type < 0 || type > kMaxStreamType) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Unknown camera type: %d", type);
        return -3;
    }
    return storeApplicationResult(type == kFrontType ? kFront : kRear, data);
}

int32_t CameraHandler::onVmDied(const Parcel& data) {
    data.setDataPosition(0);
    const int64_t time = data.readInt64();
    int32_t ret = ComponentHandler::onVmDied(data);
    // The accounter dropped every element: the open camera is charged again
    // from the notification on.
    if (mState == STATE_CONNECTED) {
        sendAction(ACTION_SET_VALUE, time);
        sendAction(ACTION_ACTIVATE, time);
    }
    return ret;
}

}  // namespace kelvo
