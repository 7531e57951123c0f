#include <binder/BpBinder.h>
#include <binder/Parcel.h>

#include "BinderPeer.h"

namespace android {

namespace {

const String16& emptyDescriptor() {
    static const String16* empty = new String16();
    return *empty;
}

} // namespace

BpBinder::BpBinder(const std::shared_ptr<kelvo::BinderPeer>& peer, uint64_t objectId)
    : mPeer(peer), mObjectId(objectId), mDescriptorKnown(false), mObitsSent(false) {}

BpBinder::~BpBinder() {
    mPeer->forgetProxy(mObjectId, this);
}

BpBinder* BpBinder::remoteBinder() {
    return this;
}

const std::string& BpBinder::endpointName() const {
    return mPeer->name();
}

uint64_t BpBinder::endpointIncarnation() const {
    return mPeer->incarnation();
}

const String16& BpBinder::getInterfaceDescriptor() const {
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (mDescriptorKnown) {
            return mDescriptor;
        }
    }
    Parcel data;
    Parcel reply;
    status_t err = const_cast<BpBinder*>(this)->transact(INTERFACE_TRANSACTION, data, &reply);
    if (err != NO_ERROR) {
        return emptyDescriptor();
    }
    String16 descriptor;
    if (reply.readString16(&descriptor) != NO_ERROR) {
        return emptyDescriptor();
    }
    std::lock_guard<std::mutex> guard(mLock);
    if (!mDescriptorKnown) {
        // Set once and never changed: the reference stays good.
        mDescriptor = descriptor;
        mDescriptorKnown = true;
    }
    return mDescriptor;
}

bool BpBinder::isBinderAlive() const {
    return mPeer->isAlive();
}

status_t BpBinder::pingBinder() {
    Parcel data;
    Parcel reply;
    return transact(PING_TRANSACTION, data, &reply);
}

status_t BpBinder::dump(int fd, const Vector<String16>& args) {
    Parcel data;
    status_t err = data.writeFileDescriptor(fd);
    if (err != NO_ERROR) {
        return err;
    }
    data.writeInt32(static_cast<int32_t>(args.size()));
    for (size_t i = 0; i < args.size(); ++i) {
        data.writeString16(args[i]);
    }
    Parcel reply;
    return transact(DUMP_TRANSACTION, data, &reply);
}

status_t BpBinder::transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags) {
    return mPeer->transact(mObjectId, code, data, reply, flags);
}

status_t BpBinder::linkToDeath(const sp<DeathRecipient>& recipient, void* cookie, uint32_t flags) {
    if (recipient == nullptr) {
        return BAD_VALUE;
    }
    status_t err = mPeer->watch();
    if (err != NO_ERROR) {
        return err == DEAD_OBJECT ? DEAD_OBJECT : err;
    }
    std::lock_guard<std::mutex> guard(mLock);
    if (mObitsSent) {
        return DEAD_OBJECT;
    }
    mObituaries.push_back({recipient, cookie, flags});
    return NO_ERROR;
}

status_t BpBinder::unlinkToDeath(const wp<DeathRecipient>& recipient, void* cookie, uint32_t flags,
                                 wp<DeathRecipient>* outRecipient) {
    std::lock_guard<std::mutex> guard(mLock);
    if (mObitsSent) {
        return DEAD_OBJECT;
    }
    for (auto it = mObituaries.begin(); it != mObituaries.end(); ++it) {
        if ((it->recipient == recipient || (recipient == nullptr && outRecipient != nullptr)) &&
            it->cookie == cookie) {
            if (outRecipient != nullptr) {
                *outRecipient = it->recipient;
            }
            mObituaries.erase(it);
            return NO_ERROR;
        }
    }
    return NAME_NOT_FOUND;
}

void BpBinder::sendObituary() {
    std::vector<Obituary> obituaries;
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (mObitsSent) {
            return;
        }
        mObitsSent = true;
        obituaries.swap(mObituaries);
    }
    wp<IBinder> who(this);
    for (const Obituary& ob : obituaries) {
        sp<DeathRecipient> recipient = ob.recipient.promote();
        if (recipient != nullptr) {
            recipient->binderDied(who);
        }
    }
}

} // namespace android
