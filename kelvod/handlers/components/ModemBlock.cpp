#include "handlers/components/ModemBlock.h"

#include <string.h>

namespace kelvo {

namespace {

uint32_t readU32(const uint8_t* at) {
    uint32_t value = 0;
    memcpy(&value, at, sizeof(value));
    return value;
}

}  // namespace

int32_t ModemBlock::parse(const uint8_t* data, size_t size) {
    records.clear();
    count = 0;
    dataLength = 0;
    error = FAULT_NONE;
    faultAt = 0;
    faultValue = 0;
    if (data == nullptr || size < kHeaderSize) {
        error = FAULT_SHORT;
        return -9;
    }
    if (size > kMaxBytes) {
        error = FAULT_TOO_LONG;
        return -9;
    }
    count = readU32(data);
    dataLength = readU32(data + 4);
    // No more records than headers fit: the reservation is bounded by the
    // bytes, not by the sender's count.
    const size_t fitting = (size - kHeaderSize) / kRecordHeaderSize;
    records.reserve(count < fitting ? count : fitting);
    size_t at = kHeaderSize;
    for (uint32_t i = 0; i < count; ++i) {
        faultAt = records.size();
        const size_t left = size - at;
        if (left < kRecordHeaderSize) {
            // Nothing of this record is there: the count claimed too much.
            error = left == 0 ? FAULT_COUNT : FAULT_CUT_HEADER;
            return -3;
        }
        Record r;
        r.length = readU32(data + at);
        r.sim = readU32(data + at + 4);
        r.module = readU32(data + at + 8);
        // Compared with what is left after the header: L + 12 never wraps.
        if (static_cast<size_t>(r.length) > left - kRecordHeaderSize) {
            error = FAULT_CUT_DATA;
            faultValue = r.length;
            return -3;
        }
        if (r.sim >= kSimCount) {
            error = FAULT_SIM;
            faultValue = r.sim;
            return -3;
        }
        if (r.module >= kModuleCount) {
            error = FAULT_MODULE;
            faultValue = r.module;
            return -3;
        }
        r.header = data + at;
        r.data = data + at + kRecordHeaderSize;
        records.push_back(r);
        at += kRecordHeaderSize + r.length;
    }
    faultAt = records.size();
    return 0;
}

const char* ModemBlock::faultName(fault f) {
    switch (f) {
        case FAULT_NONE:
            return "none";
        case FAULT_SHORT:
            return "shorter than its header";
        case FAULT_TOO_LONG:
            return "longer than the cap";
        case FAULT_CUT_HEADER:
            return "record header past the end";
        case FAULT_CUT_DATA:
            return "record data past the end";
        case FAULT_SIM:
            return "input sim type error";
        case FAULT_MODULE:
            return "unknown module";
        case FAULT_COUNT:
            return "count larger than the records present";
    }
    return "unknown";
}

}  // namespace kelvo
