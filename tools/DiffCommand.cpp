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
    DiffPrinter(std::ostream& out, Format format)
        : m_listing(out, format, "change,field,store,site,t,o") {}

    void Print(Change change, const FieldId& key, const FieldTable* a, const FieldTable* b) {
        static const char* const kText[] = {"< ", "> ", "! "};
        static const char* const kName[] = {"only-a", "only-b", "other"};
        const int index = static_cast<int>(change);
        const std::pair<const char*, const FieldTable*> sides[] = {{"a", a}, {"b", b}};
        m_listing.Item(
            [&] {
                Json item{{"change", kName[index]}, {"field", ToString(key)}};
                for (const auto& [name, table] : sides) {
                    if (table != nullptr) {
                        item[name] = TableJson(*table);
                    }
                }
                return item;
            },
            [&] {
                for (const auto& [name, table] : sides) {
                    for (const SiteRecord& r : table ? *table : FieldTable{}) {
                        m_listing.Row({kName[index], ToString(key), name, ToString(r.site),
                                       std::to_string(r.t), std::to_string(r.o)});
                    }
                }
            },
            [&] {
                return kText[index] + ToString(key) + " --> " + ToString(a ? *a : *b) +
                       (a && b ? " " + ToString(*b) : std::string());
            });
    }

    void End() { m_listing.End(); }

private:
    Listing m_listing;
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
