#include "KelvoLibEntry.h"

#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "SqlTypes.h"
#include "core/KelvoLibAgent.h"
#include "utils/XmlParser.h"

namespace kelvo {

void startLibrary(int64_t systemBootTime) {
    KelvoLibAgent::getInstance()->start(systemBootTime);
}

int32_t doSqliteOperation(int32_t action, const android::Parcel* in, android::Parcel* out) {
    if (action < SQL_OPEN_CONNECTION || action > SQL_BACKUP_COPY) {
        // Refused by the agent; parcels the SQL operator refuses count there.
        HealthCounters::add(Health::LibraryParcelRefused);
    }
    return KelvoLibAgent::getInstance()->doSqliteOperation(action, in, out);
}

int32_t registerLibraryListener(int32_t type, const android::sp<LibraryListener>& listener) {
    return KelvoLibAgent::getInstance()->registerListener(type, listener);
}

int32_t unregisterLibraryListener(int32_t type) {
    return KelvoLibAgent::getInstance()->unregisterListener(type);
}

int32_t setDataAccounter(const android::Parcel& action) {
    int32_t ret = KelvoLibAgent::getInstance()->setDataAccounter(action);
    if (ret < 0) {
        HealthCounters::add(Health::LibraryParcelRefused);
    }
    return ret;
}

int32_t setDisplayEnergyPolicy(int32_t policy) {
    int32_t ret = KelvoLibAgent::getInstance()->setDisplayEnergyPolicy(policy);
    if (ret < 0) {
        HealthCounters::add(Health::LibraryParcelRefused);
    }
    return ret;
}

int32_t getXmlConfig(int32_t element, const android::Parcel& request, android::Parcel* reply) {
    // The power profile (element 0) belongs to the accounters alone.
    if (element < CONFIG_ABNORMALITY_THRESHOLD || element > CONFIG_TEXT) {
        LLOGE("Invalid element: %d", element);
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    if (XmlParser::getInstance()->getXmlConfig(element, request, reply) < 0) {
        LLOGE("Failed to get xml configuation");
        return -1;
    }
    return 0;
}

} // namespace kelvo
