#include "handlers/components/FlashlightHandler.h"

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"
#include "utils/PackageProperty.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

const table_attribute kRawApplications = {"1.1", 1, kFamilyRawApplicationsCount,
                                          kFamilyRawApplicationsColumns,
                                          "raw_applications_flashlight"};
const table_attribute kHourlyApplications = {"1.0", 1, kFamilyHourlyApplicationsCount,
                                             kFamilyHourlyApplicationsColumns,
                                             "hourly_applications_flashlight"};
const table_attribute kHourlyComponent = {"1.0", 1, kFamilyHourlyComponentCount,
                                          kFamilyHourlyComponentColumns,
                                          "hourly_component_flashlight"};
const column_attribute kStateColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "state"},
};
const table_attribute kStateTable = {"1.0", 1, 3, kStateColumns, "raw_flashlight_state"};

// No component table: the component sums are those of the hour's
// application rows.
const component_family kFamily = {
    "flashlight",      &kRawApplications, nullptr, &kHourlyApplications,
    &kHourlyComponent, APPS_FLASHLIGHT,   18,      19,
};

}  // namespace

FlashlightHandler::FlashlightHandler()
    : ComponentHandler("FlashlightHandler", ACCOUNTER_FLASHLIGHT, kElector, {&kFamily}),
      mState(0) {}

const component_family& FlashlightHandler::family() {
    return kFamily;
}

const table_attribute& FlashlightHandler::stateTable() {
    return kStateTable;
}

void FlashlightHandler::addSchemaTable() {
    ComponentHandler::addSchemaTable();
    addSchema(kStateTable);
}

void FlashlightHandler::cleanTables(int64_t time) {
    ComponentHandler::cleanTables(time);
    cleanObsoleteEntries(kStateTable.name, time, "timestamp");
}

void FlashlightHandler::registerDispatcherTag() {
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_FLASHLIGHT_OFF", TAG_FLASHLIGHT_OFF}, this);
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_FLASHLIGHT_ON", TAG_FLASHLIGHT_ON}, this);
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_TORCH_CONNECT", TAG_TORCH_CONNECT}, this);
}

int32_t FlashlightHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    switch (tag) {
        case TAG_FLASHLIGHT_OFF:
            return changeState(time, 0);
        case TAG_FLASHLIGHT_ON:
            return changeState(time, 1);
        case TAG_TORCH_CONNECT:
            return handleTorchUser(text);
        default:
            KLOGE("Unknown message tag: %d", tag);
            return -3;
    }
}

int32_t FlashlightHandler::changeState(int64_t time, int32_t state) {
    if (state == mState) {
        // A repeated on or off changes nothing: the user learnt meanwhile
        // still waits for a real change.
        KLOGD("Already %s at %lld", state == 1 ? "on" : "off", static_cast<long long>(time));
        return 0;
    }
    mState = state;
    if (state == 1) {
        mChargedUser = mCurrentUser;
        if (mChargedUser.length() > 0) {
            sendNamedAction(ACTION_ACTIVATE, time, mChargedUser);
        }
    } else {
        if (mChargedUser.length() > 0) {
            sendNamedAction(ACTION_DEACTIVATE, time, mChargedUser);
        }
        mChargedUser = String8();
    }
    Parcel row;
    row.writeInt64(time);
    row.writeString8(mCurrentUser);
    row.writeInt32(state);
    insertEntries(kStateTable, row, 1, false);
    if (mPendingUser.length() > 0) {
        mCurrentUser = mPendingUser;
        mPendingUser = String8();
    }
    return 0;
}

int32_t FlashlightHandler::handleTorchUser(const char* text) {
    int32_t uid = -1;
    int32_t pid = -1;
    int32_t ret = parseInt(text, "uid=", "pid=", -1, &uid);
    if (ret == 0) {
        ret = parseInt(text, "pid=", nullptr, -1, &pid);
    }
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse message: %d", ret);
        return -19;
    }
    String8 name;
    ret = PackageProperty::getInstance()->queryPackageByUidAndPid(uid, pid, name);
    KLOGD("package uid %d pid %d name %s", uid, pid, name.c_str());
    if (ret < 0 || name.length() == 0) {
        KLOGE("Failed to parse uid");
        return -2;
    }
    setUser(name);
    return 0;
}

int32_t FlashlightHandler::handleCustomized(int32_t code, const Parcel& data, Parcel*) {
    if (code != kCameraUser) {
        KLOGE("Unknown customized tag: %d", code);
        return -3;
    }
    data.setDataPosition(0);
    String8 name;
    if (data.readString8(&name) != android::NO_ERROR || name.length() == 0) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid camera user");
        return -2;
    }
    KLOGD("Camera user name: %s", name.c_str());
    setUser(name);
    return 0;
}

void FlashlightHandler::setUser(const String8& name) {
    if (mState == 1) {
        mPendingUser = name;
    } else {
        mCurrentUser = name;
    }
}

}  // namespace kelvo
