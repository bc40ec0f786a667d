// The reading half of the API: lookups, ordered walks, statistics, checks
// and the dump.

#include <deque>
#include <memory>
#include <tuple>
#include <utility>

#include "tnBackends/LmdbFileCheck.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapCheck.h"
#include "tnStore/OffsetOpsStore.h"
#include "tnStore/Reachability.h"
#include "tnStore/StoreImpl.h"
#include "tnStore/TreeWalk.h"
#include "tnUtils/OstreamOutputStream.h"
#include "tnUtils/xostream.h"

namespace tarn {

namespace {

// Ordered walks hand their callback copies of this many entries at a time,
// taken with the space held; the callback runs without it, so it may even
// call the store, and a bounded cache stays bounded between batches.
constexpr std::size_t kWalkBatch = 256;

FieldTable TableOf(const OffsetOpsOnField<int64>& table) {
    FieldTable records;
    records.reserve(table.m_map.getmap().size());
    for (const auto& [site, so] : table.m_map.getmap()) {
        records.push_back(SiteRecord{site, so.t, so.o});
    }
    return records;
}

}  // namespace

StoreCheck CheckTree(OffsetOpsStore::Impl& s) {
    const ssize_t bound = s.options.cacheObjects;
    FieldIdToOffsetOpsOnInt64FieldMapCheckResult result =
        FieldIdToOffsetOpsOnInt64FieldMapCheck(s.Map(), [&] {
            s.NotePeak();
            KeepResidentsUnder(*s.space, bound);
        });
    StoreCheck check;
    check.problems = std::move(result.problems);
    check.numProblems = result.numProblems;
    return check;
}

void RequireSoundTree(OffsetOpsStore::Impl& s) {
    const StoreCheck check = CheckTree(s);
    if (!check.Ok()) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           "store '" + s.dir + "': the stored tree is damaged (" +
                               std::to_string(check.numProblems) + " problems; the first: " +
                               check.problems.front() + "); run 'offsetops validate' for all");
    }
}

std::optional<FieldTable> OffsetOpsStore::Find(const FieldId& field) {
    Impl& s = Live();
    s.RequireOpen();
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    s.ApplyDeferred();
    s.MakeRoom();
    const OffsetOpsOnField<int64>* table = s.Map().rFind(field);
    if (table == nullptr) {
        return std::nullopt;
    }
    return TableOf(*table);
}

// Entries are copied with the space held; the caller uses them without it,
// so it may even call the store, and a bounded cache stays bounded between
// batches.
std::vector<OffsetOpsStore::Entry> OffsetOpsStore::ReadBatch(BatchFrom from, const FieldId& key,
                                                             std::size_t max) {
    Impl& s = Live();
    s.RequireOpen();
    std::vector<Entry> batch;
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    s.ApplyDeferred();
    s.MakeRoom();
    const FieldIdToOffsetOpsOnInt64FieldMap& map = s.Map();
    if (from == BatchFrom::AtOrAfter || from == BatchFrom::After) {
        auto it = from == BatchFrom::AtOrAfter ? map.lower_bound(key) : map.upper_bound(key);
        for (; it != map.end() && batch.size() < max; ++it) {
            batch.emplace_back(it->first, TableOf(it->second));
        }
        return batch;
    }
    auto it = from == BatchFrom::Before       ? map.lower_bound(key)
              : from == BatchFrom::AtOrBefore ? map.upper_bound(key)
                                              : map.end();
    while (it != map.begin() && batch.size() < max) {
        --it;
        batch.emplace_back(it->first, TableOf(it->second));
    }
    return batch;
}

void OffsetOpsStore::ForEachFrom(const FieldId& from, const FieldVisitor& fn) {
    std::vector<Entry> batch = ReadBatch(BatchFrom::AtOrAfter, from, kWalkBatch);
    for (;;) {
        for (const Entry& e : batch) {
            if (!fn(e.first, e.second)) {
                return;
            }
        }
        if (batch.size() < kWalkBatch) {
            return;
        }
        const FieldId last = batch.back().first;
        batch = ReadBatch(BatchFrom::After, last, kWalkBatch);
    }
}

void OffsetOpsStore::ForEachOfObject(OID oid, const FieldVisitor& fn) {
    ForEachFrom(FieldId(oid, Path()), [&](const FieldId& field, const FieldTable& t) {
        return field.oid == oid && fn(field, t);
    });
}

int64 OffsetOpsStore::Size() {
    Impl& s = Live();
    s.RequireOpen();
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    s.ApplyDeferred();
    return s.Map().size();
}

ssize_t OffsetOpsStore::Height() {
    Impl& s = Live();
    s.RequireOpen();
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    s.ApplyDeferred();
    return s.Map().m_height;
}

StoreStatistics OffsetOpsStore::Stats() {
    Impl& s = Live();
    s.RequireOpen();
    StoreStatistics stats;
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    s.ApplyDeferred();
    stats.fields = s.Map().size();
    stats.height = s.Map().m_height;
    std::tie(stats.leaves, stats.internalNodes) = s.NodeCounts();
    const StoreStats stored = s.store->Stats();
    stats.images = stored.numImages;
    stats.imageBytes = stored.numImageBytes;
    stats.journalBytes =
        static_cast<int64>(s.journal != nullptr ? s.journal->FileBytes() : s.journalBytes);
    stats.durableOperations = s.durable;
    stats.checkpointedOperations = s.checkpointed;
    stats.pendingOperations = s.pending;
    stats.checkpoints = s.checkpoints;
    stats.imagesWritten = s.store->ImagesWritten();
    stats.imageBytesWritten = s.store->BytesWritten();
    stats.residents = s.space->NumResidents();
    s.NotePeak();
    stats.peakResidents = s.peakResidents;
    stats.replayedOperations = s.replayed;
    return stats;
}

StoreCheck OffsetOpsStore::Check() {
    Impl& s = Live();
    s.RequireOpen();
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    s.ApplyDeferred();
    StoreCheck check = CheckTree(s);
    if (s.options.cacheObjects > 0) {
        s.space->EvictCleanResidents(s.options.cacheObjects / 2);
    }
    return check;
}

namespace {

void AddProblem(FieldIdToOffsetOpsOnInt64FieldMapCheckResult& check, std::string problem) {
    if (check.problems.size() < static_cast<std::size_t>(check.kMaxProblems)) {
        check.problems.push_back(std::move(problem));
    }
    ++check.numProblems;
}

// The counts the store keeps (and opening and stats trust) against what the
// walk found.
void CompareKeptCounts(OffsetOpsStore::Impl& s,
                       FieldIdToOffsetOpsOnInt64FieldMapCheckResult& check) {
    const auto [leaves, internalNodes] = s.NodeCounts();
    const auto compare = [&](const char* what, int64 kept, int64 found) {
        if (kept != found) {
            AddProblem(check, std::string("the store keeps a count of ") + std::to_string(kept) +
                                  " " + what + ", the tree has " + std::to_string(found));
        }
    };
    compare("leaves", leaves, check.leaves);
    compare("internal nodes", internalNodes, check.internalNodes);
    compare("fields", s.Map().size(), check.entries);
}

}  // namespace

// The unreachable images are those of the store as it is (a reader's
// snapshot, a writer's last checkpoint), so they are counted in a second
// space over the same store, which holds no operation of the journal.
// Within a cache bound the map's own validation is left out: it holds the
// whole tree in memory, and the check above covers its invariants.
StoreValidation OffsetOpsStore::Validate() {
    Impl& s = Live();
    s.RequireOpen();
    StoreValidation v;
    const ssize_t bound = s.options.cacheObjects;
    {
        CSpaceGuard guard(*s.space, LockMode::Exclusive);
        s.ApplyDeferred();
        v.record = s.record->m_oid;
        v.map = s.Record().m_map.m_oid;
        const FieldIdToOffsetOpsOnInt64FieldMap& map = s.Map();
        FieldIdToOffsetOpsOnInt64FieldMapCheckResult check =
            FieldIdToOffsetOpsOnInt64FieldMapCheck(map, [&] {
                s.NotePeak();
                KeepResidentsUnder(*s.space, bound);
            });
        if (check.Ok()) {
            CompareKeptCounts(s, check);
        }
        if (check.Ok() && bound > 0) {
            v.mapValid = true;
        } else if (check.Ok()) {
            // The map's own checker stops the process on a broken invariant,
            // so it runs only on a tree that passed the check above.
            map.Validate();
            v.mapValid = true;
            const ssize_t counted = map.GetNumNodes();
            if (counted != check.Nodes()) {
                AddProblem(check, "the map counts " + std::to_string(counted) +
                                      " nodes, the walk found " + std::to_string(check.Nodes()));
                v.mapValid = false;
            }
        }
        v.check.problems = std::move(check.problems);
        v.check.numProblems = check.numProblems;
        if (s.options.cacheObjects > 0) {
            s.space->EvictCleanResidents(s.options.cacheObjects / 2);
        }
    }
    if (!s.dir.empty()) {
        // LMDB's own pages: opening reads only those on the paths it takes.
        try {
            CheckLmdbPages(s.dir);
        } catch (const RuntimeError& e) {
            v.check.problems.push_back(e.what());
            ++v.check.numProblems;
        }
    }
    CSpace stored(s.store);
    CSpaceGuard guard(stored, LockMode::Exclusive);
    ReachabilityResult reach = FindUnreachableImages(stored, bound);
    v.images = reach.stored;
    v.reached = reach.reached;
    v.unreachable = std::move(reach.unreachable);
    for (std::string& e : reach.errors) {
        v.check.problems.push_back(std::move(e));
        ++v.check.numProblems;
    }
    return v;
}

void OffsetOpsStore::Dump(std::ostream& out) {
    Impl& s = Live();
    s.RequireOpen();
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    s.ApplyDeferred();
    RequireSoundTree(s);
    OstreamOutputStream sink(out);
    xostream os(sink);
    s.Map().Write(os);
}

}  // namespace tarn
