// PObject values as JSON text, for scripts that read the front end's output.
//
// Maps become objects (keys in the map's order), arrays arrays, null null,
// strings JSON strings. Integers print as unsigned decimals, except that a
// value with the top bit set prints as its signed 64-bit value: the control
// protocol carries negative numbers sign-extended, and no count or time it
// sends comes near 2^63. Strings are bytes: valid UTF-8 passes through,
// quotes, backslashes and control characters are escaped, and each byte
// that is not part of a valid UTF-8 sequence is written as \u00XX (its
// value as a code point), so the output is always valid UTF-8 JSON.
#ifndef S2S_TOOLS_JSON_WRITER_H_
#define S2S_TOOLS_JSON_WRITER_H_

#include <string>

#include "S2S/pobject.h"

namespace s2s_tools {

// The JSON text of `value`: on one line, or indented by two blanks per level
// when `pretty`. Never fails.
std::string ToJson(const S2S::PObject& value, bool pretty);

// `text` as a JSON string literal, quotes included.
std::string JsonString(const std::string& text);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_JSON_WRITER_H_
