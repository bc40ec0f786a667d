#include "tools/JsonText.h"

#include <cstdio>

namespace tarn::tool {

namespace {

// The length of the UTF-8 sequence at the start of `s`, 0 when it is not a
// well-formed one.
std::size_t Utf8Length(std::string_view s) {
    const auto byte = [&](std::size_t i) { return static_cast<unsigned char>(s[i]); };
    const unsigned char lead = byte(0);
    const std::size_t length = lead < 0x80                    ? 1
                               : lead >= 0xC2 && lead <= 0xDF ? 2
                               : lead >= 0xE0 && lead <= 0xEF ? 3
                               : lead >= 0xF0 && lead <= 0xF4 ? 4
                                                              : 0;
    if (length == 0 || length > s.size()) {
        return 0;
    }
    for (std::size_t i = 1; i < length; ++i) {
        if ((byte(i) & 0xC0) != 0x80) {
            return 0;
        }
    }
    // Overlong three- and four-byte forms, surrogates, and past U+10FFFF.
    if ((lead == 0xE0 && byte(1) < 0xA0) || (lead == 0xED && byte(1) >= 0xA0) ||
        (lead == 0xF0 && byte(1) < 0x90) || (lead == 0xF4 && byte(1) >= 0x90)) {
        return 0;
    }
    return length;
}

// The escape of a byte below 0x80 that JSON needs escaped, or nothing.
std::string AsciiEscape(char c) {
    const auto u = static_cast<unsigned char>(c);
    switch (c) {
        case '"':
            return "\\\"";
        case '\\':
            return "\\\\";
        case '\n':
            return "\\n";
        case '\r':
            return "\\r";
        case '\t':
            return "\\t";
        default:
            break;
    }
    if (u < 0x20 || u == 0x7F) {
        char escape[8];
        std::snprintf(escape, sizeof escape, "\\u%04x", u);
        return escape;
    }
    return {};
}

}  // namespace

std::string JsonQuoted(std::string_view text) {
    std::string quoted = "\"";
    for (std::size_t i = 0; i < text.size();) {
        if (static_cast<unsigned char>(text[i]) < 0x80) {
            const std::string escape = AsciiEscape(text[i]);
            quoted += escape.empty() ? std::string(1, text[i]) : escape;
            ++i;
            continue;
        }
        const std::size_t length = Utf8Length(text.substr(i));
        if (length == 0) {
            quoted += "\\ufffd";
            ++i;
        } else {
            quoted.append(text.substr(i, length));
            i += length;
        }
    }
    return quoted + "\"";
}

std::string JsonText(const Json& value) {
    std::string text;
    bool first = true;
    switch (value.type()) {
        case Json::value_t::string:
            return JsonQuoted(value.get_ref<const std::string&>());
        case Json::value_t::array:
            text = "[";
            for (const Json& element : value) {
                text += (first ? "" : ",") + JsonText(element);
                first = false;
            }
            return text + "]";
        case Json::value_t::object:
            text = "{";
            for (const auto& [key, member] : value.items()) {
                text += (first ? "" : ",") + JsonQuoted(key) + ":" + JsonText(member);
                first = false;
            }
            return text + "}";
        default:  // numbers, truth values, null
            return value.dump();
    }
}

}  // namespace tarn::tool
