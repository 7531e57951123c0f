#pragma once

#include <time.h>

namespace kelvo {

// The wall clock of the device. On the host it is shifted by
// KELVO_CLOCK_OFFSET_MS milliseconds (default 0) so the simulator can run the
// daemon at a chosen time of day. Monotonic and boot-time clocks are never
// shifted.
class WallClock {
public:
    static int getTime(struct timespec* ts);
    // Re-reads KELVO_CLOCK_OFFSET_MS (tests).
    static void reloadOffset();
};

} // namespace kelvo
