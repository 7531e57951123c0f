// Runs parseMessage on untrusted texts, keys, formats and output sizes.
//
// Input: two bytes of output size (little-endian, taken modulo 4101), one
// byte of flags (bit 0: no first key, bit 1: no second key), then the first
// key, the second key, the format and the text, separated by NUL bytes.
// Each string gets a heap block of exactly its size, as does the output, so
// the sanitizers see any access outside them. Checks: a failure writes
// nothing; "%s" always leaves a terminated value.

#include <android/log.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "utils/LoggerMessage.h"

namespace {

constexpr uint8_t kFill = 0xa5;

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

// The next field up to a NUL byte (or the end), in a block of its own.
std::unique_ptr<char[]> takeField(const uint8_t** data, size_t* size) {
    const uint8_t* end = static_cast<const uint8_t*>(memchr(*data, '\0', *size));
    size_t len = end != nullptr ? static_cast<size_t>(end - *data) : *size;
    std::unique_ptr<char[]> field(new char[len + 1]);
    memcpy(field.get(), *data, len);
    field[len] = '\0';
    size_t used = end != nullptr ? len + 1 : len;
    *data += used;
    *size -= used;
    return field;
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    // Every refusal writes an error line: keep them out of the way.
    __android_log_set_minimum_priority(ANDROID_LOG_SILENT);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size < 3) {
        return 0;
    }
    size_t outSize = (data[0] | (data[1] << 8)) % 4101;
    uint8_t flags = data[2];
    data += 3;
    size -= 3;
    std::unique_ptr<char[]> firstKey = takeField(&data, &size);
    std::unique_ptr<char[]> secondKey = takeField(&data, &size);
    std::unique_ptr<char[]> format = takeField(&data, &size);
    std::unique_ptr<char[]> text = takeField(&data, &size);

    std::unique_ptr<uint8_t[]> out(new uint8_t[outSize]);
    memset(out.get(), kFill, outSize);
    int32_t ret = kelvo::parseMessage(text.get(), (flags & 1) ? nullptr : firstKey.get(),
                                      (flags & 2) ? nullptr : secondKey.get(), format.get(),
                                      out.get(), outSize);
    check(ret == 0 || ret == -2 || ret == -4 || ret == -5 || ret == -11);
    if (ret != 0) {
        for (size_t i = 0; i < outSize; ++i) {
            check(out[i] == kFill);
        }
    } else if (strcmp(format.get(), "%s") == 0) {
        check(outSize > 0 && out[outSize - 1] == '\0');
        size_t len = strlen(reinterpret_cast<char*>(out.get()));
        check(len < outSize && (len > 0 || outSize == 1));
        check(strstr(text.get(), reinterpret_cast<char*>(out.get())) != nullptr);
    }
    return 0;
}
