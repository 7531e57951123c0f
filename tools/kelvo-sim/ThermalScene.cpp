#include "ThermalScene.h"

#include <binder/Parcel.h>
#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <utils/String16.h>

#include <sstream>

#include "BufferedLogResponder.h"

namespace kelvo {
namespace sim {

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr size_t kMaxItems = 64;

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

bool parseNumber(const std::string& text, long long low, long long high, int32_t* out) {
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(text.c_str(), &end, 10);
    if (text.empty() || errno != 0 || *end != '\0' || value < low || value > high) {
        return false;
    }
    *out = static_cast<int32_t>(value);
    return true;
}

std::vector<std::string> split(const std::string& text, char separator) {
    std::vector<std::string> items;
    std::stringstream in(text);
    std::string item;
    while (std::getline(in, item, separator)) {
        items.push_back(item);
    }
    if (!text.empty() && text.back() == separator) {
        items.push_back("");
    }
    return items;
}

// "<range>=<count>,..." with 1 to 64 items.
bool parseRanges(const std::string& text, ThermalScene::Ranges* out) {
    std::vector<std::string> items = split(text, ',');
    if (items.empty() || items.size() > kMaxItems) {
        return false;
    }
    for (const std::string& item : items) {
        size_t equal = item.find('=');
        int32_t count = 0;
        if (equal == std::string::npos || !isWord(item.substr(0, equal)) ||
            !parseNumber(item.substr(equal + 1), 0, 1000000, &count)) {
            return false;
        }
        out->push_back({item.substr(0, equal), count});
    }
    return true;
}

void writeText(android::Parcel& out, const std::string& text) {
    out.writeString16(android::String16(text.c_str()));
}

// A length, then the pairs (range text, int32 count).
void writeRanges(android::Parcel& out, const ThermalScene::Ranges& ranges) {
    android::Parcel pairs;
    for (const auto& [range, count] : ranges) {
        writeText(pairs, range);
        pairs.writeInt32(count);
    }
    out.writeInt32(static_cast<int32_t>(pairs.dataSize()));
    out.write(pairs.data(), pairs.dataSize());
}

}  // namespace

int ThermalScene::parseStep(const std::vector<std::string>& words, std::string* record,
                            std::string* reason) {
    if (words[0] != "thermal") {
        return 0;
    }
    if (words.size() < 2 || (words[1] != "enter" && words[1] != "exit")) {
        *reason = "expected \"at <time> thermal enter|exit [<text>]\"";
        return -1;
    }
    *record = words[1] == "enter" ? "KELVO_TAG_HIGH_TEMP_ENTER\n" : "KELVO_TAG_HIGH_TEMP_EXIT\n";
    for (size_t i = 2; i < words.size(); ++i) {
        *record += (i > 2 ? " " : "") + words[i];
    }
    return 1;
}

int ThermalScene::parseLine(const std::vector<std::string>& words, Content* content,
                            std::string* reason) {
    const std::string& verb = words[0];
    if (verb == "pelmora-app") {
        Ranges ranges;
        if (words.size() != 3 || !isWord(words[1]) || !parseRanges(words[2], &ranges) ||
            content->applications.size() >= kMaxItems) {
            *reason = "expected \"pelmora-app <package> <range>=<count>[,...]\" (at most 64)";
            return -1;
        }
        content->applications.push_back({words[1], ranges});
        return 1;
    }
    if (verb == "pelmora-shell") {
        if (words.size() != 2 || !content->shell.empty() ||
            !parseRanges(words[1], &content->shell)) {
            *reason = "expected one \"pelmora-shell <range>=<count>[,...]\"";
            return -1;
        }
        return 1;
    }
    if (verb != "pelmora-scene") {
        return 0;
    }
    Scene scene;
    std::vector<std::string> temperatures =
        words.size() == 5 ? split(words[3], '/') : std::vector<std::string>();
    scene.top = words.size() == 5 ? split(words[4], ',') : std::vector<std::string>();
    bool ok = temperatures.size() == 3 && isWord(words[1]) && isWord(words[2]) &&
              parseNumber(temperatures[0], -40, 150, &scene.startTemperature) &&
              parseNumber(temperatures[1], -40, 150, &scene.endTemperature) &&
              parseNumber(temperatures[2], -40, 150, &scene.topTemperature) && !scene.top.empty() &&
              scene.top.size() <= 3 && content->scenes.size() < kMaxItems;
    for (const std::string& top : scene.top) {
        ok = ok && isWord(top);
    }
    if (!ok) {
        *reason =
            "expected \"pelmora-scene <package> <previous package> <start>/<end>/<top> °C "
            "<top package>[,<second>[,<third>]]\"";
        return -1;
    }
    scene.current = words[1];
    scene.previous = words[2];
    content->scenes.push_back(scene);
    return 1;
}

std::string ThermalScene::answer(const Content& content, int64_t day) {
    android::Parcel out;
    out.writeInt64(day);
    if (!content.applications.empty()) {
        out.writeInt32(0);
        out.writeInt32(static_cast<int32_t>(content.applications.size()));
        for (const auto& [package, ranges] : content.applications) {
            writeText(out, package);
            writeRanges(out, ranges);
        }
    }
    if (!content.shell.empty()) {
        out.writeInt32(1);
        writeRanges(out, content.shell);
    }
    if (!content.scenes.empty()) {
        out.writeInt32(2);
        out.writeInt32(static_cast<int32_t>(content.scenes.size()));
        int64_t start = day - static_cast<int64_t>(content.scenes.size() + 1) * kHourMs;
        for (const Scene& s : content.scenes) {
            out.writeInt64(start);
            out.writeInt64(start + kHourMs / 2);
            writeText(out, s.current);
            writeText(out, s.previous);
            out.writeInt32(s.startTemperature);
            out.writeInt32(s.endTemperature);
            out.writeInt32(s.topTemperature);
            out.writeInt64(start + kHourMs / 3);
            out.writeInt32(120);  // brightness
            out.writeInt32(8);    // media volume
            // signal kind .. ambient light: LTE at level 3, GNSS and Wi-Fi
            // on, the chips' temperatures near the top one.
            const int32_t values[20] = {4,  3,  1,  1,    0,    0,  s.topTemperature,
                                        36, 33, 39, 35,   34,   33, 32,
                                        1,  35, 0,  -850, 3870, 200};
            for (int32_t v : values) {
                out.writeInt32(v);
            }
            out.writeInt32(25);    // ambient temperature
            out.writeInt32(1800);  // average power
            for (size_t i = 0; i < 3; ++i) {
                writeText(out, i < s.top.size() ? s.top[i] : "");
            }
            out.writeInt32(s.topTemperature - 2);  // Wi-Fi chip
            out.writeInt32(24);                    // second ambient sensor
            start += kHourMs;
        }
    }
    return std::string(reinterpret_cast<const char*>(out.data()), out.dataSize());
}

ThermalScene::~ThermalScene() {
    stop();
}

void ThermalScene::start() {
    if (!mThread.joinable()) {
        mStop = false;
        mThread = std::thread([this] { serve(); });
    }
}

void ThermalScene::stop() {
    mStop = true;
    if (mThread.joinable()) {
        mThread.join();
    }
}

void ThermalScene::serve() {
    BufferedLogResponder::serve(
            kClientName, mStop,
            [this](int32_t magic, const std::string& data, int32_t* replyMagic,
                   std::string* reply) {
                int64_t day = 0;
                if (magic != kMagic || data.size() != sizeof(day)) {
                    return false;
                }
                memcpy(&day, data.data(), sizeof(day));
                *replyMagic = kMagic;
                *reply = answer(mContent, day);
                return true;
            },
            [this] { ++mAnswered; });
}

}  // namespace sim
}  // namespace kelvo
