#include "utils/KelvoUtils.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "KelvoLog.h"
#include "kelvo/RootPath.h"

namespace kelvo {

int32_t KelvoUtils::deleteFile(const char* path) {
    std::string resolved = RootPath::resolve(path);
    if (unlink(resolved.c_str()) != 0) {
        KLOGE("Failed to remove file: %s, %s", path != nullptr ? path : "", strerror(errno));
        return -1;
    }
    KLOGD("Successfully remove the file: %s", path);
    return 0;
}

} // namespace kelvo
