#include "BatteryReport.h"

#include <inttypes.h>
#include <json/json.h>
#include <sqlite3.h>
#include <stdarg.h>
#include <stdio.h>
#include <time.h>

#include <fstream>
#include <functional>
#include <sstream>

namespace kelvo {
namespace sim {

namespace {

std::string format(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
std::string format(const char* fmt, ...) {
    char buffer[512];
    va_list args;
    va_start(args, fmt);
    vsnprintf(buffer, sizeof(buffer), fmt, args);
    va_end(args);
    return buffer;
}

std::string clockOf(int64_t ms) {
    time_t seconds = static_cast<time_t>(ms / 1000);
    struct tm parts;
    localtime_r(&seconds, &parts);
    char text[16];
    strftime(text, sizeof(text), "%H:%M:%S", &parts);
    return text;
}

// Runs the query and hands each row over; false with the error.
bool query(sqlite3* db, const char* sql, const std::function<void(sqlite3_stmt*)>& row,
           std::string* error) {
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

const char* eventName(uint32_t id) {
    switch (id) {
        case 903002051:
            return "battery capacity decrease";
        case 903002052:
            return "battery level decrease";
        case 903002053:
            return "system (wake-ups, alarms, wakelocks, modem, sensor hub, location)";
        case 903002054:
            return "screen-off drain";
        case 903002055:
            return "applications (energy, CPU, trace)";
        case 903002056:
            return "restarts";
        default:
            return nullptr;
    }
}

// The text of a name class (its field 0), or the plain text.
std::string nameOf(const Json::Value& value) {
    if (value.isObject()) {
        return value["params"]["0"].asString();
    }
    return value.isString() ? value.asString() : std::string();
}

}  // namespace

void BatteryReport::describeBattery(std::string* out) const {
    *out += "Battery\n";
    *out += format(
        "  model     %d mAh, level %d%% .. %d%%; the load drew %.1f mAh, the charger "
        "gave %.1f mAh\n",
        mModel.capacityMah, mModel.startLevel, mModel.endLevel, mModel.drawnMah, mModel.chargedMah);
    sqlite3* db = nullptr;
    std::string error;
    if (sqlite3_open_v2(mDatabasePath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
        *out += "  the database could not be read\n";
        sqlite3_close(db);
        return;
    }
    // What the daemon measured from the gauge over the spans it closed;
    // spans it marked invalid (large negative values) are left out as in
    // its uploads.
    bool ok = query(
        db,
        "SELECT COUNT(*), MIN(start_time), MAX(end_time), "
        "TOTAL(discharge_screen_on_gas_gauge + discharge_screen_off_gas_gauge), "
        "TOTAL(discharge_screen_on_level + discharge_screen_off_level), "
        "TOTAL(charge_screen_on_gas_gauge + charge_screen_off_gas_gauge), "
        "TOTAL(discharge_screen_on_duration), TOTAL(discharge_screen_off_duration), "
        "TOTAL(charge_screen_on_duration + charge_screen_off_duration) "
        "FROM raw_component_battery WHERE discharge_screen_on_gas_gauge >= 0 AND "
        "discharge_screen_off_gas_gauge >= 0 AND discharge_screen_on_level >= 0 AND "
        "discharge_screen_off_level >= 0",
        [out](sqlite3_stmt* s) {
            int64_t spans = sqlite3_column_int64(s, 0);
            if (spans == 0) {
                *out += "  measured  no battery span was recorded\n";
                return;
            }
            *out += format("  measured  %" PRId64
                           " spans %s .. %s: discharge %.0f mAh and %.0f%% "
                           "(screen on %.0f s, off %.0f s), charged %.0f mAh in %.0f s\n",
                           spans, clockOf(sqlite3_column_int64(s, 1)).c_str(),
                           clockOf(sqlite3_column_int64(s, 2)).c_str(), sqlite3_column_double(s, 3),
                           sqlite3_column_double(s, 4), sqlite3_column_double(s, 6) / 1000,
                           sqlite3_column_double(s, 7) / 1000, sqlite3_column_double(s, 5),
                           sqlite3_column_double(s, 8) / 1000);
        },
        &error);
    int32_t rounds = 0;
    ok = ok && query(
                   db,
                   "SELECT end_time, battery, power_model, free, ratio FROM "
                   "debug_energy_compensation ORDER BY end_time",
                   [out, &rounds](sqlite3_stmt* s) {
                       ++rounds;
                       *out += format("  hour to %s: measured %" PRId64 " mA·s, modelled %" PRId64
                                      " mA·s, free %" PRId64 ", compensation ratio %.3f\n",
                                      clockOf(sqlite3_column_int64(s, 0)).c_str(),
                                      static_cast<int64_t>(sqlite3_column_int64(s, 1)),
                                      static_cast<int64_t>(sqlite3_column_int64(s, 2)),
                                      static_cast<int64_t>(sqlite3_column_int64(s, 3)),
                                      sqlite3_column_int64(s, 4) / 1000.0);
                   },
                   &error);
    if (!ok) {
        *out += "  the battery tables could not be read: " + error + "\n";
    } else if (rounds == 0) {
        *out += "  no hourly energy compensation was recorded\n";
    }
    sqlite3_close(db);
}

void BatteryReport::describeAbnormalities(std::string* out) const {
    *out += "Abnormality events\n";
    std::ifstream in(mEventsPath);
    std::string line;
    int32_t found = 0;
    Json::CharReaderBuilder builder;
    while (std::getline(in, line)) {
        Json::Value event;
        std::string errors;
        std::istringstream stream(line);
        if (!Json::parseFromStream(builder, stream, &event, &errors) || !event.isObject()) {
            continue;
        }
        uint32_t id = event["event"].asUInt();
        const char* name = eventName(id);
        if (name == nullptr) {
            continue;
        }
        ++found;
        const Json::Value& params = event["params"];
        *out += format("  %u %s: %s .. %s\n", id, name, params["0"].asString().c_str(),
                       params["1"].asString().c_str());
        // Wakelocks (array 5): application, tag, time held.
        if (id == 903002053 && params["5"].isArray()) {
            for (const Json::Value& element : params["5"]) {
                const Json::Value& p = element["params"];
                *out +=
                    format("    wakelock %s tag %s held %" PRId64 " ms\n", nameOf(p["5"]).c_str(),
                           nameOf(p["6"]).c_str(), p["3"].isIntegral() ? p["3"].asInt64() : 0);
            }
        }
        if ((id == 903002051 || id == 903002052) && params["2"].isIntegral()) {
            *out += format("    drop %" PRId64 "%s\n", params["2"].asInt64(),
                           id == 903002051 ? "% of the capacity" : "%");
        }
    }
    if (found == 0) {
        *out += "  none\n";
    }
}

std::string BatteryReport::build() const {
    std::string out;
    describeBattery(&out);
    out += "\n";
    describeAbnormalities(&out);
    return out;
}

}  // namespace sim
}  // namespace kelvo
