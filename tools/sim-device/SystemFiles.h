#pragma once

#include <stdint.h>

#include <string>
#include <utility>
#include <vector>

namespace kelvo {

// Writes the system files of a simulated device below a root directory, in
// the layouts the daemon reads (docs/system-records.md):
//   proc/meminfo                                      "MemFree:  N kB" lines
//   proc/wakeup_sources                               a title, one line per source
//   sys/class/devfreq/ddrfreq/trans_stat              the devfreq transition table
//   sys/class/tv_power/charger/charge_data/enable_hiz "0"
// Every file is replaced whole (a temporary file renamed over the old one).
// Counters only grow: advance() adds time to the held sources and to the
// current DDR level.
class SystemFiles {
public:
    struct Source {
        std::string name;     // as written: blanks after it are kept
        int64_t msPerSecond;  // held time added per second
        int32_t activations;  // active count added per 10 s
        int64_t count = 0;
        int64_t totalMs = 0;
    };

    explicit SystemFiles(std::string root);

    // The sources of a phone: two sharing a name, one padded with blanks.
    static std::vector<Source> phoneSources();
    // DDR levels in Hz, ascending.
    static std::vector<int64_t> phoneDdrLevels();

    // Writes every file with the counters at zero. False with errno set.
    bool layout();
    // Adds ms of simulated time to the counters (the DDR level moves every
    // 5 s) and rewrites the counter files.
    bool advance(int64_t ms);
    void setMemory(int64_t freeKb, int64_t availableKb);

    // The texts, also for tests and benchmarks. A "deleted" line ends the
    // sources; one line after it must not be read.
    static std::string wakeupSourcesText(const std::vector<Source>& sources);
    static std::string transStatText(const std::vector<int64_t>& levels,
                                     const std::vector<int64_t>& timesMs, size_t current);
    static std::string memInfoText(int64_t freeKb, int64_t availableKb);

private:
    bool writeFile(const std::string& relative, const std::string& text) const;
    bool writeCounters() const;

    std::string mRoot;
    std::vector<Source> mSources;
    std::vector<int64_t> mLevels;
    std::vector<int64_t> mLevelMs;
    int64_t mElapsedMs = 0;
    int64_t mFreeKb = 812344;
    int64_t mAvailableKb = 2456780;
};

}  // namespace kelvo
