#pragma once

#include <stdint.h>

namespace android {
class Parcel;
}

namespace kelvo {

// Takes an online copy of the live database. The parcel holds one C string:
// the host path of the copy. 0 on success, negative otherwise.
class DatabaseCopier {
public:
    virtual ~DatabaseCopier() = default;
    virtual int32_t doBackupCopy(const android::Parcel& data) = 0;
};

} // namespace kelvo
