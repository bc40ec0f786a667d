#pragma once

// The state behind an OffsetOpsStore handle, shared by its writing
// (OffsetOpsStore.cpp) and reading (OffsetOpsStoreRead.cpp) halves.
//
// Positions: `durable` is the sequence number after the last journaled
// entry, `checkpointed` the number of entries the store's last checkpoint
// covers (its "journal-position" counter), `pending` the entries recorded
// since the last durable point. The tree in memory always holds
// durable + pending entries; the stored tree holds `checkpointed`.

#include <algorithm>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tnBackends/CountingStore.h"
#include "tnBackends/LmdbStore.h"
#include "tnBackends/OverlayStore.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/SpaceRef.h"
#include "tnStore/Journal.h"
#include "tnStore/OffsetOpsStore.h"
#include "tnStore/TreeLoadCheck.h"

namespace tarn {

// The named root under which a store keeps its offsets record, and the
// counter that holds the journal position of the last checkpoint.
inline constexpr const char* kRecordRoot = "offsets";
inline constexpr const char* kJournalPositionCounter = "journal-position";

// What the record's refusals depend on: the newest time stamp of each site in
// any table, and an upper bound on the magnitude of every sum. An operation
// whose stamp is not older than its site's newest and whose offset cannot
// carry any sum past the 64-bit range can be refused for nothing but its
// stamp's range, so Record skips looking up the field's table for it.
//
// Both are kept with every checkpoint (see TreeSummary) and brought forward
// by recording and replay, so that opening never walks the tree for them.
// The newest stamps are exact: a site's stamps for one field never go back,
// and only Clear removes tables, which empties them.
class RefusalBounds {
public:
    bool RulesOutRefusal(const Opid& opid, int64 offset) const {
        auto it = m_newest.find(opid.s);
        return (it == m_newest.end() || opid.t >= it->second) &&
               Magnitude(offset) <= kMaxSum - m_sum;
    }
    void Note(const Opid& opid, int64 offset) {
        NoteStamp(opid.s, opid.t);
        m_sum = std::min(kMaxSum, m_sum + std::min(kMaxSum, Magnitude(offset)));
    }
    // A table's record of one site, as a walk of the tree finds it.
    void NoteStored(const Guid& site, const SiteOffset<int64>& so) {
        NoteStamp(site, so.t);
        m_sum = std::min(kMaxSum, std::max(m_sum, Magnitude(so.o)));
    }
    void NoteStamp(const Guid& site, int64 t) {
        auto [it, added] = m_newest.emplace(site, t);
        if (!added && it->second < t) {
            it->second = t;
        }
    }
    void SetSumBound(uint64 sum) { m_sum = std::min(kMaxSum, sum); }
    uint64 SumBound() const { return m_sum; }
    const std::map<Guid, int64>& Newest() const { return m_newest; }
    void Clear() { *this = RefusalBounds(); }

private:
    static constexpr uint64 kMaxSum = 9223372036854775807;
    static uint64 Magnitude(int64 v) {
        return v < 0 ? uint64{0} - static_cast<uint64>(v) : static_cast<uint64>(v);
    }

    std::map<Guid, int64> m_newest;
    uint64 m_sum = 0;  // at least the magnitude of every sum, at most kMaxSum
};

// The numbers of the tree's nodes by class, as the space counts them, less
// those of a tree Clear cut off and the next commit deletes (the space counts
// those only when the commit expands the deletion).
struct ClearedNodes {
    int64 leaves = 0;
    int64 internalNodes = 0;
};

// An operation recorded but not yet applied to the tree (see
// Impl::deferred).
struct DeferredOperation {
    Opid opid;
    FieldId field;
    int64 offset;
};

struct OffsetOpsStore::Impl {
    std::string dir;  // "" for an in-memory store
    StoreOptions options;
    bool reader = false;
    bool broken = false;  // a write failed half way: no more writes
    bool closed = false;

    // Declared before the space, which uses it until it is destroyed.
    TreeLoadCheck loadCheck;
    std::shared_ptr<CountingStore> store;
    LmdbStore* lmdb = nullptr;  // under `store`, for on-disk stores
    // Bounded stores: between the space and `store`, taking the space's
    // commits between checkpoints (see MakeRoom); a writer's checkpoint
    // flushes it into `store`.
    std::shared_ptr<OverlayStore> overlay;
    std::unique_ptr<CSpace> space;
    std::unique_ptr<SpaceRef<OffsetOps>> record;
    std::unique_ptr<Journal> journal;  // writers of on-disk stores

    uint64 durable = 0;
    uint64 checkpointed = 0;
    int64 pending = 0;
    uint64 journalBytes = 0;  // readers: the journal bytes replayed

    int64 checkpoints = 0;
    int64 replayed = 0;
    ssize_t peakResidents = 0;
    std::vector<std::string> repairs;
    RefusalBounds bounds;
    ClearedNodes cleared;
    // Bounded stores: operations that the bounds show cannot be refused wait
    // here (they are journaled already) and are applied in key order once
    // there are deferLimit of them, or before anything reads or checkpoints
    // the tree. Operations on different fields commute, and a stable sort by
    // field keeps each field's operations in their order, so the tree ends as
    // if they had been applied one by one; an operation the bounds cannot
    // clear applies the waiting ones first and is checked against the tree.
    std::vector<DeferredOperation> deferred;
    std::size_t deferLimit = 0;

    FieldIdToOffsetOpsOnInt64FieldMap& Map() { return *(*record)->m_map; }
    OffsetOps& Record() { return **record; }

    // Throws when the handle is closed, or (for writes) a reader or broken.
    void RequireOpen() const;
    void RequireWritable() const;
    // Commits the space (to the store, or a bounded store's overlay).
    void CommitSpace();
    // Commits the space and, for a bounded writer, flushes the overlay into
    // the store: one store transaction holds everything changed since the
    // last one.
    void CommitDurably();
    // Applies the deferred operations in key order. Exclusive.
    void ApplyDeferred();
    // Clears the record (and what is kept about it). Exclusive.
    void ClearRecord();
    // The tree's leaves and internal nodes, without a walk.
    std::pair<int64, int64> NodeCounts() const;
    bool TreeOutgrowsTheBound() const;
    // Releases clean residents so that one more operation fits under the
    // cache bound. Needs the space exclusively.
    void MakeRoom();
    // Writes the tree and the journal position (after a durable point).
    void WriteCheckpoint();
    void NotePeak();
    void Release();
};

// The fewest objects an operation needs resident in a tree of `height`.
ssize_t OperationHeadroom(ssize_t height);

// The non-aborting check of the store's tree, as the API reports it; within
// the cache bound. Needs the space exclusively.
StoreCheck CheckTree(OffsetOpsStore::Impl& s);
// Throws RuntimeError unless the whole tree passes CheckTree: for the
// operations that go over all of it and trust what they find (Dump, Clear).
void RequireSoundTree(OffsetOpsStore::Impl& s);

}  // namespace tarn
