#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>
#include <vector>

namespace kelvo {

// The kernel's per-process CPU report, the payload of a buffered-log entry
// of the sender "kelvo_driver" (little-endian, packed):
//   int64 timestamp   echo of the request
//   int32 mode        echo of the request
//   int32 state       1: processes alive, 0: processes that died since the last report
//   int32 count
//   count records of 65 bytes: uint32 uid, int32 pid, int64 CPU time µs,
//   uint8 name type (0 none, 1 process name, 2 kernel-thread name), char[48] name
struct CpuReport {
    static constexpr size_t kHeaderSize = 20;
    static constexpr size_t kRecordSize = 65;
    static constexpr size_t kNameSize = 48;

    enum name_type : uint8_t {
        NAME_NONE = 0,
        NAME_PROCESS = 1,
        NAME_KERNEL_THREAD = 2,
    };
    enum report_state : int32_t {
        STATE_DEAD = 0,
        STATE_ALIVE = 1,
    };

    struct Record {
        uint32_t uid;
        int32_t pid;
        int64_t timeUs;
        uint8_t nameType;
        std::string name;  // at most kNameSize bytes, never past the field
    };

    int64_t timestamp = 0;
    int32_t mode = 0;
    int32_t state = 0;
    std::vector<Record> records;

    // Decodes a whole report. -5 when the data is shorter than the header or
    // than the count's records (a negative count included): nothing is kept.
    static int32_t parse(const uint8_t* data, size_t size, CpuReport* out);
    // The wire form (tests, the simulator).
    static std::string encode(int64_t timestamp, int32_t mode, int32_t state,
                              const std::vector<Record>& records);

    // Threads of uid 0 and 1000 named after a known pool share that pool's
    // name ("kernel_kworker/0:1" -> "kernel_kworker"); other names stay.
    static std::string uniformThreadName(uint32_t uid, const std::string& name);
};

}  // namespace kelvo
