#include <binder/Binder.h>
#include <binder/Parcel.h>

namespace android {

namespace {

const String16& emptyDescriptor() {
    static const String16* empty = new String16();
    return *empty;
}

} // namespace

BBinder::BBinder() {}

BBinder::~BBinder() {}

const String16& BBinder::getInterfaceDescriptor() const {
    return emptyDescriptor();
}

bool BBinder::isBinderAlive() const {
    return true;
}

status_t BBinder::pingBinder() {
    return NO_ERROR;
}

status_t BBinder::dump(int fd, const Vector<String16>& args) {
    return NO_ERROR;
}

status_t BBinder::transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags) {
    data.setDataPosition(0);
    status_t err;
    if (code == PING_TRANSACTION) {
        err = pingBinder();
    } else {
        err = onTransact(code, data, reply, flags);
    }
    if (reply != nullptr) {
        reply->setDataPosition(0);
    }
    return err;
}

status_t BBinder::linkToDeath(const sp<DeathRecipient>& recipient, void* cookie, uint32_t flags) {
    return INVALID_OPERATION;
}

status_t BBinder::unlinkToDeath(const wp<DeathRecipient>& recipient, void* cookie, uint32_t flags,
                                wp<DeathRecipient>* outRecipient) {
    return INVALID_OPERATION;
}

BBinder* BBinder::localBinder() {
    return this;
}

status_t BBinder::onTransact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags) {
    switch (code) {
        case INTERFACE_TRANSACTION:
            if (reply == nullptr) {
                return BAD_VALUE;
            }
            return reply->writeString16(getInterfaceDescriptor());
        case DUMP_TRANSACTION: {
            int fd = data.readFileDescriptor();
            if (fd < 0) {
                return BAD_VALUE;
            }
            int32_t argc = 0;
            if (data.readInt32(&argc) != NO_ERROR || argc < 0) {
                return BAD_VALUE;
            }
            // Each argument takes at least four bytes: a count beyond what is
            // left is a lie, and the loop ends at the first bad string.
            if (static_cast<size_t>(argc) > data.dataAvail() / 4) {
                return BAD_VALUE;
            }
            Vector<String16> args;
            for (int32_t i = 0; i < argc; ++i) {
                String16 arg;
                if (data.readString16(&arg) != NO_ERROR) {
                    return BAD_VALUE;
                }
                args.add(arg);
            }
            return dump(fd, args);
        }
        default:
            return UNKNOWN_TRANSACTION;
    }
}

} // namespace android
