#include "common/TestEnv.h"

#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <thread>

#include "kelvo/HostProperties.h"
#include "kelvo/RootPath.h"

namespace kelvo {
namespace test {

namespace {

struct CaptureState {
    std::mutex lock;
    std::vector<LogLine> lines;
    int active = 0;
};

CaptureState& capture() {
    static CaptureState* s = new CaptureState();
    return *s;
}

void makeParents(const std::string& path) {
    for (size_t pos = path.find('/', 1); pos != std::string::npos; pos = path.find('/', pos + 1)) {
        mkdir(path.substr(0, pos).c_str(), 0775);
    }
}

} // namespace

TempRoot::TempRoot() {
    char tmpl[] = "/tmp/kelvo-test-XXXXXX";
    char* dir = mkdtemp(tmpl);
    mPath = dir != nullptr ? dir : "/tmp";
    RootPath::setRoot(mPath.c_str());
    HostProperties::reload();
}

TempRoot::~TempRoot() {
    std::string cmd = "rm -rf '" + mPath + "'";
    if (mPath.rfind("/tmp/kelvo-test-", 0) == 0) {
        int ignored = system(cmd.c_str());
        (void)ignored;
    }
    RootPath::setRoot("");
    HostProperties::reload();
}

void TempRoot::writeFile(const std::string& devicePath, const std::string& content) const {
    std::string full = mPath + devicePath;
    makeParents(full);
    std::ofstream out(full, std::ios::binary | std::ios::trunc);
    out << content;
}

std::string TempRoot::readFile(const std::string& devicePath) const {
    std::ifstream in(mPath + devicePath, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

LogCapture::LogCapture() {
    // Installed once and left in place: liblog calls the logger under its own
    // lock, so swapping loggers while lines are written could deadlock.
    static bool installed = [] {
        __android_log_set_logger(&LogCapture::logger);
        return true;
    }();
    (void)installed;
    CaptureState& s = capture();
    std::lock_guard<std::mutex> guard(s.lock);
    s.lines.clear();
    s.active++;
}

LogCapture::~LogCapture() {
    CaptureState& s = capture();
    std::lock_guard<std::mutex> guard(s.lock);
    s.active--;
}

void LogCapture::logger(const struct __android_logger_data* data, const char* message) {
    CaptureState& s = capture();
    {
        std::lock_guard<std::mutex> guard(s.lock);
        if (s.active > 0) {
            s.lines.push_back({data->priority, data->tag != nullptr ? data->tag : "",
                               message != nullptr ? message : ""});
            return;
        }
    }
    __android_log_stderr_logger(data, message);
}

std::vector<LogLine> LogCapture::lines() const {
    CaptureState& s = capture();
    std::lock_guard<std::mutex> guard(s.lock);
    return s.lines;
}

std::vector<LogLine> LogCapture::linesWith(const std::string& text) const {
    std::vector<LogLine> out;
    for (const LogLine& line : lines()) {
        if (line.text.find(text) != std::string::npos) {
            out.push_back(line);
        }
    }
    return out;
}

size_t LogCapture::count(const std::string& text, int priority) const {
    size_t n = 0;
    for (const LogLine& line : lines()) {
        if ((priority == 0 || line.priority == priority) &&
            line.text.find(text) != std::string::npos) {
            ++n;
        }
    }
    return n;
}

void LogCapture::clear() {
    CaptureState& s = capture();
    std::lock_guard<std::mutex> guard(s.lock);
    s.lines.clear();
}

bool waitFor(const std::function<bool()>& condition, std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
        if (condition()) {
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return condition();
}

} // namespace test
} // namespace kelvo
