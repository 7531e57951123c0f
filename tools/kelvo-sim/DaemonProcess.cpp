#include "DaemonProcess.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

namespace kelvo {
namespace sim {

namespace {

int exitStatus(int status) {
    if (WIFEXITED(status)) {
        return WEXITSTATUS(status);
    }
    if (WIFSIGNALED(status)) {
        return 128 + WTERMSIG(status);
    }
    return -1;
}

}  // namespace

DaemonProcess::~DaemonProcess() {
    stop(0);
}

bool DaemonProcess::start(const std::string& program, const std::map<std::string, std::string>& env,
                          const std::string& logPath, std::string* error) {
    int log = open(logPath.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (log < 0) {
        *error = "cannot open " + logPath + ": " + strerror(errno);
        return false;
    }
    // Everything the child needs is made before the fork: the simulator has
    // threads, so the child may only make async-signal-safe calls.
    std::vector<std::string> entries;
    for (char** e = environ; *e != nullptr; ++e) {
        std::string entry(*e);
        if (env.count(entry.substr(0, entry.find('='))) == 0) {
            entries.push_back(entry);
        }
    }
    for (const auto& entry : env) {
        entries.push_back(entry.first + "=" + entry.second);
    }
    std::vector<char*> envp;
    for (std::string& entry : entries) {
        envp.push_back(&entry[0]);
    }
    envp.push_back(nullptr);
    char* argv[] = {const_cast<char*>(program.c_str()), nullptr};
    int null = open("/dev/null", O_RDONLY | O_CLOEXEC);
    pid_t parent = getpid();
    pid_t pid = fork();
    if (pid < 0) {
        *error = std::string("cannot fork: ") + strerror(errno);
        close(log);
        if (null >= 0) {
            close(null);
        }
        return false;
    }
    if (pid == 0) {
        setpgid(0, 0);
        prctl(PR_SET_PDEATHSIG, SIGTERM);
        if (getppid() != parent) {
            _exit(127);
        }
        sigset_t none;
        sigemptyset(&none);
        sigprocmask(SIG_SETMASK, &none, nullptr);
        signal(SIGINT, SIG_DFL);
        signal(SIGTERM, SIG_DFL);
        signal(SIGHUP, SIG_DFL);
        // dup2 clears close-on-exec on the copies.
        dup2(log, STDERR_FILENO);
        dup2(log, STDOUT_FILENO);
        if (null >= 0) {
            dup2(null, STDIN_FILENO);
        }
        execve(program.c_str(), argv, envp.data());
        _exit(127);
    }
    if (null >= 0) {
        close(null);
    }
    close(log);
    setpgid(pid, pid);
    mPid = pid;
    mStatus = -1;
    return true;
}

bool DaemonProcess::running() {
    if (mPid <= 0) {
        return false;
    }
    int status = 0;
    pid_t done = waitpid(mPid, &status, WNOHANG);
    if (done == mPid) {
        mStatus = exitStatus(status);
        // Anything the daemon left in its group goes with it.
        kill(-mPid, SIGKILL);
        mPid = -1;
        return false;
    }
    return true;
}

int DaemonProcess::stop(int graceMs) {
    if (mPid <= 0) {
        return mStatus;
    }
    kill(mPid, SIGTERM);
    struct timespec step = {0, 20 * 1000 * 1000};
    for (int waited = 0; waited < graceMs && running(); waited += 20) {
        nanosleep(&step, nullptr);
    }
    if (mPid > 0) {
        kill(-mPid, SIGKILL);
        int status = 0;
        while (waitpid(mPid, &status, 0) < 0 && errno == EINTR) {
        }
        mStatus = exitStatus(status);
        mPid = -1;
    }
    return mStatus;
}

}  // namespace sim
}  // namespace kelvo
