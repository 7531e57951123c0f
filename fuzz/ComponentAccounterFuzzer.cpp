// Drives the component accounters (brightness, GNSS, flashlight, camera,
// Bluetooth, GPU, sensor, audio) with untrusted action parcels through the
// library's entry. The first byte chooses the accounter; the rest is a list
// of actions, each one byte choosing the action code, a 16-bit little-endian
// length and that many bytes of fields (after the accounter type and the
// action code). The accounters start anew for every input with a small
// profile. Besides the sanitizers, every result is 0 or -1 and every reply
// arrives rewound and holds at least its opening int32 and two times.

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

constexpr int32_t kTypes[] = {
        kelvo::ACCOUNTER_BRIGHTNESS, kelvo::ACCOUNTER_GNSS,      kelvo::ACCOUNTER_FLASHLIGHT,
        kelvo::ACCOUNTER_CAMERA,     kelvo::ACCOUNTER_BLUETOOTH, kelvo::ACCOUNTER_GPU,
        kelvo::ACCOUNTER_SENSOR,     kelvo::ACCOUNTER_AUDIO,
};

constexpr const char* kProfile = R"(<config><element id="0">
<component id="0"><parameter>90</parameter><parameter>800</parameter></component>
<component id="1"><parameter>35</parameter></component>
<component id="2"><parameter>180</parameter></component>
<component id="4"><parameter id="0"><value key="307200">180</value><value key="921600">230</value>
</parameter><parameter id="1"><value key="307200">150</value></parameter></component>
<component id="6"><parameter id="0"><value>12</value></parameter>
<parameter id="3"><value>8</value></parameter></component>
<component id="7"><parameter id="1"><value>2</value></parameter>
<parameter id="4"><value>60</value></parameter></component>
<component id="9"><parameter id="0"><value key="260">120</value><value key="480">210</value>
</parameter></component>
<component id="10"><parameter id="0"><value key="0">20</value><value key="0">1500</value>
<value key="1">1000</value></parameter><parameter id="1"><value key="0">6</value>
<value key="0">40</value><value key="1">1000</value></parameter></component>
</element><element id="2"><component id="0"><parameter>2</parameter></component></element>
</config>
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
        check(event == kelvo::LIBRARY_EVENT_APPLICATION || event == kelvo::LIBRARY_EVENT_COMPONENT);
        // Every record opens with an int32 and two int64 (the smart amplifier
        // reading with three int64).
        check(reply.dataSize() >= 20);
        return 0;
    }
};

std::string gRoot;

void removeRoot() {
    if (gRoot.rfind("/tmp/kelvo-fuzz-component-", 0) == 0) {
        std::string cmd = "rm -rf '" + gRoot + "'";
        int ignored = system(cmd.c_str());
        (void)ignored;
    }
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    __android_log_set_logger(quietLogger);
    char root[] = "/tmp/kelvo-fuzz-component-XXXXXX";
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
    if (size < 1) {
        return 0;
    }
    const int32_t type = kTypes[data[0] % (sizeof(kTypes) / sizeof(kTypes[0]))];
    kelvo::KelvoLibAgent::getInstance()->resetAccountersForTest();
    check(kelvo::registerLibraryListener(type, new CheckingListener()) == 0);
    size_t pos = 1;
    while (size - pos >= 3) {
        int32_t code = data[pos] % 9; // 8: an unknown action
        size_t len = data[pos + 1] | (static_cast<size_t>(data[pos + 2]) << 8);
        pos += 3;
        len = len > size - pos ? size - pos : len;
        len = len > kMaxFields ? kMaxFields : len;
        Parcel action;
        action.writeInt32(type);
        action.writeInt32(code);
        action.write(data + pos, len);
        pos += len;
        int32_t result = kelvo::setDataAccounter(action);
        check(result == 0 || result == -1);
    }
    return 0;
}
