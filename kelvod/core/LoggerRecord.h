#pragma once

#include <stddef.h>
#include <stdint.h>

namespace kelvo {

// One record of the log device, decoded in place: the tag and the text point
// into the bytes that were read, which must outlive the record. Layout
// (version 1 logger entry, see kelvo/LogDevice.h): a 20-byte header with the
// payload length, writer pid and tid, seconds and nanoseconds of the time
// stamp, then a priority byte, the tag and the text, each NUL-terminated.
class LoggerRecord {
public:
    static constexpr size_t kHeaderSize = 20;

    LoggerRecord() { clear(); }

    // Decodes size bytes. Returns 0 when the header is sound: at least 20
    // bytes, a payload length equal to the bytes that follow the header, and
    // nanoseconds below one second. Returns -14 otherwise, and the record
    // stays cleared.
    //
    // A sound header may still carry a payload without a tag (none, empty or
    // unterminated) or without a text (nothing after the tag, or no final
    // NUL): tag or text is then null and the caller refuses the record. An
    // empty text is a valid record whose tag says everything.
    int32_t decode(const uint8_t* data, size_t size);
    void clear();

    // Wall-clock milliseconds: the seconds field is unsigned, so stamps
    // run to the year 2106.
    int64_t getTime() const { return mTime; }
    int32_t getPid() const { return mPid; }
    int32_t getTid() const { return mTid; }
    int32_t getPriority() const { return mPriority; }
    const char* getTag() const { return mTag; }
    size_t getTagLength() const { return mTagLength; }
    const char* getText() const { return mText; }
    size_t getTextLength() const { return mTextLength; }

private:
    int64_t mTime;
    int32_t mPid;
    int32_t mTid;
    int32_t mPriority;
    const char* mTag;
    size_t mTagLength;
    const char* mText;
    size_t mTextLength;
};

} // namespace kelvo
