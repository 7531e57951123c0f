#include "GpuLoadTruth.h"

#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <tinyxml2.h>

#include <set>
#include <sstream>

#include "FakeKernelDriver.h"

namespace kelvo {
namespace sim {

namespace {

constexpr int32_t kGpuProfileComponent = 9;
constexpr int32_t kMaxBusyMs = 3600000;

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

int32_t GpuLoadTruth::parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                                std::string* reason) {
    if (words[0] != "gpu") {
        return 0;
    }
    step->action = Scenario::Action::Gpu;
    if (words.size() != 4 || words[1].empty() ||
        !parseNumber(words[2], 1, 100000, &step->frequency) ||
        !parseNumber(words[3], 0, kMaxBusyMs, &step->value)) {
        *reason = "expected \"at <time> gpu <package> <MHz> <busy ms>\"";
        return -1;
    }
    step->text = words[1];
    return 1;
}

GpuLoadTruth::GpuLoadTruth(const std::string& configPath) {
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
    while (node != nullptr && node->IntAttribute("id", -1) != kGpuProfileComponent) {
        node = node->NextSiblingElement("component");
    }
    for (const tinyxml2::XMLElement* p = node ? node->FirstChildElement("parameter") : nullptr;
         p != nullptr; p = p->NextSiblingElement("parameter")) {
        for (const tinyxml2::XMLElement* v = p->FirstChildElement("value"); v != nullptr;
             v = v->NextSiblingElement("value")) {
            if (v->GetText() != nullptr) {
                mPowers.emplace(v->IntAttribute("key", 0), atoll(v->GetText()));
            }
        }
    }
}

int64_t GpuLoadTruth::powerAt(int64_t megahertz) const {
    // The nearest step, the lower one on a tie.
    int64_t best = 0;
    int64_t distance = -1;
    for (const auto& [key, power] : mPowers) {
        const int64_t d = key > megahertz ? key - megahertz : megahertz - key;
        if (distance < 0 || d < distance) {
            distance = d;
            best = power;
        }
    }
    return best;
}

void GpuLoadTruth::apply(const Scenario::Step& step, fake::FakeKernelDriver& driver) {
    driver.addGpuResidency(static_cast<int64_t>(step.frequency) * 1000000, step.value * 1000LL, 0);
    Figures& f = mTruth[step.text];
    f.busyMs += step.value;
    f.energy += step.value * powerAt(step.frequency) / 1000;
}

std::string GpuLoadTruth::report(const std::string& databasePath) const {
    if (mTruth.empty()) {
        return "";
    }
    std::map<std::string, Figures> attributed;
    sqlite3* db = nullptr;
    if (sqlite3_open_v2(databasePath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
        sqlite3_stmt* stmt = nullptr;
        const char* sql =
            "SELECT name, SUM(usage + charge_usage), SUM(energy + charge_energy) FROM "
            "raw_applications_gpu GROUP BY name";
        if (sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr) == SQLITE_OK) {
            while (sqlite3_step(stmt) == SQLITE_ROW) {
                const unsigned char* name = sqlite3_column_text(stmt, 0);
                Figures& f = attributed[name ? reinterpret_cast<const char*>(name) : ""];
                f.busyMs = sqlite3_column_int64(stmt, 1);
                f.energy = sqlite3_column_int64(stmt, 2);
            }
        }
        sqlite3_finalize(stmt);
    }
    sqlite3_close(db);
    std::ostringstream out;
    out << "\nGPU busy time per application: truth = what the scenario gave, attributed = the "
           "daemon's raw rows. Times in ms.\n";
    char line[256];
    snprintf(line, sizeof(line), "%-10s %-28s %9s %10s %8s %10s\n", "component", "application",
             "truth", "attributed", "truth en", "attributed");
    out << line;
    std::set<std::string> names;
    for (const auto& entry : mTruth) names.insert(entry.first);
    for (const auto& entry : attributed) names.insert(entry.first);
    for (const std::string& name : names) {
        auto t = mTruth.find(name);
        auto a = attributed.find(name);
        const Figures none;
        const Figures& tf = t != mTruth.end() ? t->second : none;
        const Figures& af = a != attributed.end() ? a->second : none;
        if (tf.busyMs == 0 && af.busyMs == 0 && af.energy == 0) {
            continue;
        }
        snprintf(line, sizeof(line), "%-10s %-28s %9lld %10lld %8lld %10lld\n", "gpu", name.c_str(),
                 static_cast<long long>(tf.busyMs), static_cast<long long>(af.busyMs),
                 static_cast<long long>(tf.energy), static_cast<long long>(af.energy));
        out << line;
    }
    return out.str();
}

}  // namespace sim
}  // namespace kelvo
