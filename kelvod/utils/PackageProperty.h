#pragma once

#include <stdint.h>

#include <map>
#include <mutex>
#include <string>
#include <vector>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "storage/StorageOperator.h"

namespace kelvo {

// Readable package names for statistics, with their caches: packages by uid,
// the power-management strategy of each package (loaded once from the
// database) and the application type of each package (from application-type
// events).
class PackageProperty : public StorageOperator {
public:
    static PackageProperty* getInstance();

    // The uid's packages, from the cache or the package service: 0, -5 for
    // a negative uid, -2 when the package service fails.
    int32_t queryPackagesByUid(int32_t uid, std::vector<android::String8>& out);
    // One readable name for the uid: its only package, its well-known name,
    // or its packages combined; -4 when there is nothing.
    int32_t queryPackageByUid(int32_t uid, android::String8& out);
    // One readable name for a process: its uid's only package, the CPU
    // handler's answer, the activity manager's packages of the pid, the
    // well-known uid name, the uid's packages combined; -4 when there is
    // nothing, -2 when the package service fails.
    int32_t queryPackageByUidAndPid(int32_t uid, int32_t pid, android::String8& out);
    // Sorted names: the first, then the second and third unless the text
    // already holds them, then "more..." when there are more than three.
    static void combineName(std::vector<android::String8> names, android::String8& out);
    // The platform's name of a fixed uid, or nullptr.
    static const char* wellKnownUidName(int32_t uid);

    int32_t addPackage(int32_t uid, const android::String8& name);
    int32_t removePackage(int32_t uid, const android::String8& name);
    int32_t removeUid(int32_t uid);

    // The package's strategy type, or 0; -17 when the strategies cannot be
    // loaded. They are loaded once (a failure logged once) until cleared.
    int32_t getPackageStrategy(const android::String8& name);
    void clearPackageStrategy();
    // Records of (int64 unused, String8 name, int64 type) until the parcel
    // ends; the first type of a name wins.
    void addPackageType(const android::Parcel& records);
    // The recorded application type, or 0.
    int32_t getPackageType(const android::String8& name);
    // Records of one String8 name each, removed when present.
    void removePackageType(const android::Parcel& records);

private:
    PackageProperty() = default;

    std::mutex mLock;
    std::map<int32_t, std::vector<android::String8>> mPackagesOfUid;
    std::map<std::string, int32_t> mUidOfPackage;
    std::map<std::string, int32_t> mStrategies;
    bool mStrategiesLoaded = false;
    bool mStrategiesFailed = false;
    std::map<std::string, int32_t> mTypes;
};

} // namespace kelvo
