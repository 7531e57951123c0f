// Reads untrusted bytes as a modem statistics block. Besides the sanitizers,
// checks that every record taken lies inside the block, one after the other
// from the header on, with a SIM index and module a decoder can take; that
// a block is whole exactly when all n records were taken; and that nothing
// is taken from a block shorter than its header or above the cap.

#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "handlers/components/ModemBlock.h"

using kelvo::ModemBlock;

namespace {

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    ModemBlock block;
    int32_t ret = block.parse(data, size);
    if (size < ModemBlock::kHeaderSize || size > ModemBlock::kMaxBytes) {
        check(ret == -9 && block.records.empty());
        return 0;
    }
    uint32_t count = 0;
    memcpy(&count, data, sizeof(count));
    check(block.count == count);
    check(block.records.size() <= count);
    check((ret == 0) == (block.records.size() == count));
    check((ret == 0) == (block.error == ModemBlock::FAULT_NONE));
    size_t at = ModemBlock::kHeaderSize;
    for (const ModemBlock::Record& r : block.records) {
        check(r.header == data + at);
        check(r.data == r.header + ModemBlock::kRecordHeaderSize);
        check(r.sim < ModemBlock::kSimCount && r.module < ModemBlock::kModuleCount);
        check(at + ModemBlock::kRecordHeaderSize + r.length <= size);
        uint32_t header[3] = {r.length, r.sim, r.module};
        check(memcmp(header, r.header, sizeof(header)) == 0);
        at += ModemBlock::kRecordHeaderSize + r.length;
    }
    return 0;
}
