#pragma once

// The process-wide agent's storage on a fresh root, with "KelvoService"
// published and a permission service. Callers of another uid are the
// kelvo-as-uid helper, run as that uid (root only).

#include <binder/IServiceManager.h>
#include <binder/PermissionCache.h>
#include <binder/ServiceControl.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <vector>

#include "FakePermissionService.h"
#include "PlatformState.h"
#include "binder/KelvoService.h"
#include "core/KelvoAgent.h"
#include "kelvod/storage/StorageTestUtil.h"

namespace kelvo {
namespace test {

class KelvoServiceFixture : public AgentStorageTest {
protected:
    void SetUp() override {
        AgentStorageTest::SetUp();
        // Children of other uids reach the sockets and serve their listeners.
        chmod(mRoot->path().c_str(), 0755);
        android::PermissionCache::purge();
        auto sm = android::defaultServiceManager();
        ASSERT_EQ(android::NO_ERROR, sm->addService(android::String16("permission"),
                                                    new FakePermissionService(mState)));
        ASSERT_EQ(android::NO_ERROR, KelvoService::publish(KelvoAgent::getInstance()));
        chmod((mRoot->path() + "/dev/binder").c_str(), 01777);
        mService = sm->getService(android::String16(KelvoService::kServiceName));
        ASSERT_NE(nullptr, mService);
    }
    void TearDown() override {
        mService.clear();
        ServiceControl::stopService(android::String16(KelvoService::kServiceName));
        ServiceControl::stopService(android::String16("permission"));
        android::PermissionCache::purge();
        AgentStorageTest::TearDown();
    }

    // What the kelvo-as-uid helper prints for the calls, run as the uid; a
    // failed run ends with its exit status. *pid: the caller's process id.
    std::string asUid(uid_t uid, const std::vector<std::string>& calls, pid_t* pid = nullptr,
                      int waitMs = 5000) const {
        std::vector<std::string> words = {KELVO_AS_UID, "-r", mRoot->path()};
        words.insert(words.end(), {"-u", std::to_string(uid), "-w", std::to_string(waitMs)});
        words.insert(words.end(), calls.begin(), calls.end());
        std::vector<char*> argv;
        for (std::string& w : words) argv.push_back(&w[0]);
        argv.push_back(nullptr);
        int fds[2];
        if (pipe2(fds, O_CLOEXEC) != 0) return "no pipe";
        // Only async-signal-safe calls between the fork and the exec: the
        // other threads of this process may hold any lock at the fork.
        pid_t child = fork();
        if (child == 0) {
            if (dup2(fds[1], STDOUT_FILENO) < 0) _exit(126);
            execv(argv[0], argv.data());
            _exit(127);
        }
        close(fds[1]);
        if (pid != nullptr) *pid = child;
        std::string out;
        char buf[4096];
        for (ssize_t n; child > 0 && (n = read(fds[0], buf, sizeof(buf))) > 0;) out.append(buf, n);
        close(fds[0]);
        int status = -1;
        if (child < 0 || waitpid(child, &status, 0) != child) return out + "[not run]";
        if (WIFEXITED(status) && WEXITSTATUS(status) == 0) return out;
        return out + "[exit status " + std::to_string(status) + "]";
    }

    // The dump output for the arguments, asked through the given binder.
    static std::string dumpOf(const android::sp<android::IBinder>& binder,
                              const std::vector<std::string>& args) {
        android::Vector<android::String16> list;
        for (const std::string& a : args) list.add(android::String16(a.c_str()));
        FILE* file = tmpfile();
        if (file == nullptr) return "no file";
        binder->dump(fileno(file), list);
        std::string out;
        rewind(file);
        char buf[4096];
        for (size_t n; (n = fread(buf, 1, sizeof(buf), file)) > 0;) out.append(buf, n);
        fclose(file);
        return out;
    }

    static android::sp<android::IBinder> service() {
        return android::defaultServiceManager()->getService(
            android::String16(KelvoService::kServiceName));
    }

    std::shared_ptr<PlatformState> mState = std::make_shared<PlatformState>();
    android::sp<android::IBinder> mService;
};

#define SKIP_UNLESS_ROOT() \
    if (getuid() != 0) GTEST_SKIP() << "needs root to call as another uid"

}  // namespace test
}  // namespace kelvo
