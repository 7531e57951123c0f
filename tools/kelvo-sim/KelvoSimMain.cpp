// kelvo-sim: plays a scenario against the daemon on a simulated phone and
// reports what the daemon attributed beside what the scenario gave.
//
//   kelvo-sim [--root DIR] [--daemon PATH] [--config DIR] [--quiet]
//             [--idle-figures] [--check] SCENARIO
//
// Exit status: 0 done, 1 the run failed, 2 bad usage or a bad scenario (the
// line is named; nothing was started), 130 interrupted.

#include <limits.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include "DeviceSimulator.h"
#include "Scenario.h"

namespace {

void usage() {
    fprintf(stderr,
            "usage: kelvo-sim [--root DIR] [--daemon PATH] [--config DIR] [--quiet]\n"
            "                 [--idle-figures] [--check] SCENARIO\n"
            "  --root DIR      device root to use (default: a fresh /tmp/kelvo-sim-XXXXXX)\n"
            "  --daemon PATH   the daemon binary (default: kelvod beside kelvo-sim)\n"
            "  --config DIR    build.prop and tv_kelvo_config.xml to install (default: the\n"
            "                  source tree's config/)\n"
            "  --quiet         no progress lines\n"
            "  --idle-figures  print daemon_idle_rss_kb and daemon_idle_wakeups_per_min\n"
            "  --check         only read the scenario\n");
}

void onStop(int) {
    kelvo::sim::DeviceSimulator::requestStop();
}

std::string besideSelf(const char* name) {
    char self[PATH_MAX];
    ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
    if (n <= 0) {
        return name;
    }
    self[n] = '\0';
    std::string path(self);
    return path.substr(0, path.rfind('/') + 1) + name;
}

}  // namespace

int main(int argc, char** argv) {
    kelvo::sim::DeviceSimulator::Options options;
    options.daemonPath = besideSelf("kelvod");
    options.configDir = KELVO_SOURCE_DIR "/config";
    bool checkOnly = false;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        bool hasValue = i + 1 < argc;
        if (arg == "--root" && hasValue) {
            options.root = argv[++i];
        } else if (arg == "--daemon" && hasValue) {
            options.daemonPath = argv[++i];
        } else if (arg == "--config" && hasValue) {
            options.configDir = argv[++i];
        } else if (arg == "--quiet") {
            options.progress = false;
        } else if (arg == "--idle-figures") {
            options.idleFigures = true;
        } else if (arg == "--check") {
            checkOnly = true;
        } else if ((arg == "-h" || arg == "--help")) {
            usage();
            return 0;
        } else if (arg[0] != '-' && options.scenarioPath.empty()) {
            options.scenarioPath = arg;
        } else {
            usage();
            return 2;
        }
    }
    if (options.scenarioPath.empty()) {
        usage();
        return 2;
    }
    kelvo::sim::Scenario scenario;
    std::string error;
    if (!scenario.load(options.scenarioPath, &error)) {
        fprintf(stderr, "kelvo-sim: %s\n", error.c_str());
        return 2;
    }
    if (checkOnly) {
        printf("%s: %zu apps, %zu processes, %zu steps, %lld s\n", options.scenarioPath.c_str(),
               scenario.apps().size(), scenario.processes().size(), scenario.steps().size(),
               static_cast<long long>(scenario.durationMs() / 1000));
        return 0;
    }
    if (!options.root.empty() && options.root[0] != '/') {
        char cwd[PATH_MAX];
        if (getcwd(cwd, sizeof(cwd)) != nullptr) {
            options.root = std::string(cwd) + "/" + options.root;
        }
    }
    // Replaces the binary pool's stop handlers: a stop ends the run in order.
    struct sigaction sa = {};
    sa.sa_handler = onStop;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGINT, &sa, nullptr);
    sigaction(SIGTERM, &sa, nullptr);
    sigaction(SIGHUP, &sa, nullptr);
    kelvo::sim::DeviceSimulator simulator(scenario, options);
    return simulator.run();
}
