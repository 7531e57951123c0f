#pragma once

#include <binder/Parcel.h>
#include <stdint.h>

#include <string>

#include "binder/IKelvoService.h"

namespace kelvo {

// A client of "KelvoService": sends one query with a listener of its own and
// waits for the answer; turns answers into readable text.
class KelvoQueryClient {
public:
    static constexpr int kDefaultTimeoutMs = 5000;

    // Null when the service cannot be found.
    static android::sp<IKelvoService> connect();

    explicit KelvoQueryClient(const android::sp<IKelvoService>& service);

    // True once the answer arrived within the time-out; *response holds it.
    bool queryComponent(int64_t start, int64_t end, int32_t mask, int32_t flag,
                        android::Parcel* response, int timeoutMs = kDefaultTimeoutMs);
    bool queryApplications(int64_t start, int64_t end, int32_t top, android::Parcel* response,
                           int timeoutMs = kDefaultTimeoutMs);

    // One line per module or hour, values separated by blanks; "no data" for
    // a -1 block. A reply that does not parse ends with "malformed reply".
    static std::string formatComponent(const android::Parcel& response, int32_t flag);
    static std::string formatApplications(const android::Parcel& response);

private:
    bool send(uint32_t code, const android::Parcel& query, android::Parcel* response, int timeoutMs);

    android::sp<IKelvoService> mService;
};

}  // namespace kelvo
