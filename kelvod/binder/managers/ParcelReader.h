#pragma once

#include <binder/Parcel.h>
#include <utils/String16.h>

#include <vector>

namespace kelvo {

// Reads an int32 count (-1: none) and that many String16 values from a
// parcel another process wrote. A count larger than the bytes left could
// hold is refused; reading stops at the first failed value. False when the
// array was not read whole (out keeps what was read).
bool readString16Array(const android::Parcel& parcel, std::vector<android::String16>& out);

// True when count entries of at least minBytes each can still be in the
// parcel.
bool countFits(const android::Parcel& parcel, int32_t count, size_t minBytes);

} // namespace kelvo
