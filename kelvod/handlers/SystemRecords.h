#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>
#include <vector>

namespace kelvo {

// The binary records pushed to the system handler over the buffered log,
// each checked against its entry before anything is allocated. A record
// from the kernel driver starts with the echo of its request (int64 time,
// int32 reason or kind); counts follow as int32.
class SystemRecords {
public:
    static constexpr size_t kEchoSize = 12;
    static constexpr size_t kSymbolSize = 64;
    static constexpr size_t kDevpathSize = 128;
    static constexpr size_t kKworkerEntrySize = kSymbolSize + 16;  // symbol, count, time
    static constexpr size_t kUeventEntrySize = kDevpathSize + 8;   // devpath, action, count
    static constexpr size_t kBinderHeaderSize = 16;                // echo, count
    static constexpr size_t kBinderEntrySize = 116;
    static constexpr size_t kBinderNameSize = 48;
    static constexpr size_t kDailyStatisticsSize = 60;
    static constexpr size_t kMobilePhoneEntrySize = 20;  // five int32
    static constexpr size_t kPackageNameSize = 128;
    static constexpr size_t kPackageVersionSize = 32;
    static constexpr size_t kPackageEntrySize = kPackageNameSize + kPackageVersionSize;
    static constexpr int32_t kMaxEntries = 4096;

    struct echo {
        int64_t time = 0;
        int32_t reason = 0;
    };
    struct kworker {
        std::string symbol;
        int64_t count;
        int64_t time;
    };
    struct uevent {
        std::string devpath;
        int32_t action;
        int32_t count;
    };
    struct binder_entry {
        int32_t serviceUid;
        int32_t servicePid;
        std::string service;
        int32_t clientUid;
        int32_t clientPid;
        std::string client;
        int32_t count;
    };
    struct mobile_phone {
        int32_t subId;
        int32_t mcc;
        int32_t mnc;
        int32_t dataSwitch;
        int32_t voiceSwitch;
    };
    struct package_version {
        std::string name;
        std::string version;
    };
    struct daily_statistics {
        int64_t day = 0;
        int64_t free = 0;
        int64_t available = 0;
        int32_t settings[8] = {};  // sdcard, usb, wlan, mobile, power saving, aod, face, inscreen
    };

    // Each returns 0, or -2 for a record whose lengths or counts do not
    // fit it (nothing is returned then).
    static int32_t parseKworker(const uint8_t* data, size_t size, echo* head,
                                std::vector<kworker>* out);
    static int32_t parseUevent(const uint8_t* data, size_t size, echo* head,
                               std::vector<uevent>* out);
    static int32_t parseBinderStats(const uint8_t* data, size_t size, echo* head,
                                    std::vector<binder_entry>* out);
    // Framework records: int32 n, then n entries.
    static int32_t parseMobilePhone(const uint8_t* data, size_t size,
                                    std::vector<mobile_phone>* out);
    static int32_t parsePackageVersions(const uint8_t* data, size_t size,
                                        std::vector<package_version>* out);
    static int32_t parseDailyStatistics(const uint8_t* data, size_t size, daily_statistics* out);
};

}  // namespace kelvo
