#include "handlers/components/CpuReport.h"

#include <string.h>

namespace kelvo {

namespace {

const char* const kSystemPools[] = {
    "system_server_Binder", "system_server_HwBinder",  "system_server_Thread",
    "system_server_pool",   "system_server_AsyncTask", "system_server_SyncHandler",
    "system_server_Timer",
};
const char* const kKernelPools[] = {
    "kernel_kworker", "kernel_watchdog", "kernel_migration", "kernel_ksoftirqd", "kernel_jbd2/sdd",
};

template <typename T>
T readAt(const uint8_t* data) {
    T value;
    memcpy(&value, data, sizeof(value));
    return value;
}

template <typename T>
void append(std::string& out, T value) {
    out.append(reinterpret_cast<const char*>(&value), sizeof(value));
}

}  // namespace

int32_t CpuReport::parse(const uint8_t* data, size_t size, CpuReport* out) {
    if (data == nullptr || out == nullptr || size < kHeaderSize) {
        return -5;
    }
    int32_t count = readAt<int32_t>(data + 16);
    // In 64 bits: a count near INT32_MAX must not wrap the product.
    if (count < 0 ||
        static_cast<uint64_t>(kHeaderSize) + static_cast<uint64_t>(count) * kRecordSize > size) {
        return -5;
    }
    out->timestamp = readAt<int64_t>(data);
    out->mode = readAt<int32_t>(data + 8);
    out->state = readAt<int32_t>(data + 12);
    out->records.clear();
    out->records.reserve(static_cast<size_t>(count));
    const uint8_t* p = data + kHeaderSize;
    for (int32_t i = 0; i < count; ++i, p += kRecordSize) {
        Record r;
        r.uid = readAt<uint32_t>(p);
        r.pid = readAt<int32_t>(p + 4);
        r.timeUs = readAt<int64_t>(p + 8);
        r.nameType = p[16];
        const char* name = reinterpret_cast<const char*>(p + 17);
        r.name.assign(name, strnlen(name, kNameSize));
        out->records.push_back(std::move(r));
    }
    return 0;
}

std::string CpuReport::encode(int64_t timestamp, int32_t mode, int32_t state,
                              const std::vector<Record>& records) {
    std::string out;
    out.reserve(kHeaderSize + records.size() * kRecordSize);
    append(out, timestamp);
    append(out, mode);
    append(out, state);
    append(out, static_cast<int32_t>(records.size()));
    for (const Record& r : records) {
        append(out, r.uid);
        append(out, r.pid);
        append(out, r.timeUs);
        append(out, r.nameType);
        char name[kNameSize] = {};
        memcpy(name, r.name.data(), r.name.size() < kNameSize ? r.name.size() : kNameSize);
        out.append(name, kNameSize);
    }
    return out;
}

std::string CpuReport::uniformThreadName(uint32_t uid, const std::string& name) {
    if (uid == 1000) {
        for (const char* prefix : kSystemPools) {
            if (name.compare(0, strlen(prefix), prefix) == 0) {
                return prefix;
            }
        }
    } else if (uid == 0) {
        for (const char* prefix : kKernelPools) {
            if (name.compare(0, strlen(prefix), prefix) == 0) {
                return prefix;
            }
        }
    }
    return name;
}

}  // namespace kelvo
