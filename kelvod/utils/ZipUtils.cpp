#include "utils/ZipUtils.h"

#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>
#include <ziparchive/zip_archive.h>
#include <ziparchive/zip_writer.h>

#include <cerrno>
#include <cstring>

#include "KelvoLog.h"
#include "utils/FileUtils.h"

namespace kelvo {

namespace {

constexpr size_t kZipBufferSize = 10000;

// The entry name of a source file: its base name, or "parent/base".
std::string entryNameOf(const std::string& path, bool keepParentDir) {
    size_t slash = path.find_last_of('/');
    if (slash == std::string::npos) {
        return path;
    }
    std::string base = path.substr(slash + 1);
    if (!keepParentDir || base.empty()) {
        return base;
    }
    std::string parent = FileUtils::baseName(path.substr(0, slash));
    return parent.empty() ? base : parent + "/" + base;
}

int32_t addFile(ZipWriter* writer, const std::string& path, bool keepParentDir) {
    if (path.empty()) {
        KLOGE("Empty src file");
        return -5;
    }
    std::string name = entryNameOf(path, keepParentDir);
    if (name.empty()) {
        KLOGE("Empty src file name");
        return -5;
    }
    int fd = TEMP_FAILURE_RETRY(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (fd < 0) {
        KLOGE("Failed to open file: %s %s", path.c_str(), strerror(errno));
        return -14;
    }
    int32_t ret = writer->StartEntry(name, ZipWriter::kCompress);
    if (ret != 0) {
        KLOGE("Failed to open entry: %d %s", ret, ZipWriter::ErrorCodeString(ret));
        close(fd);
        return -14;
    }
    int32_t result = 0;
    char buffer[kZipBufferSize];
    while (true) {
        ssize_t n = TEMP_FAILURE_RETRY(read(fd, buffer, sizeof(buffer)));
        if (n < 0) {
            KLOGE("Failed to read buffer: %d %s", static_cast<int>(n), strerror(errno));
            result = -14;
            break;
        }
        if (n == 0) {
            break;
        }
        ret = writer->WriteBytes(buffer, static_cast<size_t>(n));
        if (ret != 0) {
            KLOGE("Failed to write bytes: %d %d", ret, static_cast<int>(n));
            result = -14;
            break;
        }
    }
    close(fd);
    // The entry is closed even after a failure so that later files can
    // still be added; the archive as a whole is reported as failed.
    ret = writer->FinishEntry();
    if (ret != 0 && result == 0) {
        KLOGE("Failed to finish entry: %d %s", ret, ZipWriter::ErrorCodeString(ret));
        result = -14;
    }
    return result;
}

bool isPlainEntryName(const std::string& name) {
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos &&
           name.find('\0') == std::string::npos;
}

} // namespace

int32_t ZipUtils::zipFiles(const char* zipPath, const std::vector<std::string>& files,
                           bool keepParentDir) {
    if (zipPath == nullptr || zipPath[0] == '\0' || files.empty()) {
        KLOGE("Invalid parameter: %d %s", static_cast<int>(files.size()),
              zipPath != nullptr ? zipPath : "null");
        return -5;
    }
    // An existing zip of this name is replaced, but only when it is a plain
    // file of its own: it is checked before it is emptied.
    int fd = TEMP_FAILURE_RETRY(
        open(zipPath, O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0664));
    struct stat st = {};
    bool usable = fd >= 0 && fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_nlink == 1 &&
                  ftruncate(fd, 0) == 0;
    FILE* fp = usable ? fdopen(fd, "wb") : nullptr;
    if (fp == nullptr) {
        KLOGE("Failed to open file: %s", zipPath);
        if (fd >= 0) {
            close(fd);
        }
        return -14;
    }

    int32_t result = 0;
    {
        ZipWriter writer(fp);
        for (const std::string& file : files) {
            if (addFile(&writer, file, keepParentDir) != 0) {
                KLOGE("Failed to add file: %s", file.c_str());
                result = -14;
            }
        }
        int32_t ret = writer.Finish();
        if (ret != 0) {
            KLOGE("Failed to finish zip file: %s, %s", zipPath, ZipWriter::ErrorCodeString(ret));
            result = -14;
        }
    }
    // The writer leaves buffered bytes in the stream: a full disk shows only
    // when they are flushed.
    if (fflush(fp) != 0 || ferror(fp) != 0) {
        KLOGE("Failed to write zip file: %s, %s", zipPath, strerror(errno));
        result = -14;
    }
    if (fclose(fp) != 0 && result == 0) {
        KLOGE("Failed to close zip file: %s, %s", zipPath, strerror(errno));
        result = -14;
    }
    return result;
}

int32_t ZipUtils::unzipFiles(const char* zipPath, const char* destDir, const char* suffix,
                             int64_t maxEntrySize) {
    ZipArchiveHandle handle = nullptr;
    int32_t ret = OpenArchive(zipPath, &handle);
    if (ret != 0) {
        KLOGE("Failed to open zip file: %s", zipPath);
        if (handle != nullptr) {
            CloseArchive(handle);
        }
        return -14;
    }
    void* cookie = nullptr;
    ret = StartIteration(handle, &cookie, "", suffix != nullptr ? suffix : "");
    if (ret != 0) {
        KLOGE("Failed to start iteration: %s", ErrorCodeString(ret));
        CloseArchive(handle);
        return -14;
    }

    int32_t result = 0;
    ZipEntry entry = {};
    std::string name;
    while ((ret = Next(cookie, &entry, &name)) == 0) {
        if (!isPlainEntryName(name)) {
            KLOGE("Refuse zip entry: %s, from: %s", name.c_str(), zipPath);
            result = -14;
            continue;
        }
        if (static_cast<int64_t>(entry.uncompressed_length) > maxEntrySize) {
            KLOGE("Zip entry is too large: %s, size: %u, threshold: %lld, from: %s", name.c_str(),
                  entry.uncompressed_length, static_cast<long long>(maxEntrySize), zipPath);
            result = -14;
            continue;
        }
        std::string path = FileUtils::join(destDir, name);
        // Only a file made here is written: an existing name (a link or a hard
        // link to a file elsewhere included) is left alone.
        int fd = TEMP_FAILURE_RETRY(
            open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0700));
        if (fd < 0) {
            KLOGE("Failed to open %s file: %s", path.c_str(), strerror(errno));
            result = -14;
            continue;
        }
        ret = ExtractEntryToFile(handle, &entry, fd);
        if (ret != 0) {
            KLOGE("Failed to extract entry to file: %s, from: %s", path.c_str(), zipPath);
            close(fd);
            unlink(path.c_str());
            result = -14;
            continue;
        }
        bool done = fchmod(fd, 0664) == 0;
        done = close(fd) == 0 && done;
        if (!done) {
            KLOGE("Failed to extract entry to file: %s, from: %s", path.c_str(), zipPath);
            unlink(path.c_str());
            result = -14;
        }
    }
    if (ret != -1) {
        KLOGE("Failed to iterate zip file: %s, %s", zipPath, ErrorCodeString(ret));
        result = -14;
    }
    EndIteration(cookie);
    CloseArchive(handle);
    return result;
}

} // namespace kelvo
