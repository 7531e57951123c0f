// Start-up hooks of the host layer, run before main in every program.
//
// Debian's libutils starts threads without their name or priority. Install a
// thread-creation function that applies both in the new thread before its
// entry function runs, as the phone's libutils does.

#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include <android/log.h>
#include <utils/AndroidThreads.h>

namespace {

struct ThreadStart {
    android_thread_func_t entry;
    void* userData;
    std::string name;
    int32_t priority;
};

int startThread(void* arg) {
    ThreadStart* start = static_cast<ThreadStart*>(arg);
    if (!start->name.empty()) {
        // The kernel keeps 15 characters of a thread name.
        prctl(PR_SET_NAME, start->name.substr(0, 15).c_str(), 0, 0, 0);
    }
    if (start->priority != 0) {
        // Best effort: raising a priority needs privileges.
        setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), start->priority);
    }
    android_thread_func_t entry = start->entry;
    void* userData = start->userData;
    delete start;
    return entry(userData);
}

int createThread(android_thread_func_t entry, void* userData, const char* threadName,
                 int32_t threadPriority, size_t threadStackSize, android_thread_id_t* threadId) {
    ThreadStart* start =
            new ThreadStart{entry, userData, threadName != nullptr ? threadName : "", threadPriority};
    int ok = androidCreateRawThreadEtc(startThread, start, threadName, threadPriority,
                                       threadStackSize, threadId);
    if (!ok) {
        delete start;
    }
    return ok;
}

struct HostInit {
    HostInit() {
        androidSetCreateThreadFunc(createThread);
        // Debian's liblog drops DEBUG lines by default; the daemon's own
        // switches decide what is written, so let every priority through.
        __android_log_set_minimum_priority(ANDROID_LOG_VERBOSE);
    }
} gHostInit;

} // namespace
