#pragma once

#include <hidl/HidlSupport.h>
#include <stdint.h>

namespace vendor {
namespace tovaro {
namespace hardware {
namespace kelvo {
namespace V1_0 {

// One event for the daemon: `size` bytes of data at the start of `memory`.
struct KelvoEvent {
    int32_t type = 0;
    uint32_t size = 0;
    ::android::hardware::hidl_memory memory;
};

} // namespace V1_0
} // namespace kelvo
} // namespace hardware
} // namespace tovaro
} // namespace vendor
