// kelvo-platform-services [-r ROOT] [-p UID=PKG[,PKG...]]... [-l LEVEL]
//
// Serves the fake platform services under ROOT (default $KELVO_ROOT) until
// SIGTERM or SIGINT. -p gives the packages of a uid, -l the battery level.

#include <binder/IPCThreadState.h>
#include <binder/ProcessState.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <sstream>
#include <string>
#include <vector>

#include "PlatformServices.h"
#include "kelvo/RootPath.h"

namespace {

int usage() {
    fprintf(stderr,
            "usage: kelvo-platform-services [-r ROOT] [-p UID=PKG[,PKG...]]... [-l LEVEL]\n");
    return 2;
}

} // namespace

int main(int argc, char** argv) {
    std::vector<std::pair<int32_t, std::vector<std::string>>> packages;
    int32_t level = -1;
    for (int i = 1; i < argc; ++i) {
        if (strcmp(argv[i], "-r") == 0 && i + 1 < argc) {
            kelvo::RootPath::setRoot(argv[++i]);
        } else if (strcmp(argv[i], "-p") == 0 && i + 1 < argc) {
            std::string entry = argv[++i];
            size_t eq = entry.find('=');
            if (eq == std::string::npos || eq == 0) {
                return usage();
            }
            std::vector<std::string> names;
            std::stringstream list(entry.substr(eq + 1));
            std::string name;
            while (std::getline(list, name, ',')) {
                if (!name.empty()) {
                    names.push_back(name);
                }
            }
            packages.emplace_back(atoi(entry.substr(0, eq).c_str()), names);
        } else if (strcmp(argv[i], "-l") == 0 && i + 1 < argc) {
            level = atoi(argv[++i]);
        } else {
            return usage();
        }
    }
    kelvo::PlatformServices services;
    for (const auto& entry : packages) {
        services.state()->setPackages(entry.first, entry.second);
    }
    if (level >= 0) {
        kelvo::PlatformState::Battery battery = services.state()->battery();
        battery.level = level;
        services.state()->setBattery(battery);
    }
    android::ProcessState::self()->startThreadPool();
    if (services.startAll() != android::NO_ERROR) {
        fprintf(stderr, "kelvo-platform-services: cannot register the services\n");
        return 1;
    }
    android::IPCThreadState::self()->joinThreadPool();
    services.stopAll();
    return 0;
}
