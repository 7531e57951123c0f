// Reads untrusted bytes as the kernel's per-process CPU report. Besides the
// sanitizers, checks that a report is taken only when the count's records lie
// inside the data, that names never pass their field, and that a taken report
// encodes back to the bytes it came from.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "handlers/components/CpuReport.h"

using kelvo::CpuReport;

namespace {

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    CpuReport report;
    int32_t ret = CpuReport::parse(data, size, &report);
    int32_t count = 0;
    if (size >= CpuReport::kHeaderSize) {
        memcpy(&count, data + 16, sizeof(count));
    }
    bool fits =
        size >= CpuReport::kHeaderSize && count >= 0 &&
        CpuReport::kHeaderSize + static_cast<uint64_t>(count) * CpuReport::kRecordSize <= size;
    check((ret == 0) == fits);
    if (ret != 0) {
        return 0;
    }
    check(report.records.size() == static_cast<size_t>(count));
    for (const CpuReport::Record& r : report.records) {
        check(r.name.size() <= CpuReport::kNameSize);
        check(r.name.find('\0') == std::string::npos);
        std::string uniform = CpuReport::uniformThreadName(r.uid, r.name);
        check(uniform.size() <= r.name.size());
    }
    // Whatever followed a name's terminator inside its field is not kept, so
    // compare field by field up to the terminators.
    std::string wire =
        CpuReport::encode(report.timestamp, report.mode, report.state, report.records);
    check(wire.size() == CpuReport::kHeaderSize + report.records.size() * CpuReport::kRecordSize);
    check(memcmp(wire.data(), data, CpuReport::kHeaderSize) == 0);
    for (size_t i = 0; i < report.records.size(); ++i) {
        size_t at = CpuReport::kHeaderSize + i * CpuReport::kRecordSize;
        size_t fixed = CpuReport::kRecordSize - CpuReport::kNameSize;
        check(memcmp(wire.data() + at, data + at, fixed) == 0);
        size_t name = report.records[i].name.size();
        check(memcmp(wire.data() + at + fixed, data + at + fixed, name) == 0);
    }
    return 0;
}
