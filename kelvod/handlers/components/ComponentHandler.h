#pragma once

#include <binder/Parcel.h>
#include <stddef.h>
#include <stdint.h>
#include <utils/String8.h>

#include <initializer_list>
#include <string>
#include <vector>

#include "core/KelvoOperator.h"
#include "storage/TableAttribute.h"

namespace kelvo {

// Columns of the family's tables. Durations are milliseconds (int), energies
// in the accounter's unit (long); the result pairs come in the order
// foreground, background, screen on, screen off, then the charge pairs.
inline const column_attribute kFamilyRawApplicationsColumns[] = {
    {COLUMN_TIME, "start_time"},
    {COLUMN_TIME, "end_time"},
    {COLUMN_TEXT, "name"},
    {COLUMN_INT, "foreground_duration"},
    {COLUMN_LONG, "foreground_energy"},
    {COLUMN_INT, "background_duration"},
    {COLUMN_LONG, "background_energy"},
    {COLUMN_INT, "screen_on_duration"},
    {COLUMN_LONG, "screen_on_energy"},
    {COLUMN_INT, "screen_off_duration"},
    {COLUMN_LONG, "screen_off_energy"},
    {COLUMN_INT, "charge_foreground_duration"},
    {COLUMN_LONG, "charge_foreground_energy"},
    {COLUMN_INT, "charge_background_duration"},
    {COLUMN_LONG, "charge_background_energy"},
};
inline const column_attribute kFamilyRawComponentColumns[] = {
    {COLUMN_TIME, "start_time"},
    {COLUMN_TIME, "end_time"},
    {COLUMN_INT, "foreground_duration"},
    {COLUMN_LONG, "foreground_energy"},
    {COLUMN_INT, "background_duration"},
    {COLUMN_LONG, "background_energy"},
    {COLUMN_INT, "screen_on_duration"},
    {COLUMN_LONG, "screen_on_energy"},
    {COLUMN_INT, "screen_off_duration"},
    {COLUMN_LONG, "screen_off_energy"},
    {COLUMN_INT, "charge_foreground_duration"},
    {COLUMN_LONG, "charge_foreground_energy"},
    {COLUMN_INT, "charge_background_duration"},
    {COLUMN_LONG, "charge_background_energy"},
};
inline const column_attribute kFamilyHourlyApplicationsColumns[] = {
    {COLUMN_TIME, "timestamp"},          {COLUMN_TEXT, "name"},
    {COLUMN_INT, "foreground_duration"}, {COLUMN_LONG, "foreground_energy"},
    {COLUMN_INT, "background_duration"}, {COLUMN_LONG, "background_energy"},
    {COLUMN_INT, "screen_on_duration"},  {COLUMN_LONG, "screen_on_energy"},
    {COLUMN_INT, "screen_off_duration"}, {COLUMN_LONG, "screen_off_energy"},
};
inline const column_attribute kFamilyHourlyComponentColumns[] = {
    {COLUMN_TIME, "timestamp"},         {COLUMN_INT, "foreground_duration"},
    {COLUMN_LONG, "foreground_energy"}, {COLUMN_INT, "background_duration"},
    {COLUMN_LONG, "background_energy"}, {COLUMN_INT, "screen_on_duration"},
    {COLUMN_LONG, "screen_on_energy"},  {COLUMN_INT, "screen_off_duration"},
    {COLUMN_LONG, "screen_off_energy"},
};
constexpr int32_t kFamilyRawApplicationsCount =
    static_cast<int32_t>(sizeof(kFamilyRawApplicationsColumns) / sizeof(column_attribute));
constexpr int32_t kFamilyRawComponentCount =
    static_cast<int32_t>(sizeof(kFamilyRawComponentColumns) / sizeof(column_attribute));
constexpr int32_t kFamilyHourlyApplicationsCount =
    static_cast<int32_t>(sizeof(kFamilyHourlyApplicationsColumns) / sizeof(column_attribute));
constexpr int32_t kFamilyHourlyComponentCount =
    static_cast<int32_t>(sizeof(kFamilyHourlyComponentColumns) / sizeof(column_attribute));

// One (duration, energy) pair of an energy class: indexes into a row's
// summed values and the class fields they go to. The pair is sent when its
// duration is at least 1, the energy scaled by the period's ratio.
struct upload_pair {
    int32_t duration;
    int32_t energy;
    uint32_t durationField;
    uint32_t energyField;
};

// One (tx bytes, rx bytes, energy) group of a traffic member's energy class:
// indexes into a row's summed values and the class fields they go to. The
// group is sent when either byte count is at least 1.
struct upload_traffic {
    int32_t tx;
    int32_t rx;
    int32_t energy;
    uint32_t txField;
    uint32_t rxField;
    uint32_t energyField;
};

// What tells one member of the component handler family from another: its
// tables, its word in log texts, its applications-accounting code and its
// upload fields. Every member shares the hourly cycle built on them.
struct component_family {
    const char* word;  // "gnss": in log texts and error lines
    // Raw application results: start_time, end_time, name, the four result
    // pairs, the two charge pairs.
    const table_attribute* rawApplications;
    // Raw component results (start_time, end_time, pairs); null for a member
    // whose component sums are those of its hourly application rows.
    const table_attribute* rawComponent;
    // The hourly tables: timestamp (and name), then the summed values. The
    // values summed every hour are the hourly component table's columns
    // after its timestamp; the raw tables hold them under the same names.
    const table_attribute* hourlyApplications;
    const table_attribute* hourlyComponent;
    int32_t appsCode;            // code in the applications accounting
    uint32_t componentField;     // upload field of the component class
    uint32_t applicationsField;  // upload field of the top-application array
    // The pairs of the energy class; null for the four result pairs.
    const upload_pair* uploadPairs = nullptr;
    int32_t uploadPairCount = 0;
    // The groups of a member whose energy class carries traffic; when set,
    // they replace the pairs.
    const upload_traffic* uploadTraffic = nullptr;
    int32_t uploadTrafficCount = 0;
    // The summed values whose total is the hour's compensation energy (-1
    // unused): by default the foreground and background energies.
    int32_t compensationValues[2] = {1, 3};
    // An extra condition of every query ("name != 'screen_off'"), or null.
    const char* filter = nullptr;
    // Whether the applications accounting applies the filter too. A member
    // that keeps the filtered names in its hourly application rows (the
    // display's screen-off time, uploaded on its own) leaves it off there;
    // the component sums and the uploads still apply it.
    bool filterAccounting = true;
    // The ranking of the top applications, or null for the summed
    // foreground and background time ("MAX(foreground_duration +
    // background_duration)" for members whose hourly rows overlap).
    const char* rankBy = nullptr;
    // Whether one application has several rows of one hour (one per
    // activity or type, overlapping in time): the hour's component sums and
    // the top applications then take, per hour, the durations of the row
    // with the longest foreground plus background time instead of adding
    // overlapping periods up (a day adds its hours up); energies are still
    // summed.
    bool longestDurations = false;
    // Whether the component class also carries a traffic group with energy
    // of at least 1 and no bytes (energy drawn without traffic, as the
    // modem's idle and call energy).
    bool componentEnergyAlone = false;
};

// Whether and how a member's component is governed by the data-source policy
// of the configuration: its policy component, the word of its log lines and
// the policies it runs with. A member without one is always enabled.
struct data_source_policy {
    int32_t component;  // ConfigPolicyComponent, -1 when not governed
    const char* word;   // "Camera": "Camera policy: %d"
    std::vector<int32_t> accepted;
};

// Base of the component handlers: the hourly tick, the applications and
// component accounting of the hour, energy compensation, and the hourly,
// daily and dawn uploads of the component class and the top applications.
// Every vote is cast, whatever failed before it: a failed query only leaves
// its part out. Members add their own messages and state.
class ComponentHandler : public KelvoOperator {
public:
    // Name buffers of parsed messages hold a whole package name; uploads cut
    // names further (kMaxUploadName).
    static constexpr size_t kNameBufferSize = 256;
    static constexpr int32_t kMaxUploadName = 100;
    static constexpr int32_t kTopApplications = 20;
    static constexpr int32_t kDefaultPolicy = 1;

    // Candidates of the hourly rounds a member votes for.
    enum candidate : int32_t {
        CANDIDATE_HOURLY_TICK = 1,
        CANDIDATE_HOURLY_UPLOAD = 4,
        CANDIDATE_DAILY_UPLOAD = 6,
        CANDIDATE_DAWN_UPLOAD = 8,
    };

    // One summed row: the name when grouped, the family's values in order.
    struct sum_row {
        android::String8 name;
        std::vector<int64_t> v;
    };

    // A member with more than one table set (one per camera) passes them
    // all; the cycle runs over each, and the uploads gather them in one event.
    ComponentHandler(const char* name, int32_t accounterType, uint32_t elector,
                     std::vector<const component_family*> families,
                     data_source_policy policy = {-1, "", {}});

    // The message parsers every member uses. A text value is copied into a
    // kNameBufferSize buffer; an integer starts at `sentinel`, so a value
    // that is not a number ("uid=abc") fails instead of reading as 0 or as a
    // stale value. 0, the parser's negative result, or -2 for a value that
    // is no number.
    static int32_t parseName(const char* text, const char* key, const char* nextKey,
                             std::string* out);
    static int32_t parseInt(const char* text, const char* key, const char* nextKey,
                            int32_t sentinel, int32_t* out);

    // The data-source policy of a configuration component (configuration
    // request 2), or -1 when it cannot be read.
    static int32_t readPolicy(int32_t component, int32_t* policy);

    // Runs a query whose first column is COUNT(*), then the name when named,
    // then `values` sums; rows over no data (the count is 0, the sums NULL)
    // are no rows. 0, or -17 for a failed query or a reply of another shape.
    static int32_t querySumRows(const android::String8& sql, bool named, int32_t values,
                                std::vector<sum_row>* out);

    int32_t getPolicy() const { return mPolicy; }

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    int32_t setConfiguration() override;
    int32_t checkEnable() override;
    void setupListeners(android::Parcel& out) override;
    void setCandidateElector() override;
    int32_t onHourlyTick(const android::Parcel& data) override;
    int32_t onHourlyUploading(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t onDawnUploading(const android::Parcel& data) override;
    int32_t logApplicationsAccounting(int64_t time) override;
    int32_t logComponentAccounting(int64_t time) override;
    int32_t handleApplicationResult(const android::Parcel& data) override;
    int32_t handleComponentResult(const android::Parcel& data) override;

protected:
    // Stores one application result read from the parcel's position (past
    // its header) and passes it to the applications accounting.
    int32_t storeApplicationResult(const component_family& family, const android::Parcel& data);
    int32_t storeComponentResult(const component_family& family, const android::Parcel& data);
    int32_t logApplicationsAccounting(const component_family& family, int64_t time);
    int32_t logComponentAccounting(const component_family& family, int64_t time);
    // Sends Activate or Deactivate of an application to the accounter.
    int32_t sendNamedAction(int32_t action, int64_t time, const android::String8& name);
    // Forms the event's component class and top applications over the
    // window ending at `end`, hands them over and votes for the candidate.
    int32_t uploadPeriod(uint32_t event, int64_t end, int64_t window, float ratio,
                         int32_t candidate);
    // The same without the vote, for a member that adds an event of its own
    // before voting. 0, or -23 when the event could not be handed over.
    int32_t setPeriodData(uint32_t event, int64_t end, int64_t window, float ratio);

    const std::vector<const component_family*> mFamilies;
    data_source_policy mPolicySource;
    int32_t mPolicy;

private:
    static int32_t uploadComponent(const component_family& family, int64_t end, int64_t window,
                                   float ratio, android::Parcel& out);
    static int32_t uploadTopApplications(const component_family& family, int64_t end,
                                         int64_t window, float ratio, android::Parcel& out);
    // The hour's component sums: from the raw component table, or from the
    // hourly application rows for a member without one.
    static android::String8 componentSumsQuery(const component_family& family, int64_t from,
                                               int64_t to);
    // "SUM(a), SUM(b), ..." over the family's values, and their count.
    static android::String8 sumList(const component_family& family);
    // The same with the durations taken from the longest row when the
    // family's rows overlap.
    static android::String8 valueList(const component_family& family);
    static int32_t valueCount(const component_family& family);
    // " AND (filter)" or nothing.
    static android::String8 filterClause(const component_family& family);
};

}  // namespace kelvo
