#pragma once

#include "binder/managers/BaseManager.h"

namespace kelvo {

// Client of "SysinfoService": asks for a trace dump to a device path and
// waits until it is written.
class SysinfoManager : public BaseManager {
public:
    static SysinfoManager* getInstance();

    // 0; -5 for a null path; -8 without the service or when a step fails.
    int32_t dumpSystrace(const char* path);

private:
    SysinfoManager() : BaseManager("SysinfoService") {}
};

} // namespace kelvo
