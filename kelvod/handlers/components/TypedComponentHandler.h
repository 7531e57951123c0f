#pragma once

#include <stdint.h>
#include <utils/String8.h>

#include "handlers/components/ComponentHandler.h"

namespace kelvo {

// Raw applications columns of a member whose results open with a type
// (activity or sensor type): the type, then the family's columns.
inline const column_attribute kTypedRawApplicationsColumns[] = {
    {COLUMN_INT, "type"},
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
inline const column_attribute kTypedRawComponentColumns[] = {
    {COLUMN_INT, "type"},
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
constexpr int32_t kTypedRawApplicationsCount =
    static_cast<int32_t>(sizeof(kTypedRawApplicationsColumns) / sizeof(column_attribute));
constexpr int32_t kTypedRawComponentCount =
    static_cast<int32_t>(sizeof(kTypedRawComponentColumns) / sizeof(column_attribute));

// A member of the component family whose accounter keeps its periods per
// type: the results open with the type, the raw rows keep it, the hour's
// application rows are grouped by name and type, and an application's rows
// of one hour overlap (the family sets longestDurations). The hourly
// application table holds "timestamp", "name" and "type" in any order, then
// the family's values.
class TypedComponentHandler : public ComponentHandler {
public:
    TypedComponentHandler(const char* name, int32_t accounterType, uint32_t elector,
                          const component_family* family);

    using ComponentHandler::logApplicationsAccounting;
    int32_t handleApplicationResult(const android::Parcel& data) override;
    int32_t handleComponentResult(const android::Parcel& data) override;
    int32_t logApplicationsAccounting(int64_t time) override;

protected:
    // The name a result is stored and accounted under.
    virtual android::String8 accountedName(const android::String8& name) const { return name; }
    // Sends Activate or Deactivate of a typed element.
    int32_t sendTypedAction(int32_t action, int32_t type, int64_t time,
                            const android::String8& name);
};

}  // namespace kelvo
