#include "QueryListener.h"

#include <chrono>

namespace kelvo {

void QueryListener::onQueryResponse(const android::Parcel& response) {
    std::lock_guard<std::mutex> guard(mLock);
    mResponse.freeData();
    mResponse.appendFrom(&response, 0, response.dataSize());
    mAnswered = true;
    mCond.notify_all();
}

bool QueryListener::waitResponse(android::Parcel* out, int timeoutMs) {
    std::unique_lock<std::mutex> lock(mLock);
    if (!mCond.wait_for(lock, std::chrono::milliseconds(timeoutMs), [this] { return mAnswered; })) {
        return false;
    }
    out->freeData();
    out->appendFrom(&mResponse, 0, mResponse.dataSize());
    out->setDataPosition(0);
    return true;
}

}  // namespace kelvo
