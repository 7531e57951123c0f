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

    // Runs body in a child of uid kAppUid; returns its exit status.
    int asApp(const std::function<int()>& body) {
        pid_t pid = fork();
        if (pid == 0) {
            if (setgid(kAppUid) != 0 || setuid(kAppUid) != 0) {
                _exit(100);
            }
            _exit(body());
        }
        return kelvo::test::waitChild(pid);
    }

    // The guarded service's answer to a caller of uid kAppUid: 1 allowed,
    // 0 refused, anything else a failure.
    int appAllowed(bool cached) {
        return asApp([cached] {
            sp<IBinder> guarded =
                android::defaultServiceManager()->checkService(String16("test.guarded"));
            if (guarded == nullptr) {
                return 10;
            }
            Parcel data;
            Parcel reply;
            data.writeBool(cached);
            if (guarded->transact(IBinder::FIRST_CALL_TRANSACTION, data, &reply) !=
                android::NO_ERROR) {
                return 11;
            }
            return reply.readBool() ? 1 : 0;
        });
    }

    // Permission checks the fake permission service was asked.
    int asked() { return mState->calls("permission", IBinder::FIRST_CALL_TRANSACTION); }

    kelvo::test::TempRoot mRoot;
    std::shared_ptr<kelvo::PlatformState> mState = std::make_shared<kelvo::PlatformState>();
};

TEST_F(BinderCredentialsTest, CallerIdentityIsTheKernelsNotTheCallersWord) {
    if (getuid() != 0) {
        GTEST_SKIP() << "needs root to call as another uid";
    }
    // The child claims to be root in its data; the service sees its real uid.
    int status = asApp([] {
        sp<IBinder> who = android::defaultServiceManager()->checkService(String16("test.who"));
        if (who == nullptr) {
            return 10;
        }
        Parcel data;
        Parcel reply;
        data.writeInt32(0);
        data.writeInt32(0);
        if (who->transact(kelvo::test::kWhoCalls, data, &reply) != android::NO_ERROR) {
            return 11;
        }
        int32_t pid = reply.readInt32();
        int32_t uid = reply.readInt32();
        if (pid != getpid()) {
            return 12;
        }
        return uid == static_cast<int32_t>(kAppUid) ? 0 : 13;
    });
    EXPECT_EQ(0, status);
}

TEST_F(BinderCredentialsTest, PermissionIsAskedOfThePermissionServiceAndCached) {
    if (getuid() != 0) {
        GTEST_SKIP() << "needs root to call as another uid";
    }
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
