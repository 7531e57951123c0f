#include "CameraTruth.h"

#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <tinyxml2.h>

#include <set>
#include <sstream>

namespace kelvo {
namespace sim {

namespace {

constexpr int32_t kCameraComponent = 4;

bool parseNumber(const std::string& word, int32_t low, int32_t high, int32_t* out) {
    char* end = nullptr;
    long value = strtol(word.c_str(), &end, 10);
    if (word.empty() || *end != '\0' || value < low || value > high) {
        return false;
    }
    *out = static_cast<int32_t>(value);
    return true;
}

const char* cameraOf(int32_t type) {
    return type == 1 ? "front" : "rear";
}

}  // namespace

int32_t CameraTruth::parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                               std::string* reason) {
    if (words[0] != "camera") {
        return 0;
    }
    step->action = Scenario::Action::Camera;
    const std::string what = words.size() >= 2 ? words[1] : "";
    step->text = what;
    step->values.clear();
    bool ok = false;
    if (what == "connect" && words.size() == 4) {
        int32_t id = 0;
        ok = parseNumber(words[2], 1, 0x7FFFFFFF, &step->pid) &&
             parseNumber(words[3], 0, 0x7FFFFFFF, &id);
        step->values = {id};
    } else if (what == "configure" && words.size() == 6) {
        // dual, type, width, height
        int32_t v[4] = {};
        ok = parseNumber(words[2], 0, 1, &v[0]) && parseNumber(words[3], 0, v[0] ? 3 : 1, &v[1]) &&
             parseNumber(words[4], 1, 100000, &v[2]) && parseNumber(words[5], 1, 100000, &v[3]);
        step->values.assign(v, v + 4);
    } else if (what == "unconfigure" && words.size() == 3) {
        int32_t type = 0;
        ok = parseNumber(words[2], 0, 3, &type);
        step->values = {type};
    } else if (what == "disconnect" && words.size() == 2) {
        ok = true;
    }
    if (!ok) {
        *reason =
            "expected \"at <time> camera connect <pid> <id>|configure <dual 0|1> <type> <width> "
            "<height>|unconfigure <type>|disconnect\"";
        return -1;
    }
    return 1;
}

CameraTruth::CameraTruth(const Scenario& scenario, const std::string& configPath)
    : mScenario(scenario) {
    tinyxml2::XMLDocument document;
    if (document.LoadFile(configPath.c_str()) != tinyxml2::XML_SUCCESS) {
        return;
    }
    const tinyxml2::XMLElement* root = document.RootElement();
    const tinyxml2::XMLElement* element = root ? root->FirstChildElement("element") : nullptr;
    while (element != nullptr && element->IntAttribute("id", -1) != 0) {
        element = element->NextSiblingElement("element");
    }
    const tinyxml2::XMLElement* node = element ? element->FirstChildElement("component") : nullptr;
    while (node != nullptr && node->IntAttribute("id", -1) != kCameraComponent) {
        node = node->NextSiblingElement("component");
    }
    for (const tinyxml2::XMLElement* p = node ? node->FirstChildElement("parameter") : nullptr;
         p != nullptr; p = p->NextSiblingElement("parameter")) {
        std::map<int64_t, int32_t> sizes;
        for (const tinyxml2::XMLElement* v = p->FirstChildElement("value"); v != nullptr;
             v = v->NextSiblingElement("value")) {
            if (v->GetText() != nullptr) {
                sizes.emplace(v->Int64Attribute("key", 0), atoi(v->GetText()));
            }
        }
        mPower.push_back(std::move(sizes));
    }
}

double CameraTruth::powerOf(int32_t type, const Size& size) const {
    if (type < 0 || static_cast<size_t>(type) >= mPower.size() || mPower[type].empty()) {
        return 0;
    }
    // The nearest listed size, the smaller one on a tie.
    const int64_t area = static_cast<int64_t>(size.width) * size.height;
    int64_t best = -1;
    int32_t power = 0;
    for (const auto& [key, value] : mPower[type]) {
        const int64_t distance = key > area ? key - area : area - key;
        if (best < 0 || distance < best) {
            best = distance;
            power = value;
        }
    }
    return power;
}

void CameraTruth::advanceTo(int64_t ms) {
    const int64_t dt = ms - mNowMs;
    if (dt <= 0) {
        return;
    }
    mNowMs = ms;
    if (mUser.empty()) {
        return;
    }
    for (const auto& [type, size] : mStreams) {
        Figures& f = mCameras[{mUser, cameraOf(type)}];
        f.ms += dt;
        f.energy += powerOf(type, size) * dt / 1000.0;
    }
}

bool CameraTruth::apply(const Scenario::Step& step, int64_t ms, std::string* tag,
                        std::string* text) {
    if (step.action != Scenario::Action::Camera) {
        return false;
    }
    advanceTo(ms);
    text->clear();
    mFlashlightUser.clear();
    const std::vector<int32_t>& v = step.values;
    if (step.text == "connect") {
        const Scenario::Process* process = mScenario.findProcess(step.pid);
        const Scenario::App* app = process ? mScenario.findApp(process->uid) : nullptr;
        std::string package = process && !process->package.empty() ? process->package : "";
        if (package.empty() && app != nullptr && !app->packages.empty()) {
            package = app->packages[0];
        }
        *tag = "KELVO_TAG_CAMERA_CONNECT";
        *text = "id=" + std::to_string(v[0]) + " name=" + package;
        // A connect over a running one ends it.
        mUser = package;
        mStreams.clear();
        if (v[0] == 0) {
            mFlashlightUser = package;
        }
    } else if (step.text == "configure") {
        *tag = "KELVO_TAG_CAMERA_CONFIG";
        std::ostringstream out;
        out << "dual=" << v[0] << " type=" << v[1] << " width=" << v[2] << " height=" << v[3];
        *text = out.str();
        if (v[0] == 0) {
            mStreams.clear();
        }
        mStreams[v[1]] = {v[2], v[3]};
    } else if (step.text == "unconfigure") {
        *tag = "KELVO_TAG_CAMERA_UNCONFIG";
        *text = "type=" + std::to_string(v[0]);
        mStreams.erase(v[0]);
    } else {
        *tag = "KELVO_TAG_CAMERA_DISCONNECT";
        mUser.clear();
        mStreams.clear();
    }
    return true;
}

std::string CameraTruth::report(const std::string& databasePath) const {
    std::ostringstream out;
    out << "\nCameras by application (front: stream type 1; rear: 0, 2 and 3): truth = what the\n"
           "scenario gave, attributed = the daemon's raw rows. Times in ms.\n";
    char line[256];
    snprintf(line, sizeof(line), "%-28s %-6s %9s %10s %8s %10s\n", "application", "camera", "truth",
             "attributed", "truth en", "attributed");
    out << line;
    std::map<Key, Figures> attributed;
    sqlite3* db = nullptr;
    if (sqlite3_open_v2(databasePath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
        for (const char* camera : {"front", "rear"}) {
            const std::string sql =
                std::string(
                    "SELECT name, SUM(foreground_duration + background_duration + "
                    "charge_foreground_duration + charge_background_duration), "
                    "SUM(foreground_energy + background_energy + charge_foreground_energy + "
                    "charge_background_energy) FROM raw_applications_") +
                camera + "_camera GROUP BY name";
            sqlite3_stmt* stmt = nullptr;
            if (sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) == SQLITE_OK) {
                while (sqlite3_step(stmt) == SQLITE_ROW) {
                    const unsigned char* name = sqlite3_column_text(stmt, 0);
                    Figures& f =
                        attributed[{name ? reinterpret_cast<const char*>(name) : "", camera}];
                    f.ms = sqlite3_column_int64(stmt, 1);
                    f.energy = static_cast<double>(sqlite3_column_int64(stmt, 2));
                }
            }
            sqlite3_finalize(stmt);
        }
    }
    sqlite3_close(db);
    std::set<Key> keys;
    for (const auto& entry : mCameras) keys.insert(entry.first);
    for (const auto& entry : attributed) keys.insert(entry.first);
    for (const Key& key : keys) {
        Figures none;
        auto t = mCameras.find(key);
        auto a = attributed.find(key);
        const Figures& tf = t != mCameras.end() ? t->second : none;
        const Figures& af = a != attributed.end() ? a->second : none;
        snprintf(line, sizeof(line), "%-28s %-6s %9lld %10lld %8lld %10lld\n", key.first.c_str(),
                 key.second.c_str(), static_cast<long long>(tf.ms), static_cast<long long>(af.ms),
                 static_cast<long long>(tf.energy), static_cast<long long>(af.energy));
        out << line;
    }
    return out.str();
}

}  // namespace sim
}  // namespace kelvo
