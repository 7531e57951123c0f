#include "TrafficModel.h"

#include <errno.h>
#include <inttypes.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <set>
#include <sstream>

namespace kelvo {
namespace sim {

namespace {

// Tag of the tagged copy of every uid row (ignored by the daemon).
constexpr const char* kTag = "0x2a00000000";
constexpr int64_t kMaxCounter = 1LL << 50;

bool parseCount(const std::string& text, int64_t* out) {
    if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos ||
        text.size() > 15) {
        return false;
    }
    *out = strtoll(text.c_str(), nullptr, 10);
    return *out <= kMaxCounter;
}

// "RX/TX" or "RX" (nothing sent).
bool parsePair(const std::string& text, int64_t* rx, int64_t* tx) {
    size_t slash = text.find('/');
    *tx = 0;
    if (slash == std::string::npos) {
        return parseCount(text, rx);
    }
    return parseCount(text.substr(0, slash), rx) && parseCount(text.substr(slash + 1), tx);
}

bool isInterface(const std::string& text) {
    if (text.empty() || text.size() > 15) {
        return false;
    }
    for (char c : text) {
        if (!isalnum(static_cast<unsigned char>(c)) && c != '_' && c != '.' && c != '-') {
            return false;
        }
    }
    return true;
}

bool systemUid(int32_t uid) {
    return uid % 100000 == 0 || uid % 100000 == 1000;
}

std::string four(const TrafficModel::Counters& c, bool processOrder) {
    char text[128];
    if (processOrder) {
        snprintf(text, sizeof(text), "%" PRId64 "\t%" PRId64 "\t%" PRId64 "\t%" PRId64, c.rxBytes,
                 c.txBytes, c.rxPackets, c.txPackets);
    } else {
        snprintf(text, sizeof(text), "%" PRId64 " %" PRId64 " %" PRId64 " %" PRId64, c.rxBytes,
                 c.rxPackets, c.txBytes, c.txPackets);
    }
    return text;
}

void add(TrafficModel::Counters* to, const TrafficModel::Counters& c) {
    to->rxBytes += c.rxBytes;
    to->txBytes += c.txBytes;
    to->rxPackets += c.rxPackets;
    to->txPackets += c.txPackets;
}

// name -> (bytes, energy) of a query with those three columns; false when
// the table is not there (the handler that writes it is not in this build).
bool readSums(sqlite3* db, const char* sql,
              std::map<std::string, std::pair<int64_t, int64_t>>* out) {
    sqlite3_stmt* stmt = nullptr;
    if (db == nullptr || sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr) != SQLITE_OK) {
        sqlite3_finalize(stmt);
        return false;
    }
    while (sqlite3_step(stmt) == SQLITE_ROW) {
        const unsigned char* name = sqlite3_column_text(stmt, 0);
        (*out)[name != nullptr ? reinterpret_cast<const char*>(name) : ""] = {
            sqlite3_column_int64(stmt, 1), sqlite3_column_int64(stmt, 2)};
    }
    sqlite3_finalize(stmt);
    return true;
}

}  // namespace

bool TrafficModel::parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                             std::string* reason) {
    bool app = words[0] == "traffic";
    step->action = app ? Scenario::Action::Traffic : Scenario::Action::SystemTraffic;
    size_t need = app ? 6 : 5;
    size_t at = app ? 4 : 3;
    char* end = nullptr;
    long id = words.size() == need ? strtol(words[1].c_str(), &end, 10) : -1;
    bool ok = words.size() == need && end != nullptr && *end == '\0' && id >= (app ? 0 : 1) &&
              id <= 0x7FFFFFFF && isInterface(words[2]) &&
              parsePair(words[at], &step->counters[0], &step->counters[1]) &&
              parsePair(words[at + 1], &step->counters[2], &step->counters[3]);
    if (ok && app) {
        ok = words[3] == "fg" || words[3] == "bg";
        step->value = words[3] == "fg" ? 1 : 0;
    }
    if (!ok) {
        *reason = app ? "expected \"at <time> traffic <uid> <interface> fg|bg <rx>[/<tx> bytes] "
                        "<rx>[/<tx> packets]\""
                      : "expected \"at <time> systraffic <pid> <interface> <rx>[/<tx> bytes] "
                        "<rx>[/<tx> packets]\"";
        return false;
    }
    step->pid = static_cast<int32_t>(id);
    step->text = words[2];
    return true;
}

bool TrafficModel::checkStep(const Scenario& scenario, const Scenario::Step& step,
                             std::string* reason) {
    if (step.action != Scenario::Action::SystemTraffic) {
        return true;
    }
    const Scenario::Process* process = scenario.findProcess(step.pid);
    if (process == nullptr || process->nameType != 1 || !systemUid(process->uid)) {
        *reason = "pid " + std::to_string(step.pid) +
                  " is not a declared process of uid 0 or 1000 (or of another user's)";
        return false;
    }
    return true;
}

TrafficModel::TrafficModel(const Scenario& scenario, std::string root)
    : mScenario(scenario), mRoot(std::move(root)) {}

bool TrafficModel::apply(const Scenario::Step& step) {
    if (step.action != Scenario::Action::Traffic && step.action != Scenario::Action::SystemTraffic) {
        return false;
    }
    Counters c;
    c.rxBytes = step.counters[0];
    c.txBytes = step.counters[1];
    c.rxPackets = step.counters[2];
    c.txPackets = step.counters[3];
    if (step.action == Scenario::Action::Traffic) {
        add(&mUids[UidKey(step.pid, step.text, step.value)], c);
    } else {
        add(&mProcesses[ProcessKey(step.pid, step.text)], c);
    }
    return true;
}

bool TrafficModel::writeFile(const std::string& relative, const std::string& text) const {
    std::string path = mRoot + "/" + relative;
    std::string partial;
    std::stringstream in(path.substr(0, path.rfind('/')));
    std::string part;
    while (std::getline(in, part, '/')) {
        partial += part + "/";
        if (!part.empty() && mkdir(partial.c_str(), 0755) != 0 && errno != EEXIST) {
            return false;
        }
    }
    std::string temporary = path + ".new";
    {
        std::ofstream out(temporary, std::ios::trunc);
        out << text;
        if (!out) {
            return false;
        }
    }
    return rename(temporary.c_str(), path.c_str()) == 0;
}

bool TrafficModel::write() const {
    std::map<std::string, Counters> interfaces;
    std::string uids =
        "idx iface acct_tag_hex uid_tag_int cnt_set rx_bytes rx_packets tx_bytes tx_packets\n";
    int32_t index = 2;
    for (const auto& entry : mUids) {
        const std::string& iface = std::get<1>(entry.first);
        std::string tail = " " + std::to_string(std::get<0>(entry.first)) + " " +
                           std::to_string(std::get<2>(entry.first)) + " " +
                           four(entry.second, false) + "\n";
        uids += std::to_string(index++) + " " + iface + " 0x0" + tail;
        uids += std::to_string(index++) + " " + iface + " " + kTag + tail;
        add(&interfaces[iface], entry.second);
    }
    std::string processes = "iface\tuid\tpid\tname\trx_bytes\ttx_bytes\trx_packets\ttx_packets\n";
    for (const auto& entry : mProcesses) {
        const Scenario::Process* process = mScenario.findProcess(entry.first.first);
        processes += entry.first.second + "\t" + std::to_string(process->uid) + "\t" +
                     std::to_string(process->pid) + "\t" + process->name + "\t" +
                     four(entry.second, true) + "\n";
        add(&interfaces[entry.first.second], entry.second);
    }
    std::string ifaces;
    for (const auto& entry : interfaces) {
        // Active: the daemon reads the live device counters (the last four).
        ifaces += entry.first + " 1 0 0 0 0 " + four(entry.second, false) + "\n";
    }
    return writeFile(uidStatsPath(), uids) && writeFile(processStatsPath(), processes) &&
           writeFile(interfaceStatsPath(), ifaces);
}

std::string TrafficModel::appName(int32_t uid) const {
    const Scenario::App* app = mScenario.findApp(uid);
    if (app == nullptr) {
        return "uid " + std::to_string(uid);
    }
    std::vector<std::string> names = app->packages;
    std::sort(names.begin(), names.end());
    std::string text = names[0];
    for (size_t i = 1; i < names.size() && i < 3; ++i) {
        text += "|" + names[i];
    }
    return names.size() > 3 ? text + "|more..." : text;
}

std::string TrafficModel::truthTable() const {
    struct truth {
        int32_t uid = 0;
        Counters c[2];  // Wi-Fi, cellular
    };
    std::map<std::string, truth> apps;
    for (const auto& entry : mUids) {
        int32_t uid = std::get<0>(entry.first);
        truth& app = apps[appName(uid)];
        app.uid = uid;
        bool wifi = std::get<1>(entry.first).find("wlan") != std::string::npos;
        add(&app.c[wifi ? 0 : 1], entry.second);
    }
    std::string out;
    for (const auto& app : apps) {
        const Counters* c = app.second.c;
        out += app.first + "\t" + std::to_string(app.second.uid) + "\t" +
               std::to_string(c[0].rxBytes + c[0].txBytes) + "\t" +
               std::to_string(c[1].rxBytes + c[1].txBytes) + "\n";
    }
    return out;
}

std::string TrafficModel::summary(const std::string& dbPath) const {
    sqlite3* db = nullptr;
    if (sqlite3_open_v2(dbPath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
        sqlite3_close(db);
        db = nullptr;
    }
    std::map<std::string, std::pair<int64_t, int64_t>> rows;
    std::map<std::string, std::pair<int64_t, int64_t>> accounted;
    bool haveRows = readSums(db,
                             "SELECT name, SUM(rx_bytes + tx_bytes), 0 FROM "
                             "raw_wifi_package_traffic GROUP BY name",
                             &rows);
    std::string bytes, energy;
    for (const char* group :
         {"foreground", "background", "charge_foreground", "charge_background"}) {
        bytes +=
            std::string(bytes.empty() ? "" : " + ") + group + "_tx_bytes + " + group + "_rx_bytes";
        energy += std::string(energy.empty() ? "" : " + ") + group + "_energy";
    }
    bool haveAccounted = readSums(db,
                                  ("SELECT name, SUM(" + bytes + "), SUM(" + energy +
                                   ") FROM raw_applications_wifi GROUP BY name")
                                      .c_str(),
                                  &accounted);
    sqlite3_close(db);

    std::string out =
        "\nTraffic per application: truth = bytes (rx + tx) the scenario gave on the wlan\n"
        "and on the other (cellular) interfaces; rows = raw_wifi_package_traffic; accounted =\n"
        "raw_applications_wifi bytes and energy (\"-\": table absent). Traffic after the\n"
        "daemon's last poll is not in its tables yet. A system process's traffic is\n"
        "charged to its uid's package (system_server's to \"android\").\n";
    if (mHaveEnergyTruth) {
        out += mEnergyHeading;
    }
    auto truthEnergy = [this](const double* value) {
        char text[32];
        if (!mHaveEnergyTruth || value == nullptr) return std::string("-");
        snprintf(text, sizeof(text), "%.0f", *value);
        return std::string(text);
    };
    auto byProcess = [this](const std::string& name) {
        auto it = mEnergyTruth.byProcess.find(name);
        return it == mEnergyTruth.byProcess.end() ? nullptr : &it->second;
    };
    const double zero = 0;
    char line[256];
    snprintf(line, sizeof(line), "%-30s %6s %12s %12s %12s %12s %10s %12s\n", "application",
             "uid", "wifi truth", "cell truth", "rows", "accounted", "energy", "truth energy");
    out += line;
    std::istringstream truth(truthTable());
    std::string entry;
    std::set<std::string> shown;
    auto value = [](bool have, const std::map<std::string, std::pair<int64_t, int64_t>>& sums,
                    const std::string& name, bool second) {
        if (!have) return std::string("-");
        auto it = sums.find(name);
        int64_t v = it == sums.end() ? 0 : (second ? it->second.second : it->second.first);
        return std::to_string(v);
    };
    while (std::getline(truth, entry)) {
        std::vector<std::string> f;
        std::stringstream split(entry);
        std::string field;
        while (std::getline(split, field, '\t')) f.push_back(field);
        shown.insert(f[0]);
        auto uidTruth = mEnergyTruth.byUid.find(atoi(f[1].c_str()));
        snprintf(line, sizeof(line), "%-30s %6s %12s %12s %12s %12s %10s %12s\n", f[0].c_str(),
                 f[1].c_str(), f[2].c_str(), f[3].c_str(),
                 value(haveRows, rows, f[0], false).c_str(),
                 value(haveAccounted, accounted, f[0], false).c_str(),
                 value(haveAccounted, accounted, f[0], true).c_str(),
                 truthEnergy(uidTruth == mEnergyTruth.byUid.end() ? &zero : &uidTruth->second)
                     .c_str());
        out += line;
    }
    // System processes and names only the daemon knows.
    std::map<std::string, int64_t> processTruth;
    for (const auto& p : mProcesses) {
        if (p.first.second.find("wlan") != std::string::npos) {
            processTruth[mScenario.findProcess(p.first.first)->name] +=
                p.second.rxBytes + p.second.txBytes;
        }
    }
    for (const auto& p : processTruth) {
        const double* energy = byProcess(p.first);
        snprintf(line, sizeof(line), "%-30s %6s %12" PRId64 " %12s %12s %12s %10s %12s\n",
                 ("process " + p.first).c_str(), "", p.second, "-", "-", "-", "-",
                 truthEnergy(energy != nullptr ? energy : &zero).c_str());
        out += line;
    }
    for (const auto& r : rows) {
        if (shown.count(r.first) == 0) {
            snprintf(line, sizeof(line), "%-30s %6s %12s %12s %12" PRId64 " %12s %10s %12s\n",
                     r.first.c_str(), "", "-", "-", r.second.first,
                     value(haveAccounted, accounted, r.first, false).c_str(),
                     value(haveAccounted, accounted, r.first, true).c_str(),
                     truthEnergy(byProcess(r.first)).c_str());
            out += line;
        }
    }
    if (mHaveEnergyTruth && (mEnergyTruth.hotspot > 0 || accounted.count("wifi_ap") != 0)) {
        snprintf(line, sizeof(line), "%-30s %6s %12s %12s %12s %12s %10s %12s\n", "wifi_ap (hotspot)",
                 "", "-", "-", "-", "-", value(haveAccounted, accounted, "wifi_ap", true).c_str(),
                 truthEnergy(&mEnergyTruth.hotspot).c_str());
        out += line;
    }
    return out;
}

}  // namespace sim
}  // namespace kelvo
