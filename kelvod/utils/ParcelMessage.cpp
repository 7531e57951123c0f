#include "utils/ParcelMessage.h"

namespace kelvo {

ParcelMessage::ParcelMessage() : type(-1), what(-1), reply(nullptr) {}

ParcelMessage::ParcelMessage(const android::Parcel& parcel) : ParcelMessage() {
    fill(parcel);
}

ParcelMessage::ParcelMessage(int32_t type, int32_t what) : type(type), what(what), reply(nullptr) {}

ParcelMessage::ParcelMessage(int32_t type, const android::Parcel& parcel)
    : type(type), what(-1), reply(nullptr) {
    fill(parcel);
}

ParcelMessage::ParcelMessage(int32_t type, int32_t what, const android::Parcel& parcel)
    : type(type), what(what), reply(nullptr) {
    fill(parcel);
}

ParcelMessage::ParcelMessage(int32_t type, int32_t what, const android::Parcel& parcel,
                             android::Parcel* reply)
    : type(type), what(what), reply(reply) {
    fill(parcel);
}

ParcelMessage::ParcelMessage(const ParcelMessage& other)
    : type(other.type), what(other.what), reply(other.reply) {
    fill(other.data);
}

ParcelMessage& ParcelMessage::operator=(const ParcelMessage& other) {
    if (this != &other) {
        type = other.type;
        what = other.what;
        reply = other.reply;
        data.freeData();
        fill(other.data);
    }
    return *this;
}

void ParcelMessage::fill(const android::Parcel& parcel) {
    if (parcel.dataSize() > 0) {
        data.appendFrom(&parcel, 0, parcel.dataSize());
    }
    data.setDataPosition(0);
}

} // namespace kelvo
