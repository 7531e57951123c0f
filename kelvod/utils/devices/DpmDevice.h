#pragma once

#include <stdint.h>

#include <string>
#include <vector>

namespace kelvo {

// Argument layouts of "/dev/dpm_ldm" (little-endian).

// One monitored IP block's record; its fields are read by the DPM handler.
struct dpm_ip_record_t {
    uint8_t bytes[96];
};
static_assert(sizeof(dpm_ip_record_t) == 96, "ip record layout");

// What a record holds: the block's name (not always terminated), then its
// times in ms since the statistics were last reset.
struct dpm_ip_fields_t {
    char name[64];
    int64_t offTime;
    int64_t busyTime;
    int64_t busyTimeLowVoltage;
    int64_t idleTime;
};
static_assert(sizeof(dpm_ip_fields_t) == sizeof(dpm_ip_record_t), "ip record fields");

// Head of the IP data buffer: capacity in, count out; the records follow.
struct dpm_ip_header_t {
    int32_t count;
    int32_t padding;
};
static_assert(sizeof(dpm_ip_header_t) == 8, "ip data head layout");

// One block of the DDR buffer as large as it can be: a name, then one value
// per frequency step. The kernel writes two blocks of 64 + 8 x steps bytes.
struct dpm_ddr_block_t {
    char name[64];
    int64_t values[32];
};
static_assert(sizeof(dpm_ddr_block_t) == 320, "ddr block layout");

// The two DDR blocks read ("DDR_FREQ_TIME" and "DDR_FREQ_FLUX", either order).
struct dpm_ddr_data_t {
    std::string names[2];
    std::vector<int64_t> values[2];
};

// The power-monitoring device. Every operation opens the device, issues one
// request and closes it: -10 when the device cannot be opened, -2 when the
// request fails or reads a negative value, -5 for a bad argument.
class DpmDevice {
public:
    static constexpr const char* kPath = "/dev/dpm_ldm";

    // Request numbers (the ABI; the real argument sizes are passed on their
    // own: the data requests' size bits do not match them).
    static constexpr uint32_t kGetVersion = 0x80046B01u;
    static constexpr uint32_t kSetEnable = 0x40046B02u;
    static constexpr uint32_t kSetPeriod = 0x40046B03u;
    static constexpr uint32_t kGetIpCount = 0x80046B04u;
    static constexpr uint32_t kGetIpData = 0x80086B05u;
    static constexpr uint32_t kGetPeriod = 0xC0046B06u;
    static constexpr uint32_t kGetDdrFreqCount = 0xC0046B07u;
    static constexpr uint32_t kGetDdrData = 0xC0006B08u;

    static constexpr int32_t kMaxIpCount = 256;
    static constexpr int32_t kMaxDdrSteps = 32;

    // True when the device can be opened.
    static bool isReady();

    // The value getters return the value read (>= 0).
    static int getVersion();
    static int setEnable(int32_t enable);
    static int setPeriod(int32_t period);
    // Capped at kMaxIpCount.
    static int getIpCount();
    // Reads at most capacity (1..kMaxIpCount) records into records; the
    // kernel's count beyond the capacity is cut to it. Returns 0.
    static int getIpData(int32_t capacity, std::vector<dpm_ip_record_t>* records);
    static int getPeriod(int32_t period);
    // Capped at kMaxDdrSteps.
    static int getDdrFreqCount();
    // Reads the two DDR blocks of steps (0..kMaxDdrSteps) values each. The
    // request carries the size of those two blocks, while the buffer behind
    // it always has room for kMaxDdrSteps. Names are bounded by their field.
    // Returns 0.
    static int getDdrData(int32_t steps, dpm_ddr_data_t* data);
};

} // namespace kelvo
