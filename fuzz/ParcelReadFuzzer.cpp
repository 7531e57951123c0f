// Reads an untrusted parcel every way the daemon can. The input is the
// parcel; the same bytes, taken from the other end, choose the reads, cursor
// jumps and self-appends. Besides the sanitizers, every step checks that the
// cursor and the pointers handed out stay within the parcel.

#include <fuzzer/FuzzedDataProvider.h>

#include <binder/Parcel.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>

using android::NO_ERROR;
using android::Parcel;
using android::status_t;

namespace {

// Largest parcel the self-appends may build.
constexpr size_t kMaxGrownSize = 1 << 14;
constexpr int kMaxSteps = 512;

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

volatile uint32_t gSink;

// Touches every byte so that the sanitizers see a bad pointer or length.
void consume(const void* data, size_t len) {
    uint32_t sum = 0;
    const uint8_t* bytes = static_cast<const uint8_t*>(data);
    for (size_t i = 0; i < len; ++i) {
        sum = sum * 31 + bytes[i];
    }
    gSink = gSink + sum;
}

bool within(const Parcel& p, const void* ptr, size_t len) {
    const uint8_t* at = static_cast<const uint8_t*>(ptr);
    return at >= p.data() && len <= p.dataSize() &&
           static_cast<size_t>(at - p.data()) <= p.dataSize() - len;
}

// A read that fails leaves the cursor where it was; one that succeeds moves
// it forward and no further than the end.
void checkMove(const Parcel& p, size_t before, bool ok) {
    if (ok) {
        check(p.dataPosition() > before || before == p.dataPosition());
        check(p.dataPosition() <= p.dataSize());
    } else {
        check(p.dataPosition() == before);
    }
    size_t pos = p.dataPosition();
    check(p.dataAvail() == (pos < p.dataSize() ? p.dataSize() - pos : 0));
}

template <typename T>
void readValue(const Parcel& p, status_t (Parcel::*statusRead)(T*) const,
               T (Parcel::*valueRead)() const) {
    size_t before = p.dataPosition();
    T value{};
    status_t err = (p.*statusRead)(&value);
    checkMove(p, before, err == NO_ERROR);
    check(err != NO_ERROR || p.dataPosition() == before + sizeof(T));
    p.setDataPosition(before);
    T again = (p.*valueRead)();
    check(err == NO_ERROR ? memcmp(&again, &value, sizeof(T)) == 0 : again == T{});
}

void step(Parcel* parcel, FuzzedDataProvider* in) {
    const Parcel& p = *parcel;
    size_t before = p.dataPosition();
    switch (in->ConsumeIntegralInRange<int>(0, 16)) {
        case 0:
            readValue<int32_t>(p, &Parcel::readInt32, &Parcel::readInt32);
            break;
        case 1:
            readValue<uint32_t>(p, &Parcel::readUint32, &Parcel::readUint32);
            break;
        case 2:
            readValue<int64_t>(p, &Parcel::readInt64, &Parcel::readInt64);
            break;
        case 3:
            readValue<uint64_t>(p, &Parcel::readUint64, &Parcel::readUint64);
            break;
        case 4: {
            float f = 0;
            checkMove(p, before, p.readFloat(&f) == NO_ERROR);
            double d = 0;
            before = p.dataPosition();
            checkMove(p, before, p.readDouble(&d) == NO_ERROR);
            p.readFloat();
            p.readDouble();
            break;
        }
        case 5: {
            bool b = false;
            checkMove(p, before, p.readBool(&b) == NO_ERROR);
            p.readBool();
            break;
        }
        case 6: {
            const char* str = p.readCString();
            checkMove(p, before, str != nullptr);
            if (str != nullptr) {
                size_t len = strlen(str);
                check(within(p, str, len + 1));
                consume(str, len);
            }
            break;
        }
        case 7: {
            android::String8 s;
            status_t err = p.readString8(&s);
            checkMove(p, before, err == NO_ERROR);
            if (err == NO_ERROR) {
                check(s.size() < p.dataSize());
                consume(s.string(), s.size());
            }
            p.setDataPosition(before);
            android::String8 again = p.readString8();
            check(again.size() == s.size() || err != NO_ERROR);
            break;
        }
        case 8: {
            android::String16 s;
            status_t err = p.readString16(&s);
            // A null string moves past its length and reports UNEXPECTED_NULL.
            checkMove(p, before, err == NO_ERROR || err == android::UNEXPECTED_NULL);
            check(err == NO_ERROR || s.size() == 0);
            consume(s.string(), s.size() * sizeof(char16_t));
            p.setDataPosition(before);
            p.readString16();
            break;
        }
        case 9: {
            size_t len = 12345;
            const char16_t* units = p.readString16Inplace(&len);
            checkMove(p, before, units != nullptr || p.dataPosition() != before);
            if (units != nullptr) {
                check(within(p, units, (len + 1) * sizeof(char16_t)));
                consume(units, len * sizeof(char16_t));
            } else {
                check(len == 0);
            }
            break;
        }
        case 10: {
            size_t len = in->ConsumeBool() ? in->ConsumeIntegralInRange<size_t>(0, 64)
                                           : in->ConsumeIntegral<size_t>();
            const void* block = p.readInplace(len);
            checkMove(p, before, block != nullptr);
            if (block != nullptr) {
                check(within(p, block, len));
                consume(block, len);
            }
            break;
        }
        case 11: {
            uint8_t buf[64];
            size_t len = in->ConsumeIntegralInRange<size_t>(0, sizeof(buf));
            status_t err = p.read(buf, len);
            checkMove(p, before, err == NO_ERROR);
            if (err == NO_ERROR) {
                consume(buf, len);
            }
            break;
        }
        case 12: {
            // A jump anywhere near the data, or far beyond it.
            size_t pos = in->ConsumeBool() ? in->ConsumeIntegralInRange<size_t>(0, p.dataSize() + 8)
                                           : in->ConsumeIntegral<size_t>();
            p.setDataPosition(pos);
            checkMove(p, p.dataPosition(), false);
            break;
        }
        case 13: {
            // Appends a slice of itself at the cursor.
            if (p.dataPosition() > p.dataSize() || p.dataSize() > kMaxGrownSize) {
                break;
            }
            size_t start = in->ConsumeIntegralInRange<size_t>(0, p.dataSize() + 4);
            size_t len = in->ConsumeIntegralInRange<size_t>(0, p.dataSize() + 4);
            size_t oldSize = p.dataSize();
            status_t err = parcel->appendFrom(parcel, start, len);
            bool valid = len == 0 || (start <= oldSize && len <= oldSize - start);
            check((err == NO_ERROR) == valid);
            check(p.dataSize() >= oldSize);
            check(p.dataPosition() == (err == NO_ERROR ? before + len : before));
            break;
        }
        case 14: {
            // Rewind and drain the tail.
            p.setDataPosition(0);
            size_t avail = p.dataAvail();
            const void* all = p.readInplace(avail);
            check(all != nullptr || avail % 4 != 0);
            break;
        }
        case 15: {
            // A copy through appendFrom reads the same.
            Parcel copy;
            check(copy.appendFrom(&p, 0, p.dataSize()) == NO_ERROR);
            check(copy.dataSize() == p.dataSize());
            check(p.dataSize() == 0 || memcmp(copy.data(), p.data(), p.dataSize()) == 0);
            copy.setDataPosition(before);
            check(copy.readString8().size() == p.readString8().size());
            break;
        }
        default: {
            size_t len = 0;
            const char16_t* units = p.readString16Inplace(&len);
            if (units != nullptr) {
                consume(units, len * sizeof(char16_t));
            }
            p.readCString();
            p.readInt32();
            break;
        }
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Parcel parcel;
    if (parcel.setData(data, size) != NO_ERROR) {
        return 0;
    }
    FuzzedDataProvider in(data, size);
    for (int i = 0; i < kMaxSteps && in.remaining_bytes() > 0; ++i) {
        step(&parcel, &in);
    }
    return 0;
}
