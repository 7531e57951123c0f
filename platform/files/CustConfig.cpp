#include "cust/CustConfig.h"

#include <string.h>
#include <sys/stat.h>

#include <string>

#include "kelvo/RootPath.h"

namespace {

// Highest priority first.
constexpr const char* kSearchDirs[] = {"/cust", "/vendor/etc", "/system/etc"};

// A suffix must stay below the directory it is looked up in.
bool isSafeSuffix(const char* suffix) {
    if (suffix[0] == '\0' || suffix[0] == '/') {
        return false;
    }
    const char* part = suffix;
    while (true) {
        const char* end = strchr(part, '/');
        size_t len = end != nullptr ? static_cast<size_t>(end - part) : strlen(part);
        if (len == 2 && part[0] == '.' && part[1] == '.') {
            return false;
        }
        if (end == nullptr) {
            return true;
        }
        part = end + 1;
    }
}

} // namespace

extern "C" char* get_one_cfg_file(const char* pathSuffix, char* buffer, int type) {
    if (pathSuffix == nullptr || buffer == nullptr || type != 0 || !isSafeSuffix(pathSuffix)) {
        return nullptr;
    }
    for (const char* dir : kSearchDirs) {
        std::string path = kelvo::RootPath::resolve(dir) + "/" + pathSuffix;
        struct stat st;
        if (stat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
            continue;
        }
        // The winning copy or nothing: a lower-priority copy would be the
        // wrong file, and a cut path another one.
        if (path.size() >= CUST_CFG_PATH_MAX) {
            return nullptr;
        }
        memcpy(buffer, path.c_str(), path.size() + 1);
        return buffer;
    }
    return nullptr;
}
