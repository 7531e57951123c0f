#include "ComponentTruth.h"

#include <stdlib.h>
#include <tinyxml2.h>

#include <vector>

namespace kelvo {
namespace sim {

namespace {

const char* const kAmbientTags[4] = {
    "KELVO_TAG_AUTO_AMBIENT_LIGHT",
    "KELVO_TAG_MANUAL_AMBIENT_LIGHT",
    "KELVO_TAG_APP_AMBIENT_LIGHT",
    "KELVO_TAG_FRONT_AMBIENT_LIGHT",
};

constexpr int32_t kMaxLevel = 255;

const tinyxml2::XMLElement* childWithId(const tinyxml2::XMLElement* parent, const char* name,
                                        int id) {
    for (const tinyxml2::XMLElement* child = parent ? parent->FirstChildElement(name) : nullptr;
         child != nullptr; child = child->NextSiblingElement(name)) {
        if (child->IntAttribute("id", -1) == id) {
            return child;
        }
    }
    return nullptr;
}

// The values of a component's simple parameters, in document order.
std::vector<int32_t> simpleValues(const tinyxml2::XMLElement* root, int element, int component) {
    std::vector<int32_t> values;
    const tinyxml2::XMLElement* node =
        childWithId(childWithId(root, "element", element), "component", component);
    for (const tinyxml2::XMLElement* p = node ? node->FirstChildElement("parameter") : nullptr;
         p != nullptr; p = p->NextSiblingElement("parameter")) {
        const char* text = p->GetText();
        if (text != nullptr) {
            values.push_back(atoi(text));
        }
    }
    return values;
}

}  // namespace

ComponentTruth::ComponentTruth(const Scenario& scenario, const Profile& profile)
    : mScenario(scenario), mProfile(profile) {}

bool ComponentTruth::readProfile(const std::string& configPath, Profile* profile) {
    *profile = Profile();
    tinyxml2::XMLDocument document;
    if (document.LoadFile(configPath.c_str()) != tinyxml2::XML_SUCCESS ||
        document.RootElement() == nullptr) {
        return false;
    }
    const tinyxml2::XMLElement* root = document.RootElement();
    std::vector<int32_t> backlight = simpleValues(root, 0, 0);
    std::vector<int32_t> gnss = simpleValues(root, 0, 1);
    std::vector<int32_t> flashlight = simpleValues(root, 0, 2);
    std::vector<int32_t> policy = simpleValues(root, 2, 0);
    if (backlight.size() >= 2) {
        profile->slope = backlight[0];
        profile->intercept = backlight[1];
    }
    if (!gnss.empty()) {
        profile->gnssPower = gnss[0];
    }
    if (!flashlight.empty()) {
        profile->flashlightPower = flashlight[0];
    }
    if (!policy.empty()) {
        profile->displayPolicy = policy[0];
    }
    return true;
}

int32_t ComponentTruth::levelPower(int32_t level) const {
    if (level <= 0) {
        return 0;
    }
    return static_cast<int32_t>(
        (static_cast<int64_t>(mProfile.intercept) + static_cast<int64_t>(mProfile.slope) * level) /
        100);
}

void ComponentTruth::advanceTo(int64_t ms) {
    int64_t dt = ms - mNowMs;
    if (dt <= 0) {
        return;
    }
    mNowMs = ms;
    mAdvancedSum += static_cast<int64_t>(mLevel) * dt;
    // The backlight belongs to whatever is in front; "screen_off" is the
    // daemon's own name for the dark screen and has no truth.
    if (mForeground != kScreenOff) {
        Figures& figures = mBacklight[mForeground];
        figures.ms += dt;
        figures.energyNumerator += dt * levelPower(mLevel);
    }
    if (!mGnssUsers.empty()) {
        int64_t share = dt * mProfile.gnssPower / static_cast<int64_t>(mGnssUsers.size());
        for (const std::string& user : mGnssUsers) {
            mGnss[user].ms += dt;
            mGnss[user].energyNumerator += share;
        }
    }
    // A flashlight whose user is unknown charges nobody.
    if (mFlashOn && !mChargedUser.empty()) {
        mFlashlight[mChargedUser].ms += dt;
        mFlashlight[mChargedUser].energyNumerator += dt * mProfile.flashlightPower;
    }
}

uint32_t ComponentTruth::takeAdvancedValue(int64_t ms) {
    advanceTo(ms);
    int64_t span = mNowMs - mAdvancedFromMs;
    int64_t value = span > 0 ? mAdvancedSum * kMaxAdvancedValue / (kMaxLevel * span)
                             : mLevel * kMaxAdvancedValue / kMaxLevel;
    mAdvancedSum = 0;
    mAdvancedFromMs = mNowMs;
    return static_cast<uint32_t>(value);
}

void ComponentTruth::changeForeground(const std::string& name) {
    mForeground = name;
}

void ComponentTruth::setLevel(int32_t level) {
    if (!mScreenOn && level >= 1) {
        if (mForeground == kScreenOff) {
            changeForeground(kLauncher);
        }
        mScreenOn = true;
    } else if (mScreenOn && level == 0) {
        changeForeground(kScreenOff);
        mScreenOn = false;
    }
    mLevel = level;
    if (level > 0) {
        mOnLevel = level;
    }
}

void ComponentTruth::setFlashlight(bool on) {
    if (on == mFlashOn) {
        // A repeated switch changes nothing; a pending user keeps waiting.
        return;
    }
    mFlashOn = on;
    mChargedUser = on ? mTorchUser : std::string();
    if (!mPendingUser.empty()) {
        mTorchUser = mPendingUser;
        mPendingUser.clear();
    }
}

bool ComponentTruth::apply(const Scenario::Step& step, Record* record) {
    switch (step.action) {
        case Scenario::Action::Foreground:
            advanceTo(step.atMs);
            changeForeground(step.text);
            *record = {"KELVO_TAG_FOREGROUND_CHANGED", "name=" + step.text};
            return true;
        case Scenario::Action::Screen:
        case Scenario::Action::Brightness: {
            advanceTo(step.atMs);
            int32_t level = step.action == Scenario::Action::Brightness ? step.value
                            : step.flag                                 ? mOnLevel
                                                                        : 0;
            setLevel(level);
            *record = {"KELVO_TAG_BRIGHTNESS", "brightness=" + std::to_string(level)};
            return true;
        }
        case Scenario::Action::Ambient: {
            std::string text;
            for (size_t i = 0; i < step.values.size(); ++i) {
                text += (i == 0 ? "d" : " d") + std::to_string(i) + "=" +
                        std::to_string(step.values[i]);
                mAmbientMs[step.value] += step.values[i];
            }
            *record = {kAmbientTags[step.value & 3], text};
            return true;
        }
        case Scenario::Action::Gnss:
            advanceTo(step.atMs);
            if (step.flag) {
                mGnssUsers.insert(step.text);
            } else {
                mGnssUsers.erase(step.text);
            }
            *record = {step.flag ? "KELVO_TAG_GNSS_START" : "KELVO_TAG_GNSS_STOP",
                       "name=" + step.text};
            return true;
        case Scenario::Action::Flashlight:
            advanceTo(step.atMs);
            setFlashlight(step.flag);
            // The daemon reads nothing from the text.
            *record = {step.flag ? "KELVO_TAG_FLASHLIGHT_ON" : "KELVO_TAG_FLASHLIGHT_OFF",
                       step.flag ? "state=1" : "state=0"};
            return true;
        case Scenario::Action::Torch: {
            advanceTo(step.atMs);
            const Scenario::Process* process = mScenario.findProcess(step.pid);
            const Scenario::App* app = process ? mScenario.findApp(process->uid) : nullptr;
            // The scenario admits torch users of one-package uids only: the
            // daemon names them by that package.
            if (app != nullptr && app->packages.size() == 1) {
                (mFlashOn ? mPendingUser : mTorchUser) = app->packages[0];
            }
            *record = {"KELVO_TAG_TORCH_CONNECT",
                       "uid=" + std::to_string(process ? process->uid : 0) +
                           " pid=" + std::to_string(step.pid)};
            return true;
        }
        default:
            return false;
    }
}

void ComponentTruth::learnTorchUser(int64_t ms, const std::string& package) {
    advanceTo(ms);
    (mFlashOn ? mPendingUser : mTorchUser) = package;
}

}  // namespace sim
}  // namespace kelvo
