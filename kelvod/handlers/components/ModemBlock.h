#pragma once

#include <stddef.h>
#include <stdint.h>

#include <vector>

namespace kelvo {

// The modem's power-management statistics block, as the manager service
// hands it over (little-endian, packed, records at any offset):
//   uint32 n            record count
//   uint32 data length  of the records (told in a debug line, not trusted)
//   n records: uint32 L, uint32 SIM index, uint32 module id, L bytes of data
// Every length and count is checked in size_t against the bytes present
// before anything is read; parsing stops at the first record that does not
// fit or that no decoder can take, and the records before it are kept.
struct ModemBlock {
    static constexpr size_t kHeaderSize = 8;
    static constexpr size_t kRecordHeaderSize = 12;
    // The largest block taken (the manager service refuses larger ones too).
    static constexpr size_t kMaxBytes = 1024 * 1024;
    static constexpr uint32_t kSimCount = 3;
    // Modules 0 to 11 have decoders; 12 carries PAM wake-up items.
    static constexpr uint32_t kModuleCount = 13;

    enum fault : int32_t {
        FAULT_NONE = 0,
        FAULT_SHORT = 1,       // fewer bytes than the header
        FAULT_TOO_LONG = 2,    // more than kMaxBytes
        FAULT_CUT_HEADER = 3,  // a record header past the end
        FAULT_CUT_DATA = 4,    // a record's data past the end
        FAULT_SIM = 5,         // SIM index 3 or more
        FAULT_MODULE = 6,      // module 13 or more
        FAULT_COUNT = 7,       // n larger than the records present
    };

    struct Record {
        uint32_t length;
        uint32_t sim;
        uint32_t module;
        const uint8_t* header;  // the record's header inside the block
        const uint8_t* data;    // its `length` bytes of data, after the header
    };

    uint32_t count = 0;
    uint32_t dataLength = 0;
    std::vector<Record> records;
    fault error = FAULT_NONE;
    // Index of the record that ended the block (records.size() for the
    // header and count faults).
    size_t faultAt = 0;
    uint32_t faultValue = 0;  // the SIM index or module id that was refused

    // Parses the bytes; the records point into `data`, which must outlive
    // the block. Returns 0 for a whole block, -3 when a fault ended it early
    // (the records before it are kept), -9 for a block too short or too long
    // (no records).
    int32_t parse(const uint8_t* data, size_t size);
    static const char* faultName(fault f);
};

}  // namespace kelvo
