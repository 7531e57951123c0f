#pragma once

#include <stddef.h>
#include <stdint.h>
#include <utils/RefBase.h>
#include <vendor/tovaro/hardware/kelvo/1.0/IKelvoManager.h>

namespace kelvo {

class KelvoAgent;

// The hardware-binder entry point of vendor processes (the modem side): an
// event's block is copied into a parcel (int32 size, then the bytes) and
// posted to the modem handler as its request 1.
class KelvoManager : public vendor::tovaro::hardware::kelvo::V1_0::IKelvoManager {
public:
    static constexpr const char* kInstanceName = "default";
    // The only event type taken: modem data.
    static constexpr int32_t kEventTypeModemData = 100;
    // The most bytes one event may carry.
    static constexpr uint32_t kMaxEventBytes = 1024 * 1024;
    // Serving threads of the process's hardware-binder pool.
    static constexpr size_t kThreadPoolSize = 2;
    // The modem handler's request code for an event.
    static constexpr int32_t kModemEventRequest = 1;

    explicit KelvoManager(const android::wp<KelvoAgent>& agent) : mAgent(agent) {}

    // 0 when the event was handed to the modem handler, -1 when it was
    // refused or could not be handed on.
    android::hardware::Return<int32_t> sendKelvoEvent(
            const vendor::tovaro::hardware::kelvo::V1_0::KelvoEvent& event) override;

private:
    const android::wp<KelvoAgent> mAgent;
};

} // namespace kelvo
