#pragma once

// The program's one output layer: what a command reports, described once and
// written in the format of --format (text, JSON or CSV).
//
// Two shapes:
//   Summary  named values (stats, validate; record's and backup's, text only):
//              text  "label   value" rows, values from column 23, and lines
//                    of their own
//              json  one object
//              csv   "name,value" and a row per value
//   Listing  a stream of items, as long as a store (sites, show, diff):
//              text  a line per item
//              json  one array
//              csv   a header and rows
// JSON documents put each element of their outermost object or array on a
// line of its own, so that a long document reads (and greps) a line an
// element; everything inside one is on its line (tools/JsonText.h, which
// also says how strings are escaped). CSV fields are quoted where they hold
// a comma, a quote or a line break.

#include <functional>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

#include "tnStore/FieldTable.h"
#include "tools/JsonText.h"

namespace tarn::tool {

enum class Format { Text, Json, Csv };

// A table's records as an array of {"site", "t", "o"} objects.
Json TableJson(const FieldTable& table);

// A CSV field: as it is, or quoted (doubling quotes) when it holds a comma,
// a quote or a line break.
std::string CsvField(std::string_view text);

// Named values, written once complete.
class Summary {
public:
    // A value of every format: the text row `label` (showing `text`, or the
    // value when `text` is empty), the JSON member and the CSV row `name`.
    Summary& Value(std::string name, Json value, std::string label, std::string text = {});
    // A value of JSON and CSV only (the text shows it inside another row).
    Summary& Value(std::string name, Json value);
    // A value of JSON only.
    Summary& JsonOnly(std::string name, Json value);
    // A text row only.
    Summary& TextRow(std::string label, std::string text);
    // A text line of its own.
    Summary& TextLine(std::string line);
    // Strings: the JSON array `name`, a CSV row `csvName` each, and a text
    // line `textPrefix` + item each.
    Summary& List(std::string name, std::string csvName, std::string textPrefix,
                  std::vector<std::string> items);

    void Write(std::ostream& out, Format format) const;

private:
    enum Formats : unsigned { kText = 1, kJson = 2, kCsv = 4, kAll = 7 };
    struct Entry {
        unsigned formats;
        std::string name;  // JSON and CSV
        Json value;
        std::string label;  // text; empty: a line of its own
        std::string text;   // text; empty: the value's
    };

    void WriteText(std::ostream& out) const;
    void WriteJson(std::ostream& out) const;
    void WriteCsv(std::ostream& out) const;

    std::vector<Entry> m_entries;
};

// Items written as they come; End() closes the document.
class Listing {
public:
    // `csvHeader` is the CSV header line's fields, comma-separated.
    Listing(std::ostream& out, Format format, std::string csvHeader);

    Format GetFormat() const { return m_format; }
    // A flat item: the JSON object, its values as a CSV row and, space
    // separated, as a text line.
    void Item(const Json& object);
    // An item of its own shape in each format; only the format's function
    // is called. `csvRows` writes any number of rows through Row().
    void Item(const std::function<Json()>& json, const std::function<void()>& csvRows,
              const std::function<std::string()>& text);
    // One CSV row of the current item, its fields quoted as needed.
    void Row(const std::vector<std::string>& fields);
    // Ends the document; `textNote` (text only, when not empty) is a last
    // line in parentheses.
    void End(const std::string& textNote = {});

private:
    void JsonElement(const Json& element);

    std::ostream& m_out;
    Format m_format;
    bool m_first = true;
};

// How a value reads in text and CSV: strings as they are, numbers in
// decimal, truth values as true or false.
std::string PlainText(const Json& value);

}  // namespace tarn::tool
