#pragma once

// The thread pool that serves this process's hardware-binder services, apart
// from the binder pool. Its threads start with the first registration.

#include <stddef.h>

namespace android {
namespace hardware {

// Sets the number of serving threads (host: 1 or 2; other values are
// clamped). callerWillJoin is accepted for compatibility: the host's
// threads always serve on their own.
void configureRpcThreadpool(size_t maxThreads, bool callerWillJoin);

} // namespace hardware
} // namespace android
