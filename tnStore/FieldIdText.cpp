#include "tnStore/FieldIdText.h"

#include <charconv>
#include <vector>

#include "tnUtils/Hex.h"
#include "tnUtils/xostream.h"

namespace tarn {

namespace {

std::string_view Trim(std::string_view s) {
    const char* blanks = " \t\r";
    const std::size_t first = s.find_first_not_of(blanks);
    if (first == std::string_view::npos) {
        return {};
    }
    return s.substr(first, s.find_last_not_of(blanks) - first + 1);
}

std::string Quoted(std::string_view s) {
    return "'" + std::string(s) + "'";
}

template <typename T>
std::optional<T> Refuse(std::string* error, std::string message) {
    if (error != nullptr) {
        *error = std::move(message);
    }
    return std::nullopt;
}

}  // namespace

std::optional<OID> ParseOid(std::string_view s, std::string* error) {
    if (s.empty()) {
        return Refuse<OID>(error, "the oid is missing");
    }
    if (s[0] == '-' || s[0] == '+') {
        return Refuse<OID>(error, "oid " + Quoted(s) + " is not an unsigned decimal integer");
    }
    uint64 oid = 0;
    const auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), oid);
    if (ec == std::errc::result_out_of_range) {
        return Refuse<OID>(error, "oid " + std::string(s) + " does not fit in 64 bits");
    }
    if (ec != std::errc{} || end != s.data() + s.size()) {
        return Refuse<OID>(error, "oid " + Quoted(s) + " is not an unsigned decimal integer");
    }
    if (oid == 0) {
        return Refuse<OID>(error, "oid 0 names no object (identities start at 1)");
    }
    return OID(Seid(oid));
}

std::optional<Path> ParsePathHex(std::string_view s, std::string* error) {
    if (s.size() % 2 != 0) {
        return Refuse<Path>(error, "path " + Quoted(s) + " has an odd number of hex digits");
    }
    std::vector<octet_t> bytes;
    bytes.reserve(s.size() / 2);
    for (std::size_t i = 0; i < s.size(); i += 2) {
        const int hi = HexDigitValue(s[i]);
        const int lo = HexDigitValue(s[i + 1]);
        if (hi < 0 || lo < 0) {
            return Refuse<Path>(error, "path " + Quoted(s) + " is not hex (two hex digits a byte)");
        }
        bytes.push_back(static_cast<octet_t>(hi * 16 + lo));
    }
    return Path(bytes.data(), static_cast<ssize_t>(bytes.size()));
}

std::optional<FieldId> ParseFieldId(std::string_view text, std::string* error) {
    std::string_view s = Trim(text);
    if (!s.empty() && s[0] == '#') {
        s.remove_prefix(1);
    }
    const std::size_t slash = s.find('/');
    const std::string_view pathText = slash == std::string_view::npos ? "" : s.substr(slash + 1);
    std::string message;
    const std::optional<OID> oid = ParseOid(s.substr(0, slash), &message);
    const std::optional<Path> path = oid ? ParsePathHex(pathText, &message) : std::nullopt;
    if (!path) {
        return Refuse<FieldId>(error, "field " + Quoted(text) + ": " + message +
                                          " (expected OID/PATH, e.g. #12/0a0b)");
    }
    return FieldId(*oid, *path);
}

std::string PathHex(const Path& path) {
    StringOutputStream text;
    {
        xostream os(text);
        os << path;
    }
    return text.str();
}

}  // namespace tarn
