#include "DpmActivity.h"

#include <json/json.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <tinyxml2.h>

#include <fstream>
#include <sstream>

#include "FakeKernelDriver.h"
#include "utils/devices/DpmIpNames.h"

namespace kelvo {
namespace sim {

namespace {

constexpr int32_t kDpmProfileComponent = 11;
constexpr int32_t kDpmPolicyComponent = 4;
constexpr int64_t kMaxSeconds = 86400;
constexpr int64_t kMaxFlux = 1000000000;
constexpr int32_t kTopBlocks = 10;
const char* const kTimeWords[] = {"off", "busy", "low", "idle"};

bool parseNumber(const std::string& word, int64_t low, int64_t high, int64_t* out) {
    char* end = nullptr;
    long long value = strtoll(word.c_str(), &end, 10);
    if (word.empty() || *end != '\0' || value < low || value > high) {
        return false;
    }
    *out = value;
    return true;
}

const tinyxml2::XMLElement* child(const tinyxml2::XMLElement* parent, const char* name, int id) {
    const tinyxml2::XMLElement* node = parent ? parent->FirstChildElement(name) : nullptr;
    while (node != nullptr && node->IntAttribute("id", -1) != id) {
        node = node->NextSiblingElement(name);
    }
    return node;
}

// The daemon's block name of an id under the policy, or the id.
std::string blockName(int32_t policy, int32_t id) {
    if (policy == 1) {
        for (const dpm_ip_name& ip : kDpmPolicy1Ips) {
            if (ip.id == id) return ip.name;
        }
    } else {
        for (const dpm_ip_name& ip : kDpmPolicy2Ips) {
            if (ip.id == id) return ip.name;
        }
        for (const dpm_ddr_level& level : kDpmDdrLevels) {
            if (level.id == id) return level.name;
        }
    }
    return std::to_string(id);
}

int32_t blockId(int32_t policy, const std::string& name) {
    if (policy == 1) {
        for (const dpm_ip_name& ip : kDpmPolicy1Ips) {
            if (name == ip.name) return ip.id;
        }
    } else {
        for (const dpm_ip_name& ip : kDpmPolicy2Ips) {
            if (name == ip.name) return ip.id;
        }
    }
    return -1;
}

}  // namespace

int32_t DpmActivity::parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                               std::string* reason) {
    if (words[0] == "dpm") {
        step->action = Scenario::Action::Dpm;
        step->value = -1;
        for (int32_t i = 0; words.size() == 4 && i < 4; ++i) {
            if (words[2] == kTimeWords[i]) step->value = i;
        }
        int64_t seconds = 0;
        if (words.size() != 4 || words[1].empty() || words[1].size() >= 64 || step->value < 0 ||
            !parseNumber(words[3], 0, kMaxSeconds, &seconds)) {
            *reason = "expected \"at <time> dpm <ip-name> off|busy|low|idle <seconds>\"";
            return -1;
        }
        step->text = words[1];
        step->counters[0] = seconds * 1000;
        return 1;
    }
    if (words[0] == "ddr") {
        step->action = Scenario::Action::Ddr;
        int64_t level = 0;
        if (words.size() != 4 || !parseNumber(words[1], 0, 3, &level) ||
            !parseNumber(words[2], 0, kMaxSeconds, &step->counters[0]) ||
            !parseNumber(words[3], 0, kMaxFlux, &step->counters[1])) {
            *reason = "expected \"at <time> ddr <level 0..3> <seconds> <MB>\"";
            return -1;
        }
        step->value = static_cast<int32_t>(level);
        return 1;
    }
    return 0;
}

DpmActivity::DpmActivity(const std::string& configPath) {
    tinyxml2::XMLDocument document;
    if (document.LoadFile(configPath.c_str()) != tinyxml2::XML_SUCCESS) {
        return;
    }
    const tinyxml2::XMLElement* root = document.RootElement();
    const tinyxml2::XMLElement* policy =
        child(child(root, "element", 2), "component", kDpmPolicyComponent);
    const tinyxml2::XMLElement* value = policy ? policy->FirstChildElement("parameter") : nullptr;
    if (value != nullptr && value->GetText() != nullptr) {
        mPolicy = atoi(value->GetText());
    }
    const tinyxml2::XMLElement* profile =
        child(child(root, "element", 0), "component", kDpmProfileComponent);
    for (const tinyxml2::XMLElement* p = profile ? profile->FirstChildElement("parameter") : nullptr;
         p != nullptr; p = p->NextSiblingElement("parameter")) {
        std::vector<int64_t> values;
        for (const tinyxml2::XMLElement* v = p->FirstChildElement("value"); v != nullptr;
             v = v->NextSiblingElement("value")) {
            values.push_back(v->GetText() != nullptr ? atoll(v->GetText()) : 0);
        }
        if (values.size() >= 4) {
            mCoefficients.emplace(
                p->IntAttribute("id", -1),
                std::array<int64_t, 4>{values[0], values[1], values[2], values[3]});
        }
    }
}

void DpmActivity::prepare(fake::FakeKernelDriver& driver) const {
    driver.useIpNames(mPolicy);
}

void DpmActivity::apply(const Scenario::Step& step, fake::FakeKernelDriver& driver) {
    if (step.action == Scenario::Action::Ddr) {
        driver.addDdr(step.value, step.counters[0], step.counters[1]);
        mDdrSeconds += step.counters[0];
        mDdrFlux += step.counters[1];
        // The step's bandwidth picks the level's pair: time and traffic at
        // or below its threshold, or above it.
        const dpm_ddr_level& level = kDpmDdrLevels[step.value];
        const int64_t ms = step.counters[0] * 1000;
        const int64_t bandwidth = step.counters[0] > 0 ? step.counters[1] / step.counters[0] : 0;
        auto c = mCoefficients.find(level.id);
        if (c != mCoefficients.end()) {
            const size_t pair = bandwidth <= level.threshold ? 0 : 2;
            mTruth[level.name].energy +=
                (ms * c->second[pair] + step.counters[1] * c->second[pair + 1]) / 1000;
        }
        return;
    }
    const auto which = static_cast<fake::FakeKernelDriver::DpmTime>(step.value);
    if (!driver.addIpTime(step.text, which, step.counters[0])) {
        fprintf(stderr, "kelvo-sim: line %d: the driver has no block %s\n", step.line,
                step.text.c_str());
        return;
    }
    Truth& truth = mTruth[step.text];
    truth.ms[step.value] += step.counters[0];
    auto c = mCoefficients.find(blockId(mPolicy, step.text));
    int64_t numerator = 0;
    for (size_t i = 0; c != mCoefficients.end() && i < 4; ++i) {
        numerator += truth.ms[i] * c->second[i];
    }
    truth.energy = numerator / 1000;
}

std::string DpmActivity::report(const std::string& databasePath,
                                const std::string& eventsPath) const {
    if (mTruth.empty() && mDdrSeconds == 0 && mDdrFlux == 0) {
        return "";
    }
    // How many hourly uploads carried each block in their top list.
    std::map<int64_t, int32_t> uploaded;
    std::ifstream in(eventsPath);
    std::string text;
    Json::CharReaderBuilder builder;
    while (std::getline(in, text)) {
        Json::Value event;
        std::string errors;
        std::istringstream stream(text);
        if (!Json::parseFromStream(builder, stream, &event, &errors) || !event.isObject() ||
            event["event"].asUInt() != 903001060u) {
            continue;
        }
        const Json::Value& top = event["params"]["34"];
        for (Json::ArrayIndex i = 0; top.isArray() && i < top.size(); ++i) {
            ++uploaded[top[i]["params"]["0"].asInt64()];
        }
    }
    std::ostringstream out;
    out << "\nTop DPM blocks by the daemon's energy (raw_component_dpm, charging included) "
           "beside the simulator's truth; hourly = hourly_component_dpm, uploads = hourly "
           "events whose top list (34) had the block. Busy in ms.\n";
    char line[256];
    snprintf(line, sizeof(line), "%-16s %6s %11s %11s %9s %9s %9s %7s\n", "block", "id",
             "truth busy", "daemon busy", "truth en", "daemon en", "hourly en", "uploads");
    out << line;
    sqlite3* db = nullptr;
    sqlite3_stmt* stmt = nullptr;
    const std::string sql =
        "SELECT r.ip, SUM(r.busy_time), SUM(r.energy + r.charge_energy), (SELECT "
        "IFNULL(SUM(h.energy), 0) FROM hourly_component_dpm h WHERE h.ip = r.ip) FROM "
        "raw_component_dpm r GROUP BY r.ip ORDER BY 3 DESC, 1 LIMIT " +
        std::to_string(kTopBlocks);
    if (sqlite3_open_v2(databasePath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK &&
        sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) == SQLITE_OK) {
        while (sqlite3_step(stmt) == SQLITE_ROW) {
            const int32_t id = sqlite3_column_int(stmt, 0);
            const std::string name = blockName(mPolicy, id);
            auto truth = mTruth.find(name);
            const Truth none;
            const Truth& t = truth != mTruth.end() ? truth->second : none;
            auto count = uploaded.find(id);
            snprintf(line, sizeof(line), "%-16s %6d %11lld %11lld %9lld %9lld %9lld %7d\n",
                     name.c_str(), id, static_cast<long long>(t.ms[1]),
                     static_cast<long long>(sqlite3_column_int64(stmt, 1)),
                     static_cast<long long>(t.energy),
                     static_cast<long long>(sqlite3_column_int64(stmt, 2)),
                     static_cast<long long>(sqlite3_column_int64(stmt, 3)),
                     count != uploaded.end() ? count->second : 0);
            out << line;
        }
    }
    sqlite3_finalize(stmt);
    sqlite3_close(db);
    size_t blocks = 0;
    for (const auto& entry : mTruth) {
        blocks += entry.first.rfind(kDpmDdrLevelPrefix, 0) == 0 ? 0 : 1;
    }
    snprintf(line, sizeof(line),
             "  driven: %zu blocks, DDR %lld s and %lld MB (the DDR_BW_FREQ_ rows; the first "
             "read only takes the DDR baselines)\n",
             blocks, static_cast<long long>(mDdrSeconds), static_cast<long long>(mDdrFlux));
    out << line;
    return out.str();
}

}  // namespace sim
}  // namespace kelvo
