#pragma once

#include <stddef.h>
#include <stdint.h>

namespace kelvo {

// The text of a log-device record: items "key=value" in a fixed order per
// tag, separated by exactly one space; each key includes its '='. A value
// runs from just after its key to the space before the next key asked for,
// or to the end of the text, so a text value may hold spaces.
//
// parseMessage takes one value out of a text: the value after firstKey (the
// whole text when firstKey is null) up to the space before secondKey (the
// end of the text when secondKey is null), converted with a scanf format
// into out, a buffer of outSize bytes (1 to 4096). Keys are found as plain
// substrings, first occurrence from the start of the text.
//
// The format "%s" copies the value, cut to outSize - 1 bytes, and fills the
// rest of out with zeros. Any other format must write at most one output
// that fits in outSize bytes: a number no wider than outSize, "%c" with a
// width up to outSize, and text ("%s", "%[...]") only with a width below
// outSize; others ("%n" too) are refused. A value that does not match the
// format leaves out unchanged and still succeeds, so callers initialise
// their outputs. A failure never writes to out.
//
// Returns 0, or (each with an error line):
//   -5   null text, format or out, outSize 0 or above 4096, or a format
//        refused above
//   -11  firstKey not in the text
//   -4   secondKey not after the value's start
//   -2   nothing after firstKey, no space before secondKey, an empty value,
//        or an input failure of the conversion
int32_t parseMessage(const char* text, const char* firstKey, const char* secondKey,
                     const char* format, void* out, size_t outSize);

} // namespace kelvo
