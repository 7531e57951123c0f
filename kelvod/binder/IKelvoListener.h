#pragma once

#include <binder/IInterface.h>
#include <binder/Parcel.h>

namespace kelvo {

// The callback a querying application hands over with its request: the
// daemon answers each query with one one-way onQueryResponse.
class IKelvoListener : public android::IInterface {
public:
    DECLARE_META_INTERFACE(KelvoListener)

    enum : uint32_t {
        ON_QUERY_RESPONSE = android::IBinder::FIRST_CALL_TRANSACTION,
    };

    // Request: the interface token, int32 1, then the whole response.
    virtual void onQueryResponse(const android::Parcel& response) = 0;
};

class BnKelvoListener : public android::BnInterface<IKelvoListener> {
protected:
    // Hands the response, positioned at its start, to onQueryResponse.
    android::status_t onTransact(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                                 uint32_t flags = 0) override;
};

}  // namespace kelvo
