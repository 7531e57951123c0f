#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>

namespace kelvo {

// The JSON object of a sampled-upload push: a non-empty "transactionid"
// (a scalar), "fieldid" the integer 903, and "extra" a string or absent.
class PushMessage {
public:
    static constexpr int32_t kSamplingFieldId = 903;
    // Longer messages are refused before parsing.
    static constexpr size_t kMaxMessageBytes = 16 * 1024;
    // Deeper nesting is refused by the parser.
    static constexpr int kMaxDepth = 16;

    // 0 with *extra set; -5 for a message that is not such an object, -4 for
    // an empty transaction id, -16 for another field id (the last two are
    // logged). Never throws.
    static int32_t parse(const std::string& message, std::string* extra);
};

}  // namespace kelvo
