#include "PlatformServices.h"

#include <binder/IServiceManager.h>
#include <binder/ServiceControl.h>

#include "FakeActivityService.h"
#include "FakeAudioService.h"
#include "FakePackageService.h"
#include "FakePermissionService.h"
#include "FakePmService.h"
#include "FakeSysinfoService.h"

namespace kelvo {

PlatformServices::PlatformServices() : mState(std::make_shared<PlatformState>()) {}

PlatformServices::~PlatformServices() {
    stopAll();
    mState->setBatteryObserver(nullptr);
}

std::vector<std::string> PlatformServices::names() {
    return {"activity",       "package",   "batteryproperties",
            "SysinfoService", "pmservice", "permission",
            "media.audio_flinger"};
}

android::status_t PlatformServices::start(const std::string& name) {
    android::sp<FakeService> service;
    if (name == "activity") {
        service = new FakeActivityService(mState);
    } else if (name == "package") {
        service = new FakePackageService(mState);
    } else if (name == "batteryproperties") {
        android::sp<FakeBatteryRegistrar> registrar = new FakeBatteryRegistrar(mState);
        android::wp<FakeBatteryRegistrar> weak = registrar;
        mState->setBatteryObserver([weak]() {
            android::sp<FakeBatteryRegistrar> strong = weak.promote();
            if (strong != nullptr) {
                strong->pushAll();
            }
        });
        service = registrar;
    } else if (name == "SysinfoService") {
        service = new FakeSysinfoService(mState);
    } else if (name == "pmservice") {
        service = new FakePmService(mState);
    } else if (name == "permission") {
        service = new FakePermissionService(mState);
    } else if (name == "media.audio_flinger") {
        service = new FakeAudioService(mState);
    } else {
        return android::BAD_VALUE;
    }
    android::status_t status =
        android::defaultServiceManager()->addService(android::String16(name.c_str()), service);
    if (status == android::NO_ERROR) {
        std::lock_guard<std::mutex> guard(mLock);
        mRunning[name] = service;
    }
    return status;
}

android::status_t PlatformServices::startAll() {
    for (const std::string& name : names()) {
        android::status_t status = start(name);
        if (status != android::NO_ERROR) {
            return status;
        }
    }
    return android::NO_ERROR;
}

android::status_t PlatformServices::stop(const std::string& name) {
    {
        std::lock_guard<std::mutex> guard(mLock);
        if (mRunning.erase(name) == 0) {
            return android::NAME_NOT_FOUND;
        }
    }
    return ServiceControl::stopService(android::String16(name.c_str()));
}

android::status_t PlatformServices::restart(const std::string& name) {
    stop(name);
    return start(name);
}

void PlatformServices::stopAll() {
    std::vector<std::string> running;
    {
        std::lock_guard<std::mutex> guard(mLock);
        for (const auto& entry : mRunning) {
            running.push_back(entry.first);
        }
    }
    for (const std::string& name : running) {
        stop(name);
    }
}

android::sp<FakeBatteryRegistrar> PlatformServices::batteryRegistrar() {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mRunning.find("batteryproperties");
    if (it == mRunning.end()) {
        return nullptr;
    }
    return static_cast<FakeBatteryRegistrar*>(it->second.get());
}

} // namespace kelvo
