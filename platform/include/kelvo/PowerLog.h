#pragma once

// The host's power log (tests): every __android_logPower_print call appends
// one line to <root>/data/log/power/powerlog.txt:
//   "<wall ms>\t<priority>\t<code>\t<tag>\t<category>\t<text>"

#include <powerlog/powerlog.h>

#define KELVO_POWER_LOG_FILE "/data/log/power/powerlog.txt"
