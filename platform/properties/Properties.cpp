#include <cutils/properties.h>

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <string>

#include "kelvo/HostProperties.h"
#include "kelvo/RootPath.h"

namespace {

const char* const kBuildPropFiles[] = {"/system/build.prop", "/vendor/build.prop"};
const char* const kPersistDir = "/data/property";

struct PropertyStore {
    std::mutex lock;
    std::map<std::string, std::string> values;
    bool loaded = false;
};

// Created on first use and never destroyed, so that property reads are safe
// during static initialisation and while the process exits.
PropertyStore& store() {
    static PropertyStore* s = new PropertyStore();
    return *s;
}

bool startsWith(const std::string& s, const char* prefix) {
    return s.compare(0, strlen(prefix), prefix) == 0;
}

std::string trim(const std::string& s) {
    size_t b = s.find_first_not_of(" \t\r\n");
    if (b == std::string::npos) {
        return std::string();
    }
    size_t e = s.find_last_not_of(" \t\r\n");
    return s.substr(b, e - b + 1);
}

void loadBuildProp(PropertyStore& s, const std::string& path) {
    FILE* f = fopen(path.c_str(), "re");
    if (f == nullptr) {
        return;
    }
    // Whole lines, however long: a fixed buffer would split an overlong
    // comment or value and read its tail as a line of its own.
    char* line = nullptr;
    size_t lineCapacity = 0;
    while (getline(&line, &lineCapacity, f) != -1) {
        std::string text = trim(line);
        if (text.empty() || text[0] == '#') {
            continue;
        }
        size_t eq = text.find('=');
        if (eq == std::string::npos) {
            continue;
        }
        std::string key = trim(text.substr(0, eq));
        std::string value = trim(text.substr(eq + 1));
        if (key.empty() || key.size() >= PROP_NAME_MAX || value.size() >= PROP_VALUE_MAX) {
            continue;
        }
        // Like init, the first definition of a read-only property wins.
        if (startsWith(key, "ro.") && s.values.count(key) != 0) {
            continue;
        }
        s.values[key] = value;
    }
    free(line);
    fclose(f);
}

void loadPersist(PropertyStore& s) {
    std::string dir = kelvo::RootPath::resolve(kPersistDir);
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return;
    }
    while (struct dirent* entry = readdir(d)) {
        std::string name = entry->d_name;
        if (!startsWith(name, "persist.") || name.size() >= PROP_NAME_MAX) {
            continue;
        }
        int fd = open((dir + "/" + name).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
        if (fd < 0) {
            continue;
        }
        char buf[PROP_VALUE_MAX];
        ssize_t n = read(fd, buf, sizeof(buf) - 1);
        close(fd);
        if (n < 0) {
            continue;
        }
        s.values[name] = std::string(buf, static_cast<size_t>(n));
    }
    closedir(d);
}

void loadLocked(PropertyStore& s) {
    if (s.loaded) {
        return;
    }
    s.values.clear();
    for (const char* file : kBuildPropFiles) {
        loadBuildProp(s, kelvo::RootPath::resolve(file));
    }
    loadPersist(s);
    s.loaded = true;
}

bool writePersist(const std::string& key, const std::string& value) {
    std::string data = kelvo::RootPath::resolve("/data");
    std::string dir = kelvo::RootPath::resolve(kPersistDir);
    mkdir(data.c_str(), 0771);
    mkdir(dir.c_str(), 0700);
    std::string tmp = dir + "/.temp." + key;
    int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (fd < 0) {
        return false;
    }
    bool ok = write(fd, value.data(), value.size()) == static_cast<ssize_t>(value.size());
    ok = fsync(fd) == 0 && ok;
    close(fd);
    if (!ok || rename(tmp.c_str(), (dir + "/" + key).c_str()) != 0) {
        unlink(tmp.c_str());
        return false;
    }
    return true;
}

bool lookup(const char* key, std::string* out) {
    if (key == nullptr) {
        return false;
    }
    PropertyStore& s = store();
    std::lock_guard<std::mutex> guard(s.lock);
    loadLocked(s);
    auto it = s.values.find(key);
    if (it == s.values.end()) {
        return false;
    }
    *out = it->second;
    return true;
}

} // namespace

extern "C" int property_get(const char* key, char* value, const char* default_value) {
    if (value == nullptr) {
        return -1;
    }
    std::string found;
    const char* src = nullptr;
    if (lookup(key, &found) && !found.empty()) {
        src = found.c_str();
    } else if (default_value != nullptr) {
        src = default_value;
    }
    if (src == nullptr) {
        value[0] = '\0';
        return 0;
    }
    size_t len = strnlen(src, PROPERTY_VALUE_MAX - 1);
    memcpy(value, src, len);
    value[len] = '\0';
    return static_cast<int>(len);
}

extern "C" int8_t property_get_bool(const char* key, int8_t default_value) {
    char buf[PROPERTY_VALUE_MAX];
    if (property_get(key, buf, "") <= 0) {
        return default_value;
    }
    if (strcmp(buf, "1") == 0 || strcmp(buf, "y") == 0 || strcmp(buf, "yes") == 0 ||
        strcmp(buf, "on") == 0 || strcmp(buf, "true") == 0) {
        return 1;
    }
    if (strcmp(buf, "0") == 0 || strcmp(buf, "n") == 0 || strcmp(buf, "no") == 0 ||
        strcmp(buf, "off") == 0 || strcmp(buf, "false") == 0) {
        return 0;
    }
    return default_value;
}

static int64_t getSigned(const char* key, int64_t minValue, int64_t maxValue,
                         int64_t default_value) {
    char buf[PROPERTY_VALUE_MAX];
    if (property_get(key, buf, "") <= 0) {
        return default_value;
    }
    errno = 0;
    char* end = nullptr;
    long long v = strtoll(buf, &end, 0);
    if (errno != 0 || end == buf || *end != '\0' || v < minValue || v > maxValue) {
        return default_value;
    }
    return v;
}

extern "C" int64_t property_get_int64(const char* key, int64_t default_value) {
    return getSigned(key, INT64_MIN, INT64_MAX, default_value);
}

extern "C" int32_t property_get_int32(const char* key, int32_t default_value) {
    return static_cast<int32_t>(getSigned(key, INT32_MIN, INT32_MAX, default_value));
}

extern "C" int property_set(const char* key, const char* value) {
    if (key == nullptr || key[0] == '\0' || strlen(key) >= PROP_NAME_MAX) {
        return -1;
    }
    std::string v = value != nullptr ? value : "";
    if (v.size() >= PROP_VALUE_MAX) {
        return -1;
    }
    PropertyStore& s = store();
    std::lock_guard<std::mutex> guard(s.lock);
    loadLocked(s);
    std::string k = key;
    if (startsWith(k, "ro.") && s.values.count(k) != 0) {
        return -1; // read-only once set
    }
    if (startsWith(k, "persist.") && !writePersist(k, v)) {
        return -1;
    }
    s.values[k] = v;
    return 0;
}

namespace kelvo {

void HostProperties::reload() {
    PropertyStore& s = store();
    std::lock_guard<std::mutex> guard(s.lock);
    s.loaded = false;
    loadLocked(s);
}

void HostProperties::setForTest(const char* key, const char* value) {
    if (key == nullptr) {
        return;
    }
    PropertyStore& s = store();
    std::lock_guard<std::mutex> guard(s.lock);
    loadLocked(s);
    s.values[key] = value != nullptr ? value : "";
}

} // namespace kelvo
