#pragma once

// The text form of a field, as the store's messages and the offsetops program
// write it and as their users type it: "#<oid>/<path in hex>" ("#12/0a0b").
// ToString(const FieldId&) (tnOperation/FieldId.h) writes it; these read it
// and its parts.

#include <optional>
#include <string>
#include <string_view>

#include "tnOperation/FieldId.h"

namespace tarn {

// A field key: an optional '#', the decimal identity, then '/' and the path
// in hex, two digits a byte ("12" alone, or "12/", is the empty path). Spaces
// around it are ignored. Nothing, with a message in `error` (if not null),
// when the text is not one.
std::optional<FieldId> ParseFieldId(std::string_view text, std::string* error = nullptr);

// An object identity in decimal, 1..18446744073709551615 (0 is no object).
std::optional<OID> ParseOid(std::string_view text, std::string* error = nullptr);

// A path in hex, two digits a byte, either case; may be empty.
std::optional<Path> ParsePathHex(std::string_view text, std::string* error = nullptr);

// The path in lower-case hex.
std::string PathHex(const Path& path);

}  // namespace tarn
