#pragma once

#include <string>

namespace kelvo {

// Every absolute device path of the daemon ("/dev", "/proc", "/sys", "/data",
// "/system", "/vendor") goes through this resolver. On the host the root comes
// from the environment variable KELVO_ROOT (default "/"), so tests and the
// device simulator each run on a private directory tree.
class RootPath {
public:
    // Joins the root and an absolute path. Relative paths are returned as is.
    static std::string resolve(const char* path);
    static std::string resolve(const std::string& path) { return resolve(path.c_str()); }

    // The root directory without a trailing "/" ("" for the real root).
    static std::string root();

    // Replaces the root for the rest of the process (tests).
    static void setRoot(const char* root);
};

} // namespace kelvo
