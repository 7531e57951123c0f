#pragma once

#include <stdint.h>

#include <string>

#include <utils/String8.h>

namespace kelvo {

// Small helpers shared by the daemon.
class KelvoUtils {
public:
    // Removes a file given by its device path (resolved under the root).
    // 0 on success, -1 with an error line otherwise.
    static int32_t deleteFile(const char* path);
    // Removes a database file and its "-journal", "-wal" and "-shm"
    // companions, so a stale journal never meets the next database.
    static void deleteDatabaseFiles(const char* path);

    // A text value as an SQL string literal: in single quotes, every single
    // quote doubled. Every SQL text built from a name or value goes through it.
    static android::String8 quoteSqlText(const char* value);
    // A name as an SQL identifier: in double quotes, every double quote doubled.
    static android::String8 quoteSqlIdentifier(const char* name);
};

} // namespace kelvo
