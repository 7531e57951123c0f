#pragma once

#include <stdint.h>

#include <atomic>

#include <binder/Parcel.h>

#include "utils/SqlOperator.h"

namespace kelvo {

// The library's process-wide state: its one SQL connection and the daemon's
// start time. Created on first use and never destroyed.
class KelvoLibAgent {
public:
    static KelvoLibAgent* getInstance();

    void start(int64_t systemBootTime);
    int64_t getSystemBootTime() const { return mSystemBootTime.load(std::memory_order_relaxed); }

    // Routes one sql_action to the SQL operator. Negative on failure.
    int32_t doSqliteOperation(int32_t action, const android::Parcel* in, android::Parcel* out);

private:
    KelvoLibAgent();
    ~KelvoLibAgent() = default;
    KelvoLibAgent(const KelvoLibAgent&) = delete;
    KelvoLibAgent& operator=(const KelvoLibAgent&) = delete;

    std::atomic<int64_t> mSystemBootTime;
    // Reached only from the storage thread.
    SqlOperator mSqlOperator;
};

} // namespace kelvo
