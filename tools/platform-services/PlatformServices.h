#pragma once

#include <stdint.h>

#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <utils/StrongPointer.h>

#include "FakeBatteryRegistrar.h"
#include "FakeService.h"
#include "PlatformState.h"

namespace kelvo {

// The fake platform services of tests and the simulator, served by this
// process under the current root, all answering from one PlatformState.
class PlatformServices {
public:
    PlatformServices();
    ~PlatformServices();

    // "activity", "package", "batteryproperties", "SysinfoService",
    // "pmservice", "permission", "media.audio_flinger".
    static std::vector<std::string> names();

    const std::shared_ptr<PlatformState>& state() const { return mState; }

    // Registers a fresh object under the name: NO_ERROR, or the error of
    // registering (BAD_VALUE for an unknown name).
    android::status_t start(const std::string& name);
    android::status_t startAll();
    // Stops serving the name as if its process had died: connected clients
    // get their death notifications.
    android::status_t stop(const std::string& name);
    android::status_t restart(const std::string& name);
    void stopAll();

    // The running battery registrar, or null.
    android::sp<FakeBatteryRegistrar> batteryRegistrar();

private:
    std::shared_ptr<PlatformState> mState;
    std::mutex mLock;
    std::map<std::string, android::sp<FakeService>> mRunning;
};

} // namespace kelvo
