#pragma once

#include <stdint.h>

#include <map>
#include <mutex>
#include <string>

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

    // The package's strategy type, or 0; -17 when the strategies cannot be
    // loaded.
    int32_t getPackageStrategy(const android::String8& name);
    void clearPackageStrategy();
    // Records of (int64 unused, String8 name, int64 type) until the parcel
    // ends; the first type of a name wins.
    void addPackageType(const android::Parcel& records);
    // The recorded application type, or 0.
    int32_t getPackageType(const android::String8& name);

private:
    PackageProperty() = default;

    std::mutex mLock;
    std::map<std::string, int32_t> mStrategies;
    std::map<std::string, int32_t> mTypes;
};

} // namespace kelvo
