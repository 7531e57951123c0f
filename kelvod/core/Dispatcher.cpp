#include "core/Dispatcher.h"

#include <binder/Parcel.h>
#include <errno.h>

#include <cstring>
#include <string_view>

#include <utils/Timers.h>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "core/DispatcherThread.h"
#include "core/KelvoOperator.h"
#include "core/LoggerRecord.h"

namespace kelvo {

namespace {

constexpr int32_t kThreadPriority = 11;
// Malformed records are counted one by one but summed up in the error log at
// most this often, so a broken writer cannot spend the day's error lines.
constexpr nsecs_t kMalformedSummaryPeriodNs = 60 * 1000000000LL;

std::mutex gInstanceLock;
// Never destroyed: the dispatcher lives as long as the process.
android::sp<Dispatcher>* gInstance = new android::sp<Dispatcher>();

} // namespace

android::sp<Dispatcher> Dispatcher::getInstance() {
    std::lock_guard<std::mutex> guard(gInstanceLock);
    if (*gInstance == nullptr) {
        *gInstance = new Dispatcher();
    }
    return *gInstance;
}

void Dispatcher::resetForTest() {
    android::sp<Dispatcher> old;
    {
        std::lock_guard<std::mutex> guard(gInstanceLock);
        old = *gInstance;
        gInstance->clear();
    }
    if (old != nullptr) {
        old->stop();
    }
}

Dispatcher::Dispatcher()
    : mStopping(false), mLogCount(0), mMalformedSinceSummary(0), mLastMalformedSummaryNs(0) {
    memset(mBuffer, 0, sizeof(mBuffer));
    if (mReader.open(KELVO_LOG_DEVICE) < 0) {
        int err = errno;
        KLOGE("Failed to open %s: %s", mReader.getPath().c_str(), strerror(err));
        return;
    }
    mThread = new DispatcherThread(this);
}

Dispatcher::~Dispatcher() = default;

void Dispatcher::closeDevice() {
    std::lock_guard<std::mutex> guard(mLock);
    mReader.close();
}

void Dispatcher::stop() {
    android::sp<DispatcherThread> thread;
    std::map<std::string, tag_handler, std::less<>> tags;
    {
        std::lock_guard<std::mutex> guard(mLock);
        thread = mThread;
        mThread.clear();
        tags.swap(mTags);
        mStopping.store(true);
        if (thread != nullptr) {
            thread->requestExit();
            // Wakes a blocked read at once where the device allows it.
            mReader.interrupt();
        }
    }
    if (thread != nullptr) {
        thread->join();
    }
    closeDevice();
}

int32_t Dispatcher::registerTag(const dispatcher_tag& tag,
                                const android::sp<KelvoOperator>& target) {
    if (target == nullptr || tag.name == nullptr || tag.name[0] == '\0') {
        KLOGE("Invalid parameter");
        return -5;
    }
    bool added;
    {
        std::lock_guard<std::mutex> guard(mLock);
        added = mTags.emplace(tag.name, tag_handler{tag.id, target}).second;
    }
    if (!added) {
        KLOGI("Event(%s) has been registered", tag.name);
    }
    return 0;
}

int32_t Dispatcher::startDispatchMessage() {
    std::lock_guard<std::mutex> guard(mLock);
    // No device, or it was closed when the thread ended for good.
    if (mThread == nullptr || !mReader.isOpen()) {
        return -2;
    }
    if (!mThread->isRunning() && mThread->run("Dispatcher", kThreadPriority) != android::OK) {
        return mThread->isRunning() ? 0 : -1;
    }
    return 0;
}

uint32_t Dispatcher::getLogCount() {
    return mLogCount.exchange(0);
}

int32_t Dispatcher::readLoggerMessage() {
    ssize_t n = mReader.read(mBuffer, kMaxRecordSize);
    if (mStopping.load()) {
        return 1;
    }
    if (n < 0) {
        int err = errno;
        KLOGE("Failed to read log device: %s", strerror(err));
        return -14;
    }

    // One bad record costs only itself: count it and read on.
    LoggerRecord entry;
    if (entry.decode(mBuffer, static_cast<size_t>(n)) < 0 || entry.getTag() == nullptr ||
        entry.getText() == nullptr) {
        noteMalformedRecord(static_cast<size_t>(n));
        return 0;
    }
    dispatchMessage(&entry);
    return 0;
}

void Dispatcher::noteMalformedRecord(size_t size) {
    HealthCounters::add(Health::LogRecordMalformed);
    ++mMalformedSinceSummary;
    nsecs_t now = systemTime(SYSTEM_TIME_MONOTONIC);
    if (mLastMalformedSummaryNs != 0 && now - mLastMalformedSummaryNs < kMalformedSummaryPeriodNs) {
        return;
    }
    unsigned payload = size >= 2 ? static_cast<unsigned>(mBuffer[0] | (mBuffer[1] << 8)) : 0;
    KLOGE("Dropped %u malformed logger records, last: %zu bytes, payload length %u",
          mMalformedSinceSummary, size, payload);
    mMalformedSinceSummary = 0;
    mLastMalformedSummaryNs = now;
}

int32_t Dispatcher::dispatchMessage(const LoggerRecord* entry) {
    if (entry == nullptr || entry->getTag() == nullptr || entry->getText() == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    if (entry->getTextLength() >= kMaxTextLength) {
        HealthCounters::add(Health::LogRecordMalformed);
        KLOGI("Ignored long message");
        return 0;
    }
    tag_handler handler;
    {
        std::lock_guard<std::mutex> guard(mLock);
        auto it = mTags.find(std::string_view(entry->getTag(), entry->getTagLength()));
        if (it == mTags.end()) {
            HealthCounters::add(Health::LogRecordUnknownTag);
            return 0;
        }
        handler = it->second;
    }

    int64_t time = entry->getTime();
    KLOGM(LOG_MODULE_DISPATCHER, "[%s] timestamp: %lld, message: %s", entry->getTag(),
          static_cast<long long>(time), entry->getText());
    android::Parcel data;
    // Sized once: the time and the text with its terminator, padded.
    data.setDataCapacity(sizeof(int64_t) + ((entry->getTextLength() + 1 + 3) & ~size_t(3)));
    data.writeInt64(time);
    data.writeCString(entry->getText());
    // Every record handed over counts as forwarded; one the operator could
    // not take is counted as refused as well.
    mLogCount.fetch_add(1);
    if (handler.target->sendLoggerMessage(handler.id, data) < 0) {
        HealthCounters::add(Health::LoggerMessageRefused);
    }
    return 0;
}

} // namespace kelvo
