#define LOG_TAG "hwbinder"

#include <vendor/tovaro/hardware/kelvo/1.0/IKelvoManager.h>

#include <binder/Parcel.h>
#include <fcntl.h>
#include <log/log.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utils/String16.h>

#include "HidlHost.h"

using android::BAD_TYPE;
using android::BAD_VALUE;
using android::NO_ERROR;
using android::Parcel;
using android::sp;
using android::status_t;
using android::String16;
using android::hardware::hidl_handle;
using android::hardware::hidl_memory;
using android::hardware::Return;
using android::hardware::Status;

namespace vendor {
namespace tovaro {
namespace hardware {
namespace kelvo {
namespace V1_0 {

namespace {

const String16& token() {
    static const String16* text = new String16(IKelvoManager::descriptor);
    return *text;
}

// Decodes the calls for the object that serves them.
class KelvoManagerStub : public ::kelvo::HidlStub {
public:
    explicit KelvoManagerStub(const sp<IKelvoManager>& impl) : mImpl(impl) {}

    status_t onTransact(uint32_t code, const Parcel& data, Parcel* reply) override {
        if (code != IKelvoManager::kSendKelvoEvent) {
            return android::UNKNOWN_TRANSACTION;
        }
        if (!data.enforceInterface(token())) {
            return BAD_TYPE;
        }
        KelvoEvent event;
        if (data.readInt32(&event.type) != NO_ERROR || data.readUint32(&event.size) != NO_ERROR) {
            return BAD_VALUE;
        }
        // The block is the descriptor alone: its size is its own. A call
        // without one carries an empty memory, which the service refuses.
        int fd = data.readFileDescriptor();
        if (fd >= 0) {
            int own = fcntl(fd, F_DUPFD_CLOEXEC, 0);
            native_handle_t* handle = own >= 0 ? native_handle_create(1, 0) : nullptr;
            if (handle == nullptr) {
                if (own >= 0) close(own);
                return android::NO_MEMORY;
            }
            handle->data[0] = own;
            struct stat st = {};
            size_t size = fstat(own, &st) == 0 && st.st_size > 0 ? static_cast<size_t>(st.st_size) : 0;
            hidl_handle owned;
            owned.setTo(handle, true);
            event.memory = hidl_memory("memfd", std::move(owned), size);
        }
        Return<int32_t> result = mImpl->sendKelvoEvent(event);
        if (!result.isOk()) {
            return result.getStatus().transactionError();
        }
        reply->writeInt32(0);
        reply->writeInt32(result);
        return NO_ERROR;
    }

private:
    const sp<IKelvoManager> mImpl;
};

// Calls the instance that serves the name, one connection per call.
class KelvoManagerProxy : public IKelvoManager {
public:
    explicit KelvoManagerProxy(const std::string& instance) : mInstance(instance) {}

    Return<int32_t> sendKelvoEvent(const KelvoEvent& event) override {
        Parcel data;
        data.writeInterfaceToken(token());
        data.writeInt32(event.type);
        data.writeUint32(event.size);
        const native_handle_t* handle = event.memory.handle();
        if (handle != nullptr && handle->numFds >= 1 &&
            data.writeFileDescriptor(handle->data[0]) != NO_ERROR) {
            return Status::fromStatusT(BAD_VALUE);
        }
        status_t err = NO_ERROR;
        int fd = ::kelvo::HidlHost::connect(descriptor, mInstance, &err);
        if (fd < 0) {
            return Status::fromStatusT(err);
        }
        Parcel reply;
        err = ::kelvo::HidlHost::transact(fd, kSendKelvoEvent, data, &reply);
        int32_t status = 0;
        int32_t result = 0;
        if (err == NO_ERROR &&
            (reply.readInt32(&status) != NO_ERROR || reply.readInt32(&result) != NO_ERROR)) {
            err = BAD_VALUE;
        }
        if (err == NO_ERROR && status != 0) {
            err = android::FAILED_TRANSACTION;
        }
        if (err != NO_ERROR) {
            return Status::fromStatusT(err);
        }
        return result;
    }

private:
    const std::string mInstance;
};

} // namespace

status_t IKelvoManager::registerAsService(const std::string& serviceName) {
    return ::kelvo::HidlHost::self().registerService(descriptor, serviceName,
                                                    new KelvoManagerStub(this));
}

sp<IKelvoManager> IKelvoManager::getService(const std::string& serviceName) {
    status_t err = NO_ERROR;
    int fd = ::kelvo::HidlHost::connect(descriptor, serviceName, &err);
    if (fd < 0) {
        return nullptr;
    }
    close(fd);
    return new KelvoManagerProxy(serviceName);
}

} // namespace V1_0
} // namespace kelvo
} // namespace hardware
} // namespace tovaro
} // namespace vendor
