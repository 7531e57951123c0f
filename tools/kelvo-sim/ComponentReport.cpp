#include "ComponentReport.h"

#include <inttypes.h>
#include <json/json.h>
#include <sqlite3.h>
#include <stdarg.h>
#include <stdio.h>

#include <fstream>
#include <functional>
#include <sstream>

namespace kelvo {
namespace sim {

namespace {

struct Source {
    const char* component;
    const char* raw;     // name, ms, energy from the raw table (all buckets)
    const char* hourly;  // name, ms, energy from the hourly table
};

// The daemon keeps charging time apart; the truth counts it with the rest.
// "screen_off" is the daemon's name for the dark screen: it has no truth.
const Source kSources[] = {
    {"backlight",
     "SELECT name, SUM(duration + charge_duration), SUM(energy + charge_energy) "
     "FROM raw_applications_backlight WHERE name != 'screen_off' GROUP BY name",
     "SELECT name, SUM(duration), SUM(energy) FROM hourly_applications_backlight "
     "WHERE name != 'screen_off' GROUP BY name"},
    {"gnss",
     "SELECT name, SUM(foreground_duration + background_duration + charge_foreground_duration + "
     "charge_background_duration), SUM(foreground_energy + background_energy + "
     "charge_foreground_energy + charge_background_energy) FROM raw_applications_gnss "
     "GROUP BY name",
     "SELECT name, SUM(foreground_duration + background_duration), "
     "SUM(foreground_energy + background_energy) FROM hourly_applications_gnss GROUP BY name"},
    {"flashlight",
     "SELECT name, SUM(foreground_duration + background_duration + charge_foreground_duration + "
     "charge_background_duration), SUM(foreground_energy + background_energy + "
     "charge_foreground_energy + charge_background_energy) FROM raw_applications_flashlight "
     "GROUP BY name",
     "SELECT name, SUM(foreground_duration + background_duration), "
     "SUM(foreground_energy + background_energy) FROM hourly_applications_flashlight "
     "GROUP BY name"},
};

const char* const kAmbientTypes[4] = {"auto", "manual", "app", "front"};

// Fields of the hourly event: component class, top applications array.
struct EventFields {
    const char* component;
    int componentField;
    int topField;
};
const EventFields kEventFields[] = {{"display", 4, 5}, {"gnss", 8, 9}, {"flashlight", 18, 19}};

int64_t paramInt(const Json::Value& params, int id) {
    const Json::Value& value = params[std::to_string(id)];
    return value.isIntegral() ? value.asInt64() : 0;
}

// Parameters 5/4 foreground time/energy, 7/6 background.
std::string energyClass(const Json::Value& object) {
    const Json::Value& p = object["params"];
    return std::to_string(paramInt(p, 5) + paramInt(p, 7)) + " ms/" +
           std::to_string(paramInt(p, 4) + paramInt(p, 6));
}

using RowFn = std::function<void(sqlite3_stmt*)>;

bool query(sqlite3* db, const char* sql, const RowFn& row, std::string* error) {
    sqlite3_stmt* stmt = nullptr;
    if (sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr) != SQLITE_OK) {
        *error = sqlite3_errmsg(db);
        return false;
    }
    int rc;
    while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
        row(stmt);
    }
    if (rc != SQLITE_DONE) {
        *error = sqlite3_errmsg(db);
    }
    sqlite3_finalize(stmt);
    return rc == SQLITE_DONE;
}

std::string columnText(sqlite3_stmt* stmt, int column) {
    const unsigned char* text = sqlite3_column_text(stmt, column);
    return text != nullptr ? reinterpret_cast<const char*>(text) : "";
}

std::string line(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
std::string line(const char* fmt, ...) {
    char buffer[512];
    va_list args;
    va_start(args, fmt);
    vsnprintf(buffer, sizeof(buffer), fmt, args);
    va_end(args);
    return buffer;
}

}  // namespace

ComponentReport::ComponentReport(const ComponentTruth& truth, const std::string& databasePath,
                                 const std::string& eventsPath)
    : mTruth(truth), mDatabasePath(databasePath), mEventsPath(eventsPath) {
    const std::map<std::string, ComponentTruth::Figures>* truths[] = {
        &truth.backlight(), &truth.gnss(), &truth.flashlight()};
    for (size_t i = 0; i < 3; ++i) {
        for (const auto& entry : *truths[i]) {
            Row& row = mRows[kSources[i].component][entry.first];
            row.truth = entry.second;
        }
    }
}

bool ComponentReport::energyTruth(const std::string& component) const {
    // Under the advanced policy the panel's own statistics set the power.
    return component != "backlight" || mTruth.profile().displayPolicy == 1;
}

bool ComponentReport::readDatabase(std::string* error) {
    sqlite3* db = nullptr;
    if (sqlite3_open_v2(mDatabasePath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
        *error = "cannot open " + mDatabasePath + ": " +
                 (db != nullptr ? sqlite3_errmsg(db) : "no memory");
        sqlite3_close(db);
        return false;
    }
    bool ok = true;
    for (const Source& source : kSources) {
        std::map<std::string, Row>& rows = mRows[source.component];
        ok = ok &&
             query(
                 db, source.raw,
                 [&](sqlite3_stmt* stmt) {
                     Row& row = rows[columnText(stmt, 0)];
                     row.ms = sqlite3_column_int64(stmt, 1);
                     row.energy = sqlite3_column_int64(stmt, 2);
                 },
                 error) &&
             query(
                 db, source.hourly,
                 [&](sqlite3_stmt* stmt) {
                     Row& row = rows[columnText(stmt, 0)];
                     row.hourlyMs = sqlite3_column_int64(stmt, 1);
                     row.hourlyEnergy = sqlite3_column_int64(stmt, 2);
                 },
                 error);
    }
    ok = ok && query(
                   db, "SELECT type, SUM(duration) FROM raw_ambient_light GROUP BY type",
                   [&](sqlite3_stmt* stmt) {
                       mAmbientStoredMs[sqlite3_column_int(stmt, 0)] = sqlite3_column_int64(stmt, 1);
                   },
                   error);
    sqlite3_close(db);
    return ok;
}

void ComponentReport::describeHourlyEvents(std::string* out) const {
    std::ifstream in(mEventsPath);
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
        const Json::Value& params = event["params"];
        *out += "Hourly event 903001060 for " + params["1"].asString() + ":\n";
        for (const EventFields& f : kEventFields) {
            const Json::Value& component = params[std::to_string(f.componentField)];
            *out +=
                line("  %-10s (field %d) %s; top (array %d):", f.component, f.componentField,
                     component.isObject() ? energyClass(component).c_str() : "absent", f.topField);
            const Json::Value& top = params[std::to_string(f.topField)];
            for (Json::ArrayIndex i = 0; top.isArray() && i < top.size(); ++i) {
                const Json::Value& p = top[i]["params"];
                *out += " " + p["3"]["params"]["0"].asString() + " " + energyClass(p["1"]) +
                        (i + 1 < top.size() ? "," : "");
            }
            *out += "\n";
        }
    }
}

bool ComponentReport::build(std::string* text) {
    std::string& out = *text;
    std::string error;
    if (!readDatabase(&error)) {
        out += "The display, GNSS and flashlight tables could not be read: " + error + "\n";
        return false;
    }
    const ComponentTruth::Profile& profile = mTruth.profile();
    out +=
        "Display, GNSS and flashlight per application: truth = what the scenario gave (time in\n"
        "front with the screen on and its backlight energy, GNSS time with an equal share of\n"
        "its power, flashlight time of the torch user); attributed = raw_applications_*\n"
        "(with charging time); hourly = hourly_applications_* (without). Times in ms.\n";
    out += line(
        "  profile: backlight (%d + %d x level) / 100, GNSS %d, flashlight %d; display "
        "policy %d%s\n",
        profile.intercept, profile.slope, profile.gnssPower, profile.flashlightPower,
        profile.displayPolicy,
        profile.displayPolicy == 1 ? "" : " (advanced values: no backlight energy truth)");
    out += line("%-10s %-30s %8s %10s %6s %9s %10s %6s %15s\n", "component", "application", "truth",
                "attributed", "diff", "truth en", "attributed", "diff", "hourly ms/en");
    for (const auto& component : mRows) {
        bool withEnergy = energyTruth(component.first);
        for (const auto& entry : component.second) {
            const Row& row = entry.second;
            std::string truthEnergy =
                withEnergy ? std::to_string(row.truth.energy()) : std::string("-");
            std::string energyDiff =
                withEnergy ? std::to_string(row.energy - row.truth.energy()) : std::string("-");
            std::string hourly =
                std::to_string(row.hourlyMs) + "/" + std::to_string(row.hourlyEnergy);
            out += line("%-10s %-30s %8" PRId64 " %10" PRId64 " %6" PRId64 " %9s %10" PRId64
                        " %6s %15s\n",
                        component.first.c_str(), entry.first.c_str(), row.truth.ms, row.ms,
                        row.ms - row.truth.ms, truthEnergy.c_str(), row.energy, energyDiff.c_str(),
                        hourly.c_str());
        }
    }
    const std::map<int32_t, int64_t>& written = mTruth.ambientMs();
    if (!written.empty() || !mAmbientStoredMs.empty()) {
        out += "Ambient light (raw_ambient_light), ms written / stored:";
        for (int32_t type = 0; type < 4; ++type) {
            auto w = written.find(type);
            auto s = mAmbientStoredMs.find(type);
            out += line(" %s %" PRId64 "/%" PRId64, kAmbientTypes[type],
                        w == written.end() ? 0 : w->second,
                        s == mAmbientStoredMs.end() ? 0 : s->second);
        }
        out += "\n";
    }
    describeHourlyEvents(&out);
    return true;
}

std::string ComponentReport::table() const {
    std::string out;
    for (const auto& component : mRows) {
        bool withEnergy = energyTruth(component.first);
        for (const auto& entry : component.second) {
            const Row& row = entry.second;
            out += component.first + "\t" + entry.first + "\t" + std::to_string(row.truth.ms) +
                   "\t" + std::to_string(row.ms) + "\t" +
                   (withEnergy ? std::to_string(row.truth.energy()) : std::string("-")) + "\t" +
                   std::to_string(row.energy) + "\n";
        }
    }
    return out;
}

}  // namespace sim
}  // namespace kelvo
