#include "handlers/SystemRecords.h"

#include <string.h>

namespace kelvo {

namespace {

template <typename T>
T readAt(const uint8_t* data, size_t offset) {
    T value;
    memcpy(&value, data + offset, sizeof(T));
    return value;
}

// A text of at most `size` bytes, not always terminated.
std::string textAt(const uint8_t* data, size_t offset, size_t size) {
    const char* text = reinterpret_cast<const char*>(data + offset);
    return std::string(text, strnlen(text, size));
}

// The echo and the entry count; the number of entries when they fit.
int32_t countedEntries(const uint8_t* data, size_t size, size_t entrySize,
                       SystemRecords::echo* head) {
    if (data == nullptr || size < SystemRecords::kEchoSize + 4) {
        return -2;
    }
    head->time = readAt<int64_t>(data, 0);
    head->reason = readAt<int32_t>(data, 8);
    int32_t n = readAt<int32_t>(data, SystemRecords::kEchoSize);
    size_t room = (size - SystemRecords::kEchoSize - 4) / entrySize;
    if (n < 0 || n > SystemRecords::kMaxEntries || static_cast<size_t>(n) > room) {
        return -2;
    }
    return n;
}

}  // namespace

int32_t SystemRecords::parseKworker(const uint8_t* data, size_t size, echo* head,
                                    std::vector<kworker>* out) {
    int32_t n = countedEntries(data, size, kKworkerEntrySize, head);
    if (n < 0) {
        return -2;
    }
    out->reserve(n);
    for (int32_t i = 0; i < n; ++i) {
        size_t at = kEchoSize + 4 + i * kKworkerEntrySize;
        out->push_back({textAt(data, at, kSymbolSize), readAt<int64_t>(data, at + kSymbolSize),
                        readAt<int64_t>(data, at + kSymbolSize + 8)});
    }
    return 0;
}

int32_t SystemRecords::parseUevent(const uint8_t* data, size_t size, echo* head,
                                   std::vector<uevent>* out) {
    int32_t n = countedEntries(data, size, kUeventEntrySize, head);
    if (n < 0) {
        return -2;
    }
    out->reserve(n);
    for (int32_t i = 0; i < n; ++i) {
        size_t at = kEchoSize + 4 + i * kUeventEntrySize;
        out->push_back({textAt(data, at, kDevpathSize), readAt<int32_t>(data, at + kDevpathSize),
                        readAt<int32_t>(data, at + kDevpathSize + 4)});
    }
    return 0;
}

int32_t SystemRecords::parseBinderStats(const uint8_t* data, size_t size, echo* head,
                                        std::vector<binder_entry>* out) {
    int32_t n = countedEntries(data, size, kBinderEntrySize, head);
    if (n < 0) {
        return -2;
    }
    out->reserve(n);
    for (int32_t i = 0; i < n; ++i) {
        size_t at = kBinderHeaderSize + i * kBinderEntrySize;
        binder_entry e;
        e.serviceUid = readAt<int32_t>(data, at);
        e.servicePid = readAt<int32_t>(data, at + 4);
        e.service = textAt(data, at + 8, kBinderNameSize);
        e.clientUid = readAt<int32_t>(data, at + 56);
        e.clientPid = readAt<int32_t>(data, at + 60);
        e.client = textAt(data, at + 64, kBinderNameSize);
        e.count = readAt<int32_t>(data, at + 112);
        out->push_back(std::move(e));
    }
    return 0;
}

namespace {

// The count of a framework record when its entries fit.
int32_t frameworkEntries(const uint8_t* data, size_t size, size_t entrySize) {
    if (data == nullptr || size < 4) {
        return -2;
    }
    int32_t n = readAt<int32_t>(data, 0);
    if (n < 0 || n > SystemRecords::kMaxEntries || static_cast<size_t>(n) > (size - 4) / entrySize) {
        return -2;
    }
    return n;
}

}  // namespace

int32_t SystemRecords::parseMobilePhone(const uint8_t* data, size_t size,
                                        std::vector<mobile_phone>* out) {
    int32_t n = frameworkEntries(data, size, kMobilePhoneEntrySize);
    if (n < 0) {
        return -2;
    }
    for (int32_t i = 0; i < n; ++i) {
        size_t at = 4 + i * kMobilePhoneEntrySize;
        out->push_back({readAt<int32_t>(data, at), readAt<int32_t>(data, at + 4),
                        readAt<int32_t>(data, at + 8), readAt<int32_t>(data, at + 12),
                        readAt<int32_t>(data, at + 16)});
    }
    return 0;
}

int32_t SystemRecords::parsePackageVersions(const uint8_t* data, size_t size,
                                            std::vector<package_version>* out) {
    int32_t n = frameworkEntries(data, size, kPackageEntrySize);
    if (n < 0) {
        return -2;
    }
    for (int32_t i = 0; i < n; ++i) {
        size_t at = 4 + i * kPackageEntrySize;
        out->push_back({textAt(data, at, kPackageNameSize),
                        textAt(data, at + kPackageNameSize, kPackageVersionSize)});
    }
    return 0;
}

int32_t SystemRecords::parseDailyStatistics(const uint8_t* data, size_t size,
                                            daily_statistics* out) {
    if (data == nullptr || size < kDailyStatisticsSize) {
        return -2;
    }
    out->day = readAt<int64_t>(data, 4);
    out->free = readAt<int64_t>(data, 12);
    out->available = readAt<int64_t>(data, 20);
    for (int i = 0; i < 8; ++i) {
        out->settings[i] = readAt<int32_t>(data, 28 + 4 * i);
    }
    return 0;
}

}  // namespace kelvo
