#pragma once

// What an OffsetOpsStore handle holds, by concern. Each piece keeps its own
// invariant and states its contract in its header:
//
//   OffsetOpsStoreImpl  the handle's identity (directory, options, reader or
//                       writer) and life: open, closed, or broken after a
//                       failed write
//   OpeningReport       what opening repaired and replayed (StoreOpening.h)
//   TreeSpace           the object space, the record, the chain of stores
//                       under them and the load check (TreeSpace.h)
//   MemoryBound         the bound on tree objects in memory and the peak
//                       (MemoryBound.h)
//   Recorder            the refusal checks, the refusal bounds and the
//                       deferred operations (Recorder.h)
//   Checkpointer        the journal, the positions in it (durable,
//                       checkpointed, pending) and the checkpoints
//                       (Checkpointer.h)
//
// Reading (OffsetOpsStoreRead.cpp, FieldBatch.h) owns no state: each read
// takes the space, applies the deferred operations and copies what it found.
//
// Threads (the rules users see are in tnStore/OffsetOpsStore.h). Three locks,
// always taken in this order:
//   life     shared by every call, exclusive for Release (Close): no call
//            runs on parts that are gone
//   writer   one write at a time (Record, Clear, Sync, Checkpoint, Merge,
//            Compact, Close); held across a write's journal append and sync
//   space    the object space's lock (CSpaceGuard): exclusive while the tree
//            or what is kept about it changes, shared by the reads of an
//            unbounded store (which neither load into a bound nor apply
//            deferred operations), exclusive for the reads of a bounded one
// Everything a read looks at (the tree, the positions, the bounds, the
// counts) changes only under the space's lock held exclusively, so a read
// sees the record after some prefix of the recorded operations and never a
// table half changed.

#include <atomic>
#include <memory>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <utility>
#include <vector>

#include "tnRuntime/CSpaceGuard.h"
#include "tnStore/Checkpointer.h"
#include "tnStore/MemoryBound.h"
#include "tnStore/OffsetOpsStore.h"
#include "tnStore/Recorder.h"
#include "tnStore/TreeSpace.h"

namespace tarn {

// What opening repaired (a torn journal tail dropped, a lock file made anew),
// one line each, and how many journaled operations it replayed.
struct OpeningReport {
    std::vector<std::string> repairs;
    int64 replayed = 0;
};

class OffsetOpsStoreImpl {
public:
    // A handle over `backend` (`disk` when it is on disk, else null); "" for
    // `dir` makes an in-memory store.
    OffsetOpsStoreImpl(std::string dir, const StoreOptions& options,
                       std::unique_ptr<IStore> backend, DiskStore* disk);
    OffsetOpsStoreImpl(const OffsetOpsStoreImpl&) = delete;
    OffsetOpsStoreImpl& operator=(const OffsetOpsStoreImpl&) = delete;

    const std::string& Dir() const { return m_dir; }
    const StoreOptions& Options() const { return m_options; }
    bool IsReader() const { return m_options.mode == StoreMode::Read; }
    bool IsClosed() const { return m_parts == nullptr; }
    bool IsBroken() const { return m_broken.load(); }
    // "the store 'dir'", or "the store" for an in-memory one: for messages.
    std::string Named() const;

    // Throw RuntimeError when the handle is closed, or (for writes) a reader
    // or broken.
    void RequireOpen() const;
    void RequireWritable() const;

    // Runs `write` for a writer, marking the handle broken when it fails
    // with anything but a refusal: a write that failed half way may leave
    // the tree changed in memory, and nothing more may become durable then.
    // REQUIRES: the life lock shared and the writer lock held.
    template <class Write>
    decltype(auto) Writing(Write&& write) {
        RequireWritable();
        try {
            return write();
        } catch (const RecordRefused&) {
            throw;
        } catch (...) {
            m_broken = true;
            throw;
        }
    }
    // Runs `read` with the life lock shared and the space held: shared for an
    // unbounded store, exclusively for a bounded one (its reads release nodes
    // and apply the deferred operations first). A failure to apply them
    // breaks the handle, as a failed write does.
    template <class Read>
    decltype(auto) Reading(Read&& read) {
        std::shared_lock life(m_life);
        return ReadingLocked(std::forward<Read>(read));
    }
    // The same for a caller that holds the life lock shared already.
    template <class Read>
    decltype(auto) ReadingLocked(Read&& read) {
        RequireOpen();
        const bool bounded = Memory().On();
        CSpaceGuard guard(Tree().Space(), bounded ? LockMode::Exclusive : LockMode::Shared);
        if (bounded) {
            ApplyDeferred();
        }
        return read();
    }
    // REQUIRES: the space held exclusively.
    void ApplyDeferred();

    // The writes, for callers that hold the life lock shared and the writer
    // lock (the public calls, Merge).
    void RecordOperation(const Opid& opid, const FieldId& field, int64 offset);
    // A durable point, and a checkpoint when the journal has grown past its
    // limit.
    void MakeDurable();
    // A durable point and a checkpoint.
    void CheckpointNow();

    // The life lock, shared, for a call; exclusive for Release.
    std::shared_lock<std::shared_mutex> ShareLife() { return std::shared_lock(m_life); }
    // The writer lock. REQUIRES: the life lock shared.
    std::unique_lock<std::mutex> LockWriter() { return std::unique_lock(m_writer); }

    // The parts of an open handle (see above).
    TreeSpace& Tree() { return m_parts->tree; }
    MemoryBound& Memory() { return m_parts->memory; }
    Recorder& Recording() { return m_parts->recorder; }
    Checkpointer& Checkpoints() { return m_parts->checkpointer; }
    OpeningReport& Opening() { return m_opening; }
    const OpeningReport& Opening() const { return m_opening; }

    // Lets go of everything the handle opened; the handle is closed. Takes
    // the life lock exclusively: every call still running ends first.
    void Release();
    // Release for a caller that holds the life lock exclusively already.
    void ReleaseLocked();
    std::unique_lock<std::shared_mutex> LockLife() { return std::unique_lock(m_life); }

private:
    // Built and destroyed together, in this order: each refers to those
    // before it.
    struct Parts {
        Parts(std::unique_ptr<IStore> backend, DiskStore* disk, const std::string& dir,
              const StoreOptions& options);
        TreeSpace tree;
        MemoryBound memory;
        Recorder recorder;
        Checkpointer checkpointer;
    };

    const std::string m_dir;
    const StoreOptions m_options;
    OpeningReport m_opening;
    std::unique_ptr<Parts> m_parts;  // null once closed
    std::atomic<bool> m_broken{false};
    std::shared_mutex m_life;
    std::mutex m_writer;
};

// The table of `field`, nothing when it has none. REQUIRES: the life lock
// shared.
std::optional<FieldTable> FindTable(OffsetOpsStoreImpl& handle, const FieldId& field);

}  // namespace tarn
