#pragma once

#include <stddef.h>
#include <stdint.h>

namespace kelvo {

// The vendor side of the hardware-binder manager service: hands one block of
// bytes to the daemon's IKelvoManager ("default") in shared memory (a memfd
// passed as a descriptor). Used by the simulator's modem and by tests.
class KelvoManagerClient {
public:
    // Sends `size` bytes as one event of `type`, declaring `size`. Returns
    // the service's result (0 accepted, -1 refused) or a negative errno-style
    // transport error when the service cannot be reached.
    static int32_t send(int32_t type, const void* data, size_t size);
    // The same with a declared size that may differ from the block's (tests).
    static int32_t send(int32_t type, const void* data, size_t size, uint32_t declaredSize);
};

}  // namespace kelvo
