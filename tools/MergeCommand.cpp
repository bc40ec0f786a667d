// offsetops merge: another replica's later records into a store.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

constexpr int kConflicts = 1;
constexpr int kTrouble = 2;
constexpr uint64 kMaxCommitEvery = 1'000'000'000;

int RunMerge(const Arguments& args, Io& io) {
    const std::string dir = args.Store();
    const std::string from = args.Required("--from", "the directory of the store to merge from");
    const bool dryRun = args.Flag("--dry-run");
    StoreOptions options;
    options.mode = dryRun ? StoreMode::Read : StoreMode::WriteExisting;
    options.sync = !args.Flag("--no-sync");
    options.cacheObjects = args.CacheNodes(kDefaultWalkCacheObjects);
    MergeOptions merge;
    merge.dryRun = dryRun;
    merge.cacheObjects = options.cacheObjects;
    merge.durableEvery =
        static_cast<int64>(args.Number("--commit-every", 1, kMaxCommitEvery, 10000));
    merge.onConflict = [&](const MergeConflict& c) {
        io.out << "! " << ToString(c.field) << ' ' << ToString(c.site) << ' ' << ToString(c.ours)
               << ' ' << ToString(c.theirs) << '\n';
    };
    RequireStore(from);
    OffsetOpsStore store = OpenAndReport(dir, options, io.err);
    const MergeResult result = store.Merge(from, merge);
    store.Close();
    if (!io.out.flush()) {
        return OutputFailed(io.err, kTrouble);
    }
    io.err << "offsetops: " << (dryRun ? "would merge" : "merged") << " '" << from << "' into '"
           << dir << "': " << Counted(result.fields, "field", "fields") << " read, "
           << Counted(result.taken, "site record", "site records") << " "
           << (dryRun ? "to take"
                      : "taken in " + Counted(result.operations, "operation", "operations"))
           << ", " << Counted(result.conflicts, "conflict", "conflicts")
           << (result.conflicts > 0 ? " left as they were" : "") << '\n';
    return result.conflicts > 0 ? kConflicts : 0;
}

}  // namespace

CommandDecl MergeCommand() {
    return {
        "merge",
        "--store A --from B [--dry-run] [--cache-nodes C] [--commit-every K] [--no-sync]",
        "take another replica's records wherever its time stamps are later; exit status 0 when "
        "merged, 1 when there were conflicts (left as they were), 2 on errors",
        {
            StoreOption("the store merged into (its writer)"),
            {"--from", "B", "the store merged from (read beside any writer of it)"},
            {"--dry-run", "", "print the conflicts and what would be taken; change nothing"},
            CacheOption(", per store"),
            {"--commit-every", "K",
             "a durable point after every K merged operations (1 to " +
                 std::to_string(kMaxCommitEvery) + ", default 10000)"},
            {"--no-sync", "", "do not sync durable points to disk (scratch stores)"},
        },
        RunMerge,
        kTrouble,
    };
}

}  // namespace tarn::tool
