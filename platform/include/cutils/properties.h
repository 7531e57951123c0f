#pragma once

// System properties with Android's semantics, served by the host layer:
// read-only "ro.*" values come from <root>/system/build.prop and
// <root>/vendor/build.prop, "persist.*" values live as one file per property
// under <root>/data/property/, all others in memory.

#include <stddef.h>
#include <stdint.h>

#define PROP_NAME_MAX 32
#define PROP_VALUE_MAX 92
#define PROPERTY_KEY_MAX PROP_NAME_MAX
#define PROPERTY_VALUE_MAX PROP_VALUE_MAX

#ifdef __cplusplus
extern "C" {
#endif

int property_get(const char* key, char* value, const char* default_value);
int8_t property_get_bool(const char* key, int8_t default_value);
int64_t property_get_int64(const char* key, int64_t default_value);
int32_t property_get_int32(const char* key, int32_t default_value);
int property_set(const char* key, const char* value);

#ifdef __cplusplus
}
#endif
