#pragma once

#include <binder/Parcel.h>

#include <vector>

#include "binder/managers/BaseManager.h"

namespace kelvo {

// Client of the "package" service: packages of a uid and package versions.
class PackageManager : public BaseManager {
public:
    static PackageManager* getInstance();

    // Appends the uid's non-empty package names to out: 0, -8 without the
    // service, -12 for a failed answer.
    int32_t getPackagesForUid(int32_t uid, std::vector<android::String8>& out);
    // Writes int32 version code and String16 version name to out: 0, -8, -12.
    int32_t getPackageVersion(const android::String8& name, android::Parcel* out);

    void onServiceDied() override;
    void setBinderId() override;

private:
    PackageManager();

    uint32_t mPackageInfoCode;
    uint32_t mPackagesForUidCode;
};

} // namespace kelvo
