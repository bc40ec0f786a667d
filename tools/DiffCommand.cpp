// offsetops diff: the fields whose tables two stores do not agree on.

#include <filesystem>

#include "tnStore/FieldCursor.h"
#include "tools/CommandSupport.h"
#include "tools/Commands.h"
#include "tools/Progress.h"

namespace tarn::tool {

namespace {

constexpr int kDiffer = 1;
constexpr int kTrouble = 2;

enum class Change { OnlyA, OnlyB, Other };

struct DiffCounts {
    int64 onlyA = 0;
    int64 onlyB = 0;
    int64 other = 0;
    int64 Total() const { return onlyA + onlyB + other; }
};

// The differences in the format asked for:
//   text  < FIELD --> TABLE  (only in A), > FIELD --> TABLE (only in B),
//         ! FIELD --> TABLE-A TABLE-B (in both, with other tables)
//   json  [{"change":"only-a"|"only-b"|"other","field":..,"a":TABLE,"b":TABLE},...]
//         (a table a store lacks is left out)
//   csv   change,field,store,site,t,o: a row per site record of each side
class DiffPrinter {
public:
    DiffPrinter(std::ostream& out, Format format) : m_out(out), m_format(format), m_json(out) {
        if (m_format == Format::Json) {
            m_json.BeginArray();
        } else if (m_format == Format::Csv) {
            m_out << "change,field,store,site,t,o\n";
        }
    }

    void Print(Change change, const FieldId& key, const FieldTable* a, const FieldTable* b) {
        static const char* const kText[] = {"< ", "> ", "! "};
        static const char* const kName[] = {"only-a", "only-b", "other"};
        const int index = static_cast<int>(change);
        switch (m_format) {
            case Format::Text:
                m_out << kText[index] << ToString(key) << " --> " << ToString(a ? *a : *b);
                if (a && b) {
                    m_out << ' ' << ToString(*b);
                }
                m_out << '\n';
                break;
            case Format::Json:
                m_json.BeginObject();
                m_json.Member("change", kName[index]);
                m_json.Member("field", ToString(key));
                for (const auto& [name, table] : {std::pair{"a", a}, std::pair{"b", b}}) {
                    if (table != nullptr) {
                        m_json.Key(name);
                        WriteTable(m_json, *table);
                    }
                }
                m_json.EndObject();
                break;
            case Format::Csv:
                for (const auto& [name, table] : {std::pair{"a", a}, std::pair{"b", b}}) {
                    for (const SiteRecord& r : table ? *table : FieldTable{}) {
                        m_out << kName[index] << ',' << CsvField(ToString(key)) << ',' << name
                              << ',' << ToString(r.site) << ',' << r.t << ',' << r.o << '\n';
                    }
                }
                break;
        }
    }

    void End() {
        if (m_format == Format::Json) {
            m_json.EndArray();
        }
    }

private:
    std::ostream& m_out;
    Format m_format;
    JsonWriter m_json;
};

DiffCounts Compare(OffsetOpsStore& a, OffsetOpsStore& b, bool progressWanted, Format format,
                   Io& io) {
    const uint64 total = static_cast<uint64>(a.Size() + b.Size());
    ProgressLine progress(progressWanted, io.err, "diff");
    DiffPrinter printer(io.out, format);
    uint64 walked = 0;
    DiffCounts counts;
    FieldCursor x(a), y(b);
    while ((!x.AtEnd() || !y.AtEnd()) && io.out) {
        const int order = x.AtEnd()           ? 1
                          : y.AtEnd()         ? -1
                          : x.Key() < y.Key() ? -1
                          : y.Key() < x.Key() ? 1
                                              : 0;
        if (order < 0) {
            printer.Print(Change::OnlyA, x.Key(), &x.Table(), nullptr);
            ++counts.onlyA;
            x.Next();
            ++walked;
        } else if (order > 0) {
            printer.Print(Change::OnlyB, y.Key(), nullptr, &y.Table());
            ++counts.onlyB;
            y.Next();
            ++walked;
        } else {
            if (!(x.Table() == y.Table())) {
                printer.Print(Change::Other, x.Key(), &x.Table(), &y.Table());
                ++counts.other;
            }
            x.Next();
            y.Next();
            walked += 2;
        }
        if (progress.Enabled()) {
            progress.Show(walked, total,
                          std::to_string(walked) + " of " + Counted(total, "field", "fields"));
        }
    }
    progress.Finish();
    printer.End();
    return counts;
}

int RunDiff(const Arguments& args, Io& io) {
    const std::string a = args.Store();
    const std::string b = args.Required("--with", "the directory of the store to compare with");
    const ssize_t cacheObjects = args.CacheNodes(kDefaultWalkCacheObjects);
    const Format format = args.OutputFormat();
    const bool progress = args.Progress();
    std::optional<OffsetOpsStore> first = OpenForWalk(a, cacheObjects, io.err);
    if (!first) {
        return kTrouble;
    }
    // A directory opens once per process; compared with itself it is equal.
    std::error_code ec;
    std::optional<OffsetOpsStore> second;
    if (!std::filesystem::equivalent(a, b, ec)) {
        second = OpenForWalk(b, cacheObjects, io.err);
        if (!second) {
            return kTrouble;
        }
    }
    const DiffCounts counts = Compare(*first, second ? *second : *first, progress, format, io);
    if (!io.out.flush()) {
        return OutputFailed(io.err, kTrouble);
    }
    if (counts.Total() == 0) {
        return 0;
    }
    // Standard output holds the differences and nothing else; the count is
    // for a person at a terminal.
    if (progress) {
        io.err << "offsetops: " << counts.Total()
               << (counts.Total() == 1 ? " field differs: " : " fields differ: ") << counts.onlyA
               << " only in '" << a << "', " << counts.onlyB << " only in '" << b << "', "
               << counts.other << " with other tables\n";
    }
    return kDiffer;
}

}  // namespace

CommandDecl DiffCommand() {
    return {
        "diff",
        "--store A --with B [--cache-nodes C] [--format FORMAT] [--no-progress]",
        "print the fields whose tables two stores do not agree on; exit status 0 when the maps "
        "are equal, 1 when they differ, 2 on errors",
        {
            StoreOption("the first store's directory"),
            {"--with", "B", "the second store's directory"},
            CacheOption(", per store"),
            FormatOption(),
            NoProgressOption(),
        },
        RunDiff,
        kTrouble,
    };
}

}  // namespace tarn::tool
