#pragma once

// vendor.tovaro.hardware.kelvo@1.0::IKelvoManager: vendor processes hand
// blocks of data to the daemon in shared memory.
//
// Wire form of sendKelvoEvent (one transaction, code kSendKelvoEvent): the
// interface token, int32 type, uint32 size, the block's descriptor. Reply:
// int32 status (0: the call ran), int32 result.

#include <android/hidl/base/1.0/IBase.h>
#include <hidl/Status.h>
#include <utils/Errors.h>
#include <utils/StrongPointer.h>
#include <vendor/tovaro/hardware/kelvo/1.0/types.h>

#include <string>

namespace vendor {
namespace tovaro {
namespace hardware {
namespace kelvo {
namespace V1_0 {

class IKelvoManager : public ::android::hidl::base::V1_0::IBase {
public:
    static constexpr const char* descriptor = "vendor.tovaro.hardware.kelvo@1.0::IKelvoManager";
    static constexpr uint32_t kSendKelvoEvent = 1;

    // 0 when the event was taken, -1 when it was refused.
    virtual ::android::hardware::Return<int32_t> sendKelvoEvent(const KelvoEvent& event) = 0;

    // Serves this object under the instance name; calls arrive on the
    // process's hardware-binder threads.
    ::android::status_t registerAsService(const std::string& serviceName = "default");
    // A proxy to whatever serves the instance now, or null when nothing
    // does.
    static ::android::sp<IKelvoManager> getService(const std::string& serviceName = "default");
};

} // namespace V1_0
} // namespace kelvo
} // namespace hardware
} // namespace tovaro
} // namespace vendor
