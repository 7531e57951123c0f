// kelvo-as-uid -r ROOT -u UID [-w WAIT_MS] CALL [CALL ...]
//
// Takes the uid (and the same gid, no supplementary groups) before it first
// touches binder, then makes the calls to "KelvoService" in order, as a
// caller of that uid would. The tests run it so that calls of another uid
// come from a process of their own instead of a child forked from the
// multi-threaded test program. Calls and what each prints:
//   component START END MASK FLAG  the formatted answer ("no answer" after
//   apps START END TOP             WAIT_MS, default 5000), then a line "--"
//   open MESSAGE                   the result, one line
//   capture PATH                   the result, one line
//   close                          the result, one line
//   sample MESSAGE PATH            the result, one line
//   dump [ARGS ...]                the dump text (takes the remaining words)
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

#include <string>
#include <vector>

#include "KelvoQueryClient.h"
#include "kelvo/RootPath.h"

using android::String16;
using kelvo::IKelvoService;

namespace {

// A call that hangs must not hold the test up beyond its own time-out.
constexpr unsigned kLifetimeSeconds = 100;

void usage() {
    fprintf(stderr,
            "usage: kelvo-as-uid -r ROOT -u UID [-w WAIT_MS] CALL [CALL ...]\n"
            "  calls: component START END MASK FLAG | apps START END TOP | open MESSAGE |\n"
            "         capture PATH | close | sample MESSAGE PATH | dump [ARGS ...]\n");
}

bool parseNumber(const char* text, long long* out) {
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(text, &end, 0);
    if (errno != 0 || end == text || *end != '\0') {
        return false;
    }
    *out = value;
    return true;
}

// Words each call takes after its name (-1: all that are left).
int arityOf(const std::string& call) {
    if (call == "component") return 4;
    if (call == "apps") return 3;
    if (call == "open" || call == "capture") return 1;
    if (call == "close") return 0;
    if (call == "sample") return 2;
    if (call == "dump") return -1;
    return -2;
}

// Numbers of a query call, all checked before any call is made.
bool numbersOf(const std::vector<std::string>& words, std::vector<long long>* out) {
    out->clear();
    for (const std::string& w : words) {
        long long value = 0;
        if (!parseNumber(w.c_str(), &value)) {
            return false;
        }
        out->push_back(value);
    }
    return true;
}

struct Call {
    std::string name;
    std::vector<std::string> words;
};

int dump(const android::sp<IKelvoService>& service, const std::vector<std::string>& words) {
    android::Vector<String16> args;
    for (const std::string& w : words) {
        args.add(String16(w.c_str()));
    }
    fflush(stdout);
    return android::IInterface::asBinder(service)->dump(STDOUT_FILENO, args);
}

}  // namespace

int main(int argc, char** argv) {
    const char* root = nullptr;
    long long uid = -1;
    long long waitMs = kelvo::KelvoQueryClient::kDefaultTimeoutMs;
    int opt;
    while ((opt = getopt(argc, argv, "+r:u:w:")) != -1) {
        bool ok = true;
        switch (opt) {
            case 'r':
                root = optarg;
                break;
            case 'u':
                ok = parseNumber(optarg, &uid) && uid >= 0 && uid <= 0x7fffffff;
                break;
            case 'w':
                ok = parseNumber(optarg, &waitMs) && waitMs >= 0 && waitMs <= 600000;
                break;
            default:
                ok = false;
        }
        if (!ok) {
            usage();
            return 2;
        }
    }
    std::vector<Call> calls;
    std::vector<long long> numbers;
    for (int i = optind; i < argc;) {
        Call call{argv[i++], {}};
        int arity = arityOf(call.name);
        int left = argc - i;
        if (arity < -1 || arity > left) {
            usage();
            return 2;
        }
        int take = arity < 0 ? left : arity;
        call.words.assign(argv + i, argv + i + take);
        i += take;
        if ((call.name == "component" || call.name == "apps") && !numbersOf(call.words, &numbers)) {
            usage();
            return 2;
        }
        calls.push_back(call);
    }
    if (root == nullptr || uid < 0 || calls.empty()) {
        usage();
        return 2;
    }
    kelvo::RootPath::setRoot(root);
    alarm(kLifetimeSeconds);
    gid_t id = static_cast<gid_t>(uid);
    if (setgroups(0, nullptr) != 0 || setgid(id) != 0 || setuid(id) != 0) {
        fprintf(stderr, "kelvo-as-uid: cannot take uid %lld: %s\n", uid, strerror(errno));
        return 3;
    }
    android::sp<IKelvoService> service = kelvo::KelvoQueryClient::connect();
    if (service == nullptr) {
        fprintf(stderr, "kelvo-as-uid: no KelvoService below %s\n", root);
        return 1;
    }
    kelvo::KelvoQueryClient client(service);
    for (const Call& call : calls) {
        const std::vector<std::string>& w = call.words;
        if (call.name == "component" || call.name == "apps") {
            numbersOf(w, &numbers);
            android::Parcel reply;
            bool answered;
            std::string text;
            if (call.name == "component") {
                int32_t flag = static_cast<int32_t>(numbers[3]);
                answered = client.queryComponent(numbers[0], numbers[1],
                                                 static_cast<int32_t>(numbers[2]), flag, &reply,
                                                 static_cast<int>(waitMs));
                text = answered ? kelvo::KelvoQueryClient::formatComponent(reply, flag) : "";
            } else {
                answered = client.queryApplications(numbers[0], numbers[1],
                                                    static_cast<int32_t>(numbers[2]), &reply,
                                                    static_cast<int>(waitMs));
                text = answered ? kelvo::KelvoQueryClient::formatApplications(reply) : "";
            }
            printf("%s--\n", answered ? text.c_str() : "no answer\n");
        } else if (call.name == "dump") {
            android::status_t err = dump(service, w);
            if (err != android::NO_ERROR) {
                printf("dump failed: %d\n", err);
            }
        } else {
            int32_t result;
            if (call.name == "open") {
                result = service->remoteDebugOpen(String16(w[0].c_str()));
            } else if (call.name == "capture") {
                result = service->remoteDebugCapture(String16(w[0].c_str()));
            } else if (call.name == "close") {
                result = service->remoteDebugClose();
            } else {
                result = service->noteSamplingMessage(String16(w[0].c_str()),
                                                      String16(w[1].c_str()));
            }
            printf("%d\n", result);
        }
        fflush(stdout);
    }
    return 0;
}
