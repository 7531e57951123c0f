#pragma once

#include <utils/String16.h>

#include <vector>

#include "binder/managers/BaseManager.h"

namespace kelvo {

// Client of "pmservice": partial wakelock records and the note that battery
// statistics were reset.
class WakelockManager : public BaseManager {
public:
    static WakelockManager* getInstance();

    // Appends one text per wakelock record: 0, -8 without the service, -12
    // for a failed answer.
    int32_t getPartialWakelocks(std::vector<android::String16>& out);
    // One-way: 0, or -8 without the service.
    int32_t noteResetBatteryStats();

private:
    WakelockManager() : BaseManager("pmservice") {}
};

} // namespace kelvo
