// offsetops validate: every node, the leaf chain, the kept counts and the
// images no root reaches.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

// The problems validate reports: the check's (with a count of those it did
// not keep), the map's own validation, and the images no root reaches.
struct Problems {
    std::vector<std::string> lines;
    int64 count = 0;
};

std::string UnreachableText(const std::vector<uint64>& unreachable) {
    std::string list;
    for (std::size_t i = 0; i < unreachable.size() && i < 10; ++i) {
        list += (i == 0 ? "#" : ", #") + std::to_string(unreachable[i]);
    }
    if (unreachable.size() > 10) {
        list += ", ...";
    }
    return Counted(static_cast<int64>(unreachable.size()), "image", "images") +
           " that no root reaches: " + list;
}

Problems ProblemsOf(const StoreValidation& v) {
    Problems problems{v.check.problems, v.check.numProblems};
    const auto kept = static_cast<int64>(problems.lines.size());
    if (problems.count > kept) {
        problems.lines.push_back("(and " + std::to_string(problems.count - kept) + " more)");
    }
    if (v.check.Ok() && !v.mapValid) {
        problems.lines.push_back("the map's own validation failed");
        ++problems.count;
    }
    if (!v.unreachable.empty()) {
        problems.lines.push_back(UnreachableText(v.unreachable));
        ++problems.count;
    }
    return problems;
}

// What validate found (tools/Report.h):
//   text  "label   value" rows, a "problem: ..." line each, then valid or invalid
//   json  {"valid":..,"record":..,"map":..,"fields":..,...,"problems":[..]}
//   csv   name,value rows, a problem row each
Summary ValidationSummary(const StoreValidation& v, const std::optional<StoreStatistics>& stats,
                          const Problems& problems) {
    Summary summary;
    summary.Value("valid", problems.count == 0)
        .TextRow("record", ToString(v.record) + " (map " + ToString(v.map) + ")")
        .Value("record", ToString(v.record))
        .Value("map", ToString(v.map));
    if (stats) {
        summary.Value("fields", stats->fields, "fields")
            .Value("height", static_cast<int64>(stats->height), "height")
            .TextRow("nodes", NodesText(*stats))
            .Value("leaves", stats->leaves)
            .Value("internal_nodes", stats->internalNodes);
    }
    summary
        .Value("images", v.images, "images",
               std::to_string(v.images) + " (" + std::to_string(v.reached) + " reached from roots)")
        .Value("reached", v.reached)
        .JsonOnly("problem_count", problems.count)
        .List("problems", "problem", "problem: ", problems.lines)
        .TextLine(problems.count > 0 ? "invalid" : "valid");
    return summary;
}

int RunValidate(const Arguments& args, Io& io) {
    const std::string dir = args.Store();
    const ssize_t cacheObjects = args.CacheNodes(kDefaultWalkCacheObjects);
    const Format format = args.OutputFormat();
    std::optional<OffsetOpsStore> walkable = OpenForWalk(dir, cacheObjects, io.err);
    if (!walkable) {
        return kFailed;
    }
    OffsetOpsStore& store = *walkable;
    const StoreValidation v = store.Validate();
    std::optional<StoreStatistics> stats;
    if (v.check.Ok()) {
        stats = store.Stats();
    }
    const Problems problems = ProblemsOf(v);
    ValidationSummary(v, stats, problems).Write(io.out, format);
    if (!io.out.flush()) {
        return OutputFailed(io.err, kFailed);
    }
    if (problems.count > 0) {
        return Fail(io.err, "validation of '" + dir +
                                "' failed: " + Counted(problems.count, "problem", "problems"));
    }
    return 0;
}

}  // namespace

CommandDecl ValidateCommand() {
    return {
        "validate",
        "--store DIR [--cache-nodes C] [--format FORMAT]",
        "check the tree and the store; exit status 0 only when all holds",
        {
            StoreOption(),
            CacheOption(),
            FormatOption(),
            {"--no-progress", "",
             "accepted for symmetry with the other walks; validate shows none"},
        },
        RunValidate,
    };
}

}  // namespace tarn::tool
