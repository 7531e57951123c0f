#pragma once

#include <stdint.h>

#include <binder/Parcel.h>

namespace kelvo {

// The accounting library's entry surface. Everything crosses it in parcels.

// Starts the library with the daemon's start time (wall clock, ms).
void startLibrary(int64_t systemBootTime);

// Runs one database action (sql_action) on the library's one SQL connection.
// Only the storage thread calls it. Negative on failure.
int32_t doSqliteOperation(int32_t action, const android::Parcel* in, android::Parcel* out);

} // namespace kelvo
