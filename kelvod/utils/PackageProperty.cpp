#include "utils/PackageProperty.h"

#include <string.h>

#include <algorithm>

#include "KelvoLog.h"
#include "binder/managers/ActivityManager.h"
#include "binder/managers/PackageManager.h"
#include "core/KelvoAgent.h"

namespace kelvo {

PackageProperty* PackageProperty::getInstance() {
    static std::mutex lock;
    static PackageProperty* instance = nullptr;
    std::lock_guard<std::mutex> guard(lock);
    if (instance == nullptr) {
        instance = new PackageProperty();
    }
    return instance;
}

int32_t PackageProperty::getPackageStrategy(const android::String8& name) {
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (mStrategiesLoaded) {
            auto it = mStrategies.find(name.string());
            return it != mStrategies.end() ? it->second : 0;
        }
        if (mStrategiesFailed) {
            return -17;
        }
    }
    // Loaded once, outside the lock: the query waits for the storage thread.
    // An empty table is a loaded one; a failed load is logged once and not
    // tried again until the strategies are cleared.
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(android::String8("SELECT name, type FROM raw_pelmora_strategy"), &reply,
                           2, rows) < 0) {
        bool first;
        {
            std::lock_guard<std::mutex> guard(mLock);
            first = !mStrategiesFailed;
            mStrategiesFailed = true;
        }
        if (first) {
            KLOGE("Failed to query package strategy");
        }
        return -17;
    }
    std::lock_guard<std::mutex> guard(mLock);
    if (!mStrategiesLoaded) {
        for (int32_t i = 0; i < rows; ++i) {
            android::String8 package;
            int64_t type = 0;
            if (reply.readString8(&package) != android::NO_ERROR ||
                reply.readInt64(&type) != android::NO_ERROR) {
                break;
            }
            mStrategies.emplace(package.string(), static_cast<int32_t>(type));
        }
        mStrategiesLoaded = true;
    }
    auto it = mStrategies.find(name.string());
    return it != mStrategies.end() ? it->second : 0;
}

void PackageProperty::clearPackageStrategy() {
    std::lock_guard<std::mutex> guard(mLock);
    mStrategies.clear();
    mStrategiesLoaded = false;
    mStrategiesFailed = false;
}

void PackageProperty::addPackageType(const android::Parcel& records) {
    std::lock_guard<std::mutex> guard(mLock);
    while (records.dataAvail() > 0) {
        int64_t unused = 0;
        android::String8 name;
        int64_t type = 0;
        if (records.readInt64(&unused) != android::NO_ERROR ||
            records.readString8(&name) != android::NO_ERROR ||
            records.readInt64(&type) != android::NO_ERROR) {
            break;
        }
        if (mTypes.emplace(name.string(), static_cast<int32_t>(type)).second) {
            KLOGD("name: %s, type: %lld", name.string(), static_cast<long long>(type));
        }
    }
}

int32_t PackageProperty::getPackageType(const android::String8& name) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mTypes.find(name.string());
    return it != mTypes.end() ? it->second : 0;
}

} // namespace kelvo

namespace kelvo {

namespace {

struct WellKnownUid {
    int32_t uid;
    const char* name;
};

// The platform's fixed ids, searched in this order.
constexpr WellKnownUid kWellKnownUids[] = {
    {0, "root"},          {1000, "system"},
    {1001, "radio"},      {1002, "bluetooth"},
    {1003, "graphics"},   {1004, "input"},
    {1005, "audio"},      {1006, "camera"},
    {1007, "log"},        {1008, "compass"},
    {1009, "mount"},      {1010, "wifi"},
    {1014, "dhcp"},       {1011, "adb"},
    {1012, "install"},    {1013, "media"},
    {1015, "sdcard_rw"},  {1016, "vpn"},
    {1017, "keystore"},   {1020, "MulticastDNSResponder"},
    {1021, "gps"},        {1036, "logd"},
    {1038, "dbus-daemon"}, {1040, "mediaextractor"},
    {1041, "audioserver"}, {1042, "metrics_collector"},
    {1043, "metricsd"},   {1044, "webservd"},
    {1046, "mediacodec"}, {1047, "cameraserver"},
    {1048, "firewalld"},  {1049, "trunksd"},
    {1051, "netd"},       {1052, "dnsmasq"},
    {1053, "WebView zygote"}, {2000, "shell"},
    {2001, "cache"},      {2002, "diag"},
    {3001, "net_bt_admin"}, {3002, "net_bt"},
    {3003, "inet"},       {3004, "net_raw"},
    {3005, "net_admin"},  {9998, "misc"},
    {9999, "nobody"},
};
static_assert(sizeof(kWellKnownUids) / sizeof(kWellKnownUids[0]) == 45, "45 fixed uids");

bool contains(const std::vector<android::String8>& names, const android::String8& name) {
    for (const android::String8& entry : names) {
        if (entry == name) {
            return true;
        }
    }
    return false;
}

} // namespace

const char* PackageProperty::wellKnownUidName(int32_t uid) {
    for (const WellKnownUid& entry : kWellKnownUids) {
        if (entry.uid == uid) {
            return entry.name;
        }
    }
    return nullptr;
}

void PackageProperty::combineName(std::vector<android::String8> names, android::String8& out) {
    out.clear();
    if (names.empty()) {
        return;
    }
    std::sort(names.begin(), names.end(), [](const android::String8& a, const android::String8& b) {
        return strcmp(a.string(), b.string()) < 0;
    });
    std::string text = names[0].string();
    for (size_t i = 1; i < names.size() && i < 3; ++i) {
        if (text.find(names[i].string()) == std::string::npos) {
            text += "|";
            text += names[i].string();
        }
    }
    if (names.size() > 3) {
        text += "|more...";
    }
    out = android::String8(text.c_str());
}

int32_t PackageProperty::queryPackagesByUid(int32_t uid, std::vector<android::String8>& out) {
    if (uid < 0) {
        KLOGE("Invalid parameter");
        return -5;
    }
    {
        std::lock_guard<std::mutex> guard(mLock);
        auto it = mPackagesOfUid.find(uid);
        if (it != mPackagesOfUid.end()) {
            out = it->second;
            return 0;
        }
    }
    // The package service is asked without the property lock: a service
    // that hangs must not stall every other lookup.
    std::vector<android::String8> packages;
    int32_t ret = PackageManager::getInstance()->getPackagesForUid(uid, packages);
    if (ret != 0) {
        KLOGE("Failed to get packages from package manager: %d", ret);
        return -2;
    }
    std::lock_guard<std::mutex> guard(mLock);
    if (!packages.empty()) {
        // Another caller may have filled the entry meanwhile: keep one list.
        std::vector<android::String8>& cached = mPackagesOfUid[uid];
        for (const android::String8& name : packages) {
            if (!contains(cached, name)) {
                cached.push_back(name);
            }
            mUidOfPackage[name.string()] = uid;
        }
        out = cached;
    } else {
        out.clear();
    }
    return 0;
}

int32_t PackageProperty::queryPackageByUid(int32_t uid, android::String8& out) {
    std::vector<android::String8> packages;
    queryPackagesByUid(uid, packages);
    if (packages.size() == 1) {
        out = packages[0];
        return 0;
    }
    const char* known = wellKnownUidName(uid);
    if (known != nullptr) {
        out = android::String8(known);
        return 0;
    }
    if (packages.empty()) {
        return -4;
    }
    combineName(packages, out);
    return 0;
}

int32_t PackageProperty::queryPackageByUidAndPid(int32_t uid, int32_t pid, android::String8& out) {
    std::vector<android::String8> packages;
    int32_t ret = queryPackagesByUid(uid, packages);
    if (ret != 0) {
        KLOGE("Failed to get packages by uid=%d, ret: %d", uid, ret);
        return -2;
    }
    if (packages.size() == 1) {
        out = packages[0];
        return 0;
    }
    android::sp<KelvoAgent> agent = KelvoAgent::getInstance();
    if (agent != nullptr) {
        android::Parcel data;
        android::Parcel reply;
        data.writeInt32(uid);
        data.writeInt32(pid);
        if (agent->sendToHandler(HANDLER_CPU, 0, data, &reply, true) == 0 &&
            reply.dataSize() > 0) {
            reply.setDataPosition(0);
            android::String8 name;
            if (reply.readString8(&name) == android::NO_ERROR && name.length() > 0) {
                out = name;
                return 0;
            }
        }
    }
    std::vector<android::String8> pidPackages;
    if (ActivityManager::getInstance()->getPackagesForPid(uid, pid, pidPackages) == 0 &&
        !pidPackages.empty()) {
        combineName(pidPackages, out);
        return 0;
    }
    const char* known = wellKnownUidName(uid);
    if (known != nullptr) {
        out = android::String8(known);
        return 0;
    }
    if (packages.empty()) {
        return -4;
    }
    combineName(packages, out);
    return 0;
}

int32_t PackageProperty::addPackage(int32_t uid, const android::String8& name) {
    if (uid < 0) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    // Only an existing entry grows: a new one would hold this one package
    // and hide the others of a shared uid from later lookups.
    auto it = mPackagesOfUid.find(uid);
    if (it != mPackagesOfUid.end() && !contains(it->second, name)) {
        it->second.push_back(name);
    }
    mUidOfPackage[name.string()] = uid;
    return 0;
}

int32_t PackageProperty::removePackage(int32_t uid, const android::String8& name) {
    if (uid < 0) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mPackagesOfUid.find(uid);
    if (it != mPackagesOfUid.end() && contains(it->second, name)) {
        mPackagesOfUid.erase(it);
        KLOGD("remove uid=%d name=%s", uid, name.string());
    }
    mUidOfPackage.erase(name.string());
    return 0;
}

int32_t PackageProperty::removeUid(int32_t uid) {
    if (uid < 0) {
        KLOGE("Invalid parameter");
        return -5;
    }
    std::lock_guard<std::mutex> guard(mLock);
    mPackagesOfUid.erase(uid);
    KLOGD("remove uid=%d", uid);
    return 0;
}

void PackageProperty::removePackageType(const android::Parcel& records) {
    std::lock_guard<std::mutex> guard(mLock);
    while (records.dataAvail() > 0) {
        android::String8 name;
        if (records.readString8(&name) != android::NO_ERROR) {
            break;
        }
        if (mTypes.erase(name.string()) > 0) {
            KLOGD("name: %s", name.string());
        }
    }
}

} // namespace kelvo
