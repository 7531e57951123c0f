#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>
#include <vector>

namespace kelvo {

// The daily thermal statistics the power-management application sends over
// the buffered log (docs/thermal-records.md): an int64 day stamp, then typed
// blocks until the entry ends, in binder's flat parcel format (values aligned
// to 4 bytes, texts as String16). Every count and length is checked against
// the bytes left before anything is allocated; reading stops at the first
// fault and keeps what was read before it.
class ThermalRecords {
public:
    enum block_type : int32_t {
        BLOCK_APPLICATIONS = 0,
        BLOCK_SHELL = 1,
        BLOCK_HEAT_SCENES = 2,
    };
    // Parse results.
    static constexpr int32_t kComplete = 0;
    static constexpr int32_t kMalformed = -2;     // a count, length or value did not fit
    static constexpr int32_t kUnknownBlock = -3;  // the rest of the entry was dropped

    // Longest text kept, in UTF-16 units.
    static constexpr size_t kMaxTextUnits = 256;
    // A scene holds 3 int64, 29 int32 and 5 texts of at least 8 bytes.
    static constexpr size_t kMinSceneSize = 3 * 8 + 29 * 4 + 5 * 8;
    // A package: its text and the int32 length of its pairs.
    static constexpr size_t kMinApplicationSize = 8 + 4;
    static constexpr int32_t kSceneInts = 20;  // signal_kind .. ambient_light

    struct range_count {
        std::string range;
        int32_t count = 0;
    };
    struct application_range {
        std::string name;
        std::string range;
        int32_t count = 0;
    };
    struct heat_scene {
        int64_t startTime = 0;
        int64_t endTime = 0;
        std::string currentPackage;
        std::string previousPackage;
        int32_t startTemperature = 0;
        int32_t endTemperature = 0;
        int32_t topTemperature = 0;
        int64_t topTime = 0;
        int32_t brightness = 0;
        int32_t mediaVolume = 0;
        int32_t values[kSceneInts] = {};
        int32_t ambientTemperature = 0;
        int32_t averagePower = 0;
        std::string topPackages[3];
        int32_t wifiTemp = 0;
        int32_t ambientTemperature2 = 0;
    };
    struct daily {
        int64_t dayStamp = 0;
        std::vector<application_range> applications;
        std::vector<range_count> shell;
        std::vector<heat_scene> scenes;
        int32_t unknownType = 0;  // with kUnknownBlock
    };

    // Reads the entry; kComplete, kMalformed or kUnknownBlock. An entry too
    // short for its day stamp is kMalformed with nothing read.
    static int32_t parse(const uint8_t* data, size_t size, daily* out);

    // The index of a range name "Range<n>"; -1 when the name has another
    // form. The caller checks the upper bound.
    static int64_t rangeIndex(const std::string& name);
};

}  // namespace kelvo
