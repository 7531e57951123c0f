#pragma once

#include <stdint.h>

namespace kelvo {

// The device's processors, as its own tree below the root tells them: the
// daemon never counts the cores of the machine it happens to run on unless
// the tree says nothing.
class Processors {
public:
    // Most cores a tree may claim; a larger claim is ignored.
    static constexpr int32_t kMaxCores = 1024;

    // The configured processor count: the highest index of
    // "/sys/devices/system/cpu/possible" plus one, else the highest
    // "/sys/devices/system/cpu/cpuN" folder plus one, else the system's own
    // configured count. Below 1 only when even that fails.
    static int32_t configuredCount();

    // Parses a cpu list ("0-3,5,7-8") into its highest index plus one; -1
    // when the text is not such a list or names an index of kMaxCores or
    // more.
    static int32_t countFromList(const char* text);
};

}  // namespace kelvo
