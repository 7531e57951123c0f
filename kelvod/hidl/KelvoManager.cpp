#include "hidl/KelvoManager.h"

#include <binder/Parcel.h>
#include <hidlmemory/mapping.h>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/KelvoAgent.h"

using android::sp;
using android::hardware::Return;
using android::hidl::memory::V1_0::IMemory;
using vendor::tovaro::hardware::kelvo::V1_0::KelvoEvent;

namespace kelvo {

namespace {

int32_t refuse() {
    HealthCounters::add(Health::HidlEventsRefused);
    return -1;
}

} // namespace

Return<int32_t> KelvoManager::sendKelvoEvent(const KelvoEvent& event) {
    if (event.type != kEventTypeModemData) {
        KLOGE("Unknown event type: %d", event.type);
        return refuse();
    }
    if (event.size > kMaxEventBytes) {
        KLOGE("Event size %u above the limit %u", event.size, kMaxEventBytes);
        return refuse();
    }
    // The copy is bounded by the block's own size, never by what the sender
    // declared.
    sp<IMemory> memory = android::hardware::mapMemory(event.memory);
    if (memory == nullptr) {
        KLOGE("Failed to map the event memory");
        return refuse();
    }
    uint64_t blockSize = memory->getSize();
    if (event.size > blockSize) {
        KLOGE("Event size %u above the block size %llu", event.size,
              static_cast<unsigned long long>(blockSize));
        return refuse();
    }
    void* data = memory->getPointer();
    memory->update();
    memory->read();
    android::Parcel parcel;
    parcel.writeInt32(static_cast<int32_t>(event.size));
    android::status_t written = parcel.write(data, event.size);
    memory->commit();
    memory.clear();
    if (written != android::NO_ERROR) {
        KLOGE("Failed to copy the event: %d", written);
        return refuse();
    }

    sp<KelvoAgent> agent = mAgent.promote();
    int32_t status = agent != nullptr
                             ? agent->sendToHandler(HANDLER_MODEM, kModemEventRequest, parcel,
                                                    nullptr, false)
                             : -11;
    if (status == -11) {
        KLOGI("Modem handler absent (modem disabled): event dropped");
        return refuse();
    }
    if (status < 0) {
        KLOGE("Failed to send the event to the modem handler: %d", status);
        return refuse();
    }
    return 0;
}

} // namespace kelvo
