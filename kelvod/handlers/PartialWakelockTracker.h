#pragma once

#include <stddef.h>
#include <stdint.h>

#include <map>
#include <string>
#include <vector>

namespace kelvo {

// Framework partial wakelocks ("uid=U prevent_time=MS ws_name=NAME tag=TAG")
// as increments of held time per (uid, name, tag). Records of one key are
// summed within a reading; an increment counts from kMinIncrementMs, smaller
// ones accumulate; held time that went down moves the baseline without
// counting. An empty name or tag reads as "NULL".
class PartialWakelockTracker {
public:
    static constexpr size_t kNameSize = 64;  // with its terminating zero
    static constexpr size_t kMaxKeys = 5000;
    static constexpr int64_t kMinIncrementMs = 1000;

    struct increment {
        int32_t uid;
        std::string name;
        std::string tag;
        int64_t duration;
    };

    // When baselineFirst, the first reading only fills the baseline: held
    // times from before a restart are not counted again.
    explicit PartialWakelockTracker(bool baselineFirst) : mBaselineOnly(baselineFirst) {}

    // Parses one record: 0, or -19 for a record without a uid or held time.
    static int32_t parse(const std::string& text, increment* out);
    // The increments of a reading; records that do not parse are skipped
    // and counted. Returns the number skipped.
    int32_t update(const std::vector<std::string>& texts, std::vector<increment>* out);
    void clear() { mBaseline.clear(); }
    // Forgets the keys absent from the last reading (daily).
    void prune();
    size_t size() const { return mBaseline.size(); }

private:
    struct counted {
        int64_t held = 0;
        bool seen = false;
    };

    bool mBaselineOnly;
    std::map<std::string, counted> mBaseline;
};

}  // namespace kelvo
