#include "handlers/components/BluetoothHandler.h"

#include <limits>
#include <string>

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

const column_attribute kHourlyApplicationsColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "type"},
    {COLUMN_INT, "foreground_duration"},
    {COLUMN_LONG, "foreground_energy"},
    {COLUMN_INT, "background_duration"},
    {COLUMN_LONG, "background_energy"},
    {COLUMN_INT, "screen_on_duration"},
    {COLUMN_LONG, "screen_on_energy"},
    {COLUMN_INT, "screen_off_duration"},
    {COLUMN_LONG, "screen_off_energy"},
};
const column_attribute kStateColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "type"},
    {COLUMN_INT, "state"},
};

const table_attribute kRawApplications = {"1.1", 1, kTypedRawApplicationsCount,
                                          kTypedRawApplicationsColumns,
                                          "raw_applications_bluetooth"};
const table_attribute kHourlyApplications = {
    "1.0", 1, static_cast<int32_t>(sizeof(kHourlyApplicationsColumns) / sizeof(column_attribute)),
    kHourlyApplicationsColumns, "hourly_applications_bluetooth"};
const table_attribute kHourlyComponent = {"1.0", 1, kFamilyHourlyComponentCount,
                                          kFamilyHourlyComponentColumns,
                                          "hourly_component_bluetooth"};
const table_attribute kStateTable = {"1.0", 1, 4, kStateColumns, "raw_bluetooth_state"};

// No component table: the hour's component sums come from its application
// rows, one per application and activity.
component_family makeFamily() {
    component_family f = {
        "bluetooth",       &kRawApplications, nullptr, &kHourlyApplications,
        &kHourlyComponent, APPS_BLUETOOTH,    27,      28,
    };
    f.rankBy = "MAX(foreground_duration + background_duration)";
    f.longestDurations = true;
    return f;
}
const component_family kFamily = makeFamily();

constexpr int32_t kNoNumber = std::numeric_limits<int32_t>::min();

const char* onOff(bool on) {
    return on ? "On" : "Off";
}

}  // namespace

BluetoothHandler::BluetoothHandler()
    : TypedComponentHandler("BluetoothHandler", ACCOUNTER_BLUETOOTH, kElector, &kFamily) {}

const component_family& BluetoothHandler::family() {
    return kFamily;
}

const table_attribute& BluetoothHandler::stateTable() {
    return kStateTable;
}

void BluetoothHandler::addSchemaTable() {
    ComponentHandler::addSchemaTable();
    addSchema(kStateTable);
}

void BluetoothHandler::cleanTables(int64_t time) {
    ComponentHandler::cleanTables(time);
    cleanObsoleteEntries(kStateTable.name, time, "timestamp");
}

void BluetoothHandler::registerDispatcherTag() {
    android::sp<Dispatcher> dispatcher = Dispatcher::getInstance();
    dispatcher->registerTag({"KELVO_TAG_BT_DISCOVERY_START", TAG_DISCOVERY_START}, this);
    dispatcher->registerTag({"KELVO_TAG_BT_DISCOVERY_STOP", TAG_DISCOVERY_STOP}, this);
    dispatcher->registerTag({"KELVO_TAG_BT_TRANSFER_TX_START", TAG_TRANSFER_TX_START}, this);
    dispatcher->registerTag({"KELVO_TAG_BT_TRANSFER_RX_START", TAG_TRANSFER_RX_START}, this);
    dispatcher->registerTag({"KELVO_TAG_BT_TRANSFER_STOP", TAG_TRANSFER_STOP}, this);
}

int32_t BluetoothHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    switch (tag) {
        case TAG_DISCOVERY_START:
        case TAG_DISCOVERY_STOP:
            return handleDiscovery(time, tag == TAG_DISCOVERY_START, text);
        case TAG_TRANSFER_TX_START:
        case TAG_TRANSFER_RX_START:
        case TAG_TRANSFER_STOP:
            return handleTransfer(time, tag);
        default:
            KLOGE("Unknown message tag: %d", tag);
            return -3;
    }
}

void BluetoothHandler::applyChange(activity& a, int64_t time, bool on, int32_t type,
                                   const String8& name, bool sendAction) {
    a.on = on;
    a.type = type;
    a.name = name;
    if (sendAction) {
        sendTypedAction(on ? ACTION_ACTIVATE : ACTION_DEACTIVATE, type, time, name);
    }
    Parcel row;
    row.writeInt64(time);
    row.writeString8(name);
    row.writeInt32(type);
    row.writeInt32(on ? 1 : 0);
    insertEntries(kStateTable, row, 1, false);
}

String8 BluetoothHandler::discoveryPackage(const char* text) {
    int32_t uid = 0;
    int32_t pid = 0;
    int32_t ret = parseInt(text, "uid=", "pid=", kNoNumber, &uid);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse uid: %d", ret);
        return String8(kUnknownPackage);
    }
    ret = parseInt(text, "pid=", nullptr, kNoNumber, &pid);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse pid: %d", ret);
        return String8(kUnknownPackage);
    }
    String8 name;
    if (PackageProperty::getInstance()->queryPackageByUidAndPid(uid, pid, name) < 0 ||
        name.length() == 0) {
        KLOGD("Not found package name by uid and pid: %d", uid);
        return String8(kUnknownPackage);
    }
    return name;
}

int32_t BluetoothHandler::handleDiscovery(int64_t time, bool start, const char* text) {
    if (mDiscovery.on == start) {
        KLOGD("Already %s at %lld", onOff(start), static_cast<long long>(time));
        return 0;
    }
    // A stop ends the period under the name it began with.
    String8 name = start ? discoveryPackage(text) : mDiscovery.name;
    applyChange(mDiscovery, time, start, ACTIVITY_DISCOVERY, name, true);
    KLOGD("Timestamp: %lld, Name: %s, State: %d", static_cast<long long>(time), name.c_str(),
          start ? 1 : 0);
    return 0;
}

int32_t BluetoothHandler::handleTransfer(int64_t time, int32_t tag) {
    const bool start = tag != TAG_TRANSFER_STOP;
    if (mTransfer.on == start) {
        KLOGD("Already %s at %lld", onOff(start), static_cast<long long>(time));
        return 0;
    }
    // A stop keeps the direction of the transfer it ends.
    const int32_t type = tag == TAG_TRANSFER_TX_START   ? ACTIVITY_TX
                         : tag == TAG_TRANSFER_RX_START ? ACTIVITY_RX
                                                        : mTransfer.type;
    String8 name = start ? String8(kTransferPackage) : mTransfer.name;
    applyChange(mTransfer, time, start, type, name, true);
    KLOGD("Timestamp: %lld, Name: %s, Type: %s, State: %d", static_cast<long long>(time),
          name.c_str(), type == ACTIVITY_RX ? "RX" : "TX", start ? 1 : 0);
    return 0;
}

int32_t BluetoothHandler::handleCustomized(int32_t code, const Parcel& data, Parcel*) {
    if (code != kMediaState && code != kPhoneState) {
        KLOGE("Unknown customized tag: %d", code);
        return -3;
    }
    data.setDataPosition(0);
    int64_t time = 0;
    String8 package;
    bool on = false;
    if (data.readInt64(&time) != android::NO_ERROR ||
        data.readString8(&package) != android::NO_ERROR || data.readBool(&on) != android::NO_ERROR) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid bluetooth notice: %d", code);
        return -2;
    }
    return code == kMediaState ? handleMedia(time, package, on) : handlePhone(time, package, on);
}

int32_t BluetoothHandler::handleMedia(int64_t time, const String8& package, bool on) {
    // Every notice is recorded; the accounter holds one element per package,
    // so its charge ends only with the package's last session.
    auto it = mMediaSessions.find(package);
    bool send = true;
    if (on) {
        if (it == mMediaSessions.end()) {
            if (mMediaSessions.size() >= kMaxMediaPackages) {
                HealthCounters::add(Health::HandlerStateCapped);
                KLOGE("Too many media packages: %zu, refused: %s", mMediaSessions.size(),
                      package.c_str());
                return -2;
            }
            it = mMediaSessions.emplace(package, 0).first;
        }
        if (it->second < std::numeric_limits<int32_t>::max()) {
            ++it->second;
        }
    } else if (it == mMediaSessions.end()) {
        KLOGD("No media session of %s at %lld", package.c_str(), static_cast<long long>(time));
        send = false;
    } else if (--it->second > 0) {
        KLOGD("Media sessions of %s left: %d", package.c_str(), it->second);
        send = false;
    } else {
        mMediaSessions.erase(it);
    }
    applyChange(mMedia, time, on, ACTIVITY_MEDIA, package, send);
    KLOGD("Timestamp: %lld, Name: %s, State: %d", static_cast<long long>(time), package.c_str(),
          on ? 1 : 0);
    return 0;
}

int32_t BluetoothHandler::handlePhone(int64_t time, const String8& package, bool on) {
    if (mPhone.on == on) {
        KLOGD("Already %s at %lld", onOff(on), static_cast<long long>(time));
        return 0;
    }
    // The call ends under the name it was charged to.
    String8 name = on ? package : mPhone.name;
    if (!on && package != name) {
        KLOGD("Phone off as %s, charged to %s", package.c_str(), name.c_str());
    }
    applyChange(mPhone, time, on, ACTIVITY_PHONE, name, true);
    KLOGD("Timestamp: %lld, Name: %s, State: %d", static_cast<long long>(time), name.c_str(),
          on ? 1 : 0);
    return 0;
}

int32_t BluetoothHandler::onVmDied(const Parcel& data) {
    int32_t ret = TypedComponentHandler::onVmDied(data);
    // The accounter dropped every element: nothing runs any more, and the
    // next start is charged again.
    for (activity* a : {&mDiscovery, &mTransfer, &mMedia, &mPhone}) {
        a->on = false;
    }
    mMediaSessions.clear();
    return ret;
}

}  // namespace kelvo
