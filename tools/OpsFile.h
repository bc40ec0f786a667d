#pragma once

// The text form of offset operations read by `offsetops record --ops FILE`.
//
// One operation a line, five comma-separated fields:
//
//   site,t,oid,path,offset
//
//   site    the site's Guid, 8-4-4-4-12 hex digits ("0123abcd-0000-4000-8000-00000000002a")
//   t       the operation's time stamp, decimal, 0..4294967295 (stored as 32 bits)
//   oid     the object's identity, decimal, 1..18446744073709551615 (0 is no object)
//   path    the field's path inside the object, hex, two digits a byte; may be empty
//   offset  the offset, signed decimal, 64 bits
//
// Spaces and tabs around a field are ignored, and so is a carriage return at
// the end of a line (CRLF files). A UTF-8 byte order mark (EF BB BF) at the
// start of the first line is skipped. A '#' starts a comment that runs to the
// end of the line; a line holding nothing but a comment or blanks is skipped.
//
// Everything here only parses: nothing checks an operation against what a
// store already holds (OffsetOpsStore::Record refuses what it must not take).

#include <istream>
#include <optional>
#include <string>
#include <string_view>

#include "tnOperation/FieldId.h"
#include "tnStore/OffsetOpsStore.h"
#include "tnUtils/Guid.h"
#include "tnUtils/Types.h"

namespace tarn::tool {

// One offset operation: `offset` added to field `field` by site `site` at
// time stamp `t`.
struct OffsetOperation {
    Guid site{};
    int64 t = 0;
    FieldId field;
    int64 offset = 0;
};

// The line form above, without a line break; ParseOpsLine reads it back.
std::string FormatOpsLine(const OffsetOperation& op);

// The outcome of parsing one line.
struct ParsedLine {
    enum class Kind { Operation, Nothing, Error };
    Kind kind = Kind::Nothing;
    OffsetOperation op;  // for Operation
    std::string error;   // for Error: what is wrong, without file or line
};

ParsedLine ParseOpsLine(std::string_view line);

// Reads operations from a stream line by line, skipping blanks and comments.
// Not thread-safe; owns nothing but its line buffer.
class OpsFileReader {
public:
    enum class Status { Operation, End, Error };

    OpsFileReader(std::istream& in, std::string name) : m_in(in), m_name(std::move(name)) {}

    // The next operation into `op`; on Error, `error` says what is wrong with
    // line LineNumber(). After End or Error, do not call again.
    Status Next(OffsetOperation& op, std::string& error);

    // Passes over the next `lines` lines, whatever they hold; returns how
    // many there were (fewer at the end of the input).
    int64 Skip(int64 lines);

    // Whether the line read last ended in a line break (or was the file's
    // last line): false for one cut short by the input's end.
    bool LastLineComplete() const { return m_complete; }

    // The number of the line read last (1 for the first line).
    int64 LineNumber() const { return m_line; }
    const std::string& Name() const { return m_name; }
    // The bytes of the lines read so far, line breaks included.
    uint64 BytesRead() const { return m_bytes; }

private:
    std::istream& m_in;
    std::string m_name;
    std::string m_buffer;
    int64 m_line = 0;
    uint64 m_bytes = 0;
    bool m_complete = true;
};

}  // namespace tarn::tool
