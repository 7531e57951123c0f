#pragma once

#include <stdint.h>

#include <atomic>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace kelvo {
namespace sim {

// The phone's thermal side: the kernel's high-temperature records (the
// timed verb "thermal enter|exit [text]") and the power-management
// application "Pelmora", a buffered-log client that answers the daemon's
// daily request with the day's thermal statistics (docs/thermal-records.md).
class ThermalScene {
public:
    static constexpr const char* kClientName = "Pelmora";
    static constexpr int32_t kMagic = 0;

    using Ranges = std::vector<std::pair<std::string, int32_t>>;
    struct Scene {
        std::string current;
        std::string previous;
        int32_t startTemperature = 0;
        int32_t endTemperature = 0;
        int32_t topTemperature = 0;
        std::vector<std::string> top;  // up to three packages
    };
    // What "Pelmora" answers, from the scenario's lines.
    struct Content {
        std::vector<std::pair<std::string, Ranges>> applications;
        Ranges shell;
        std::vector<Scene> scenes;
    };

    // A timed verb: 1 with the record (tag, newline, text); 0 when the verb
    // is not "thermal"; -1 with the reason of a bad line.
    static int parseStep(const std::vector<std::string>& words, std::string* record,
                         std::string* reason);
    // An untimed "pelmora-app", "pelmora-shell" or "pelmora-scene" line: 1
    // read into content; 0 another verb; -1 with the reason.
    static int parseLine(const std::vector<std::string>& words, Content* content,
                         std::string* reason);
    // The answer for the day stamp the daemon sent.
    static std::string answer(const Content& content, int64_t day);

    explicit ThermalScene(const Content& content) : mContent(content) {}
    ~ThermalScene();

    // Starts the client once the daemon listens; stop ends it.
    void start();
    void stop();
    // Daily requests answered so far.
    int32_t answered() const { return mAnswered; }

private:
    void serve();

    const Content mContent;
    std::atomic<bool> mStop{false};
    std::atomic<int32_t> mAnswered{0};
    std::thread mThread;
};

}  // namespace sim
}  // namespace kelvo
