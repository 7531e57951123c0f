#include "kelvo/Processors.h"

#include <dirent.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include "kelvo/RootPath.h"

namespace kelvo {

namespace {

constexpr const char* kCpuDir = "/sys/devices/system/cpu";

// One decimal index below kMaxCores; advances *p past it.
bool readIndex(const char** p, long* out) {
    const char* s = *p;
    if (*s < '0' || *s > '9') {
        return false;
    }
    long v = 0;
    while (*s >= '0' && *s <= '9') {
        v = v * 10 + (*s - '0');
        if (v >= Processors::kMaxCores) {
            return false;
        }
        ++s;
    }
    *p = s;
    *out = v;
    return true;
}

int32_t countFromPossible() {
    std::string path = RootPath::resolve(std::string(kCpuDir) + "/possible");
    FILE* f = fopen(path.c_str(), "re");
    if (f == nullptr) {
        return -1;
    }
    char buf[256] = {};
    size_t n = fread(buf, 1, sizeof(buf) - 1, f);
    fclose(f);
    buf[n] = '\0';
    return Processors::countFromList(buf);
}

int32_t countFromFolders() {
    std::string path = RootPath::resolve(kCpuDir);
    DIR* dir = opendir(path.c_str());
    if (dir == nullptr) {
        return -1;
    }
    int32_t count = -1;
    while (struct dirent* e = readdir(dir)) {
        const char* p = e->d_name;
        if (strncmp(p, "cpu", 3) != 0) {
            continue;
        }
        p += 3;
        long index = 0;
        if (readIndex(&p, &index) && *p == '\0' && index + 1 > count) {
            count = static_cast<int32_t>(index + 1);
        }
    }
    closedir(dir);
    return count;
}

}  // namespace

int32_t Processors::countFromList(const char* text) {
    if (text == nullptr) {
        return -1;
    }
    const char* p = text;
    long highest = -1;
    for (;;) {
        long first = 0;
        if (!readIndex(&p, &first)) {
            return -1;
        }
        long last = first;
        if (*p == '-') {
            ++p;
            if (!readIndex(&p, &last) || last < first) {
                return -1;
            }
        }
        if (last > highest) {
            highest = last;
        }
        if (*p != ',') {
            break;
        }
        ++p;
    }
    while (*p == '\n' || *p == ' ') {
        ++p;
    }
    return *p == '\0' ? static_cast<int32_t>(highest + 1) : -1;
}

int32_t Processors::configuredCount() {
    int32_t count = countFromPossible();
    if (count > 0) {
        return count;
    }
    count = countFromFolders();
    if (count > 0) {
        return count;
    }
    long conf = sysconf(_SC_NPROCESSORS_CONF);
    return conf > 0 && conf < kMaxCores ? static_cast<int32_t>(conf) : -1;
}

}  // namespace kelvo
