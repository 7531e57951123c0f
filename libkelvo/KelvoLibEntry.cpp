#include "KelvoLibEntry.h"

#include "core/KelvoLibAgent.h"

namespace kelvo {

void startLibrary(int64_t systemBootTime) {
    KelvoLibAgent::getInstance()->start(systemBootTime);
}

int32_t doSqliteOperation(int32_t action, const android::Parcel* in, android::Parcel* out) {
    return KelvoLibAgent::getInstance()->doSqliteOperation(action, in, out);
}

} // namespace kelvo
