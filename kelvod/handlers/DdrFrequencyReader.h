#pragma once

#include <stdint.h>

#include <map>
#include <string>
#include <utility>
#include <vector>

namespace kelvo {

// DDR frequency residency from the devfreq transition table: one line per
// level ("*  200000000:  0  5  1234", a '*' marking the current one), its
// cumulative time in ms in the last column. Readings give the growth of
// each level's time since the previous one.
class DdrFrequencyReader {
public:
    // Levels counted at most; lines beyond are ignored.
    static constexpr int32_t kMaxLevels = 64;

    // The number of level lines of the table at the host path; -14 when it
    // cannot be opened.
    static int32_t countLevels(const std::string& path);
    // (frequency, growth in ms) of every level whose time grew; a new level
    // counts in full unless the reading only sets the baseline. Times that
    // went down move the baseline. 0, or -14 when the file cannot be opened.
    int32_t read(const std::string& path, bool baselineOnly,
                 std::vector<std::pair<int64_t, int64_t>>* out);

private:
    // One line into frequency and time; false for a title or bad line.
    static bool parseLine(const std::string& line, int64_t* freq, int64_t* time);

    std::map<int64_t, int64_t> mResidency;
};

}  // namespace kelvo
