#include "binder/managers/ParcelReader.h"

namespace kelvo {

bool countFits(const android::Parcel& parcel, int32_t count, size_t minBytes) {
    return count >= 0 && static_cast<size_t>(count) <= parcel.dataAvail() / minBytes;
}

bool readString16Array(const android::Parcel& parcel, std::vector<android::String16>& out) {
    int32_t count = 0;
    if (parcel.readInt32(&count) != android::NO_ERROR) {
        return false;
    }
    if (count == -1) {
        return true;
    }
    // Each string takes at least its length word.
    if (!countFits(parcel, count, sizeof(int32_t))) {
        return false;
    }
    for (int32_t i = 0; i < count; ++i) {
        android::String16 value;
        if (parcel.readString16(&value) != android::NO_ERROR) {
            return false;
        }
        out.push_back(value);
    }
    return true;
}

} // namespace kelvo
