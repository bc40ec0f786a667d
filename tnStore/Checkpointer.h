#pragma once

// Durable points and checkpoints: the journal, the positions in it, and the
// writing of the tree.
//
// Positions are operation sequence numbers (tnStore/Journal.h):
//   durable       the number after the last journaled entry: every operation
//                 before it survives a crash
//   checkpointed  the entries the stored tree covers (the store's
//                 "journal-position" counter)
//   pending       entries recorded since the last durable point
// The tree in memory always holds durable + pending entries; the stored tree
// holds `checkpointed`, and checkpointed <= durable.
//
// A durable point (Sync) appends the pending entries to the journal as one
// checksummed record and syncs the file. A checkpoint (WriteCheckpoint) runs
// only at a durable point, so that the stored tree never holds an operation
// the journal could lose: the deferred operations applied, the changed nodes,
// the journal position and the tree's summary committed to the backend in one
// transaction, then a new, empty journal that begins at that position. A
// failure before the transaction ends leaves memory and store as they were.
//
// Owns the journal (writers of store directories only; readers and
// in-memory stores have none), the positions and this handle's checkpoint
// count. Threads: the calls that change something are the writer's (under
// the handle's writer lock); they change the positions, the count and the
// journal's size as reads see them only with the space held exclusively, so
// a read holding the space (either way) sees them consistent. The getters
// need the space held.

#include <memory>
#include <string>

#include "tnStore/Journal.h"
#include "tnStore/MemoryBound.h"
#include "tnStore/Recorder.h"
#include "tnStore/TreeSpace.h"

namespace tarn {

class Checkpointer {
public:
    Checkpointer(TreeSpace& tree, MemoryBound& memory, Recorder& recorder, std::string dir,
                 bool sync);

    // Opening: where the store stands, and the journal to append to (null
    // for readers and in-memory stores).
    void Start(uint64 durable, uint64 checkpointed, std::unique_ptr<Journal> journal);
    // Replaces the journal with an empty one that begins at `base`.
    void StartNewJournal(uint64 base);

    // One more operation (or Clear) recorded: journaled at the next durable
    // point.
    void AddRecord(const Opid& opid, const FieldId& field, int64 offset);
    void AddClear();
    // A durable point.
    void Sync();
    // Whether the journal has grown past `limit` bytes.
    bool JournalPast(std::size_t limit) const;
    // A checkpoint (see above). Needs no guard: takes the space itself.
    void WriteCheckpoint();
    // Whether anything is not in the stored tree yet: changed objects, or
    // journaled operations since the last checkpoint.
    bool HasWorkSinceCheckpoint() const;
    // Closing: lets go of the journal.
    void CloseJournal() { m_journal.reset(); }

    uint64 Durable() const { return m_durable; }
    uint64 Checkpointed() const { return m_checkpointed; }
    int64 Pending() const { return m_pending; }
    int64 Count() const { return m_count; }
    // The journal's bytes: a writer's file, or what a reader replayed.
    uint64 JournalBytes() const;
    void SetReplayedJournalBytes(uint64 bytes) { m_journalBytes = bytes; }

private:
    TreeSpace& m_tree;
    MemoryBound& m_memory;
    Recorder& m_recorder;
    const std::string m_dir;
    const bool m_sync;
    std::unique_ptr<Journal> m_journal;
    uint64 m_durable = 0;
    uint64 m_checkpointed = 0;
    int64 m_pending = 0;
    int64 m_count = 0;
    uint64 m_journalBytes = 0;  // as of the last change reads may see
};

}  // namespace tarn
