#include <hidl/HidlTransportSupport.h>

#include "HidlHost.h"

namespace android {
namespace hardware {

void configureRpcThreadpool(size_t maxThreads, bool /*callerWillJoin*/) {
    kelvo::HidlHost::self().setThreadCount(maxThreads);
}

} // namespace hardware
} // namespace android
