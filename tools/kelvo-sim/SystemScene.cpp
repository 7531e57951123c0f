#include "SystemScene.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include "FakeKernelDriver.h"
#include "BufferedLogResponder.h"
#include "kelvo/LogWriter.h"

namespace kelvo {
namespace sim {

namespace {


bool parseNumber(const std::string& text, long long low, long long high, long long* out) {
    if (text.empty()) {
        return false;
    }
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(text.c_str(), &end, 10);
    if (errno != 0 || *end != '\0' || value < low || value > high) {
        return false;
    }
    *out = value;
    return true;
}

// 1 to 47 visible characters.
bool isWord(const std::string& text) {
    if (text.empty() || text.size() > 47) {
        return false;
    }
    for (char c : text) {
        if (c <= ' ' || c > '~') {
            return false;
        }
    }
    return true;
}

template <typename T>
void append(std::string* out, T value) {
    out->append(reinterpret_cast<const char*>(&value), sizeof(value));
}

void appendText(std::string* out, const std::string& text, size_t field) {
    std::string cut = text.substr(0, field);
    cut.resize(field, '\0');
    *out += cut;
}

int64_t realtimeMs() {
    struct timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

}  // namespace

int SystemScene::parseStep(const std::vector<std::string>& words, std::string* record,
                           std::string* reason) {
    const std::string& verb = words[0];
    long long a = 0;
    long long b = 0;
    long long c = 0;
    if (verb == "suspend" || verb == "resume" || verb == "boot_completed" || verb == "shutdown") {
        if (words.size() != 1) {
            *reason = "expected \"at <time> " + verb + "\" alone";
            return -1;
        }
        static const std::map<std::string, std::string> kTags = {
            {"suspend", "KELVO_TAG_KERNEL_SUSPEND"},
            {"resume", "KELVO_TAG_KERNEL_RESUME"},
            {"boot_completed", "KELVO_TAG_BOOT_COMPLETED"},
            {"shutdown", "KELVO_TAG_SHUTDOWN"},
        };
        *record = kTags.at(verb) + "\n";
        return 1;
    }
    if (verb == "wakeup") {
        if ((words.size() != 2 && words.size() != 3) || !isWord(words[1]) ||
            (words.size() == 3 && !parseNumber(words[2], 0, 9999, &a))) {
            *reason = "expected \"at <time> wakeup <irq> [<gpio>]\"";
            return -1;
        }
        *record = "KELVO_TAG_KERNEL_WAKEUP\nirq=" + words[1] + " gpio=" + std::to_string(a);
        return 1;
    }
    if (verb == "alarm") {
        if (words.size() != 6 || !parseNumber(words[1], 0, 0x7FFFFFFF, &a) || !isWord(words[2]) ||
            !parseNumber(words[3], 0, 3, &b) || !isWord(words[4]) ||
            !parseNumber(words[5], 1, 100, &c)) {
            *reason =
                "expected \"at <time> alarm <uid> <package> <type 0..3> <tag> <batch size "
                "1..100>\"";
            return -1;
        }
        *record = "KELVO_TAG_ALARM_TRIGGER\nuid=" + words[1] + " name=" + words[2] +
                  " type=" + words[3] + " tag=*walarm*:" + words[4] + " size=" + words[5];
        return 1;
    }
    if (verb == "package") {
        if (words.size() != 4 || (words[1] != "add" && words[1] != "remove") ||
            !parseNumber(words[2], 0, 0x7FFFFFFF, &a) || !isWord(words[3])) {
            *reason = "expected \"at <time> package add|remove <uid> <package>\"";
            return -1;
        }
        *record = std::string(words[1] == "add" ? "KELVO_TAG_PACKAGE_ADDED"
                                                : "KELVO_TAG_PACKAGE_REMOVED") +
                  "\nuid=" + words[2] + " name=" + words[3];
        return 1;
    }
    if (verb == "time_change") {
        // Up to a day either way.
        if (words.size() != 2 || !parseNumber(words[1], -86400000LL, 86400000LL, &a)) {
            *reason = "expected \"at <time> time_change <delta ms>\" within a day";
            return -1;
        }
        *record = "KELVO_TAG_TIME_CHANGED\ndelta=" + words[1];
        return 1;
    }
    return 0;
}

SystemScene::SystemScene(const Scenario& scenario, const std::string& root)
    : mScenario(scenario), mFiles(root) {}

SystemScene::~SystemScene() {
    stop();
}

bool SystemScene::layout() {
    return mFiles.layout();
}

bool SystemScene::advance(int64_t ms) {
    return mFiles.advance(ms);
}

void SystemScene::configureDriver(fake::FakeKernelDriver& driver) const {
    const Scenario::Process* system = nullptr;
    for (const Scenario::Process& p : mScenario.processes()) {
        if (system == nullptr && p.nameType == 1 && p.uid < 10000) {
            system = &p;
        }
    }
    std::vector<fake::FakeKernelDriver::BinderCall> calls;
    int32_t count = 3;
    for (const Scenario::Process& p : mScenario.processes()) {
        if (system != nullptr && p.nameType == 1 && p.uid >= 10000) {
            calls.push_back({system->uid, system->pid, system->name, p.uid, p.pid, p.name, count});
            calls.push_back({p.uid, p.pid, p.name, system->uid, system->pid, system->name, 1});
            count += 2;
        }
    }
    driver.update([&calls](fake::FakeKernelDriver::State& s) {
        s.binderCalls = calls;
        s.kworkers = {{"flush_to_ufs", 12, 35}, {"wq_barrier_func", 4, 9}};
        s.uevents = {{"/devices/platform/battery/power_supply/Battery", 2, 5},
                     {"/devices/virtual/misc/tvlog_kelvo", 1, 1}};
    });
}

int SystemScene::write(LogWriter& writer, const std::string& record, int64_t timeMs) {
    const size_t newline = record.find('\n');
    const std::string tag = record.substr(0, newline);
    const std::string text = newline == std::string::npos ? "" : record.substr(newline + 1);
    return writer.write(LogWriter::PRIORITY_INFO, tag.c_str(), text.c_str(), timeMs);
}

std::string SystemScene::dailyStatistics(int64_t dayMs) {
    std::string body;
    append<int32_t>(&body, 0);
    append<int64_t>(&body, dayMs);
    append<int64_t>(&body, 23LL * 1024 * 1024 * 1024);  // free storage
    append<int64_t>(&body, 25LL * 1024 * 1024 * 1024);  // available storage
    for (int32_t setting : {0, 0, 1, 1, 0, 1, 1, 0}) {  // sdcard .. inscreen
        append<int32_t>(&body, setting);
    }
    return body;
}

std::string SystemScene::mobilePhone() {
    std::string body;
    append<int32_t>(&body, 2);
    for (int32_t field : {0, 208, 1, 1, 1, 1, 208, 10, 0, 1}) {  // sub_id, mcc, mnc, data, voice
        append<int32_t>(&body, field);
    }
    return body;
}

std::string SystemScene::packageVersions(const std::vector<Scenario::App>& apps) {
    std::string entries;
    int32_t count = 0;
    for (const Scenario::App& app : apps) {
        for (const std::string& package : app.packages) {
            appendText(&entries, package, 128);
            appendText(&entries, "1." + std::to_string(app.uid % 100), 32);
            ++count;
        }
    }
    std::string body;
    append<int32_t>(&body, count);
    return body + entries;
}

void SystemScene::startService(int64_t clockOffsetMs) {
    if (!mThread.joinable()) {
        mClockOffsetMs = clockOffsetMs;
        mStop = false;
        mThread = std::thread([this] { serve(); });
    }
}

void SystemScene::stop() {
    mStop = true;
    if (mThread.joinable()) {
        mThread.join();
    }
}

void SystemScene::serve() {
    BufferedLogResponder::serve(
            kServiceName, mStop,
            [this](int32_t magic, const std::string& /*data*/, int32_t* /*replyMagic*/,
                   std::string* reply) {
                switch (magic) {
                    case REQUEST_DAILY_STATISTICS:
                        *reply = dailyStatistics(realtimeMs() + mClockOffsetMs);
                        return true;
                    case REQUEST_MOBILE_PHONE:
                        *reply = mobilePhone();
                        return true;
                    case REQUEST_PACKAGE_VERSIONS:
                        *reply = packageVersions(mScenario.apps());
                        return true;
                    default:
                        return false;
                }
            });
}

}  // namespace sim
}  // namespace kelvo
