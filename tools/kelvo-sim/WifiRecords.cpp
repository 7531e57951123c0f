#include "WifiRecords.h"

#include <stdlib.h>

namespace kelvo {
namespace sim {

namespace {

struct wifi_kind {
    const char* word;
    const char* tag;
    const char* key;  // the number's key, or null when the record has none
    int32_t min;
    int32_t max;
    const char* fixedText;  // the text of a record without a number
};

const wifi_kind kKinds[] = {
    {"on", "KELVO_TAG_WIFI_ON", nullptr, 0, 0, ""},
    {"off", "KELVO_TAG_WIFI_OFF", nullptr, 0, 0, ""},
    {"ap-on", "KELVO_TAG_WIFI_AP_ON", nullptr, 0, 0, ""},
    {"ap-off", "KELVO_TAG_WIFI_AP_OFF", nullptr, 0, 0, ""},
    {"active", "KELVO_TAG_WIFI_ACTIVITY", nullptr, 0, 0, "activity=1"},
    {"idle", "KELVO_TAG_WIFI_ACTIVITY", nullptr, 0, 0, "activity=0"},
    {"band", "KELVO_TAG_WIFI_BAND", "band=", 0, 2, nullptr},
    {"level", "KELVO_TAG_WIFI_SIGNAL_LEVEL", "level=", 0, 4, nullptr},
    {"scan", "KELVO_TAG_WIFI_SCAN_STARTED", "uid=", 0, 0x7FFFFFFF, nullptr},
};
constexpr int32_t kKindCount = static_cast<int32_t>(sizeof(kKinds) / sizeof(kKinds[0]));

}  // namespace

bool WifiRecords::parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                            std::string* reason) {
    step->action = Scenario::Action::Wifi;
    for (int32_t k = 0; words.size() >= 2 && k < kKindCount; ++k) {
        const wifi_kind& kind = kKinds[k];
        if (words[1] != kind.word) {
            continue;
        }
        step->value = k;
        if (kind.key == nullptr) {
            if (words.size() == 2) {
                return true;
            }
            break;
        }
        char* end = nullptr;
        long n = words.size() == 3 ? strtol(words[2].c_str(), &end, 10) : -1;
        if (words.size() == 3 && end != nullptr && *end == '\0' && !words[2].empty() &&
            n >= kind.min && n <= kind.max) {
            step->pid = static_cast<int32_t>(n);
            return true;
        }
        break;
    }
    *reason =
        "expected \"at <time> wifi on|off|ap-on|ap-off|active|idle\", \"wifi band <0..2>\", "
        "\"wifi level <0..4>\" or \"wifi scan <uid>\"";
    return false;
}

void WifiRecords::record(const Scenario::Step& step, std::string* tag, std::string* text) {
    const wifi_kind& kind = kKinds[step.value >= 0 && step.value < kKindCount ? step.value : 0];
    *tag = kind.tag;
    *text = kind.key == nullptr ? kind.fixedText : kind.key + std::to_string(step.pid);
}

}  // namespace sim
}  // namespace kelvo
