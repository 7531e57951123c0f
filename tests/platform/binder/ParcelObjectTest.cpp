#include <binder/Binder.h>
#include <binder/Parcel.h>
#include <binder/Status.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>
#include <vector>

#include "utils/ParcelMessage.h"

using android::BBinder;
using android::IBinder;
using android::Parcel;
using android::sp;
using android::String16;
using android::String8;

namespace {

bool isOpen(int fd) {
    return fcntl(fd, F_GETFD) != -1;
}

// Writes through the descriptor and reads the bytes back from the pipe.
std::string passThrough(int writeFd, int readFd, const char* text) {
    EXPECT_EQ(static_cast<ssize_t>(strlen(text)), write(writeFd, text, strlen(text)));
    char buf[64] = {};
    ssize_t n = read(readFd, buf, sizeof(buf) - 1);
    return n > 0 ? std::string(buf, static_cast<size_t>(n)) : std::string();
}

struct Pipe {
    Pipe() { EXPECT_EQ(0, pipe2(fds, O_CLOEXEC)); }
    ~Pipe() {
        close(fds[0]);
        close(fds[1]);
    }
    int in() const { return fds[0]; }
    int out() const { return fds[1]; }
    int fds[2];
};

} // namespace

TEST(ParcelObjectTest, BindersReadBackAndBytesAloneNeverMakeOne) {
    sp<IBinder> binder = new BBinder();
    Parcel p;
    p.writeInt32(7);
    ASSERT_EQ(android::NO_ERROR, p.writeStrongBinder(binder));
    ASSERT_EQ(android::NO_ERROR, p.writeStrongBinder(nullptr));
    p.writeInt32(8);
    EXPECT_EQ(1u, p.objectsCount());

    p.setDataPosition(0);
    EXPECT_EQ(7, p.readInt32());
    EXPECT_EQ(binder.get(), p.readStrongBinder().get());
    sp<IBinder> out = binder;
    EXPECT_EQ(android::UNEXPECTED_NULL, p.readStrongBinder(&out));
    EXPECT_EQ(nullptr, out);
    EXPECT_EQ(8, p.readInt32());

    // Where no object is, reading one fails and leaves the cursor alone.
    p.setDataPosition(0);
    EXPECT_EQ(android::BAD_TYPE, p.readStrongBinder(&out));
    EXPECT_EQ(0u, p.dataPosition());
    EXPECT_LT(p.readFileDescriptor(), 0);
    EXPECT_EQ(0u, p.dataPosition());

    // The same bytes copied as plain data carry no object.
    Parcel forged;
    ASSERT_EQ(android::NO_ERROR, forged.setData(p.data(), p.dataSize()));
    forged.setDataPosition(4);
    EXPECT_EQ(android::BAD_TYPE, forged.readNullableStrongBinder(&out));
    EXPECT_EQ(4u, forged.dataPosition());
    // A slot at the very end that is cut short.
    forged.setDataPosition(forged.dataSize() - 8);
    EXPECT_EQ(android::NOT_ENOUGH_DATA, forged.readNullableStrongBinder(&out));
}

TEST(ParcelObjectTest, DescriptorsAreOwnedCopies) {
    Pipe pipe;
    int parcelFd = -1;
    {
        Parcel p;
        ASSERT_EQ(android::NO_ERROR, p.writeFileDescriptor(pipe.out()));
        EXPECT_TRUE(p.hasFileDescriptors());
        p.setDataPosition(0);
        parcelFd = p.readFileDescriptor();
        ASSERT_GE(parcelFd, 0);
        EXPECT_NE(pipe.out(), parcelFd);
        EXPECT_EQ("abc", passThrough(parcelFd, pipe.in(), "abc"));

        android::base::unique_fd copy;
        p.setDataPosition(0);
        ASSERT_EQ(android::NO_ERROR, p.readUniqueFileDescriptor(&copy));
        EXPECT_NE(parcelFd, copy.get());
        EXPECT_EQ("de", passThrough(copy.get(), pipe.in(), "de"));
    }
    // The parcel closed its own copy, not the caller's descriptor.
    EXPECT_FALSE(isOpen(parcelFd));
    EXPECT_TRUE(isOpen(pipe.out()));

    // Taking ownership: the parcel closes it.
    int mine = dup(pipe.out());
    {
        Parcel p;
        ASSERT_EQ(android::NO_ERROR, p.writeFileDescriptor(mine, true));
    }
    EXPECT_FALSE(isOpen(mine));

    Parcel bad;
    EXPECT_EQ(android::BAD_VALUE, bad.writeFileDescriptor(-1));
    EXPECT_EQ(0u, bad.dataSize());
}

TEST(ParcelObjectTest, AppendFromAndMessagesCopyTheObjectsInsideTheRange) {
    Pipe pipe;
    sp<IBinder> binder = new BBinder();
    Parcel src;
    src.writeInt32(1);                    // 0..4
    src.writeStrongBinder(binder);        // 4..20
    src.writeFileDescriptor(pipe.out());  // 20..36
    src.writeInt32(2);                    // 36..40

    Parcel whole;
    ASSERT_EQ(android::NO_ERROR, whole.appendFrom(&src, 0, src.dataSize()));
    EXPECT_EQ(2u, whole.objectsCount());
    whole.setDataPosition(4);
    EXPECT_EQ(binder.get(), whole.readStrongBinder().get());
    int fd = whole.readFileDescriptor();
    ASSERT_GE(fd, 0);
    src.setDataPosition(20);
    EXPECT_NE(src.readFileDescriptor(), fd);
    EXPECT_EQ("x", passThrough(fd, pipe.in(), "x"));

    // Appended after other data, objects move with their bytes; a slot cut
    // by the range is left behind.
    Parcel part;
    part.writeInt64(0);
    ASSERT_EQ(android::NO_ERROR, part.appendFrom(&src, 4, 24));
    EXPECT_EQ(1u, part.objectsCount());
    part.setDataPosition(8);
    EXPECT_EQ(binder.get(), part.readStrongBinder().get());
    EXPECT_LT(part.readFileDescriptor(), 0);

    // A parcel appended to itself keeps both copies.
    Parcel self;
    self.writeStrongBinder(binder);
    ASSERT_EQ(android::NO_ERROR, self.appendFrom(&self, 0, self.dataSize()));
    EXPECT_EQ(2u, self.objectsCount());
    self.setDataPosition(0);
    EXPECT_EQ(binder.get(), self.readStrongBinder().get());
    EXPECT_EQ(binder.get(), self.readStrongBinder().get());

    // Messages between threads carry them too.
    kelvo::ParcelMessage message(kelvo::MESSAGE_CUSTOMIZED, 1, src);
    kelvo::ParcelMessage copy(message);
    copy.getParcel().setDataPosition(4);
    EXPECT_EQ(binder.get(), copy.getParcel().readStrongBinder().get());
    fd = copy.getParcel().readFileDescriptor();
    ASSERT_GE(fd, 0);
    EXPECT_EQ("m", passThrough(fd, pipe.in(), "m"));
}

TEST(ParcelObjectTest, OverwritingShrinkingAndFreeingDropObjects) {
    Pipe pipe;
    Parcel p;
    p.writeStrongBinder(new BBinder());
    p.writeFileDescriptor(pipe.out());
    p.setDataPosition(16);
    int fd = p.readFileDescriptor();
    ASSERT_GE(fd, 0);

    // Plain bytes over the binder's slot take it away.
    p.setDataPosition(0);
    p.writeInt32(0x4b424e44);
    EXPECT_EQ(1u, p.objectsCount());
    p.setDataPosition(0);
    EXPECT_EQ(nullptr, p.readStrongBinder().get());

    // Shrinking over the descriptor's slot closes it.
    ASSERT_EQ(android::NO_ERROR, p.setDataSize(20));
    EXPECT_EQ(0u, p.objectsCount());
    EXPECT_FALSE(isOpen(fd));

    p.setDataPosition(p.dataSize());
    p.writeFileDescriptor(pipe.out());
    p.setDataPosition(p.dataSize() - 16);
    fd = p.readFileDescriptor();
    ASSERT_GE(fd, 0);
    p.freeData();
    EXPECT_FALSE(isOpen(fd));
    EXPECT_EQ(0u, p.objectsCount());
}

TEST(ParcelObjectTest, InterfaceTokens) {
    Parcel p;
    ASSERT_EQ(android::NO_ERROR, p.writeInterfaceToken(String16("kelvo.ITest")));
    p.writeInt32(5);
    p.setDataPosition(0);
    EXPECT_TRUE(p.enforceInterface(String16("kelvo.ITest")));
    EXPECT_EQ(5, p.readInt32());
    for (const char* other : {"kelvo.ITes", "kelvo.ITest2", "", "kelvo.ITesT"}) {
        SCOPED_TRACE(other);
        p.setDataPosition(0);
        EXPECT_FALSE(p.enforceInterface(String16(other)));
    }
    // A bare string is not a token, nor is nothing.
    Parcel bare;
    bare.writeString16(String16("kelvo.ITest"));
    bare.setDataPosition(0);
    EXPECT_FALSE(bare.enforceInterface(String16("kelvo.ITest")));
    EXPECT_FALSE(Parcel().enforceInterface(String16("kelvo.ITest")));
}

TEST(ParcelObjectTest, ExceptionHeaders) {
    using android::binder::Status;
    Parcel none;
    none.writeNoException();
    none.writeInt32(3);
    none.setDataPosition(0);
    EXPECT_EQ(0, none.readExceptionCode());
    EXPECT_EQ(3, none.readInt32());

    // The message (and a service error) is read past with the code.
    Parcel thrown;
    Status::fromServiceSpecificError(42, String8("no such uid")).writeToParcel(&thrown);
    thrown.writeInt32(9);
    thrown.setDataPosition(0);
    EXPECT_EQ(Status::EX_SERVICE_SPECIFIC, thrown.readExceptionCode());
    EXPECT_EQ(9, thrown.readInt32());
    thrown.setDataPosition(0);
    Status status;
    ASSERT_EQ(android::NO_ERROR, status.readFromParcel(thrown));
    EXPECT_EQ(42, status.serviceSpecificErrorCode());
    EXPECT_EQ(std::string("no such uid"), status.exceptionMessage().string());

    // A reply header is skipped; one longer than the data is malformed.
    for (int32_t headerSize : {12, 1000}) {
        Parcel header;
        for (int32_t word : {static_cast<int32_t>(Status::EX_HAS_REPLY_HEADER), headerSize, -1,
                             -1, 77}) {
            header.writeInt32(word);
        }
        header.setDataPosition(0);
        EXPECT_EQ(headerSize == 12 ? 0 : Status::EX_BAD_PARCELABLE, header.readExceptionCode());
        if (headerSize == 12) {
            EXPECT_EQ(77, header.readInt32());
        }
    }

    // A transport failure is a status, never written.
    Parcel failed;
    EXPECT_EQ(android::DEAD_OBJECT,
              Status::fromStatusT(android::DEAD_OBJECT).writeToParcel(&failed));
    EXPECT_EQ(0u, failed.dataSize());
}
