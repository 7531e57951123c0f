#pragma once

// A proxy to an object of another process (or to a service of this one,
// reached through its socket). Proxies are unique: the same remote object
// always gives the same BpBinder while one is held.

#include <binder/IBinder.h>
#include <stdint.h>

#include <memory>
#include <mutex>
#include <vector>

namespace kelvo {
class BinderPeer;
class DeathNotifier;
} // namespace kelvo

namespace android {

class BpBinder : public IBinder {
public:
    const String16& getInterfaceDescriptor() const override;
    bool isBinderAlive() const override;
    status_t pingBinder() override;
    status_t dump(int fd, const Vector<String16>& args) override;

    // DEAD_OBJECT at once when the object's process is gone (or goes while
    // the call waits); otherwise the status the remote onTransact returned.
    status_t transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags = 0) override;

    status_t linkToDeath(const sp<DeathRecipient>& recipient, void* cookie = nullptr,
                         uint32_t flags = 0) override;
    status_t unlinkToDeath(const wp<DeathRecipient>& recipient, void* cookie = nullptr,
                           uint32_t flags = 0, wp<DeathRecipient>* outRecipient = nullptr) override;

    BpBinder* remoteBinder() override;

    // Where the object lives: the socket's name below <root>/dev/binder, the
    // socket's incarnation and the object's id there (0: the socket's own
    // object).
    const std::string& endpointName() const;
    uint64_t endpointIncarnation() const;
    uint64_t objectId() const { return mObjectId; }

private:
    friend class kelvo::BinderPeer;
    friend class kelvo::DeathNotifier;

    struct Obituary {
        wp<DeathRecipient> recipient;
        void* cookie;
        uint32_t flags;
    };

    BpBinder(const std::shared_ptr<kelvo::BinderPeer>& peer, uint64_t objectId);
    ~BpBinder() override;

    // Calls every linked recipient once (death thread).
    void sendObituary();

    const std::shared_ptr<kelvo::BinderPeer> mPeer;
    const uint64_t mObjectId;

    mutable std::mutex mLock;
    mutable bool mDescriptorKnown;
    mutable String16 mDescriptor;
    std::vector<Obituary> mObituaries;
    bool mObitsSent;
};

} // namespace android
