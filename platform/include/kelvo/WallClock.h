#pragma once

#include <stdint.h>
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
    // Stops the clock at ms (the offset is not added); a negative value
    // lets it run again (tests).
    static void setFixedTimeMs(int64_t ms);
};

} // namespace kelvo
