#pragma once

#include <binder/IInterface.h>
#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/String16.h>

namespace kelvo {

// The daemon's binder interface: energy queries answered later through the
// caller's IKelvoListener, remote debugging and sampled uploads of the
// database files.
class IKelvoService : public android::IInterface {
public:
    DECLARE_META_INTERFACE(KelvoService)

    enum : uint32_t {
        REQUEST_QUERY_COMPONENT = 1,
        REQUEST_QUERY_APPLICATIONS = 2,
        REMOTE_DEBUG_OPEN = 1011,
        REMOTE_DEBUG_CAPTURE = 1012,
        REMOTE_DEBUG_CLOSE = 1013,
        NOTE_SAMPLING_MESSAGE = 1121,
    };

    // The query is the whole request after the interface token: its fields,
    // then optionally the listener binder. Nothing is replied.
    virtual void requestQueryComponent(const android::Parcel& query) = 0;
    virtual void requestQueryApplications(const android::Parcel& query) = 0;
    // Each replies no exception and its int32 result.
    virtual int32_t remoteDebugOpen(const android::String16& message) = 0;
    virtual int32_t remoteDebugCapture(const android::String16& path) = 0;
    virtual int32_t remoteDebugClose() = 0;
    virtual int32_t noteSamplingMessage(const android::String16& message,
                                        const android::String16& path) = 0;
};

class BnKelvoService : public android::BnInterface<IKelvoService> {
protected:
    // A request whose interface token does not match is refused with -1.
    android::status_t onTransact(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                                 uint32_t flags = 0) override;
};

}  // namespace kelvo
