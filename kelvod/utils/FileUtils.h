#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <string>

namespace kelvo {

// File operations of the storage side. Every path here is a host path: device
// paths are resolved through RootPath before they reach these helpers. None of
// them follows a symbolic link at the last component of a path it writes to.
class FileUtils {
public:
    // Copies src to dest, which must not exist yet, keeping the source's mode.
    // A partly written dest is removed. 0, or -14 with an error line.
    static int32_t copyFile(const char* src, const char* dest);
    // Creates (or opens an existing) dir/name with the mode. 0; -2 when dir
    // is missing; -14 when the file cannot be made.
    static int32_t createFile(const char* dir, const char* name, mode_t mode);
    // 0, or -2 with an error line.
    static int32_t renameFile(const char* src, const char* dest);
    // Removes a file (never a directory). A file already gone counts as
    // removed. 0, or -1 with an error line.
    static int32_t deleteFile(const char* path);
    // Creates the directory and its missing parents, one level at a time.
    // An existing directory is success. 0, or -2 with an error line.
    static int32_t createDirectory(const char* path, mode_t mode);
    // Changes owner and group. Refused changes when not root are not errors.
    static int32_t chownDir(const char* path, uid_t owner, gid_t group);
    // Changes the mode of a file or directory (not of a symbolic link).
    static int32_t chmodFile(const char* path, mode_t mode);
    // Size in bytes, or -1 with errno set.
    static int64_t getFileSize(const char* path);
    static bool isDirectory(const char* path);
    static bool isRegularFile(const char* path);
    // True when something (a dangling link included) has this name.
    static bool exists(const char* path);
    // "dir/name".
    static std::string join(const std::string& dir, const std::string& name);
    // The text after the last '/'.
    static std::string baseName(const std::string& path);
};

} // namespace kelvo
