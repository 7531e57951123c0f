#include <android/log.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <mutex>
#include <string>

#include "kelvo/PowerLog.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"

namespace {

void makeParents(const std::string& path) {
    for (size_t pos = path.find('/', 1); pos != std::string::npos;
         pos = path.find('/', pos + 1)) {
        mkdir(path.substr(0, pos).c_str(), 0775);
    }
}

const char* orEmpty(const char* s) {
    return s != nullptr ? s : "";
}

} // namespace

extern "C" int __android_logPower_print(int priority, int code, const char* tag,
                                        const char* category, const char* text) {
    static std::mutex* lock = new std::mutex();
    struct timespec ts = {};
    kelvo::WallClock::getTime(&ts);
    long long ms = static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
    char head[96];
    snprintf(head, sizeof(head), "%lld\t%d\t%d\t", ms, priority, code);
    std::string line = head;
    line.append(orEmpty(tag)).append("\t").append(orEmpty(category)).append("\t");
    line.append(orEmpty(text)).append("\n");

    std::string path = kelvo::RootPath::resolve(KELVO_POWER_LOG_FILE);
    std::lock_guard<std::mutex> guard(*lock);
    int fd = open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (fd < 0) {
        makeParents(path);
        fd = open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
        if (fd < 0) {
            return -1;
        }
    }
    ssize_t n = write(fd, line.data(), line.size());
    close(fd);
    return n == static_cast<ssize_t>(line.size()) ? 0 : -1;
}
