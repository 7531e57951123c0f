#include "CpuTree.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <string>

namespace kelvo {

namespace {

constexpr const char* kCpuDir = "sys/devices/system/cpu";

std::string coreDir(int32_t core) {
    return std::string(kCpuDir) + "/cpu" + std::to_string(core);
}

}  // namespace

std::vector<CpuTree::Cluster> CpuTree::phoneClusters() {
    Cluster little;
    little.cores = {0, 1, 2, 3};
    little.frequencies = {300000, 576000, 768000, 1017600, 1248000, 1324800, 1516800, 1747200};
    little.idleStates = 2;
    Cluster big;
    big.cores = {4, 5, 6, 7};
    big.frequencies = {300000,  652800,  806400,  1094400, 1344000,
                       1574400, 1804800, 2208000, 2457600};
    big.idleStates = 2;
    return {little, big};
}

std::string CpuTree::timeInStatePath(int32_t core) {
    return coreDir(core) + "/cpufreq/stats/time_in_state";
}

std::string CpuTree::idleTimePath(int32_t core, int32_t state) {
    return coreDir(core) + "/cpuidle/state" + std::to_string(state) + "/time";
}

bool CpuTree::makeDirs(const std::string& relative) const {
    std::string path = mRoot;
    size_t pos = 0;
    while (pos < relative.size()) {
        size_t end = relative.find('/', pos);
        if (end == std::string::npos) {
            end = relative.size();
        }
        path += "/" + relative.substr(pos, end - pos);
        if (mkdir(path.c_str(), 0755) != 0 && errno != EEXIST) {
            return false;
        }
        pos = end + 1;
    }
    return true;
}

bool CpuTree::writeFile(const std::string& relative, const std::string& text) const {
    size_t slash = relative.rfind('/');
    if (slash != std::string::npos && !makeDirs(relative.substr(0, slash))) {
        return false;
    }
    // Unique per writer and call, so writers in several threads never share
    // a temporary file.
    static std::atomic<uint64_t> sSequence{0};
    std::string path = mRoot + "/" + relative;
    std::string temp =
        path + ".tmp" + std::to_string(getpid()) + "." + std::to_string(sSequence.fetch_add(1));
    int fd = open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) {
        return false;
    }
    size_t done = 0;
    while (done < text.size()) {
        ssize_t n = write(fd, text.data() + done, text.size() - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            int err = errno;
            close(fd);
            unlink(temp.c_str());
            errno = err;
            return false;
        }
        done += static_cast<size_t>(n);
    }
    if (close(fd) != 0 || rename(temp.c_str(), path.c_str()) != 0) {
        int err = errno;
        unlink(temp.c_str());
        errno = err;
        return false;
    }
    return true;
}

bool CpuTree::removeFile(const std::string& relative) const {
    std::string path = mRoot + "/" + relative;
    return unlink(path.c_str()) == 0 || errno == ENOENT;
}

const CpuTree::Cluster* CpuTree::clusterOf(int32_t core) const {
    for (const Cluster& c : mClusters) {
        for (int32_t n : c.cores) {
            if (n == core) {
                return &c;
            }
        }
    }
    return nullptr;
}

bool CpuTree::layout(const std::vector<Cluster>& clusters) {
    mClusters = clusters;
    int32_t highest = -1;
    for (const Cluster& c : mClusters) {
        std::string related;
        std::string freqs;
        for (int32_t core : c.cores) {
            related += (related.empty() ? "" : " ") + std::to_string(core);
            highest = core > highest ? core : highest;
        }
        for (int32_t f : c.frequencies) {
            freqs += std::to_string(f) + " ";
        }
        for (int32_t core : c.cores) {
            std::string dir = coreDir(core) + "/cpufreq/";
            if (!writeFile(dir + "related_cpus", related + "\n") ||
                !writeFile(dir + "scaling_available_frequencies", freqs + "\n") ||
                !setFrequencyTicks(core, std::vector<uint64_t>(c.frequencies.size(), 0))) {
                return false;
            }
            for (int32_t s = 0; s < c.idleStates; ++s) {
                if (!writeFile(coreDir(core) + "/cpuidle/state" + std::to_string(s) + "/name",
                               "S" + std::to_string(s) + "\n") ||
                    !setIdleTime(core, s, 0)) {
                    return false;
                }
            }
        }
    }
    if (highest >= 0 &&
        !writeFile(std::string(kCpuDir) + "/possible",
                   (highest == 0 ? std::string("0") : "0-" + std::to_string(highest)) + "\n")) {
        return false;
    }
    return setUidTimes({});
}

bool CpuTree::setFrequencyTicks(int32_t core, const std::vector<uint64_t>& ticks) {
    const Cluster* c = clusterOf(core);
    if (c == nullptr || ticks.size() != c->frequencies.size()) {
        errno = EINVAL;
        return false;
    }
    std::string text;
    for (size_t i = 0; i < ticks.size(); ++i) {
        text += std::to_string(c->frequencies[i]) + " " + std::to_string(ticks[i]) + "\n";
    }
    return writeFile(timeInStatePath(core), text);
}

bool CpuTree::setClusterTicks(size_t cluster, const std::vector<uint64_t>& ticks) {
    if (cluster >= mClusters.size()) {
        errno = EINVAL;
        return false;
    }
    for (int32_t core : mClusters[cluster].cores) {
        if (!setFrequencyTicks(core, ticks)) {
            return false;
        }
    }
    return true;
}

bool CpuTree::setIdleTime(int32_t core, int32_t state, uint64_t us) {
    return writeFile(idleTimePath(core, state), std::to_string(us) + "\n");
}

bool CpuTree::setUidTimes(const std::vector<UidTime>& times) {
    std::string text;
    text.reserve(times.size() * 32);
    char line[96];
    for (const UidTime& t : times) {
        snprintf(line, sizeof(line), "%u: %llu %llu\n", t.uid,
                 static_cast<unsigned long long>(t.userUs),
                 static_cast<unsigned long long>(t.systemUs));
        text += line;
    }
    return writeFile(uidStatPath(), text);
}

}  // namespace kelvo
