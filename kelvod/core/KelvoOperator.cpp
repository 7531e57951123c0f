#include "core/KelvoOperator.h"

#include "KelvoLog.h"

namespace kelvo {

KelvoOperator::KelvoOperator(const char* name, int32_t accounterType, uint32_t elector)
    : HandlerThread(name, 11), mAccounterType(accounterType), mElector(elector) {}

int32_t KelvoOperator::earlyInitialize() {
    setConfiguration();
    int32_t ret = checkEnable();
    if (ret < 0) {
        KLOGE("Check support failed, disable module: %d", mAccounterType);
        requestThreadExit();
        return -2;
    }
    return 0;
}

int32_t KelvoOperator::initialize() {
    return lateInitialize();
}

int32_t KelvoOperator::sendCustomizedMessage(int32_t code, const android::Parcel& data,
                                             android::Parcel* reply, bool sync) {
    if (!sync) {
        return sendMessage(ParcelMessage(MESSAGE_CUSTOMIZED, code, data));
    }
    if (reply == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    return sendMessageSync(ParcelMessage(MESSAGE_CUSTOMIZED, code, data, reply));
}

int32_t KelvoOperator::sendLoggerMessage(int32_t tag, const android::Parcel& data) {
    return sendMessage(ParcelMessage(MESSAGE_LOGGER, tag, data));
}

int32_t KelvoOperator::lateInitialize() {
    return 0;
}

void KelvoOperator::dump(android::String8& out) {}

int32_t KelvoOperator::setConfiguration() {
    return 0;
}

int32_t KelvoOperator::checkEnable() {
    return 0;
}

int32_t KelvoOperator::handleCustomized(int32_t code, const android::Parcel& data,
                                        android::Parcel* reply) {
    KLOGI("Please implement this function in subclass");
    return 0;
}

int32_t KelvoOperator::handleParcelMessage(const ParcelMessage& msg) {
    switch (msg.type) {
        case MESSAGE_CUSTOMIZED:
            return handleCustomized(msg.what, msg.getParcel(), msg.getReply());
        default:
            KLOGE("Unknown message type: %d", msg.type);
            return -3;
    }
}

} // namespace kelvo
