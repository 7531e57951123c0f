#define LOG_TAG "binder"

#include <binder/IPCThreadState.h>
#include <binder/IServiceManager.h>
#include <binder/Parcel.h>
#include <binder/ServiceControl.h>
#include <log/log.h>
#include <unistd.h>
#include <utils/String8.h>

#include <algorithm>
#include <chrono>
#include <mutex>
#include <thread>

#include "BinderHost.h"

namespace android {

namespace {

std::string toStd(const String16& name) {
    String8 text(name);
    return std::string(text.string(), text.size());
}

class HostServiceManager : public IServiceManager {
public:
    sp<IBinder> getService(const String16& name) const override {
        using Clock = std::chrono::steady_clock;
        auto deadline =
            Clock::now() + std::chrono::milliseconds(kelvo::ServiceControl::serviceWaitMs());
        bool told = false;
        for (;;) {
            sp<IBinder> service = checkService(name);
            if (service != nullptr) {
                return service;
            }
            auto now = Clock::now();
            if (now >= deadline) {
                ALOGW("Service %s did not appear", toStd(name).c_str());
                return nullptr;
            }
            if (!told) {
                ALOGI("Waiting for service %s...", toStd(name).c_str());
                told = true;
            }
            auto pause = std::min<Clock::duration>(std::chrono::milliseconds(50), deadline - now);
            std::this_thread::sleep_for(pause);
        }
    }

    sp<IBinder> checkService(const String16& name) const override {
        return kelvo::BinderHost::self().checkService(toStd(name));
    }

    status_t addService(const String16& name, const sp<IBinder>& service, bool allowIsolated,
                        int dumpsysFlags) override {
        return kelvo::BinderHost::self().addService(toStd(name), service);
    }

    Vector<String16> listServices(int dumpsysFlags) override {
        Vector<String16> out;
        for (const std::string& name : kelvo::BinderHost::self().listServices()) {
            out.add(String16(name.c_str()));
        }
        return out;
    }
};

// The permission service's interface and its one call.
const char16_t kPermissionDescriptor[] = u"android.os.IPermissionController";
constexpr uint32_t kCheckPermissionTransaction = IBinder::FIRST_CALL_TRANSACTION;

} // namespace

sp<IServiceManager> defaultServiceManager() {
    static sp<IServiceManager>* manager = new sp<IServiceManager>(new HostServiceManager());
    return *manager;
}

bool checkPermission(const String16& permission, pid_t pid, uid_t uid) {
    if (uid == 0 || pid == getpid()) {
        return true;
    }
    static std::mutex lock;
    static sp<IBinder>* controller = new sp<IBinder>();
    Parcel reply;
    status_t err = DEAD_OBJECT;
    // A remembered service may have died unseen: look it up again once.
    for (int attempt = 0; attempt < 2 && err == DEAD_OBJECT; ++attempt) {
        sp<IBinder> service;
        {
            std::lock_guard<std::mutex> guard(lock);
            if (attempt > 0 || *controller == nullptr || !(*controller)->isBinderAlive()) {
                *controller = defaultServiceManager()->checkService(String16("permission"));
            }
            service = *controller;
        }
        if (service == nullptr) {
            ALOGW("No permission service: %s refused to pid %d uid %d", toStd(permission).c_str(),
                  static_cast<int>(pid), static_cast<int>(uid));
            return false;
        }
        Parcel data;
        data.writeInterfaceToken(String16(kPermissionDescriptor));
        data.writeString16(permission);
        data.writeInt32(static_cast<int32_t>(pid));
        data.writeInt32(static_cast<int32_t>(uid));
        reply.freeData();
        err = service->transact(kCheckPermissionTransaction, data, &reply);
    }
    if (err != NO_ERROR || reply.readExceptionCode() != 0) {
        ALOGW("Permission check of %s failed (%d)", toStd(permission).c_str(), err);
        return false;
    }
    int32_t granted = 0;
    return reply.readInt32(&granted) == NO_ERROR && granted != 0;
}

bool checkCallingPermission(const String16& permission) {
    return checkCallingPermission(permission, nullptr, nullptr);
}

bool checkCallingPermission(const String16& permission, int32_t* outPid, int32_t* outUid) {
    IPCThreadState* ipc = IPCThreadState::self();
    pid_t pid = ipc->getCallingPid();
    uid_t uid = ipc->getCallingUid();
    if (outPid != nullptr) {
        *outPid = pid;
    }
    if (outUid != nullptr) {
        *outUid = static_cast<int32_t>(uid);
    }
    return checkPermission(permission, pid, uid);
}

} // namespace android
