#include <binder/Binder.h>
#include <binder/Parcel.h>
#include <binder/Status.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cmath>
#include <cstdint>
#include <cstring>
#include <limits>
#include <string>
#include <vector>

#include "utils/ParcelMessage.h"

using android::BBinder;
using android::IBinder;
using android::Parcel;
using android::sp;
using android::String16;
using android::String8;
using Bytes = std::vector<uint8_t>;

namespace {

Bytes bytesOf(const Parcel& p) {
    return Bytes(p.data(), p.data() + p.dataSize());
}

// A parcel holding exactly these bytes (capacity == size, so any read past
// the end leaves the heap block).
void load(Parcel* p, const Bytes& bytes) {
    ASSERT_EQ(android::NO_ERROR, p->setData(bytes.data(), bytes.size()));
    ASSERT_EQ(bytes.size(), p->dataSize());
    ASSERT_EQ(0u, p->dataPosition());
}

Bytes le32(uint32_t v) {
    return {static_cast<uint8_t>(v), static_cast<uint8_t>(v >> 8), static_cast<uint8_t>(v >> 16),
            static_cast<uint8_t>(v >> 24)};
}

Bytes cat(std::initializer_list<Bytes> parts) {
    Bytes out;
    for (const Bytes& part : parts) {
        out.insert(out.end(), part.begin(), part.end());
    }
    return out;
}

Bytes ascii(const char* s) {
    return Bytes(s, s + strlen(s));
}

std::u16string toU16(const String16& s) {
    return std::u16string(s.string(), s.size());
}

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

TEST(ParcelLayoutTest, NumbersAreLittleEndianBoolIsAnInt32AndAllReadBack) {
    Parcel p;
    p.writeInt32(INT32_MIN + 0x01020304);
    p.writeUint32(0xfffffffeu);
    p.writeInt64(INT64_MIN + 0x0102030405060708LL);
    p.writeUint64(0xf0debc9a78563412ULL);
    p.writeBool(true);
    p.writeBool(false);
    p.writeFloat(-0.5f);
    p.writeDouble(std::numeric_limits<double>::quiet_NaN());
    Bytes expected = {
            0x04, 0x03, 0x02, 0x81,                         // int32
            0xfe, 0xff, 0xff, 0xff,                         // uint32
            0x08, 0x07, 0x06, 0x05, 0x04, 0x03, 0x02, 0x81, // int64
            0x12, 0x34, 0x56, 0x78, 0x9a, 0xbc, 0xde, 0xf0, // uint64
            0x01, 0x00, 0x00, 0x00,                         // true
            0x00, 0x00, 0x00, 0x00,                         // false
            0x00, 0x00, 0x00, 0xbf,                         // -0.5f
            0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0xf8, 0x7f, // NaN
    };
    EXPECT_EQ(expected, bytesOf(p));
    p.setDataPosition(0);
    EXPECT_EQ(INT32_MIN + 0x01020304, p.readInt32());
    EXPECT_EQ(0xfffffffeu, p.readUint32());
    EXPECT_EQ(INT64_MIN + 0x0102030405060708LL, p.readInt64());
    EXPECT_EQ(0xf0debc9a78563412ULL, p.readUint64());
    EXPECT_TRUE(p.readBool());
    EXPECT_FALSE(p.readBool());
    EXPECT_EQ(-0.5f, p.readFloat());
    EXPECT_TRUE(std::isnan(p.readDouble()));
    EXPECT_EQ(0u, p.dataAvail());
}

TEST(ParcelLayoutTest, StringsAreLengthPrefixedTerminatedAndPadded) {
    using Write = android::status_t (*)(Parcel*);
    struct Case {
        const char* what;
        Write write;
        Bytes wire;
    } cases[] = {
            {"String8 empty", [](Parcel* p) { return p->writeString8(String8("")); },
             {0, 0, 0, 0, 0, 0, 0, 0}},
            {"String8 abc", [](Parcel* p) { return p->writeString8(String8("abc")); },
             {3, 0, 0, 0, 'a', 'b', 'c', 0}},
            {"String8 abcd", [](Parcel* p) { return p->writeString8(String8("abcd")); },
             {4, 0, 0, 0, 'a', 'b', 'c', 'd', 0, 0, 0, 0}},
            {"String16 hi", [](Parcel* p) { return p->writeString16(String16(u"hi")); },
             {2, 0, 0, 0, 0x68, 0, 0x69, 0, 0, 0, 0, 0}},
            // One unit plus its NUL needs no padding; units beyond Latin-1
            // keep both bytes.
            {"String16 wide", [](Parcel* p) { return p->writeString16(String16(u"\u4e2d")); },
             {1, 0, 0, 0, 0x2d, 0x4e, 0, 0}},
            {"String16 empty", [](Parcel* p) { return p->writeString16(String16()); },
             {0, 0, 0, 0, 0, 0, 0, 0}},
            {"String16 null", [](Parcel* p) { return p->writeString16(nullptr, 0); },
             {0xff, 0xff, 0xff, 0xff}},
            {"CString empty", [](Parcel* p) { return p->writeCString(""); }, {0, 0, 0, 0}},
            {"CString abc", [](Parcel* p) { return p->writeCString("abc"); },
             {'a', 'b', 'c', 0}},
            {"CString abcd", [](Parcel* p) { return p->writeCString("abcd"); },
             {'a', 'b', 'c', 'd', 0, 0, 0, 0}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        Parcel p;
        ASSERT_EQ(android::NO_ERROR, c.write(&p));
        EXPECT_EQ(c.wire, bytesOf(p));
    }
    Parcel p;
    EXPECT_EQ(android::BAD_VALUE, p.writeCString(nullptr));
    EXPECT_EQ(0u, p.dataSize());
}

TEST(ParcelLayoutTest, RawBlockPaddingIsZeroedEvenOverOldBytes) {
    Parcel p;
    // Fill the buffer with ones, then rewrite from the start.
    for (int i = 0; i < 4; ++i) {
        p.writeInt32(-1);
    }
    p.setDataPosition(0);
    const uint8_t five[] = {1, 2, 3, 4, 5};
    ASSERT_EQ(android::NO_ERROR, p.write(five, sizeof(five)));
    void* block = p.writeInplace(1);
    ASSERT_NE(nullptr, block);
    memset(block, 9, 1);
    EXPECT_EQ((Bytes{1, 2, 3, 4, 5, 0, 0, 0, 9, 0, 0, 0, 0xff, 0xff, 0xff, 0xff}), bytesOf(p));
    // An empty block takes no room.
    p.setDataPosition(16);
    ASSERT_EQ(android::NO_ERROR, p.write(nullptr, 0));
    EXPECT_EQ(16u, p.dataSize());
    EXPECT_EQ(android::BAD_VALUE, p.write(nullptr, 4));
    EXPECT_EQ(16u, p.dataSize());
}

TEST(ParcelRoundTripTest, StringsAndBlocksReadBackInOrder) {
    const uint8_t raw[] = {0xde, 0xad, 0xbe, 0xef, 0x01, 0x02};
    Parcel p;
    p.writeCString("cpu0");
    p.writeString8(String8("a\0b", 3));
    p.writeString16(String16(u"gr\u00fc\u00dfe \U0001f600"));
    p.writeString16(String16());
    p.writeString16(nullptr, 0);
    p.write(raw, sizeof(raw));
    p.writeInt32(77);

    p.setDataPosition(0);
    EXPECT_STREQ("cpu0", p.readCString());
    String8 s8 = p.readString8();
    EXPECT_EQ(std::string("a\0b", 3), std::string(s8.string(), s8.size()));
    EXPECT_EQ(u"gr\u00fc\u00dfe \U0001f600", toU16(p.readString16()));
    size_t len = 99;
    ASSERT_NE(nullptr, p.readString16Inplace(&len));
    EXPECT_EQ(0u, len);
    // The null string reads as null, distinct from the empty one.
    String16 s16(u"old");
    EXPECT_EQ(android::UNEXPECTED_NULL, p.readString16(&s16));
    EXPECT_EQ(0u, s16.size());
    uint8_t back[sizeof(raw)] = {};
    EXPECT_EQ(android::NO_ERROR, p.read(back, sizeof(back)));
    EXPECT_EQ(0, memcmp(raw, back, sizeof(raw)));
    EXPECT_EQ(77, p.readInt32());
    EXPECT_EQ(0u, p.dataAvail());
}

TEST(ParcelReadPastEndTest, ShortReadsFailInPlace) {
    Parcel empty;
    Parcel tail;  // an int32, then three bytes
    load(&tail, {1, 0, 0, 0, 2, 0, 0});
    Parcel beyond;
    beyond.writeInt32(42);
    const struct {
        const char* what;
        const Parcel* parcel;
        size_t position;
    } places[] = {{"empty", &empty, 0},
                  {"three bytes left", &tail, 4},
                  {"beyond the end", &beyond, 1000},
                  {"far beyond the end", &beyond, SIZE_MAX}};
    for (const auto& place : places) {
        SCOPED_TRACE(place.what);
        const Parcel& p = *place.parcel;
        p.setDataPosition(place.position);
        size_t at = p.dataPosition();
        // Each read fails: zero, empty or an error, any output left alone.
        int32_t i32 = 11;
        uint64_t u64 = 14;
        double d = 16;
        bool b = true;
        String8 s8;
        uint8_t two[2] = {1, 2};
        size_t len = 3;
        EXPECT_EQ(android::NOT_ENOUGH_DATA, p.readInt32(&i32));
        EXPECT_EQ(android::NOT_ENOUGH_DATA, p.readUint64(&u64));
        EXPECT_EQ(android::NOT_ENOUGH_DATA, p.readDouble(&d));
        EXPECT_EQ(android::NOT_ENOUGH_DATA, p.readBool(&b));
        EXPECT_NE(android::NO_ERROR, p.readString8(&s8));
        EXPECT_EQ(android::NOT_ENOUGH_DATA, p.read(two, sizeof(two)));
        EXPECT_TRUE(i32 == 11 && u64 == 14 && d == 16 && b && two[0] == 1);
        EXPECT_EQ(0, p.readInt32() + p.readInt64() + p.readDouble() + p.readBool());
        EXPECT_EQ(0u, p.readString8().size() + p.readString16().size());
        EXPECT_EQ(nullptr, p.readString16Inplace(&len));
        EXPECT_EQ(0u, len);
        // A raw block needs its padding too.
        EXPECT_EQ(nullptr, p.readInplace(3));
        EXPECT_EQ(nullptr, p.readInplace(SIZE_MAX));
        EXPECT_EQ(at, p.dataPosition());
    }
    // Impossible lengths never wrap around the buffer's end.
    Parcel eight;
    load(&eight, ascii("abcdefgh"));
    for (size_t len : {static_cast<size_t>(9), static_cast<size_t>(INT32_MAX) + 1, SIZE_MAX}) {
        uint8_t out[16];
        EXPECT_EQ(nullptr, eight.readInplace(len));
        EXPECT_NE(android::NO_ERROR, eight.read(out, len));
    }
    EXPECT_EQ(android::BAD_VALUE, eight.read(nullptr, 4));
    EXPECT_EQ(0u, eight.dataPosition());
    // Far positions are held at the largest parcel size, never wrap; back
    // inside, reading works again.
    EXPECT_GT(beyond.dataPosition(), beyond.dataSize());
    EXPECT_EQ(0u, beyond.dataAvail());
    beyond.setDataPosition(0);
    EXPECT_EQ(42, beyond.readInt32());

    // A C string needs its terminator; one that ends the data unpadded is
    // accepted and the cursor stops at the end.
    EXPECT_EQ(nullptr, empty.readCString());
    Parcel open;
    load(&open, ascii("abcdefg"));
    EXPECT_EQ(nullptr, open.readCString());
    EXPECT_EQ(0u, open.dataPosition());
    load(&open, {'x', 'y', 0});
    EXPECT_STREQ("xy", open.readCString());
    EXPECT_EQ(3u, open.dataPosition());
}

TEST(ParcelMalformedTest, StringsWithBadLengthsAreRejected) {
    const Bytes hi = {0x68, 0, 0x69, 0};
    const Bytes nul = {0, 0, 0, 0};
    struct Case {
        const char* what;
        bool wide;
        Bytes wire;
    } cases[] = {
            {"String8 negative", false, cat({le32(0xfffffffeu), ascii("abcd")})},
            {"String8 largest", false, cat({le32(0x7fffffffu), ascii("abcd")})},
            {"String8 huge", false, cat({le32(0x7ffffffeu), ascii("abcd")})},
            {"String8 longer than data", false, cat({le32(8), ascii("abcdefg")})},
            {"String8 no room for NUL", false, cat({le32(4), ascii("abcd")})},
            {"String8 no NUL", false, cat({le32(3), ascii("abcd")})},
            {"String8 length only", false, le32(1)},
            {"String16 negative", true, cat({le32(0xfffffffeu), hi, nul})},
            {"String16 most negative", true, cat({le32(0x80000000u), hi, nul})},
            {"String16 largest", true, cat({le32(0x7fffffffu), hi, nul})},
            {"String16 half of largest", true, cat({le32(0x40000000u), hi, nul})},
            {"String16 longer than data", true, cat({le32(5), hi, nul})},
            {"String16 no room for NUL", true, cat({le32(2), hi})},
            {"String16 no NUL", true, cat({le32(2), hi, {0x21, 0, 0, 0}})},
            {"String16 length only", true, le32(0)},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        Parcel p;
        load(&p, c.wire);
        android::status_t status;
        String16 out16(u"untouched");
        String8 out8;
        status = c.wide ? p.readString16(&out16) : p.readString8(&out8);
        EXPECT_EQ(0u, c.wide ? out16.size() + p.readString16().size() : p.readString8().size());
        size_t len = 9;
        EXPECT_TRUE(!c.wide || (p.readString16Inplace(&len) == nullptr && len == 0));
        // A failure, and only -1 is the null string.
        EXPECT_NE(android::NO_ERROR, status);
        EXPECT_NE(android::UNEXPECTED_NULL, status);
        // The cursor stays at the length word.
        EXPECT_EQ(0u, p.dataPosition());
        EXPECT_EQ(Bytes(c.wire.begin(), c.wire.begin() + 4), le32(p.readUint32()));
    }
}

TEST(ParcelMalformedTest, StringsAtAnOddPositionReadCleanly) {
    // A cursor moved to an odd offset must still give the bytes that are
    // there, without relying on the buffer's alignment.
    Parcel p;
    load(&p, cat({{0x55}, le32(2), {0x68, 0, 0x69, 0, 0, 0, 0, 0}}));
    p.setDataPosition(1);
    EXPECT_EQ(u"hi", toU16(p.readString16()));
    EXPECT_EQ(13u, p.dataPosition());

    p.setDataPosition(1);
    size_t len = 0;
    const char16_t* units = p.readString16Inplace(&len);
    ASSERT_EQ(2u, len);
    EXPECT_EQ(0, memcmp(units, u"hi", 4));

    Parcel q;
    load(&q, cat({{0x55, 0x66, 0x77}, le32(0x05060708), le32(0x01020304), le32(0x0a0b0c0d),
                  le32(3), ascii("abc"), {0}}));
    q.setDataPosition(3);
    EXPECT_EQ(0x0102030405060708LL, q.readInt64());
    EXPECT_EQ(0x0a0b0c0du, q.readUint32());
    EXPECT_STREQ("abc", q.readString8().string());
    EXPECT_EQ(q.dataSize(), q.dataPosition());
}

TEST(ParcelBufferTest, AppendFromChecksTheRangeAndMayReadItself) {
    Parcel src;
    src.writeInt32(1);
    src.writeInt32(2);
    src.writeInt32(3);

    Parcel dst;
    dst.writeInt32(9);
    EXPECT_EQ(android::BAD_VALUE, dst.appendFrom(nullptr, 0, 4));
    for (auto range : {std::make_pair<size_t, size_t>(13, 1), {0, 13}, {8, 5}, {4, SIZE_MAX},
                       {SIZE_MAX, 2}}) {
        EXPECT_EQ(android::BAD_VALUE, dst.appendFrom(&src, range.first, range.second));
    }
    EXPECT_EQ(android::NO_ERROR, dst.appendFrom(&src, 12, 0));
    EXPECT_EQ(4u, dst.dataSize());

    // A valid range lands at the cursor; the source's cursor is left alone.
    src.setDataPosition(8);
    EXPECT_EQ(android::NO_ERROR, dst.appendFrom(&src, 4, 8));
    EXPECT_EQ(8u, src.dataPosition());
    EXPECT_EQ(12u, dst.dataPosition());
    EXPECT_EQ(cat({le32(9), le32(2), le32(3)}), bytesOf(dst));

    // In the middle it overwrites, past the end it extends.
    dst.setDataPosition(4);
    EXPECT_EQ(android::NO_ERROR, dst.appendFrom(&src, 0, 12));
    EXPECT_EQ(cat({le32(9), le32(1), le32(2), le32(3)}), bytesOf(dst));

    // From itself.
    Parcel p;
    load(&p, cat({le32(1), le32(2), le32(3)}));
    // The buffer is exactly full, so the append must grow it before copying.
    p.setDataPosition(p.dataSize());
    ASSERT_EQ(android::NO_ERROR, p.appendFrom(&p, 0, p.dataSize()));
    EXPECT_EQ(cat({le32(1), le32(2), le32(3), le32(1), le32(2), le32(3)}), bytesOf(p));

    // Overlapping source and destination.
    p.setDataPosition(4);
    ASSERT_EQ(android::NO_ERROR, p.appendFrom(&p, 0, 12));
    EXPECT_EQ(cat({le32(1), le32(1), le32(2), le32(3), le32(2), le32(3)}), bytesOf(p));
    p.setDataPosition(0);
    ASSERT_EQ(android::NO_ERROR, p.appendFrom(&p, 8, 16));
    EXPECT_EQ(cat({le32(2), le32(3), le32(2), le32(3), le32(2), le32(3)}), bytesOf(p));
    EXPECT_EQ(16u, p.dataPosition());
}

TEST(ParcelBufferTest, SetDataSizeGrowsWithZeroesAndShrinksTheCursor) {
    Parcel p;
    p.writeInt64(-1);
    p.writeInt64(-1);
    ASSERT_EQ(16u, p.dataPosition());

    ASSERT_EQ(android::NO_ERROR, p.setDataSize(6));
    EXPECT_EQ(6u, p.dataPosition());

    // Growing again, within the capacity and beyond it, never brings the
    // dropped bytes back.
    ASSERT_EQ(android::NO_ERROR, p.setDataSize(12));
    EXPECT_EQ((Bytes{0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0, 0, 0, 0, 0, 0}), bytesOf(p));
    ASSERT_EQ(android::NO_ERROR, p.setDataSize(2));
    Bytes expected(p.dataCapacity() + 100, 0);
    expected[0] = expected[1] = 0xff;
    ASSERT_EQ(android::NO_ERROR, p.setDataSize(expected.size()));
    EXPECT_EQ(expected, bytesOf(p));
    EXPECT_EQ(2u, p.dataPosition());

    // So does writing past the end after a shrink: the gap is zero.
    ASSERT_EQ(android::NO_ERROR, p.setDataSize(0));
    p.setDataPosition(8);
    p.writeInt32(7);
    EXPECT_EQ(cat({le32(0), le32(0), le32(7)}), bytesOf(p));

    EXPECT_EQ(android::BAD_VALUE, p.setDataSize(SIZE_MAX));
    EXPECT_EQ(12u, p.dataSize());
}

TEST(ParcelBufferTest, SetDataCopiesAndCapacityNeverCuts) {
    Parcel p;
    EXPECT_EQ(android::BAD_VALUE, p.setData(nullptr, 4));
    EXPECT_EQ(android::NO_ERROR, p.setData(nullptr, 0));
    EXPECT_EQ(0u, p.dataSize());

    Bytes in = cat({le32(5), le32(6), le32(7)});
    load(&p, in);
    in[0] = 0;
    EXPECT_EQ(5, p.readInt32());

    // Taking a slice of its own data.
    ASSERT_EQ(android::NO_ERROR, p.setData(p.data() + 4, 8));
    EXPECT_EQ(cat({le32(6), le32(7)}), bytesOf(p));
    EXPECT_EQ(0u, p.dataPosition());

    // A smaller capacity never cuts data; freeData empties it for reuse.
    ASSERT_EQ(android::NO_ERROR, p.setDataCapacity(4));
    EXPECT_EQ(cat({le32(6), le32(7)}), bytesOf(p));
    p.freeData();
    EXPECT_EQ(nullptr, p.data());
    EXPECT_EQ(0u, p.dataSize() + p.dataCapacity() + p.dataPosition() + p.dataAvail());
    EXPECT_EQ(0u, p.readString8().size());
    p.writeInt32(3);
    EXPECT_EQ(le32(3), bytesOf(p));
}

TEST(ParcelBufferTest, WritesFromItsOwnBytesSurviveGrowth) {
    // Strings read in place point into the parcel; writing them back to the
    // same parcel grows (and moves) the buffer under them.
    Parcel p;
    load(&p, cat({ascii("hello"), {0, 0, 0}, le32(2), {0x68, 0, 0x69, 0, 0, 0, 0, 0}}));
    const char* text = p.readCString();
    ASSERT_STREQ("hello", text);
    size_t len = 0;
    const char16_t* units = p.readString16Inplace(&len);
    ASSERT_NE(nullptr, units);
    ASSERT_EQ(p.dataSize(), p.dataPosition());
    ASSERT_EQ(p.dataSize(), p.dataCapacity());

    ASSERT_EQ(android::NO_ERROR, p.writeString16(units, len));
    // The earlier pointers are stale now; fetch the text again.
    p.setDataPosition(0);
    text = p.readCString();
    p.setDataPosition(p.dataSize());
    ASSERT_EQ(android::NO_ERROR, p.writeCString(text));
    p.setDataPosition(0);
    ASSERT_EQ(android::NO_ERROR, p.write(p.data(), 8));

    p.setDataPosition(0);
    EXPECT_STREQ("hello", p.readCString());
    EXPECT_EQ(u"hi", toU16(p.readString16()));
    EXPECT_EQ(u"hi", toU16(p.readString16()));
    EXPECT_STREQ("hello", p.readCString());
    EXPECT_EQ(0u, p.dataAvail());
}

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

TEST(ParcelObjectTest, DescriptorsAreOwnedCopiesClosedWithTheirSlot) {
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

    Parcel p;
    EXPECT_EQ(android::BAD_VALUE, p.writeFileDescriptor(-1));
    EXPECT_EQ(0u, p.dataSize());

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
    const int32_t kHeader = Status::EX_HAS_REPLY_HEADER;
    Parcel header;
    for (int32_t word : {kHeader, 12, -1, -1, 77, kHeader, 1000, -1}) {
        header.writeInt32(word);
    }
    header.setDataPosition(0);
    EXPECT_EQ(0, header.readExceptionCode());
    EXPECT_EQ(77, header.readInt32());
    EXPECT_EQ(Status::EX_BAD_PARCELABLE, header.readExceptionCode());

    // A transport failure is a status, never written.
    Parcel failed;
    EXPECT_EQ(android::DEAD_OBJECT,
              Status::fromStatusT(android::DEAD_OBJECT).writeToParcel(&failed));
    EXPECT_EQ(0u, failed.dataSize());
}
