#pragma once

// Services and helpers of the binder transport tests.

#include <binder/Binder.h>
#include <binder/IBinder.h>
#include <binder/IPCThreadState.h>
#include <binder/IServiceManager.h>
#include <binder/Parcel.h>
#include <binder/ServiceControl.h>
#include <signal.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utils/String8.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace kelvo {
namespace test {

// The codes of TestService.
enum : uint32_t {
    kEcho = android::IBinder::FIRST_CALL_TRANSACTION,  // int32 n, String16 s -> n + 1, s
    kWhoCalls,                                         // -> int32 pid, int32 uid of the caller
    kBlock,       // int32 count: waits (10 s at most) until count calls are inside -> bool
    kRecord,      // int32 seq (one-way): appended to the record
    kCallBack,    // binder b, int32 n: calls kEcho on b with n -> its answer
    kWriteFd,     // fd, String8 text: writes text to fd
    kNewObject,   // -> a new TestService
    kSameObject,  // -> this very service
};

// Sends kEcho and returns the status; *out gets the answer.
inline android::status_t echo(const android::sp<android::IBinder>& binder, int32_t n,
                              int32_t* out = nullptr) {
    android::Parcel data;
    android::Parcel reply;
    data.writeInt32(n);
    data.writeString16(android::String16("ping"));
    android::status_t err = binder->transact(kEcho, data, &reply);
    if (err == android::NO_ERROR && out != nullptr) {
        *out = reply.readInt32();
    }
    return err;
}

constexpr char16_t kTestDescriptor[] = u"kelvo.test.ITestService";

class TestService : public android::BBinder {
public:
    const android::String16& getInterfaceDescriptor() const override { return mDescriptor; }

    android::status_t dump(int fd, const android::Vector<android::String16>& args) override {
        std::string text = "dump of test service:";
        for (size_t i = 0; i < args.size(); ++i) {
            text += " " + std::string(android::String8(args[i]).string());
        }
        text += "\n";
        bool whole = write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
        return whole ? android::NO_ERROR : android::UNKNOWN_ERROR;
    }

    // One-way records, in arrival order, and the most that ran at once.
    std::vector<int32_t> records() {
        std::lock_guard<std::mutex> guard(mLock);
        return mRecords;
    }
    int maxInside() const { return mMaxInside.load(); }

protected:
    android::status_t onTransact(uint32_t code, const android::Parcel& data, android::Parcel* reply,
                                 uint32_t flags) override {
        using android::NO_ERROR;
        android::IPCThreadState* ipc = android::IPCThreadState::self();
        switch (code) {
            case kEcho: {
                int32_t n = data.readInt32();
                android::String16 s = data.readString16();
                reply->writeInt32(n + 1);
                reply->writeString16(s);
                return NO_ERROR;
            }
            case kWhoCalls:
                reply->writeInt32(ipc->getCallingPid());
                reply->writeInt32(static_cast<int32_t>(ipc->getCallingUid()));
                return NO_ERROR;
            case kBlock: {
                int32_t count = data.readInt32();
                std::unique_lock<std::mutex> lock(mLock);
                mInsideBlock++;
                mChanged.notify_all();
                bool reached = mChanged.wait_for(lock, std::chrono::seconds(10),
                                                 [&] { return mInsideBlock >= count; });
                reply->writeBool(reached);
                return NO_ERROR;
            }
            case kRecord: {
                int inside = ++mInside;
                int seen = mMaxInside.load();
                while (inside > seen && !mMaxInside.compare_exchange_weak(seen, inside)) {
                }
                std::this_thread::sleep_for(std::chrono::microseconds(100));
                {
                    std::lock_guard<std::mutex> guard(mLock);
                    mRecords.push_back(data.readInt32());
                }
                --mInside;
                return NO_ERROR;
            }
            case kCallBack: {
                android::sp<android::IBinder> other;
                android::status_t err = data.readStrongBinder(&other);
                int32_t answer = 0;
                if (err == NO_ERROR) {
                    err = echo(other, data.readInt32(), &answer);
                }
                reply->writeInt32(answer);
                return err;
            }
            case kWriteFd: {
                int fd = data.readFileDescriptor();
                if (fd < 0) {
                    return android::BAD_TYPE;
                }
                android::String8 text = data.readString8();
                ssize_t n = write(fd, text.string(), text.size());
                return n == static_cast<ssize_t>(text.size()) ? NO_ERROR : android::UNKNOWN_ERROR;
            }
            case kNewObject:
                return reply->writeStrongBinder(new TestService());
            case kSameObject:
                return reply->writeStrongBinder(this);
            default:
                return BBinder::onTransact(code, data, reply, flags);
        }
    }

private:
    const android::String16 mDescriptor{kTestDescriptor};
    std::mutex mLock;
    std::condition_variable mChanged;
    int mInsideBlock = 0;
    std::atomic<int> mInside{0};
    std::atomic<int> mMaxInside{0};
    std::vector<int32_t> mRecords;
};

// Counts the deaths it is told of, and remembers on which thread and of
// whom (read those once the count shows the death).
class DeathCounter : public android::IBinder::DeathRecipient {
public:
    void binderDied(const android::wp<android::IBinder>& who) override {
        mWho = who;
        mThread = std::this_thread::get_id();
        mCount++;
    }
    int count() const { return mCount.load(); }
    std::thread::id thread() const { return mThread; }
    android::wp<android::IBinder> who() const { return mWho; }

private:
    std::atomic<int> mCount{0};
    std::thread::id mThread;
    android::wp<android::IBinder> mWho;
};

// Serves a TestService under name from a forked child until it is killed.
inline pid_t forkService(const char* name) {
    pid_t pid = fork();
    if (pid == 0) {
        android::defaultServiceManager()->addService(android::String16(name), new TestService());
        for (;;) {
            pause();
        }
    }
    return pid;
}

inline void killChild(pid_t pid) {
    if (pid > 0) {
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
    }
}

// Forks the service and waits for it to answer. A child forked from a busy
// multi-threaded process can be stuck on a lock another thread held at the
// fork (sanitizer builds especially): such a child is replaced.
inline pid_t startRemoteService(const char* name, android::sp<android::IBinder>* proxy) {
    for (int attempt = 0; attempt < 3; ++attempt) {
        pid_t pid = forkService(name);
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        while (std::chrono::steady_clock::now() < deadline) {
            *proxy = android::defaultServiceManager()->checkService(android::String16(name));
            if (*proxy != nullptr) {
                return pid;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        killChild(pid);
    }
    return -1;
}

// Waits for a child and returns its exit status (-1 when it did not exit
// within the time-out, and is then killed).
inline int waitChild(pid_t pid, std::chrono::seconds timeout = std::chrono::seconds(30)) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
        int status = 0;
        if (waitpid(pid, &status, WNOHANG) == pid) {
            return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    killChild(pid);
    return -1;
}

// Shortens getService's wait for the life of the object.
class ServiceWait {
public:
    explicit ServiceWait(int ms) { ServiceControl::setServiceWaitMs(ms); }
    ~ServiceWait() { ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs); }
};

} // namespace test
} // namespace kelvo
