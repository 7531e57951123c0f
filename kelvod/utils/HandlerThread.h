#pragma once

#include <stdint.h>

#include <atomic>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <unordered_map>

#include <utils/Looper.h>
#include <utils/String8.h>
#include <utils/Thread.h>

#include "utils/ParcelMessage.h"

namespace kelvo {

// A named worker thread with its own looper. The thread starts as soon as the
// object is first held by a strong pointer. Every message gets an id; its
// body waits in the pending table and its id in a time-ordered queue until
// the thread takes it. The looper carries at most a wake-up or two for the
// queue's head, so a deep queue costs log(n) per message, not a looper scan.
// Sends are asynchronous, delayed or synchronous (the caller waits for the
// handler's status and reply).
class HandlerThread : public android::Thread, public android::MessageHandler {
public:
    // Longest wait of a synchronous send.
    static constexpr int64_t kDefaultSyncTimeoutMs = 20000;
    // Names are cut to this many characters.
    static constexpr size_t kMaxNameLength = 19;

    HandlerThread(const char* name, int32_t priority);
    ~HandlerThread() override;

    // Each returns the message id (0 or more) or -2 when the thread is not
    // running or is pending to exit (counted in Health::MessagesRefused).
    int32_t sendMessage(const ParcelMessage& msg);
    int32_t sendMessageDelayed(nsecs_t delay, const ParcelMessage& msg);
    int32_t sendMessageAtTime(nsecs_t when, const ParcelMessage& msg);
    // Waits for the handler. Returns its status, -1 on time-out, -13 when the
    // id is already waited for, -2 when the thread is not running.
    int32_t sendMessageSync(const ParcelMessage& msg);
    // The same with a wait of its own (at most timeoutMs; the default when
    // 0 or less). A message the caller gave up on is still handled.
    int32_t sendMessageSync(const ParcelMessage& msg, int64_t timeoutMs);

    int32_t removeMessage(int32_t id);
    void removeAllMessages();
    void requestThreadExit();

    const char* getName() const { return mName.string(); }
    // True while the thread runs and no exit is pending.
    bool isAccepting();

    // Sets the id the next one follows (tests of the wrap-around).
    void setLastMessageId(int32_t id);

    // Shortens the synchronous wait (tests); 0 or less restores the default.
    static void setSyncTimeoutMs(int64_t ms);

    void onFirstRef() override;
    bool threadLoop() override;
    void handleMessage(const android::Message& message) override;
    virtual int32_t handleParcelMessage(const ParcelMessage& msg) = 0;

private:
    struct sync_result {
        int32_t result = -1;
        bool done = false;
        std::condition_variable cond;
    };

    typedef std::multimap<nsecs_t, int32_t> Queue;

    // Slot of this thread's queue high-water mark (-1: none).
    int mQueueSlot = -1;

    struct pending_message {
        pending_message(const ParcelMessage& m, bool row) : msg(m), errorRow(row) {}
        ParcelMessage msg;
        // Queued while the sender stored an error row: handled the same way.
        bool errorRow;
        bool queued = false;
        Queue::iterator position;
    };

    int32_t queueMessage(const ParcelMessage& msg);
    void postMessage(int32_t id, nsecs_t when);
    // Asks the looper to wake the thread at `when` unless an earlier wake-up
    // is already due; called with the message lock held, returns whether the
    // caller must post the wake-up after unlocking.
    bool needWakeLocked(nsecs_t when);
    void deliver(int32_t id, pending_message& entry);
    void releaseWaiters(const int32_t* ids, size_t count);
    // Empties the queue and releases the waiters; returns how many
    // messages were dropped.
    size_t dropAllMessages();

    android::String8 mName;
    int32_t mPriority;
    android::sp<android::Looper> mLooper;

    std::mutex mMessageLock;
    int32_t mLastId;
    std::unordered_map<int32_t, pending_message> mPending;
    Queue mQueue;
    // Earliest wake-up posted to the looper (LLONG_MAX: none), and whether
    // the thread is draining the queue right now (then it picks up new
    // messages itself).
    nsecs_t mWakeAt;
    bool mDraining;

    std::mutex mSyncLock;
    std::unordered_map<int32_t, std::shared_ptr<sync_result>> mWaiting;

    static std::atomic<int64_t> sSyncTimeoutMs;
};

} // namespace kelvo
