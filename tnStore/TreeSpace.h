#pragma once

// The tree a handle works on: the object space, the offsets record the space
// holds under the named root "offsets", and the chain of stores under the
// space.
//
// The chain, from the space down:
//   overlay        bounded stores only (cacheObjects > 0): takes the space's
//                  commits between checkpoints, so that changed nodes may
//                  leave memory too; a temporary file of the process's own,
//                  never durable (tnBackends/OverlayStore.h)
//   counting store counts the images and bytes checkpoints write
//   backend        the on-disk store of a store directory (a DiskStore), or
//                  a MemoryStore
// Commit() commits the space one step down; CommitToBackend() also moves
// what the overlay holds into the backend, so that one backend transaction
// holds everything changed since the last one: a checkpoint's.
//
// Owns the chain, the space and the load check every node passes through
// (declared before the space, which uses it until it is destroyed), the
// reference to the record, and the node counts of trees that Clear cut off
// and the next commit deletes.
//
// Threads: a handle's; every call but the constructor needs the space held
// (CSpaceGuard), exclusively where it changes or loads something.

#include <memory>
#include <utility>

#include "tnBackends/CountingStore.h"
#include "tnBackends/DiskStore.h"
#include "tnBackends/OverlayStore.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/SpaceRef.h"
#include "tnStore/TreeLoadCheck.h"

namespace tarn {

// The named root under which a store keeps its offsets record, and the
// counter that holds the journal position of the last checkpoint.
inline constexpr const char* kRecordRoot = "offsets";
inline constexpr const char* kJournalPositionCounter = "journal-position";

class TreeSpace {
public:
    // `disk` is the backend when it is on disk (null for a MemoryStore).
    TreeSpace(std::unique_ptr<IStore> backend, DiskStore* disk, ssize_t cacheObjects);
    TreeSpace(const TreeSpace&) = delete;
    TreeSpace& operator=(const TreeSpace&) = delete;

    CSpace& Space() { return *m_space; }
    const CSpace& Space() const { return *m_space; }
    // The backend as the counting store sees it: what a checkpoint wrote.
    CountingStore& Store() { return *m_store; }
    std::shared_ptr<CountingStore> SharedStore() { return m_store; }
    DiskStore* Disk() { return m_disk; }

    // Binds the record of identity `oid` and loads it and the map's header,
    // so that a root of another class or a damaged image is reported now.
    // Exclusive.
    void BindRecord(OID oid);
    OffsetOps& Record() { return **m_record; }
    FieldIdToOffsetOpsOnInt64FieldMap& Map() { return *Record().m_map; }
    OID RecordOid() const { return m_record->m_oid; }

    // The journal position the stored tree covers (0 in a new store), and
    // whether the store has that counter at all (not before journals).
    uint64 CheckpointedPosition() const;
    bool HasJournalPosition() const;

    // Commits the space one step down the chain.
    void Commit();
    // Commits the space and moves what the overlay holds into the backend.
    void CommitToBackend();

    // Clear cut the tree off: its nodes stop counting now, although the
    // space counts them until the next commit deletes them.
    void NoteCleared();
    // The tree's leaves and internal nodes, from the space's counts.
    std::pair<int64, int64> NodeCounts() const;
    // Whether the space has changes no commit has taken yet.
    bool HasUncommittedChanges() const;

private:
    // The node counts of cut-off trees the space still counts.
    struct ClearedNodes {
        int64 leaves = 0;
        int64 internalNodes = 0;
    };

    TreeLoadCheck m_loadCheck;
    std::shared_ptr<CountingStore> m_store;
    DiskStore* m_disk;
    std::shared_ptr<OverlayStore> m_overlay;
    std::unique_ptr<CSpace> m_space;
    std::unique_ptr<SpaceRef<OffsetOps>> m_record;
    ClearedNodes m_cleared;
};

}  // namespace tarn
