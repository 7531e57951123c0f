#pragma once

#include <stdint.h>

#include <map>
#include <mutex>
#include <string>

#include <utils/String8.h>

#include "core/LogReceiver.h"

namespace kelvo {

// Routes binary entries from other processes to the operators that
// registered for them, by sender name and magic.
class BufferedLogServer {
public:
    static BufferedLogServer* getInstance();

    // 0; -5 for a null receiver or an empty name; -13 when the sender and
    // magic are taken.
    int32_t registerLogReceiver(const android::sp<LogReceiver>& receiver,
                                const android::String8& name, int32_t magic);
    int32_t unregisterLogReceiver(const android::String8& name, int32_t magic);
    // Delivers one entry (int32 length, int32 magic, data) of a named sender
    // to its receiver; -4 when nobody receives it.
    int32_t sendLogMessage(const android::String8& name, const uint8_t* entry, size_t size);

private:
    BufferedLogServer() = default;
    static std::string key(const android::String8& name, int32_t magic);

    std::mutex mLock;
    std::map<std::string, android::sp<LogReceiver>> mReceivers;
};

} // namespace kelvo
