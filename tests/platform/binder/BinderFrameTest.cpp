// Frames as any process could write them on a service's socket: what the
// wire format documents, and what a broken or hostile client sends instead.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>
#include <string>
#include <vector>

#include "common/TestEnv.h"
#include "platform/binder/BinderTestUtil.h"

using android::sp;
using android::String16;
using Bytes = std::vector<uint8_t>;

namespace {

constexpr uint32_t kMagic = 0x3146424b;

// Little-endian 32-bit words.
Bytes words(std::initializer_list<uint32_t> values) {
    Bytes b;
    for (uint32_t v : values) {
        for (int i = 0; i < 4; ++i) {
            b.push_back(static_cast<uint8_t>(v >> (8 * i)));
        }
    }
    return b;
}

Bytes header(uint16_t kind, uint32_t code, uint32_t flags, uint64_t target, uint32_t dataSize,
             uint32_t tableSize, uint32_t magic = kMagic) {
    // The kind takes the low half of its word, the high half is reserved.
    return words({magic, kind, code, flags, static_cast<uint32_t>(target),
                  static_cast<uint32_t>(target >> 32), dataSize, tableSize});
}

// A 32-bit field of a frame read from the server.
uint32_t field(const Bytes& frame, size_t offset) {
    uint32_t v = 0;
    memcpy(&v, frame.data() + offset, 4);
    return v;
}

// A transaction frame with the given data and table.
Bytes frame(const Bytes& data, const Bytes& table, uint32_t code = kelvo::test::kEcho,
            uint32_t flags = 0, uint64_t target = 0) {
    Bytes b = header(1, code, flags, target, static_cast<uint32_t>(data.size()),
                     static_cast<uint32_t>(table.size()));
    b.insert(b.end(), data.begin(), data.end());
    b.insert(b.end(), table.begin(), table.end());
    return b;
}

// The data of an echo request: int32 n, String16 "a".
Bytes echoData(int32_t n) {
    android::Parcel p;
    p.writeInt32(n);
    p.writeString16(String16("a"));
    return Bytes(p.data(), p.data() + p.dataSize());
}

class RawClient {
public:
    explicit RawClient(const std::string& path) {
        mFd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_un addr = {};
        addr.sun_family = AF_UNIX;
        snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path.c_str());
        mConnected = connect(mFd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0;
    }
    ~RawClient() { close(mFd); }

    // Reads n bytes within the time-out; fewer when the server closes.
    Bytes read(size_t n, int timeoutMs = 10000) {
        Bytes out;
        while (out.size() < n) {
            struct pollfd pfd = {mFd, POLLIN, 0};
            if (poll(&pfd, 1, timeoutMs) <= 0) {
                break;
            }
            uint8_t buf[256];
            ssize_t got = recv(mFd, buf, std::min(sizeof(buf), n - out.size()), 0);
            if (got <= 0) {
                mClosed = true;
                break;
            }
            out.insert(out.end(), buf, buf + got);
        }
        return out;
    }
    bool send(const Bytes& b, int fd = -1) {
        struct iovec iov = {const_cast<uint8_t*>(b.data()), b.size()};
        struct msghdr msg = {};
        msg.msg_iov = &iov;
        msg.msg_iovlen = 1;
        alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
        if (fd >= 0) {
            msg.msg_control = control;
            msg.msg_controllen = sizeof(control);
            struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
            c->cmsg_level = SOL_SOCKET;
            c->cmsg_type = SCM_RIGHTS;
            c->cmsg_len = CMSG_LEN(sizeof(int));
            memcpy(CMSG_DATA(c), &fd, sizeof(int));
        }
        return sendmsg(mFd, &msg, MSG_NOSIGNAL) == static_cast<ssize_t>(b.size());
    }
    // True when the server closes the connection within the time-out.
    bool closedByServer(int timeoutMs = 10000) {
        read(1, timeoutMs);
        return mClosed;
    }
    bool connected() const { return mConnected; }

private:
    int mFd = -1;
    bool mConnected = false;
    bool mClosed = false;
};

class BinderFrameTest : public ::testing::Test {
protected:
    void SetUp() override {
        ASSERT_EQ(android::NO_ERROR, android::defaultServiceManager()->addService(
                                         String16("test.frames"), new kelvo::test::TestService()));
        mPath = kelvo::ServiceControl::socketDir() + "/test.frames";
        mProxy = android::defaultServiceManager()->getService(String16("test.frames"));
        ASSERT_NE(nullptr, mProxy);
    }
    void TearDown() override { kelvo::ServiceControl::stopService(String16("test.frames")); }

    // Connects and reads the server's hello.
    std::unique_ptr<RawClient> open(Bytes* hello = nullptr) {
        auto client = std::make_unique<RawClient>(mPath);
        EXPECT_TRUE(client->connected());
        Bytes got = client->read(32);
        EXPECT_EQ(32u, got.size());
        if (hello != nullptr) {
            *hello = got;
        }
        return client;
    }

    kelvo::test::TempRoot mRoot;
    std::string mPath;
    sp<android::IBinder> mProxy;
};

TEST_F(BinderFrameTest, HandWrittenFramesFollowTheWireFormat) {
    Bytes hello;
    auto client = open(&hello);
    ASSERT_EQ(32u, hello.size());
    EXPECT_EQ(kMagic, field(hello, 0));
    EXPECT_EQ(3, hello[4]);  // kind: hello
    EXPECT_NE(0u, field(hello, 16) | field(hello, 20));  // the incarnation

    // Two requests on one connection, each answered with a reply frame.
    for (int32_t n : {10, 20}) {
        ASSERT_TRUE(client->send(frame(echoData(n), {})));
        Bytes reply = client->read(32);
        ASSERT_EQ(32u, reply.size());
        EXPECT_EQ(2, reply[4]);  // kind: reply
        EXPECT_EQ(android::NO_ERROR, static_cast<int32_t>(field(reply, 8)));  // status
        Bytes data = client->read(field(reply, 24));
        ASSERT_EQ(field(reply, 24), data.size());
        EXPECT_EQ(static_cast<uint32_t>(n + 1), field(data, 0));
    }

    // An object id that was never handed out is no object.
    ASSERT_TRUE(client->send(frame(echoData(1), {}, kelvo::test::kEcho, 0, 99)));
    Bytes reply = client->read(32);
    ASSERT_EQ(32u, reply.size());
    EXPECT_EQ(android::NAME_NOT_FOUND, static_cast<int32_t>(field(reply, 8)));
}

TEST_F(BinderFrameTest, MalformedFramesCloseOnlyTheirConnection) {
    Bytes slotData(16, 0);
    const uint32_t binderSlot = 0x4b424e44;
    memcpy(slotData.data(), &binderSlot, 4);
    auto binderEntry = [](uint32_t offset, const std::string& name, uint32_t nameLen) {
        // One entry: a binder at the offset, its two 64-bit ids, its name.
        Bytes t = words({1, offset, 1, 1, 0, 1, 0, nameLen});
        t.insert(t.end(), name.begin(), name.end());
        while (t.size() % 4 != 0) {
            t.push_back(0);
        }
        return t;
    };
    Bytes fdEntry = words({1, 0, 2});  // a descriptor, but none is sent
    Bytes countTooBig = words({1000000, 0});

    struct Case {
        const char* what;
        Bytes bytes;
    } cases[] = {
        {"bad magic", header(1, 1, 0, 0, 0, 0, 0x12345678)},
        {"unknown kind", header(9, 1, 0, 0, 0, 0)},
        {"a reply from a client", header(2, 0, 0, 0, 0, 0)},
        {"unknown flag", header(1, 1, 0x10, 0, 0, 0)},
        {"data beyond the bound", header(1, 1, 0, 0, 0x7fffffff, 0)},
        {"table beyond the bound", header(1, 1, 0, 0, 0, 0x10000000)},
        {"table shorter than its count", frame(slotData, countTooBig)},
        {"object past the data", frame(slotData, binderEntry(8, "x", 1))},
        {"name with a slash", frame(slotData, binderEntry(0, "../a", 4))},
        {"name longer than its bytes", frame(slotData, binderEntry(0, "abcd", 200))},
        {"descriptor entry without a descriptor", frame(slotData, fdEntry)},
        {"object over plain data", frame(Bytes(16, 0), binderEntry(0, "x", 1))},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        auto client = open();
        ASSERT_TRUE(client->send(c.bytes));
        EXPECT_TRUE(client->closedByServer());
        // The service goes on for everybody else.
        int32_t answer = 0;
        EXPECT_EQ(android::NO_ERROR, kelvo::test::echo(mProxy, 1, &answer));
        EXPECT_EQ(2, answer);
    }

    // A descriptor that comes without an entry for it is not kept either.
    int pipeFds[2];
    ASSERT_EQ(0, pipe2(pipeFds, O_CLOEXEC));
    {
        auto client = open();
        ASSERT_TRUE(client->send(frame(echoData(1), {}), pipeFds[1]));
        EXPECT_TRUE(client->closedByServer());
    }
    close(pipeFds[1]);
    // Every write end is closed: the read end sees the end of the pipe.
    char byte;
    EXPECT_EQ(0, read(pipeFds[0], &byte, 1));
    close(pipeFds[0]);
}

TEST_F(BinderFrameTest, StalledFrameIsDroppedAfterTheFrameTimeOut) {
    auto client = open();
    Bytes half = frame(echoData(1), {});
    half.resize(20);
    ASSERT_TRUE(client->send(half));
    // Meanwhile others are served.
    EXPECT_EQ(android::NO_ERROR, kelvo::test::echo(mProxy, 1));
    EXPECT_TRUE(client->closedByServer(30000));
    EXPECT_EQ(android::NO_ERROR, kelvo::test::echo(mProxy, 2));
}

} // namespace
