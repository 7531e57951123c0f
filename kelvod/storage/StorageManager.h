#pragma once

#include <stdint.h>
#include <sys/types.h>
#include <utils/String8.h>

#include <atomic>
#include <map>
#include <string>
#include <vector>

namespace kelvo {

class DatabaseCopier;

// Kinds of files kept next to the database.
enum storage_file_type {
    STORAGE_FILE_DB = 0,  // "kelvo-<time ms>.db": a copy of the database
    STORAGE_FILE_ZIP = 1, // "kelvo-<time ms>-<age>.zip": zipped copies, age 0 newest
};

enum remote_debug_action {
    REMOTE_DEBUG_OPEN = 0,
    REMOTE_DEBUG_CAPTURE = 1,
    REMOTE_DEBUG_CLOSE = 2,
};

// The files around the database: the daily backup zips (six days, ages 0..5),
// the daily upload copies of beta users, copies for sampling collections and
// remote debugging, and moving a database aside. Runs on the storage thread;
// the copies themselves are taken through the DatabaseCopier.
//
// Paths given to the public methods are device paths (resolved through
// RootPath here); client paths are also checked to lie in a collection place.
// The private helpers work on resolved host paths.
class StorageManager {
public:
    static constexpr const char* kDatabasePath = "/data/log/kelvo/kelvo.db";
    static constexpr const char* kDatabaseDir = "/data/log/kelvo";
    static constexpr const char* kBackupDir = "/data/log/kelvo/backup";
    static constexpr const char* kUploadDir = "/data/log/kelvo/upload";
    // Collection directories of clients must lie below this one.
    static constexpr const char* kCollectParentDir = "/data/log";
    static constexpr const char* kFinishFileName = "903";
    static constexpr int32_t kDailyUploadEventId = 903999001;
    static constexpr uid_t kSystemId = 1000;
    static constexpr int32_t kUserTypeDomesticBeta = 3;
    static constexpr int32_t kUserTypeOverseasBeta = 5;
    static constexpr int32_t kBackupKeepCount = 7;
    static constexpr int32_t kUploadKeepCount = 0;
    static constexpr int32_t kMaxSamplingDay = 6;
    static constexpr int32_t kPathWaitTimes = 3;
    static constexpr int64_t kDefaultPathWaitMs = 1000;
    static constexpr int64_t kDayMs = 86400000;

    // STORAGE_FILE_DB and STORAGE_FILE_ZIP to sorted file names.
    using FileList = std::map<int32_t, std::vector<std::string>>;
    // Uploads the database rows of [from, to) (ms); negative on failure.
    typedef int32_t (*DailyUploadHook)(int64_t from, int64_t to);

    explicit StorageManager(DatabaseCopier* copier);

    // Moves the database (with its journal files) into the backup directory
    // after zipping the copies already there.
    int32_t moveDatabase();
    // The daily step: drops expired files, backs the database up, trims
    // oversized files.
    int32_t cleanDatabase(int64_t time);
    // Fills a client's collection directory with the database of a day
    // ("day=N" in extra, 0 today, default 1) and writes the finish marker.
    int32_t samplingUpload(const android::String8& path, const android::String8& extra);
    // REMOTE_DEBUG_OPEN ("day=N"), REMOTE_DEBUG_CAPTURE (argument: the
    // collection directory), REMOTE_DEBUG_CLOSE.
    int32_t remoteDebug(int32_t action, const android::String8& argument);
    int32_t getRemoteDebugDay() const { return mRemoteDebugDay; }

    // Deletes dir/name when it is larger than threshold bytes.
    static int32_t checkFileSize(const std::string& dir, const std::string& name, int64_t threshold);
    // Lists the copies and zips of dir (with the journal files of the copies
    // left alone) and deletes everything else in it. A missing dir is an
    // empty list.
    static int32_t getValidFileList(const std::string& dir, FileList* list);
    // The name of the next generation of a file: "kelvo.db" becomes
    // "kelvo-<time>.db", "kelvo-<t>-<n>.zip" becomes "kelvo-<t>-<n+1>.zip".
    static int32_t makeBackupName(const std::string& path, std::string* name, int64_t time);
    // Largest allowed size of a file of the type for this device's user type.
    static int64_t getFileSizeThreshold(int32_t type);

    // The uploader of the beta users' daily data.
    static void setDailyUploadHook(DailyUploadHook hook);
    // Pause between the checks for a collection directory (tests shorten it).
    static void setPathWaitMs(int64_t ms);

private:
    static int32_t listValidFiles(const std::string& dir, FileList* list);
    static int32_t checkHostFileSize(const std::string& dir, const std::string& name,
                                     int64_t threshold);
    int32_t backupDatabase(int64_t time);
    int32_t backupFile(const std::string& dir, const std::string& name, uid_t owner, gid_t group);
    int32_t uploadDailyData(int64_t time);
    int32_t renameFiles(const std::string& dir);
    int32_t zipDbFiles(const std::string& srcDir, const std::string& destDir, int32_t number);
    int32_t cleanFiles(const std::string& dir, int32_t keep);
    int32_t cleanFiles(const std::string& dir, const std::string& extension);
    int32_t cleanExpiredFiles();
    int32_t checkDirSize(const std::string& dir);
    int32_t moveCompanions(const std::string& src, const std::string& dest);

    int32_t uploadSamplingData(const std::string& path, int32_t day, bool capture);
    int32_t resolveCollectDir(const std::string& path, std::string* dir);
    int32_t uploadBackup(const std::string& backupDir, const std::string& dir, int32_t day,
                         bool capture);
    int32_t uploadCurrent(const std::string& dir, bool capture);
    int32_t getZipFileName(const std::string& dir, int32_t age, std::string* path);
    int32_t remoteDebugOpen(const android::String8& argument);
    int32_t remoteDebugCapture(const android::String8& argument);

    static int32_t getUserType();
    static bool isBetaUser(int32_t userType);

    DatabaseCopier* mCopier;
    // Day of the open remote debug session (0..6), -1 when closed.
    int32_t mRemoteDebugDay;

    static std::atomic<DailyUploadHook> sDailyUploadHook;
    static std::atomic<int64_t> sPathWaitMs;
};

} // namespace kelvo
