#include "RadioSensorTruth.h"

#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <tinyxml2.h>

#include <sstream>

namespace kelvo {
namespace sim {

namespace {

// The first value of each parameter of a grouped profile component, by id.
std::map<int32_t, int32_t> groupedValues(const tinyxml2::XMLElement* root, int component) {
    std::map<int32_t, int32_t> values;
    const tinyxml2::XMLElement* element = root ? root->FirstChildElement("element") : nullptr;
    while (element != nullptr && element->IntAttribute("id", -1) != 0) {
        element = element->NextSiblingElement("element");
    }
    const tinyxml2::XMLElement* node = element ? element->FirstChildElement("component") : nullptr;
    while (node != nullptr && node->IntAttribute("id", -1) != component) {
        node = node->NextSiblingElement("component");
    }
    for (const tinyxml2::XMLElement* p = node ? node->FirstChildElement("parameter") : nullptr;
         p != nullptr; p = p->NextSiblingElement("parameter")) {
        const tinyxml2::XMLElement* value = p->FirstChildElement("value");
        if (value != nullptr && value->GetText() != nullptr) {
            values[p->IntAttribute("id", -1)] = atoi(value->GetText());
        }
    }
    return values;
}

bool parseNumber(const std::string& word, int32_t low, int32_t high, int32_t* out) {
    char* end = nullptr;
    long value = strtol(word.c_str(), &end, 10);
    if (word.empty() || *end != '\0' || value < low || value > high) {
        return false;
    }
    *out = static_cast<int32_t>(value);
    return true;
}

}  // namespace

int32_t RadioSensorTruth::parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                                    std::string* reason) {
    if (words[0] == "bluetooth") {
        step->action = Scenario::Action::Bluetooth;
        const std::string what = words.size() >= 2 ? words[1] : "";
        bool ok = (what == "send" || what == "receive" || what == "stop") && words.size() == 2;
        if (what == "discovery" && words.size() >= 3) {
            ok = (words[2] == "stop" && words.size() == 3) ||
                 (words[2] == "start" && words.size() == 4 &&
                  parseNumber(words[3], 1, 0x7FFFFFFF, &step->pid));
        }
        if (!ok) {
            *reason =
                "expected \"at <time> bluetooth discovery start <pid>|discovery stop|send|"
                "receive|stop\"";
            return -1;
        }
        step->text = what == "discovery" ? what + "-" + words[2] : what;
        return 1;
    }
    if (words[0] == "sensor") {
        step->action = Scenario::Action::Sensor;
        if (words.size() != 5 || (words[1] != "enable" && words[1] != "disable") ||
            !parseNumber(words[2], 1, 0x7FFFFFFF, &step->pid) ||
            !parseNumber(words[3], words[1] == "disable" ? -1 : 0, 0x7FFFFFFF, &step->value) ||
            words[4].find_first_of(" |") != std::string::npos) {
            *reason = "expected \"at <time> sensor enable|disable <pid> <type> <connection>\"";
            return -1;
        }
        step->flag = words[1] == "enable";
        step->text = words[4];
        return 1;
    }
    return 0;
}

RadioSensorTruth::RadioSensorTruth(const Scenario& scenario, const std::string& configPath)
    : mScenario(scenario) {
    tinyxml2::XMLDocument document;
    if (document.LoadFile(configPath.c_str()) == tinyxml2::XML_SUCCESS) {
        mBluetoothPower = groupedValues(document.RootElement(), 6);
        mSensorPower = groupedValues(document.RootElement(), 7);
    }
}

std::string RadioSensorTruth::packageOf(int32_t pid, int32_t* uid) const {
    const Scenario::Process* process = mScenario.findProcess(pid);
    if (process == nullptr) {
        *uid = 0;
        return "";
    }
    *uid = process->uid;
    if (!process->package.empty()) {
        return process->package;
    }
    const Scenario::App* app = mScenario.findApp(process->uid);
    return app != nullptr && !app->packages.empty() ? app->packages[0] : "";
}

void RadioSensorTruth::advanceTo(int64_t ms) {
    const int64_t dt = ms - mNowMs;
    if (dt <= 0) {
        return;
    }
    mNowMs = ms;
    auto charge = [&](std::map<Key, Figures>& to, const Key& key, double power) {
        to[key].ms += dt;
        to[key].energy += power * dt / 1000.0;
    };
    if (!mDiscovery.empty()) {
        charge(mBluetooth, {mDiscovery, 0}, mBluetoothPower[0]);
    }
    if (!mTransfer.empty()) {
        charge(mBluetooth, {mTransfer, mTransferType}, mBluetoothPower[mTransferType]);
    }
    std::map<int32_t, int32_t> holders;
    for (const auto& e : mEnabled) {
        ++holders[std::get<0>(e)];
    }
    for (const auto& e : mEnabled) {
        const int32_t type = std::get<0>(e);
        // Sensor powers are in 0.1 mA.
        const bool wakeUpType = type == 17 || type == 19 || type == 65545;
        charge(mAsleep && !wakeUpType ? mSleeping : mSensors, {std::get<1>(e), type},
               mSensorPower[type] / 10.0 / holders[type]);
    }
}

void RadioSensorTruth::suspend(int64_t ms) {
    advanceTo(ms);
    mAsleep = true;
    mWoken = false;
}

void RadioSensorTruth::wakeup(int64_t ms) {
    advanceTo(ms);
    mWoken = mAsleep;
}

void RadioSensorTruth::resume(int64_t ms) {
    advanceTo(ms);
    if (!mWoken) {
        // A sleep the daemon does not count: the sensors ran through it.
        for (const auto& [key, figures] : mSleeping) {
            mSensors[key].ms += figures.ms;
            mSensors[key].energy += figures.energy;
        }
    }
    mSleeping.clear();
    mAsleep = false;
    mWoken = false;
}

void RadioSensorTruth::setAudio(const std::string& package, int64_t ms, double energy) {
    mAudio[{package, 0}] = Figures{ms, energy};
}

void RadioSensorTruth::setMedia(const std::string& package, int64_t ms) {
    Figures& media = mBluetooth[{package, 3}];
    media.ms = ms;
    media.energy = mBluetoothPower[3] * static_cast<double>(ms) / 1000.0;
}

bool RadioSensorTruth::apply(const Scenario::Step& step, int64_t ms, std::string* tag,
                             std::string* text) {
    if (step.action != Scenario::Action::Bluetooth && step.action != Scenario::Action::Sensor) {
        return false;
    }
    advanceTo(ms);
    int32_t uid = 0;
    text->clear();
    if (step.action == Scenario::Action::Sensor) {
        const std::string package = packageOf(step.pid, &uid);
        std::ostringstream out;
        out << "uid=" << uid << " name=" << package << " type=" << step.value
            << " connection=" << step.text;
        *text = out.str();
        *tag = step.flag ? "KELVO_TAG_SENSOR_ENABLE" : "KELVO_TAG_SENSOR_DISABLE";
        if (step.flag) {
            mEnabled.emplace(step.value, package, step.text);
        } else {
            for (auto it = mEnabled.begin(); it != mEnabled.end();) {
                bool match = (step.value == -1 || std::get<0>(*it) == step.value) &&
                             std::get<1>(*it) == package && std::get<2>(*it) == step.text;
                it = match ? mEnabled.erase(it) : std::next(it);
            }
        }
        return true;
    }
    if (step.text == "discovery-start") {
        *tag = "KELVO_TAG_BT_DISCOVERY_START";
        const std::string package = packageOf(step.pid, &uid);
        *text = "uid=" + std::to_string(uid) + " pid=" + std::to_string(step.pid);
        if (mDiscovery.empty()) {
            mDiscovery = package.empty() ? "Unknow package" : package;
        }
    } else if (step.text == "discovery-stop") {
        *tag = "KELVO_TAG_BT_DISCOVERY_STOP";
        mDiscovery.clear();
    } else if (step.text == "stop") {
        *tag = "KELVO_TAG_BT_TRANSFER_STOP";
        mTransfer.clear();
    } else {
        const bool send = step.text == "send";
        *tag = send ? "KELVO_TAG_BT_TRANSFER_TX_START" : "KELVO_TAG_BT_TRANSFER_RX_START";
        if (mTransfer.empty()) {
            mTransfer = kTransferPackage;
            mTransferType = send ? 1 : 2;
        }
    }
    return true;
}

std::string RadioSensorTruth::report(const std::string& databasePath) const {
    std::ostringstream out;
    out << "\nAudio on the powered outputs, Bluetooth by activity (0 discovery, 1 sending,\n"
           "2 receiving, 3 media) and sensors by type: truth = what the scenario gave,\n"
           "attributed = the daemon's raw rows. Times in ms.\n";
    char line[256];
    snprintf(line, sizeof(line), "%-10s %-28s %5s %9s %10s %8s %10s\n", "component", "application",
             "kind", "truth", "attributed", "truth en", "attributed");
    out << line;
    sqlite3* db = nullptr;
    if (sqlite3_open_v2(databasePath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
        sqlite3_close(db);
        db = nullptr;
    }
    const std::pair<const char*, const std::map<Key, Figures>*> parts[] = {
        {"audio", &mAudio}, {"bluetooth", &mBluetooth}, {"sensor", &mSensors}};
    for (const auto& [word, truth] : parts) {
        std::map<Key, Figures> attributed;
        // Audio rows carry no type: the powered outputs are one line.
        const bool audio = std::string(word) == "audio";
        std::string sql = std::string("SELECT name, ") + (audio ? "0" : "type") +
                          ", SUM(foreground_duration + background_duration + "
                          "charge_foreground_duration + charge_background_duration), "
                          "SUM(foreground_energy + background_energy + "
                          "charge_foreground_energy + charge_background_energy) "
                          "FROM raw_applications_" +
                          word + " GROUP BY 1, 2";
        sqlite3_stmt* stmt = nullptr;
        if (db != nullptr && sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) == SQLITE_OK) {
            while (sqlite3_step(stmt) == SQLITE_ROW) {
                const unsigned char* name = sqlite3_column_text(stmt, 0);
                Figures& f = attributed[{name ? reinterpret_cast<const char*>(name) : "",
                                         sqlite3_column_int(stmt, 1)}];
                f.ms = sqlite3_column_int64(stmt, 2);
                f.energy = static_cast<double>(sqlite3_column_int64(stmt, 3));
            }
        }
        sqlite3_finalize(stmt);
        std::set<Key> keys;
        for (const auto& entry : *truth) keys.insert(entry.first);
        for (const auto& entry : attributed) keys.insert(entry.first);
        for (const Key& key : keys) {
            auto t = truth->find(key);
            auto a = attributed.find(key);
            Figures none;
            const Figures& tf = t != truth->end() ? t->second : none;
            const Figures& af = a != attributed.end() ? a->second : none;
            snprintf(line, sizeof(line), "%-10s %-28s %5d %9lld %10lld %8lld %10lld\n", word,
                     key.first.c_str(), key.second, static_cast<long long>(tf.ms),
                     static_cast<long long>(af.ms), static_cast<long long>(tf.energy),
                     static_cast<long long>(af.energy));
            out << line;
        }
    }
    sqlite3_close(db);
    return out.str();
}

}  // namespace sim
}  // namespace kelvo
