#include "binder/IKelvoService.h"

#include "KelvoLog.h"

namespace kelvo {

class BpKelvoService : public android::BpInterface<IKelvoService> {
public:
    explicit BpKelvoService(const android::sp<android::IBinder>& remote)
        : android::BpInterface<IKelvoService>(remote) {}

    void requestQueryComponent(const android::Parcel& query) override {
        sendQuery(REQUEST_QUERY_COMPONENT, query);
    }
    void requestQueryApplications(const android::Parcel& query) override {
        sendQuery(REQUEST_QUERY_APPLICATIONS, query);
    }
    int32_t remoteDebugOpen(const android::String16& message) override {
        android::Parcel data;
        data.writeInterfaceToken(IKelvoService::descriptor);
        data.writeString16(message);
        return call(REMOTE_DEBUG_OPEN, data);
    }
    int32_t remoteDebugCapture(const android::String16& path) override {
        android::Parcel data;
        data.writeInterfaceToken(IKelvoService::descriptor);
        data.writeString16(path);
        return call(REMOTE_DEBUG_CAPTURE, data);
    }
    int32_t remoteDebugClose() override {
        android::Parcel data;
        data.writeInterfaceToken(IKelvoService::descriptor);
        return call(REMOTE_DEBUG_CLOSE, data);
    }
    int32_t noteSamplingMessage(const android::String16& message,
                                const android::String16& path) override {
        android::Parcel data;
        data.writeInterfaceToken(IKelvoService::descriptor);
        data.writeString16(message);
        data.writeString16(path);
        return call(NOTE_SAMPLING_MESSAGE, data);
    }

private:
    void sendQuery(uint32_t code, const android::Parcel& query) {
        android::Parcel data;
        android::Parcel reply;
        data.writeInterfaceToken(IKelvoService::descriptor);
        data.appendFrom(&query, 0, query.dataSize());
        remote()->transact(code, data, &reply);
    }
    // The transport's failure, the reply's exception, or the result.
    int32_t call(uint32_t code, const android::Parcel& data) {
        android::Parcel reply;
        android::status_t err = remote()->transact(code, data, &reply);
        if (err != android::NO_ERROR) {
            return err;
        }
        int32_t exception = reply.readExceptionCode();
        if (exception != 0) {
            return exception;
        }
        int32_t result = -1;
        return reply.readInt32(&result) == android::NO_ERROR ? result : -1;
    }
};

IMPLEMENT_META_INTERFACE(KelvoService, "com.tovaro.kelvo.IKelvoService")

android::status_t BnKelvoService::onTransact(uint32_t code, const android::Parcel& data,
                                             android::Parcel* reply, uint32_t flags) {
    switch (code) {
        case REQUEST_QUERY_COMPONENT:
        case REQUEST_QUERY_APPLICATIONS: {
            if (!data.enforceInterface(IKelvoService::descriptor)) {
                return android::PERMISSION_DENIED;
            }
            if (data.dataAvail() == 0) {
                if (code == REQUEST_QUERY_COMPONENT) {
                    KLOGI("Empty component query request");
                } else {
                    KLOGI("Empty applications query request");
                }
                return android::NO_ERROR;
            }
            // The listener binder travels with the bytes.
            android::Parcel query;
            query.appendFrom(&data, data.dataPosition(), data.dataAvail());
            query.setDataPosition(0);
            if (code == REQUEST_QUERY_COMPONENT) {
                requestQueryComponent(query);
            } else {
                requestQueryApplications(query);
            }
            return android::NO_ERROR;
        }
        case REMOTE_DEBUG_OPEN: {
            if (!data.enforceInterface(IKelvoService::descriptor)) {
                return android::PERMISSION_DENIED;
            }
            android::String16 message;
            if (data.dataAvail() > 0) {
                data.readString16(&message);
            }
            reply->writeNoException();
            return reply->writeInt32(remoteDebugOpen(message));
        }
        case REMOTE_DEBUG_CAPTURE: {
            if (!data.enforceInterface(IKelvoService::descriptor)) {
                return android::PERMISSION_DENIED;
            }
            android::String16 path = data.readString16();
            reply->writeNoException();
            return reply->writeInt32(remoteDebugCapture(path));
        }
        case REMOTE_DEBUG_CLOSE:
            if (!data.enforceInterface(IKelvoService::descriptor)) {
                return android::PERMISSION_DENIED;
            }
            reply->writeNoException();
            return reply->writeInt32(remoteDebugClose());
        case NOTE_SAMPLING_MESSAGE: {
            if (!data.enforceInterface(IKelvoService::descriptor)) {
                return android::PERMISSION_DENIED;
            }
            android::String16 message = data.readString16();
            android::String16 path = data.readString16();
            reply->writeNoException();
            return reply->writeInt32(noteSamplingMessage(message, path));
        }
        default:
            return android::BBinder::onTransact(code, data, reply, flags);
    }
}

}  // namespace kelvo
