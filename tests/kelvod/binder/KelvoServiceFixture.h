#pragma once

// The process-wide agent's storage on a fresh root, with "KelvoService"
// published and a permission service. Callers of another uid are forked
// children (root only).

#include <binder/IServiceManager.h>
#include <binder/PermissionCache.h>
#include <binder/ServiceControl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
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

    // What body returns, run in a child of the uid ("" when it failed).
    static std::string asUid(uid_t uid, const std::function<std::string()>& body) {
        int fds[2];
        if (pipe(fds) != 0) return "";
        pid_t pid = fork();
        if (pid == 0) {
            close(fds[0]);
            alarm(30);
            if (setgid(uid) != 0 || setuid(uid) != 0) _exit(100);
            std::string out = body();
            ssize_t ignored = write(fds[1], out.data(), out.size());
            (void)ignored;
            _exit(0);
        }
        close(fds[1]);
        std::string out;
        char buf[4096];
        for (ssize_t n; (n = read(fds[0], buf, sizeof(buf))) > 0;) out.append(buf, n);
        close(fds[0]);
        waitpid(pid, nullptr, 0);
        return out;
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

// Calls as another uid run in a child forked from this multi-threaded
// process, which can inherit a lock another thread held at the fork; the
// sanitizer runtimes make that likely, so those calls run in the plain
// build only.
#ifdef KELVO_SANITIZED
#define SKIP_UNLESS_ROOT() GTEST_SKIP() << "calls as another uid fork a multi-threaded process"
#else
#define SKIP_UNLESS_ROOT() \
    if (getuid() != 0) GTEST_SKIP() << "needs root to call as another uid"
#endif

}  // namespace test
}  // namespace kelvo
