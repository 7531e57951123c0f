#pragma once

#include <stdint.h>

#include <mutex>
#include <string>
#include <vector>

#include "common/TestEnv.h"
#include "utils/HandlerThread.h"

namespace kelvo {
namespace test {

// A handler thread that records the type, `what`, leading int64 and the
// int32 after it of every message it handles (0 for what the body lacks).
class RecordingHandler : public HandlerThread {
public:
    struct Got {
        int32_t type;
        int32_t what;
        int64_t time;
        int32_t value;
    };

    explicit RecordingHandler(const char* name) : HandlerThread(name, 11) {}

    int32_t handleParcelMessage(const ParcelMessage& msg) override {
        std::lock_guard<std::mutex> guard(mLock);
        int64_t time = msg.getParcel().readInt64();
        mGot.push_back({msg.type, msg.what, time, msg.getParcel().readInt32()});
        return 0;
    }

    std::vector<Got> got() {
        std::lock_guard<std::mutex> guard(mLock);
        return mGot;
    }

    void clear() {
        std::lock_guard<std::mutex> guard(mLock);
        mGot.clear();
    }

    size_t count(int32_t type, int32_t what) {
        size_t n = 0;
        for (const Got& g : got()) n += g.type == type && g.what == what ? 1 : 0;
        return n;
    }

    // Waits until everything posted to this thread so far has been handled.
    bool drain() {
        size_t before = count(MESSAGE_CUSTOMIZED, kMarker);
        return sendMessage(ParcelMessage(MESSAGE_CUSTOMIZED, kMarker)) >= 0 &&
                waitFor([&] { return count(MESSAGE_CUSTOMIZED, kMarker) > before; });
    }

private:
    static constexpr int32_t kMarker = -1;
    std::mutex mLock;
    std::vector<Got> mGot;
};

// Records every buffered-log entry delivered to it as "name:magic:data".
class EntryRecorder : public HandlerThread {
public:
    EntryRecorder() : HandlerThread("EntryRecorder", 11) {}
    int32_t handleParcelMessage(const ParcelMessage& msg) override {
        const android::Parcel& p = msg.getParcel();
        p.readInt64();
        std::string entry = std::string(p.readString8().string()) + ":";
        entry += std::to_string(p.readInt32()) + ":";
        std::string data(static_cast<size_t>(p.readInt32()), '\0');
        p.read(&data[0], data.size());
        std::lock_guard<std::mutex> guard(mLock);
        mGot.push_back(entry + data);
        return 0;
    }
    std::vector<std::string> got() {
        std::lock_guard<std::mutex> guard(mLock);
        return mGot;
    }

private:
    std::mutex mLock;
    std::vector<std::string> mGot;
};

} // namespace test
} // namespace kelvo
