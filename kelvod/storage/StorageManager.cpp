#include "storage/StorageManager.h"

#include <android-base/stringprintf.h>
#include <binder/Parcel.h>
#include <dirent.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstring>
#include <set>
#include <thread>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "kelvo/RootPath.h"
#include "storage/DatabaseCopier.h"
#include "utils/FileUtils.h"
#include "utils/TimeProvider.h"
#include "utils/ZipUtils.h"

using android::String8;
using android::base::StringPrintf;

namespace kelvo {

std::atomic<StorageManager::DailyUploadHook> StorageManager::sDailyUploadHook{nullptr};
std::atomic<int64_t> StorageManager::sPathWaitMs{StorageManager::kDefaultPathWaitMs};

namespace {

constexpr const char* kDbExtension = ".db";
constexpr const char* kZipExtension = ".zip";
constexpr const char* kNamePrefix = "kelvo-";
constexpr mode_t kDirMode = 0775;
constexpr mode_t kFileMode = 0664;
// Files SQLite keeps beside a database; they belong to it wherever it goes.
constexpr const char* kCompanionSuffixes[] = {"-journal", "-wal", "-shm"};

// Reads an unsigned decimal (digits only, at least one, at most max) at *pos.
bool readNumber(const std::string& text, size_t* pos, int64_t max, int64_t* value) {
    size_t i = *pos;
    int64_t n = 0;
    while (i < text.size() && isdigit(static_cast<unsigned char>(text[i]))) {
        int digit = text[i] - '0';
        if (n > (max - digit) / 10) {
            return false;
        }
        n = n * 10 + digit;
        ++i;
    }
    if (i == *pos) {
        return false;
    }
    *pos = i;
    *value = n;
    return true;
}

bool endsWith(const std::string& text, const std::string& suffix) {
    return text.size() >= suffix.size() &&
           text.compare(text.size() - suffix.size(), suffix.size(), suffix) == 0;
}

// The fields of a copy or zip name: "kelvo-<time>.db" or
// "kelvo-<time>-<age>.zip", matched over the whole name.
struct NameFields {
    int32_t count = 0; // fields read before the match ended
    bool whole = false;
    int64_t time = 0;
    int32_t age = 0;
};

NameFields scanName(const std::string& name, bool zip) {
    NameFields fields;
    std::string prefix = kNamePrefix;
    if (name.compare(0, prefix.size(), prefix) != 0) {
        return fields;
    }
    size_t pos = prefix.size();
    if (!readNumber(name, &pos, INT64_MAX, &fields.time)) {
        return fields;
    }
    fields.count = 1;
    if (!zip) {
        fields.whole = name.compare(pos, std::string::npos, kDbExtension) == 0;
        return fields;
    }
    int64_t age = 0;
    if (pos >= name.size() || name[pos] != '-') {
        return fields;
    }
    ++pos;
    if (!readNumber(name, &pos, INT32_MAX, &age)) {
        return fields;
    }
    fields.count = 2;
    fields.age = static_cast<int32_t>(age);
    fields.whole = name.compare(pos, std::string::npos, kZipExtension) == 0;
    return fields;
}

// The database name a journal, WAL or shared-memory file belongs to; empty
// for other names.
std::string companionOwner(const std::string& name) {
    for (const char* suffix : kCompanionSuffixes) {
        if (endsWith(name, suffix)) {
            return name.substr(0, name.size() - strlen(suffix));
        }
    }
    return std::string();
}

// The companions of dir/name that exist, as paths.
std::vector<std::string> existingCompanions(const std::string& path) {
    std::vector<std::string> found;
    for (const char* suffix : kCompanionSuffixes) {
        std::string companion = path + suffix;
        if (FileUtils::exists(companion.c_str())) {
            found.push_back(companion);
        }
    }
    return found;
}

// "day=N" in a client's text: 1 with the day when present and in 0..6, 0
// when the text has no day, -1 when the day cannot be read.
int32_t parseDay(const char* text, int32_t* day) {
    if (text == nullptr || text[0] == '\0') {
        return 0;
    }
    std::string s = text;
    size_t key = std::string::npos;
    for (size_t pos = s.find("day="); pos != std::string::npos; pos = s.find("day=", pos + 1)) {
        if (pos == 0 || !isalnum(static_cast<unsigned char>(s[pos - 1]))) {
            key = pos;
            break;
        }
    }
    if (key == std::string::npos) {
        return 0;
    }
    size_t pos = key + 4;
    int64_t value = 0;
    if (!readNumber(s, &pos, INT32_MAX, &value) || value > StorageManager::kMaxSamplingDay ||
        (pos < s.size() && isalnum(static_cast<unsigned char>(s[pos])))) {
        return -1;
    }
    *day = static_cast<int32_t>(value);
    return 1;
}

bool hasDotDotComponent(const std::string& path) {
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string::npos) {
            end = path.size();
        }
        if (path.compare(start, end - start, "..") == 0) {
            return true;
        }
        start = end + 1;
    }
    return false;
}

std::string realPath(const std::string& path) {
    char* real = realpath(path.c_str(), nullptr);
    if (real == nullptr) {
        return std::string();
    }
    std::string result = real;
    free(real);
    return result;
}

bool isBelow(const std::string& path, const std::string& dir) {
    return path.size() > dir.size() + 1 && path.compare(0, dir.size(), dir) == 0 &&
           path[dir.size()] == '/';
}

int64_t now() {
    return TimeProvider::getCurrentTime(TIME_TYPE_WALL);
}

// Deletes a file a clean gives up (the caller has logged why); counted, as
// what it held is gone.
int32_t discardFile(const char* path) {
    int32_t ret = FileUtils::deleteFile(path);
    if (ret == 0) {
        HealthCounters::add(Health::FilesDeleted);
    }
    return ret;
}

} // namespace

StorageManager::StorageManager(DatabaseCopier* copier) : mCopier(copier), mRemoteDebugDay(-1) {}

void StorageManager::setDailyUploadHook(DailyUploadHook hook) {
    sDailyUploadHook.store(hook);
}

void StorageManager::setPathWaitMs(int64_t ms) {
    sPathWaitMs.store(ms < 0 ? 0 : ms);
}

int32_t StorageManager::getUserType() {
    // Read once before main, with the log switches.
    return gLogUserType.load(std::memory_order_relaxed);
}

bool StorageManager::isBetaUser(int32_t userType) {
    return userType == kUserTypeDomesticBeta || userType == kUserTypeOverseasBeta;
}

int64_t StorageManager::getFileSizeThreshold(int32_t type) {
    bool beta = isBetaUser(getUserType());
    switch (type) {
        case STORAGE_FILE_DB:
            return beta ? 52428800 : 31457280;
        case STORAGE_FILE_ZIP:
            return beta ? 10485760 : 5242880;
        default:
            KLOGE("Invalid file type: %d", type);
            return 0;
    }
}

int32_t StorageManager::makeBackupName(const std::string& path, std::string* name, int64_t time) {
    std::string base = FileUtils::baseName(path);
    std::string extension;
    if (endsWith(base, kZipExtension)) {
        extension = kZipExtension;
    } else if (endsWith(base, kDbExtension)) {
        extension = kDbExtension;
    } else {
        KLOGE("Invalid parameter: %s", path.c_str());
        return -5;
    }
    std::string stem = base.substr(0, base.size() - extension.size());
    if (stem.empty()) {
        KLOGE("Invalid file format");
        return -5;
    }
    // Only the base name counts: the directories above may hold '-' too.
    size_t dash = base.find_last_of('-');
    if (dash == std::string::npos) {
        *name = StringPrintf("%s-%lld%s", stem.c_str(), static_cast<long long>(time),
                             extension.c_str());
        return 0;
    }
    if (dash == 0) {
        KLOGE("Error file format");
        return -5;
    }
    std::string prefix = base.substr(0, dash + 1);
    size_t pos = prefix.size();
    int64_t number = 0;
    int32_t read = readNumber(base, &pos, INT32_MAX - 1, &number) ? 1 : 0;
    if (read != 1 || base.compare(pos, std::string::npos, kZipExtension) != 0) {
        KLOGE("Failed to parse num, ret=%d", read);
        return -2;
    }
    *name =
        StringPrintf("%s%lld%s", prefix.c_str(), static_cast<long long>(number + 1), kZipExtension);
    return 0;
}

int32_t StorageManager::getValidFileList(const std::string& dir, FileList* list) {
    return listValidFiles(RootPath::resolve(dir), list);
}

int32_t StorageManager::checkFileSize(const std::string& dir, const std::string& name,
                                      int64_t threshold) {
    return checkHostFileSize(RootPath::resolve(dir), name, threshold);
}

int32_t StorageManager::listValidFiles(const std::string& dir, FileList* list) {
    list->clear();
    (*list)[STORAGE_FILE_DB];
    (*list)[STORAGE_FILE_ZIP];
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        if (errno == ENOENT) {
            KLOGD("The path does not exist: %s", dir.c_str());
            return 0;
        }
        KLOGE("Failed to open directory: %s, error: %s", dir.c_str(), strerror(errno));
        return -2;
    }
    struct Entry {
        std::string name;
        mode_t mode;
    };
    std::vector<Entry> entries;
    while (struct dirent* ent = readdir(d)) {
        std::string name = ent->d_name;
        if (name == "." || name == "..") {
            continue;
        }
        struct stat st = {};
        if (fstatat(dirfd(d), ent->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
            continue; // gone meanwhile
        }
        entries.push_back({name, st.st_mode});
    }
    closedir(d);

    std::set<std::string> databases;
    std::vector<const Entry*> others;
    for (const Entry& entry : entries) {
        bool zip = endsWith(entry.name, kZipExtension);
        if (S_ISREG(entry.mode) && (zip || endsWith(entry.name, kDbExtension)) &&
            scanName(entry.name, zip).whole) {
            (*list)[zip ? STORAGE_FILE_ZIP : STORAGE_FILE_DB].push_back(entry.name);
            if (!zip) {
                databases.insert(entry.name);
            }
        } else {
            others.push_back(&entry);
        }
    }
    for (const Entry* entry : others) {
        const std::string& name = entry->name;
        // The journal files of a copy stay as long as the copy does.
        if (S_ISREG(entry->mode) && databases.count(companionOwner(name)) > 0) {
            continue;
        }
        bool zip = endsWith(name, kZipExtension);
        if (S_ISREG(entry->mode) && (zip || endsWith(name, kDbExtension))) {
            KLOGE("Error file(%s/%s) format, ret=%d", dir.c_str(), name.c_str(),
                  scanName(name, zip).count);
        } else {
            KLOGE("Error file(%s/%s)", dir.c_str(), name.c_str());
        }
        std::string path = FileUtils::join(dir, name);
        if (S_ISDIR(entry->mode)) {
            if (rmdir(path.c_str()) != 0) {
                KLOGE("Failed to delete directory: %s, error: %s", path.c_str(), strerror(errno));
            }
        } else {
            discardFile(path.c_str());
        }
    }
    for (auto& item : *list) {
        std::sort(item.second.begin(), item.second.end());
    }
    return 0;
}

int32_t StorageManager::checkHostFileSize(const std::string& dir, const std::string& name,
                                          int64_t threshold) {
    std::string path = FileUtils::join(dir, name);
    int64_t size = FileUtils::getFileSize(path.c_str());
    if (size < 0) {
        // A database that does not exist yet (first start) is no fault.
        if (errno == ENOENT) {
            KLOGD("File does not exist yet: %s", path.c_str());
        } else {
            KLOGE("Failed to get file stat: %s, error: %s", path.c_str(), strerror(errno));
        }
        size = 0;
    }
    KLOGD("File(%s/%s) size: %lld, threshold: %lld", dir.c_str(), name.c_str(),
          static_cast<long long>(size), static_cast<long long>(threshold));
    if (size > threshold) {
        KLOGE("File(%s/%s) is too large: %lld, threshold: %lld, DELETE!", dir.c_str(), name.c_str(),
              static_cast<long long>(size), static_cast<long long>(threshold));
        if (discardFile(path.c_str()) != 0) {
            return -2;
        }
        // A database goes with its journal files, or they would be taken for
        // the journal of the next database of that name.
        if (endsWith(name, kDbExtension)) {
            for (const std::string& companion : existingCompanions(path)) {
                discardFile(companion.c_str());
            }
        }
    }
    return 0;
}

int32_t StorageManager::checkDirSize(const std::string& dir) {
    FileList list;
    if (listValidFiles(dir, &list) != 0) {
        KLOGE("Failed to get valid file list: %s", dir.c_str());
        return -2;
    }
    int32_t ret = 0;
    int64_t dbThreshold = getFileSizeThreshold(STORAGE_FILE_DB);
    int64_t zipThreshold = getFileSizeThreshold(STORAGE_FILE_ZIP);
    for (const std::string& name : list[STORAGE_FILE_DB]) {
        if (checkHostFileSize(dir, name, dbThreshold) != 0) {
            ret = -2;
        }
    }
    for (const std::string& name : list[STORAGE_FILE_ZIP]) {
        if (checkHostFileSize(dir, name, zipThreshold) != 0) {
            ret = -2;
        }
    }
    return ret;
}

int32_t StorageManager::renameFiles(const std::string& dir) {
    FileList list;
    if (listValidFiles(dir, &list) != 0) {
        KLOGE("Failed to get valid file list: %s", dir.c_str());
        return -2;
    }
    // Oldest first, so that no zip lands on a name still in use and each one
    // moves exactly once.
    std::vector<std::string> zips = list[STORAGE_FILE_ZIP];
    std::stable_sort(zips.begin(), zips.end(), [](const std::string& a, const std::string& b) {
        return scanName(a, true).age > scanName(b, true).age;
    });
    for (const std::string& zip : zips) {
        std::string src = FileUtils::join(dir, zip);
        std::string name;
        if (makeBackupName(src, &name, 0) != 0) {
            KLOGE("Failed to make backup name: %s", src.c_str());
            discardFile(src.c_str());
            continue;
        }
        std::string dest = FileUtils::join(dir, name);
        if (FileUtils::renameFile(src.c_str(), dest.c_str()) != 0) {
            KLOGE("Failed to rename file src=%s, dest=%s", src.c_str(), dest.c_str());
            discardFile(src.c_str());
        }
    }
    return 0;
}

int32_t StorageManager::zipDbFiles(const std::string& srcDir, const std::string& destDir,
                                   int32_t number) {
    FileList list;
    if (listValidFiles(srcDir, &list) != 0) {
        KLOGE("Failed to get valid file list: %s", srcDir.c_str());
        return -2;
    }
    const std::vector<std::string>& databases = list[STORAGE_FILE_DB];
    if (databases.empty()) {
        return 0;
    }
    std::vector<std::string> files;
    for (const std::string& name : databases) {
        std::string path = FileUtils::join(srcDir, name);
        files.push_back(path);
        for (const std::string& companion : existingCompanions(path)) {
            files.push_back(companion);
        }
    }
    std::string zipPath = StringPrintf("%s/kelvo-%lld-%d%s", destDir.c_str(),
                                       static_cast<long long>(now()), number, kZipExtension);
    if (ZipUtils::zipFiles(zipPath.c_str(), files, false) != 0) {
        // The copies stay for the next zip.
        KLOGE("Failed to zip file: %s", zipPath.c_str());
        FileUtils::deleteFile(zipPath.c_str());
        return -14;
    }
    FileUtils::chmodFile(zipPath.c_str(), kFileMode);
    KLOGD("Successfully zip files to %s", zipPath.c_str());
    for (const std::string& name : databases) {
        KLOGI("File(%s/%s) zipped, DELETE!", srcDir.c_str(), name.c_str());
        std::string path = FileUtils::join(srcDir, name);
        for (const std::string& companion : existingCompanions(path)) {
            FileUtils::deleteFile(companion.c_str());
        }
        FileUtils::deleteFile(path.c_str());
    }
    return 0;
}

int32_t StorageManager::cleanFiles(const std::string& dir, int32_t keep) {
    FileList list;
    if (listValidFiles(dir, &list) != 0) {
        KLOGE("Failed to get valid file list: %s", dir.c_str());
        return -2;
    }
    for (const std::string& name : list[STORAGE_FILE_ZIP]) {
        if (scanName(name, true).age >= keep - 2) {
            KLOGI("File(%s/%s) expired: %d, DELETE!", dir.c_str(), name.c_str(), keep);
            discardFile(FileUtils::join(dir, name).c_str());
        }
    }
    return 0;
}

int32_t StorageManager::cleanFiles(const std::string& dir, const std::string& extension) {
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        if (errno == ENOENT) {
            return 0;
        }
        KLOGE("Failed to open directory: %s, error: %s", dir.c_str(), strerror(errno));
        return -2;
    }
    std::vector<std::string> doomed;
    while (struct dirent* ent = readdir(d)) {
        std::string name = ent->d_name;
        struct stat st = {};
        if (fstatat(dirfd(d), ent->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0 || S_ISDIR(st.st_mode)) {
            continue;
        }
        bool match = endsWith(name, extension);
        if (!match && extension == kDbExtension) {
            // A database goes with its journal files.
            match = endsWith(companionOwner(name), extension);
        }
        if (match) {
            doomed.push_back(name);
        }
    }
    closedir(d);
    int32_t ret = 0;
    for (const std::string& name : doomed) {
        KLOGI("File(%s/%s) left over, DELETE!", dir.c_str(), name.c_str());
        if (discardFile(FileUtils::join(dir, name).c_str()) != 0) {
            ret = -2;
        }
    }
    return ret;
}

int32_t StorageManager::cleanExpiredFiles() {
    int32_t ret = 0;
    std::string backupDir = RootPath::resolve(kBackupDir);
    if (cleanFiles(backupDir, kBackupKeepCount) != 0) {
        KLOGE("Failed to clean expired file, path is: %s", backupDir.c_str());
        ret = -2;
    }
    std::string uploadDir = RootPath::resolve(kUploadDir);
    if (cleanFiles(uploadDir, kUploadKeepCount) != 0) {
        KLOGE("Failed to clean expired file, path is: %s", uploadDir.c_str());
        ret = -2;
    }
    return ret;
}

int32_t StorageManager::backupFile(const std::string& dir, const std::string& name, uid_t owner,
                                   gid_t group) {
    if (FileUtils::createDirectory(dir.c_str(), kDirMode) != 0) {
        return -2;
    }
    std::string path = FileUtils::join(dir, name);
    if (mCopier == nullptr) {
        KLOGE("Failed to backup file=%s: no database copier", path.c_str());
        return -17;
    }
    // The copy is written only as a new file of its own.
    if (FileUtils::exists(path.c_str())) {
        KLOGE("Failed to backup file=%s: the name is taken", path.c_str());
        return -17;
    }
    android::Parcel data;
    data.writeCString(path.c_str());
    data.setDataPosition(0);
    if (mCopier->doBackupCopy(data) < 0) {
        KLOGE("Failed to backup file=%s", path.c_str());
        FileUtils::deleteFile(path.c_str());
        return -17;
    }
    FileUtils::chownDir(dir.c_str(), owner, group);
    FileUtils::chownDir(path.c_str(), owner, group);
    FileUtils::chmodFile(dir.c_str(), kDirMode);
    FileUtils::chmodFile(path.c_str(), kFileMode);
    return 0;
}

int32_t StorageManager::uploadDailyData(int64_t time) {
    DailyUploadHook hook = sDailyUploadHook.load();
    if (hook == nullptr || hook(time - kDayMs, time) < 0) {
        KLOGE("Failed to upload database data");
        return -23;
    }
    return 0;
}

int32_t StorageManager::backupDatabase(int64_t time) {
    std::string name;
    if (makeBackupName(kDatabasePath, &name, time) != 0) {
        KLOGE("Failed to make backup name");
        return -2;
    }
    int32_t ret = 0;
    std::string backupDir = RootPath::resolve(kBackupDir);
    if (renameFiles(backupDir) != 0) {
        KLOGE("Failed to rename backup files");
        ret = -2;
    } else {
        if (backupFile(backupDir, name, kSystemId, kSystemId) != 0) {
            KLOGE("Failed to backed up files: %s/%s", backupDir.c_str(), name.c_str());
            ret = -2;
        }
        if (zipDbFiles(backupDir, backupDir, 0) != 0) {
            KLOGE("Failed to zip backup files");
            ret = -2;
        }
    }

    int32_t userType = getUserType();
    if (userType == kUserTypeDomesticBeta) {
        std::string uploadDir = RootPath::resolve(kUploadDir);
        if (renameFiles(uploadDir) != 0) {
            KLOGE("Failed to rename upload files");
            return -2;
        }
        if (backupFile(uploadDir, name, kSystemId, kSystemId) != 0) {
            KLOGE("Failed to backed up files: %s/%s", uploadDir.c_str(), name.c_str());
            return -2;
        }
        if (uploadDailyData(time) != 0) {
            KLOGE("Failed to upload daily database");
            return -23;
        }
        KLOGI("Domestic beta user, upload database success");
    } else {
        KLOGI("No need to upload database: %d", userType);
    }
    if (ret == 0) {
        KLOGD("Successfully backed up database files");
    }
    return ret;
}

int32_t StorageManager::cleanDatabase(int64_t time) {
    int32_t ret = cleanExpiredFiles();
    std::string backupDir = RootPath::resolve(kBackupDir);
    std::string uploadDir = RootPath::resolve(kUploadDir);
    // Copies in the backup directory (a database moved aside after a failed
    // open, a day whose zip failed) stay: the zip step below takes them.
    // The upload directory's copy of an earlier day has served its turn.
    if (cleanFiles(uploadDir, kDbExtension) != 0) {
        ret = -2;
    }
    int32_t backup = backupDatabase(time);
    if (backup != 0) {
        KLOGE("Failed to backup database");
        ret = backup;
    }
    if (checkDirSize(backupDir) != 0) {
        KLOGE("Failed to check backup dir size");
        ret = ret != 0 ? ret : -2;
    }
    if (checkDirSize(uploadDir) != 0) {
        KLOGE("Failed to check upload dir size");
        ret = ret != 0 ? ret : -2;
    }
    return ret;
}

int32_t StorageManager::moveCompanions(const std::string& src, const std::string& dest) {
    int32_t ret = 0;
    for (const char* suffix : kCompanionSuffixes) {
        std::string from = src + suffix;
        if (!FileUtils::exists(from.c_str())) {
            continue;
        }
        std::string to = dest + suffix;
        if (!dest.empty() && FileUtils::renameFile(from.c_str(), to.c_str()) == 0) {
            FileUtils::chmodFile(to.c_str(), kFileMode);
            continue;
        }
        // Left in place it would be taken for the next database's journal.
        KLOGI("File(%s) without its database, DELETE!", from.c_str());
        if (discardFile(from.c_str()) != 0) {
            ret = -2;
        }
    }
    return ret;
}

int32_t StorageManager::moveDatabase() {
    std::string name;
    if (makeBackupName(kDatabasePath, &name, now()) != 0) {
        KLOGE("Failed to make backup name");
        return -2;
    }
    std::string backupDir = RootPath::resolve(kBackupDir);
    if (FileUtils::createDirectory(backupDir.c_str(), kDirMode) != 0) {
        return -2;
    }
    FileUtils::chownDir(backupDir.c_str(), kSystemId, kSystemId);
    if (renameFiles(backupDir) != 0) {
        KLOGE("Failed to rename backup files");
        return -2;
    }
    if (zipDbFiles(backupDir, backupDir, 0) != 0) {
        KLOGE("Failed to zip backup files");
        return -2;
    }
    std::string src = RootPath::resolve(kDatabasePath);
    std::string dest = FileUtils::join(backupDir, name);
    if (rename(src.c_str(), dest.c_str()) != 0) {
        int error = errno;
        KLOGE("Failed to move file, src=%s, dest=%s: %d", src.c_str(), dest.c_str(), error);
        if (error == ENOENT) {
            // No database: journal files left from it must not meet the next one.
            moveCompanions(src, std::string());
        }
        return -2;
    }
    FileUtils::chmodFile(dest.c_str(), kFileMode);
    if (moveCompanions(src, dest) != 0) {
        KLOGE("Failed to move journal files of %s", src.c_str());
        return -2;
    }
    KLOGD("Successfully move database files");
    return 0;
}

int32_t StorageManager::samplingUpload(const String8& path, const String8& extra) {
    if (path.isEmpty()) {
        KLOGE("Invalid parameter");
        return -5;
    }
    int32_t day = 1;
    if (parseDay(extra.c_str(), &day) < 0) {
        KLOGE("Failed to parse extra message: %s", extra.c_str());
        day = 1;
    }
    return uploadSamplingData(path.c_str(), day, false);
}

int32_t StorageManager::resolveCollectDir(const std::string& path, std::string* dir) {
    std::string parent = realPath(RootPath::resolve(kCollectParentDir));
    std::string real = realPath(RootPath::resolve(path));
    if (parent.empty() || real.empty() || !isBelow(real, parent) ||
        !FileUtils::isDirectory(real.c_str())) {
        KLOGE("Refuse upload path: %s, resolved: %s", path.c_str(), real.c_str());
        return -5;
    }
    // The daemon's own directories are no collection place.
    std::string own = parent + (kDatabaseDir + strlen(kCollectParentDir));
    if (real == own || isBelow(real, own)) {
        KLOGE("Refuse upload path: %s, resolved: %s", path.c_str(), real.c_str());
        return -5;
    }
    *dir = real;
    return 0;
}

int32_t StorageManager::uploadSamplingData(const std::string& path, int32_t day, bool capture) {
    bool forUser = !capture && isBetaUser(getUserType());
    if (path.empty() || path[0] != '/' || hasDotDotComponent(path)) {
        KLOGE("Refuse upload path: %s", path.c_str());
        return -5;
    }
    std::string host = RootPath::resolve(path);
    for (int32_t i = 0; !FileUtils::isDirectory(host.c_str()); ++i) {
        if (i == kPathWaitTimes) {
            KLOGE("Nonexistent path: %s", path.c_str());
            return -2;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(sPathWaitMs.load()));
    }
    std::string dir;
    int32_t ret = resolveCollectDir(path, &dir);
    if (ret != 0) {
        return ret;
    }
    FileUtils::chmodFile(dir.c_str(), kDirMode);
    KLOGI("Upload path: %s", dir.c_str());

    bool current = day == 0 || forUser;
    if (day >= 1 && day <= kMaxSamplingDay &&
        uploadBackup(RootPath::resolve(kBackupDir), dir, day, capture) != 0) {
        KLOGE("Upload current file instead of backup file(%d)", day);
        current = true;
    }
    if (current && uploadCurrent(dir, capture) != 0) {
        KLOGE("Failed to upload current database");
        ret = -17;
    }
    // The marker ends the collection whatever came of it; the result tells.
    if (FileUtils::createFile(dir.c_str(), kFinishFileName, kFileMode) != 0) {
        KLOGE("Failed to create finish file");
        return -14;
    }
    if (ret != 0) {
        return ret;
    }
    KLOGI("Upload sampling data success, day: %d", day);
    return 0;
}

int32_t StorageManager::getZipFileName(const std::string& dir, int32_t age, std::string* path) {
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return -14;
    }
    int64_t newest = -1;
    while (struct dirent* ent = readdir(d)) {
        std::string name = ent->d_name;
        if (name == "." || name == "..") {
            continue;
        }
        NameFields fields = scanName(name, true);
        if (!fields.whole) {
            KLOGD("Error file(%s) format, ret=%d", name.c_str(), fields.count);
            continue;
        }
        std::string full = FileUtils::join(dir, name);
        if (fields.age == age && fields.time > newest && FileUtils::isRegularFile(full.c_str())) {
            newest = fields.time;
            *path = full;
        }
    }
    closedir(d);
    return newest >= 0 ? 0 : -14;
}

int32_t StorageManager::uploadBackup(const std::string& backupDir, const std::string& dir,
                                     int32_t day, bool capture) {
    std::string zip;
    if (getZipFileName(backupDir, day - 1, &zip) != 0) {
        KLOGE("Failed to get backup zip file: %d", day);
        return -14;
    }
    if (capture) {
        std::string dest = StringPrintf("%s/kelvo-%lld-%d%s", dir.c_str(),
                                        static_cast<long long>(now()), day, kZipExtension);
        if (FileUtils::copyFile(zip.c_str(), dest.c_str()) != 0) {
            KLOGE("Failed to copy %s to %s", zip.c_str(), dest.c_str());
            return -14;
        }
        FileUtils::chmodFile(dest.c_str(), kFileMode);
        return 0;
    }
    if (ZipUtils::unzipFiles(zip.c_str(), dir.c_str(), kDbExtension,
                             getFileSizeThreshold(STORAGE_FILE_DB)) != 0) {
        KLOGE("Failed to unzip %s to %s", zip.c_str(), dir.c_str());
        return -14;
    }
    return 0;
}

int32_t StorageManager::uploadCurrent(const std::string& dir, bool capture) {
    int64_t time = now();
    std::string name;
    if (makeBackupName(kDatabasePath, &name, time) != 0) {
        KLOGE("Failed to make backup name");
        return -2;
    }
    if (backupFile(dir, name, kSystemId, kSystemId) != 0) {
        KLOGE("Failed to backed up files: %s/%s", dir.c_str(), name.c_str());
        return -17;
    }
    if (!capture) {
        return 0;
    }
    std::string copy = FileUtils::join(dir, name);
    std::string zipPath =
        StringPrintf("%s/kelvo-%lld-0%s", dir.c_str(), static_cast<long long>(time), kZipExtension);
    int32_t ret = 0;
    if (ZipUtils::zipFiles(zipPath.c_str(), {copy}, false) != 0) {
        KLOGE("Failed to zip file: %s", zipPath.c_str());
        FileUtils::deleteFile(zipPath.c_str());
        ret = -14;
    } else {
        FileUtils::chmodFile(zipPath.c_str(), kFileMode);
    }
    FileUtils::deleteFile(copy.c_str());
    return ret;
}

int32_t StorageManager::remoteDebug(int32_t action, const String8& argument) {
    switch (action) {
        case REMOTE_DEBUG_OPEN:
            return remoteDebugOpen(argument);
        case REMOTE_DEBUG_CAPTURE:
            return remoteDebugCapture(argument);
        case REMOTE_DEBUG_CLOSE:
            if (mRemoteDebugDay >= 0) {
                KLOGI("Remote debug close success, day: %d", mRemoteDebugDay);
            }
            mRemoteDebugDay = -1;
            return 0;
        default:
            KLOGE("Unknown remote debug action");
            return -3;
    }
}

int32_t StorageManager::remoteDebugOpen(const String8& argument) {
    if (mRemoteDebugDay >= 0) {
        KLOGI("Close previous remote debug action firstly");
        mRemoteDebugDay = -1;
    }
    int32_t day = 0;
    if (parseDay(argument.c_str(), &day) < 0) {
        KLOGE("Failed to parse extra message: %s", argument.c_str());
        day = 0;
    }
    mRemoteDebugDay = day;
    KLOGI("Remote debug open success, day: %d", day);
    return 0;
}

int32_t StorageManager::remoteDebugCapture(const String8& argument) {
    bool beta = isBetaUser(getUserType());
    int32_t day = mRemoteDebugDay;
    if (day < 0) {
        if (!beta) {
            KLOGE("Remote debug is not opening");
            return -2;
        }
        day = 0;
    }
    int32_t ret = uploadSamplingData(argument.c_str(), day, true);
    if (ret != 0) {
        KLOGE("Failed to capture files for remote debug: %d", ret);
    } else {
        KLOGI("Remote debug capture log success, day: %d", day);
    }
    // Beta users capture once per request; other sessions stay open.
    if (beta) {
        mRemoteDebugDay = -1;
    }
    return ret;
}

} // namespace kelvo
