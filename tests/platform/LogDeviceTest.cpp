#include <errno.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <android-base/unique_fd.h>

#include "common/TestEnv.h"
#include "core/LoggerRecord.h"
#include "kelvo/LogDevice.h"
#include "kelvo/LogDeviceReader.h"
#include "kelvo/LogWriter.h"
#include "kelvo/RootPath.h"
#include "kelvo/WallClock.h"

using kelvo::LogDevice;
using kelvo::LogDeviceReader;
using kelvo::LogWriter;
using kelvo::RootPath;

namespace {

// One record as the dispatcher decodes it; the text is "(none)" without its
// terminator.
struct Record {
    int64_t time = 0;
    int32_t pid = 0;
    int priority = -1;
    std::string tag;
    std::string text;
};

// Reads one record, waiting at most timeoutMs; false on time-out or when it
// does not decode.
bool readRecord(int fd, Record* out, int timeoutMs = 10000) {
    struct pollfd pfd = {fd, POLLIN, 0};
    static uint8_t buf[70000];
    ssize_t n = poll(&pfd, 1, timeoutMs) == 1 ? read(fd, buf, sizeof(buf)) : -1;
    kelvo::LoggerRecord record;
    if (n < 0 || record.decode(buf, static_cast<size_t>(n)) != 0 || record.getTag() == nullptr) {
        return false;
    }
    const char* text = record.getText() != nullptr ? record.getText() : "(none)";
    *out = {record.getTime(), record.getPid(), record.getPriority(), record.getTag(), text};
    return true;
}

// Runs kelvo-log, which sits beside the test program in bin/, with the
// arguments; its exit status.
int runTool(const std::vector<std::string>& args) {
    char self[PATH_MAX] = {};
    ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
    std::string command(self, n > 0 ? static_cast<size_t>(n) : 0);
    command = command.substr(0, command.find_last_of('/') + 1) + "kelvo-log";
    for (const std::string& arg : args) {
        command += " '" + arg + "'";
    }
    // Its complaints are expected; keep the test output clean.
    int status = system((command + " 2>/dev/null").c_str());
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

class LogDeviceTest : public ::testing::Test {
protected:
    // The host socket's reader, closed when it goes.
    android::base::unique_fd openReader() {
        return android::base::unique_fd(LogDevice::openForReading(mPath.c_str()));
    }

    std::unique_ptr<kelvo::test::TempRoot> mRoot = std::make_unique<kelvo::test::TempRoot>();
    std::string mPath = RootPath::resolve(KELVO_LOG_DEVICE);
};

} // namespace

TEST_F(LogDeviceTest, WrittenRecordsAreReadOneWholeRecordPerReadAndBadOnesRefused) {
    android::base::unique_fd fd = openReader();
    ASSERT_GE(fd, 0) << strerror(errno);
    LogWriter writer(mPath);
    // The last time the unsigned seconds field holds.
    const int64_t kLastMs = 4294967295LL * 1000 + 999;
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_WARN, "KELVO_TAG_BRIGHTNESS", "brightness=120",
                              kLastMs));
    Record first;
    ASSERT_TRUE(readRecord(fd, &first));
    EXPECT_EQ(getpid(), first.pid);
    EXPECT_EQ(kLastMs, first.time);
    EXPECT_EQ(LogWriter::PRIORITY_WARN, first.priority);
    EXPECT_EQ("KELVO_TAG_BRIGHTNESS", first.tag);
    EXPECT_EQ("brightness=120", first.text);

    // Without a time the wall clock stamps the record, read from the same
    // clock at the same precision.
    auto wallMs = [] {
        struct timespec ts = {};
        EXPECT_EQ(0, kelvo::WallClock::getTime(&ts));
        return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
    };
    int64_t before = wallMs();
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "now"));
    int64_t after = wallMs();
    Record stamped;
    ASSERT_TRUE(readRecord(fd, &stamped));
    EXPECT_GE(stamped.time, before);
    EXPECT_LE(stamped.time, after);

    // What a record cannot carry is refused and never reaches the reader.
    EXPECT_EQ(-EINVAL, writer.write(LogWriter::PRIORITY_INFO, nullptr, "a=1"));
    EXPECT_EQ(-EINVAL, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", nullptr));
    EXPECT_EQ(-EINVAL, writer.write(256, "KELVO_TAG_X", "a=1"));
    EXPECT_EQ(-EINVAL, writer.write(-1, "KELVO_TAG_X", "a=1"));
    EXPECT_EQ(-EINVAL, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "a=1", kLastMs + 1));
    // The payload length field has 16 bits: priority, two terminators and
    // the tag leave this much for the text.
    std::string tooLong(LogDevice::kMaxPayloadSize - 3 - strlen("KELVO_TAG_X") + 1, 'x');
    EXPECT_EQ(-EMSGSIZE, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", tooLong.c_str()));
    EXPECT_FALSE(readRecord(fd, &stamped, 100));
    // Without a reader there is nothing to write to.
    fd.reset();
    ASSERT_EQ(0, unlink(mPath.c_str()));
    EXPECT_EQ(-ENOENT, LogWriter(mPath).write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "a=1"));
}

// What the daemon sees through its reader, whatever stands behind the path.
TEST_F(LogDeviceTest, ReaderGivesWholeRecordsAndHidesTheHostSocket) {
    LogDeviceReader reader;
    uint8_t buf[256];
    EXPECT_EQ(-1, reader.read(buf, sizeof(buf)));
    EXPECT_EQ(EBADF, errno);
    ASSERT_EQ(0, reader.open(KELVO_LOG_DEVICE)) << strerror(errno);
    EXPECT_EQ(mPath, reader.getPath());
    LogWriter writer(mPath);
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "a=1", 5000));
    ASSERT_EQ(0, writer.writeRaw("", 0));
    // One record per read; an empty record is no end of the device.
    EXPECT_EQ(static_cast<ssize_t>(LogDevice::kHeaderSize + 1 + 12 + 4),
              reader.read(buf, sizeof(buf)));
    EXPECT_STREQ("a=1", reinterpret_cast<char*>(buf) + LogDevice::kHeaderSize + 1 + 12);
    EXPECT_EQ(0, reader.read(buf, sizeof(buf)));
    // A read blocked in another thread can be woken.
    ssize_t blocked = 1;
    std::thread waiter([&] { blocked = reader.read(buf, sizeof(buf)); });
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    reader.interrupt();
    waiter.join();
    EXPECT_LE(blocked, 0);
    reader.close();

    // A failed open names the path it tried.
    kelvo::RootPath::setRoot((mRoot->path() + "/missing").c_str());
    EXPECT_EQ(-1, reader.open(KELVO_LOG_DEVICE));
    EXPECT_EQ(ENOENT, errno);
    EXPECT_EQ(mRoot->path() + "/missing/dev/tvlog_kelvo", reader.getPath());
    EXPECT_FALSE(reader.isOpen());
}

TEST_F(LogDeviceTest, ReaderReplacesAStaleSocketButNotALiveReader) {
    android::base::unique_fd first = openReader();
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
    first.reset();
    EXPECT_TRUE(kelvo::test::hostPathExists(mPath));
    EXPECT_EQ(-ECONNREFUSED, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "lost"));
    android::base::unique_fd second = openReader();
    ASSERT_GE(second, 0) << strerror(errno);
    // The writer finds the new reader by itself.
    ASSERT_EQ(0, writer.write(LogWriter::PRIORITY_INFO, "KELVO_TAG_X", "to second"));
    ASSERT_TRUE(readRecord(second, &record));
    EXPECT_EQ("to second", record.text);

    // A path longer than a socket address holds is refused.
    std::string deep = mRoot->path() + "/" + std::string(120, 'd');
    EXPECT_EQ(-1, LogDevice::openForReading(deep.c_str()));
    EXPECT_EQ(ENAMETOOLONG, errno);
}

TEST_F(LogDeviceTest, KelvoLogToolWritesOneRecordToTheRootsDevice) {
    // No reader: nothing written.
    EXPECT_EQ(1, runTool({"-r", mRoot->path(), "KELVO_TAG_X", "a=1"}));

    android::base::unique_fd fd = openReader();
    ASSERT_GE(fd, 0);
    ASSERT_EQ(0, runTool({"-r", mRoot->path(), "-p", "w", "-t", "1234567", "KELVO_TAG_APP_WAKEUP",
                          "procname=com.example", "source=alarm", "gpio=-1"}));
    Record record;
    ASSERT_TRUE(readRecord(fd, &record));
    EXPECT_EQ(LogWriter::PRIORITY_WARN, record.priority);
    EXPECT_EQ(1234567, record.time);
    EXPECT_EQ("KELVO_TAG_APP_WAKEUP", record.tag);
    EXPECT_EQ("procname=com.example source=alarm gpio=-1", record.text);

    // Bad usage, or a time the record cannot hold, writes nothing.
    for (auto option : {std::make_pair("-t", "12ms"), {"-p", "256"}}) {
        EXPECT_EQ(2, runTool({"-r", mRoot->path(), option.first, option.second, "KELVO_TAG_X"}));
    }
    EXPECT_EQ(1, runTool({"-r", mRoot->path(), "-t", "4294967296000", "KELVO_TAG_X", "a=1"}));
    EXPECT_FALSE(readRecord(fd, &record, 200));
}

TEST_F(LogDeviceTest, AWriterWaitsForRoomAndCanBeToldHowLong) {
    android::base::unique_fd fd = openReader();
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
