#pragma once

// The device's power log channel: one line per call with a priority, a
// numeric event code, a tag, a category word and a text. 0 when written.

#ifdef __cplusplus
extern "C" {
#endif

int __android_logPower_print(int priority, int code, const char* tag, const char* category,
                             const char* text);

#ifdef __cplusplus
}
#endif
