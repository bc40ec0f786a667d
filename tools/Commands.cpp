#include "tools/Commands.h"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iomanip>
#include <iostream>
#include <map>
#include <sstream>

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnUtils/OstreamOutputStream.h"
#include "tnUtils/xostream.h"
#include "tools/CommandSupport.h"
#include "tools/OpsFile.h"
#include "tools/Progress.h"

namespace tarn::tool {

namespace {

using Clock = std::chrono::steady_clock;

std::string NodesText(const StoreStatistics& stats) {
    return std::to_string(stats.Nodes()) + " (" + std::to_string(stats.leaves) + " leaves, " +
           std::to_string(stats.internalNodes) + " internal)";
}

// For each site, the largest time stamp any field's table holds.
void Summary(std::ostream& out, const StoreStatistics& stats, int64 recorded, int64 durablePoints,
             ssize_t bound, double seconds) {
    std::ostringstream rate;
    rate << std::fixed << std::setprecision(0)
         << (seconds > 0 ? static_cast<double>(recorded) / seconds : 0.0);
    std::ostringstream elapsed;
    elapsed << std::fixed << std::setprecision(3) << seconds;
    Row(out, "operations", std::to_string(recorded));
    Row(out, "fields", std::to_string(stats.fields));
    Row(out, "nodes", NodesText(stats));
    Row(out, "height", std::to_string(stats.height));
    Row(out, "durable points", std::to_string(durablePoints));
    Row(out, "checkpoints", std::to_string(stats.checkpoints));
    Row(out, "images written", std::to_string(stats.imagesWritten));
    Row(out, "bytes written", std::to_string(stats.imageBytesWritten));
    Row(out, "peak residents",
        std::to_string(stats.peakResidents) +
            (bound > 0 ? " (bound " + std::to_string(bound) + ")" : std::string()));
    Row(out, "seconds", elapsed.str());
    Row(out, "operations/s", rate.str());
}

}  // namespace

int RunRecord(const RecordCommand& cmd, std::ostream& out, std::ostream& err) {
    // Check the source and the cache bound before opening the store, so that
    // a run refused for them creates no store.
    std::ifstream file;
    std::istream* in = nullptr;
    std::string sourceName;
    if (!cmd.generate) {
        if (cmd.opsFile == "-") {
            in = &std::cin;
            sourceName = "<stdin>";
        } else {
            std::error_code ec;
            if (std::filesystem::is_directory(cmd.opsFile, ec)) {
                return Fail(err, "ops file '" + cmd.opsFile + "' is a directory");
            }
            file.open(cmd.opsFile);
            if (!file) {
                return Fail(err,
                            "cannot open ops file '" + cmd.opsFile + "': " + std::strerror(errno));
            }
            in = &file;
            sourceName = cmd.opsFile;
        }
    }
    const ssize_t bound = cmd.cacheObjects;
    if (bound > 0 && bound < OffsetOpsStore::MinCacheObjects(0)) {
        err << "offsetops: " << CacheTooSmall(bound, 0) << '\n';
        return 2;
    }

    StoreOptions options;
    options.mode = StoreMode::Write;
    options.sync = cmd.sync;
    options.cacheObjects = bound;
    options.journalLimitBytes = cmd.journalLimitBytes;
    OffsetOpsStore store = OffsetOpsStore::Open(cmd.store, options);
    for (const std::string& repair : store.Repairs()) {
        err << "offsetops: " << cmd.store << ": repaired: " << repair << '\n';
    }
    if (bound > 0) {
        const ssize_t height = std::max<ssize_t>(store.Height(), 0);
        if (bound < OffsetOpsStore::MinCacheObjects(height)) {
            store.Close();
            err << "offsetops: " << CacheTooSmall(bound, height) << '\n';
            return 2;
        }
    }

    const auto start = Clock::now();
    // The share done: of the operations to generate, or of the ops file's
    // bytes (unknown for a pipe).
    ProgressLine progress(cmd.progress, err, "record");
    uint64 sourceBytes = 0;
    if (cmd.progress && in == &file) {
        std::error_code ec;
        const auto size = std::filesystem::file_size(cmd.opsFile, ec);
        sourceBytes = ec ? 0 : static_cast<uint64>(size);
    }
    int64 recorded = 0;       // operations of this run recorded
    int64 durable = 0;        // of those, durable
    int64 durablePoints = 0;  // reached by this run
    auto sync = [&] {
        store.Sync();
        durable = recorded;
        ++durablePoints;
    };

    // Record until the source ends or an input is refused; position() names
    // the input that stopped the run.
    OffsetOperation op;
    std::string error;
    std::optional<Generator> generator;
    std::optional<OpsFileReader> reader;
    bool inOperation = false;  // `op` is taken from the source, not yet recorded
    bool finishing = false;    // the source is done
    auto position = [&] {
        if (finishing) {
            return std::string("after the last operation");
        }
        if (generator) {
            return "generated operation " +
                   std::to_string(generator->Made() + (inOperation ? 0 : 1));
        }
        if (reader) {
            return reader->Name() + ":" + std::to_string(reader->LineNumber());
        }
        return std::string("before the first operation");
    };
    auto record = [&] {
        inOperation = true;
        try {
            store.Record(Opid(op.site, op.t), op.field, op.offset);
        } catch (const RecordRefused& e) {
            error = e.what();
            return false;
        }
        if (++recorded - durable >= cmd.commitEvery) {
            sync();
        }
        inOperation = false;
        if (progress.Enabled() && (recorded & 1023) == 0) {
            const std::string text =
                std::to_string(recorded) + " operations, " + std::to_string(durable) + " durable";
            if (generator) {
                progress.Show(static_cast<uint64>(recorded),
                              static_cast<uint64>(cmd.generate->count), text);
            } else {
                progress.Show(reader->BytesRead(), sourceBytes, text);
            }
        }
        return true;
    };
    try {
        if (cmd.generate) {
            // Each site's newest stamp, as the store keeps it: no walk.
            generator.emplace(*cmd.generate, store.Sites());
            while (generator->Next(op, error) && record()) {
            }
        } else {
            reader.emplace(*in, sourceName);
            for (OpsFileReader::Status status;
                 (status = reader->Next(op, error)) != OpsFileReader::Status::End;) {
                if (status == OpsFileReader::Status::Error || !record()) {
                    break;
                }
            }
        }
        // Refused input never reached the tree: keep everything before it.
        const std::string where = position();
        finishing = true;
        if (recorded > durable) {
            sync();
        }
        if (!error.empty()) {
            store.Close();
            progress.Finish();
            return Fail(err, where + ": " + error + "; stopped there: the " +
                                 std::to_string(durable) +
                                 " operations of this run before it are durable, nothing from "
                                 "it on");
        }
        store.Checkpoint();
        const StoreStatistics stats = store.Stats();
        store.Close();
        progress.Finish();
        Summary(out, stats, recorded, durablePoints, bound,
                std::chrono::duration<double>(Clock::now() - start).count());
        return 0;
    } catch (const RuntimeError& e) {
        progress.Finish();
        std::string what = e.what();
        if (bound > 0) {
            // The store refuses, changing nothing, an operation that would
            // take the tree past the bound: like refused input, everything
            // before it is made durable. Say so in terms of the option.
            try {
                const ssize_t height = store.Height();
                if (bound < OffsetOpsStore::MinCacheObjects(height)) {
                    const std::string where = position();
                    finishing = true;
                    sync();
                    store.Close();
                    return Fail(err, where + ": " + CacheTooSmall(bound, height) +
                                         ", and the tree has grown to that height; stopped "
                                         "there: the " +
                                         std::to_string(durable) +
                                         " operations of this run before it are durable, "
                                         "nothing from it on");
                }
            } catch (const RuntimeError&) {
            }
        }
        // Any other error broke the handle: nothing more becomes durable.
        return Fail(err, position() + ": " + what +
                             "; stopped there: the store keeps its last durable point, with the " +
                             std::to_string(durable) + " operations of this run before it; the " +
                             std::to_string(recorded - durable) + " recorded since are lost");
    }
}

int RunShow(const std::string& store, const ShowQuery& query, std::ostream& out,
            std::ostream& err) {
    OffsetOpsStore opened = OpenAndReport(store, StoreMode::Read, err);
    OstreamOutputStream sink(out);
    xostream os(sink);
    if (query.field) {
        const std::optional<FieldTable> table = opened.Find(*query.field);
        if (!table) {
            return Fail(err, "no offsets recorded for field " + ToString(*query.field));
        }
        os << *query.field << " --> " << ToString(*table) << '\n';
        return 0;
    }
    int64 shown = 0;
    bool more = false;  // a field in range after the limit
    const OffsetOpsStore::FieldVisitor print = [&](const FieldId& key, const FieldTable& table) {
        if (query.to && CompareKeys(key, *query.to) > 0) {
            return false;
        }
        if (shown == query.limit) {
            more = true;
            return false;
        }
        os << key << " --> " << ToString(table) << '\n';
        ++shown;
        return static_cast<bool>(out);
    };
    if (query.oid) {
        opened.ForEachOfObject(*query.oid, print);
        if (shown == 0) {
            return Fail(err, "no offsets recorded for object " + ToString(*query.oid));
        }
    } else {
        opened.ForEachFrom(query.from.value_or(FieldId()), print);
    }
    if (!out) {
        return 0;
    }
    if (!query.oid && !query.from && !query.to) {
        const int64 size = opened.Size();
        if (shown < size) {
            os << "(" << shown << " of " << size << " fields shown)\n";
        }
    } else if (more) {
        os << "(" << shown << " fields shown; more follow)\n";
    }
    return 0;
}

int RunDump(const std::string& store, std::ostream& out, std::ostream& err) {
    OffsetOpsStore opened = OpenAndReport(store, StoreMode::Read, err);
    opened.Dump(out);
    return 0;
}

int RunValidate(const std::string& store, const WalkSettings& settings, std::ostream& out,
                std::ostream& err) {
    std::optional<OffsetOpsStore> walkable = OpenForWalk(store, settings.cacheObjects, err);
    if (!walkable) {
        return 1;
    }
    OffsetOpsStore& opened = *walkable;
    const StoreValidation v = opened.Validate();
    std::vector<std::string> problems = v.check.problems;
    int64 numProblems = v.check.numProblems;
    if (numProblems > static_cast<int64>(problems.size())) {
        problems.push_back(
            "(and " + std::to_string(numProblems - static_cast<int64>(problems.size())) + " more)");
    }
    Row(out, "record", ToString(v.record) + " (map " + ToString(v.map) + ")");
    if (v.check.Ok()) {
        const StoreStatistics stats = opened.Stats();
        Row(out, "fields", std::to_string(stats.fields));
        Row(out, "height", std::to_string(stats.height));
        Row(out, "nodes", NodesText(stats));
        if (!v.mapValid) {
            problems.push_back("the map's own validation failed");
            ++numProblems;
        }
    }
    Row(out, "images",
        std::to_string(v.images) + " (" + std::to_string(v.reached) + " reached from roots)");
    if (!v.unreachable.empty()) {
        std::string list;
        for (std::size_t i = 0; i < v.unreachable.size() && i < 10; ++i) {
            list += (i == 0 ? "#" : ", #") + std::to_string(v.unreachable[i]);
        }
        if (v.unreachable.size() > 10) {
            list += ", ...";
        }
        problems.push_back(std::to_string(v.unreachable.size()) +
                           " images that no root reaches: " + list);
        ++numProblems;
    }
    for (const std::string& p : problems) {
        out << "problem: " << p << '\n';
    }
    if (numProblems > 0) {
        out << "invalid\n";
        return Fail(err, "validation of '" + store + "' failed: " + std::to_string(numProblems) +
                             " problems");
    }
    out << "valid\n";
    return 0;
}

int RunStats(const std::string& store, std::ostream& out, std::ostream& err) {
    // Answered from what the store keeps: no walk of the tree.
    OffsetOpsStore opened = OpenAndReport(store, StoreMode::Read, err);
    const StoreStatistics stats = opened.Stats();
    Row(out, "images", std::to_string(stats.images));
    Row(out, "image bytes", std::to_string(stats.imageBytes));
    Row(out, "fields", std::to_string(stats.fields));
    Row(out, "nodes", NodesText(stats));
    Row(out, "height", std::to_string(stats.height));
    Row(out, "journal bytes", std::to_string(stats.journalBytes));
    Row(out, "ops since checkpoint",
        std::to_string(stats.durableOperations - stats.checkpointedOperations));
    return 0;
}

int RunClear(const std::string& store, std::ostream& out, std::ostream& err) {
    OffsetOpsStore opened = OpenAndReport(store, StoreMode::WriteExisting, err);
    // Clearing hands the whole tree to deletion, which walks it: refuse a
    // damaged tree first.
    RequireSoundTree(opened);
    const int64 fields = opened.Size();
    const int64 imagesBefore = opened.Stats().images;
    opened.Clear();
    opened.Checkpoint();
    const int64 imagesAfter = opened.Stats().images;
    opened.Close();
    out << "cleared " << fields << " fields; " << (imagesBefore - imagesAfter)
        << " images removed\n";
    return 0;
}

}  // namespace tarn::tool
