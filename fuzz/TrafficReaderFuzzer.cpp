// Reads untrusted bytes as one of the kernel's traffic views: the first byte
// picks the view (0 uid, 1 process, 2 interface), the rest is the file.
// Besides the sanitizers, checks that only whole, valid rows of the reader's
// interfaces go out: names inside their fields, counters at least 0 with a
// packet moved, untagged uid rows of counter set 0 or 1.

#include <stdlib.h>
#include <sys/stat.h>

#include <cstdint>
#include <fstream>
#include <string>
#include <vector>

#include "kelvo/RootPath.h"
#include "utils/TrafficReader.h"

using kelvo::TrafficReader;

namespace {

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

void writeFile(const char* devicePath, const std::string& text) {
    std::ofstream(kelvo::RootPath::resolve(devicePath), std::ios::trunc | std::ios::binary) << text;
}

bool validCounters(int64_t rb, int64_t rp, int64_t tb, int64_t tp) {
    return rb >= 0 && rp >= 0 && tb >= 0 && tp >= 0 && (rp >= 1 || tp >= 1);
}

bool validInterface(const std::string& name) {
    return name.find("wlan") != std::string::npos && name.size() < TrafficReader::kInterfaceSize - 1;
}

const std::string& root() {
    static const std::string sRoot = [] {
        char tmpl[] = "/tmp/kelvo-fuzz-traffic-XXXXXX";
        std::string dir = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
        for (const char* sub :
             {"/proc", "/proc/net", "/proc/net/xt_qtaguid", "/proc/net/proc_netstat"}) {
            mkdir((dir + sub).c_str(), 0755);
        }
        return dir;
    }();
    return sRoot;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size < 1) {
        return 0;
    }
    kelvo::RootPath::setRoot(root().c_str());
    std::string text(reinterpret_cast<const char*>(data + 1), size - 1);
    const char* paths[] = {TrafficReader::kUidStatsPath, TrafficReader::kPidStatsPath,
                           TrafficReader::kInterfaceStatsPath};
    int view = data[0] % 3;
    // A baseline of title lines only, so that the fuzzed keys are new.
    for (int i = 0; i < 3; ++i) {
        writeFile(paths[i], i == 2 ? "" : "title\n");
    }
    TrafficReader reader("wlan", [](int32_t, int32_t pid, std::string* name) {
        *name = pid % 7 == 0 ? "" : "process" + std::to_string(pid % 5);
        return name->empty() ? -4 : 0;
    });
    reader.getUidTrafficData(nullptr);
    reader.getPidTrafficData(nullptr);
    reader.getInterfaceTrafficData(nullptr);
    writeFile(paths[view], text);
    for (int pass = 0; pass < 2; ++pass) {
        if (view == 0) {
            std::vector<kelvo::traffic_data> out;
            reader.getUidTrafficData(&out);
            for (const kelvo::traffic_data& d : out) {
                check(validInterface(d.interface) && d.uid >= 0 && d.tag == 0 &&
                      (d.counter == 0 || d.counter == 1) &&
                      validCounters(d.rxBytes, d.rxPackets, d.txBytes, d.txPackets));
            }
        } else if (view == 1) {
            std::vector<kelvo::pid_traffic_data> out;
            reader.getPidTrafficData(&out);
            for (const kelvo::pid_traffic_data& d : out) {
                check(validInterface(d.interface) && !d.name.empty() &&
                      d.name.size() < TrafficReader::kNameSize - 1 &&
                      (d.uid % 100000 == 0 || d.uid % 100000 == 1000) &&
                      validCounters(d.rxBytes, d.rxPackets, d.txBytes, d.txPackets));
            }
        } else {
            std::vector<kelvo::interface_traffic_data> out;
            reader.getInterfaceTrafficData(&out);
            for (const kelvo::interface_traffic_data& d : out) {
                check(validInterface(d.interface) &&
                      validCounters(d.rxBytes, d.rxPackets, d.txBytes, d.txPackets));
            }
        }
    }
    check(reader.uidKeys() <= TrafficReader::kMaxKeys &&
          reader.processKeys() <= TrafficReader::kMaxKeys);
    return 0;
}
