#include "core/BufferedLogServer.h"

#include <cstring>

#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

BufferedLogServer* BufferedLogServer::getInstance() {
    static std::mutex lock;
    static BufferedLogServer* instance = nullptr;
    std::lock_guard<std::mutex> guard(lock);
    if (instance == nullptr) {
        instance = new BufferedLogServer();
    }
    return instance;
}

std::string BufferedLogServer::key(const android::String8& name, int32_t magic) {
    return std::string(name.string()) + std::to_string(magic);
}

int32_t BufferedLogServer::registerLogReceiver(const android::sp<LogReceiver>& receiver,
                                               const android::String8& name, int32_t magic) {
    if (receiver == nullptr || name.isEmpty()) {
        KLOGE("Invalid parameter");
        return -5;
    }
    bool added;
    {
        std::lock_guard<std::mutex> guard(mLock);
        added = mReceivers.emplace(key(name, magic), receiver).second;
    }
    if (!added) {
        KLOGE("This type(%s) or magic(%d) has been registered", name.string(), magic);
        return -13;
    }
    return 0;
}

int32_t BufferedLogServer::unregisterLogReceiver(const android::String8& name, int32_t magic) {
    std::lock_guard<std::mutex> guard(mLock);
    mReceivers.erase(key(name, magic));
    return 0;
}

int32_t BufferedLogServer::sendLogMessage(const android::String8& name, const uint8_t* entry,
                                          size_t size) {
    int32_t magic = 0;
    if (entry == nullptr || size < 8) {
        HealthCounters::add(Health::BufferedEntryRefused);
        KLOGE("Invalid parameter");
        return -5;
    }
    memcpy(&magic, entry + 4, sizeof(magic));
    android::sp<LogReceiver> receiver;
    std::string k = key(name, magic);
    {
        std::lock_guard<std::mutex> guard(mLock);
        auto it = mReceivers.find(k);
        if (it != mReceivers.end()) {
            receiver = it->second;
        }
    }
    if (receiver == nullptr) {
        HealthCounters::add(Health::BufferedEntryRefused);
        KLOGE("No receiver to receive message (name=%s, type=%s, magic=%d)", k.c_str(),
              name.string(), magic);
        return -4;
    }
    receiver->onLogReceived(name, entry, size);
    return 0;
}

} // namespace kelvo
