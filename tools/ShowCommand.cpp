// offsetops show: tables of fields, in key order, as text, JSON or CSV.

#include "tnStore/FieldCursor.h"
#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

constexpr uint64 kMaxLimit = INT64_MAX;

// What show prints: one field, every field of one object, the fields of a
// key range, or every field.
struct ShowQuery {
    std::optional<FieldId> field;  // only this field
    std::optional<OID> oid;        // every field of this object
    std::optional<FieldId> from;   // the fields from this one on ...
    std::optional<FieldId> to;     // ... up to and including this one
    int64 limit = -1;              // 0 or more: at most this many fields
};

ShowQuery ShowQueryOf(const Arguments& args) {
    ShowQuery query;
    query.field = args.Field("--field");
    query.from = args.Field("--from");
    query.to = args.Field("--to");
    if (args.Has("--oid")) {
        query.oid = OID(Seid(args.Number("--oid", 1, UINT64_MAX, 0)));
    }
    const int given =
        (query.field ? 1 : 0) + (query.oid ? 1 : 0) + (query.from || query.to ? 1 : 0);
    if (given > 1) {
        throw UsageError{"show takes one of --field, --oid, or --from/--to", "show"};
    }
    if (query.from && query.to && *query.to < *query.from) {
        throw UsageError{"--from " + ToString(*query.from) + " comes after --to " +
                         ToString(*query.to)};
    }
    if (args.Has("--limit")) {  // with --field: one field at most anyway
        query.limit = static_cast<int64>(args.Number("--limit", 0, kMaxLimit, 0));
    }
    return query;
}

// Fields and their tables in the format asked for:
//   text  #12/0a0b --> {(site,(t,o)),...}, a line each, and a last line
//         in parentheses when a limit cut the list
//   json  [{"field":"#12/0a0b","oid":12,"path":"0a0b","table":[{"site":..,"t":..,"o":..}]},...]
//   csv   field,site,t,o and a row per site of each field
class FieldPrinter {
public:
    FieldPrinter(std::ostream& out, Format format) : m_listing(out, format, "field,site,t,o") {}

    void Field(const FieldId& key, const FieldTable& table) {
        m_listing.Item(
            [&] {
                return Json{{"field", ToString(key)},
                            {"oid", key.oid.value_},
                            {"path", PathHex(key.path)},
                            {"table", TableJson(table)}};
            },
            [&] {
                for (const SiteRecord& r : table) {
                    m_listing.Row({ToString(key), ToString(r.site), std::to_string(r.t),
                                   std::to_string(r.o)});
                }
            },
            [&] { return ToString(key) + " --> " + ToString(table); });
    }

    // Ends the list; `note` (text only) says what a limit left out.
    void End(const std::string& note) { m_listing.End(note); }

private:
    Listing m_listing;
};

int RunShow(const Arguments& args, Io& io) {
    const std::string dir = args.Store();
    const ShowQuery query = ShowQueryOf(args);
    const Format format = args.OutputFormat();
    OffsetOpsStore store = OpenAndReport(dir, StoreMode::Read, io.err);
    if (query.field) {
        const std::optional<FieldTable> table = store.Find(*query.field);
        if (!table) {
            return Fail(io.err, "no offsets recorded for field " + ToString(*query.field));
        }
        FieldPrinter printer(io.out, format);
        printer.Field(*query.field, *table);
        printer.End("");
        return io.out.flush() ? 0 : OutputFailed(io.err, kFailed);
    }
    std::optional<FieldPrinter> printer;
    int64 shown = 0;
    bool more = false;  // a field in range after the limit
    auto print = [&](const FieldId& key, const FieldTable& table) {
        if (shown == query.limit) {
            more = true;
            return false;
        }
        if (!printer) {
            printer.emplace(io.out, format);
        }
        printer->Field(key, table);
        ++shown;
        return static_cast<bool>(io.out);
    };
    if (query.oid) {
        store.ForEachOfObject(*query.oid, print);
        if (shown == 0) {
            return Fail(io.err, "no offsets recorded for object " + ToString(*query.oid));
        }
    } else {
        for (FieldCursor c(store, query.from.value_or(FieldId()), query.to);
             !c.AtEnd() && print(c.Key(), c.Table()); c.Next()) {
        }
    }
    if (!io.out) {
        return OutputFailed(io.err, kFailed);
    }
    if (!printer) {
        printer.emplace(io.out, format);
    }
    std::string note;
    if (!query.oid && !query.from && !query.to) {
        const int64 size = store.Size();
        if (shown < size) {
            note = std::to_string(shown) + " of " + Counted(size, "field", "fields") + " shown";
        }
    } else if (more) {
        note = Counted(shown, "field", "fields") + " shown; more follow";
    }
    printer->End(note);
    return io.out.flush() ? 0 : OutputFailed(io.err, kFailed);
}

}  // namespace

CommandDecl ShowCommand() {
    return {
        "show",
        "--store DIR [--field OID/PATH | --oid N | --from OID/PATH [--to OID/PATH]] [--limit N] "
        "[--format FORMAT]",
        "print one field's table, one object's, a range of fields', or every field's in key "
        "order",
        {
            StoreOption(),
            {"--field", "OID/PATH", "only this field (e.g. #12/0a0b)"},
            {"--oid", "N", "every field of object N"},
            {"--from", "OID/PATH", "the fields from this one on, in key order"},
            {"--to", "OID/PATH", "the fields up to and including this one"},
            {"--limit", "N", "print at most N fields (text: then how many there are)"},
            FormatOption(),
        },
        RunShow,
    };
}

}  // namespace tarn::tool
