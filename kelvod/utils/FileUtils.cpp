#include "utils/FileUtils.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "KelvoLog.h"

namespace kelvo {

namespace {

constexpr size_t kCopyBufferSize = 65536;

int32_t writeAll(int fd, const char* data, size_t len) {
    while (len > 0) {
        ssize_t n = TEMP_FAILURE_RETRY(write(fd, data, len));
        if (n <= 0) {
            if (n == 0) {
                errno = EIO;
            }
            return -1;
        }
        data += n;
        len -= static_cast<size_t>(n);
    }
    return 0;
}

} // namespace

int32_t FileUtils::copyFile(const char* src, const char* dest) {
    int in = TEMP_FAILURE_RETRY(open(src, O_RDONLY | O_CLOEXEC));
    if (in < 0) {
        KLOGE("Failed to open file(%s) to read: %s", src, strerror(errno));
        return -14;
    }
    struct stat st = {};
    if (fstat(in, &st) != 0) {
        KLOGE("Failed to read file(%s) perms: %s", src, strerror(errno));
        close(in);
        return -14;
    }
    mode_t mode = st.st_mode & 07777;
    // A name that is already taken (a link to somewhere else included) is
    // never written through.
    int out =
        TEMP_FAILURE_RETRY(open(dest, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
    if (out < 0) {
        KLOGE("Failed to open file(%s) to write: %s", dest, strerror(errno));
        close(in);
        return -14;
    }

    int32_t ret = 0;
    char buffer[kCopyBufferSize];
    while (true) {
        ssize_t n = TEMP_FAILURE_RETRY(read(in, buffer, sizeof(buffer)));
        if (n < 0) {
            KLOGE("Failed to read file(%s): %s", src, strerror(errno));
            ret = -14;
            break;
        }
        if (n == 0) {
            break;
        }
        if (writeAll(out, buffer, static_cast<size_t>(n)) != 0) {
            KLOGE("Failed to write file(%s): %s", dest, strerror(errno));
            ret = -14;
            break;
        }
    }
    if (ret == 0 && fchmod(out, mode) != 0) {
        KLOGE("Failed to write file(%s): %s", dest, strerror(errno));
        ret = -14;
    }
    if (close(out) != 0 && ret == 0) {
        KLOGE("Failed to write file(%s): %s", dest, strerror(errno));
        ret = -14;
    }
    close(in);
    if (ret != 0) {
        unlink(dest);
    }
    return ret;
}

int32_t FileUtils::createFile(const char* dir, const char* name, mode_t mode) {
    if (!isDirectory(dir)) {
        KLOGE("Nonexitent dir: %s", dir);
        return -2;
    }
    std::string path = join(dir, name);
    int fd = TEMP_FAILURE_RETRY(
        open(path.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, mode));
    if (fd < 0) {
        KLOGE("Failed to create %s: %s", path.c_str(), strerror(errno));
        return -14;
    }
    int32_t ret = 0;
    struct stat st = {};
    if (fstat(fd, &st) != 0) {
        KLOGE("Failed to create %s: %s", path.c_str(), strerror(errno));
        ret = -14;
    } else if (!S_ISREG(st.st_mode) || st.st_nlink != 1) {
        // Another name of some other file: its mode is not ours to change.
        KLOGE("Failed to create %s: not a file of its own", path.c_str());
        ret = -14;
    } else if (fchmod(fd, mode) != 0) {
        KLOGE("Failed to create %s: %s", path.c_str(), strerror(errno));
        ret = -14;
    }
    close(fd);
    return ret;
}

int32_t FileUtils::renameFile(const char* src, const char* dest) {
    if (rename(src, dest) != 0) {
        KLOGE("Failed to rename the file: %s, from %s, %s", dest, src, strerror(errno));
        return -2;
    }
    return 0;
}

int32_t FileUtils::deleteFile(const char* path) {
    if (unlink(path) != 0 && errno != ENOENT) {
        KLOGE("Failed to delete file: %s, error: %s", path, strerror(errno));
        return -1;
    }
    return 0;
}

int32_t FileUtils::createDirectory(const char* path, mode_t mode) {
    std::string full = path != nullptr ? path : "";
    if (full.empty()) {
        KLOGE("Failed to create directory: empty path");
        return -2;
    }
    // Each level in turn: "/a", "/a/b", ... and last the whole path.
    size_t pos = 0;
    while (pos != std::string::npos) {
        pos = full.find('/', pos + 1);
        std::string part = full.substr(0, pos);
        if (part.back() == '/') {
            continue;
        }
        if (mkdir(part.c_str(), mode) == 0) {
            // mkdir applies the umask; the directory gets the mode asked for.
            chmod(part.c_str(), mode);
        } else if (errno != EEXIST || !isDirectory(part.c_str())) {
            KLOGE("Failed to create directory: %s, error: %s", part.c_str(),
                  strerror(errno == EEXIST ? ENOTDIR : errno));
            return -2;
        }
    }
    return 0;
}

int32_t FileUtils::chownDir(const char* path, uid_t owner, gid_t group) {
    int ret = fchownat(AT_FDCWD, path, owner, group, AT_SYMLINK_NOFOLLOW);
    if (ret != 0) {
        // Only root may give a file away; elsewhere the change is skipped.
        if (errno == EPERM && geteuid() != 0) {
            return 0;
        }
        KLOGE("Failed to chown dir: %d %s, error: %s", ret, path, strerror(errno));
        return -1;
    }
    return 0;
}

int32_t FileUtils::chmodFile(const char* path, mode_t mode) {
    struct stat st = {};
    int ret = lstat(path, &st);
    if (ret == 0 && S_ISLNK(st.st_mode)) {
        // Never through a link: the mode would land on its target.
        ret = -1;
        errno = ELOOP;
    } else if (ret == 0) {
        ret = chmod(path, mode);
    }
    if (ret != 0) {
        KLOGE("Failed to chmod file: %d %s, error: %s", ret, path, strerror(errno));
        return -1;
    }
    return 0;
}

int64_t FileUtils::getFileSize(const char* path) {
    struct stat st = {};
    if (stat(path, &st) != 0) {
        return -1;
    }
    return static_cast<int64_t>(st.st_size);
}

bool FileUtils::isDirectory(const char* path) {
    struct stat st = {};
    return stat(path, &st) == 0 && S_ISDIR(st.st_mode);
}

bool FileUtils::isRegularFile(const char* path) {
    struct stat st = {};
    return lstat(path, &st) == 0 && S_ISREG(st.st_mode);
}

bool FileUtils::exists(const char* path) {
    struct stat st = {};
    return lstat(path, &st) == 0;
}

std::string FileUtils::join(const std::string& dir, const std::string& name) {
    if (dir.empty()) {
        return name;
    }
    if (dir.back() == '/') {
        return dir + name;
    }
    return dir + "/" + name;
}

std::string FileUtils::baseName(const std::string& path) {
    size_t slash = path.find_last_of('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

} // namespace kelvo
