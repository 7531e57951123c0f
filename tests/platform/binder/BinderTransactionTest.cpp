#include <binder/BpBinder.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include "common/TestEnv.h"
#include "platform/binder/BinderTestUtil.h"

using android::IBinder;
using android::Parcel;
using android::sp;
using android::String16;
using android::String8;
using kelvo::test::TestService;

namespace {

// A service of this process, reached through its socket like any other.
class BinderTransactionTest : public ::testing::Test {
protected:
    void SetUp() override {
        mService = new TestService();
        ASSERT_EQ(android::NO_ERROR,
                  android::defaultServiceManager()->addService(String16("test.echo"), mService));
        mProxy = android::defaultServiceManager()->getService(String16("test.echo"));
        ASSERT_NE(nullptr, mProxy);
    }
    void TearDown() override { kelvo::ServiceControl::stopService(String16("test.echo")); }

    kelvo::test::TempRoot mRoot;
    sp<TestService> mService;
    sp<IBinder> mProxy;
};

TEST_F(BinderTransactionTest, TwoWayCallsAnswerWithTheRemoteStatusAndReply) {
    // A proxy, even to a service of this very process.
    ASSERT_NE(nullptr, mProxy->remoteBinder());
    EXPECT_EQ(nullptr, mProxy->localBinder());
    EXPECT_TRUE(mProxy->isBinderAlive());

    Parcel data;
    Parcel reply;
    data.writeInt32(-7);
    data.writeString16(String16(u"h\u00e9llo"));
    ASSERT_EQ(android::NO_ERROR, mProxy->transact(kelvo::test::kEcho, data, &reply));
    EXPECT_EQ(-6, reply.readInt32());
    EXPECT_EQ(String16(u"h\u00e9llo"), reply.readString16());

    // The caller of an in-process call is this process, as outside a call.
    Parcel who;
    ASSERT_EQ(android::NO_ERROR, mProxy->transact(kelvo::test::kWhoCalls, data, &who));
    EXPECT_EQ(getpid(), who.readInt32());
    EXPECT_EQ(static_cast<int32_t>(getuid()), who.readInt32());
    EXPECT_EQ(getpid(), android::IPCThreadState::self()->getCallingPid());

    // The remote onTransact's status comes back as is.
    EXPECT_EQ(android::UNKNOWN_TRANSACTION, mProxy->transact(0x00777777, data, &reply));
    EXPECT_EQ(android::BAD_TYPE, mProxy->transact(kelvo::test::kWriteFd, data, &reply));

    // A large parcel crosses whole; one beyond the frame bound is refused
    // before it is sent, and the service goes on.
    std::vector<uint8_t> big(512 * 1024, 0x5a);
    Parcel large;
    large.writeInt32(1);
    large.writeString16(String16(std::string(1000, 'x').c_str()));
    large.write(big.data(), big.size());
    Parcel largeReply;
    ASSERT_EQ(android::NO_ERROR, mProxy->transact(kelvo::test::kEcho, large, &largeReply));
    EXPECT_EQ(2, largeReply.readInt32());
    EXPECT_EQ(1000u, largeReply.readString16().size());
    Parcel tooLarge;
    std::vector<uint8_t> huge(2 * 1024 * 1024, 1);
    tooLarge.write(huge.data(), huge.size());
    EXPECT_EQ(android::FAILED_TRANSACTION, mProxy->transact(kelvo::test::kEcho, tooLarge, &reply));
    int32_t answer = 0;
    EXPECT_EQ(android::NO_ERROR, kelvo::test::echo(mProxy, 9, &answer));
    EXPECT_EQ(10, answer);
}

TEST_F(BinderTransactionTest, BuiltInsAndDescriptors) {
    EXPECT_EQ(android::NO_ERROR, mProxy->pingBinder());
    EXPECT_EQ(String16(kelvo::test::kTestDescriptor), mProxy->getInterfaceDescriptor());
    // The descriptor names the interface of the token a client writes.
    Parcel token;
    token.writeInterfaceToken(mProxy->getInterfaceDescriptor());
    token.setDataPosition(0);
    EXPECT_TRUE(token.checkInterface(mService.get()));

    // A descriptor travels as a duplicate: the caller's may close before
    // the call.
    int pipeFds[2];
    ASSERT_EQ(0, pipe2(pipeFds, O_CLOEXEC));
    Parcel data;
    ASSERT_EQ(android::NO_ERROR, data.writeFileDescriptor(pipeFds[1]));
    data.writeString8(String8("through the socket"));
    close(pipeFds[1]);
    Parcel reply;
    ASSERT_EQ(android::NO_ERROR, mProxy->transact(kelvo::test::kWriteFd, data, &reply));
    data.freeData();
    char text[64] = {};
    EXPECT_EQ(18, read(pipeFds[0], text, sizeof(text) - 1));
    EXPECT_STREQ("through the socket", text);
    close(pipeFds[0]);

    // A dump request whose argument count outruns its data is refused.
    Parcel bad;
    bad.writeFileDescriptor(STDERR_FILENO);
    bad.writeInt32(1000);
    bad.writeString16(String16("one"));
    EXPECT_EQ(android::BAD_VALUE, mProxy->transact(IBinder::DUMP_TRANSACTION, bad, &reply));
}

TEST_F(BinderTransactionTest, ObjectsInParcelsKeepTheirIdentity) {
    // Our own objects come back as themselves.
    Parcel data;
    Parcel reply;
    ASSERT_EQ(android::NO_ERROR, mProxy->transact(kelvo::test::kSameObject, data, &reply));
    sp<IBinder> same = reply.readStrongBinder();
    EXPECT_EQ(mService.get(), same.get());

    Parcel newReply;
    ASSERT_EQ(android::NO_ERROR, mProxy->transact(kelvo::test::kNewObject, data, &newReply));
    sp<IBinder> fresh = newReply.readStrongBinder();
    ASSERT_NE(nullptr, fresh);
    ASSERT_NE(nullptr, fresh->localBinder());
    int32_t answer = 0;
    EXPECT_EQ(android::NO_ERROR, kelvo::test::echo(fresh, 1, &answer));
    EXPECT_EQ(2, answer);

    // A callback object handed to the service is called back during the
    // call; a proxy handed on reaches the same object.
    for (const sp<IBinder>& callee : {sp<IBinder>(new TestService()), mProxy}) {
        Parcel call;
        Parcel callReply;
        call.writeStrongBinder(callee);
        call.writeInt32(100);
        ASSERT_EQ(android::NO_ERROR, mProxy->transact(kelvo::test::kCallBack, call, &callReply));
        EXPECT_EQ(101, callReply.readInt32());
    }

    // A null binder is refused by a service that needs one.
    Parcel nullCall;
    nullCall.writeStrongBinder(nullptr);
    EXPECT_EQ(android::UNEXPECTED_NULL, mProxy->transact(kelvo::test::kCallBack, nullCall, &reply));
}

TEST_F(BinderTransactionTest, TwoWayCallsAreServedAtOnceOneWayCallsInOrderOneAtATime) {
    // Each call waits inside until three are inside: a pool that served one
    // at a time would never get there.
    constexpr int kCalls = 3;
    std::vector<std::thread> callers;
    std::atomic<int> reached{0};
    for (int i = 0; i < kCalls; ++i) {
        callers.emplace_back([this, &reached] {
            Parcel data;
            Parcel reply;
            data.writeInt32(kCalls);
            if (mProxy->transact(kelvo::test::kBlock, data, &reply) == android::NO_ERROR &&
                reply.readBool()) {
                reached++;
            }
        });
    }
    for (std::thread& t : callers) {
        t.join();
    }
    EXPECT_EQ(kCalls, reached.load());

    constexpr int kCount = 200;
    for (int i = 0; i < kCount; ++i) {
        Parcel data;
        data.writeInt32(i);
        ASSERT_EQ(android::NO_ERROR,
                  mProxy->transact(kelvo::test::kRecord, data, nullptr, IBinder::FLAG_ONEWAY));
    }
    ASSERT_TRUE(kelvo::test::waitFor([&] { return mService->records().size() >= kCount; },
                                     std::chrono::seconds(30)));
    std::vector<int32_t> records = mService->records();
    ASSERT_EQ(static_cast<size_t>(kCount), records.size());
    for (int i = 0; i < kCount; ++i) {
        ASSERT_EQ(i, records[i]);
    }
    EXPECT_EQ(1, mService->maxInside());
}

} // namespace
