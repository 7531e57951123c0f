#include "ErrorLogger.h"

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "HealthCounters.h"
#include "utils/TimeProvider.h"

namespace kelvo {

std::atomic<int32_t> ErrorLogger::sCounter{0};
std::atomic<ErrorLogger::Sink> ErrorLogger::sSink{nullptr};

namespace {
// Set while this thread stores an error row: an error raised on the way is
// written to the system log only, never forwarded again. Handler threads
// carry it over to the messages they queue meanwhile, so the threads that
// store the row on its behalf hold it too.
thread_local bool tErrorRow = false;
} // namespace

ErrorLogger::ErrorRowScope::ErrorRowScope(bool mark) : mSaved(tErrorRow) {
    tErrorRow = mark;
}

ErrorLogger::ErrorRowScope::~ErrorRowScope() {
    tErrorRow = mSaved;
}

bool ErrorLogger::isStoringErrorRow() {
    return tErrorRow;
}

void ErrorLogger::toDatabase(const char* text) {
    if (tErrorRow || text == nullptr) {
        return;
    }
    Sink sink = sSink.load(std::memory_order_acquire);
    if (sink == nullptr) {
        return;
    }
    // Count before forwarding, so the cap holds however the sink fares.
    int32_t n = sCounter.load(std::memory_order_relaxed);
    do {
        if (n >= kMaxErrorsPerDay) {
            HealthCounters::add(Health::ErrorLinesSuppressed);
            return;
        }
    } while (!sCounter.compare_exchange_weak(n, n + 1, std::memory_order_relaxed));

    ErrorRowScope mark(true);
    android::Parcel data;
    data.writeInt64(TimeProvider::getCurrentTime(TIME_TYPE_WALL));
    data.writeString8(android::String8(text));
    data.setDataPosition(0);
    sink(data);
}

void ErrorLogger::setCounter(int32_t n) {
    if (n >= 0) {
        sCounter.store(n, std::memory_order_relaxed);
    }
}

int32_t ErrorLogger::getCounter() {
    return sCounter.load(std::memory_order_relaxed);
}

void ErrorLogger::setSink(Sink sink) {
    sSink.store(sink, std::memory_order_release);
}

} // namespace kelvo
