#include "core/NotifierHandler.h"

#include "KelvoLog.h"
#include "core/Notifier.h"

namespace kelvo {

NotifierHandler::NotifierHandler(Notifier* notifier)
    : HandlerThread("NotifierHandler", 11), mNotifier(notifier) {}

int32_t NotifierHandler::handleParcelMessage(const ParcelMessage& msg) {
    if (mNotifier == nullptr) {
        KLOGE("Invalid notifier");
        return -2;
    }
    if (msg.type != MESSAGE_NOTIFICATION) {
        KLOGE("Unknown message type: %d", msg.type);
        return -3;
    }
    return mNotifier->notifyAllListeners(msg.what, msg.getParcel());
}

} // namespace kelvo
