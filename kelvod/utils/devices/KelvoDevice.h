#pragma once

#include <stdint.h>

#include <string>

namespace kelvo {

// Argument layouts of "/dev/kelvo" (little-endian).

// Transmit block of the report requests: the kernel echoes the time stamp
// and the reason in the report it sends later, so the report can be matched
// to its request.
#pragma pack(push, 1)
struct dev_transmit_t {
    int32_t length;  // payload bytes after this field: 12
    int64_t timestamp;
    int32_t reason;
};
#pragma pack(pop)
static_assert(sizeof(dev_transmit_t) == 16, "transmit block layout");

// One GPU frequency step; the steps start at byte 4 of the report, so the
// 64-bit fields are not aligned.
#pragma pack(push, 1)
struct gpu_freq_entry_t {
    int64_t frequency;
    int64_t busyUs;
    int64_t idleUs;
};
struct gpu_info_t {
    int32_t count;
    gpu_freq_entry_t entries[20];
};
#pragma pack(pop)
static_assert(sizeof(gpu_freq_entry_t) == 24, "gpu step layout");
static_assert(sizeof(gpu_info_t) == 484, "gpu report layout");

struct process_name_t {
    int32_t reserved;  // 0
    int32_t pid;
    char threadName[16];
    char processName[48];  // filled by the kernel, not always terminated
};
static_assert(sizeof(process_name_t) == 72, "process name layout");

// The daemon's kernel statistics device. Every operation opens the device,
// issues one request and closes it: 0 on success, -10 when the device cannot
// be opened, -2 when the request fails or its answer is unusable, -5 for a
// null argument.
class KelvoDevice {
public:
    static constexpr const char* kPath = "/dev/kelvo";

    // Request numbers (the ABI; some size bits differ from the real layout
    // sizes, which are passed on their own).
    static constexpr uint32_t kSetGpuEnable = 0x40016B01u;
    static constexpr uint32_t kGetGpuInfo = 0x80046B02u;
    static constexpr uint32_t kRequestPidCpuTime = 0x40046B03u;
    static constexpr uint32_t kGetProcessName = 0xC0046B04u;
    static constexpr uint32_t kSetLogStatsEnable = 0x40016B05u;
    static constexpr uint32_t kRequestKworkerInfo = 0x40086B06u;
    static constexpr uint32_t kRequestUeventInfo = 0x40086B07u;
    static constexpr uint32_t kSetBrightnessInfoEnable = 0x40016B08u;
    static constexpr uint32_t kGetBrightnessInfo = 0x80046B09u;
    static constexpr uint32_t kEnablePidCpuTime = 0x40016B0Au;
    static constexpr uint32_t kSetBinderStatsEnable = 0x40016B0Bu;
    static constexpr uint32_t kRequestBinderStats = 0x40046B0Du;

    static constexpr int32_t kMaxGpuSteps = 20;

    static dev_transmit_t makeTransmit(int64_t timestamp, int32_t reason);

    static int setGpuEnable(bool enable);
    // On success the report's count is within 0..kMaxGpuSteps; any other
    // count is refused (-2).
    static int getGpuInfo(gpu_info_t* info);
    // The per-process CPU time report arrives later as a buffered log entry.
    static int requestPidCpuTime(const dev_transmit_t* transmit);
    // The name is bounded by its field; an empty name is a failure (-2).
    static int getProcessName(int32_t pid, const char* threadName, std::string* processName);
    static int setLogStatsEnable(bool enable);
    static int requestKworkerInfo(int64_t timestamp);
    static int requestUeventInfo(int64_t timestamp);
    static int setBrightnessInfoEnable(bool enable);
    static int getBrightnessInfo(uint32_t* brightness);
    static int enablePidCpuTime(bool enable);
    static int setBinderStatsEnable(bool enable);
    static int requestBinderStats(const dev_transmit_t* transmit);
};

} // namespace kelvo
