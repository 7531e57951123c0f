#include "binder/IKelvoListener.h"

namespace kelvo {

class BpKelvoListener : public android::BpInterface<IKelvoListener> {
public:
    explicit BpKelvoListener(const android::sp<android::IBinder>& remote)
        : android::BpInterface<IKelvoListener>(remote) {}

    void onQueryResponse(const android::Parcel& response) override {
        android::Parcel data;
        data.writeInterfaceToken(IKelvoListener::descriptor);
        data.writeInt32(1);
        data.appendFrom(&response, 0, response.dataSize());
        remote()->transact(ON_QUERY_RESPONSE, data, nullptr, android::IBinder::FLAG_ONEWAY);
    }
};

IMPLEMENT_META_INTERFACE(KelvoListener, "com.tovaro.kelvo.IKelvoListener")

android::status_t BnKelvoListener::onTransact(uint32_t code, const android::Parcel& data,
                                              android::Parcel* reply, uint32_t flags) {
    if (code != ON_QUERY_RESPONSE) {
        return android::BBinder::onTransact(code, data, reply, flags);
    }
    if (!data.enforceInterface(IKelvoListener::descriptor)) {
        return android::PERMISSION_DENIED;
    }
    int32_t present = 0;
    if (data.readInt32(&present) != android::NO_ERROR || present != 1) {
        return android::BAD_VALUE;
    }
    android::Parcel response;
    response.appendFrom(&data, data.dataPosition(), data.dataAvail());
    response.setDataPosition(0);
    onQueryResponse(response);
    return android::NO_ERROR;
}

}  // namespace kelvo
