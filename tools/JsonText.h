#pragma once

// How the program writes a JSON value: on one line, with strings quoted by
// its own rules. nlohmann::json holds the values and writes the numbers,
// truth values and null; strings, arrays and objects are written here, so
// that a string reads the same as it always has:
//   " and \          \" and \\ (backslash first)
//   \n \r \t         \n \r \t
//   other bytes below 0x20, and 0x7f
//                    \u00XX (lower-case hexadecimal)
//   well-formed UTF-8 as it is
//   any other byte   \ufffd, one for each byte that starts no well-formed
//                    sequence
// nlohmann's own dump would write \b and \f, 0x7f as it is, and one U+FFFD
// as raw bytes for a whole broken sequence.

#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

namespace tarn::tool {

// Objects keep their members in the order they were added.
using Json = nlohmann::ordered_json;

// `text` as a JSON string, quotes included, as above.
std::string JsonQuoted(std::string_view text);

// `value` as JSON on one line, with no spaces.
std::string JsonText(const Json& value);

}  // namespace tarn::tool
