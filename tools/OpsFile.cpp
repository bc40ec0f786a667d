#include "tools/OpsFile.h"

#include <charconv>
#include <vector>

#include "tnStore/FieldIdText.h"

namespace tarn::tool {

namespace {

// The UTF-8 encoding of U+FEFF, which some editors put at the start of a file.
constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

std::string_view Trim(std::string_view s) {
    const char* blanks = " \t\r";
    std::size_t first = s.find_first_not_of(blanks);
    if (first == std::string_view::npos) {
        return {};
    }
    std::size_t last = s.find_last_not_of(blanks);
    return s.substr(first, last - first + 1);
}

std::string Quoted(std::string_view s) {
    return "'" + std::string(s) + "'";
}

// A decimal integer filling all of `s`; std::errc{} on success,
// invalid_argument or result_out_of_range otherwise.
template <typename Int>
std::errc ParseDecimal(std::string_view s, Int& value) {
    if (s.size() > 1 && s[0] == '+') {
        s.remove_prefix(1);
    }
    if (s.empty()) {
        return std::errc::invalid_argument;
    }
    auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), value);
    if (ec == std::errc{} && end != s.data() + s.size()) {
        return std::errc::invalid_argument;
    }
    return ec;
}

bool ParseTimeStamp(std::string_view s, int64& t, std::string& error) {
    if (s.empty()) {
        error = "the time stamp is missing";
        return false;
    }
    std::errc ec = ParseDecimal(s, t);
    if (ec == std::errc::invalid_argument) {
        error = "time stamp " + Quoted(s) + " is not a decimal integer";
        return false;
    }
    if (ec == std::errc::result_out_of_range || t < 0 || t > kMaxTimeStamp) {
        error = "time stamp " + std::string(s) + " is outside 0.." + std::to_string(kMaxTimeStamp) +
                " (time stamps are stored as 32-bit values)";
        return false;
    }
    return true;
}

bool ParseOffset(std::string_view s, int64& offset, std::string& error) {
    if (s.empty()) {
        error = "the offset is missing";
        return false;
    }
    std::errc ec = ParseDecimal(s, offset);
    if (ec == std::errc::invalid_argument) {
        error = "offset " + Quoted(s) + " is not a signed decimal integer";
        return false;
    }
    if (ec == std::errc::result_out_of_range) {
        error = "offset " + std::string(s) + " does not fit in 64 bits";
        return false;
    }
    return true;
}

}  // namespace

std::string FormatOpsLine(const OffsetOperation& op) {
    return ToString(op.site) + "," + std::to_string(op.t) + "," +
           std::to_string(op.field.oid.value_) + "," + PathHex(op.field.path) + "," +
           std::to_string(op.offset);
}

ParsedLine ParseOpsLine(std::string_view line) {
    ParsedLine parsed;
    line = Trim(line.substr(0, line.find('#')));
    if (line.empty()) {
        return parsed;
    }
    std::vector<std::string_view> fields;
    for (std::size_t start = 0;;) {
        std::size_t comma = line.find(',', start);
        fields.push_back(Trim(line.substr(start, comma - start)));
        if (comma == std::string_view::npos) {
            break;
        }
        start = comma + 1;
    }
    parsed.kind = ParsedLine::Kind::Error;
    if (fields.size() != 5) {
        parsed.error = "expected 5 comma-separated fields (site,t,oid,path,offset), found " +
                       std::to_string(fields.size());
        return parsed;
    }
    std::optional<Guid> site = ParseGuid(fields[0]);
    if (!site) {
        parsed.error = "site " + Quoted(fields[0]) +
                       " is not a Guid (8-4-4-4-12 hex digits, e.g. "
                       "0123abcd-0000-4000-8000-00000000002a)";
        return parsed;
    }
    OffsetOperation& op = parsed.op;
    op.site = *site;
    if (!ParseTimeStamp(fields[1], op.t, parsed.error)) {
        return parsed;
    }
    const std::optional<OID> oid = ParseOid(fields[2], &parsed.error);
    const std::optional<Path> path = oid ? ParsePathHex(fields[3], &parsed.error) : std::nullopt;
    if (!path || !ParseOffset(fields[4], op.offset, parsed.error)) {
        return parsed;
    }
    op.field = FieldId(*oid, *path);
    parsed.kind = ParsedLine::Kind::Operation;
    return parsed;
}

int64 OpsFileReader::Skip(int64 lines) {
    int64 skipped = 0;
    for (; skipped < lines && std::getline(m_in, m_buffer); ++skipped) {
        ++m_line;
        m_complete = !m_in.eof();
        m_bytes += m_buffer.size() + 1;
    }
    return skipped;
}

OpsFileReader::Status OpsFileReader::Next(OffsetOperation& op, std::string& error) {
    while (std::getline(m_in, m_buffer)) {
        ++m_line;
        m_complete = !m_in.eof();
        m_bytes += m_buffer.size() + 1;
        std::string_view line = m_buffer;
        if (m_line == 1 && line.starts_with(kByteOrderMark)) {
            line.remove_prefix(kByteOrderMark.size());
        }
        ParsedLine parsed = ParseOpsLine(line);
        switch (parsed.kind) {
            case ParsedLine::Kind::Nothing:
                continue;
            case ParsedLine::Kind::Operation:
                op = std::move(parsed.op);
                return Status::Operation;
            case ParsedLine::Kind::Error:
                error = std::move(parsed.error);
                return Status::Error;
        }
    }
    if (m_in.bad()) {
        ++m_line;
        error = "read error";
        return Status::Error;
    }
    return Status::End;
}

}  // namespace tarn::tool
