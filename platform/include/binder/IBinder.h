#pragma once

// The binder object interface: a local object (BBinder) or a proxy to an
// object of another process (BpBinder). Transactions carry a code, a data
// parcel and flags, and answer with a status and a reply parcel.

#include <stdint.h>
#include <sys/types.h>
#include <utils/Errors.h>
#include <utils/RefBase.h>
#include <utils/String16.h>
#include <utils/Vector.h>

namespace android {

class BBinder;
class BpBinder;
class IInterface;
class Parcel;

#define B_PACK_CHARS(c1, c2, c3, c4)                                         \
    ((static_cast<uint32_t>(c1) << 24) | (static_cast<uint32_t>(c2) << 16) | \
     (static_cast<uint32_t>(c3) << 8) | static_cast<uint32_t>(c4))

class IBinder : public virtual RefBase {
public:
    enum : uint32_t {
        FIRST_CALL_TRANSACTION = 0x00000001,
        LAST_CALL_TRANSACTION = 0x00ffffff,

        // Built in, answered by every object.
        PING_TRANSACTION = B_PACK_CHARS('_', 'P', 'N', 'G'),
        DUMP_TRANSACTION = B_PACK_CHARS('_', 'D', 'M', 'P'),
        INTERFACE_TRANSACTION = B_PACK_CHARS('_', 'N', 'T', 'F'),

        // The caller does not wait: no reply, and calls to one object are
        // delivered in order, one at a time.
        FLAG_ONEWAY = 0x00000001,
    };

    IBinder();

    // The interface object when this binder implements descriptor locally.
    virtual sp<IInterface> queryLocalInterface(const String16& descriptor);

    // For a proxy: the descriptor the remote object reports (asked once,
    // then kept); empty when the remote cannot be reached.
    virtual const String16& getInterfaceDescriptor() const = 0;

    virtual bool isBinderAlive() const = 0;
    virtual status_t pingBinder() = 0;
    virtual status_t dump(int fd, const Vector<String16>& args) = 0;

    virtual status_t transact(uint32_t code, const Parcel& data, Parcel* reply,
                              uint32_t flags = 0) = 0;

    // Told when the object's process dies. It runs on a thread of its own,
    // never inside a caller's transact, at most once per link.
    class DeathRecipient : public virtual RefBase {
    public:
        virtual void binderDied(const wp<IBinder>& who) = 0;
    };

    // The recipient is held weakly: keep it alive while linked. Local objects
    // never die and answer INVALID_OPERATION; an already dead proxy answers
    // DEAD_OBJECT.
    virtual status_t linkToDeath(const sp<DeathRecipient>& recipient, void* cookie = nullptr,
                                 uint32_t flags = 0) = 0;
    virtual status_t unlinkToDeath(const wp<DeathRecipient>& recipient, void* cookie = nullptr,
                                   uint32_t flags = 0,
                                   wp<DeathRecipient>* outRecipient = nullptr) = 0;

    virtual bool checkSubclass(const void* subclassID) const;

    virtual BBinder* localBinder();
    virtual BpBinder* remoteBinder();

protected:
    virtual ~IBinder();
};

} // namespace android
