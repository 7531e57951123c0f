#include <cutils/sockets.h>
#include <errno.h>
#include <stddef.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <string>

#include "kelvo/RootPath.h"

namespace {

// Creates every missing folder of the path's parent.
void makeParents(const std::string& path) {
    for (size_t i = 1; i < path.size(); ++i) {
        if (path[i] == '/') {
            mkdir(path.substr(0, i).c_str(), 0755);
        }
    }
}

// Fills the address; false (errno ENAMETOOLONG or EINVAL) when it does not fit.
bool makeAddress(const char* name, int namespaceId, sockaddr_un* addr, socklen_t* len,
                 std::string* file) {
    if (name == nullptr || name[0] == '\0') {
        errno = EINVAL;
        return false;
    }
    memset(addr, 0, sizeof(*addr));
    addr->sun_family = AF_LOCAL;
    std::string root = kelvo::RootPath::root();
    if (namespaceId == ANDROID_SOCKET_NAMESPACE_ABSTRACT && root.empty()) {
        size_t n = strlen(name);
        if (n + 1 > sizeof(addr->sun_path)) {
            errno = ENAMETOOLONG;
            return false;
        }
        memcpy(addr->sun_path + 1, name, n);
        *len = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + n);
        file->clear();
        return true;
    }
    if (namespaceId == ANDROID_SOCKET_NAMESPACE_ABSTRACT ||
        namespaceId == ANDROID_SOCKET_NAMESPACE_RESERVED) {
        *file = root + "/dev/socket/" + name;
    } else if (namespaceId == ANDROID_SOCKET_NAMESPACE_FILESYSTEM) {
        *file = kelvo::RootPath::resolve(name);
    } else {
        errno = EINVAL;
        return false;
    }
    if (file->size() + 1 > sizeof(addr->sun_path)) {
        errno = ENAMETOOLONG;
        return false;
    }
    memcpy(addr->sun_path, file->data(), file->size());
    *len = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + file->size() + 1);
    return true;
}

}  // namespace

extern "C" int socket_local_server(const char* name, int namespaceId, int type) {
    sockaddr_un addr;
    socklen_t len = 0;
    std::string file;
    if (!makeAddress(name, namespaceId, &addr, &len, &file)) {
        return -1;
    }
    int fd = socket(AF_LOCAL, type | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return -1;
    }
    if (!file.empty()) {
        makeParents(file);
        unlink(file.c_str());
    }
    if (bind(fd, reinterpret_cast<sockaddr*>(&addr), len) < 0 ||
        ((type & 0xf) == SOCK_STREAM && listen(fd, 16) < 0)) {
        int saved = errno;
        close(fd);
        errno = saved;
        return -1;
    }
    if (!file.empty()) {
        // Reachable by every user, as an abstract socket is.
        chmod(file.c_str(), 0666);
    }
    return fd;
}

extern "C" int socket_local_client(const char* name, int namespaceId, int type) {
    sockaddr_un addr;
    socklen_t len = 0;
    std::string file;
    if (!makeAddress(name, namespaceId, &addr, &len, &file)) {
        return -1;
    }
    int fd = socket(AF_LOCAL, type | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return -1;
    }
    int ret;
    do {
        ret = connect(fd, reinterpret_cast<sockaddr*>(&addr), len);
    } while (ret < 0 && errno == EINTR);
    if (ret < 0) {
        int saved = errno;
        close(fd);
        errno = saved;
        return -1;
    }
    return fd;
}
