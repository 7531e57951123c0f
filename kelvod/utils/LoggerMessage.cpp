#include "utils/LoggerMessage.h"

#include <stddef.h>

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <cstring>

#include "KelvoLog.h"

namespace kelvo {

namespace {

constexpr size_t kMaxOutSize = 4096;
// Longest value taken from a text.
constexpr size_t kMaxValueLength = 4095;
// Widths above this are refused anyway (outSize is at most 4096).
constexpr size_t kWidthCap = 1 << 20;

enum LengthModifier {
    LENGTH_NONE,
    LENGTH_HH,
    LENGTH_H,
    LENGTH_L,
    LENGTH_LL,
    LENGTH_J,
    LENGTH_Z,
    LENGTH_T,
    LENGTH_LD
};

size_t integerSize(LengthModifier length) {
    switch (length) {
        case LENGTH_HH:
            return sizeof(char);
        case LENGTH_H:
            return sizeof(short);
        case LENGTH_L:
            return sizeof(long);
        case LENGTH_LL:
        case LENGTH_LD:  // "%Lld" is read as long long
            return sizeof(long long);
        case LENGTH_J:
            return sizeof(intmax_t);
        case LENGTH_Z:
            return sizeof(size_t);
        case LENGTH_T:
            return sizeof(ptrdiff_t);
        default:
            return sizeof(int);
    }
}

// True when the format writes at most one output and that output fits in
// outSize bytes: every text conversion has a width, and every conversion is
// one this checker knows.
bool isBoundedFormat(const char* format, size_t outSize) {
    int outputs = 0;
    for (const char* p = format; *p != '\0'; ++p) {
        if (*p != '%') {
            continue;
        }
        ++p;
        if (*p == '%') {
            continue;
        }
        bool assigns = true;
        if (*p == '*') {
            assigns = false;
            ++p;
        }
        size_t width = 0;
        while (*p >= '0' && *p <= '9') {
            width = std::min(width * 10 + static_cast<size_t>(*p - '0'), kWidthCap);
            ++p;
        }
        // A width of 0 means no width.
        bool hasWidth = width > 0;

        LengthModifier length = LENGTH_NONE;
        switch (*p) {
            case 'h':
                length = p[1] == 'h' ? LENGTH_HH : LENGTH_H;
                p += length == LENGTH_HH ? 2 : 1;
                break;
            case 'l':
                length = p[1] == 'l' ? LENGTH_LL : LENGTH_L;
                p += length == LENGTH_LL ? 2 : 1;
                break;
            case 'q':
                length = LENGTH_LL;
                ++p;
                break;
            case 'j':
                length = LENGTH_J;
                ++p;
                break;
            case 'z':
                length = LENGTH_Z;
                ++p;
                break;
            case 't':
                length = LENGTH_T;
                ++p;
                break;
            case 'L':
                length = LENGTH_LD;
                ++p;
                break;
            default:
                break;
        }

        size_t needed;
        switch (*p) {
            case 'd':
            case 'i':
            case 'o':
            case 'u':
            case 'x':
            case 'X':
                needed = integerSize(length);
                break;
            case 'a':
            case 'A':
                // Once the allocating "%as"; refused in that spelling.
                if (p[1] == 's' || p[1] == 'S' || p[1] == '[') {
                    return false;
                }
                [[fallthrough]];
            case 'e':
            case 'E':
            case 'f':
            case 'F':
            case 'g':
            case 'G':
                if (length == LENGTH_NONE) {
                    needed = sizeof(float);
                } else if (length == LENGTH_L) {
                    needed = sizeof(double);
                } else if (length == LENGTH_LD) {
                    needed = sizeof(long double);
                } else {
                    return false;
                }
                break;
            case 'p':
                if (length != LENGTH_NONE) {
                    return false;
                }
                needed = sizeof(void*);
                break;
            case 'c':
                if (length != LENGTH_NONE) {
                    return false;
                }
                needed = hasWidth ? width : 1;
                break;
            case 's':
            case '[':
                if (length != LENGTH_NONE) {
                    return false;
                }
                if (*p == '[') {
                    // The set: a leading ']' (after an optional '^') belongs to it.
                    ++p;
                    if (*p == '^') {
                        ++p;
                    }
                    if (*p == ']') {
                        ++p;
                    }
                    while (*p != '\0' && *p != ']') {
                        ++p;
                    }
                    if (*p == '\0') {
                        return false;
                    }
                }
                if (!hasWidth && assigns) {
                    return false;
                }
                needed = width + 1;
                break;
            default:
                // Unknown, wide or allocating ('m') conversions, the end, and
                // "%n", which would write out even when the conversion fails.
                return false;
        }
        if (!assigns) {
            continue;
        }
        if (++outputs > 1 || needed > outSize) {
            return false;
        }
    }
    return true;
}

} // namespace

int32_t parseMessage(const char* text, const char* firstKey, const char* secondKey,
                     const char* format, void* out, size_t outSize) {
    if (text == nullptr || format == nullptr || out == nullptr || outSize == 0 ||
        outSize > kMaxOutSize) {
        KLOGE("Invalid parameter");
        return -5;
    }
    if (strchr(format, '%') == nullptr) {
        KLOGE("Invalid format");
        return -5;
    }
    bool plainText = strcmp(format, "%s") == 0;
    if (!plainText && !isBoundedFormat(format, outSize)) {
        KLOGE("Invalid format for an output of %zu bytes: %s", outSize, format);
        return -5;
    }

    const char* start = text;
    if (firstKey != nullptr) {
        const char* found = strstr(text, firstKey);
        if (found == nullptr) {
            KLOGE("Failed to find first tag: %s", firstKey);
            return -11;
        }
        start = found + strlen(firstKey);
        if (*start == '\0') {
            KLOGE("Value of this tag(%s) is blank", firstKey);
            return -2;
        }
    }
    const char* end;
    if (secondKey != nullptr) {
        const char* found = strstr(start, secondKey);
        if (found == nullptr) {
            KLOGE("Failed to find second tag: %s", secondKey);
            return -4;
        }
        // The text's first character has nothing before it.
        if (found == text || found[-1] != ' ') {
            KLOGE("Invalid logger message format. It must have a space between two items");
            return -2;
        }
        end = found - 1;
    } else {
        end = start + strlen(start);
    }
    if (end <= start) {
        KLOGE("Position of second symbol is less than or equal to first one");
        return -2;
    }

    size_t length = std::min(static_cast<size_t>(end - start), kMaxValueLength);
    if (plainText) {
        char* dest = static_cast<char*>(out);
        size_t n = std::min(length, outSize - 1);
        memcpy(dest, start, n);
        memset(dest + n, 0, outSize - n);
        return 0;
    }
    // A value that ends the text is converted where it is; any other is
    // copied out first, so the conversion sees only the value.
    const char* value = start;
    char buffer[kMaxValueLength + 1];
    if (*end != '\0' || start + length != end) {
        memcpy(buffer, start, length);
        buffer[length] = '\0';
        value = buffer;
    }
    // Converted into a copy of out, which takes the result only on success:
    // a failed conversion must not leave part of its output behind.
    alignas(std::max_align_t) unsigned char result[kMaxOutSize];
    memcpy(result, out, outSize);
    if (sscanf(value, format, result) == EOF) {
        KLOGE("Failed to get result");
        return -2;
    }
    memcpy(out, result, outSize);
    return 0;
}

} // namespace kelvo
