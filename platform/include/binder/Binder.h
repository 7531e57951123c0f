#pragma once

// A local binder object. Subclasses answer their codes in onTransact; the
// built-in ping, interface-descriptor and dump transactions are answered here.

#include <binder/IBinder.h>

namespace android {

class BBinder : public IBinder {
public:
    BBinder();

    // Empty unless a subclass (BnInterface) names its interface.
    const String16& getInterfaceDescriptor() const override;
    bool isBinderAlive() const override;
    status_t pingBinder() override;
    status_t dump(int fd, const Vector<String16>& args) override;

    // Rewinds data, runs onTransact and rewinds the reply.
    status_t transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags = 0) final;

    status_t linkToDeath(const sp<DeathRecipient>& recipient, void* cookie = nullptr,
                         uint32_t flags = 0) override;
    status_t unlinkToDeath(const wp<DeathRecipient>& recipient, void* cookie = nullptr,
                           uint32_t flags = 0, wp<DeathRecipient>* outRecipient = nullptr) override;

    BBinder* localBinder() override;

protected:
    ~BBinder() override;

    // INTERFACE_TRANSACTION writes the descriptor; DUMP_TRANSACTION reads a
    // descriptor, an int32 count and that many String16 arguments and calls
    // dump(); anything else is UNKNOWN_TRANSACTION.
    virtual status_t onTransact(uint32_t code, const Parcel& data, Parcel* reply,
                                uint32_t flags = 0);
};

} // namespace android
