#include <binder/Parcel.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <map>
#include <random>
#include <regex>
#include <string>
#include <utility>
#include <vector>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "common/TestEnv.h"
#include "kelvo/HostProperties.h"
#include "kelvo/RootPath.h"
#include "storage/DatabaseCopier.h"
#include "storage/StorageManager.h"

using android::String8;
using kelvo::RootPath;
using kelvo::StorageManager;
using namespace kelvo::test;

namespace {

constexpr int64_t kDayMs = 86400000;
constexpr int64_t kFirstDay = 1700000000000;

// Contents of the database copies in dir, sorted.
std::vector<std::string> copiesIn(const std::string& dir) {
    std::vector<std::string> contents;
    for (const std::string& name : listDir(dir, "kelvo-[0-9]+\\.db")) {
        contents.push_back(readHostFile(dir + "/" + name));
    }
    std::sort(contents.begin(), contents.end());
    return contents;
}

std::string copyName(int64_t time) {
    return "kelvo-" + std::to_string(time) + ".db";
}

// Stands in for the storage thread: the copy is the live database file.
class FileCopier : public kelvo::DatabaseCopier {
public:
    int32_t doBackupCopy(const android::Parcel& data) override {
        std::string dest = data.readCString();
        if (mFail) {
            return -1;
        }
        writeHostFile(dest, readHostFile(RootPath::resolve(StorageManager::kDatabasePath)));
        if (mAfterCopy) {
            mAfterCopy();
        }
        return 0;
    }

    bool mFail = false;
    std::function<void()> mAfterCopy;
};

std::vector<std::pair<int64_t, int64_t>> gUploads;
int32_t gUploadResult = 0;

int32_t recordUpload(int64_t from, int64_t to) {
    gUploads.emplace_back(from, to);
    return gUploadResult;
}

// Each test runs on a fresh root whose own path holds '-' ("my-root"), so
// that backup names come from the base name only.
class StorageManagerTest : public ::testing::Test {
protected:
    StorageManagerTest() : mManager(&mCopier) {}

    void SetUp() override {
        std::string root = mTemp.path() + "/my-root";
        makeHostDirs(root);
        RootPath::setRoot(root.c_str());
        kelvo::HostProperties::reload();
        setUserType(1);
        kelvo::gLogInfoEnable.store(1);
        kelvo::gLogDebugEnable.store(1);
        StorageManager::setPathWaitMs(1);
        StorageManager::setDailyUploadHook(nullptr);
        gUploads.clear();
        gUploadResult = 0;
        kelvo::HealthCounters::resetForTest();
        mLive = RootPath::resolve(StorageManager::kDatabasePath);
        mBackup = RootPath::resolve(StorageManager::kBackupDir);
        mUpload = RootPath::resolve(StorageManager::kUploadDir);
        writeHostFile(mLive, "live database");
    }

    void TearDown() override {
        StorageManager::setPathWaitMs(StorageManager::kDefaultPathWaitMs);
        StorageManager::setDailyUploadHook(nullptr);
        kelvo::gLogUserType.store(-1);
    }

    // The user type is read once at start-up.
    void setUserType(int type) { kelvo::gLogUserType.store(type); }

    // Backup zips by age; a test fails when two share an age.
    std::map<int, std::string> backupZips() {
        std::map<int, std::string> zips;
        std::regex re("kelvo-[0-9]+-([0-9]+)\\.zip");
        for (const std::string& name : listDir(mBackup)) {
            std::smatch m;
            if (std::regex_match(name, m, re)) {
                int age = std::stoi(m[1]);
                EXPECT_EQ(0u, zips.count(age)) << name;
                zips[age] = mBackup + "/" + name;
            }
        }
        return zips;
    }

    // Daily cleans on days 1..days, each backing up "database of day N".
    void runDailyCleans(int days) {
        for (int day = 1; day <= days; ++day) {
            writeHostFile(mLive, "database of day " + std::to_string(day));
            ASSERT_EQ(0, mManager.cleanDatabase(kFirstDay + day * kDayMs));
        }
        writeHostFile(mLive, "live database");
    }

    std::string collectDir(const std::string& devicePath) {
        makeHostDirs(RootPath::resolve(devicePath));
        return RootPath::resolve(devicePath);
    }

    TempRoot mTemp;
    LogCapture mLog;
    FileCopier mCopier;
    StorageManager mManager;
    std::string mLive;
    std::string mBackup;
    std::string mUpload;
};

} // namespace

TEST_F(StorageManagerTest, DailyCleansKeepSixRotatingZips) {
    for (int day = 1; day <= 8; ++day) {
        SCOPED_TRACE(day);
        writeHostFile(mLive, "database of day " + std::to_string(day));
        ASSERT_EQ(0, mManager.cleanDatabase(kFirstDay + day * kDayMs));

        std::map<int, std::string> zips = backupZips();
        int kept = std::min(day, 6);
        ASSERT_EQ(static_cast<size_t>(kept), zips.size());
        for (int age = 0; age < kept; ++age) {
            ASSERT_EQ(1u, zips.count(age));
            std::map<std::string, std::string> entries = readZip(zips[age]);
            ASSERT_EQ(1u, entries.size());
            int copied = day - age;
            EXPECT_EQ("database of day " + std::to_string(copied),
                      entries[copyName(kFirstDay + copied * kDayMs)]);
            struct stat st = {};
            ASSERT_EQ(0, stat(zips[age].c_str(), &st));
            EXPECT_EQ(0664u, st.st_mode & 0777);
        }
        // Zipped copies are gone; only zips remain.
        EXPECT_EQ(static_cast<size_t>(kept), listDir(mBackup).size());
    }
    EXPECT_EQ(2u, mLog.count("expired: 7, DELETE!", ANDROID_LOG_INFO));
    EXPECT_EQ(2u, kelvo::HealthCounters::get(kelvo::Health::FilesDeleted));
}

TEST_F(StorageManagerTest, ListingKeepsWholeNamesOfCopiesAndZipsOnly) {
    std::string outside = mTemp.path() + "/outside.db";
    writeHostFile(outside, "not ours");
    for (const char* name :
         {"kelvo-12.db", "kelvo-12.db-wal", "kelvo-12-3.zip", "notes.txt", "kelvo-12.dbx",
          "kelvo-12-3.zipx", "kelvo-x.db", "kelvo- 12.db", "kelvo-12--3.zip", "kelvo-12.zip",
          "kelvo-12.db.db", "kelvo-12-3.zip.zip", "kelvo-9.db-journal"}) {
        writeHostFile(mBackup + "/" + name, "x");
    }
    ASSERT_EQ(0, symlink(outside.c_str(), (mBackup + "/kelvo-13.db").c_str()));
    makeHostDirs(mBackup + "/kelvo-14.db");

    StorageManager::FileList list;
    ASSERT_EQ(0, StorageManager::getValidFileList(StorageManager::kBackupDir, &list));
    EXPECT_EQ(std::vector<std::string>{"kelvo-12.db"}, list[kelvo::STORAGE_FILE_DB]);
    EXPECT_EQ(std::vector<std::string>{"kelvo-12-3.zip"}, list[kelvo::STORAGE_FILE_ZIP]);
    // The journal of a listed copy stays with it; everything else goes.
    EXPECT_EQ((std::vector<std::string>{"kelvo-12-3.zip", "kelvo-12.db", "kelvo-12.db-wal"}),
              listDir(mBackup));
    EXPECT_EQ("not ours", readHostFile(outside));
    EXPECT_EQ(12u, mLog.count("Error file(" + mBackup + "/", ANDROID_LOG_ERROR));

    // A stray file is gone after the next daily clean too, and so is a zip
    // whose age has no successor (it must not wrap round).
    writeHostFile(mBackup + "/notes.txt", "stray");
    writeHostFile(mBackup + "/kelvo-12-2147483647.zip", "x");
    ASSERT_EQ(0, mManager.cleanDatabase(kFirstDay));
    EXPECT_FALSE(hostPathExists(mBackup + "/notes.txt"));
    EXPECT_EQ(std::vector<std::string>{"kelvo-12-4.zip"}, listDir(mBackup, "kelvo-12-.*"));

    // A missing directory lists as empty; a file in its place cannot be listed.
    EXPECT_EQ(0, StorageManager::getValidFileList("/data/none", &list));
    EXPECT_TRUE(list[kelvo::STORAGE_FILE_DB].empty());
    writeHostFile(RootPath::resolve("/data/file"), "x");
    EXPECT_EQ(-2, StorageManager::getValidFileList("/data/file", &list));
}

TEST_F(StorageManagerTest, SizeLimitsDependOnUserType) {
    constexpr off_t kDbLimit = 31457280;
    struct Case {
        int userType;
        int32_t fileType;
        off_t size;
        bool kept;
    };
    const Case cases[] = {
        {1, kelvo::STORAGE_FILE_DB, kDbLimit, true},
        {1, kelvo::STORAGE_FILE_DB, kDbLimit + 1, false},
        {5, kelvo::STORAGE_FILE_DB, kDbLimit + 1, true}, // beta users keep larger copies
        {3, kelvo::STORAGE_FILE_ZIP, kDbLimit / 3, true},
        {1, kelvo::STORAGE_FILE_ZIP, kDbLimit / 3, false},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(testing::Message() << c.userType << " " << c.fileType << " " << c.size);
        setUserType(c.userType);
        // The live database, as checked before it is opened.
        writeHostFile(mLive, "");
        ASSERT_EQ(0, truncate(mLive.c_str(), c.size));
        writeHostFile(mLive + "-journal", "journal");
        ASSERT_EQ(0,
                  StorageManager::checkFileSize(StorageManager::kDatabaseDir, "kelvo.db",
                                                StorageManager::getFileSizeThreshold(c.fileType)));
        EXPECT_EQ(c.kept, hostPathExists(mLive));
        EXPECT_EQ(c.kept, hostPathExists(mLive + "-journal"));
    }
    EXPECT_EQ(2u, mLog.count("is too large", ANDROID_LOG_ERROR));
    EXPECT_EQ(0, StorageManager::getFileSizeThreshold(7));
    EXPECT_TRUE(mLog.contains("Invalid file type: 7", ANDROID_LOG_ERROR));
}

TEST_F(StorageManagerTest, DomesticBetaUsersUploadTheDailyCopy) {
    setUserType(3);
    StorageManager::setDailyUploadHook(recordUpload);
    for (int day = 1; day <= 2; ++day) {
        writeHostFile(mLive, "beta day " + std::to_string(day));
        int64_t time = kFirstDay + day * kDayMs;
        ASSERT_EQ(0, mManager.cleanDatabase(time));
        EXPECT_EQ(std::vector<std::string>{copyName(time)}, listDir(mUpload));
        EXPECT_EQ("beta day " + std::to_string(day), readHostFile(mUpload + "/" + copyName(time)));
        ASSERT_EQ(static_cast<size_t>(day), gUploads.size());
        EXPECT_EQ(std::make_pair(time - kDayMs, time), gUploads.back());
    }

    gUploadResult = -1;
    EXPECT_NE(0, mManager.cleanDatabase(kFirstDay + 3 * kDayMs));
    EXPECT_TRUE(mLog.contains("Failed to upload database data", ANDROID_LOG_ERROR));
    StorageManager::setDailyUploadHook(nullptr);
    EXPECT_NE(0, mManager.cleanDatabase(kFirstDay + 4 * kDayMs));

    // Other users upload nothing; yesterday's upload copy is dropped.
    setUserType(1);
    size_t calls = gUploads.size();
    StorageManager::setDailyUploadHook(recordUpload);
    ASSERT_EQ(0, mManager.cleanDatabase(kFirstDay + 5 * kDayMs));
    EXPECT_TRUE(listDir(mUpload).empty());
    EXPECT_TRUE(mLog.contains(copyName(kFirstDay + 4 * kDayMs) + ") left over, DELETE!"));
    EXPECT_EQ(calls, gUploads.size());
    EXPECT_TRUE(mLog.contains("No need to upload database: 1", ANDROID_LOG_INFO));
}

TEST_F(StorageManagerTest, SamplingUploadTakesTheAskedDayBelowDataLog) {
    runDailyCleans(3);
    struct Case {
        const char* extra;
        std::string content;
    };
    const Case cases[] = {
        {"day=9", "database of day 3"}, // unreadable: yesterday
        {"", "database of day 3"},      {"day=0", "live database"},
        {"day=2", "database of day 2"}, {"mode=x,day=3", "database of day 1"},
        {"day=5", "live database"}, // no zip that old: today's instead
    };
    int n = 0;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.extra);
        std::string device = "/data/log/collect" + std::to_string(n++);
        std::string dir = collectDir(device);
        ASSERT_EQ(0, mManager.samplingUpload(String8(device.c_str()), String8(c.extra)));
        EXPECT_EQ(std::vector<std::string>{c.content}, copiesIn(dir));
        EXPECT_TRUE(hostPathExists(dir + "/903"));
        EXPECT_EQ(2u, listDir(dir).size());
    }
    EXPECT_EQ(1u, mLog.count("Failed to parse extra message: day=9", ANDROID_LOG_ERROR));
    EXPECT_TRUE(mLog.contains("Upload current file instead of backup file(5)", ANDROID_LOG_ERROR));

    // Beta users get today's database besides the day asked for.
    setUserType(5);
    std::string dir = collectDir("/data/log/beta");
    ASSERT_EQ(0, mManager.samplingUpload(String8("/data/log/beta"), String8("day=2")));
    EXPECT_EQ((std::vector<std::string>{"database of day 2", "live database"}), copiesIn(dir));

    // A failed copy is reported, and the collection still ends.
    setUserType(1);
    mCopier.mFail = true;
    dir = collectDir("/data/log/failed");
    EXPECT_NE(0, mManager.samplingUpload(String8("/data/log/failed"), String8("day=0")));
    EXPECT_TRUE(hostPathExists(dir + "/903"));


    // Collection folders lie below /data/log, outside the daemon's own.
    std::vector<std::string> backupBefore = listDir(mBackup);
    std::string outside = mTemp.path() + "/outside";
    makeHostDirs(outside);
    makeHostDirs(RootPath::resolve("/data/log"));
    ASSERT_EQ(0, symlink(outside.c_str(), RootPath::resolve("/data/log/escape").c_str()));
    makeHostDirs(RootPath::resolve("/data/elsewhere"));

    for (const char* path : {"", "../evil.db", "data/log/x", "/data/log/../../evil",
                             "/data/log/../elsewhere", "/data/log/escape", "/data/elsewhere",
                             "/data/log", "/data/log/kelvo", "/data/log/kelvo/backup"}) {
        SCOPED_TRACE(path);
        EXPECT_EQ(-5, mManager.samplingUpload(String8(path), String8("day=0")));
    }
    EXPECT_TRUE(listDir(outside).empty());
    EXPECT_TRUE(listDir(RootPath::resolve("/data/elsewhere")).empty());
    EXPECT_EQ(backupBefore, listDir(mBackup));

    // The finish marker is never another file's second name.
    std::string victim = mTemp.path() + "/victim";
    writeHostFile(victim, "not ours");
    ASSERT_EQ(0, chmod(victim.c_str(), 0600));
    dir = collectDir("/data/log/linked");
    ASSERT_EQ(0, link(victim.c_str(), (dir + "/903").c_str()));
    EXPECT_EQ(-14, mManager.samplingUpload(String8("/data/log/linked"), String8("day=0")));
    struct stat st = {};
    ASSERT_EQ(0, stat(victim.c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 0777);

    EXPECT_EQ(-2, mManager.samplingUpload(String8("/data/log/missing"), String8()));
    EXPECT_TRUE(mLog.contains("Nonexistent path: /data/log/missing", ANDROID_LOG_ERROR));
}

TEST_F(StorageManagerTest, RemoteDebugCaptureFollowsSessionAndUserType) {
    runDailyCleans(2);
    String8 device("/data/log/remote");
    std::string dir = collectDir("/data/log/remote");

    // Closed, on an ordinary device: nothing to capture.
    EXPECT_EQ(-2, mManager.remoteDebug(kelvo::REMOTE_DEBUG_CAPTURE, device));
    EXPECT_TRUE(listDir(dir).empty());

    // An open session on day 2 hands over the zip of two days ago as it is.
    ASSERT_EQ(0, mManager.remoteDebug(kelvo::REMOTE_DEBUG_OPEN, String8("day=2")));
    ASSERT_EQ(0, mManager.remoteDebug(kelvo::REMOTE_DEBUG_CAPTURE, device));
    std::vector<std::string> zips = listDir(dir, "kelvo-[0-9]+-2\\.zip");
    ASSERT_EQ(1u, zips.size());
    EXPECT_EQ(readHostFile(backupZips()[1]), readHostFile(dir + "/" + zips[0]));
    EXPECT_TRUE(hostPathExists(dir + "/903"));
    EXPECT_EQ(2, mManager.getRemoteDebugDay());

    ASSERT_EQ(0, mManager.remoteDebug(kelvo::REMOTE_DEBUG_CLOSE, String8()));
    EXPECT_EQ(-1, mManager.getRemoteDebugDay());

    // Beta devices capture today's database, zipped, without a session.
    setUserType(3);
    String8 betaDevice("/data/log/remote-beta");
    std::string betaDir = collectDir("/data/log/remote-beta");
    ASSERT_EQ(0, mManager.remoteDebug(kelvo::REMOTE_DEBUG_CAPTURE, betaDevice));
    zips = listDir(betaDir, "kelvo-[0-9]+-0\\.zip");
    ASSERT_EQ(1u, zips.size());
    std::map<std::string, std::string> entries = readZip(betaDir + "/" + zips[0]);
    ASSERT_EQ(1u, entries.size());
    EXPECT_EQ("live database", entries.begin()->second);
    EXPECT_TRUE(listDir(betaDir, ".*\\.db").empty());
    EXPECT_TRUE(mLog.contains("Remote debug capture log success, day: 0", ANDROID_LOG_INFO));

    // A bad day opens on day 0; on beta devices a capture ends the session.
    ASSERT_EQ(0, mManager.remoteDebug(kelvo::REMOTE_DEBUG_OPEN, String8("day=12")));
    EXPECT_EQ(0, mManager.getRemoteDebugDay());
    EXPECT_TRUE(mLog.contains("Failed to parse extra message: day=12", ANDROID_LOG_ERROR));
    ASSERT_NE(0, mManager.remoteDebug(kelvo::REMOTE_DEBUG_CAPTURE, String8("/data/log/none")));
    EXPECT_EQ(-1, mManager.getRemoteDebugDay());
    EXPECT_EQ(-3, mManager.remoteDebug(9, String8()));
}

// Copies left in the backup folder (a failed zip's, a database moved aside)
// go into the next zip.
TEST_F(StorageManagerTest, CopiesLeftInBackupGoIntoTheNextZip) {
    // A failed zip keeps its copy. Incompressible content, so that the zip
    // must outgrow the file size limit set once the copy is written (root
    // ignores file modes).
    std::mt19937 random(42);
    std::string payload(256 * 1024, '\0');
    for (char& c : payload) {
        c = static_cast<char>(random());
    }
    writeHostFile(mLive, payload);
    struct rlimit saved = {};
    ASSERT_EQ(0, getrlimit(RLIMIT_FSIZE, &saved));
    sighandler_t oldHandler = signal(SIGXFSZ, SIG_IGN);
    mCopier.mAfterCopy = [&saved] {
        struct rlimit small = saved;
        small.rlim_cur = 16384;
        setrlimit(RLIMIT_FSIZE, &small);
    };
    int32_t ret = mManager.cleanDatabase(kFirstDay);
    setrlimit(RLIMIT_FSIZE, &saved);
    signal(SIGXFSZ, oldHandler);
    mCopier.mAfterCopy = nullptr;

    EXPECT_NE(0, ret);
    EXPECT_TRUE(mLog.contains("Failed to zip file", ANDROID_LOG_ERROR));
    EXPECT_EQ(std::vector<std::string>{copyName(kFirstDay)}, listDir(mBackup));
    EXPECT_EQ(payload, readHostFile(mBackup + "/" + copyName(kFirstDay)));

    // A database moved aside takes its journal files along.
    const char* suffixes[] = {"-journal", "-wal", "-shm"};
    writeHostFile(mLive, "moved database");
    for (const char* suffix : suffixes) {
        writeHostFile(mLive + suffix, std::string("old") + suffix);
    }
    ASSERT_EQ(0, mManager.moveDatabase());
    EXPECT_EQ(std::vector<std::string>{"backup"},
              listDir(RootPath::resolve(StorageManager::kDatabaseDir)));
    std::vector<std::string> copies = listDir(mBackup, "kelvo-[0-9]+\\.db");
    ASSERT_EQ(1u, copies.size());
    std::string moved = copies[0];
    // The move zips the copies already there first.
    EXPECT_EQ(payload, readZip(backupZips()[0])[copyName(kFirstDay)]);
    EXPECT_EQ("moved database", readHostFile(mBackup + "/" + moved));
    for (const char* suffix : suffixes) {
        EXPECT_EQ(std::string("old") + suffix, readHostFile(mBackup + "/" + moved + suffix));
    }

    // The next clean (a rebuild's or the day's) zips the set with its copy.
    writeHostFile(mLive, "rebuilt database");
    ASSERT_EQ(0, mManager.cleanDatabase(kFirstDay + kDayMs));
    std::map<std::string, std::string> entries = readZip(backupZips()[0]);
    EXPECT_EQ(5u, entries.size());
    EXPECT_EQ("rebuilt database", entries[copyName(kFirstDay + kDayMs)]);
    EXPECT_EQ("moved database", entries[moved]);
    EXPECT_EQ("old-wal", entries[moved + "-wal"]);
    EXPECT_FALSE(hostPathExists(mBackup + "/" + moved + "-journal"));

    // Journal files of a database that is gone must not meet the next one.
    ASSERT_EQ(0, unlink(mLive.c_str()));
    writeHostFile(mLive + "-wal", "stale");
    EXPECT_EQ(-2, mManager.moveDatabase());
    EXPECT_FALSE(hostPathExists(mLive + "-wal"));
}
