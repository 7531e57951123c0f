#pragma once

#include <stdint.h>

#include <array>
#include <atomic>
#include <functional>
#include <memory>
#include <mutex>

#include <binder/Parcel.h>
#include <utils/StrongPointer.h>

#include "AccounterTypes.h"
#include "LibraryListener.h"
#include "accounters/DataAccounter.h"
#include "utils/SqlOperator.h"

namespace kelvo {

// The library's process-wide state: its one SQL connection, the daemon's
// start time and the accounters, one per AccounterType, created on first use.
// Created on first use and never destroyed.
class KelvoLibAgent {
public:
    // Makes the accounter of one type; null when it cannot.
    using AccounterFactory = std::function<std::unique_ptr<DataAccounter>()>;

    static KelvoLibAgent* getInstance();

    void start(int64_t systemBootTime);
    int64_t getSystemBootTime() const { return mSystemBootTime.load(std::memory_order_relaxed); }

    // Routes one sql_action to the SQL operator. Negative on failure.
    int32_t doSqliteOperation(int32_t action, const android::Parcel* in, android::Parcel* out);

    // The accounter of the type, created on first use; null for a type out of
    // range or without an accounter. An accounter's constructor must not come
    // back here.
    DataAccounter* findAccounter(int32_t type);
    // 0, or -1 for a null listener or a type without an accounter.
    int32_t registerListener(int32_t type, const android::sp<LibraryListener>& listener);
    int32_t unregisterListener(int32_t type);
    // action: int32 AccounterType, int32 AccounterAction, the action's fields.
    // The accounter's result, or -1 when there is no accounter of the type.
    int32_t setDataAccounter(const android::Parcel& action);
    // The display's effective energy accounting policy, for the brightness
    // accounter. 0, or -1 for an unknown policy.
    int32_t setDisplayEnergyPolicy(int32_t policy);

    // Tests only: makes the type's accounters with the factory (null
    // restores the built-in one), and drops every accounter and restores the
    // built-in factories. No action may run meanwhile.
    void setAccounterFactoryForTest(int32_t type, AccounterFactory factory);
    void resetAccountersForTest();

private:
    KelvoLibAgent();
    ~KelvoLibAgent() = default;
    KelvoLibAgent(const KelvoLibAgent&) = delete;
    KelvoLibAgent& operator=(const KelvoLibAgent&) = delete;

    std::atomic<int64_t> mSystemBootTime;
    // Reached only from the storage thread.
    SqlOperator mSqlOperator;

    // Guards the filling of the accounter table (and the factories).
    std::mutex mAccounterLock;
    std::array<AccounterFactory, ACCOUNTER_TYPE_COUNT> mFactories;
    // Slots fill on first lookup and stay filled.
    std::array<std::unique_ptr<DataAccounter>, ACCOUNTER_TYPE_COUNT> mAccounters;
};

} // namespace kelvo
