#include "tools/Output.h"

#include <poll.h>
#include <unistd.h>

#include <cstdio>

namespace tarn::tool {

void JsonWriter::BeforeValue() {
    if (m_afterKey) {
        m_afterKey = false;
        return;
    }
    if (m_first.empty()) {
        return;
    }
    if (!m_first.back()) {
        m_out << ',';
    }
    if (m_first.size() == 1) {
        m_out << '\n';
    }
    m_first.back() = false;
}

void JsonWriter::Open(char bracket) {
    BeforeValue();
    m_out << bracket;
    m_first.push_back(true);
}

void JsonWriter::Close(char bracket) {
    const bool empty = m_first.back();
    m_first.pop_back();
    if (m_first.empty() && !empty) {
        m_out << '\n';
    }
    m_out << bracket;
    if (m_first.empty()) {
        m_out << '\n';
    }
}

void JsonWriter::Key(std::string_view key) {
    BeforeValue();
    m_out << JsonQuoted(key) << ':';
    m_afterKey = true;
}

void JsonWriter::String(std::string_view value) {
    BeforeValue();
    m_out << JsonQuoted(value);
}

void JsonWriter::Number(int64 value) {
    BeforeValue();
    m_out << value;
}

void JsonWriter::Unsigned(uint64 value) {
    BeforeValue();
    m_out << value;
}

void JsonWriter::Bool(bool value) {
    BeforeValue();
    m_out << (value ? "true" : "false");
}

namespace {

// The length of the UTF-8 sequence at the start of `s`, 0 when it is not a
// well-formed one.
std::size_t Utf8Length(std::string_view s) {
    const auto byte = [&](std::size_t i) { return static_cast<unsigned char>(s[i]); };
    const unsigned char lead = byte(0);
    std::size_t length = lead < 0x80                    ? 1
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

}  // namespace

std::string JsonQuoted(std::string_view text) {
    std::string quoted = "\"";
    for (std::size_t i = 0; i < text.size();) {
        const char c = text[i];
        const auto u = static_cast<unsigned char>(c);
        if (c == '"' || c == '\\') {
            quoted += '\\';
            quoted += c;
        } else if (c == '\n') {
            quoted += "\\n";
        } else if (c == '\r') {
            quoted += "\\r";
        } else if (c == '\t') {
            quoted += "\\t";
        } else if (u < 0x20 || u == 0x7F) {
            char escape[8];
            std::snprintf(escape, sizeof escape, "\\u%04x", u);
            quoted += escape;
        } else if (u >= 0x80) {
            const std::size_t length = Utf8Length(text.substr(i));
            if (length == 0) {
                quoted += "\\ufffd";
                ++i;
                continue;
            }
            quoted.append(text.substr(i, length));
            i += length;
            continue;
        } else {
            quoted += c;
        }
        ++i;
    }
    return quoted + "\"";
}

void WriteTable(JsonWriter& json, const FieldTable& table) {
    json.BeginArray();
    for (const SiteRecord& r : table) {
        json.BeginObject();
        json.Member("site", ToString(r.site));
        json.Member("t", r.t);
        json.Member("o", r.o);
        json.EndObject();
    }
    json.EndArray();
}

std::string CsvField(std::string_view text) {
    if (text.find_first_of(",\"\r\n") == std::string_view::npos) {
        return std::string(text);
    }
    std::string quoted = "\"";
    for (const char c : text) {
        quoted += c;
        if (c == '"') {
            quoted += '"';
        }
    }
    return quoted + "\"";
}

std::string Counted(int64 n, std::string_view one, std::string_view many) {
    return std::to_string(n) + " " + std::string(n == 1 ? one : many);
}

bool StandardOutputClosed() {
    pollfd fd{STDOUT_FILENO, POLLOUT, 0};
    return ::poll(&fd, 1, 0) == 1 && (fd.revents & POLLERR) != 0;
}

}  // namespace tarn::tool
