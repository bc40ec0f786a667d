// offsetops stats: the counts the store keeps, without a walk.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

// text: "label   value" rows; json: one object; csv: name,value rows.
int RunStats(const Arguments& args, Io& io) {
    const std::string dir = args.Store();
    const Format format = args.OutputFormat();
    OffsetOpsStore store = OpenAndReport(dir, StoreMode::Read, io.err);
    const StoreStatistics stats = store.Stats();
    const int64 sinceCheckpoint =
        static_cast<int64>(stats.durableOperations - stats.checkpointedOperations);
    if (format == Format::Text) {
        Row(io.out, "images", std::to_string(stats.images));
        Row(io.out, "image bytes", std::to_string(stats.imageBytes));
        Row(io.out, "fields", std::to_string(stats.fields));
        Row(io.out, "nodes", NodesText(stats));
        Row(io.out, "height", std::to_string(stats.height));
        Row(io.out, "journal bytes", std::to_string(stats.journalBytes));
        Row(io.out, "ops since checkpoint", std::to_string(sinceCheckpoint));
        return io.out.flush() ? 0 : OutputFailed(io.err, kFailed);
    }
    const std::pair<const char*, int64> values[] = {
        {"images", stats.images},
        {"image_bytes", stats.imageBytes},
        {"fields", stats.fields},
        {"nodes", stats.Nodes()},
        {"leaves", stats.leaves},
        {"internal_nodes", stats.internalNodes},
        {"height", static_cast<int64>(stats.height)},
        {"journal_bytes", stats.journalBytes},
        {"ops_since_checkpoint", sinceCheckpoint},
    };
    JsonWriter json(io.out);
    if (format == Format::Json) {
        json.BeginObject();
    } else {
        io.out << "name,value\n";
    }
    for (const auto& [name, value] : values) {
        if (format == Format::Json) {
            json.Member(name, value);
        } else {
            io.out << name << ',' << value << '\n';
        }
    }
    if (format == Format::Json) {
        json.EndObject();
    }
    return io.out.flush() ? 0 : OutputFailed(io.err, kFailed);
}

}  // namespace

CommandDecl StatsCommand() {
    return {
        "stats",
        "--store DIR [--format FORMAT]",
        "print counts of the store, its journal and the tree (from what the store keeps: no "
        "walk)",
        {StoreOption(), FormatOption()},
        RunStats,
    };
}

}  // namespace tarn::tool
