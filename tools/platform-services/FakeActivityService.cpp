#include "FakeActivityService.h"

namespace kelvo {

FakeActivityService::FakeActivityService(const std::shared_ptr<PlatformState>& state)
    : FakeService("activity", u"android.app.IActivityManager", state) {}

android::status_t FakeActivityService::handle(uint32_t code, const android::Parcel& /*data*/,
                                              android::Parcel* reply, uint32_t /*flags*/) {
    if (code != 77 && code != 83) {
        return android::UNKNOWN_TRANSACTION;
    }
    std::vector<PlatformState::Process> processes = mState->processes();
    reply->writeNoException();
    reply->writeInt32(static_cast<int32_t>(processes.size()));
    for (const PlatformState::Process& process : processes) {
        reply->writeInt32(1);
        reply->writeString16(android::String16(process.name.c_str()));
        reply->writeInt32(process.pid);
        reply->writeInt32(process.uid);
        reply->writeInt32(static_cast<int32_t>(process.packages.size()));
        for (const std::string& name : process.packages) {
            reply->writeString16(android::String16(name.c_str()));
        }
        reply->writeInt32(0);              // flags
        reply->writeInt32(0);              // last trim level
        reply->writeInt32(100);            // importance: foreground
        reply->writeInt32(0);              // lru
        reply->writeInt32(0);              // importance reason code
        reply->writeInt32(0);              // importance reason pid
        reply->writeString16(nullptr, 0);  // no reason component
        reply->writeInt32(0);              // importance reason importance
        reply->writeInt32(2);              // process state
    }
    return android::NO_ERROR;
}

} // namespace kelvo
