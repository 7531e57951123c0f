#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <poll.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "common/TestEnv.h"
#include "kelvo/LogDevice.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"

extern char** environ;

using kelvo::LogDevice;
using kelvo::LogWriter;
using kelvo::RootPath;

namespace {

// A record as the reader sees it, taken apart field by field.
struct Record {
    size_t size = 0;
    unsigned payloadLength = 0;
    int32_t pid = 0;
    uint32_t seconds = 0;
    uint32_t nanoseconds = 0;
    int priority = -1;
    std::string tag;
    std::string text;
};

uint32_t le32(const uint8_t* at) {
    return at[0] | (at[1] << 8) | (at[2] << 16) | (static_cast<uint32_t>(at[3]) << 24);
}

// Reads one record, waiting at most timeoutMs; false on time-out.
bool readRecord(int fd, Record* out, int timeoutMs = 10000) {
    struct pollfd pfd = {fd, POLLIN, 0};
    if (poll(&pfd, 1, timeoutMs) != 1) {
        return false;
    }
    uint8_t buf[70000];
    ssize_t n = read(fd, buf, sizeof(buf));
    if (n < static_cast<ssize_t>(LogDevice::kHeaderSize)) {
        return false;
    }
    out->size = static_cast<size_t>(n);
    out->payloadLength = buf[0] | (buf[1] << 8);
    out->pid = static_cast<int32_t>(le32(buf + 4));
    out->seconds = le32(buf + 12);
    out->nanoseconds = le32(buf + 16);
    const char* payload = reinterpret_cast<const char*>(buf + LogDevice::kHeaderSize);
    size_t payloadSize = n - LogDevice::kHeaderSize;
    if (payloadSize == 0) {
        return true;
    }
    out->priority = static_cast<uint8_t>(payload[0]);
    out->tag = std::string(payload + 1, strnlen(payload + 1, payloadSize - 1));
    size_t textAt = 1 + out->tag.size() + 1;
    if (textAt < payloadSize) {
        out->text = std::string(payload + textAt, strnlen(payload + textAt, payloadSize - textAt));
    }
    return true;
}

std::string toolPath() {
    char self[PATH_MAX] = {};
    ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
    std::string dir = n > 0 ? std::string(self, n) : std::string();
    return dir.substr(0, dir.find_last_of('/') + 1) + "kelvo-log";
}

// Runs kelvo-log with the arguments; its exit status, or -1.
int runTool(const std::vector<std::string>& args) {
    std::string path = toolPath();
    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(path.c_str()));
    for (const std::string& arg : args) {
        argv.push_back(const_cast<char*>(arg.c_str()));
    }
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    // Its complaints are expected; keep the test output clean.
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
    pid_t pid;
    int err = posix_spawn(&pid, path.c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (err != 0) {
        return -1;
    }
    int status = 0;
    if (waitpid(pid, &status, 0) != pid || !WIFEXITED(status)) {
        return -1;
    }
    return WEXITSTATUS(status);
}

class LogDeviceTest : public ::testing::Test {
protected:
    void SetUp() override {
        mRoot.reset(new kelvo::test::TempRoot());
        mPath = RootPath::resolve(KELVO_LOG_DEVICE);
    }
    void TearDown() override {
        for (int fd : mReaders) {
            close(fd);
        }
        mRoot.reset();
    }
    int openReader() {
        int fd = LogDevice::openForReading(mPath.c_str());
        if (fd >= 0) {
            mReaders.push_back(fd);
        }
        return fd;
    }
    void closeReader(int fd) {
        close(fd);
        mReaders.erase(std::find(mReaders.begin(), mReaders.end(), fd));
    }

    std::unique_ptr<kelvo::test::TempRoot> mRoot;
    std::string mPath;
    std::vector<int> mReaders;
};

} // namespace

TEST_F(LogDeviceTest, WrittenRecordsAreReadOneWholeRecordPerRead) {
    int fd = openReader();
    ASSERT_GE(fd, 0) << strerror(errno);
    LogWriter writer(mPath);

    // Seconds above INT32_MAX: the field is unsigned.
    const int64_t kLate = 3000000000LL * 1000 + 123;
    ASSERT_EQ(
        0, writer.write(LogWriter::PRIORITY_WARN, "KELVO_TAG_BRIGHTNESS", "brightness=120", kLate));
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_SHUTDOWN", "", 999));

    Record first;
    ASSERT_TRUE(readRecord(fd, &first));
    EXPECT_EQ(first.size - LogDevice::kHeaderSize, first.payloadLength);
    EXPECT_EQ(getpid(), first.pid);
    EXPECT_EQ(3000000000u, first.seconds);
    EXPECT_EQ(123000000u, first.nanoseconds);
    EXPECT_EQ(LogWriter::PRIORITY_WARN, first.priority);
    EXPECT_EQ("KELVO_TAG_BRIGHTNESS", first.tag);
    EXPECT_EQ("brightness=120", first.text);

    // A tag-only record still ends with the text's terminator.
    Record second;
    ASSERT_TRUE(readRecord(fd, &second));
    EXPECT_EQ(1 + strlen("KELVO_TAG_SHUTDOWN") + 1 + 1, second.payloadLength);
    EXPECT_EQ(0u, second.seconds);
    EXPECT_EQ(999000000u, second.nanoseconds);
    EXPECT_EQ("KELVO_TAG_SHUTDOWN", second.tag);
    EXPECT_EQ("", second.text);

    // Without a time the wall clock stamps the record.
    time_t before = time(nullptr);
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "now"));
    Record third;
    ASSERT_TRUE(readRecord(fd, &third));
    EXPECT_GE(static_cast<time_t>(third.seconds), before);
    EXPECT_LE(static_cast<time_t>(third.seconds), time(nullptr));
}

TEST_F(LogDeviceTest, WriterRefusesWhatARecordCannotCarry) {
    // No reader yet: nothing to write to.
    LogWriter writer(mPath);
    EXPECT_EQ(-ENOENT, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "a=1"));

    int fd = openReader();
    ASSERT_GE(fd, 0);
    EXPECT_EQ(-EINVAL, writer.write(LogWriter::PRIORITY_INFO, nullptr, "a=1"));
    EXPECT_EQ(-EINVAL, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", nullptr));
    EXPECT_EQ(-EINVAL, writer.write(256, "KELVO_TAG_X", "a=1"));
    EXPECT_EQ(-EINVAL, writer.write(-1, "KELVO_TAG_X", "a=1"));
    const int64_t kLastMs = 4294967295LL * 1000 + 999;
    EXPECT_EQ(-EINVAL, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "a=1", kLastMs + 1));
    // The payload length field has 16 bits: priority, two terminators and
    // the tag leave this much for the text.
    std::string tag = "KELVO_TAG_X";
    std::string fits(LogDevice::kMaxPayloadSize - 3 - tag.size(), 'x');
    std::string tooLong = fits + "x";
    EXPECT_EQ(-EMSGSIZE, writer.write(LogWriter::PRIORITY_INFO, tag.c_str(), tooLong.c_str()));

    // Nothing refused reached the reader; the last valid time did.
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "last", kLastMs));
    Record record;
    ASSERT_TRUE(readRecord(fd, &record));
    EXPECT_EQ("last", record.text);
    EXPECT_EQ(4294967295u, record.seconds);
    EXPECT_EQ(999000000u, record.nanoseconds);
}

TEST_F(LogDeviceTest, ReaderReplacesAStaleSocketButNotALiveReaderOrAnotherFile) {
    int first = openReader();
    ASSERT_GE(first, 0);
    // A second reader while the first one lives is refused.
    EXPECT_EQ(-1, LogDevice::openForReading(mPath.c_str()));
    EXPECT_EQ(EADDRINUSE, errno);

    LogWriter writer(mPath);
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "to first"));
    Record record;
    ASSERT_TRUE(readRecord(first, &record));
    EXPECT_EQ("to first", record.text);

    // The first reader goes; its socket file stays behind, stale.
    closeReader(first);
    EXPECT_TRUE(kelvo::test::hostPathExists(mPath));
    EXPECT_EQ(-ECONNREFUSED, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "lost"));
    int second = openReader();
    ASSERT_GE(second, 0) << strerror(errno);
    // The writer finds the new reader by itself.
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "to second"));
    ASSERT_TRUE(readRecord(second, &record));
    EXPECT_EQ("to second", record.text);
    closeReader(second);

    // A file of another kind is left alone.
    ASSERT_EQ(0, unlink(mPath.c_str()));
    kelvo::test::writeHostFile(mPath, "not a device");
    EXPECT_EQ(-1, LogDevice::openForReading(mPath.c_str()));
    EXPECT_EQ(EEXIST, errno);
    EXPECT_EQ("not a device", kelvo::test::readHostFile(mPath));

    // A missing root is not made up.
    std::string nowhere = mRoot->path() + "/missing/dev/tvlog_kelvo";
    EXPECT_EQ(-1, LogDevice::openForReading(nowhere.c_str()));
    EXPECT_EQ(ENOENT, errno);
    // Nor is a path longer than a socket address holds.
    std::string deep = mRoot->path() + "/" + std::string(120, 'd');
    EXPECT_EQ(-1, LogDevice::openForReading(deep.c_str()));
    EXPECT_EQ(ENAMETOOLONG, errno);
}

TEST_F(LogDeviceTest, KelvoLogToolWritesOneRecordToTheRootsDevice) {
    ASSERT_TRUE(kelvo::test::hostPathExists(toolPath())) << toolPath();
    // No reader: nothing written.
    EXPECT_EQ(1, runTool({"-r", mRoot->path(), "KELVO_TAG_X", "a=1"}));

    int fd = openReader();
    ASSERT_GE(fd, 0);
    ASSERT_EQ(0, runTool({"-r", mRoot->path(), "-p", "w", "-t", "1234567", "KELVO_TAG_APP_WAKEUP",
                          "procname=com.example", "source=alarm", "gpio=-1"}));
    Record record;
    ASSERT_TRUE(readRecord(fd, &record));
    EXPECT_EQ(LogWriter::PRIORITY_WARN, record.priority);
    EXPECT_EQ(1234u, record.seconds);
    EXPECT_EQ(567000000u, record.nanoseconds);
    EXPECT_EQ("KELVO_TAG_APP_WAKEUP", record.tag);
    EXPECT_EQ("procname=com.example source=alarm gpio=-1", record.text);
    EXPECT_EQ(record.size - LogDevice::kHeaderSize, record.payloadLength);

    // The tag alone, a numeric priority, and a text that looks like an option.
    ASSERT_EQ(0, runTool({"-r", mRoot->path(), "-p", "6", "KELVO_TAG_SHUTDOWN"}));
    ASSERT_TRUE(readRecord(fd, &record));
    EXPECT_EQ(6, record.priority);
    EXPECT_EQ("KELVO_TAG_SHUTDOWN", record.tag);
    EXPECT_EQ("", record.text);
    ASSERT_EQ(0, runTool({"-r", mRoot->path(), "KELVO_TAG_X", "-p", "delta=-5"}));
    ASSERT_TRUE(readRecord(fd, &record));
    EXPECT_EQ(4, record.priority);
    EXPECT_EQ("-p delta=-5", record.text);

    // Bad usage writes nothing.
    EXPECT_EQ(2, runTool({"-r", mRoot->path()}));
    EXPECT_EQ(2, runTool({"-r", mRoot->path(), "-t", "-1", "KELVO_TAG_X", "a=1"}));
    EXPECT_EQ(2, runTool({"-r", mRoot->path(), "-t", "12ms", "KELVO_TAG_X", "a=1"}));
    EXPECT_EQ(2, runTool({"-r", mRoot->path(), "-p", "x", "KELVO_TAG_X", "a=1"}));
    EXPECT_EQ(2, runTool({"-r", mRoot->path(), "-p", "256", "KELVO_TAG_X", "a=1"}));
    // A time the record cannot hold is not written either.
    EXPECT_EQ(1, runTool({"-r", mRoot->path(), "-t", "4294967296000", "KELVO_TAG_X", "a=1"}));
    EXPECT_FALSE(readRecord(fd, &record, 200));
}

TEST_F(LogDeviceTest, AWriterWaitsForRoomAndCanBeToldHowLong) {
    int fd = openReader();
    ASSERT_GE(fd, 0);
    LogWriter writer(mPath);
    writer.setTimeout(100);
    // Nobody reads: the queue fills, then a write waits and gives up.
    int written = 0;
    int err = 0;
    while (written < 100000 && (err = writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X",
                                                   std::to_string(written).c_str())) == 0) {
        ++written;
    }
    EXPECT_EQ(-EAGAIN, err);
    ASSERT_GT(written, 0);
    ASSERT_LT(written, 100000);

    // Every record written is there, whole and in order, and none of the
    // one that gave up.
    Record record;
    for (int i = 0; i < written; ++i) {
        ASSERT_TRUE(readRecord(fd, &record));
        ASSERT_EQ(std::to_string(i), record.text);
    }
    EXPECT_FALSE(readRecord(fd, &record, 100));
    // With room again, the writer goes on.
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "again"));
    ASSERT_TRUE(readRecord(fd, &record));
    EXPECT_EQ("again", record.text);
}
