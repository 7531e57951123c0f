#include "common/TestEnv.h"

#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>
#include <dirent.h>

#include <algorithm>
#include <fstream>
#include <regex>
#include <sstream>
#include <thread>

#include <ziparchive/zip_archive.h>

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

} // namespace

void makeHostDirs(const std::string& dir) {
    for (size_t pos = dir.find('/', 1); pos != std::string::npos; pos = dir.find('/', pos + 1)) {
        mkdir(dir.substr(0, pos).c_str(), 0775);
    }
    mkdir(dir.c_str(), 0775);
}

void writeHostFile(const std::string& path, const std::string& content) {
    size_t slash = path.find_last_of('/');
    if (slash != std::string::npos && slash > 0) makeHostDirs(path.substr(0, slash));
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << content;
}

std::string readHostFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

bool hostPathExists(const std::string& path) {
    struct stat st = {};
    return lstat(path.c_str(), &st) == 0;
}

std::vector<std::string> listDir(const std::string& dir, const std::string& pattern) {
    std::vector<std::string> names;
    std::regex re(pattern);
    if (DIR* d = opendir(dir.c_str())) {
        while (struct dirent* ent = readdir(d)) {
            std::string name = ent->d_name;
            if (name != "." && name != ".." && std::regex_match(name, re)) names.push_back(name);
        }
        closedir(d);
    }
    std::sort(names.begin(), names.end());
    return names;
}

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
    writeHostFile(mPath + devicePath, content);
}

std::string TempRoot::readFile(const std::string& devicePath) const {
    return readHostFile(mPath + devicePath);
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
        if (line.text.find(text) != std::string::npos) out.push_back(line);
    }
    return out;
}

size_t LogCapture::count(const std::string& text, int priority) const {
    size_t n = 0;
    for (const LogLine& line : linesWith(text)) n += priority == 0 || line.priority == priority;
    return n;
}

void LogCapture::clear() {
    CaptureState& s = capture();
    std::lock_guard<std::mutex> guard(s.lock);
    s.lines.clear();
}

std::map<std::string, std::string> readZip(const std::string& path) {
    std::map<std::string, std::string> entries;
    ZipArchiveHandle handle = nullptr;
    if (OpenArchive(path.c_str(), &handle) == 0) {
        void* cookie = nullptr;
        if (StartIteration(handle, &cookie) == 0) {
            ZipEntry entry = {};
            std::string name;
            while (Next(cookie, &entry, &name) == 0) {
                std::string data(entry.uncompressed_length, '\0');
                if (ExtractToMemory(handle, &entry, reinterpret_cast<uint8_t*>(&data[0]),
                                    entry.uncompressed_length) == 0) {
                    entries[name] = data;
                }
            }
            EndIteration(cookie);
        }
    }
    if (handle != nullptr) CloseArchive(handle);
    return entries;
}

bool waitFor(const std::function<bool()>& condition, std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
        if (condition()) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return condition();
}

} // namespace test
} // namespace kelvo
