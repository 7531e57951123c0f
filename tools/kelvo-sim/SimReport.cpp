#include "SimReport.h"

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

// The six bucket pairs of the CPU tables, in their stored order.
const char* const kBuckets[6] = {"foreground", "background",        "screen_on",
                                 "screen_off", "charge_foreground", "charge_background"};

std::string format(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
std::string format(const char* fmt, ...) {
    char buffer[512];
    va_list args;
    va_start(args, fmt);
    vsnprintf(buffer, sizeof(buffer), fmt, args);
    va_end(args);
    return buffer;
}

std::string localTime(int64_t ms) {
    time_t seconds = static_cast<time_t>(ms / 1000);
    struct tm parts;
    localtime_r(&seconds, &parts);
    char text[32];
    strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S", &parts);
    return text;
}

using Row = std::function<void(sqlite3_stmt*)>;

bool query(sqlite3* db, const std::string& sql, const Row& row, std::string* error) {
    sqlite3_stmt* stmt = nullptr;
    if (sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) != SQLITE_OK) {
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

int64_t paramInt(const Json::Value& params, int id) {
    const Json::Value& value = params[std::to_string(id)];
    return value.isIntegral() ? value.asInt64() : 0;
}

// Field 5/4 foreground time/energy, 7/6 background, 1/0 screen on, 3/2 off.
std::string cpuClass(const Json::Value& object) {
    const Json::Value& p = object["params"];
    return format("fg %" PRId64 " ms/%" PRId64 ", bg %" PRId64 " ms/%" PRId64 ", screen on %" PRId64
                  " ms/%" PRId64 ", screen off %" PRId64 " ms/%" PRId64,
                  paramInt(p, 5), paramInt(p, 4), paramInt(p, 7), paramInt(p, 6), paramInt(p, 1),
                  paramInt(p, 0), paramInt(p, 3), paramInt(p, 2));
}

}  // namespace

SimReport::SimReport(const Header& header, const std::map<std::string, int64_t>& truthMs,
                     const std::map<std::string, int32_t>& uids)
    : mHeader(header), mTruth(truthMs), mUids(uids) {}

std::string SimReport::databasePath(const std::string& root) {
    return root + "/data/log/kelvo/kelvo.db";
}

std::string SimReport::eventsPath(const std::string& root) {
    return root + "/data/log/zendrel/events.jsonl";
}

bool SimReport::readDatabase(std::string* error) {
    sqlite3* db = nullptr;
    std::string path = databasePath(mHeader.root);
    if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
        *error = "cannot open " + path + ": " + (db != nullptr ? sqlite3_errmsg(db) : "no memory");
        sqlite3_close(db);
        return false;
    }
    std::string sums;
    for (const char* bucket : kBuckets) {
        sums += format(", SUM(%s_time), SUM(%s_energy)", bucket, bucket);
    }
    auto readSums = [](sqlite3_stmt* stmt, int first, Sums* out) {
        for (int i = 0; i < 6; ++i) {
            out->time[i] = sqlite3_column_int64(stmt, first + 2 * i);
            out->energy[i] = sqlite3_column_int64(stmt, first + 2 * i + 1);
        }
    };
    bool ok =
        query(
            db, "SELECT name, MIN(uid)" + sums + " FROM raw_applications_cpu GROUP BY name",
            [&](sqlite3_stmt* stmt) {
                const unsigned char* name = sqlite3_column_text(stmt, 0);
                Sums& app = mApps[name != nullptr ? reinterpret_cast<const char*>(name) : ""];
                app.uid = sqlite3_column_int(stmt, 1);
                app.stored = true;
                readSums(stmt, 2, &app);
            },
            error) &&
        query(
            db,
            "SELECT name, SUM(foreground_time + background_time), "
            "SUM(foreground_energy + background_energy) FROM hourly_applications_cpu "
            "GROUP BY name",
            [&](sqlite3_stmt* stmt) {
                const unsigned char* name = sqlite3_column_text(stmt, 0);
                Sums& app = mApps[name != nullptr ? reinterpret_cast<const char*>(name) : ""];
                app.hourlyTime = sqlite3_column_int64(stmt, 1);
                app.hourlyEnergy = sqlite3_column_int64(stmt, 2);
            },
            error) &&
        query(
            db, "SELECT COUNT(*)" + sums + " FROM raw_component_cpu",
            [&](sqlite3_stmt* stmt) {
                mComponentRows = sqlite3_column_int64(stmt, 0);
                readSums(stmt, 1, &mComponent);
            },
            error) &&
        query(
            db,
            "SELECT SUM(foreground_energy + background_energy + charge_foreground_energy + "
            "charge_background_energy) FROM raw_component_cpu WHERE end_time IN "
            "(SELECT end_time FROM raw_applications_cpu)",
            [&](sqlite3_stmt* stmt) { mComponentSharedEnergy = sqlite3_column_int64(stmt, 0); },
            error) &&
        query(
            db,
            "SELECT COUNT(*), SUM(foreground_time + background_time), "
            "SUM(foreground_energy + background_energy) FROM hourly_component_cpu",
            [&](sqlite3_stmt* stmt) {
                mHourlyComponentRows = sqlite3_column_int64(stmt, 0);
                mHourlyComponentTime = sqlite3_column_int64(stmt, 1);
                mHourlyComponentEnergy = sqlite3_column_int64(stmt, 2);
            },
            error);
    sqlite3_close(db);
    return ok;
}

void SimReport::describeHourlyEvent(std::string* out) const {
    std::ifstream in(eventsPath(mHeader.root));
    std::string line;
    int32_t found = 0;
    Json::CharReaderBuilder builder;
    while (std::getline(in, line)) {
        Json::Value event;
        std::string errors;
        std::istringstream stream(line);
        if (!Json::parseFromStream(builder, stream, &event, &errors) || !event.isObject() ||
            event["event"].asUInt() != 903001060u) {
            continue;
        }
        ++found;
        const Json::Value& params = event["params"];
        *out += format("Hourly event 903001060 #%d: period %s .. %s", found,
                       params["0"].asString().c_str(), params["1"].asString().c_str());
        if (params.isMember("35")) {
            *out += format(", compensation ratio x1000 %" PRId64, paramInt(params, 35));
        }
        *out += "\n";
        if (params["6"].isObject()) {
            *out += "  CPU component (field 6): " + cpuClass(params["6"]) + "\n";
        } else {
            *out += "  CPU component (field 6): absent\n";
        }
        const Json::Value& top = params["7"];
        *out += format("  top applications (array 7): %u\n", top.isArray() ? top.size() : 0u);
        if (top.isArray()) {
            for (const Json::Value& element : top) {
                const Json::Value& p = element["params"];
                std::string name = p["3"]["params"]["0"].asString();
                *out += format("    %-40s %s\n", name.c_str(), cpuClass(p["1"]).c_str());
            }
        }
    }
    if (found == 0) {
        *out += "Hourly event 903001060: not uploaded\n";
    }
}

bool SimReport::build(std::string* text) {
    std::string& out = *text;
    out += format("kelvo-sim report%s\n", mHeader.interrupted ? " (interrupted)" : "");
    out += format("  scenario  %s\n", mHeader.scenario.c_str());
    out += format("  simulated %s .. %s (%s)\n", localTime(mHeader.startMs).c_str(),
                  localTime(mHeader.endMs).c_str(), mHeader.timeZone.c_str());
    out += format(
        "  daemon exit status %d; %d per-process reports answered; %d log-device "
        "records written, %d refused by the device\n\n",
        mHeader.daemonStatus, mHeader.reportsAnswered, mHeader.logRecordsWritten,
        mHeader.logRecordsUnread);
    if (mHeader.reportsAnswered == 0) {
        out +=
            "No per-process report was asked for: the daemon ran no CPU pass with its\n"
            "processes, so nothing it attributed can be compared with the scenario.\n\n";
    }
    std::string error;
    if (!readDatabase(&error)) {
        out += "The database could not be read: " + error + "\n";
        return false;
    }
    for (const auto& truth : mTruth) {
        if (mApps.count(truth.first) == 0) {
            mApps[truth.first].uid = mUids.count(truth.first) ? mUids.at(truth.first) : 0;
        }
    }
    out +=
        "CPU per application: truth = CPU time the scenario gave between the first and the\n"
        "last per-process report; attributed = raw_applications_cpu (all buckets); hourly =\n"
        "hourly_applications_cpu (foreground + background). Times in ms, energy in the\n"
        "power profile's unit x ms / 1000.\n";
    out += format("%-30s %6s %7s %10s %5s %7s %13s %13s %13s %13s %13s\n", "application", "uid",
                  "truth", "attributed", "diff", "energy", "fg ms/en", "bg ms/en", "scr-on ms/en",
                  "scr-off ms/en", "hourly ms/en");
    int64_t truthSum = 0;
    int64_t timeSum = 0;
    int64_t energySum = 0;
    auto pair = [](int64_t time, int64_t energy) {
        return std::to_string(time) + "/" + std::to_string(energy);
    };
    for (const auto& entry : mApps) {
        const Sums& app = entry.second;
        auto truth = mTruth.find(entry.first);
        std::string truthText = truth == mTruth.end() ? "-" : std::to_string(truth->second);
        std::string diff = truth == mTruth.end() ? "-" : std::to_string(app.total() - truth->second);
        if (truth != mTruth.end()) {
            truthSum += truth->second;
        }
        timeSum += app.total();
        energySum += app.totalEnergy();
        // Charging time counts with foreground and background only.
        out += format("%-30s %6d %7s %10" PRId64 " %5s %7" PRId64 " %13s %13s %13s %13s %13s\n",
                      entry.first.c_str(), app.uid, truthText.c_str(), app.total(), diff.c_str(),
                      app.totalEnergy(),
                      pair(app.time[0] + app.time[4], app.energy[0] + app.energy[4]).c_str(),
                      pair(app.time[1] + app.time[5], app.energy[1] + app.energy[5]).c_str(),
                      pair(app.time[2], app.energy[2]).c_str(),
                      pair(app.time[3], app.energy[3]).c_str(),
                      pair(app.hourlyTime, app.hourlyEnergy).c_str());
    }
    out += format("%-30s %6s %7" PRId64 " %10" PRId64 " %5" PRId64 " %7" PRId64 "\n",
                  "sum over applications", "", truthSum, timeSum, timeSum - truthSum, energySum);
    out += format("\nCPU component (raw_component_cpu, %" PRId64 " rows): %" PRId64
                  " ms of core time, energy %" PRId64
                  "\n  in the passes with application time: %" PRId64
                  " (sum over applications: %" PRId64 ", difference %" PRId64 ")\n",
                  mComponentRows, mComponent.total(), mComponent.totalEnergy(),
                  mComponentSharedEnergy, energySum, energySum - mComponentSharedEnergy);
    out += format("  foreground %" PRId64 " ms/%" PRId64 ", background %" PRId64 " ms/%" PRId64
                  ", screen on %" PRId64 " ms/%" PRId64 ", screen off %" PRId64 " ms/%" PRId64
                  ", charging %" PRId64 " ms/%" PRId64 "\n",
                  mComponent.time[0], mComponent.energy[0], mComponent.time[1],
                  mComponent.energy[1], mComponent.time[2], mComponent.energy[2],
                  mComponent.time[3], mComponent.energy[3], mComponent.time[4] + mComponent.time[5],
                  mComponent.energy[4] + mComponent.energy[5]);
    out += format("Hourly component rows (hourly_component_cpu): %" PRId64 ", %" PRId64
                  " ms, energy %" PRId64 "\n\n",
                  mHourlyComponentRows, mHourlyComponentTime, mHourlyComponentEnergy);
    describeHourlyEvent(&out);
    for (const std::string& section : mSections) {
        out += "\n" + section;
    }
    out += "\nFiles\n";
    out += "  database         " + databasePath(mHeader.root) + "\n";
    out += "  uploaded events  " + eventsPath(mHeader.root) + "\n";
    out += "  daemon log       " + mHeader.daemonLog + "\n";
    out += "  device root      " + mHeader.root + "\n";
    return true;
}

std::string SimReport::truthTable() const {
    std::string out;
    for (const auto& truth : mTruth) {
        auto app = mApps.find(truth.first);
        int64_t attributed = app == mApps.end() ? 0 : app->second.total();
        int32_t uid = mUids.count(truth.first) ? mUids.at(truth.first) : 0;
        out += format("%s\t%d\t%" PRId64 "\t%" PRId64 "\n", truth.first.c_str(), uid, truth.second,
                      attributed);
    }
    return out;
}

}  // namespace sim
}  // namespace kelvo
