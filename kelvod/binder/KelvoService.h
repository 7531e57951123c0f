#pragma once

#include <binder/Parcel.h>
#include <stdint.h>
#include <sys/types.h>
#include <utils/String16.h>
#include <utils/String8.h>
#include <utils/Vector.h>

#include "binder/IKelvoService.h"

namespace kelvo {

class KelvoAgent;

// The "KelvoService" binder service: checks the caller, parses and forwards
// each request to the agent; `dumpsys KelvoService` prints diagnostics and
// switches logging, flushes, balances and the charging state.
class KelvoService : public BnKelvoService {
public:
    static constexpr const char* kServiceName = "KelvoService";
    // The only caller served.
    static constexpr uid_t kSystemUid = 1000;
    // Always allowed to dump.
    static constexpr uid_t kShellUid = 2000;
    static constexpr const char* kChargeSwitchPath =
        "/sys/class/tv_power/charger/charge_data/enable_hiz";
    static constexpr const char* kCollectionRoot = "/data/log/";

    explicit KelvoService(const android::sp<KelvoAgent>& agent);

    // Registers a new service of the agent with the service manager.
    static android::status_t publish(const android::sp<KelvoAgent>& agent);

    void requestQueryComponent(const android::Parcel& query) override;
    void requestQueryApplications(const android::Parcel& query) override;
    int32_t remoteDebugOpen(const android::String16& message) override;
    int32_t remoteDebugCapture(const android::String16& path) override;
    int32_t remoteDebugClose() override;
    int32_t noteSamplingMessage(const android::String16& message,
                                const android::String16& path) override;

    android::status_t dump(int fd, const android::Vector<android::String16>& args) override;

    // A path below the collection root without a ".." component.
    static bool isCollectionPath(const android::String8& path);

private:
    bool checkPermission();
    void dumpOptions(const android::Vector<android::String16>& args, android::String8& out);
    void switchLog(const android::String8& module, const android::String8& enable,
                   android::String8& out);
    void switchCharge(const android::String8& value, android::String8& out);

    const android::sp<KelvoAgent> mAgent;
};

}  // namespace kelvo
