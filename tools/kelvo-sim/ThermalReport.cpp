#include "ThermalReport.h"

#include <dirent.h>
#include <inttypes.h>
#include <json/json.h>
#include <sqlite3.h>
#include <stdarg.h>
#include <stdio.h>
#include <time.h>

#include <fstream>
#include <sstream>
#include <utility>
#include <vector>

namespace kelvo {
namespace sim {

namespace {

constexpr uint32_t kEpisodeEvent = 903002050;

std::string format(const char* fmt, ...) {
    char text[512];
    va_list args;
    va_start(args, fmt);
    vsnprintf(text, sizeof(text), fmt, args);
    va_end(args);
    return text;
}

// As the uploads show times: local "%Y-%m-%d %H:%M:%S".
std::string dateOf(int64_t ms) {
    time_t seconds = static_cast<time_t>(ms / 1000);
    struct tm parts;
    localtime_r(&seconds, &parts);
    char text[32];
    strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S", &parts);
    return text;
}

#define BUCKETS(unit) \
    "foreground_" unit "+background_" unit "+charge_foreground_" unit "+charge_background_" unit

// Each component's rows: usage and energy sums, and where the upload puts
// them.
struct component {
    const char* name;
    const char* usage;  // "SUM(...) FROM table" pieces
    const char* energy;
    const char* table;
    const char* usageTable;  // when not the same table
    int32_t usageParam;
    int32_t energyParam;
};

const component kComponents[] = {
    {"display", "duration+charge_duration", "energy+charge_energy", "raw_applications_backlight",
     nullptr, 5, 4},
    {"cpu", BUCKETS("time"), BUCKETS("energy"), "raw_component_cpu", nullptr, 7, 6},
    {"gnss", BUCKETS("duration"), BUCKETS("energy"), "raw_component_gnss", nullptr, 9, 8},
    {"sensors", BUCKETS("duration"), BUCKETS("energy"), "raw_component_sensor", nullptr, 11, 10},
    {"gpu", "usage+charge_usage", "energy+charge_energy", "raw_applications_gpu", nullptr, 13, 12},
    {"front camera", BUCKETS("duration"), BUCKETS("energy"), "raw_applications_front_camera",
     nullptr, 15, 14},
    {"rear camera", BUCKETS("duration"), BUCKETS("energy"), "raw_applications_rear_camera", nullptr,
     17, 16},
    {"flashlight", BUCKETS("duration"), BUCKETS("energy"), "raw_applications_flashlight", nullptr,
     19, 18},
    {"audio", BUCKETS("duration"), BUCKETS("energy"), "raw_applications_audio", nullptr, 21, 20},
    {"modem (bytes)", BUCKETS("tx_bytes") "+" BUCKETS("rx_bytes"), "energy+charge_energy",
     "raw_component_modem", "raw_applications_modem", 23, 22},
    {"wifi (bytes)", BUCKETS("tx_bytes") "+" BUCKETS("rx_bytes"), BUCKETS("energy"),
     "raw_applications_wifi", nullptr, 26, 25},
    {"bluetooth", BUCKETS("duration"), BUCKETS("energy"), "raw_applications_bluetooth", nullptr, 28,
     27},
};

// One value of a one-row query; 0 when the table is missing.
int64_t scalar(sqlite3* db, const std::string& sql) {
    sqlite3_stmt* stmt = nullptr;
    int64_t value = 0;
    if (sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) == SQLITE_OK &&
        sqlite3_step(stmt) == SQLITE_ROW) {
        value = sqlite3_column_int64(stmt, 0);
    }
    sqlite3_finalize(stmt);
    return value;
}

std::vector<Json::Value> episodeEvents(const std::string& path) {
    std::vector<Json::Value> out;
    std::ifstream in(path);
    std::string line;
    Json::CharReaderBuilder builder;
    while (std::getline(in, line)) {
        Json::Value event;
        std::string errors;
        std::istringstream stream(line);
        if (Json::parseFromStream(builder, stream, &event, &errors) && event.isObject() &&
            event["event"].asUInt() == kEpisodeEvent) {
            out.push_back(event["params"]);
        }
    }
    return out;
}

void describeEpisode(sqlite3* db, int64_t start, int64_t end, const Json::Value* up,
                     std::string* out) {
    const std::string window =
        format(" WHERE end_time > %" PRId64 " AND end_time <= %" PRId64, start, end);
    const int64_t gas = scalar(
        db,
        "SELECT SUM(discharge_screen_on_gas_gauge+discharge_screen_off_gas_gauge) FROM "
        "raw_component_battery" +
            window +
            " AND discharge_screen_on_gas_gauge >= 0 AND discharge_screen_off_gas_gauge >= 0 "
            "AND discharge_screen_on_level >= 0 AND discharge_screen_off_level >= 0");
    const int64_t charging =
        scalar(db,
               "SELECT SUM(charge_screen_on_duration+charge_screen_off_duration) FROM "
               "raw_component_battery" +
                   window);
    std::vector<std::pair<int64_t, int64_t>> sums;
    double accounted = 0;
    for (const component& c : kComponents) {
        int64_t usage = scalar(db, std::string("SELECT SUM(") + c.usage + ") FROM " +
                                       (c.usageTable != nullptr ? c.usageTable : c.table) + window);
        int64_t energy =
            scalar(db, std::string("SELECT SUM(") + c.energy + ") FROM " + c.table + window);
        sums.push_back({usage, energy});
        accounted += static_cast<double>(energy);
    }
    const bool scaled = accounted >= 1 && gas >= 0 && charging == 0;
    const double factor = scaled ? static_cast<double>(gas) * 3600.0 / accounted : 1.0;
    *out += format("  %s .. %s: battery %" PRId64 " mAh, charging %" PRId64
                   " ms, energy factor %.4f%s\n",
                   dateOf(start).c_str(), dateOf(end).c_str(), gas, charging, factor,
                   up == nullptr ? " (not uploaded)" : "");
    *out += format("    %-14s %12s %12s %12s %12s %12s\n", "component", "usage up", "usage rows",
                   "energy up", "scaled rows", "energy rows");
    for (size_t i = 0; i < sums.size(); ++i) {
        const component& c = kComponents[i];
        auto uploaded = [up](int32_t param) -> std::string {
            const Json::Value& v = up == nullptr ? Json::Value() : (*up)[std::to_string(param)];
            return v.isIntegral() ? std::to_string(v.asInt64()) : "-";
        };
        *out += format(
            "    %-14s %12s %12" PRId64 " %12s %12" PRId64 " %12" PRId64 "\n", c.name,
            uploaded(c.usageParam).c_str(), sums[i].first, uploaded(c.energyParam).c_str(),
            static_cast<int64_t>(static_cast<double>(sums[i].second) * factor), sums[i].second);
    }
}

}  // namespace

std::string ThermalReport::build() const {
    std::string out = "Thermal episodes (uploaded beside the simulator's sums of the same rows)\n";
    sqlite3* live = nullptr;
    const bool readable =
        sqlite3_open_v2(mDatabasePath.c_str(), &live, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK;
    sqlite3_close(live);
    if (!readable) {
        return out + "  the database cannot be read\n";
    }
    // A midnight round moves the day's rows into the day's copy and cleans
    // them from the database: read both.
    std::vector<std::string> files = {mDatabasePath};
    const std::string upload = mDatabasePath.substr(0, mDatabasePath.rfind('/') + 1) + "upload";
    if (DIR* dir = opendir(upload.c_str())) {
        while (struct dirent* entry = readdir(dir)) {
            std::string name = entry->d_name;
            if (name.size() > 3 && name.compare(name.size() - 3, 3, ".db") == 0) {
                files.push_back(upload + "/" + name);
            }
        }
        closedir(dir);
    }
    std::vector<Json::Value> events = episodeEvents(mEventsPath);
    int32_t episodes = 0;
    int64_t counts[3] = {};
    for (const std::string& file : files) {
        sqlite3* db = nullptr;
        if (sqlite3_open_v2(file.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
            sqlite3_close(db);
            continue;
        }
        sqlite3_stmt* stmt = nullptr;
        if (sqlite3_prepare_v2(db,
                               "SELECT start_time, end_time FROM raw_thermal_abnormality ORDER BY "
                               "id",
                               -1, &stmt, nullptr) == SQLITE_OK) {
            while (sqlite3_step(stmt) == SQLITE_ROW) {
                const int64_t start = sqlite3_column_int64(stmt, 0);
                const int64_t end = sqlite3_column_int64(stmt, 1);
                const Json::Value* up = nullptr;
                for (const Json::Value& e : events) {
                    if (e["0"].asString() == dateOf(start) && e["1"].asString() == dateOf(end)) {
                        up = &e;
                    }
                }
                describeEpisode(db, start, end, up, &out);
                ++episodes;
            }
        }
        sqlite3_finalize(stmt);
        counts[0] += scalar(db, "SELECT COUNT(*) FROM daily_thermal_applications");
        counts[1] += scalar(db, "SELECT COUNT(*) FROM daily_thermal_shell");
        counts[2] += scalar(db, "SELECT COUNT(*) FROM raw_thermal_heat_scene");
        sqlite3_close(db);
    }
    if (episodes == 0) {
        out += "  none\n";
    }
    out += format("  daily statistics from Pelmora: %" PRId64 " application ranges, %" PRId64
                  " shell ranges, %" PRId64 " heat scenes\n",
                  counts[0], counts[1], counts[2]);
    return out;
}

}  // namespace sim
}  // namespace kelvo
