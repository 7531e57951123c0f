#include <binder/ServiceControl.h>
#include <utils/String8.h>

#include <atomic>

#include "BinderHost.h"

namespace kelvo {

namespace {

std::atomic<int> gServiceWaitMs{ServiceControl::kDefaultServiceWaitMs};

} // namespace

void ServiceControl::setServiceWaitMs(int ms) {
    gServiceWaitMs.store(ms < 0 ? 0 : ms);
}

int ServiceControl::serviceWaitMs() {
    return gServiceWaitMs.load();
}

android::status_t ServiceControl::stopService(const android::String16& name) {
    android::String8 text(name);
    return BinderHost::self().stopService(std::string(text.string(), text.size()));
}

std::string ServiceControl::socketDir() {
    return BinderHost::socketDir();
}

} // namespace kelvo
