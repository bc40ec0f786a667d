#include "tools/Report.h"

#include <iomanip>

namespace tarn::tool {

namespace {

// A summary's text rows start their values in this column.
constexpr int kLabelWidth = 22;

}  // namespace

Json TableJson(const FieldTable& table) {
    Json records = Json::array();
    for (const SiteRecord& r : table) {
        records.push_back(Json{{"site", ToString(r.site)}, {"t", r.t}, {"o", r.o}});
    }
    return records;
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

std::string PlainText(const Json& value) {
    return value.is_string() ? value.get<std::string>() : JsonText(value);
}

// --- Summary ---------------------------------------------------------------------

Summary& Summary::Value(std::string name, Json value, std::string label, std::string text) {
    m_entries.push_back(
        {kAll, std::move(name), std::move(value), std::move(label), std::move(text)});
    return *this;
}

Summary& Summary::Value(std::string name, Json value) {
    m_entries.push_back({kJson | kCsv, std::move(name), std::move(value), {}, {}});
    return *this;
}

Summary& Summary::JsonOnly(std::string name, Json value) {
    m_entries.push_back({kJson, std::move(name), std::move(value), {}, {}});
    return *this;
}

Summary& Summary::TextRow(std::string label, std::string text) {
    m_entries.push_back({kText, {}, {}, std::move(label), std::move(text)});
    return *this;
}

Summary& Summary::TextLine(std::string line) {
    m_entries.push_back({kText, {}, {}, {}, std::move(line)});
    return *this;
}

Summary& Summary::List(std::string name, std::string csvName, std::string textPrefix,
                       std::vector<std::string> items) {
    Json array = Json::array();
    for (const std::string& item : items) {
        array.push_back(item);
    }
    // A CSV row and a text line per item, then the one JSON member. Each
    // format writes only its own entries, so none sees this order.
    for (const std::string& item : items) {
        m_entries.push_back({kCsv, csvName, item, {}, {}});
        m_entries.push_back({kText, {}, {}, {}, textPrefix + item});
    }
    m_entries.push_back({kJson, std::move(name), std::move(array), {}, {}});
    return *this;
}

void Summary::Write(std::ostream& out, Format format) const {
    switch (format) {
        case Format::Text:
            WriteText(out);
            break;
        case Format::Json:
            WriteJson(out);
            break;
        case Format::Csv:
            WriteCsv(out);
            break;
    }
}

void Summary::WriteText(std::ostream& out) const {
    for (const Entry& e : m_entries) {
        if ((e.formats & kText) == 0) {
            continue;
        }
        if (e.label.empty()) {
            out << e.text << '\n';
        } else {
            out << std::left << std::setw(kLabelWidth) << e.label
                << (e.text.empty() ? PlainText(e.value) : e.text) << '\n';
        }
    }
}

void Summary::WriteJson(std::ostream& out) const {
    bool first = true;
    out << '{';
    for (const Entry& e : m_entries) {
        if ((e.formats & kJson) != 0) {
            out << (first ? "\n" : ",\n") << JsonText(Json(e.name)) << ':' << JsonText(e.value);
            first = false;
        }
    }
    out << (first ? "}\n" : "\n}\n");
}

void Summary::WriteCsv(std::ostream& out) const {
    out << "name,value\n";
    for (const Entry& e : m_entries) {
        if ((e.formats & kCsv) != 0) {
            out << CsvField(e.name) << ',' << CsvField(PlainText(e.value)) << '\n';
        }
    }
}

// --- Listing ---------------------------------------------------------------------

Listing::Listing(std::ostream& out, Format format, std::string csvHeader)
    : m_out(out), m_format(format) {
    if (m_format == Format::Json) {
        m_out << '[';
    } else if (m_format == Format::Csv) {
        m_out << csvHeader << '\n';
    }
}

void Listing::JsonElement(const Json& element) {
    m_out << (m_first ? "\n" : ",\n") << JsonText(element);
    m_first = false;
}

void Listing::Item(const Json& object) {
    switch (m_format) {
        case Format::Json:
            JsonElement(object);
            break;
        case Format::Csv:
        case Format::Text: {
            std::string line;
            for (const auto& [key, value] : object.items()) {
                const std::string text = PlainText(value);
                line += (line.empty()              ? ""
                         : m_format == Format::Csv ? ","
                                                   : " ") +
                        (m_format == Format::Csv ? CsvField(text) : text);
            }
            m_out << line << '\n';
            break;
        }
    }
}

void Listing::Item(const std::function<Json()>& json, const std::function<void()>& csvRows,
                   const std::function<std::string()>& text) {
    switch (m_format) {
        case Format::Json:
            JsonElement(json());
            break;
        case Format::Csv:
            csvRows();
            break;
        case Format::Text:
            m_out << text() << '\n';
            break;
    }
}

void Listing::Row(const std::vector<std::string>& fields) {
    for (std::size_t i = 0; i < fields.size(); ++i) {
        m_out << (i == 0 ? "" : ",") << CsvField(fields[i]);
    }
    m_out << '\n';
}

void Listing::End(const std::string& textNote) {
    if (m_format == Format::Json) {
        m_out << (m_first ? "]\n" : "\n]\n");
    } else if (m_format == Format::Text && !textNote.empty()) {
        m_out << "(" << textNote << ")\n";
    }
}

}  // namespace tarn::tool
