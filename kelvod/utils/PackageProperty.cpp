#include "utils/PackageProperty.h"

#include "KelvoLog.h"

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
        if (!mStrategies.empty()) {
            auto it = mStrategies.find(name.string());
            return it != mStrategies.end() ? it->second : 0;
        }
    }
    // Loaded outside the lock: the query waits for the storage thread.
    android::Parcel reply;
    int32_t rows = 0;
    if (queryEntriesSimple(android::String8("SELECT name, type FROM raw_pelmora_strategy"), &reply,
                           2, rows) < 0) {
        KLOGE("Failed to query package strategy");
        return -17;
    }
    std::lock_guard<std::mutex> guard(mLock);
    for (int32_t i = 0; i < rows; ++i) {
        android::String8 package;
        int64_t type = 0;
        if (reply.readString8(&package) != android::NO_ERROR ||
            reply.readInt64(&type) != android::NO_ERROR) {
            break;
        }
        mStrategies.emplace(package.string(), static_cast<int32_t>(type));
    }
    auto it = mStrategies.find(name.string());
    return it != mStrategies.end() ? it->second : 0;
}

void PackageProperty::clearPackageStrategy() {
    std::lock_guard<std::mutex> guard(mLock);
    mStrategies.clear();
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
