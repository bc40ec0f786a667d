#include "tools/Commands.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <fstream>
#include <iomanip>
#include <iostream>
#include <set>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapCheck.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/LmdbStore.h"
#include "tnUtils/RuntimeError.h"
#include "tnUtils/xostream.h"
#include "tools/CountingStore.h"
#include "tools/OstreamOutputStream.h"
#include "tools/Reachability.h"
#include "tools/TreeWalk.h"

namespace tarn::tool {

namespace {

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using Clock = std::chrono::steady_clock;

int Fail(std::ostream& err, const std::string& message) {
    err << "offsetops: " << message << '\n';
    return 1;
}

// A space over the LMDB store in `dir`, its store wrapped to count writes.
struct OpenedSpace {
    CountingStore* store = nullptr;  // owned by the space
    std::unique_ptr<CSpace> space;
};

OpenedSpace OpenSpace(const std::string& dir, OpenMode mode, bool sync = true) {
    LmdbStoreOptions options;
    options.mode = mode;
    options.syncOnCommit = sync;
    auto counting = std::make_shared<CountingStore>(LmdbStore::Open(dir, options));
    OpenedSpace opened;
    opened.store = counting.get();
    opened.space = std::make_unique<CSpace>(counting);
    return opened;
}

// The record's identity; an error for a store that holds none.
OID RecordRoot(CSpace& space, const std::string& dir) {
    OID oid = space.GetRoot(kRecordRoot);
    if (oid.IsNull()) {
        throw RuntimeError("store '" + dir + "' holds no offsets record (root \"" + kRecordRoot +
                           "\"); record into it first");
    }
    return oid;
}

void Row(std::ostream& out, const char* label, const std::string& value) {
    out << std::left << std::setw(16) << label << value << '\n';
}

std::string NodesText(int64 leaves, int64 internal) {
    return std::to_string(leaves + internal) + " (" + std::to_string(leaves) + " leaves, " +
           std::to_string(internal) + " internal)";
}

// Loads, with class checks, the nodes from the root to the leaf whose range
// holds `key`, so that the map's own lookup then finds them resident and of
// the kind it assumes. Throws RuntimeError on a damaged path.
void LoadPathChecked(const Map& map, const FieldId& key) {
    if (map.m_height < 0) {
        return;
    }
    const prefbase* ref = &map.m_root;
    for (ssize_t h = map.m_height; h >= 0; --h) {
        if (!*ref) {
            throw RuntimeError("damaged tree: a missing node reference at height " +
                               std::to_string(h));
        }
        if (h == 0) {
            ref->Resolve(&GetReflectedClass<Map::LeafNode>());
            return;
        }
        const auto* node = static_cast<const Map::InternalNode*>(
            ref->Resolve(&GetReflectedClass<Map::InternalNode>()).m_self);
        if (node->m_numKeyEntrys < 1) {
            throw RuntimeError("damaged tree: internal node " + ToString(ref->m_oid) +
                               " holds no entries");
        }
        const ssize_t i = node->FindChildIndexGivenKey(key);
        ref = i < 0 ? &node->m_ptr : &node->GetEntry(i).m_ptr;
    }
}

// Refuses a tree that the map's own code could not walk safely.
void RequireSoundTree(const Map& map) {
    FieldIdToOffsetOpsOnInt64FieldMapCheckResult check =
        FieldIdToOffsetOpsOnInt64FieldMapCheck(map);
    if (!check.Ok()) {
        throw RuntimeError("the stored tree is damaged (" + std::to_string(check.numProblems) +
                           " problems; the first: " + check.problems.front() +
                           "); run 'offsetops validate' for all");
    }
}

// For each site, the largest time stamp any field's table holds.
std::map<Guid, int64> LastStamps(CSpace& space, OID mapOid, ssize_t bound) {
    std::map<Guid, int64> last;
    WalkTree(space, mapOid, bound, [&](const Map::LeafNode& leaf) {
        for (ssize_t i = 0; i < leaf.m_numKeyEntrys; ++i) {
            for (const auto& [site, so] : leaf.GetEntry(i).second.m_map.getmap()) {
                auto [it, added] = last.emplace(site, so.t);
                if (!added && it->second < so.t) {
                    it->second = so.t;
                }
            }
        }
    });
    return last;
}

// Progress on a terminal: one line, rewritten at most a few times a second.
class Progress {
public:
    Progress(bool enabled, std::ostream& err, int64 total)
        : m_enabled(enabled), m_err(err), m_total(total), m_start(Clock::now()) {}

    void Update(int64 recorded, int64 committed) {
        if (!m_enabled || (recorded & 1023) != 0) {
            return;
        }
        const auto now = Clock::now();
        if (now - m_last < std::chrono::milliseconds(250)) {
            return;
        }
        m_last = now;
        const double seconds = std::chrono::duration<double>(now - m_start).count();
        m_err << "\r" << recorded;
        if (m_total > 0) {
            m_err << "/" << m_total;
        }
        m_err << " operations, " << committed << " committed, "
              << static_cast<int64>(seconds > 0 ? recorded / seconds : 0) << " ops/s   "
              << std::flush;
        m_shown = true;
    }

    void Finish() {
        if (m_shown) {
            m_err << '\n';
            m_shown = false;
        }
    }

private:
    bool m_enabled;
    std::ostream& m_err;
    int64 m_total;
    Clock::time_point m_start;
    Clock::time_point m_last{};
    bool m_shown = false;
};

// The message for input that stops a run at `where` (FILE:LINE, or the
// number of a generated operation).
std::string Stopped(const std::string& where, const std::string& what, int64 committed) {
    return where + ": " + what + "; stopped there: the " + std::to_string(committed) +
           " operations of this run before it are committed, nothing from it on";
}

void Summary(std::ostream& out, Recorder& recorder, CountingStore& store, CSpace& space,
             ssize_t bound, Clock::time_point start) {
    const double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    const int64 fields = recorder.Map().size();
    TreeShape shape = WalkTree(space, recorder.MapIdentity(), bound, {});
    std::ostringstream rate;
    rate << std::fixed << std::setprecision(0)
         << (seconds > 0 ? static_cast<double>(recorder.Recorded()) / seconds : 0.0);
    std::ostringstream elapsed;
    elapsed << std::fixed << std::setprecision(3) << seconds;
    Row(out, "operations", std::to_string(recorder.Recorded()));
    Row(out, "fields", std::to_string(fields));
    Row(out, "nodes", NodesText(shape.leaves, shape.internalNodes));
    Row(out, "height", std::to_string(shape.height));
    Row(out, "commits", std::to_string(store.Commits()));
    Row(out, "images written", std::to_string(store.ImagesWritten()));
    Row(out, "bytes written", std::to_string(store.BytesWritten()));
    Row(out, "peak residents",
        std::to_string(recorder.PeakResidents()) +
            (bound > 0 ? " (bound " + std::to_string(bound) + ")" : std::string()));
    Row(out, "seconds", elapsed.str());
    Row(out, "operations/s", rate.str());
}

}  // namespace

int RunRecord(const RecordCommand& cmd, std::ostream& out, std::ostream& err) {
    // Open the source before the store, so that a wrong file name creates no
    // store.
    std::ifstream file;
    std::istream* in = nullptr;
    std::string sourceName;
    if (!cmd.generate) {
        if (cmd.opsFile == "-") {
            in = &std::cin;
            sourceName = "<stdin>";
        } else {
            file.open(cmd.opsFile);
            if (!file) {
                return Fail(err,
                            "cannot open ops file '" + cmd.opsFile + "': " + std::strerror(errno));
            }
            in = &file;
            sourceName = cmd.opsFile;
        }
    }

    OpenedSpace opened = OpenSpace(cmd.store, OpenMode::CreateIfMissing, cmd.sync);
    CSpace& space = *opened.space;
    CSpaceGuard guard(space, LockMode::Exclusive);
    const auto start = Clock::now();
    Progress progress(cmd.progress, err, cmd.generate ? cmd.generate->count : 0);
    Recorder recorder(space, cmd.settings);
    const ssize_t bound = cmd.settings.cacheNodes;

    // Record until the source ends or an input is refused; `where` names the
    // input that stopped the run.
    OffsetOperation op;
    std::string error;
    std::string where;
    std::optional<Generator> generator;
    std::optional<OpsFileReader> reader;
    auto position = [&] {
        return generator ? "generated operation " + std::to_string(generator->Made())
                         : reader->Name() + ":" + std::to_string(reader->LineNumber());
    };
    try {
        if (cmd.generate) {
            generator.emplace(*cmd.generate, LastStamps(space, recorder.MapIdentity(), bound));
            bool refused = false;
            while (generator->Next(op, error)) {
                error = recorder.Record(op);
                if (!error.empty()) {
                    refused = true;
                    break;
                }
                progress.Update(recorder.Recorded(), recorder.Committed());
            }
            // A refused operation was made; running out of time stamps stops
            // before the next one.
            where = "generated operation " + std::to_string(generator->Made() + (refused ? 0 : 1));
        } else {
            reader.emplace(*in, sourceName);
            for (;;) {
                OpsFileReader::Status status = reader->Next(op, error);
                if (status == OpsFileReader::Status::End) {
                    break;
                }
                if (status == OpsFileReader::Status::Operation) {
                    error = recorder.Record(op);
                }
                if (!error.empty()) {
                    break;
                }
                progress.Update(recorder.Recorded(), recorder.Committed());
            }
            where = position();
        }
    } catch (const RuntimeError& e) {
        // An error of the store in the middle of an operation may leave the
        // tree in memory half changed: nothing more is committed.
        progress.Finish();
        const std::string at = generator || reader ? position() : "before the first operation";
        return Fail(err, at + ": " + e.what() + "; stopped there: the " +
                             std::to_string(recorder.Committed()) +
                             " operations of this run committed before it are kept, the " +
                             std::to_string(recorder.Recorded() - recorder.Committed()) +
                             " recorded since are not");
    }
    if (!error.empty()) {
        // Refused input never reached the tree: keep everything before it.
        recorder.Commit();
        progress.Finish();
        return Fail(err, Stopped(where, error, recorder.Committed()));
    }
    recorder.Commit();
    progress.Finish();
    Summary(out, recorder, *opened.store, space, bound, start);
    return 0;
}

int RunShow(const std::string& store, const std::optional<FieldId>& field, int64 limit,
            std::ostream& out, std::ostream& err) {
    OpenedSpace opened = OpenSpace(store, OpenMode::ReadOnly);
    CSpace& space = *opened.space;
    CSpaceGuard guard(space, LockMode::Shared);
    SpaceRef<OffsetOps> record(space, RecordRoot(space, store));
    const Map& map = *record->m_map;
    OstreamOutputStream sink(out);
    xostream os(sink);
    if (field) {
        LoadPathChecked(map, *field);
        const OffsetOpsOnField<int64>* table = map.rFind(*field);
        if (table == nullptr) {
            return Fail(err, "no offsets recorded for field " + ToString(*field));
        }
        os << *field << " --> " << *table << '\n';
        return 0;
    }
    RequireSoundTree(map);
    int64 shown = 0;
    for (auto it = map.begin(); it != map.end() && shown != limit; ++it, ++shown) {
        os << it->first << " --> " << it->second << '\n';
    }
    if (shown < map.size()) {
        os << "(" << shown << " of " << map.size() << " fields shown)\n";
    }
    return 0;
}

int RunDump(const std::string& store, std::ostream& out, std::ostream& /*err*/) {
    OpenedSpace opened = OpenSpace(store, OpenMode::ReadOnly);
    CSpace& space = *opened.space;
    CSpaceGuard guard(space, LockMode::Shared);
    SpaceRef<OffsetOps> record(space, RecordRoot(space, store));
    const Map& map = *record->m_map;
    RequireSoundTree(map);
    OstreamOutputStream sink(out);
    xostream os(sink);
    map.Write(os);
    return 0;
}

int RunValidate(const std::string& store, std::ostream& out, std::ostream& err) {
    OpenedSpace opened = OpenSpace(store, OpenMode::ReadOnly);
    CSpace& space = *opened.space;
    CSpaceGuard guard(space, LockMode::Shared);
    const OID recordOid = RecordRoot(space, store);
    std::vector<std::string> problems;
    int64 numProblems = 0;
    try {
        SpaceRef<OffsetOps> record(space, recordOid);
        const Map& map = *record->m_map;
        Row(out, "record", ToString(recordOid) + " (map " + ToString(record->m_map.m_oid) + ")");
        Row(out, "fields", std::to_string(map.size()));
        Row(out, "height", std::to_string(map.m_height));
        FieldIdToOffsetOpsOnInt64FieldMapCheckResult check =
            FieldIdToOffsetOpsOnInt64FieldMapCheck(map);
        Row(out, "nodes", NodesText(check.leaves, check.internalNodes));
        problems = check.problems;
        numProblems = check.numProblems;
        if (check.Ok()) {
            // The tree's own checker; it stops the process on a broken
            // invariant, so it only runs on a tree that passed the checks above.
            map.Validate();
            const ssize_t counted = map.GetNumNodes();
            if (counted != check.Nodes()) {
                problems.push_back("the map counts " + std::to_string(counted) +
                                   " nodes, the walk found " + std::to_string(check.Nodes()));
                ++numProblems;
            }
        }
    } catch (const RuntimeError& e) {
        problems.push_back(std::string("the record cannot be read: ") + e.what());
        ++numProblems;
    }
    ReachabilityResult reach = FindUnreachableImages(space);
    Row(out, "images",
        std::to_string(reach.stored) + " (" + std::to_string(reach.reached) +
            " reached from roots)");
    // Objects the tree check could not load are reported once.
    for (const std::string& e : reach.errors) {
        if (std::none_of(problems.begin(), problems.end(),
                         [&](const std::string& p) { return p.find(e) != std::string::npos; })) {
            problems.push_back(e);
            ++numProblems;
        }
    }
    if (!reach.unreachable.empty()) {
        std::string list;
        for (std::size_t i = 0; i < reach.unreachable.size() && i < 10; ++i) {
            list += (i == 0 ? "#" : ", #") + std::to_string(reach.unreachable[i]);
        }
        if (reach.unreachable.size() > 10) {
            list += ", ...";
        }
        problems.push_back(std::to_string(reach.unreachable.size()) +
                           " images that no root reaches" +
                           (reach.errors.empty() ? ""
                                                 : " (or that lie below objects that could not "
                                                   "be read)") +
                           ": " + list);
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

int RunStats(const std::string& store, std::ostream& out, std::ostream& /*err*/) {
    OpenedSpace opened = OpenSpace(store, OpenMode::ReadOnly);
    CSpace& space = *opened.space;
    CSpaceGuard guard(space, LockMode::Shared);
    const StoreStats stats = space.GetStore().Stats();
    std::string roots;
    for (const auto& [name, oid] : space.Roots()) {
        roots += (roots.empty() ? "" : " ") + name + "=" + ToString(oid);
    }
    SpaceRef<OffsetOps> record(space, RecordRoot(space, store));
    const OID mapOid = record->m_map.m_oid;
    std::set<Guid> sites;
    int64 siteRecords = 0;
    TreeShape shape = WalkTree(space, mapOid, 0, [&](const Map::LeafNode& leaf) {
        for (ssize_t i = 0; i < leaf.m_numKeyEntrys; ++i) {
            for (const auto& [site, so] : leaf.GetEntry(i).second.m_map.getmap()) {
                sites.insert(site);
                ++siteRecords;
            }
        }
    });
    Row(out, "images", std::to_string(stats.numImages));
    Row(out, "image bytes", std::to_string(stats.numImageBytes));
    Row(out, "next identity", std::to_string(space.NextIdentity()));
    Row(out, "roots", roots);
    Row(out, "fields", std::to_string(shape.entries));
    Row(out, "sites", std::to_string(sites.size()));
    Row(out, "site records", std::to_string(siteRecords));
    Row(out, "height", std::to_string(shape.height));
    Row(out, "nodes", NodesText(shape.leaves, shape.internalNodes));
    Row(out, "residents", std::to_string(space.NumResidents()));
    return 0;
}

int RunClear(const std::string& store, std::ostream& out, std::ostream& /*err*/) {
    OpenedSpace opened = OpenSpace(store, OpenMode::MustExist);
    CSpace& space = *opened.space;
    CSpaceGuard guard(space, LockMode::Exclusive);
    SpaceRef<OffsetOps> record(space, RecordRoot(space, store));
    // Clearing hands the whole tree to deletion, which walks it: refuse a
    // damaged tree before the map's code takes its nodes for what their
    // level says they are.
    RequireSoundTree(*record->m_map);
    const int64 fields = record->m_map->size();
    const ssize_t imagesBefore = space.GetStore().Stats().numImages;
    record->Clear();
    space.Commit();
    const ssize_t imagesAfter = space.GetStore().Stats().numImages;
    out << "cleared " << fields << " fields; " << (imagesBefore - imagesAfter)
        << " images removed\n";
    return 0;
}

}  // namespace tarn::tool
