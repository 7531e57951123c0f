#include "utils/KelvoUtils.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "kelvo/RootPath.h"

namespace kelvo {

int32_t KelvoUtils::deleteFile(const char* path) {
    std::string resolved = RootPath::resolve(path);
    if (unlink(resolved.c_str()) != 0) {
        KLOGE("Failed to remove file: %s, %s", path != nullptr ? path : "", strerror(errno));
        return -1;
    }
    KLOGD("Successfully remove the file: %s", path);
    return 0;
}

void KelvoUtils::deleteDatabaseFiles(const char* path) {
    if (path == nullptr) {
        return;
    }
    // A database already moved aside is no failure to report.
    if (access(RootPath::resolve(path).c_str(), F_OK) == 0) {
        deleteFile(path);
    }
    for (const char* suffix : {"-journal", "-wal", "-shm"}) {
        std::string companion = std::string(path) + suffix;
        if (access(RootPath::resolve(companion).c_str(), F_OK) == 0) {
            deleteFile(companion.c_str());
        }
    }
}

namespace {

android::String8 quote(const char* value, char mark) {
    android::String8 out;
    out.append(&mark, 1);
    for (const char* p = value != nullptr ? value : ""; *p != '\0'; ++p) {
        if (*p == mark) {
            out.append(&mark, 1);
        }
        out.append(p, 1);
    }
    out.append(&mark, 1);
    return out;
}

} // namespace

android::String8 KelvoUtils::quoteSqlText(const char* value) {
    return quote(value, '\'');
}

android::String8 KelvoUtils::quoteSqlIdentifier(const char* name) {
    return quote(name, '"');
}


int64_t KelvoUtils::scaleEnergy(int64_t energy, double ratio) {
    if (!(ratio > 0.0)) {
        return energy;
    }
    double product = static_cast<double>(energy) * ratio;
    // 2^63 is exact in double; anything at or past it does not fit.
    constexpr double kLimit = 9223372036854775808.0;
    if (product >= kLimit) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT64_MAX;
    }
    if (product < -kLimit) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT64_MIN;
    }
    return static_cast<int64_t>(product);
}

int32_t KelvoUtils::saturateInt32(int64_t value) {
    if (value > INT32_MAX) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT32_MAX;
    }
    if (value < INT32_MIN) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT32_MIN;
    }
    return static_cast<int32_t>(value);
}

int32_t KelvoUtils::saturateInt32(double value) {
    if (value != value) {
        HealthCounters::add(Health::ValuesSaturated);
        return 0;
    }
    if (value >= 2147483648.0) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT32_MAX;
    }
    if (value <= -2147483649.0) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT32_MIN;
    }
    return static_cast<int32_t>(value);
}

} // namespace kelvo
