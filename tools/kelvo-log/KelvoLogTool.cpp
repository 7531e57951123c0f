// kelvo-log: writes one record to the log device of a root, as the framework
// and the kernel do on the phone.
//
//   kelvo-log [-r root] [-p priority] [-t time_ms] TAG [TEXT ...]
//
// The words of TEXT are joined with single spaces; without TEXT the record
// carries the tag alone. The root defaults to $KELVO_ROOT (else "/"), the
// priority to I (letters V D I W E F, or a number 0..255) and the time to the
// wall clock now. Exit status: 0 written, 1 not written, 2 bad usage.

#include <ctype.h>
#include <errno.h>
#include <getopt.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "kelvo/LogDevice.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"

namespace {

void usage(FILE* out) {
    fprintf(out,
            "usage: kelvo-log [-r root] [-p priority] [-t time_ms] TAG [TEXT ...]\n"
            "  -r root      root directory of the device (default $KELVO_ROOT, else /)\n"
            "  -p priority  V D I W E F or 0..255 (default I)\n"
            "  -t time_ms   time stamp in wall-clock milliseconds (default now)\n");
}

bool parsePriority(const char* arg, int* priority) {
    static const char kLetters[] = "VDIWEF";
    if (arg[0] != '\0' && arg[1] == '\0') {
        const char* at = strchr(kLetters, toupper(static_cast<unsigned char>(arg[0])));
        if (at != nullptr && *at != '\0') {
            *priority = kelvo::LogWriter::PRIORITY_VERBOSE + static_cast<int>(at - kLetters);
            return true;
        }
    }
    char* end = nullptr;
    errno = 0;
    long value = strtol(arg, &end, 10);
    if (errno != 0 || end == arg || *end != '\0' || value < 0 || value > 255) {
        return false;
    }
    *priority = static_cast<int>(value);
    return true;
}

bool parseTime(const char* arg, int64_t* timeMs) {
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(arg, &end, 10);
    if (errno != 0 || end == arg || *end != '\0' || value < 0) {
        return false;
    }
    *timeMs = value;
    return true;
}

} // namespace

int main(int argc, char** argv) {
    int priority = kelvo::LogWriter::PRIORITY_INFO;
    int64_t timeMs = -1;
    int opt;
    // '+': options end at TAG, so a text may begin with '-'.
    while ((opt = getopt(argc, argv, "+r:p:t:h")) != -1) {
        switch (opt) {
            case 'r':
                kelvo::RootPath::setRoot(optarg);
                break;
            case 'p':
                if (!parsePriority(optarg, &priority)) {
                    fprintf(stderr, "kelvo-log: bad priority: %s\n", optarg);
                    return 2;
                }
                break;
            case 't':
                if (!parseTime(optarg, &timeMs)) {
                    fprintf(stderr, "kelvo-log: bad time: %s\n", optarg);
                    return 2;
                }
                break;
            case 'h':
                usage(stdout);
                return 0;
            default:
                usage(stderr);
                return 2;
        }
    }
    if (optind >= argc || argv[optind][0] == '\0') {
        usage(stderr);
        return 2;
    }
    const char* tag = argv[optind++];
    std::string text;
    for (int i = optind; i < argc; ++i) {
        if (i > optind) {
            text += ' ';
        }
        text += argv[i];
    }

    std::string path = kelvo::RootPath::resolve(KELVO_LOG_DEVICE);
    kelvo::LogWriter writer(path);
    int err = writer.write(priority, tag, text.c_str(), timeMs);
    if (err < 0) {
        fprintf(stderr, "kelvo-log: cannot write to %s: %s\n", path.c_str(), strerror(-err));
        return 1;
    }
    return 0;
}
