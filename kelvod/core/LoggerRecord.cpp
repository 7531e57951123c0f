#include "core/LoggerRecord.h"

#include <cstring>

namespace kelvo {

namespace {

uint16_t getUint16(const uint8_t* at) {
    return static_cast<uint16_t>(at[0] | (at[1] << 8));
}

uint32_t getUint32(const uint8_t* at) {
    return static_cast<uint32_t>(at[0]) | (static_cast<uint32_t>(at[1]) << 8) |
           (static_cast<uint32_t>(at[2]) << 16) | (static_cast<uint32_t>(at[3]) << 24);
}

} // namespace

void LoggerRecord::clear() {
    mTime = 0;
    mPid = 0;
    mTid = 0;
    mPriority = 0;
    mTag = nullptr;
    mTagLength = 0;
    mText = nullptr;
    mTextLength = 0;
}

int32_t LoggerRecord::decode(const uint8_t* data, size_t size) {
    clear();
    if (data == nullptr || size < kHeaderSize) {
        return -14;
    }
    size_t payloadSize = getUint16(data);
    uint32_t seconds = getUint32(data + 12);
    uint32_t nanoseconds = getUint32(data + 16);
    if (payloadSize != size - kHeaderSize || nanoseconds >= 1000000000u) {
        return -14;
    }
    mPid = static_cast<int32_t>(getUint32(data + 4));
    mTid = static_cast<int32_t>(getUint32(data + 8));
    mTime = static_cast<int64_t>(seconds) * 1000 + nanoseconds / 1000000;
    if (payloadSize == 0) {
        return 0;
    }

    const char* payload = reinterpret_cast<const char*>(data + kHeaderSize);
    const char* end = payload + payloadSize;
    mPriority = static_cast<uint8_t>(payload[0]);

    const char* tag = payload + 1;
    const char* tagEnd = static_cast<const char*>(memchr(tag, '\0', end - tag));
    if (tagEnd == nullptr || tagEnd == tag) {
        return 0;
    }
    mTag = tag;
    mTagLength = tagEnd - tag;

    const char* text = tagEnd + 1;
    if (text == end) {
        return 0;
    }
    const char* textEnd = static_cast<const char*>(memchr(text, '\0', end - text));
    if (textEnd == nullptr) {
        return 0;
    }
    // Bytes after the text's NUL are ignored.
    mText = text;
    mTextLength = textEnd - text;
    return 0;
}

} // namespace kelvo
