#pragma once

#include <stddef.h>
#include <stdint.h>
#include <utils/RefBase.h>
#include <utils/StrongPointer.h>

#include <atomic>
#include <functional>
#include <map>
#include <mutex>
#include <string>

#include "kelvo/LogDeviceReader.h"

namespace kelvo {

class DispatcherThread;
class KelvoOperator;
class LoggerRecord;

// A tag an operator takes from the log device, with the operator's own id
// for it (the tag argument of its handleLogger).
struct dispatcher_tag {
    const char* name;
    int32_t id;
};

// Where the records of one tag go.
struct tag_handler {
    int32_t id;
    android::sp<KelvoOperator> target;
};

// Reads the log device on its "Dispatcher" thread and forwards each record
// whose tag an operator registered to that operator as a MESSAGE_LOGGER
// message (int64 time in ms, C string text). Records reach each operator in
// device order. The process-wide instance opens the device when it is first
// used, normally by the first tag registration during start-up; when the
// device cannot be opened the daemon runs without its events.
class Dispatcher : public virtual android::RefBase {
public:
    // Bytes taken by one read: a record never exceeds this.
    static constexpr size_t kMaxRecordSize = 5120;
    // Texts of this many characters or more are dropped.
    static constexpr size_t kMaxTextLength = 4096;

    static android::sp<Dispatcher> getInstance();

    // Adds a tag to the registry. -5 with a null operator or an empty name;
    // a name registered before keeps its first operator (0).
    int32_t registerTag(const dispatcher_tag& tag, const android::sp<KelvoOperator>& target);

    // Starts the thread when the device is open and it does not run yet.
    // 0 when it runs, -2 without a device (none, or closed after the thread
    // ended for good), -1 when it could not start.
    int32_t startDispatchMessage();

    // Records handed to an operator's sendLoggerMessage since the last call,
    // whether or not the operator could take them.
    uint32_t getLogCount();

    // Forwards one decoded record. -5 without a record, tag or text (an
    // error line); 0 otherwise, also when the text is too long (dropped with
    // an information line) or no operator registered the tag (dropped
    // silently). Each drop is counted in the self-health counters.
    int32_t dispatchMessage(const LoggerRecord* entry);

    // Stops the thread and forgets the instance with its device and tags,
    // so that the next getInstance() opens the device of the current root
    // (tests; waits for the thread).
    static void resetForTest();

    ~Dispatcher() override;

private:
    friend class DispatcherThread;

    Dispatcher();

    // One round of the thread: reads a record and dispatches it. A record
    // that cannot be forwarded is logged and dropped; only a failed read
    // returns a negative code, which ends the thread. 1 once the thread is
    // asked to stop.
    int32_t readLoggerMessage();
    // Closes the device once its thread has ended for good, so writers are
    // refused instead of waiting for a reader that will not come back.
    void closeDevice();
    void stop();
    // Counts a record that could not be decoded; the error line sums them
    // up at most once a minute.
    void noteMalformedRecord(size_t size);

    // Closed under mLock once the thread has started; read without it only
    // by the thread itself.
    LogDeviceReader mReader;
    std::atomic<bool> mStopping;
    std::atomic<uint32_t> mLogCount;
    // Only the dispatcher thread touches these.
    uint32_t mMalformedSinceSummary;
    int64_t mLastMalformedSummaryNs;
    std::mutex mLock;  // guards the tag map, the thread and closing the device
    std::map<std::string, tag_handler, std::less<>> mTags;
    android::sp<DispatcherThread> mThread;
    // Only the dispatcher thread touches the read buffer; it keeps room for
    // a terminator after the longest read.
    uint8_t mBuffer[kMaxRecordSize + 4];
};

} // namespace kelvo
