#include "routines/PollingPayload.h"

namespace kelvo {

void PollingPayload::writeTo(android::Parcel& out) const {
    out.writeInt32(reason);
    out.writeInt64(time);
    switch (reason) {
        case POLLING_HOURLY_TICK:
            out.writeInt64(hour);
            break;
        case POLLING_TIME_CHANGED:
            out.writeInt64(newTime);
            break;
        case POLLING_CHARGER:
            out.writeBool(online);
            break;
        default:
            break;
    }
}

int32_t PollingPayload::readFrom(const android::Parcel& in, PollingPayload* out) {
    PollingPayload got;
    if (out == nullptr || in.readInt32(&got.reason) != android::NO_ERROR ||
        got.reason < 0 || got.reason >= POLLING_REASON_COUNT ||
        in.readInt64(&got.time) != android::NO_ERROR) {
        return -5;
    }
    android::status_t status = android::NO_ERROR;
    switch (got.reason) {
        case POLLING_HOURLY_TICK:
            status = in.readInt64(&got.hour);
            break;
        case POLLING_TIME_CHANGED:
            status = in.readInt64(&got.newTime);
            break;
        case POLLING_CHARGER:
            status = in.readBool(&got.online);
            break;
        default:
            break;
    }
    if (status != android::NO_ERROR) {
        return -5;
    }
    *out = got;
    return 0;
}

} // namespace kelvo
