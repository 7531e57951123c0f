// Reads untrusted bytes as the daily thermal statistics of the
// power-management application. Besides the sanitizers, checks that nothing
// read is larger than the entry could hold: every application range, shell
// range and scene takes bytes of its own.

#include <cstdint>
#include <cstdlib>

#include "handlers/ThermalRecords.h"

using kelvo::ThermalRecords;

namespace {

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    ThermalRecords::daily daily;
    int32_t ret = ThermalRecords::parse(data, size, &daily);
    check(ret == ThermalRecords::kComplete || ret == ThermalRecords::kMalformed ||
          ret == ThermalRecords::kUnknownBlock);
    // A pair takes at least 12 bytes (an empty text and its count).
    check((daily.applications.size() + daily.shell.size()) * 12 <= size);
    check(daily.scenes.size() * ThermalRecords::kMinSceneSize <= size);
    for (const ThermalRecords::heat_scene& s : daily.scenes) {
        check(s.currentPackage.size() <= 3 * ThermalRecords::kMaxTextUnits);
    }
    return 0;
}
