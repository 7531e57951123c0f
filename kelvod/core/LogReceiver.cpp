#include "core/LogReceiver.h"

#include <cstring>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "utils/TimeProvider.h"

namespace kelvo {

int32_t LogReceiver::onLogReceived(const android::String8& name, const uint8_t* entry,
                                   size_t size) {
    int32_t length = -1;
    int32_t magic = 0;
    if (entry != nullptr && size >= 8) {
        memcpy(&length, entry, sizeof(length));
        memcpy(&magic, entry + 4, sizeof(magic));
    }
    // The data must be all there: never read past what arrived.
    android::sp<HandlerThread> handler = mHandler.promote();
    if (length < 0 || static_cast<size_t>(length) > size - 8 || handler == nullptr) {
        HealthCounters::add(Health::BufferedEntryRefused);
        KLOGE("Invalid parameter");
        return -5;
    }
    android::Parcel body;
    body.writeInt64(TimeProvider::getCurrentTime(TIME_TYPE_WALL));
    body.writeString8(name);
    body.writeInt32(magic);
    body.writeInt32(length);
    body.write(entry + 8, static_cast<size_t>(length));
    int32_t id = handler->sendMessage(ParcelMessage(MESSAGE_BUFFERED_LOG, body));
    return id < 0 ? id : 0;
}

} // namespace kelvo
