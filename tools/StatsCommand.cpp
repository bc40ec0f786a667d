// offsetops stats: the counts the store keeps, without a walk.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

// The counts as a summary (tools/Report.h): the text shows the nodes in one
// row, JSON and CSV as three values.
int RunStats(const Arguments& args, Io& io) {
    const std::string dir = args.Store();
    const Format format = args.OutputFormat();
    OffsetOpsStore store = OpenAndReport(dir, StoreMode::Read, io.err);
    const StoreStatistics stats = store.Stats();
    const int64 sinceCheckpoint =
        static_cast<int64>(stats.durableOperations - stats.checkpointedOperations);
    Summary summary;
    summary.Value("images", stats.images, "images")
        .Value("image_bytes", stats.imageBytes, "image bytes")
        .Value("fields", stats.fields, "fields")
        .Value("nodes", stats.Nodes(), "nodes", NodesText(stats))
        .Value("leaves", stats.leaves)
        .Value("internal_nodes", stats.internalNodes)
        .Value("height", static_cast<int64>(stats.height), "height")
        .Value("journal_bytes", stats.journalBytes, "journal bytes")
        .Value("ops_since_checkpoint", sinceCheckpoint, "ops since checkpoint");
    summary.Write(io.out, format);
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
