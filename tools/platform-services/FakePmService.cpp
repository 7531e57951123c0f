#include "FakePmService.h"

namespace kelvo {

FakePmService::FakePmService(const std::shared_ptr<PlatformState>& state)
    : FakeService("pmservice", u"vendor.pm.IPmService", state) {}

android::status_t FakePmService::handle(uint32_t code, const android::Parcel& data,
                                        android::Parcel* reply, uint32_t /*flags*/) {
    switch (code) {
        case 101: {
            int32_t unused = 0;
            if (data.readInt32(&unused) != android::NO_ERROR) {
                return android::BAD_VALUE;
            }
            std::vector<std::string> records = mState->wakelocks();
            reply->writeNoException();
            reply->writeInt32(static_cast<int32_t>(records.size()));
            for (const std::string& record : records) {
                reply->writeString16(android::String16(record.c_str()));
            }
            return android::NO_ERROR;
        }
        case 102:
            mState->noteReset();
            return android::NO_ERROR;
        default:
            return android::UNKNOWN_TRANSACTION;
    }
}

} // namespace kelvo
