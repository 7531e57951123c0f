#pragma once

// The outcome of a hardware-binder call: the transport's status and, when
// it went through, the method's result.

#include <utils/Errors.h>

#include <string>
#include <utility>

namespace android {
namespace hardware {

class Status {
public:
    static Status ok() { return Status(NO_ERROR); }
    static Status fromStatusT(status_t status) { return Status(status); }

    bool isOk() const { return mStatus == NO_ERROR; }
    status_t transactionError() const { return mStatus; }
    std::string description() const {
        return isOk() ? "ok" : "transport error " + std::to_string(mStatus);
    }

private:
    explicit Status(status_t status) : mStatus(status) {}
    status_t mStatus;
};

template <typename T>
class Return {
public:
    Return(T value) : mStatus(Status::ok()), mValue(std::move(value)) {}
    Return(const Status& status) : mStatus(status), mValue() {}

    bool isOk() const { return mStatus.isOk(); }
    const Status& getStatus() const { return mStatus; }
    std::string description() const { return mStatus.description(); }
    // The result; a failed call has none, so the default is given instead.
    T withDefault(T def) const { return isOk() ? mValue : def; }
    operator T() const { return mValue; }

private:
    Status mStatus;
    T mValue;
};

template <>
class Return<void> {
public:
    Return() : mStatus(Status::ok()) {}
    Return(const Status& status) : mStatus(status) {}

    bool isOk() const { return mStatus.isOk(); }
    const Status& getStatus() const { return mStatus; }
    std::string description() const { return mStatus.description(); }

private:
    Status mStatus;
};

inline Return<void> Void() {
    return Return<void>();
}

} // namespace hardware
} // namespace android
