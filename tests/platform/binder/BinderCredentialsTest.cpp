// Who calls: the uid and pid the kernel gives for the connection, and the
// permission checks built on them. The other uid comes from a child that
// changes its uid, which needs root.

#include <binder/PermissionCache.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <memory>

#include "FakePermissionService.h"
#include "PlatformState.h"
#include "common/TestEnv.h"
#include "platform/binder/BinderTestUtil.h"

using android::IBinder;
using android::Parcel;
using android::sp;
using android::String16;

namespace {

constexpr uid_t kAppUid = 10123;
const char kDump[] = "android.permission.DUMP";

// Answers kEcho only to callers holding the permission (checked through
// the cache when cached is set).
class GuardedService : public android::BBinder {
protected:
    android::status_t onTransact(uint32_t code, const Parcel& data, Parcel* reply,
                                 uint32_t flags) override {
        bool cached = data.readBool();
        bool allowed = cached ? android::PermissionCache::checkCallingPermission(String16(kDump))
                              : android::checkCallingPermission(String16(kDump));
        reply->writeBool(allowed);
        return android::NO_ERROR;
    }
};

class BinderCredentialsTest : public ::testing::Test {
protected:
    void SetUp() override {
        // A child of another uid must reach the sockets below the root.
        chmod(mRoot.path().c_str(), 0755);
        android::PermissionCache::purge();
        auto sm = android::defaultServiceManager();
        ASSERT_EQ(android::NO_ERROR, sm->addService(String16("permission"),
                                                    new kelvo::FakePermissionService(mState)));
        ASSERT_EQ(android::NO_ERROR, sm->addService(String16("test.guarded"), new GuardedService()));
        ASSERT_EQ(android::NO_ERROR,
                  sm->addService(String16("test.who"), new kelvo::test::TestService()));
    }
    void TearDown() override {
        for (const char* name : {"permission", "test.guarded", "test.who"}) {
            kelvo::ServiceControl::stopService(String16(name));
        }
        android::PermissionCache::purge();
    }

    // Calls a service from a child of uid kAppUid that claims uid 0 in its
    // data; returns what judge makes of the reply (10: the call failed).
    int callAsApp(const char* name, uint32_t code, bool flag, int (*judge)(const Parcel&)) {
        pid_t pid = fork();
        if (pid == 0) {
            if (setgid(kAppUid) != 0 || setuid(kAppUid) != 0) {
                _exit(100);
            }
            sp<IBinder> service = android::defaultServiceManager()->checkService(String16(name));
            Parcel data;
            Parcel reply;
            data.writeBool(flag);
            data.writeInt32(0);
            bool called = service != nullptr && service->transact(code, data, &reply) == 0;
            _exit(called ? judge(reply) : 10);
        }
        return kelvo::test::waitChild(pid);
    }

    // The guarded service's answer to a caller of uid kAppUid: 1 allowed,
    // 0 refused, anything else a failure.
    int appAllowed(bool cached) {
        return callAsApp("test.guarded", IBinder::FIRST_CALL_TRANSACTION, cached,
                         [](const Parcel& reply) { return reply.readBool() ? 1 : 0; });
    }

    // Permission checks the fake permission service was asked.
    int asked() { return mState->calls("permission", IBinder::FIRST_CALL_TRANSACTION); }

    kelvo::test::TempRoot mRoot;
    std::shared_ptr<kelvo::PlatformState> mState = std::make_shared<kelvo::PlatformState>();
};

TEST_F(BinderCredentialsTest, TheKernelsCallerIdentityIsCheckedWithThePermissionService) {
    if (getuid() != 0) {
        GTEST_SKIP() << "needs root to call as another uid";
    }
    // The service sees the child's real pid and uid, not the uid 0 it claims.
    EXPECT_EQ(0, callAsApp("test.who", kelvo::test::kWhoCalls, false, [](const Parcel& reply) {
        int32_t pid = reply.readInt32();
        return pid == getpid() && reply.readInt32() == static_cast<int32_t>(kAppUid) ? 0 : 13;
    }));
    // Permissions are asked of the permission service, and cached.
    EXPECT_EQ(0, appAllowed(false));
    EXPECT_EQ(1, asked());
    mState->grant(kDump, kAppUid, true);
    EXPECT_EQ(1, appAllowed(false));
    // Another permission, or another uid, is not granted by it.
    EXPECT_FALSE(android::checkPermission(String16("android.permission.OTHER"), 1, kAppUid));
    EXPECT_FALSE(android::checkPermission(String16(kDump), 1, kAppUid + 1));
    // Root and this very process never need asking.
    int before = asked();
    EXPECT_TRUE(android::checkPermission(String16(kDump), 1, 0));
    EXPECT_TRUE(android::checkPermission(String16(kDump), getpid(), kAppUid + 1));
    EXPECT_EQ(before, asked());

    // The cache asks again after a refusal, and remembers a grant even once
    // revoked, until it is purged.
    mState->grant(kDump, kAppUid, false);
    EXPECT_EQ(0, appAllowed(true));
    EXPECT_EQ(before + 1, asked());
    mState->grant(kDump, kAppUid, true);
    EXPECT_EQ(1, appAllowed(true));
    mState->grant(kDump, kAppUid, false);
    EXPECT_EQ(1, appAllowed(true));
    EXPECT_EQ(before + 2, asked());
    android::PermissionCache::purge();
    EXPECT_EQ(0, appAllowed(true));
}

TEST_F(BinderCredentialsTest, NoPermissionServiceMeansNo) {
    kelvo::ServiceControl::stopService(String16("permission"));
    EXPECT_FALSE(android::checkPermission(String16(kDump), 1, kAppUid));
    EXPECT_FALSE(android::PermissionCache::checkPermission(String16(kDump), 1, kAppUid));
    EXPECT_TRUE(android::PermissionCache::checkPermission(String16(kDump), 1, 0));
}

} // namespace
