#pragma once

#include <string>

namespace kelvo {

// Small helpers shared by the daemon.
class KelvoUtils {
public:
    // Removes a file given by its device path (resolved under the root).
    // 0 on success, -1 with an error line otherwise.
    static int32_t deleteFile(const char* path);
};

} // namespace kelvo
