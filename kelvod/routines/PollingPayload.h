#pragma once

#include <stdint.h>

#include <binder/Parcel.h>

namespace kelvo {

// Reasons of the data-polling notification.
enum polling_reason : int32_t {
    POLLING_PERIODIC = 0,
    POLLING_BATTERY_LEVEL = 1,
    POLLING_HOURLY_TICK = 2,
    POLLING_TIME_CHANGED = 3,
    POLLING_THERMAL = 4,
    POLLING_FORCE_BALANCE = 5,
    POLLING_CHARGER = 6,
    POLLING_SHUT_DOWN = 7,
    POLLING_REASON_COUNT = 8,
};

// The data-polling notification: int32 reason, int64 time, then by reason
// int64 round hour (2), int64 new time (3) or bool online (6). One writer
// and one reader, so senders and listeners cannot disagree on the layout.
struct PollingPayload {
    int32_t reason = POLLING_PERIODIC;
    // Reason 3: the time before the change; otherwise when the poll was asked.
    int64_t time = 0;
    int64_t hour = 0;    // reason 2
    int64_t newTime = 0; // reason 3: the clock after the change
    bool online = false; // reason 6

    void writeTo(android::Parcel& out) const;
    // Reads from the parcel's current position; -5 for an unknown reason or
    // a short parcel (nothing usable is returned then).
    static int32_t readFrom(const android::Parcel& in, PollingPayload* out);
};

} // namespace kelvo
