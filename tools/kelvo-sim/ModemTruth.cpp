#include "ModemTruth.h"

#include <inttypes.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <tinyxml2.h>

#include <algorithm>
#include <set>
#include <sstream>

namespace kelvo {
namespace sim {

namespace {

constexpr int32_t kModemComponent = 8;
constexpr size_t kMaxLevels = 10;
constexpr int32_t kLteMode = 5;
constexpr int32_t kWcdmaMode = 1;
constexpr int64_t kHourMs = 3600 * 1000;
// The hourly poll's block is filed under the hour that has just ended.
constexpr int64_t kHourlyAnswerMs = 30 * 1000;
// The most connected time the LTE record may hold, in 1/8 s (2^29 - 2 ticks).
constexpr int64_t kMaxLteActive = (((1 << 29) - 2) >> 12);

const tinyxml2::XMLElement* childWithId(const tinyxml2::XMLElement* parent, const char* name,
                                        int id) {
    for (const tinyxml2::XMLElement* c = parent ? parent->FirstChildElement(name) : nullptr;
         c != nullptr; c = c->NextSiblingElement(name)) {
        if (c->IntAttribute("id", -1) == id) return c;
    }
    return nullptr;
}

int64_t units(int64_t ms) {
    return std::min<int64_t>(ms / 125, UINT32_MAX >> 12);
}

// One action's energy: Σ t × power / 1000, truncated; t in ms per level.
int64_t levelsEnergy(const std::vector<int64_t>& ms, const std::vector<int64_t>& powers,
                     int64_t* usage) {
    int64_t sum = 0;
    for (size_t i = 0; i < ms.size(); ++i) {
        if (ms[i] >= 1) {
            *usage += ms[i];
            sum += ms[i] * (i < powers.size() ? powers[i] : 0);
        }
    }
    return sum / 1000;
}

struct Sums {
    int64_t bytes = 0;
    int64_t energy = 0;
    int64_t ms = 0;
};

// key -> sums of a query with (key, ms or bytes, energy) columns; false
// when the table is absent.
bool readSums(sqlite3* db, const std::string& sql, std::map<std::string, Sums>* out) {
    sqlite3_stmt* stmt = nullptr;
    if (db == nullptr || sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) != SQLITE_OK) {
        sqlite3_finalize(stmt);
        return false;
    }
    while (sqlite3_step(stmt) == SQLITE_ROW) {
        const unsigned char* key = sqlite3_column_text(stmt, 0);
        Sums& s = (*out)[key != nullptr ? reinterpret_cast<const char*>(key) : ""];
        s.bytes = s.ms = sqlite3_column_int64(stmt, 1);
        s.energy = sqlite3_column_int64(stmt, 2);
    }
    sqlite3_finalize(stmt);
    return true;
}

int64_t residencyMs(const ModemModel::Residency& r) {
    int64_t sum = r.volte;
    for (int64_t ms : r.lteTx) sum += ms;
    for (int32_t i = 0; i < ModemModel::kIdleLevels; ++i) sum += r.lteIdle[i] + r.wcdmaIdle[i];
    for (int32_t i = 0; i < ModemModel::kWcdmaLevels; ++i) {
        sum += r.wcdmaVoice[i] + r.wcdmaData[i];
    }
    return sum;
}

bool wellFormed(const ModemModel::Sent& sent) {
    return sent.fault == ModemModel::Fault::None || sent.fault == ModemModel::Fault::Pam;
}

}  // namespace

bool ModemTruth::readProfile(const std::string& configPath, Profile* profile) {
    *profile = Profile();
    tinyxml2::XMLDocument document;
    if (document.LoadFile(configPath.c_str()) != tinyxml2::XML_SUCCESS) {
        return false;
    }
    const tinyxml2::XMLElement* modem = childWithId(
        childWithId(document.RootElement(), "element", 0), "component", kModemComponent);
    for (int mode = 0; mode < 6; ++mode) {
        const tinyxml2::XMLElement* p = childWithId(modem, "parameter", mode);
        for (const tinyxml2::XMLElement* v = p ? p->FirstChildElement("value") : nullptr;
             v != nullptr; v = v->NextSiblingElement("value")) {
            const int64_t value = v->GetText() != nullptr ? atoll(v->GetText()) : 0;
            const int key = v->IntAttribute("key", 0);
            if (key >= 0 && key < 3 && profile->powers[mode][key].size() < kMaxLevels) {
                profile->powers[mode][key].push_back(value);
            } else if (key == 3 && mode == 1) {
                profile->special = value;
            }
        }
    }
    return modem != nullptr;
}

ModemTruth::Energy ModemTruth::energyOf(const ModemModel::Residency& r, const Profile& profile) {
    Energy e;
    // LTE physical layer, in 1/8 s units as the record's ticks are read.
    int64_t x[ModemModel::kLteLevels];
    int64_t active = units(r.volte);
    for (int32_t i = 0; i < ModemModel::kLteLevels; ++i) {
        x[i] = units(r.lteTx[i]);
        active += x[i];
    }
    const int64_t volte = units(r.volte);
    const auto& lte = profile.powers[kLteMode][r.band == 1 ? 1 : 2];
    if (active <= kMaxLteActive) {
        std::vector<int64_t> voice(ModemModel::kLteLevels), data(ModemModel::kLteLevels);
        for (int32_t i = 0; i < ModemModel::kLteLevels; ++i) {
            const int64_t share = volte > 0 ? volte * x[i] / active : 0;
            voice[i] = share * 125;
            data[i] = x[i] * 125 - voice[i];
        }
        if (volte > 0) {
            int64_t ignored = 0;
            e.voice += levelsEnergy(voice, lte, &ignored);
            e.voiceMs += volte * 125;
        }
        e.data += levelsEnergy(data, lte, &e.dataMs);
    }
    // LTE idle: exact ms per signal level.
    std::vector<int64_t> idle(r.lteIdle, r.lteIdle + ModemModel::kIdleLevels);
    e.idle += levelsEnergy(idle, profile.powers[kLteMode][0], &e.idleMs);
    // WCDMA: idle in 1/8 s, transmit counts of 10 ms.
    std::vector<int64_t> drx(ModemModel::kIdleLevels);
    for (int32_t i = 0; i < ModemModel::kIdleLevels; ++i) drx[i] = units(r.wcdmaIdle[i]) * 125;
    e.idle += levelsEnergy(drx, profile.powers[kWcdmaMode][0], &e.idleMs);
    std::vector<int64_t> cs(ModemModel::kWcdmaLevels), ps(ModemModel::kWcdmaLevels);
    for (int32_t i = 0; i < ModemModel::kWcdmaLevels; ++i) {
        cs[i] = r.wcdmaVoice[i] / 10 * 10;
        ps[i] = r.wcdmaData[i] / 10 * 10;
    }
    e.voice += levelsEnergy(cs, profile.powers[kWcdmaMode][1], &e.voiceMs);
    e.data += levelsEnergy(ps, profile.powers[kWcdmaMode][2], &e.dataMs);
    return e;
}

ModemTruth::ModemTruth(const Scenario& scenario, const Profile& profile, int64_t startMs,
                       int64_t endMs)
    : mScenario(scenario), mProfile(profile), mStartMs(startMs), mEndMs(endMs) {}

int64_t ModemTruth::hourOf(int64_t elapsedMs, bool request) const {
    const int64_t wall = mStartMs + elapsedMs;
    const int64_t within = ((wall % kHourMs) + kHourMs) % kHourMs;
    if (within == 0 || (request && within < kHourlyAnswerMs)) {
        return wall - within;
    }
    return wall - within + kHourMs;
}

std::string ModemTruth::appName(int32_t uid) const {
    const Scenario::App* app = mScenario.findApp(uid);
    if (app == nullptr) {
        return "uid " + std::to_string(uid);
    }
    if (app->packages.size() == 1) {
        return app->packages[0];
    }
    std::vector<std::string> names = app->packages;
    std::sort(names.begin(), names.end());
    std::string text = names[0];
    for (size_t i = 1; i < names.size() && i < 3; ++i) text += "|" + names[i];
    return names.size() > 3 ? text + "|more..." : text;
}

void ModemTruth::compute(const std::vector<ModemModel::Sent>& sent) {
    mTotal = Energy();
    mApps.clear();
    mOpenHourData = 0;
    mUsed = !sent.empty();
    std::map<int64_t, int64_t> dataByHour;
    for (const ModemModel::Sent& answer : sent) {
        if (!wellFormed(answer)) continue;
        Energy e = energyOf(answer.residency, mProfile);
        mTotal.idle += e.idle;
        mTotal.voice += e.voice;
        mTotal.data += e.data;
        mTotal.idleMs += e.idleMs;
        mTotal.voiceMs += e.voiceMs;
        mTotal.dataMs += e.dataMs;
        dataByHour[hourOf(answer.requestMs, true)] += e.data;
    }
    // Cellular packets per hour: the daemon reads them with the next block.
    std::map<int64_t, std::map<std::string, int64_t>> packetsByHour;
    for (const Scenario::Step& step : mScenario.steps()) {
        if (step.action == Scenario::Action::Modem) mUsed = true;
        if (step.action != Scenario::Action::Traffic ||
            step.text.find("rmnet") == std::string::npos) {
            continue;
        }
        mUsed = true;
        int64_t hour = hourOf(step.atMs, false);
        for (const ModemModel::Sent& answer : sent) {
            if (wellFormed(answer) && answer.answerMs >= step.atMs) {
                hour = hourOf(answer.requestMs, true);
                break;
            }
        }
        const std::string name = appName(step.pid);
        App& app = mApps[name];
        app.uid = step.pid;
        app.bytes += step.counters[0] + step.counters[1];
        app.packets += step.counters[2] + step.counters[3];
        packetsByHour[hour][name] += step.counters[2] + step.counters[3];
    }
    for (const auto& [hour, energy] : dataByHour) {
        auto packets = packetsByHour.find(hour);
        int64_t total = 0;
        if (packets != packetsByHour.end()) {
            for (const auto& entry : packets->second) total += entry.second;
        }
        if (hour > mStartMs + mEndMs || total == 0) {
            mOpenHourData += static_cast<double>(energy);
            continue;
        }
        for (const auto& [name, count] : packets->second) {
            mApps[name].energy += static_cast<double>(energy) * count / total;
        }
    }
}

std::string ModemTruth::table() const {
    std::string out;
    char line[256];
    const std::pair<const char*, std::pair<int64_t, int64_t>> kinds[] = {
        {"idle", {mTotal.idleMs, mTotal.idle}},
        {"voice", {mTotal.voiceMs, mTotal.voice}},
        {"data", {mTotal.dataMs, mTotal.data}}};
    for (const auto& [kind, figures] : kinds) {
        snprintf(line, sizeof(line), "component\t%s\t%" PRId64 "\t%" PRId64 "\n", kind,
                 figures.first, figures.second);
        out += line;
    }
    for (const auto& [name, app] : mApps) {
        snprintf(line, sizeof(line), "app\t%s\t%d\t%" PRId64 "\t%" PRId64 "\t%.0f\n", name.c_str(),
                 app.uid, app.packets, app.bytes, app.energy);
        out += line;
    }
    return out;
}

std::string ModemTruth::report(const std::string& databasePath, int32_t requests,
                               const std::vector<ModemModel::Sent>& sent,
                               const ModemModel::Residency& pending) const {
    if (!mUsed && requests == 0) {
        return "";
    }
    sqlite3* db = nullptr;
    if (sqlite3_open_v2(databasePath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
        sqlite3_close(db);
        db = nullptr;
    }
    std::map<std::string, Sums> component, accounted;
    const bool haveComponent = readSums(db,
                                        "SELECT type, SUM(duration + charge_duration), "
                                        "SUM(energy + charge_energy) FROM raw_component_modem "
                                        "GROUP BY type",
                                        &component);
    std::string bytes, energy;
    for (const char* group :
         {"foreground", "background", "charge_foreground", "charge_background"}) {
        bytes +=
            std::string(bytes.empty() ? "" : " + ") + group + "_tx_bytes + " + group + "_rx_bytes";
        energy += std::string(energy.empty() ? "" : " + ") + group + "_energy";
    }
    const bool haveAccounted = readSums(db,
                                        "SELECT name, SUM(" + bytes + "), SUM(" + energy +
                                            ") FROM raw_applications_modem GROUP BY name",
                                        &accounted);
    sqlite3_close(db);

    int32_t malformed = 0, accepted = 0;
    int64_t lostMs = 0;
    for (const ModemModel::Sent& answer : sent) {
        if (!wellFormed(answer)) {
            ++malformed;
            lostMs += residencyMs(answer.residency);
        }
        accepted += answer.result == 0 ? 1 : 0;
    }
    std::ostringstream out;
    char line[256];
    snprintf(line, sizeof(line),
             "\nModem: %d requests, %zu answers (%d malformed), %d accepted by the manager "
             "service;\n",
             requests, sent.size(), malformed, accepted);
    out << line;
    snprintf(line, sizeof(line),
             "%" PRId64 " ms of residency lost in malformed answers, %" PRId64
             " ms never answered.\n",
             lostMs, residencyMs(pending));
    out << line;
    out << "truth = the profile's modem energy (component 8) of the residency the well-formed\n"
           "answers carried; daemon = raw_component_modem (type 1 idle, 0 voice, 2 data) and\n"
           "raw_applications_modem (\"-\": table absent). Times in ms.\n";
    snprintf(line, sizeof(line), "%-10s %10s %12s %10s %12s\n", "kind", "truth ms", "truth energy",
             "daemon ms", "daemon en");
    out << line;
    const std::pair<const char*, std::pair<std::string, std::pair<int64_t, int64_t>>> kinds[] = {
        {"idle", {"1", {mTotal.idleMs, mTotal.idle}}},
        {"voice", {"0", {mTotal.voiceMs, mTotal.voice}}},
        {"data", {"2", {mTotal.dataMs, mTotal.data}}}};
    for (const auto& [kind, figures] : kinds) {
        auto it = component.find(figures.first);
        Sums none;
        const Sums& d = it != component.end() ? it->second : none;
        snprintf(line, sizeof(line), "%-10s %10" PRId64 " %12" PRId64 " %10s %12s\n", kind,
                 figures.second.first, figures.second.second,
                 haveComponent ? std::to_string(d.ms).c_str() : "-",
                 haveComponent ? std::to_string(d.energy).c_str() : "-");
        out << line;
    }
    out << "Cellular traffic per application: truth = packets and bytes (rx + tx) on rmnet\n"
           "interfaces and the data energy split by packets within each hour whose round\n"
           "ran; accounted = raw_applications_modem bytes and energy.\n";
    snprintf(line, sizeof(line), "%-30s %6s %9s %11s %11s %10s %12s\n", "application", "uid",
             "packets", "bytes", "accounted", "energy", "truth energy");
    out << line;
    std::set<std::string> names;
    for (const auto& entry : mApps) names.insert(entry.first);
    for (const auto& entry : accounted) names.insert(entry.first);
    for (const std::string& name : names) {
        auto t = mApps.find(name);
        auto a = accounted.find(name);
        const bool truth = t != mApps.end();
        snprintf(line, sizeof(line), "%-30s %6s %9s %11s %11s %10s %12s\n", name.c_str(),
                 truth ? std::to_string(t->second.uid).c_str() : "",
                 truth ? std::to_string(t->second.packets).c_str() : "-",
                 truth ? std::to_string(t->second.bytes).c_str() : "-",
                 !haveAccounted         ? "-"
                 : a != accounted.end() ? std::to_string(a->second.bytes).c_str()
                                        : "0",
                 !haveAccounted         ? "-"
                 : a != accounted.end() ? std::to_string(a->second.energy).c_str()
                                        : "0",
                 truth ? std::to_string(static_cast<int64_t>(t->second.energy + 0.5)).c_str() : "-");
        out << line;
    }
    snprintf(line, sizeof(line),
             "data energy not yet given to applications (an hour still open, or no cellular "
             "packets in it): %.0f\n",
             mOpenHourData);
    out << line;
    return out.str();
}

}  // namespace sim
}  // namespace kelvo
