// dumpsys [-r ROOT] [-t SECONDS] SERVICE [ARGS...]
// dumpsys [-r ROOT] -l
//
// Sends SERVICE the dump transaction with this program's standard output as
// the descriptor and ARGS as the arguments, like the phone's dumpsys. The
// root defaults to $KELVO_ROOT. Exit status: 0 when the service answered,
// 1 when it cannot be found or the dump failed, 2 for bad usage, 3 when it
// did not answer within the time-out (10 s by default).

#include <binder/IBinder.h>
#include <binder/IServiceManager.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>
#include <utils/String16.h>
#include <utils/String8.h>
#include <utils/Vector.h>

#include "kelvo/RootPath.h"

using android::IBinder;
using android::sp;
using android::String16;
using android::String8;
using android::Vector;

namespace {

void usage() {
    fprintf(stderr,
            "usage: dumpsys [-r ROOT] [-t SECONDS] SERVICE [ARGS...]\n"
            "       dumpsys [-r ROOT] -l\n");
}

void onTimeout(int) {
    static const char kText[] = "dumpsys: timed out\n";
    ssize_t ignored = write(STDERR_FILENO, kText, sizeof(kText) - 1);
    (void)ignored;
    _exit(3);
}

} // namespace

int main(int argc, char** argv) {
    int timeoutSeconds = 10;
    bool list = false;
    int i = 1;
    for (; i < argc && argv[i][0] == '-'; ++i) {
        if (strcmp(argv[i], "-r") == 0 && i + 1 < argc) {
            kelvo::RootPath::setRoot(argv[++i]);
        } else if (strcmp(argv[i], "-t") == 0 && i + 1 < argc) {
            timeoutSeconds = atoi(argv[++i]);
        } else if (strcmp(argv[i], "-l") == 0) {
            list = true;
        } else if (strcmp(argv[i], "--") == 0) {
            ++i;
            break;
        } else {
            usage();
            return 2;
        }
    }
    // A reader that goes away must not kill us halfway.
    signal(SIGPIPE, SIG_IGN);
    if (list) {
        printf("Currently running services:\n");
        for (const String16& name : android::defaultServiceManager()->listServices()) {
            printf("  %s\n", String8(name).string());
        }
        return 0;
    }
    if (i >= argc) {
        usage();
        return 2;
    }
    const char* name = argv[i++];
    sp<IBinder> service = android::defaultServiceManager()->checkService(String16(name));
    if (service == nullptr) {
        fprintf(stderr, "Can't find service: %s\n", name);
        return 1;
    }
    Vector<String16> args;
    for (; i < argc; ++i) {
        args.add(String16(argv[i]));
    }
    if (timeoutSeconds > 0) {
        signal(SIGALRM, onTimeout);
        alarm(static_cast<unsigned>(timeoutSeconds));
    }
    fflush(stdout);
    android::status_t err = service->dump(STDOUT_FILENO, args);
    alarm(0);
    if (err != android::NO_ERROR) {
        fprintf(stderr, "Error dumping service info: (%s) %s\n", strerror(-err), name);
        return 1;
    }
    return 0;
}
