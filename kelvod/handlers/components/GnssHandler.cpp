#include "handlers/components/GnssHandler.h"

#include <string>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/AppsAccounting.h"
#include "core/Dispatcher.h"

namespace kelvo {

namespace {

const table_attribute kRawApplications = {"1.1", 1, kFamilyRawApplicationsCount,
                                          kFamilyRawApplicationsColumns, "raw_applications_gnss"};
const table_attribute kRawComponent = {"1.1", 1, kFamilyRawComponentCount,
                                       kFamilyRawComponentColumns, "raw_component_gnss"};
const table_attribute kHourlyApplications = {"1.0", 1, kFamilyHourlyApplicationsCount,
                                             kFamilyHourlyApplicationsColumns,
                                             "hourly_applications_gnss"};
const table_attribute kHourlyComponent = {"1.0", 1, kFamilyHourlyComponentCount,
                                          kFamilyHourlyComponentColumns, "hourly_component_gnss"};

const component_family kFamily = {
    "gnss",
    &kRawApplications,
    &kRawComponent,
    &kHourlyApplications,
    &kHourlyComponent,
    APPS_GNSS,
    8,
    9,
};

}  // namespace

GnssHandler::GnssHandler()
    : ComponentHandler("GnssHandler", ACCOUNTER_GNSS, kElector, {&kFamily}) {}

const component_family& GnssHandler::family() {
    return kFamily;
}

void GnssHandler::registerDispatcherTag() {
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_GNSS_START", TAG_GNSS_START}, this);
    Dispatcher::getInstance()->registerTag({"KELVO_TAG_GNSS_STOP", TAG_GNSS_STOP}, this);
}

int32_t GnssHandler::handleLogger(int64_t time, int32_t tag, const char* text) {
    if (tag != TAG_GNSS_START && tag != TAG_GNSS_STOP) {
        KLOGE("Unknown message tag: %d", tag);
        return -3;
    }
    std::string name;
    int32_t ret = parseName(text, "name=", nullptr, &name);
    if (ret < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
        KLOGE("Failed to parse name: %d", ret);
        return -19;
    }
    bool start = tag == TAG_GNSS_START;
    sendNamedAction(start ? ACTION_ACTIVATE : ACTION_DEACTIVATE, time,
                    android::String8(name.c_str()));
    KLOGD("timestamp: %lld, name: %s, state: %d", static_cast<long long>(time), name.c_str(),
          start ? 1 : 0);
    return 0;
}

}  // namespace kelvo
