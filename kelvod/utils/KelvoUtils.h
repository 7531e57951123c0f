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

    // An energy scaled by the hour's compensation ratio for an upload: the
    // product in double, truncated toward zero and clamped to int64. A ratio
    // of 0 or below means "no battery measurement" and scales by 1.0. Every
    // uploader scales through it.
    static int64_t scaleEnergy(int64_t energy, double ratio);
    // A value narrowed to int32 for a row or an upload field: clamped to
    // the int32 range (counted as saturated when it had to be).
    static int32_t saturateInt32(int64_t value);
    static int32_t saturateInt32(double value);
};

} // namespace kelvo
