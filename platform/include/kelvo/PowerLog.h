#pragma once

// The device's power log channel. The host version appends one line per call
// to <root>/data/log/power/powerlog.txt:
//   "<wall ms>\t<priority>\t<code>\t<tag>\t<category>\t<text>"

#ifdef __cplusplus
extern "C" {
#endif

int __android_logPower_print(int priority, int code, const char* tag, const char* category,
                             const char* text);

#ifdef __cplusplus
}
#endif

#define KELVO_POWER_LOG_FILE "/data/log/power/powerlog.txt"
