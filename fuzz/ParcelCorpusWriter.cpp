// Writes the seed parcels of fuzz_parcel_read, each a well-formed parcel as
// the daemon's threads exchange them, into the folder given as argument.
//
//   parcel_corpus_writer fuzz/corpus/parcel_read

#include <binder/Parcel.h>

#include <cstdio>
#include <string>

using android::Parcel;
using android::String16;
using android::String8;

namespace {

bool save(const std::string& dir, const char* name, const Parcel& p) {
    std::string path = dir + "/" + name;
    FILE* f = fopen(path.c_str(), "wb");
    if (f == nullptr) {
        perror(path.c_str());
        return false;
    }
    bool ok = fwrite(p.data(), 1, p.dataSize(), f) == p.dataSize();
    return fclose(f) == 0 && ok;
}

} // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        fprintf(stderr, "usage: %s <corpus folder>\n", argv[0]);
        return 2;
    }
    std::string dir = argv[1];
    bool ok = true;

    Parcel numbers;
    numbers.writeInt32(-7);
    numbers.writeUint32(0x80000000u);
    numbers.writeInt64(1234567890123LL);
    numbers.writeUint64(UINT64_MAX);
    numbers.writeFloat(0.25f);
    numbers.writeDouble(-1e300);
    numbers.writeBool(true);
    ok = save(dir, "numbers", numbers) && ok;

    Parcel strings;
    strings.writeString8(String8("battery_level"));
    strings.writeString16(String16(u"com.example.app"));
    strings.writeString16(nullptr, 0);
    strings.writeString16(String16());
    strings.writeCString("cpu0");
    strings.writeString8(String8());
    ok = save(dir, "strings", strings) && ok;

    // A log record: time, text.
    Parcel logRecord;
    logRecord.writeInt64(1700000000000LL);
    logRecord.writeCString("screen on, brightness 128");
    ok = save(dir, "log_record", logRecord) && ok;

    // A storage entry: kind, count, then name/value pairs and a raw block.
    Parcel entry;
    entry.writeInt32(3);
    entry.writeInt32(2);
    entry.writeString8(String8("wifi_tx_bytes"));
    entry.writeInt64(4096);
    entry.writeString8(String8("wifi_rx_bytes"));
    entry.writeInt64(65536);
    const uint8_t raw[] = {1, 2, 3, 4, 5, 6, 7};
    entry.write(raw, sizeof(raw));
    ok = save(dir, "storage_entry", entry) && ok;

    Parcel wide;
    wide.writeString16(String16(u"\u00e9t\u00e9 \u4e2d\u6587 \U0001f50b"));
    wide.writeInt32(42);
    ok = save(dir, "wide_string", wide) && ok;

    return ok ? 0 : 1;
}
