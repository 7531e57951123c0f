#pragma once

#include <android/log.h>

#include <chrono>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace kelvo {
namespace test {

// A fresh private root directory for the daemon's device paths; removed when
// the object goes. Properties are reloaded from it.
class TempRoot {
public:
    TempRoot();
    ~TempRoot();
    const std::string& path() const { return mPath; }
    // Writes a file below the root (parents created).
    void writeFile(const std::string& devicePath, const std::string& content) const;
    std::string readFile(const std::string& devicePath) const;

private:
    std::string mPath;
};

struct LogLine {
    int priority;
    std::string tag;
    std::string text;
};

// Captures every line written through liblog while it lives.
class LogCapture {
public:
    LogCapture();
    ~LogCapture();
    std::vector<LogLine> lines() const;
    // The captured lines that contain the text (other threads log too).
    std::vector<LogLine> linesWith(const std::string& text) const;
    // Number of captured lines containing the text (at any priority when
    // priority is 0).
    size_t count(const std::string& text, int priority = 0) const;
    bool contains(const std::string& text, int priority = 0) const {
        return count(text, priority) > 0;
    }
    void clear();

private:
    static void logger(const struct __android_logger_data* data, const char* message);
};

// Host file helpers of the tests (paths are host paths, not device paths).
void makeHostDirs(const std::string& dir);
// Writes the file, creating its parent directories.
void writeHostFile(const std::string& path, const std::string& content);
std::string readHostFile(const std::string& path);
// True when something, a dangling link included, has this name.
bool hostPathExists(const std::string& path);
// The sorted names in dir (without "." and "..") that match the pattern.
std::vector<std::string> listDir(const std::string& dir, const std::string& pattern = ".*");

// Entry name -> content of a zip, read with the platform's zip reader;
// empty when it cannot be opened.
std::map<std::string, std::string> readZip(const std::string& path);

// Polls the condition until it holds or the time-out passes.
bool waitFor(const std::function<bool()>& condition,
             std::chrono::milliseconds timeout = std::chrono::milliseconds(5000));

} // namespace test
} // namespace kelvo
