// Drives the CPU accounter with untrusted action parcels through the
// library's entry. The input is a list of actions, each one byte choosing the
// action code, a 16-bit little-endian length and that many bytes of fields
// (after the accounter type and the action code). The accounter starts anew
// for every input with a two-cluster profile. Besides the sanitizers, every
// result is 0 or -1 and every component record covers a forward interval
// with usage and energy that are not negative.

#include <android/log.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>

#include <string>

#include <binder/Parcel.h>

#include "AccounterTypes.h"
#include "KelvoLibEntry.h"
#include "LibraryListener.h"
#include "core/KelvoLibAgent.h"
#include "kelvo/RootPath.h"
#include "utils/XmlParser.h"

using android::Parcel;

namespace {

constexpr size_t kMaxFields = 4096;

constexpr const char* kProfile = R"(<config><element id="0"><component id="3">
<parameter id="0"><value>16</value><value>21</value><value>27</value></parameter>
<parameter id="1"><value>58</value><value>74</value><value>93</value><value>115</value></parameter>
<parameter id="100"><value>4</value></parameter>
</component></element></config>
)";

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

void quietLogger(const struct __android_logger_data*, const char*) {}

class CheckingListener : public kelvo::LibraryListener {
public:
    int32_t handleLibraryEvent(int32_t event, const Parcel& reply) override {
        check(reply.dataPosition() == 0);
        if (event == kelvo::LIBRARY_EVENT_COMPONENT) {
            int64_t start = reply.readInt64();
            int64_t end = reply.readInt64();
            reply.readInt32();
            reply.readInt64();
            int32_t usage = reply.readInt32();
            int64_t energy = reply.readInt64();
            check(start <= end && usage >= 0 && energy >= 0);
        }
        return 0;
    }
};

std::string gRoot;

void removeRoot() {
    if (gRoot.rfind("/tmp/kelvo-fuzz-cpu-", 0) == 0) {
        std::string cmd = "rm -rf '" + gRoot + "'";
        int ignored = system(cmd.c_str());
        (void)ignored;
    }
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    __android_log_set_logger(quietLogger);
    char root[] = "/tmp/kelvo-fuzz-cpu-XXXXXX";
    check(mkdtemp(root) != nullptr);
    gRoot = root;
    atexit(removeRoot);
    for (const char* dir : {"/data", "/data/misc", "/data/misc/kelvo"}) {
        mkdir((gRoot + dir).c_str(), 0775);
    }
    FILE* file = fopen((gRoot + "/data/misc/kelvo/tv_kelvo_config.xml").c_str(), "wb");
    check(file != nullptr);
    check(fwrite(kProfile, 1, strlen(kProfile), file) == strlen(kProfile));
    fclose(file);
    kelvo::RootPath::setRoot(gRoot.c_str());
    kelvo::XmlParser::resetInstance();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    check(kelvo::registerLibraryListener(kelvo::ACCOUNTER_CPU, new CheckingListener()) == 0);
    size_t pos = 0;
    while (size - pos >= 3) {
        int32_t code = data[pos] % 9; // 8: an unknown action
        size_t len = data[pos + 1] | (static_cast<size_t>(data[pos + 2]) << 8);
        pos += 3;
        len = len > size - pos ? size - pos : len;
        len = len > kMaxFields ? kMaxFields : len;
        Parcel action;
        action.writeInt32(kelvo::ACCOUNTER_CPU);
        action.writeInt32(code);
        action.write(data + pos, len);
        pos += len;
        int32_t result = kelvo::setDataAccounter(action);
        check(result == 0 || result == -1);
    }
    return 0;
}
