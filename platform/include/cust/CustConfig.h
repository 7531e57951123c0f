#pragma once

// Host stand-in for the device's customisation library: finds the copy of a
// configuration file that wins among the customisation directories.

#ifdef __cplusplus
extern "C" {
#endif

// Size of the buffer that get_one_cfg_file fills, terminating NUL included.
#define CUST_CFG_PATH_MAX 256

// Looks pathSuffix (a relative path such as "xml/tv_kelvo_config.xml") up in
// "<root>/cust", then "<root>/vendor/etc", then "<root>/system/etc", and
// writes the full path of the first regular file found into buffer
// (CUST_CFG_PATH_MAX bytes). Returns buffer, or null when no copy exists,
// when the winning path does not fit the buffer (never a cut path), for an
// absolute suffix or one that climbs out with "..", and for any type but 0.
char* get_one_cfg_file(const char* pathSuffix, char* buffer, int type);

#ifdef __cplusplus
}
#endif
