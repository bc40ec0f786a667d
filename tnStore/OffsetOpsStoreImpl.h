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
// Threads: a handle's, one thread at a time (tnStore/OffsetOpsStore.h).

#include <memory>
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
    bool IsBroken() const { return m_broken; }
    // "the store 'dir'", or "the store" for an in-memory one: for messages.
    std::string Named() const;

    // Throw RuntimeError when the handle is closed, or (for writes) a reader
    // or broken.
    void RequireOpen() const;
    void RequireWritable() const;

    // Runs `write` for a writer, marking the handle broken when it fails
    // with anything but a refusal: a write that failed half way may leave
    // the tree changed in memory, and nothing more may become durable then.
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
    // Runs `read` with the space held exclusively (reads load and release
    // nodes) and the deferred operations applied. A failure to apply them
    // breaks the handle, as a failed write does.
    template <class Read>
    decltype(auto) Reading(Read&& read) {
        RequireOpen();
        CSpaceGuard guard(Tree().Space(), LockMode::Exclusive);
        ApplyDeferred();
        return read();
    }
    void ApplyDeferred();

    // The parts of an open handle (see above).
    TreeSpace& Tree() { return m_parts->tree; }
    MemoryBound& Memory() { return m_parts->memory; }
    Recorder& Recording() { return m_parts->recorder; }
    Checkpointer& Checkpoints() { return m_parts->checkpointer; }
    OpeningReport& Opening() { return m_opening; }
    const OpeningReport& Opening() const { return m_opening; }

    // Lets go of everything the handle opened; the handle is closed.
    void Release();

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
    bool m_broken = false;
};

}  // namespace tarn
