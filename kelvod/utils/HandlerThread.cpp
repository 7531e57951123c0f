#include "utils/HandlerThread.h"

#include <cerrno>
#include <chrono>
#include <climits>
#include <cstring>
#include <memory>
#include <tuple>
#include <utility>
#include <vector>

#include <utils/Timers.h>

#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

std::atomic<int64_t> HandlerThread::sSyncTimeoutMs{HandlerThread::kDefaultSyncTimeoutMs};

void HandlerThread::setSyncTimeoutMs(int64_t ms) {
    sSyncTimeoutMs.store(ms > 0 ? ms : kDefaultSyncTimeoutMs);
}

HandlerThread::HandlerThread(const char* name, int32_t priority)
    : android::Thread(), mPriority(0), mLastId(0), mWakeAt(LLONG_MAX), mDraining(false) {
    if (name == nullptr || name[0] == '\0') {
        KLOGE("Handler name is empty");
        return;
    }
    mName.setTo(name, strnlen(name, kMaxNameLength));
    mQueueSlot = HealthCounters::queueSlot(mName.string());
    if (priority < -19 || priority > 19) {
        KLOGE("Invalid priority: %s", mName.string());
        return;
    }
    // The looper and the name exist before the thread runs.
    mLooper = new android::Looper(false);
    mPriority = priority;
}

void HandlerThread::onFirstRef() {
    android::Thread::onFirstRef();
    // Started once the object is fully built and owned, so the new thread
    // never sees a half-constructed handler.
    if (mLooper != nullptr) {
        run(mName.string(), mPriority);
    }
}

HandlerThread::~HandlerThread() {
    KLOGE("%s exit", mName.string());
}

void HandlerThread::setLastMessageId(int32_t id) {
    std::lock_guard<std::mutex> guard(mMessageLock);
    mLastId = id;
}

bool HandlerThread::isAccepting() {
    return mLooper != nullptr && isRunning() && !exitPending();
}

int32_t HandlerThread::queueMessage(const ParcelMessage& msg) {
    std::lock_guard<std::mutex> guard(mMessageLock);
    int32_t id;
    do {
        // Ids run 1, 2, 3 ... and wrap from INT32_MAX to 0; an id that is
        // still pending is skipped.
        id = (mLastId < 0 || mLastId == INT32_MAX) ? 0 : mLastId + 1;
        mLastId = id;
    } while (mPending.count(id) != 0);
    mPending.emplace(std::piecewise_construct, std::forward_as_tuple(id),
                     std::forward_as_tuple(msg, ErrorLogger::isStoringErrorRow()));
    HealthCounters::noteQueueDepth(mQueueSlot, mPending.size());
    return id;
}

bool HandlerThread::needWakeLocked(nsecs_t when) {
    if (mDraining || when >= mWakeAt) {
        return false;
    }
    mWakeAt = when;
    return true;
}

void HandlerThread::postMessage(int32_t id, nsecs_t when) {
    bool wake = false;
    {
        std::lock_guard<std::mutex> guard(mMessageLock);
        auto it = mPending.find(id);
        if (it == mPending.end()) {
            return;
        }
        // Equal times keep their order of arrival.
        it->second.position = mQueue.emplace(when, id);
        it->second.queued = true;
        wake = it->second.position == mQueue.begin() && needWakeLocked(when);
    }
    if (wake) {
        mLooper->sendMessageAtTime(when, this, android::Message(0));
    }
}

int32_t HandlerThread::sendMessage(const ParcelMessage& msg) {
    return sendMessageAtTime(systemTime(SYSTEM_TIME_MONOTONIC), msg);
}

int32_t HandlerThread::sendMessageDelayed(nsecs_t delay, const ParcelMessage& msg) {
    return sendMessageAtTime(systemTime(SYSTEM_TIME_MONOTONIC) + delay, msg);
}

int32_t HandlerThread::sendMessageAtTime(nsecs_t when, const ParcelMessage& msg) {
    if (!isAccepting()) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("%s is not running or is pending to exit", mName.string());
        return -2;
    }
    int32_t id = queueMessage(msg);
    postMessage(id, when);
    return id;
}

int32_t HandlerThread::sendMessageSync(const ParcelMessage& msg) {
    return sendMessageSync(msg, 0);
}

int32_t HandlerThread::sendMessageSync(const ParcelMessage& msg, int64_t waitMs) {
    if (!isAccepting()) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("%s is not running or is pending to exit", mName.string());
        return -2;
    }
    // Queued only: it is posted once the waiter is in place.
    int32_t id = queueMessage(msg);

    std::unique_lock<std::mutex> lock(mSyncLock);
    if (mWaiting.count(id) != 0) {
        {
            std::lock_guard<std::mutex> guard(mMessageLock);
            mPending.erase(id);
        }
        lock.unlock();
        // Logged with no lock held: the line may be queued on this very
        // thread when it is the one that stores error rows.
        KLOGE("Already existed message id[%d] in %s", id, mName.string());
        return -13;
    }
    // Shared with the handler, which wakes the caller after it let go of
    // the lock: the caller does not wake only to block on it again.
    std::shared_ptr<sync_result> waiter = std::make_shared<sync_result>();
    mWaiting.emplace(id, waiter);
    lock.unlock();
    postMessage(id, systemTime(SYSTEM_TIME_MONOTONIC));

    using Clock = std::chrono::steady_clock;
    int64_t timeoutMs = waitMs > 0 ? waitMs : sSyncTimeoutMs.load();
    Clock::time_point now = Clock::now();
    Clock::time_point deadline = Clock::time_point::max();
    if (std::chrono::duration_cast<std::chrono::milliseconds>(Clock::time_point::max() - now)
                .count() > timeoutMs) {
        deadline = now + std::chrono::milliseconds(timeoutMs);
    }
    lock.lock();
    // A spurious wake-up goes back to waiting until done or the deadline.
    bool done = waiter->cond.wait_until(lock, deadline, [&waiter] { return waiter->done; });
    int32_t result = waiter->result;
    mWaiting.erase(id);
    lock.unlock();
    if (!done) {
        KLOGE("Failed to send synchronized message to %s: %d, result: %d", mName.string(),
              ETIMEDOUT, result);
    }
    return result;
}

int32_t HandlerThread::removeMessage(int32_t id) {
    bool found = false;
    {
        std::lock_guard<std::mutex> guard(mMessageLock);
        auto it = mPending.find(id);
        if (it != mPending.end()) {
            if (it->second.queued) {
                mQueue.erase(it->second.position);
            }
            mPending.erase(it);
            found = true;
        }
    }
    if (!found) {
        // Logged after unlocking: the line goes to the system handler's
        // queue, which may be this one.
        KLOGE("Invalid message id[%d] in %s", id, mName.string());
        return -4;
    }
    releaseWaiters(&id, 1);
    return 0;
}

void HandlerThread::removeAllMessages() {
    dropAllMessages();
}

size_t HandlerThread::dropAllMessages() {
    // The looper's wake-ups hold a reference to this handler.
    if (mLooper != nullptr) {
        mLooper->removeMessages(this);
    }
    std::vector<int32_t> ids;
    {
        std::lock_guard<std::mutex> guard(mMessageLock);
        ids.reserve(mPending.size());
        for (const auto& entry : mPending) {
            ids.push_back(entry.first);
        }
        mPending.clear();
        mQueue.clear();
        mWakeAt = LLONG_MAX;
    }
    releaseWaiters(ids.data(), ids.size());
    return ids.size();
}

void HandlerThread::releaseWaiters(const int32_t* ids, size_t count) {
    // A caller waiting for a removed message would otherwise sit out the
    // whole time-out: it returns at once with -1.
    std::vector<std::shared_ptr<sync_result>> released;
    {
        std::lock_guard<std::mutex> guard(mSyncLock);
        if (mWaiting.empty()) {
            return;
        }
        for (size_t i = 0; i < count; ++i) {
            auto it = mWaiting.find(ids[i]);
            if (it != mWaiting.end()) {
                it->second->done = true;
                released.push_back(it->second);
            }
        }
    }
    for (const auto& waiter : released) {
        waiter->cond.notify_one();
    }
}

void HandlerThread::requestThreadExit() {
    requestExit();
    if (mLooper != nullptr) {
        mLooper->wake();
    }
}

void HandlerThread::handleMessage(const android::Message& message) {
    std::unique_lock<std::mutex> lock(mMessageLock);
    mWakeAt = LLONG_MAX;
    mDraining = true;
    for (;;) {
        if (mQueue.empty()) {
            break;
        }
        Queue::iterator head = mQueue.begin();
        if (head->first > systemTime(SYSTEM_TIME_MONOTONIC)) {
            break;
        }
        int32_t id = head->second;
        mQueue.erase(head);
        // The entry leaves the table with its body: no copy.
        auto node = mPending.extract(id);
        lock.unlock();
        if (!node.empty()) {
            node.mapped().queued = false;
            deliver(id, node.mapped());
        }
        lock.lock();
        if (exitPending()) {
            break;
        }
    }
    mDraining = false;
    bool wake = false;
    nsecs_t when = 0;
    if (!mQueue.empty()) {
        when = mQueue.begin()->first;
        wake = needWakeLocked(when);
    }
    lock.unlock();
    if (wake) {
        mLooper->sendMessageAtTime(when, this, android::Message(0));
    }
}

void HandlerThread::deliver(int32_t id, pending_message& entry) {
    if (exitPending()) {
        // The thread is going away: what is still queued is dropped.
        HealthCounters::add(Health::MessagesDropped);
        releaseWaiters(&id, 1);
        return;
    }
    ParcelMessage& msg = entry.msg;
    android::Parcel* callerReply = msg.reply;
    android::Parcel reply;
    msg.reply = &reply;

    int32_t status;
    {
        ErrorLogger::ErrorRowScope mark(entry.errorRow);
        status = handleParcelMessage(msg);
    }

    std::shared_ptr<sync_result> waiter;
    {
        std::lock_guard<std::mutex> guard(mSyncLock);
        auto it = mWaiting.find(id);
        if (it == mWaiting.end()) {
            return;  // asynchronous, or the caller gave up waiting
        }
        waiter = it->second;
        waiter->result = status;
        // The caller's reply is written while it still waits under the lock.
        if (callerReply != nullptr && reply.dataSize() > 0) {
            callerReply->freeData();
            callerReply->appendFrom(&reply, 0, reply.dataSize());
            callerReply->setDataPosition(0);
        }
        waiter->done = true;
    }
    waiter->cond.notify_one();
}

bool HandlerThread::threadLoop() {
    int result = mLooper->pollOnce(-1);
    if (exitPending()) {
        // Whatever woke the loop, an exit request drops the queue; the
        // thread then ends.
        size_t dropped = dropAllMessages();
        if (dropped > 0) {
            HealthCounters::add(Health::MessagesDropped, dropped);
        }
        KLOGE("%s is pending to exit", mName.string());
        return true;
    }
    switch (result) {
        case android::Looper::POLL_CALLBACK:
            break;
        case android::Looper::POLL_WAKE:
            KLOGD("%s Looper::POLL_WAKE", mName.string());
            break;
        case android::Looper::POLL_TIMEOUT:
            KLOGD("%s Looper::POLL_TIMEOUT", mName.string());
            break;
        case android::Looper::POLL_ERROR:
            KLOGD("%s Looper::POLL_ERROR", mName.string());
            break;
        default:
            KLOGD("%s Looper::default", mName.string());
            break;
    }
    return true;
}

} // namespace kelvo
