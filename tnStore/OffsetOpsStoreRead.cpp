// The reading half of the API: lookups, ordered walks, statistics, checks
// and the dump.

#include <memory>
#include <tuple>
#include <utility>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapCheck.h"
#include "tnStore/FieldBatch.h"
#include "tnStore/OffsetOpsStore.h"
#include "tnStore/OffsetOpsStoreImpl.h"
#include "tnStore/Reachability.h"
#include "tnUtils/OstreamOutputStream.h"
#include "tnUtils/xostream.h"

namespace tarn {

namespace {

// Ordered walks hand their callback copies of this many entries at a time,
// taken with the space held; the callback runs without it, so it may even
// call the store, and a bounded cache stays bounded between batches.
constexpr std::size_t kWalkBatch = 256;

using MapCheck = FieldIdToOffsetOpsOnInt64FieldMapCheckResult;

FieldTable TableOf(const OffsetOpsOnField<int64>& table) {
    FieldTable records;
    records.reserve(table.m_map.getmap().size());
    for (const auto& [site, so] : table.m_map.getmap()) {
        records.push_back(SiteRecord{site, so.t, so.o});
    }
    return records;
}

// The map's non-aborting check, within the cache bound. Exclusive.
MapCheck CheckMap(OffsetOpsStoreImpl& handle) {
    return FieldIdToOffsetOpsOnInt64FieldMapCheck(handle.Tree().Map(),
                                                  [&] { handle.Memory().KeepUnder(); });
}

StoreCheck AsStoreCheck(MapCheck&& check) {
    StoreCheck result;
    result.problems = std::move(check.problems);
    result.numProblems = check.numProblems;
    return result;
}

void AddProblem(MapCheck& check, std::string problem) {
    if (check.problems.size() < static_cast<std::size_t>(check.kMaxProblems)) {
        check.problems.push_back(std::move(problem));
    }
    ++check.numProblems;
}

// The counts the store keeps (and opening and stats trust) against what the
// walk found.
void CompareKeptCounts(OffsetOpsStoreImpl& handle, MapCheck& check) {
    const auto [leaves, internalNodes] = handle.Tree().NodeCounts();
    const auto compare = [&](const char* what, int64 kept, int64 found) {
        if (kept != found) {
            AddProblem(check, std::string("the store keeps a count of ") + std::to_string(kept) +
                                  " " + what + ", the tree has " + std::to_string(found));
        }
    };
    compare("leaves", leaves, check.leaves);
    compare("internal nodes", internalNodes, check.internalNodes);
    compare("fields", handle.Tree().Map().size(), check.entries);
}

// The map's own validation, which stops the process on a broken invariant,
// so it runs only on a tree that passed the check. Within a cache bound it
// is left out: it holds the whole tree in memory, and the check covers its
// invariants. Exclusive.
bool ValidateMap(OffsetOpsStoreImpl& handle, MapCheck& check) {
    if (!check.Ok()) {
        return false;
    }
    if (handle.Memory().On()) {
        return true;
    }
    const FieldIdToOffsetOpsOnInt64FieldMap& map = handle.Tree().Map();
    map.Validate();
    const ssize_t counted = map.GetNumNodes();
    if (counted != check.Nodes()) {
        AddProblem(check, "the map counts " + std::to_string(counted) + " nodes, the walk found " +
                              std::to_string(check.Nodes()));
        return false;
    }
    return true;
}

// The stored images no root reaches. They are those of the store as it is
// (a reader's snapshot, a writer's last checkpoint), so they are counted in
// a second space over the same store, which holds no operation of the
// journal.
void FindUnreachable(OffsetOpsStoreImpl& handle, StoreValidation& v) {
    CSpace stored(handle.Tree().SharedStore());
    CSpaceGuard guard(stored, LockMode::Exclusive);
    ReachabilityResult reach = FindUnreachableImages(stored, handle.Memory().Objects());
    v.images = reach.stored;
    v.reached = reach.reached;
    v.unreachable = std::move(reach.unreachable);
    for (std::string& e : reach.errors) {
        v.check.problems.push_back(std::move(e));
        ++v.check.numProblems;
    }
}

}  // namespace

std::vector<FieldEntry> ReadBatch(OffsetOpsStoreImpl& handle, BatchFrom from, const FieldId& key,
                                  std::size_t max) {
    return handle.Reading([&] {
        handle.Memory().MakeRoomForOperation();
        std::vector<FieldEntry> batch;
        const FieldIdToOffsetOpsOnInt64FieldMap& map = handle.Tree().Map();
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
    });
}

std::optional<FieldTable> OffsetOpsStore::Find(const FieldId& field) {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    return FindTable(handle, field);
}

std::optional<FieldTable> FindTable(OffsetOpsStoreImpl& handle, const FieldId& field) {
    return handle.ReadingLocked([&]() -> std::optional<FieldTable> {
        handle.Memory().MakeRoomForOperation();
        const OffsetOpsOnField<int64>* table = handle.Tree().Map().rFind(field);
        if (table == nullptr) {
            return std::nullopt;
        }
        return TableOf(*table);
    });
}

void OffsetOpsStore::ForEachFrom(const FieldId& from, const FieldVisitor& fn) {
    std::vector<FieldEntry> batch = ReadBatch(State(), BatchFrom::AtOrAfter, from, kWalkBatch);
    for (;;) {
        for (const FieldEntry& e : batch) {
            if (!fn(e.first, e.second)) {
                return;
            }
        }
        if (batch.size() < kWalkBatch) {
            return;
        }
        const FieldId last = batch.back().first;
        batch = ReadBatch(State(), BatchFrom::After, last, kWalkBatch);
    }
}

void OffsetOpsStore::ForEachOfObject(OID oid, const FieldVisitor& fn) {
    ForEachFrom(FieldId(oid, Path()), [&](const FieldId& field, const FieldTable& t) {
        return field.oid == oid && fn(field, t);
    });
}

int64 OffsetOpsStore::Size() {
    OffsetOpsStoreImpl& handle = State();
    return handle.Reading([&] { return handle.Tree().Map().size(); });
}

ssize_t OffsetOpsStore::Height() {
    OffsetOpsStoreImpl& handle = State();
    return handle.Reading([&] { return handle.Tree().Map().m_height; });
}

std::map<Guid, int64> OffsetOpsStore::Sites() {
    OffsetOpsStoreImpl& handle = State();
    return handle.Reading([&] { return handle.Recording().Bounds().Newest(); });
}

StoreStatistics OffsetOpsStore::Stats() {
    OffsetOpsStoreImpl& handle = State();
    return handle.Reading([&] {
        TreeSpace& tree = handle.Tree();
        const Checkpointer& checkpoints = handle.Checkpoints();
        StoreStatistics stats;
        stats.fields = tree.Map().size();
        stats.height = tree.Map().m_height;
        std::tie(stats.leaves, stats.internalNodes) = tree.NodeCounts();
        const ImageCounts stored = tree.Store().Stats();
        stats.images = stored.numImages;
        stats.imageBytes = stored.numImageBytes;
        stats.journalBytes = static_cast<int64>(checkpoints.JournalBytes());
        stats.durableOperations = checkpoints.Durable();
        stats.checkpointedOperations = checkpoints.Checkpointed();
        stats.pendingOperations = checkpoints.Pending();
        stats.checkpoints = checkpoints.Count();
        stats.imagesWritten = tree.Store().ImagesWritten();
        stats.imageBytesWritten = tree.Store().BytesWritten();
        stats.residents = tree.Space().NumResidents();
        stats.peakResidents = handle.Memory().Peak();
        stats.replayedOperations = handle.Opening().replayed;
        return stats;
    });
}

StoreCheck OffsetOpsStore::Check() {
    OffsetOpsStoreImpl& handle = State();
    return handle.Reading([&] {
        StoreCheck check = AsStoreCheck(CheckMap(handle));
        handle.Memory().Trim();
        return check;
    });
}

StoreValidation OffsetOpsStore::Validate() {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    StoreValidation v = handle.ReadingLocked([&] {
        StoreValidation found;
        found.record = handle.Tree().RecordOid();
        found.map = handle.Tree().Record().m_map.m_oid;
        MapCheck check = CheckMap(handle);
        if (check.Ok()) {
            CompareKeptCounts(handle, check);
        }
        found.mapValid = ValidateMap(handle, check);
        found.check = AsStoreCheck(std::move(check));
        handle.Memory().Trim();
        return found;
    });
    if (DiskStore* disk = handle.Tree().Disk()) {
        // The file's own structure: opening and lookups read only the parts
        // on the paths they take.
        try {
            disk->CheckFile();
        } catch (const RuntimeError& e) {
            v.check.problems.push_back(e.what());
            ++v.check.numProblems;
        }
    }
    FindUnreachable(handle, v);
    return v;
}

void OffsetOpsStore::Dump(std::ostream& out) {
    OffsetOpsStoreImpl& handle = State();
    handle.Reading([&] {
        const StoreCheck check = AsStoreCheck(CheckMap(handle));
        if (!check.Ok()) {
            throw RuntimeError(RuntimeError::Category::Damaged,
                               "store '" + handle.Dir() + "': the stored tree is damaged (" +
                                   std::to_string(check.numProblems) + " problems; the first: " +
                                   check.problems.front() + "); run 'offsetops validate' for all");
        }
        OstreamOutputStream sink(out);
        xostream os(sink);
        handle.Tree().Map().Write(os);
    });
}

}  // namespace tarn
