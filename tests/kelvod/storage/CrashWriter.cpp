// Inserts rows through the storage thread without end, flushing after every
// batch, and reports each committed total on standard output as
// "committed <rows>". The crash-safety test kills it with SIGKILL at a random
// moment and then checks the database it leaves behind.
//   kelvo_crash_writer <root directory>

#include <cstdio>

#include "kelvo/RootPath.h"
#include "storage/KelvoStorage.h"

using android::Parcel;
using android::String8;

namespace {

const kelvo::column_attribute kColumns[] = {
        {kelvo::COLUMN_TIME, "timestamp"}, {kelvo::COLUMN_LONG, "seq"},
        {kelvo::COLUMN_TEXT, "name"},      {kelvo::COLUMN_INT, "uid"},
        {kelvo::COLUMN_LONG, "energy"},    {kelvo::COLUMN_LONG, "duration"},
        {kelvo::COLUMN_INT, "state"},      {kelvo::COLUMN_TEXT, "detail"},
};
const kelvo::table_attribute kTable = {"1.0", 1, 8, kColumns, "raw_crash_test"};

constexpr int kRowsPerRequest = 20;
constexpr int kRequestsPerFlush = 25;

} // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        fprintf(stderr, "usage: %s <root directory>\n", argv[0]);
        return 2;
    }
    kelvo::RootPath::setRoot(argv[1]);
    android::sp<kelvo::KelvoStorage> storage = new kelvo::KelvoStorage(nullptr);
    storage->addSchema(kTable);
    if (storage->startConnection() != 0) {
        fprintf(stderr, "start failed\n");
        return 1;
    }
    int64_t seq = 0;
    for (;;) {
        for (int r = 0; r < kRequestsPerFlush; ++r) {
            Parcel p;
            p.writeString8(String8(kTable.name));
            p.writeInt32(kTable.count);
            for (int c = 0; c < kTable.count; ++c) {
                p.writeString8(String8(kColumns[c].name));
                p.writeInt32(kColumns[c].type);
            }
            p.writeInt32(kRowsPerRequest);
            for (int i = 0; i < kRowsPerRequest; ++i, ++seq) {
                p.writeInt64(1700000000000LL + seq);
                p.writeInt64(seq);
                p.writeString8(String8("com.example.application"));
                p.writeInt32(10000 + static_cast<int32_t>(seq % 50));
                p.writeInt64(seq * 3);
                p.writeInt64(seq * 7);
                p.writeInt32(static_cast<int32_t>(seq % 2));
                p.writeString8(String8("crash safety row"));
            }
            storage->insertEntries(p);
        }
        if (storage->flushAllEntries() != 0) {
            fprintf(stderr, "flush failed\n");
            return 1;
        }
        printf("committed %lld\n", static_cast<long long>(seq));
        fflush(stdout);
    }
}
