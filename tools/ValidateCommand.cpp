// offsetops validate: every node, the leaf chain, the kept counts and the
// images no root reaches.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

// What validate found, in the three formats:
//   text  "label   value" rows, a "problem: ..." line each, then valid or invalid
//   json  {"valid":..,"record":..,"map":..,"fields":..,...,"problems":[..]}
//   csv   name,value rows, a problem row each
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
    std::vector<std::string> problems = v.check.problems;
    int64 numProblems = v.check.numProblems;
    if (numProblems > static_cast<int64>(problems.size())) {
        problems.push_back(
            "(and " + std::to_string(numProblems - static_cast<int64>(problems.size())) + " more)");
    }
    std::optional<StoreStatistics> stats;
    if (v.check.Ok()) {
        stats = store.Stats();
        if (!v.mapValid) {
            problems.push_back("the map's own validation failed");
            ++numProblems;
        }
    }
    if (!v.unreachable.empty()) {
        std::string list;
        for (std::size_t i = 0; i < v.unreachable.size() && i < 10; ++i) {
            list += (i == 0 ? "#" : ", #") + std::to_string(v.unreachable[i]);
        }
        if (v.unreachable.size() > 10) {
            list += ", ...";
        }
        problems.push_back(Counted(static_cast<int64>(v.unreachable.size()), "image", "images") +
                           " that no root reaches: " + list);
        ++numProblems;
    }

    if (format == Format::Text) {
        Row(io.out, "record", ToString(v.record) + " (map " + ToString(v.map) + ")");
        if (stats) {
            Row(io.out, "fields", std::to_string(stats->fields));
            Row(io.out, "height", std::to_string(stats->height));
            Row(io.out, "nodes", NodesText(*stats));
        }
        Row(io.out, "images",
            std::to_string(v.images) + " (" + std::to_string(v.reached) + " reached from roots)");
        for (const std::string& p : problems) {
            io.out << "problem: " << p << '\n';
        }
        io.out << (numProblems > 0 ? "invalid\n" : "valid\n");
    } else if (format == Format::Json) {
        JsonWriter json(io.out);
        json.BeginObject();
        json.Key("valid");
        json.Bool(numProblems == 0);
        json.Member("record", ToString(v.record));
        json.Member("map", ToString(v.map));
        if (stats) {
            json.Member("fields", stats->fields);
            json.Member("height", static_cast<int64>(stats->height));
            json.Member("leaves", stats->leaves);
            json.Member("internal_nodes", stats->internalNodes);
        }
        json.Member("images", v.images);
        json.Member("reached", v.reached);
        json.Member("problem_count", numProblems);
        json.Key("problems");
        json.BeginArray();
        for (const std::string& p : problems) {
            json.String(p);
        }
        json.EndArray();
        json.EndObject();
    } else {
        io.out << "name,value\n"
               << "valid," << (numProblems == 0 ? "true" : "false") << '\n'
               << "record," << ToString(v.record) << '\n'
               << "map," << ToString(v.map) << '\n';
        if (stats) {
            io.out << "fields," << stats->fields << "\nheight," << stats->height << "\nleaves,"
                   << stats->leaves << "\ninternal_nodes," << stats->internalNodes << '\n';
        }
        io.out << "images," << v.images << "\nreached," << v.reached << '\n';
        for (const std::string& p : problems) {
            io.out << "problem," << CsvField(p) << '\n';
        }
    }
    if (!io.out.flush()) {
        return OutputFailed(io.err, kFailed);
    }
    if (numProblems > 0) {
        return Fail(io.err, "validation of '" + dir +
                                "' failed: " + Counted(numProblems, "problem", "problems"));
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
