// kelvo-as-uid -r ROOT -u UID [-w WAIT_MS] CALL [CALL ...]
//
// Takes the uid (and the same gid, no supplementary groups) before it first
// touches binder, then makes the calls to "KelvoService" in order. The tests
// run it so that calls of another uid come from a process of its own, never
// from a child forked from the multi-threaded test program. Calls:
//   component START END MASK FLAG | apps START END TOP: the formatted answer
//       ("no answer" after WAIT_MS, default 5000), then a line "--"
//   open MESSAGE | capture PATH | close | sample MESSAGE PATH: the result
//   dump [ARGS ...]: the dump text (takes the remaining words)
// Exit status: 0 every call made, 1 no service, 2 bad usage, 3 the uid could
// not be taken.

#include <binder/IBinder.h>
#include <errno.h>
#include <grp.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>
#include <utils/String16.h>
#include <utils/Vector.h>

#include <map>
#include <string>

#include "KelvoQueryClient.h"
#include "kelvo/RootPath.h"

using android::String16;
using kelvo::KelvoQueryClient;

namespace {

// Words each call takes after its name (-1: all that are left).
const std::map<std::string, int> kArity = {{"component", 4}, {"apps", 3},  {"open", 1},
                                           {"capture", 1},   {"close", 0}, {"sample", 2},
                                           {"dump", -1}};

int usage() {
    fprintf(stderr, "usage: kelvo-as-uid -r ROOT -u UID [-w WAIT_MS] CALL [CALL ...]\n");
    return 2;
}

bool number(const char* text, long long* out) {
    char* end = nullptr;
    errno = 0;
    *out = strtoll(text, &end, 0);
    return errno == 0 && end != text && *end == '\0';
}

}  // namespace

int main(int argc, char** argv) {
    const char* root = nullptr;
    long long uid = -1;
    long long waitMs = KelvoQueryClient::kDefaultTimeoutMs;
    for (int opt; (opt = getopt(argc, argv, "+r:u:w:")) != -1;) {
        if ((opt == 'u' && !number(optarg, &uid)) || (opt == 'w' && !number(optarg, &waitMs)) ||
            opt == '?') {
            return usage();
        }
        root = opt == 'r' ? optarg : root;
    }
    // Every call is checked before the first is made.
    for (int i = optind; i < argc;) {
        auto call = kArity.find(argv[i++]);
        long long value;
        if (call == kArity.end() || call->second > argc - i) return usage();
        bool numeric = call->first == "component" || call->first == "apps";
        for (int k = 0; numeric && k < call->second; ++k) {
            if (!number(argv[i + k], &value)) return usage();
        }
        i = call->second < 0 ? argc : i + call->second;
    }
    if (root == nullptr || uid < 0 || uid > 0x7fffffff || waitMs < 0 || optind >= argc) {
        return usage();
    }
    kelvo::RootPath::setRoot(root);
    // A call that hangs must not outlast the test waiting for it.
    alarm(100);
    if (setgroups(0, nullptr) != 0 || setgid(uid) != 0 || setuid(uid) != 0) {
        fprintf(stderr, "kelvo-as-uid: cannot take uid %lld: %s\n", uid, strerror(errno));
        return 3;
    }
    android::sp<kelvo::IKelvoService> service = KelvoQueryClient::connect();
    if (service == nullptr) {
        fprintf(stderr, "kelvo-as-uid: no KelvoService below %s\n", root);
        return 1;
    }
    KelvoQueryClient client(service);
    for (int i = optind; i < argc;) {
        const std::string call = argv[i++];
        char** w = argv + i;
        i = call == "dump" ? argc : i + kArity.at(call);
        long long n[4] = {};
        for (int k = 0; (call == "component" || call == "apps") && k < kArity.at(call); ++k) {
            number(w[k], &n[k]);
        }
        android::Parcel reply;
        if (call == "component") {
            bool answered = client.queryComponent(n[0], n[1], n[2], n[3], &reply, waitMs);
            printf("%s--\n", answered ? KelvoQueryClient::formatComponent(reply, n[3]).c_str()
                                      : "no answer\n");
        } else if (call == "apps") {
            bool answered = client.queryApplications(n[0], n[1], n[2], &reply, waitMs);
            printf("%s--\n",
                   answered ? KelvoQueryClient::formatApplications(reply).c_str() : "no answer\n");
        } else if (call == "dump") {
            android::Vector<String16> args;
            for (char** a = w; a < argv + argc; ++a) args.add(String16(*a));
            fflush(stdout);
            android::status_t err = android::IInterface::asBinder(service)->dump(1, args);
            if (err != android::NO_ERROR) printf("dump failed: %d\n", err);
        } else if (call == "open") {
            printf("%d\n", service->remoteDebugOpen(String16(w[0])));
        } else if (call == "capture") {
            printf("%d\n", service->remoteDebugCapture(String16(w[0])));
        } else if (call == "close") {
            printf("%d\n", service->remoteDebugClose());
        } else {
            printf("%d\n", service->noteSamplingMessage(String16(w[0]), String16(w[1])));
        }
        fflush(stdout);
    }
    return 0;
}
