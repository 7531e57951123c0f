#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <random>
#include <string>
#include <thread>

#include "common/TestEnv.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/KelvoStorage.h"

using kelvo::test::DirectDb;
using kelvo::test::TempRoot;

namespace {

// Runs the writer on the root, reads its reports until `flushes` commits were
// seen, lets it run a random while longer, kills it and returns the last
// committed total it reported.
long long runAndKill(const std::string& root, int flushes, int extraMs) {
    int out[2];
    if (pipe(out) != 0) return -1;
    pid_t pid = fork();
    if (pid == 0) {
        dup2(out[1], STDOUT_FILENO);
        close(out[0]);
        close(out[1]);
        execl(KELVO_CRASH_WRITER, KELVO_CRASH_WRITER, root.c_str(), static_cast<char*>(nullptr));
        _exit(127);
    }
    close(out[1]);
    FILE* in = fdopen(out[0], "r");
    long long committed = 0;
    char line[128];
    int seen = 0;
    while (seen < flushes && fgets(line, sizeof(line), in) != nullptr) {
        sscanf(line, "committed %lld", &committed);
        ++seen;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(extraMs));
    kill(pid, SIGKILL);
    int status = 0;
    waitpid(pid, &status, 0);
    // Reports written before the kill still count.
    while (fgets(line, sizeof(line), in) != nullptr) {
        sscanf(line, "committed %lld", &committed);
    }
    fclose(in);
    return seen == flushes ? committed : -1;
}

} // namespace

TEST(CrashSafetyTest, KilledMidFlushKeepsEveryCommittedRowAndAnIntactFile) {
    std::mt19937 random(std::random_device{}());
    for (int round = 0; round < 4; ++round) {
        TempRoot root;
        int extraMs = std::uniform_int_distribution<int>(0, 40)(random);
        long long committed = runAndKill(root.path(), 3 + round, extraMs);
        ASSERT_GT(committed, 0) << "the writer did not report its flushes";

        DirectDb db(root.path() + kelvo::KelvoStorage::kDatabasePath);
        ASSERT_TRUE(db.ok());
        EXPECT_EQ(std::vector<std::string>{"ok"}, db.column("PRAGMA integrity_check"));
        long long rows = db.scalar("SELECT COUNT(*) FROM raw_crash_test");
        // Every reported commit is there; at most the batch being committed
        // when the kill came may be there too, and only whole.
        EXPECT_GE(rows, committed);
        EXPECT_EQ(0, rows % 500) << "a flush was half written";
        EXPECT_EQ(rows, db.scalar("SELECT COUNT(DISTINCT seq) FROM raw_crash_test"));
        EXPECT_EQ(rows - 1, db.scalar("SELECT MAX(seq) FROM raw_crash_test"));
    }
}
