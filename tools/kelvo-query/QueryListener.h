#pragma once

#include <binder/Parcel.h>

#include <condition_variable>
#include <mutex>

#include "binder/IKelvoListener.h"

namespace kelvo {

// Keeps the one answer a query gets.
class QueryListener : public BnKelvoListener {
public:
    void onQueryResponse(const android::Parcel& response) override;
    // Waits up to timeoutMs for the answer and copies it into *out.
    bool waitResponse(android::Parcel* out, int timeoutMs);

private:
    std::mutex mLock;
    std::condition_variable mCond;
    bool mAnswered = false;
    android::Parcel mResponse;
};

}  // namespace kelvo
