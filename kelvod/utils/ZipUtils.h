#pragma once

#include <stdint.h>

#include <string>
#include <vector>

namespace kelvo {

// Packing and unpacking of the storage side's zip files (host paths).
class ZipUtils {
public:
    // Writes the files, compressed, into a new zip at zipPath (an existing
    // file of that name is replaced; a symbolic link is not followed). Each
    // entry is named by the file's base name, or "parent/base" when
    // keepParentDir is set. 0 only when every file went in; -5 for bad
    // arguments, -14 otherwise. A failed zip is left for the caller to remove.
    static int32_t zipFiles(const char* zipPath, const std::vector<std::string>& files,
                            bool keepParentDir);

    // Extracts the entries whose names end with suffix into destDir as new
    // files (mode 0664). Names with a directory part, "." and "..", and
    // entries larger than maxEntrySize are refused; an existing file or link
    // of the same name is never written through. 0 when every matching entry
    // was extracted, -14 otherwise.
    static int32_t unzipFiles(const char* zipPath, const char* destDir, const char* suffix,
                              int64_t maxEntrySize);
};

} // namespace kelvo
