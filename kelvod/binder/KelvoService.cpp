#include "binder/KelvoService.h"

#include <binder/IPCThreadState.h>
#include <binder/IServiceManager.h>
#include <binder/PermissionCache.h>
#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "binder/PushMessage.h"
#include "core/KelvoAgent.h"
#include "core/Notifier.h"
#include "core/QueryService.h"
#include "kelvo/RootPath.h"
#include "utils/TimeProvider.h"

namespace kelvo {

namespace {

// The module words of "--log" and their bits.
struct log_module {
    const char* word;
    uint32_t bits;
};

const log_module kLogModules[] = {
    {"module", LOG_MODULE_ALL},
    {"audio", LOG_MODULE_AUDIO},
    {"battery", LOG_MODULE_BATTERY},
    {"bluetooth", LOG_MODULE_BLUETOOTH},
    {"camera", LOG_MODULE_CAMERA},
    {"cpu", LOG_MODULE_CPU},
    {"display", LOG_MODULE_DISPLAY},
    {"flashlight", LOG_MODULE_FLASHLIGHT},
    {"abnormality", LOG_MODULE_ABNORMALITY},
    {"gnss", LOG_MODULE_GNSS},
    {"gpu", LOG_MODULE_GPU},
    {"modem", LOG_MODULE_MODEM},
    {"sensor", LOG_MODULE_SENSOR},
    {"wifi", LOG_MODULE_WIFI},
    {"dpm", LOG_MODULE_DPM},
    {"system", LOG_MODULE_SYSTEM},
    {"thermal", LOG_MODULE_THERMAL},
    {"storage", LOG_MODULE_STORAGE},
    {"dispatcher", LOG_MODULE_DISPATCHER},
    {"bufferedlog", LOG_MODULE_BUFFEREDLOG},
};

const char* const kHelpLines[] = {
    "Kelvo daemon dumpsys help information\n",
    "command: dumpsys KelvoService [options]\n",
    "options:\n",
    "  --version    -v : show kelvod version\n",
    "  --help       -h : show this help information\n",
    "  --dump       -d : dump message for handlers and routines\n",
    "  --log        -l : log print control\n",
    "  --flush      -f : force flush database\n",
    "  --balance    -b : force balance\n",
    "  --discharge     : change charging status on/off\n",
};

const char kDumpPermission[] = "android.permission.DUMP";

bool isSwitchValue(const android::String8& value) {
    return value == "1" || value == "0";
}

}  // namespace

KelvoService::KelvoService(const android::sp<KelvoAgent>& agent) : mAgent(agent) {}

android::status_t KelvoService::publish(const android::sp<KelvoAgent>& agent) {
    return android::defaultServiceManager()->addService(android::String16(kServiceName),
                                                        new KelvoService(agent));
}

bool KelvoService::checkPermission() {
    uid_t uid = android::IPCThreadState::self()->getCallingUid();
    if (uid == kSystemUid) {
        return true;
    }
    KLOGE("Permission Denial: can't communicate with kelvo, uid=%d", static_cast<int32_t>(uid));
    HealthCounters::add(Health::ServiceRequestsRefused);
    return false;
}

bool KelvoService::isCollectionPath(const android::String8& path) {
    std::string text(path.string(), path.size());
    if (text.size() != strlen(text.c_str()) || text.rfind(kCollectionRoot, 0) != 0) {
        return false;
    }
    size_t start = 0;
    while (start <= text.size()) {
        size_t slash = text.find('/', start);
        size_t end = slash == std::string::npos ? text.size() : slash;
        if (text.compare(start, end - start, "..") == 0 && end - start == 2) {
            return false;
        }
        start = end + 1;
    }
    return true;
}

void KelvoService::requestQueryComponent(const android::Parcel& query) {
    if (checkPermission()) {
        mAgent->requestQuery(QueryService::QUERY_COMPONENT, query);
    }
}

void KelvoService::requestQueryApplications(const android::Parcel& query) {
    if (checkPermission()) {
        mAgent->requestQuery(QueryService::QUERY_APPLICATIONS, query);
    }
}

int32_t KelvoService::remoteDebugOpen(const android::String16& message) {
    if (!checkPermission()) {
        return -1;
    }
    android::String8 text(message);
    KLOGD("message=%s", text.string());
    mAgent->noteRemoteDebug(0, text);
    return 0;
}

int32_t KelvoService::remoteDebugCapture(const android::String16& path) {
    if (!checkPermission()) {
        return -1;
    }
    android::String8 text(path);
    KLOGD("path=%s", text.string());
    if (!isCollectionPath(text)) {
        KLOGE("Invalid path to store log");
        HealthCounters::add(Health::ServiceRequestsRefused);
        return -2;
    }
    mAgent->noteRemoteDebug(1, text);
    return 0;
}

int32_t KelvoService::remoteDebugClose() {
    if (!checkPermission()) {
        return -1;
    }
    mAgent->noteRemoteDebug(2, android::String8());
    return 0;
}

int32_t KelvoService::noteSamplingMessage(const android::String16& message,
                                          const android::String16& path) {
    if (!checkPermission()) {
        return -1;
    }
    android::String8 text(message);
    android::String8 where(path);
    KLOGD("message=%s, path=%s", text.string(), where.string());
    if (!isCollectionPath(where)) {
        KLOGE("Invalid path to store log");
        HealthCounters::add(Health::ServiceRequestsRefused);
        return -2;
    }
    std::string extra;
    if (PushMessage::parse(std::string(text.string(), text.size()), &extra) < 0) {
        KLOGE("Invalid push message");
        HealthCounters::add(Health::ServiceRequestsRefused);
        return -3;
    }
    mAgent->noteSamplingUpload(where, android::String8(extra.data(), extra.size()));
    return 0;
}

android::status_t KelvoService::dump(int fd, const android::Vector<android::String16>& args) {
    android::IPCThreadState* ipc = android::IPCThreadState::self();
    pid_t pid = ipc->getCallingPid();
    uid_t uid = ipc->getCallingUid();
    android::String8 out;
    if (uid != kShellUid &&
        !android::PermissionCache::checkPermission(android::String16(kDumpPermission), pid, uid)) {
        out.appendFormat("Permission Denial: cannot dump KELVO information from pid=%d, uid=%d\n",
                         static_cast<int32_t>(pid), static_cast<int32_t>(uid));
    } else {
        dumpOptions(args, out);
    }
    size_t written = 0;
    while (written < out.size()) {
        ssize_t n = write(fd, out.string() + written, out.size() - written);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            KLOGE("Failed to write to fd");
            return android::NO_ERROR;
        }
        written += static_cast<size_t>(n);
    }
    return android::NO_ERROR;
}

void KelvoService::dumpOptions(const android::Vector<android::String16>& args,
                               android::String8& out) {
    if (args.size() == 0) {
        return;
    }
    android::String8 option(args[0]);
    if (option == "--help" || option == "-h") {
        for (const char* line : kHelpLines) {
            out.append(line);
        }
    } else if (option == "--version" || option == "-v") {
        out.appendFormat("Kelvo Daemon (Version: %s)\n", KelvoAgent::kVersion);
    } else if (option == "--dump" || option == "-d") {
        mAgent->handleDump(out);
    } else if (option == "--log" || option == "-l") {
        if (args.size() < 3) {
            out.append("Usage: dumpsys KelvoService --log [module] [enable]\n");
        } else {
            switchLog(android::String8(args[1]), android::String8(args[2]), out);
        }
    } else if (option == "--flush" || option == "-f") {
        mAgent->forceFlushDatabase();
    } else if (option == "--balance" || option == "-b") {
        android::Parcel body;
        body.writeInt64(TimeProvider::getCurrentTime(TIME_TYPE_WALL));
        Notifier::getInstance()->sendNotification(NOTIFICATION_FORCE_BALANCE, body);
    } else if (option == "--discharge") {
        if (args.size() < 2) {
            out.append("Usage: dumpsys KelvoService --discharge [1/0]  1:discharge 0:charge\n");
        } else {
            switchCharge(android::String8(args[1]), out);
        }
    } else {
        out.appendFormat("Unknown argument: %s\n", option.string());
    }
}

void KelvoService::switchLog(const android::String8& module, const android::String8& enable,
                             android::String8& out) {
    if (!isSwitchValue(enable)) {
        out.append("Error: [enable] = {0, 1}\n");
        return;
    }
    bool on = enable == "1";
    if (module == "debug") {
        setLogDebugEnable(on);
        return;
    }
    if (module == "info") {
        setLogInfoEnable(on);
        return;
    }
    for (const log_module& entry : kLogModules) {
        if (module == entry.word) {
            setLogModuleEnable(entry.bits, on);
            return;
        }
    }
    out.append(
        "Error: [module] = {module, debug, info, audio, bluetooth, camera, cpu, display, "
        "flashlight, gnss, modem, sensor, wifi, dpm, system, thermal, storage, "
        "dispatcher, bufferedlog}\n");
}

void KelvoService::switchCharge(const android::String8& value, android::String8& out) {
    FILE* file = fopen(RootPath::resolve(kChargeSwitchPath).c_str(), "re");
    if (file == nullptr) {
        out.appendFormat("Error: Failed to open %s\n", kChargeSwitchPath);
        return;
    }
    char line[128] = {};
    bool read = fgets(line, sizeof(line), file) != nullptr;
    fclose(file);
    // Only "1" (discharging) or "0" (charging), and only when the switch
    // file says the same.
    if (!isSwitchValue(value) || !read || line[0] != value.string()[0]) {
        out.append("Error: wrong parameter or inconsistent with file\n");
        return;
    }
    android::Parcel body;
    body.writeInt64(TimeProvider::getCurrentTime(TIME_TYPE_WALL));
    body.writeBool(value != "1");
    Notifier::getInstance()->sendNotification(NOTIFICATION_CHARGER_ONLINE_CHANGED, body);
}

}  // namespace kelvo
