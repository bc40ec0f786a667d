// The ops-file parser of the command-line program on arbitrary text.
//
// Input: any bytes, used three ways:
//   - as one line for ParseOpsLine, up to the first line break;
//   - as a field key text for ParseFieldId, up to the first line break;
//   - as a whole file for OpsFileReader.
// Properties:
//   - parsing never crashes; every failure is an Error with a message;
//   - an accepted operation prints (FormatOpsLine) to a line that parses
//     back to the same operation; an accepted key prints (ToString) to a
//     text that parses back to the same key;
//   - the reader stops (End or Error) after at most one operation a line,
//     and every error it reports has a message.

#include <cstddef>
#include <cstdint>
#include <sstream>
#include <string>
#include <string_view>

#include "fuzz/FuzzStore.h"
#include "tnStore/FieldIdText.h"
#include "tools/OpsFile.h"

namespace {

using tarn::tool::OffsetOperation;
using tarn::tool::ParsedLine;

bool SameOperation(const OffsetOperation& a, const OffsetOperation& b) {
    return a.site == b.site && a.t == b.t && a.field == b.field && a.offset == b.offset;
}

void CheckLine(std::string_view line) {
    const ParsedLine parsed = tarn::tool::ParseOpsLine(line);
    if (parsed.kind == ParsedLine::Kind::Error && parsed.error.empty()) {
        tarn::fuzz::PropertyFailed("a rejected line has no message");
    }
    if (parsed.kind != ParsedLine::Kind::Operation) {
        return;
    }
    const std::string printed = tarn::tool::FormatOpsLine(parsed.op);
    const ParsedLine again = tarn::tool::ParseOpsLine(printed);
    if (again.kind != ParsedLine::Kind::Operation || !SameOperation(again.op, parsed.op)) {
        tarn::fuzz::PropertyFailed("a printed operation does not parse back to itself");
    }
}

void CheckFieldId(std::string_view text) {
    std::string error;
    const std::optional<tarn::FieldId> fid = tarn::ParseFieldId(text, &error);
    if (!fid) {
        if (error.empty()) {
            tarn::fuzz::PropertyFailed("a rejected key has no message");
        }
        return;
    }
    const std::optional<tarn::FieldId> again = tarn::ParseFieldId(tarn::ToString(*fid), &error);
    if (!again || *again != *fid) {
        tarn::fuzz::PropertyFailed("a printed key does not parse back to itself");
    }
}

void CheckReader(std::string_view text) {
    std::istringstream in{std::string(text)};
    tarn::tool::OpsFileReader reader(in, "fuzz");
    OffsetOperation op;
    std::string error;
    for (std::size_t n = 0; n <= text.size() + 1; ++n) {
        switch (reader.Next(op, error)) {
            case tarn::tool::OpsFileReader::Status::Operation:
                break;
            case tarn::tool::OpsFileReader::Status::End:
                return;
            case tarn::tool::OpsFileReader::Status::Error:
                if (error.empty()) {
                    tarn::fuzz::PropertyFailed("a reader error has no message");
                }
                return;
        }
    }
    tarn::fuzz::PropertyFailed("the reader returned more operations than the text has lines");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    const std::string_view line = text.substr(0, text.find('\n'));
    CheckLine(line);
    CheckFieldId(line);
    CheckReader(text);
    return 0;
}
