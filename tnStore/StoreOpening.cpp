#include "tnStore/StoreOpening.h"

#include <algorithm>
#include <filesystem>
#include <string>
#include <utility>

#include "tnBackends/MemoryStore.h"
#include "tnStore/RegisterClasses.h"
#include "tnStore/TreeSummary.h"

namespace tarn {

namespace {

namespace fs = std::filesystem;

// A reader whose snapshot is older than the journal's first entry (the
// writer checkpointed and started a new journal in between) takes a new
// snapshot; this many times at most.
constexpr int kReaderAttempts = 8;

// Raised inside a reader's replay when the journal starts after its snapshot.
struct SnapshotTooOld {};

std::string JournalPath(const std::string& dir) {
    return (fs::path(dir) / Journal::kFileName).string();
}

std::unique_ptr<OffsetOpsStoreImpl> OpenHandle(const std::string& dir,
                                               const StoreOptions& options) {
    DiskStoreOptions disk;
    disk.mode = options.mode == StoreMode::Read            ? OpenMode::ReadOnly
                : options.mode == StoreMode::WriteExisting ? OpenMode::MustExist
                                                           : OpenMode::CreateIfMissing;
    disk.syncOnCommit = options.sync;
    std::unique_ptr<DiskStore> backend = OpenDiskStore(dir, disk);
    DiskStore* opened = backend.get();
    auto handle = std::make_unique<OffsetOpsStoreImpl>(dir, options, std::move(backend), opened);
    // What opening the backend repaired (a lock file made anew).
    std::vector<std::string>& repairs = handle->Opening().repairs;
    repairs.insert(repairs.end(), opened->Repairs().begin(), opened->Repairs().end());
    return handle;
}

// Replays one journal entry into the tree. A refused entry is damage: the
// writer accepted every entry it journaled.
void ReplayEntry(OffsetOpsStoreImpl& handle, uint64 seq, const JournalEntry& e) {
    if (e.kind == JournalEntry::Kind::Clear) {
        handle.Recording().Clear();
    } else {
        try {
            handle.Recording().Record(Opid(e.site, e.t), e.field, e.offset);
        } catch (const RecordRefused& refused) {
            throw RuntimeError(RuntimeError::Category::Damaged,
                               "journal '" + JournalPath(handle.Dir()) + "': entry " +
                                   std::to_string(seq) + " cannot be replayed: " + refused.what());
        }
    }
    ++handle.Opening().replayed;
}

// The record of the space: the root's, or (writers of a store without one)
// a new record, committed at once with the journal position 0 and an empty
// summary. Only a store without any image is given a new record: one that
// holds images but names no record lost its root, and a new record would
// orphan the stored tree.
void FindOrCreateRecord(OffsetOpsStoreImpl& handle) {
    TreeSpace& tree = handle.Tree();
    OID oid = tree.Space().GetRoot(kRecordRoot);
    if (oid.IsNull()) {
        if (handle.IsReader()) {
            throw RuntimeError(RuntimeError::Category::NotFound,
                               "store '" + handle.Dir() + "' holds no offsets record yet");
        }
        if (std::optional<uint64> largest = tree.Store().LargestIdentity()) {
            throw RuntimeError(RuntimeError::Category::Damaged,
                               "store '" + handle.Dir() + "' is damaged: it holds images (up to #" +
                                   std::to_string(*largest) +
                                   ") but names no offsets record; run 'offsetops validate'");
        }
        CSpaceGuard guard(tree.Space(), LockMode::Exclusive);
        OffsetOps* created = CreatePersistent<OffsetOps>();
        oid = created->GetPersistObjState().m_oid;
        tree.Space().SetRoot(kRecordRoot, oid);
        tree.Space().SetCounter(kJournalPositionCounter, 0);
        SetTreeSummary(tree.Space(), RefusalBounds());
        tree.CommitToBackend();
    }
    CSpaceGuard guard(tree.Space(), LockMode::Exclusive);
    tree.BindRecord(oid);
}

// The refusal bounds and node counts kept with the last checkpoint. A store
// from before they were kept has its tree walked once: a writer commits what
// the walk found at once (the upgrade: counters only, no image changes), a
// reader keeps it in memory.
void LoadSummary(OffsetOpsStoreImpl& handle) {
    TreeSpace& tree = handle.Tree();
    CSpaceGuard guard(tree.Space(), LockMode::Exclusive);
    if (LoadTreeSummary(tree.Space(), handle.Recording().Bounds())) {
        return;
    }
    RebuildTreeSummary(tree, handle.Memory(), handle.Recording().Bounds());
    if (!handle.IsReader()) {
        tree.CommitToBackend();
        handle.Opening().repairs.push_back(
            "kept the tree's counts and bounds with the store (once, for a "
            "store made before they were kept)");
    }
    handle.Memory().Trim();
}

// A checkpoint at operation P starts a new journal whose first entry is P; a
// writer that died between the two left the old journal, which ends at P (the
// next writer begins the new one when it opens). The stored position has no
// checksum of its own: any other value is damage, and replaying from it would
// drop or repeat operations.
void RequireCheckpointInJournal(const std::string& dir, uint64 checkpointed,
                                const std::string& path, const JournalScan& scan) {
    if (checkpointed != scan.base && checkpointed != scan.end) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           "store '" + dir + "': its last checkpoint is recorded at operation " +
                               std::to_string(checkpointed) + ", but journal '" + path +
                               "' holds operations " + std::to_string(scan.base) + " to " +
                               std::to_string(scan.end) +
                               ": the recorded position or the journal is damaged");
    }
}

RuntimeError MissingJournal(uint64 checkpointed, const std::string& path) {
    return RuntimeError(RuntimeError::Category::Damaged,
                        "journal '" + path + "' is missing: the store's last checkpoint covers " +
                            std::to_string(checkpointed) +
                            " operations, and any made durable after it are lost");
}

// The writer's replay of the journal after the last checkpoint.
JournalScan ReplayForWriting(OffsetOpsStoreImpl& handle, const std::string& path,
                             uint64 checkpointed) {
    JournalScan scan;
    {
        CSpaceGuard guard(handle.Tree().Space(), LockMode::Exclusive);
        scan = Journal::Scan(path, checkpointed, [&](uint64 seq, const JournalEntry& e) {
            ReplayEntry(handle, seq, e);
        });
    }
    if (scan.base > checkpointed) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           "journal '" + path + "' begins at operation " +
                               std::to_string(scan.base) +
                               " but the store's last checkpoint covers " +
                               std::to_string(checkpointed) + ": the operations between are lost");
    }
    // Without syncs a machine crash may leave the journal behind the
    // checkpoint, which OpenJournalForWriting answers.
    if (handle.Options().sync || scan.end >= checkpointed) {
        RequireCheckpointInJournal(handle.Dir(), checkpointed, path, scan);
    }
    if (scan.tornTail()) {
        handle.Opening().repairs.push_back("dropped " +
                                           std::to_string(scan.fileBytes - scan.validBytes) +
                                           " bytes of an incomplete last record from journal '" +
                                           path + "' (an append cut short by a crash)");
    }
    return scan;
}

// Writer: the journal after the last checkpoint, replayed; a torn tail cut.
void OpenJournalForWriting(OffsetOpsStoreImpl& handle, bool legacy) {
    const std::string& dir = handle.Dir();
    const std::string path = JournalPath(dir);
    const uint64 checkpointed = handle.Tree().CheckpointedPosition();
    std::error_code ec;
    if (!fs::exists(path, ec)) {
        if (!legacy) {
            throw MissingJournal(checkpointed, path);
        }
        Journal::Reset(dir, checkpointed, handle.Options().sync);
        handle.Opening().repairs.push_back("started a journal in '" + dir +
                                           "', which had none (a store made before journals)");
    }
    const JournalScan scan = ReplayForWriting(handle, path, checkpointed);
    Checkpointer& checkpoints = handle.Checkpoints();
    checkpoints.Start(std::max(scan.end, checkpointed), checkpointed,
                      std::make_unique<Journal>(dir, scan, handle.Options().sync));
    if (scan.base != checkpointed) {
        // The last checkpoint was cut short before its new journal began (or,
        // without syncs, the journal lost entries the checkpoint holds): the
        // checkpoint holds every entry of this one, begin the new one now.
        checkpoints.StartNewJournal(checkpointed);
        if (scan.end < checkpointed) {
            handle.Opening().repairs.push_back("journal '" + path +
                                               "' ended before the last checkpoint; started a "
                                               "new one after it");
        }
    }
}

// The identity counter has no checksum: one not above a stored identity
// would hand that identity out again, and a checkpoint would write over its
// image.
void RequireIdentitiesAhead(OffsetOpsStoreImpl& handle) {
    CountingStore& store = handle.Tree().Store();
    const uint64 next = store.NextIdentity();
    const uint64 largest = store.LargestIdentity().value_or(0);
    if (largest >= next) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           "store '" + handle.Dir() + "' is damaged: its identity counter " +
                               std::to_string(next) + " is not above the stored identity #" +
                               std::to_string(largest));
    }
}

std::unique_ptr<OffsetOpsStoreImpl> OpenWriter(const std::string& dir,
                                               const StoreOptions& options) {
    std::unique_ptr<OffsetOpsStoreImpl> handle = OpenHandle(dir, options);
    RequireIdentitiesAhead(*handle);
    TreeSpace& tree = handle->Tree();
    // A store made before journals has neither journal nor position counter.
    const bool legacy = !tree.HasJournalPosition();
    const bool fresh = tree.Space().GetRoot(kRecordRoot).IsNull();
    if (fresh && !fs::exists(JournalPath(dir))) {
        Journal::Reset(dir, tree.CheckpointedPosition(), options.sync);
    }
    FindOrCreateRecord(*handle);
    LoadSummary(*handle);
    OpenJournalForWriting(*handle, legacy && !fresh);
    return handle;
}

// One attempt of a reader: the snapshot's record and summary, and the
// journal's complete records after it. Throws SnapshotTooOld when the
// journal begins after the snapshot.
void ReplayForReading(OffsetOpsStoreImpl& handle) {
    const std::string path = JournalPath(handle.Dir());
    const uint64 checkpointed = handle.Tree().CheckpointedPosition();
    const bool legacy = !handle.Tree().HasJournalPosition();
    FindOrCreateRecord(handle);
    LoadSummary(handle);
    std::error_code ec;
    if (!fs::exists(path, ec)) {
        if (legacy) {
            handle.Checkpoints().Start(checkpointed, checkpointed, nullptr);
            return;
        }
        throw MissingJournal(checkpointed, path);
    }
    CSpaceGuard guard(handle.Tree().Space(), LockMode::Exclusive);
    bool first = true;
    JournalScan scan = Journal::Scan(path, checkpointed, [&](uint64 seq, const JournalEntry& e) {
        if (first && seq != checkpointed) {
            throw SnapshotTooOld{};
        }
        first = false;
        handle.Memory().MakeRoomForOperation();
        ReplayEntry(handle, seq, e);
    });
    if (scan.base > checkpointed) {
        throw SnapshotTooOld{};
    }
    RequireCheckpointInJournal(handle.Dir(), checkpointed, path, scan);
    handle.Checkpoints().Start(std::max(scan.end, checkpointed), checkpointed, nullptr);
    handle.Checkpoints().SetReplayedJournalBytes(scan.validBytes);
}

// Reader: one snapshot of the last checkpoint, plus the journal's complete
// records after it, replayed into memory.
std::unique_ptr<OffsetOpsStoreImpl> OpenReader(const std::string& dir,
                                               const StoreOptions& options) {
    for (int attempt = 1;; ++attempt) {
        // A store directory is open at most once per process: each attempt's
        // handle is gone before the next one opens.
        std::unique_ptr<OffsetOpsStoreImpl> handle = OpenHandle(dir, options);
        try {
            ReplayForReading(*handle);
            return handle;
        } catch (const SnapshotTooOld&) {
            if (attempt == kReaderAttempts) {
                throw RuntimeError(RuntimeError::Category::InUse,
                                   "journal '" + JournalPath(dir) +
                                       "' keeps moving past the store's "
                                       "checkpoints; try again");
            }
        }
    }
}

}  // namespace

std::unique_ptr<OffsetOpsStoreImpl> OpenStoreDirectory(const std::filesystem::path& dir,
                                                       const StoreOptions& options) {
    RegisterOffsetOpsClasses();
    std::unique_ptr<OffsetOpsStoreImpl> handle = options.mode == StoreMode::Read
                                                     ? OpenReader(dir.string(), options)
                                                     : OpenWriter(dir.string(), options);
    handle->Memory().NotePeak();
    return handle;
}

std::unique_ptr<OffsetOpsStoreImpl> OpenStoreInMemory(const StoreOptions& options) {
    RegisterOffsetOpsClasses();
    StoreOptions inMemory = options;
    inMemory.mode = StoreMode::Write;
    auto handle = std::make_unique<OffsetOpsStoreImpl>("", inMemory,
                                                       std::make_unique<MemoryStore>(), nullptr);
    FindOrCreateRecord(*handle);
    return handle;
}

}  // namespace tarn
