// Loads an untrusted configuration file and answers lookups on it. The head
// of the input is the file (up to the first lone backslash); the tail chooses
// where the file lies and which lookups follow. A fixed sweep over every
// element and component runs for each input as well. Besides the sanitizers,
// each reply is checked: it starts at 0, a grouped answer reads back whole,
// a text answer is whole strings, and refused elements fail.

#include <fuzzer/FuzzedDataProvider.h>

#include <android/log.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <binder/Parcel.h>

#include "KelvoLibEntry.h"
#include "kelvo/RootPath.h"
#include "utils/XmlParser.h"

using android::Parcel;
using kelvo::XmlParser;

namespace {

constexpr int kMaxLookups = 64;
constexpr const char* kDataDir = "/data/misc/kelvo";
constexpr const char* kDataFile = "/data/misc/kelvo/tv_kelvo_config.xml";
constexpr const char* kCustDir = "/cust/xml";
constexpr const char* kCustFile = "/cust/xml/tv_kelvo_config.xml";

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

void quietLogger(const struct __android_logger_data*, const char*) {}

std::string gRoot;

void removeRoot() {
    if (gRoot.rfind("/tmp/kelvo-fuzz-xml-", 0) == 0) {
        std::string cmd = "rm -rf '" + gRoot + "'";
        int ignored = system(cmd.c_str());
        (void)ignored;
    }
}

void makeDirs(const std::string& path) {
    for (size_t pos = path.find('/', 1); pos != std::string::npos; pos = path.find('/', pos + 1)) {
        mkdir(path.substr(0, pos).c_str(), 0775);
    }
    mkdir(path.c_str(), 0775);
}

void writeFile(const std::string& path, const std::string& content) {
    FILE* file = fopen(path.c_str(), "wb");
    check(file != nullptr);
    check(fwrite(content.data(), 1, content.size(), file) == content.size());
    fclose(file);
}

bool isGrouped(int32_t element, int32_t component) {
    return (element == kelvo::CONFIG_POWER_PROFILE && component >= kelvo::PROFILE_CPU &&
            component <= kelvo::PROFILE_DPM) ||
           element == kelvo::CONFIG_ABNORMALITY_THRESHOLD;
}

// One lookup and the checks on its reply.
void lookup(int32_t element, int32_t component, int32_t parameter, bool keyed, int fields,
            bool throughEntry) {
    Parcel request;
    if (fields > 0) {
        request.writeInt32(component);
    }
    if (fields > 1) {
        request.writeInt32(parameter);
    }
    if (fields > 2) {
        request.writeBool(keyed);
    }
    Parcel reply;
    int32_t ret = throughEntry ? kelvo::getXmlConfig(element, request, &reply)
                               : XmlParser::getInstance()->getXmlConfig(element, request, &reply);
    check(ret == 0 || ret == -1);
    check(reply.dataPosition() == 0);
    if (element < 0 || element > kelvo::CONFIG_TEXT ||
        (throughEntry && element == kelvo::CONFIG_POWER_PROFILE)) {
        check(ret == -1 && reply.dataSize() == 0);
        return;
    }
    if (ret != 0) {
        return;
    }
    check(fields >= 1);
    if (isGrouped(element, component)) {
        check(fields == 3);
        std::vector<kelvo::config_parameter> parameters;
        check(XmlParser::readGroupedReply(reply, keyed, &parameters) == 0);
        check(reply.dataAvail() == 0);
        for (const kelvo::config_parameter& p : parameters) {
            check(parameter == -1 || p.id == parameter);
        }
    } else if (element == kelvo::CONFIG_TEXT) {
        while (reply.dataAvail() > 0) {
            android::String8 text;
            check(reply.readString8(&text) == android::NO_ERROR);
        }
    } else {
        check(reply.dataSize() % sizeof(int32_t) == 0);
    }
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    char tmpl[] = "/tmp/kelvo-fuzz-xml-XXXXXX";
    const char* root = mkdtemp(tmpl);
    check(root != nullptr);
    gRoot = root;
    atexit(removeRoot);
    kelvo::RootPath::setRoot(root);
    makeDirs(kelvo::RootPath::resolve(kDataDir));
    makeDirs(kelvo::RootPath::resolve(kCustDir));
    __android_log_set_logger(quietLogger);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    FuzzedDataProvider in(data, size);
    std::string xml = in.ConsumeRandomLengthString(size);
    // The file lies at the first location, or only at the located one.
    bool first = in.ConsumeBool();
    std::string dataFile = kelvo::RootPath::resolve(kDataFile);
    std::string custFile = kelvo::RootPath::resolve(kCustFile);
    writeFile(first ? dataFile : custFile, xml);
    unlink((first ? custFile : dataFile).c_str());
    XmlParser::resetInstance();

    for (int32_t element : {0, 1, 2, 3, 4, 7, 1000}) {
        for (int32_t component = -1; component <= 12; ++component) {
            lookup(element, component, -1, element != 1, 3, false);
        }
    }
    for (int i = 0; i < kMaxLookups && in.remaining_bytes() > 0; ++i) {
        int32_t element = 0;
        switch (in.ConsumeIntegralInRange<int>(0, 3)) {
            case 0:
                element = in.ConsumeIntegralInRange<int32_t>(0, 4);
                break;
            case 1:
                element = kelvo::CONFIG_TEXT;
                break;
            case 2:
                element = in.ConsumeIntegralInRange<int32_t>(-2, 1002);
                break;
            default:
                element = in.ConsumeIntegral<int32_t>();
                break;
        }
        int32_t component = in.ConsumeBool() ? in.ConsumeIntegralInRange<int32_t>(-1, 12)
                                             : in.ConsumeIntegral<int32_t>();
        int32_t parameter = in.ConsumeBool() ? in.ConsumeIntegralInRange<int32_t>(-1, 101)
                                             : in.ConsumeIntegral<int32_t>();
        bool keyed = in.ConsumeBool();
        int fields = in.ConsumeIntegralInRange<int>(0, 3);
        lookup(element, component, parameter, keyed, fields, in.ConsumeBool());
    }
    return 0;
}
