#include <gtest/gtest.h>

#include <cctype>
#include <cstring>
#include <memory>
#include <ostream>
#include <string>
#include <vector>

#include "common/TestEnv.h"
#include "utils/LoggerMessage.h"

using kelvo::parseMessage;
using kelvo::test::LogCapture;

namespace {

enum Output { INT32, INT64, TEXT };

constexpr unsigned char kFill = 0x5a;
constexpr int32_t kUntouched32 = 0x5a5a5a5a;

struct Case {
    const char* name;
    const char* text;
    const char* firstKey;
    const char* secondKey;
    const char* format;
    size_t outSize;
    int32_t result;
    // The error line's message, after "parseMessage# "; null: no error line.
    const char* error;
    Output output;
    int64_t number;     // INT32 and INT64 outputs
    const char* value;  // TEXT outputs
};

const Case kCases[] = {
    // Reading items of a text.
    {"number between two keys", "uid=1000 name=com.example.app", "uid=", "name=", "%d", 4, 0,
     nullptr, INT32, 1000, nullptr},
    {"text value holding spaces", "uid=1 name=My Music App type=3", "name=", "type=", "%s", 32, 0,
     nullptr, TEXT, 0, "My Music App"},
    {"whole text without keys", "42", nullptr, nullptr, "%d", 4, 0, nullptr, INT32, 42, nullptr},
    {"64-bit value", "delta=-5000000000", "delta=", nullptr, "%lld", 8, 0, nullptr, INT64,
     -5000000000LL, nullptr},
    {"first occurrence wins, inside a longer key too", "xuid=5 uid=7", "uid=", nullptr, "%d", 4, 0,
     nullptr, INT32, 5, nullptr},
    {"text cut to the output", "name=abcdefgh", "name=", nullptr, "%s", 4, 0, nullptr, TEXT, 0,
     "abc"},
    {"letters for a number leave the output as it was", "level=abc", "level=", nullptr, "%d", 4, 0,
     nullptr, INT32, kUntouched32, nullptr},
    {"bounded text conversion", "irq=gpio_keys gpio=3", "irq=", "gpio=", "%15s", 16, 0, nullptr,
     TEXT, 0, "gpio_keys"},
    {"skipped conversion then one output", "size=12 34", "size=", nullptr, "%*d %d", 4, 0, nullptr,
     INT32, 34, nullptr},

    // Failures of the text.
    {"no space between items", "uid=1000name=x", "uid=", "name=", "%d", 4, -2,
     "Invalid logger message format. It must have a space between two items", INT32, kUntouched32,
     nullptr},
    {"blank value", "uid=", "uid=", nullptr, "%d", 4, -2, "Value of this tag(uid=) is blank", INT32,
     kUntouched32, nullptr},
    {"first key missing", "uid=1000", "pid=", nullptr, "%d", 4, -11,
     "Failed to find first tag: pid=", INT32, kUntouched32, nullptr},
    {"second key missing", "uid=1000 name=x", "uid=", "type=", "%d", 4, -4,
     "Failed to find second tag: type=", INT32, kUntouched32, nullptr},
    {"second key opens the text", "name=x uid=1", nullptr, "name=", "%s", 8, -2,
     "Invalid logger message format. It must have a space between two items", TEXT, 0, nullptr},
    {"empty value between keys", "a= b=1", "a=", "b=", "%s", 8, -2,
     "Position of second symbol is less than or equal to first one", TEXT, 0, nullptr},
    {"empty text", "", nullptr, nullptr, "%d", 4, -2,
     "Position of second symbol is less than or equal to first one", INT32, kUntouched32, nullptr},
    {"only spaces for a number", "level=   ", "level=", nullptr, "%d", 4, -2,
     "Failed to get result", INT32, kUntouched32, nullptr},

    // Refused arguments: one case per rule of the format check.
    {"output of 0 bytes", "uid=1", "uid=", nullptr, "%s", 0, -5, "Invalid parameter", TEXT, 0,
     nullptr},
    {"text conversion without a width", "name=abc", "name=", nullptr, "%s ", 64, -5,
     "Invalid format for an output of 64 bytes: %s ", TEXT, 0, nullptr},
    {"width as large as the output", "name=abc", "name=", nullptr, "%64s", 64, -5, "Invalid format",
     TEXT, 0, nullptr},
    {"count of characters read", "name=ab", "name=", nullptr, "%n", 4, -5, "Invalid format", INT32,
     kUntouched32, nullptr},
    {"number wider than the output", "delta=5", "delta=", nullptr, "%lld", 4, -5, "Invalid format",
     INT32, kUntouched32, nullptr},
};

// Test names and failure messages show the case by its name.
void PrintTo(const Case& c, std::ostream* os) {
    *os << c.name;
}

class LoggerMessageTest : public ::testing::TestWithParam<Case> {};

} // namespace

TEST_P(LoggerMessageTest, ParsesOrRefusesWithItsErrorLine) {
    const Case& c = GetParam();
    // The text and the output get exactly their own size on the heap, so a
    // read or write outside them is caught by the sanitizers.
    size_t textSize = strlen(c.text) + 1;
    std::unique_ptr<char[]> text(new char[textSize]);
    memcpy(text.get(), c.text, textSize);
    size_t room = c.outSize > 0 ? c.outSize : 1;
    std::unique_ptr<unsigned char[]> out(new unsigned char[room]);
    memset(out.get(), kFill, room);

    LogCapture log;
    EXPECT_EQ(c.result,
              parseMessage(text.get(), c.firstKey, c.secondKey, c.format, out.get(), c.outSize));
    std::vector<kelvo::test::LogLine> errors = log.linesWith("parseMessage# ");
    if (c.error == nullptr) {
        EXPECT_TRUE(errors.empty()) << errors[0].text;
    } else {
        ASSERT_EQ(1u, errors.size());
        EXPECT_EQ(ANDROID_LOG_ERROR, errors[0].priority);
        EXPECT_NE(std::string::npos,
                  errors[0].text.find(std::string("[LoggerMessage.cpp] parseMessage# ") + c.error))
            << errors[0].text;
    }

    switch (c.output) {
        case INT32:
        case INT64: {
            int32_t value32;
            int64_t value64 = 0;
            memcpy(&value32, out.get(), sizeof(value32));
            if (c.output == INT64) memcpy(&value64, out.get(), sizeof(value64));
            EXPECT_EQ(c.number, c.output == INT64 ? value64 : value32);
            break;
        }
        case TEXT:
            if (c.value == nullptr) {
                // Refused: not a byte written.
                for (size_t i = 0; i < room; ++i) {
                    ASSERT_EQ(kFill, out[i]) << i;
                }
            } else {
                // The value and its terminator; "%s" zeros the whole rest.
                size_t n = strlen(c.value);
                EXPECT_EQ(std::string(c.value), std::string(reinterpret_cast<char*>(out.get()), n));
                size_t zeroTo = strcmp(c.format, "%s") == 0 ? c.outSize : n + 1;
                for (size_t i = n; i < zeroTo; ++i) {
                    ASSERT_EQ(0, out[i]) << i;
                }
            }
            break;
    }
}

INSTANTIATE_TEST_SUITE_P(Cases, LoggerMessageTest, ::testing::ValuesIn(kCases),
                         [](const ::testing::TestParamInfo<Case>& info) {
                             std::string name;
                             for (const char* p = info.param.name; *p != '\0'; ++p) {
                                 name += isalnum(static_cast<unsigned char>(*p)) ? *p : '_';
                             }
                             return name;
                         });

TEST(LoggerMessageLimitsTest, RefusesMissingTextFormatOrOutput) {
    LogCapture log;
    int32_t out = 7;
    EXPECT_EQ(-5, parseMessage(nullptr, "uid=", nullptr, "%d", &out, sizeof(out)));
    EXPECT_EQ(-5, parseMessage("uid=1", "uid=", nullptr, nullptr, &out, sizeof(out)));
    EXPECT_EQ(-5, parseMessage("uid=1", "uid=", nullptr, "%d", nullptr, sizeof(out)));
    EXPECT_EQ(7, out);
    EXPECT_EQ(3u, log.count("parseMessage# Invalid parameter", ANDROID_LOG_ERROR));
}

TEST(LoggerMessageLimitsTest, LongValuesAreTakenUpTo4095Characters) {
    // A value running past the second key's search: 5000 characters, read
    // into the largest output.
    std::string text = "name=" + std::string(5000, 'n') + " type=1";
    std::unique_ptr<char[]> out(new char[4096]);
    ASSERT_EQ(0, parseMessage(text.c_str(), "name=", "type=", "%s", out.get(), 4096));
    EXPECT_EQ(4095u, strnlen(out.get(), 4096));
    int32_t type = 0;
    ASSERT_EQ(0, parseMessage(text.c_str(), "type=", nullptr, "%d", &type, sizeof(type)));
    EXPECT_EQ(1, type);
    std::string bounded = "count=" + std::string(5000, '9');
    char digits[8];
    ASSERT_EQ(0, parseMessage(bounded.c_str(), "count=", nullptr, "%7s", digits, sizeof(digits)));
    EXPECT_STREQ("9999999", digits);
}
