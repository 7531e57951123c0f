#include "WifiEnergyTruth.h"

#include <sqlite3.h>
#include <stdlib.h>
#include <tinyxml2.h>

#include <algorithm>
#include <set>
#include <tuple>

namespace kelvo {
namespace sim {

namespace {

constexpr int64_t kMaxLevelTimeMs = 660000;
// The display handler tells the screen's change this much after the record.
constexpr int64_t kScreenNoticeMs = 200;
constexpr int32_t kLevels = 4;

// Record kinds of WifiRecords, in its table's order.
enum WifiKind { ON, OFF, AP_ON, AP_OFF, ACTIVE, IDLE, BAND, LEVEL, SCAN };

const tinyxml2::XMLElement* childWithId(const tinyxml2::XMLElement* parent, const char* name,
                                        int id) {
    for (const tinyxml2::XMLElement* c = parent ? parent->FirstChildElement(name) : nullptr;
         c != nullptr; c = c->NextSiblingElement(name)) {
        if (c->IntAttribute("id", -1) == id) return c;
    }
    return nullptr;
}

struct Packets {
    double tx = 0;
    double rx = 0;
};

}  // namespace

bool WifiEnergyTruth::readProfile(const std::string& configPath, Profile* profile) {
    *profile = Profile();
    tinyxml2::XMLDocument document;
    if (document.LoadFile(configPath.c_str()) != tinyxml2::XML_SUCCESS) {
        return false;
    }
    const tinyxml2::XMLElement* wifi =
        childWithId(childWithId(document.RootElement(), "element", 0), "component", 5);
    for (int id = 0; id <= 4; ++id) {
        int32_t filled[2] = {0, 0};
        const tinyxml2::XMLElement* p = childWithId(wifi, "parameter", id);
        for (const tinyxml2::XMLElement* v = p ? p->FirstChildElement("value") : nullptr;
             v != nullptr; v = v->NextSiblingElement("value")) {
            const int32_t value = v->GetText() != nullptr ? atoi(v->GetText()) : 0;
            const int32_t band = v->IntAttribute("key", 0) == 1 ? 1 : 0;
            if (id == 0) {
                profile->hotspot = value;
            } else if (id == 3) {
                profile->scan = value;
            } else if (id == 4) {
                profile->bandFixed[band] = value;
            } else if (filled[band] < kLevels) {
                (id == 1 ? profile->tx : profile->rx)[band][filled[band]++] = value;
            }
        }
    }
    return wifi != nullptr;
}

bool WifiEnergyTruth::readPolls(const std::string& dbPath, int64_t startMs,
                                std::vector<int64_t>* polls) {
    sqlite3* db = nullptr;
    sqlite3_stmt* stmt = nullptr;
    bool ok = sqlite3_open_v2(dbPath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK &&
              sqlite3_prepare_v2(db, "SELECT timestamp FROM debug_data_polling", -1, &stmt,
                                 nullptr) == SQLITE_OK;
    while (ok && sqlite3_step(stmt) == SQLITE_ROW) {
        polls->push_back(sqlite3_column_int64(stmt, 0) - startMs);
    }
    sqlite3_finalize(stmt);
    sqlite3_close(db);
    return ok;
}

WifiEnergyTruth::Result WifiEnergyTruth::compute(std::vector<int64_t> polls, int64_t endMs) const {
    Result result;
    result.perPoll = !polls.empty();
    std::set<int64_t> notices;
    const std::vector<Scenario::Step>& steps = mScenario.steps();
    if (result.perPoll) {
        // The Wi-Fi handler also reads the counters at each screen change.
        bool displayOn = false;
        for (const Scenario::Step& step : steps) {
            int32_t level = step.action == Scenario::Action::Brightness ? step.value
                            : step.action == Scenario::Action::Screen   ? (step.flag ? 1 : 0)
                                                                        : -1;
            if (level >= 0 && (level >= 1) != displayOn) {
                displayOn = level >= 1;
                polls.push_back(step.atMs + kScreenNoticeMs);
                notices.insert(step.atMs + kScreenNoticeMs);
            }
        }
    } else {
        polls.push_back(endMs);
    }
    std::sort(polls.begin(), polls.end());

    // (uid, process name, counter set) -> packets since the last batch.
    std::map<std::tuple<int32_t, std::string, int32_t>, Packets> pending;
    std::map<int32_t, int64_t> scans;
    Packets totals;
    double levelTime[kLevels] = {};
    bool screenOn = true;  // the handler's view until the first notice
    bool active = false;
    int32_t level = 4;
    int32_t band = 0;
    bool hotspotOn = false;
    int64_t hotspotMs = 0;
    int64_t last = 0;

    auto advance = [&](int64_t t) {
        if (t <= last) return;
        if (active) levelTime[level <= 1 ? 0 : level - 1] += static_cast<double>(t - last);
        if (hotspotOn) hotspotMs += t - last;
        last = t;
    };
    auto weighted = [&](double L, double tx, double rx) {
        double e = 0;
        for (int32_t i = 0; i < kLevels; ++i) {
            e += levelTime[i] / (L * 1000.0) *
                 (tx * mProfile.tx[band][i] + rx * mProfile.rx[band][i]);
        }
        return e;
    };
    auto read = [&](int64_t t) {
        advance(t);
        for (auto& [uid, count] : scans) {
            result.byUid[uid] += static_cast<double>(mProfile.scan) * count;
        }
        scans.clear();
        if (pending.empty()) return;
        double L = 0;
        for (double time : levelTime) L += time;
        const bool weighedByLevels = L >= 1 && L <= kMaxLevelTimeMs;
        const double all = weighedByLevels ? weighted(L, totals.tx, totals.rx) : 0;
        for (const auto& [key, p] : pending) {
            double e = 0;
            if (!weighedByLevels) {
                e = (p.tx * mProfile.tx[band][3] + p.rx * mProfile.rx[band][3]) / 100.0;
            } else {
                e = weighted(L, p.tx, p.rx);
                if (all > 0) e += L * mProfile.bandFixed[band] / 1000.0 * std::min(e, all) / all;
            }
            if (std::get<1>(key).empty()) {
                result.byUid[std::get<0>(key)] += e;
            } else {
                result.byProcess[std::get<1>(key)] += e;
            }
        }
        ++result.batches;
        pending.clear();
        totals = Packets();
        std::fill(levelTime, levelTime + kLevels, 0.0);
    };

    size_t next = 0;
    bool displayOn = false;
    for (int64_t poll : polls) {
        for (; next < steps.size() && steps[next].atMs <= poll; ++next) {
            const Scenario::Step& step = steps[next];
            advance(step.atMs);
            const bool wlan = step.text.find("wlan") != std::string::npos;
            if ((step.action == Scenario::Action::Traffic ||
                 step.action == Scenario::Action::SystemTraffic) &&
                wlan) {
                // counters: rx bytes, tx bytes, rx packets, tx packets
                const Scenario::Process* process = mScenario.findProcess(step.pid);
                auto key = step.action == Scenario::Action::Traffic
                               ? std::make_tuple(step.pid, std::string(), step.value)
                               : std::make_tuple(0, process ? process->name : "?", 0);
                Packets& p = pending[key];
                p.rx += static_cast<double>(step.counters[2]);
                p.tx += static_cast<double>(step.counters[3]);
                totals.rx += static_cast<double>(step.counters[2]);
                totals.tx += static_cast<double>(step.counters[3]);
            } else if (step.action == Scenario::Action::Wifi) {
                switch (step.value) {
                    case OFF:
                    case IDLE:
                        active = false;
                        break;
                    case ACTIVE:
                        active = active || screenOn;
                        break;
                    case AP_ON:
                    case AP_OFF:
                        hotspotOn = step.value == AP_ON;
                        break;
                    case BAND:
                        band = step.pid == 1 ? 1 : step.pid == 2 ? 0 : band;
                        break;
                    case LEVEL:
                        level = std::min(std::max(step.pid, 0), 4);
                        break;
                    case SCAN:
                        ++scans[step.pid];
                        break;
                    default:
                        break;
                }
            } else if (step.action == Scenario::Action::Brightness ||
                       step.action == Scenario::Action::Screen) {
                int32_t value =
                    step.action == Scenario::Action::Brightness ? step.value : (step.flag ? 1 : 0);
                displayOn = value >= 1;
                if (!result.perPoll) {
                    screenOn = displayOn;
                    active = active && screenOn;
                }
            }
        }
        read(poll);
        if (notices.count(poll) != 0) {
            // The screen's notice: off makes the link idle, and it stays
            // idle until the next "active" record with the screen on.
            screenOn = displayOn;
            active = active && screenOn;
        }
    }
    result.hotspot = static_cast<double>(mProfile.hotspot) * hotspotMs / 1000.0;
    return result;
}

}  // namespace sim
}  // namespace kelvo
