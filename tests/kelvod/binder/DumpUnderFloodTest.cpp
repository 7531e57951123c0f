// The real daemon on a private root: dumpsys --dump while another thread
// floods the log device with suspend/wake-up/resume records.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "kelvo/LogDevice.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/KelvoStorage.h"

extern char** environ;

namespace {

using kelvo::test::waitFor;
using std::chrono::milliseconds;

// A program built beside the test program in bin/.
std::string besideTests(const char* name) {
    char self[PATH_MAX] = {};
    ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
    std::string path(self, n > 0 ? static_cast<size_t>(n) : 0);
    return path.substr(0, path.find_last_of('/') + 1) + name;
}

// Standard output of dumpsys for the arguments, "[exit status N]" appended
// when it failed.
std::string dumpsys(const std::string& root, const std::string& args) {
    FILE* p = popen(
        (besideTests("dumpsys") + " -r " + root + " -t 30 KelvoService " + args).c_str(), "r");
    std::string out;
    char buf[4096];
    for (size_t got; p != nullptr && (got = fread(buf, 1, sizeof(buf), p)) > 0;) {
        out.append(buf, got);
    }
    int status = p != nullptr ? pclose(p) : -1;
    return status == 0 ? out : out + "[exit status " + std::to_string(status) + "]";
}

TEST(DumpUnderFloodTest, EveryOperatorDumpsAndNoRecordIsLost) {
    const std::string daemon = besideTests("kelvod");
    if (access(daemon.c_str(), X_OK) != 0) GTEST_SKIP() << "kelvod not built beside the tests";
    kelvo::test::TempRoot root;
    root.writeFile("/vendor/etc/xml/tv_kelvo_config.xml",
                   kelvo::test::readHostFile(KELVO_SAMPLE_CONFIG));
    const std::string log = root.path() + "/daemon.log";
    // The first of the name wins.
    std::vector<std::string> env = {"KELVO_ROOT=" + root.path()};
    for (char** e = environ; *e != nullptr; ++e) env.push_back(*e);
    std::vector<char*> envp;
    for (std::string& e : env) envp.push_back(&e[0]);
    envp.push_back(nullptr);
    char* argv[] = {const_cast<char*>(daemon.c_str()), nullptr};
    int logFd = open(log.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    ASSERT_GE(logFd, 0);
    pid_t pid = fork();
    if (pid == 0) {
        dup2(logFd, STDERR_FILENO);
        dup2(logFd, STDOUT_FILENO);
        execve(argv[0], argv, envp.data());
        _exit(127);
    }
    close(logFd);
    ASSERT_GT(pid, 0);
    const std::string device = kelvo::RootPath::resolve(KELVO_LOG_DEVICE);
    struct stat st;
    bool up = waitFor(
        [&] {
            return stat(device.c_str(), &st) == 0 &&
                   dumpsys(root.path(), "--version").find("Kelvo Daemon") == 0;
        },
        milliseconds(30000));

    // Triples within one hour, 3 ms apart: each makes one suspend row.
    const int64_t hour = (time(nullptr) / 3600 - 1) * 3600000LL;
    std::atomic<bool> stop{false};
    std::atomic<int> triples{0};
    std::atomic<int> failed{0};
    std::thread flood([&] {
        kelvo::LogWriter writer(device);
        writer.setTimeout(10000);
        for (int64_t t = hour; up && !stop && t < hour + 3000000; t += 3) {
            if (writer.write(kelvo::LogWriter::PRIORITY_INFO, "KELVO_TAG_KERNEL_SUSPEND", "", t) ||
                writer.write(kelvo::LogWriter::PRIORITY_INFO, "KELVO_TAG_KERNEL_WAKEUP",
                             "irq=flood gpio=0", t + 1) ||
                writer.write(kelvo::LogWriter::PRIORITY_INFO, "KELVO_TAG_KERNEL_RESUME", "", t + 2)) {
                failed++;
                return;
            }
            triples++;
        }
    });
    waitFor([&] { return triples.load() >= 500; }, milliseconds(10000));
    std::string out = up ? dumpsys(root.path(), "--dump") : "";
    int during = triples.load();
    waitFor([&] { return triples.load() >= during + 500; }, milliseconds(10000));
    stop = true;
    flood.join();

    // Every operator's section, none skipped.
    EXPECT_TRUE(up) << kelvo::test::readHostFile(log);
    EXPECT_NE(std::string::npos, out.find("SystemHandler: screen ")) << out;
    EXPECT_NE(std::string::npos, out.find("PollingRoutine: period=")) << out;
    EXPECT_EQ(std::string::npos, out.find("[exit status")) << out;
    EXPECT_EQ(0, failed.load());
    EXPECT_GT(triples.load(), during);
    // The daemon kept handling records: each triple became its row.
    kelvo::test::DirectDb db(root.path() + kelvo::KelvoStorage::kDatabasePath);
    long long rows = -1;
    EXPECT_TRUE(waitFor(
        [&] {
            dumpsys(root.path(), "--flush");
            rows = db.scalar("SELECT COUNT(*) FROM raw_system_suspend");
            return rows == triples.load();
        },
        milliseconds(60000)))
        << rows << " rows of " << triples.load();

    kill(pid, SIGTERM);
    int status = -1;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_EQ(0, status);
    std::string text = kelvo::test::readHostFile(log);
    EXPECT_EQ(std::string::npos, text.find("No dump from")) << text.substr(0, 4000);
}

}  // namespace
