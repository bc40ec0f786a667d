#pragma once

// How offsetops writes what it reports: the formats of --format (text, JSON,
// CSV), JSON written by hand, CSV fields, counted nouns, and telling a closed
// pipe from a failed write.

#include <ostream>
#include <string>
#include <string_view>
#include <vector>

#include "tnStore/FieldTable.h"
#include "tnUtils/Types.h"

namespace tarn::tool {

enum class Format { Text, Json, Csv };

// A JSON document written as it goes: commas and quoting are its business.
// The elements of the outermost array or object go on lines of their own, so
// that a long document reads (and greps) a line an element; everything
// inside one is on its line.
class JsonWriter {
public:
    explicit JsonWriter(std::ostream& out) : m_out(out) {}

    void BeginObject() { Open('{'); }
    void EndObject() { Close('}'); }
    void BeginArray() { Open('['); }
    void EndArray() { Close(']'); }
    // The key of the next value in an object.
    void Key(std::string_view key);
    void String(std::string_view value);
    void Number(int64 value);
    void Unsigned(uint64 value);
    void Bool(bool value);

    // Shorthands for a member of an object.
    void Member(std::string_view key, std::string_view value) {
        Key(key);
        String(value);
    }
    void Member(std::string_view key, int64 value) {
        Key(key);
        Number(value);
    }

private:
    void BeforeValue();
    void Open(char bracket);
    void Close(char bracket);

    std::ostream& m_out;
    std::vector<bool> m_first;  // per open level: no element yet
    bool m_afterKey = false;
};

// `text` as a JSON string, quotes included: control characters, quotes and
// backslashes escaped; bytes that are not UTF-8 as U+FFFD.
std::string JsonQuoted(std::string_view text);

// A table's records as an array of {"site", "t", "o"} objects.
void WriteTable(JsonWriter& json, const FieldTable& table);

// A CSV field: as it is, or quoted (doubling quotes) when it holds a comma,
// a quote or a line break.
std::string CsvField(std::string_view text);

// "1 operation", "3 operations".
std::string Counted(int64 n, std::string_view one, std::string_view many);

// True when standard output is a pipe whose reader has gone: a program that
// stops reading (`offsetops show | head -1`) ends ours quietly.
bool StandardOutputClosed();

}  // namespace tarn::tool
