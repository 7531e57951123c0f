#pragma once

#include <stdint.h>

#include <atomic>

namespace android {
class Parcel;
}

namespace kelvo {

// The database side of error output. Each stored error becomes a parcel of
// (int64 wall-clock ms, String8 text) handed to the agent, which has the
// system handler store it. At most kMaxErrorsPerDay are stored between two
// counter resets (the system handler resets it on the daily tick).
class ErrorLogger {
public:
    static constexpr int32_t kMaxErrorsPerDay = 1000;

    // Where stored errors go; the agent installs itself once it is built.
    typedef void (*Sink)(const android::Parcel& data);

    // Hands the line to the sink unless the daily cap is reached (counted
    // in Health::ErrorLinesSuppressed) or this thread is storing an error
    // row: then the line reaches the system log only.
    static void toDatabase(const char* text);
    static void setCounter(int32_t n);
    static int32_t getCounter();
    static void setSink(Sink sink);

    // True while this thread stores an error row: it forwards an error, or
    // handles a message queued on the way (the mark travels with every
    // message a thread queues while it is set).
    static bool isStoringErrorRow();

    // Sets the mark of this thread for its lifetime (restores the old one).
    class ErrorRowScope {
    public:
        explicit ErrorRowScope(bool mark);
        ~ErrorRowScope();
        ErrorRowScope(const ErrorRowScope&) = delete;
        ErrorRowScope& operator=(const ErrorRowScope&) = delete;

    private:
        bool mSaved;
    };

private:
    static std::atomic<int32_t> sCounter;
    static std::atomic<Sink> sSink;
};

} // namespace kelvo
