#pragma once

#include <stddef.h>
#include <stdint.h>

#include <map>
#include <string>
#include <vector>

namespace kelvo {

// Kernel wakelocks as increments between readings of the wakeup-source
// table. Sources sharing a name are summed within a reading first; an
// increment counts once the held time grew by kMinIncrementMs, smaller growth
// accumulates until it does. A count or time that went down (a source
// registered again) moves the baseline without counting anything.
class KernelWakelockReader {
public:
    static constexpr size_t kNameSize = 64;  // with its terminating zero
    static constexpr size_t kMaxLines = 5000;
    static constexpr size_t kMaxKeys = 5000;
    static constexpr int64_t kMinIncrementMs = 1000;

    struct increment {
        std::string name;
        int32_t count;
        int64_t time;
    };

    // Reads the table at the host path and returns the increments against
    // the baseline, which follows the reading. Bad lines are skipped and
    // counted, the rest is still read. 0; -14 (no line: the caller logs)
    // when the file cannot be opened; -10 without a title line.
    int32_t read(const std::string& path, std::vector<increment>* out);
    // Forgets the sources absent from the last reading (daily).
    void prune();
    size_t size() const { return mBaseline.size(); }

private:
    struct sample {
        int64_t count = 0;
        int64_t time = 0;
        bool seen = false;
    };
    // One line into name, count and time; false for a line to skip.
    static bool parseLine(const std::string& line, std::string* name, int64_t* count, int64_t* time);

    std::map<std::string, sample> mBaseline;
};

}  // namespace kelvo
