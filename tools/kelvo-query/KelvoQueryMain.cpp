// kelvo-query [-r ROOT] component START END MASK [FLAG]
// kelvo-query [-r ROOT] apps START END TOP
//
// Asks "KelvoService" for the energy of components (MASK: bit k selects
// module k; FLAG 1 totals over the raw rows, otherwise an hourly series) or
// for the top applications of each stored hour, and prints the answer.
// Times are wall-clock milliseconds. Exit status: 0 answered, 1 no service
// or no answer, 2 bad usage.

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include "KelvoQueryClient.h"
#include "kelvo/RootPath.h"

namespace {

void usage() {
    fprintf(stderr,
            "usage: kelvo-query [-r ROOT] component START END MASK [FLAG]\n"
            "       kelvo-query [-r ROOT] apps START END TOP\n");
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

}  // namespace

int main(int argc, char** argv) {
    int i = 1;
    if (i + 1 < argc && strcmp(argv[i], "-r") == 0) {
        kelvo::RootPath::setRoot(argv[i + 1]);
        i += 2;
    }
    if (i >= argc) {
        usage();
        return 2;
    }
    std::string command = argv[i++];
    long long values[4] = {0, 0, 0, 0};
    int count = argc - i;
    bool component = command == "component";
    if ((component && (count < 3 || count > 4)) ||
        (!component && (command != "apps" || count != 3))) {
        usage();
        return 2;
    }
    for (int k = 0; k < count; ++k) {
        if (!parseNumber(argv[i + k], &values[k])) {
            usage();
            return 2;
        }
    }
    kelvo::KelvoQueryClient client(kelvo::KelvoQueryClient::connect());
    android::Parcel response;
    bool answered;
    std::string text;
    if (component) {
        int32_t flag = static_cast<int32_t>(values[3]);
        answered = client.queryComponent(values[0], values[1], static_cast<int32_t>(values[2]),
                                         flag, &response);
        text = answered ? kelvo::KelvoQueryClient::formatComponent(response, flag) : "";
    } else {
        answered = client.queryApplications(values[0], values[1], static_cast<int32_t>(values[2]),
                                            &response);
        text = answered ? kelvo::KelvoQueryClient::formatApplications(response) : "";
    }
    if (!answered) {
        fprintf(stderr, "kelvo-query: no answer (only uid 1000 is answered; this is uid %d)\n",
                static_cast<int>(getuid()));
        return 1;
    }
    fputs(text.c_str(), stdout);
    return 0;
}
