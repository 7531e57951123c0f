#pragma once

#include <utils/Looper.h>
#include <utils/String8.h>
#include <utils/Thread.h>

namespace kelvo {

// A thread that only watches file descriptors on its looper and runs their
// callbacks.
class FdObserver : public android::Thread {
public:
    explicit FdObserver(const char* name);

    // 0, or -2 when the looper refused.
    int32_t addFd(int fd, const android::sp<android::LooperCallback>& callback);
    int32_t removeFd(int fd);
    // Ends the thread and waits for it (from the thread itself: no wait).
    void stop();

    void onFirstRef() override;
    bool threadLoop() override;

private:
    android::String8 mName;
    android::sp<android::Looper> mLooper;
};

}  // namespace kelvo
