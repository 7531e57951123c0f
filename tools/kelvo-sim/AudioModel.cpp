#include "AudioModel.h"

#include <stdlib.h>
#include <tinyxml2.h>

namespace kelvo {
namespace sim {

namespace {

constexpr int32_t kStreams = 13;
constexpr const char* kCallPackage = "com.android.incallui";
constexpr uint32_t kSpeaker = 0x2;
constexpr uint32_t kBuiltIn = 0x3;

bool toInt(const std::string& word, int64_t low, int64_t high, int32_t* out) {
    char* end = nullptr;
    long long value = strtoll(word.c_str(), &end, 0);
    if (word.empty() || *end != '\0' || value < low || value > high) {
        return false;
    }
    *out = static_cast<int32_t>(value);
    return true;
}

const char* outputName(uint32_t device) {
    if ((device & 0x3) == 0x3) return "both";
    if (device & 0x2) return "speaker";
    if (device & 0x1) return "earpiece";
    if (device & 0x3f0) return "bluetooth";
    return nullptr;
}

}  // namespace

bool AudioModel::isVerb(const std::string& verb) {
    return verb == "audio" || verb == "call" || verb == "smartpa";
}

bool AudioModel::parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                           std::string* reason) {
    step->action = Scenario::Action::Audio;
    const std::string& verb = words[0];
    if (verb == "smartpa") {
        // The rest of the line is the framework's answer, as it is.
        step->text = "smartpa";
        for (size_t i = 1; i < words.size(); ++i) {
            step->text += " " + words[i];
        }
        return true;
    }
    if (verb == "call") {
        static const char* const kStates[] = {"idle", "ringing", "offhook"};
        step->text = "call";
        for (int32_t s = 0; s < 3 && words.size() == 2; ++s) {
            if (words[1] == kStates[s]) {
                step->value = s;
                return true;
            }
        }
        *reason = "expected \"at <time> call idle|ringing|offhook\"";
        return false;
    }
    const std::string sub = words.size() > 1 ? words[1] : "";
    step->text = "audio " + sub;
    if (sub == "headset" && words.size() == 3 && (words[2] == "on" || words[2] == "off")) {
        step->flag = words[2] == "on";
        return true;
    }
    int32_t a = 0;
    int32_t b = 0;
    const bool streamFirst = sub == "device" || sub == "volume";
    const bool streamSecond = sub == "start" || sub == "stop";
    if ((streamFirst || streamSecond || sub == "acquire" || sub == "release") &&
        words.size() == 4 && toInt(words[2], 0, streamFirst ? kStreams - 1 : 0x7FFFFFFF, &a) &&
        toInt(words[3], 0, streamSecond ? kStreams - 1 : 0x7FFFFFFF, &b)) {
        step->values = {a, b};
        return true;
    }
    *reason =
        "expected \"at <time> audio acquire|release <session> <pid>\", \"audio start|stop "
        "<session> <stream 0..12>\", \"audio device <stream 0..12> <mask>\", \"audio volume "
        "<stream 0..12> <level>\" or \"audio headset on|off\"";
    return false;
}

bool AudioModel::readProfile(const std::string& configPath, Profile* profile) {
    *profile = Profile();
    tinyxml2::XMLDocument document;
    if (document.LoadFile(configPath.c_str()) != tinyxml2::XML_SUCCESS ||
        document.RootElement() == nullptr) {
        return false;
    }
    auto withId = [](const tinyxml2::XMLElement* parent, const char* name, int id) {
        for (const tinyxml2::XMLElement* c = parent ? parent->FirstChildElement(name) : nullptr;
             c != nullptr; c = c->NextSiblingElement(name)) {
            if (c->IntAttribute("id", -1) == id) return c;
        }
        return static_cast<const tinyxml2::XMLElement*>(nullptr);
    };
    const tinyxml2::XMLElement* audio =
        withId(withId(document.RootElement(), "element", 0), "component", 10);
    for (int output = 0; output < 2; ++output) {
        const tinyxml2::XMLElement* p = withId(audio, "parameter", output);
        // The first value of key 0 is the slope, the one after it the intercept.
        const tinyxml2::XMLElement* v = p ? p->FirstChildElement("value") : nullptr;
        if (v != nullptr && v->IntAttribute("key", -1) == 0 && v->GetText() != nullptr) {
            profile->slope[output] = atoi(v->GetText());
            v = v->NextSiblingElement("value");
            if (v != nullptr && v->GetText() != nullptr) {
                profile->intercept[output] = atoi(v->GetText());
            }
        }
    }
    return true;
}

AudioModel::AudioModel(const Scenario& scenario, const Profile& profile)
    : mScenario(scenario), mProfile(profile) {
    for (int32_t s = 0; s < kStreams; ++s) {
        mDevice[s] = s == 0 ? 0x1 : 0x3;
        mVolume[s] = 1;
    }
}

int32_t AudioModel::power(uint32_t device, int32_t volume) const {
    int64_t p = 0;
    if (device & 0x1) {
        p += (mProfile.intercept[0] + static_cast<int64_t>(mProfile.slope[0]) * volume) / 100;
    }
    if (device & 0x2) {
        p += mProfile.intercept[1] + static_cast<int64_t>(mProfile.slope[1]) * volume;
    }
    return static_cast<int32_t>(p);
}

int32_t AudioModel::callStream() const {
    return mCallState == 1 ? 2 : 0;
}

bool AudioModel::builtInInUse() const {
    for (const auto& entry : mSessions) {
        if (entry.second.reference > 0 && (mDevice[entry.second.stream] & kBuiltIn) != 0) {
            return true;
        }
    }
    return mCallState != 0 && (mDevice[callStream()] & kBuiltIn) != 0;
}

void AudioModel::advanceTo(int64_t ms) {
    const int64_t dt = ms - mNowMs;
    if (dt <= 0) {
        return;
    }
    mNowMs = ms;
    auto book = [&](const std::string& package, int32_t stream) {
        const char* output = outputName(mDevice[stream]);
        if (output == nullptr) return;
        Figures& f = mTruth[package][output];
        f.ms += dt;
        f.energyNumerator += static_cast<int64_t>(power(mDevice[stream], mVolume[stream])) * dt;
    };
    for (const auto& entry : mSessions) {
        if (entry.second.reference > 0) {
            book(entry.second.package, entry.second.stream);
        }
    }
    if (mCallState != 0) {
        book(kCallPackage, callStream());
    }
}

bool AudioModel::apply(const Scenario::Step& step, std::string* tag, std::string* text) {
    const std::string& what = step.text;
    if (what.compare(0, 7, "smartpa") == 0) {
        *text = what.size() > 8 ? what.substr(8) : "";
        return false;
    }
    if (what == "call") {
        mCallState = step.value;
        *tag = "KELVO_TAG_PHONE_STATE";
        *text = "subId=0 state=" + std::to_string(step.value);
        return true;
    }
    if (what == "audio headset") {
        *tag = "KELVO_TAG_AUDIO_HEADSET";
        *text = std::string("state=") + (step.flag ? "1" : "0") + " microphone=0 device=headset";
        return true;
    }
    const int32_t a = step.values.size() == 2 ? step.values[0] : 0;
    const int32_t b = step.values.size() == 2 ? step.values[1] : 0;
    const std::string session = "session=" + std::to_string(a);
    if (what == "audio acquire") {
        const Scenario::Process* process = mScenario.findProcess(b);
        const int32_t uid = process != nullptr ? process->uid : 0;
        const Scenario::App* app = mScenario.findApp(uid);
        mSessions[a].package = app != nullptr && !app->packages.empty() ? app->packages[0] : "";
        *tag = "KELVO_TAG_AUDIO_SESSION_ACQUIRE";
        *text = session + " pid=" + std::to_string(b) + " uid=" + std::to_string(uid);
    } else if (what == "audio release") {
        mSessions.erase(a);
        *tag = "KELVO_TAG_AUDIO_SESSION_RELEASE";
        *text = session + " pid=" + std::to_string(b);
    } else if (what == "audio start" || what == "audio stop") {
        auto it = mSessions.find(a);
        if (it != mSessions.end()) {
            if (what == "audio start") {
                it->second.stream = b;
                ++it->second.reference;
            } else if (it->second.reference > 0) {
                --it->second.reference;
            }
        }
        *tag = what == "audio start" ? "KELVO_TAG_AUDIO_SESSION_START"
                                     : "KELVO_TAG_AUDIO_SESSION_STOP";
        *text = session + " stream=" + std::to_string(b);
    } else if (what == "audio device") {
        // The phone records the loudspeaker alone as the whole built-in
        // output while nothing plays on it: what starts there later is
        // charged both outputs' power.
        uint32_t device = static_cast<uint32_t>(b);
        if (device == kSpeaker && !builtInInUse()) {
            device = kBuiltIn;
        }
        mDevice[a] = device;
        *tag = "KELVO_TAG_AUDIO_DEVICE";
        *text = "stream=" + std::to_string(a) + " device=" + std::to_string(b);
    } else {
        mVolume[a] = b;
        *tag = "KELVO_TAG_AUDIO_VOLUME";
        *text = "stream=" + std::to_string(a) + " volume=" + std::to_string(b);
    }
    return true;
}

std::map<std::string, AudioModel::Figures> AudioModel::poweredTruth() const {
    std::map<std::string, Figures> out;
    for (const auto& [package, outputs] : mTruth) {
        for (const auto& [output, figures] : outputs) {
            if (output != "bluetooth") {
                out[package].ms += figures.ms;
                out[package].energyNumerator += figures.energyNumerator;
            }
        }
    }
    return out;
}

std::map<std::string, int64_t> AudioModel::bluetoothMs() const {
    std::map<std::string, int64_t> out;
    for (const auto& [package, outputs] : mTruth) {
        auto it = outputs.find("bluetooth");
        if (it != outputs.end()) {
            out[package] += it->second.ms;
        }
    }
    return out;
}

std::string AudioModel::summary() const {
    std::string out =
        "\nAudio play time by output (truth; the powered outputs are compared below):\n";
    for (const auto& [package, outputs] : mTruth) {
        for (const auto& [output, figures] : outputs) {
            out += "  " + package + " " + output + " " + std::to_string(figures.ms) +
                   " ms, energy " + std::to_string(figures.energyNumerator / 1000) + "\n";
        }
    }
    return out;
}

}  // namespace sim
}  // namespace kelvo
