// Decodes untrusted bytes as one read of the log device. Besides the
// sanitizers, checks that a decoded tag and text lie inside the record, are
// terminated there and have the lengths reported, and that a refused header
// leaves the record cleared.

#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "core/LoggerRecord.h"

using kelvo::LoggerRecord;

namespace {

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

// The string starts inside the record and its terminator is there too.
void checkInside(const uint8_t* data, size_t size, const char* str, size_t len) {
    const uint8_t* at = reinterpret_cast<const uint8_t*>(str);
    check(at >= data + LoggerRecord::kHeaderSize && at < data + size);
    check(static_cast<size_t>(at - data) + len < size);
    check(memchr(str, '\0', len) == nullptr);
    check(str[len] == '\0');
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    LoggerRecord record;
    int32_t ret = record.decode(data, size);
    if (ret != 0) {
        check(ret == -14);
        check(record.getTag() == nullptr && record.getText() == nullptr && record.getTime() == 0);
        return 0;
    }
    check(size >= LoggerRecord::kHeaderSize);
    check(record.getTime() >= 0 && record.getTime() <= 4294967295LL * 1000 + 999);
    if (record.getTag() == nullptr) {
        check(record.getText() == nullptr);
        return 0;
    }
    check(record.getTagLength() > 0);
    checkInside(data, size, record.getTag(), record.getTagLength());
    if (record.getText() != nullptr) {
        checkInside(data, size, record.getText(), record.getTextLength());
        check(record.getText() == record.getTag() + record.getTagLength() + 1);
    }
    return 0;
}
