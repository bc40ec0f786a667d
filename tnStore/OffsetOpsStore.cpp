// The handle's life and its writes: opening, recording, durable points,
// checkpoints, compaction and closing. Reads are in OffsetOpsStoreRead.cpp,
// replicas in OffsetOpsStoreMerge.cpp, backups in OffsetOpsStoreBackup.cpp.

#include "tnStore/OffsetOpsStore.h"

#include <utility>

#include "tnStore/OffsetOpsStoreImpl.h"
#include "tnStore/StoreOpening.h"

namespace tarn {

namespace {

// Data files smaller than this are not worth a compacting copy.
constexpr int64 kCompactionFloorBytes = int64{1} << 20;

// Whether free space takes more than `share` of the data file.
bool WorthCompacting(DiskStore* disk, double share) {
    return disk != nullptr && share > 0 && disk->FileBytes() >= kCompactionFloorBytes &&
           disk->FreeShare() > share;
}

// What Close does for a writer that is not broken: a durable point, a
// checkpoint when anything is not in the stored tree yet, and a compaction
// when free space has grown past the options' share.
void CloseWriter(OffsetOpsStoreImpl& handle) {
    Checkpointer& checkpoints = handle.Checkpoints();
    checkpoints.Sync();
    // Nothing of an in-memory store outlives the handle.
    if (!handle.Dir().empty() && checkpoints.HasWorkSinceCheckpoint()) {
        checkpoints.WriteCheckpoint();
    }
    DiskStore* disk = handle.Tree().Disk();
    if (WorthCompacting(disk, handle.Options().compactFreeShare)) {
        // The store is whole whatever happens here: a compaction that cannot
        // run (another process has the store open) or fails leaves the old
        // file in place.
        try {
            (void)disk->Compact();
        } catch (const RuntimeError&) {
        }
    }
}

}  // namespace

// --- Opening and closing -----------------------------------------------------------

OffsetOpsStore::OffsetOpsStore(std::unique_ptr<OffsetOpsStoreImpl> impl)
    : m_impl(std::move(impl)) {}
OffsetOpsStore::OffsetOpsStore(OffsetOpsStore&&) noexcept = default;
OffsetOpsStore& OffsetOpsStore::operator=(OffsetOpsStore&& rhs) noexcept {
    if (this != &rhs) {
        if (m_impl != nullptr) {
            try {
                Close();
            } catch (...) {
                m_impl->Release();
            }
        }
        m_impl = std::move(rhs.m_impl);
    }
    return *this;
}

OffsetOpsStore::~OffsetOpsStore() {
    if (m_impl == nullptr) {
        return;
    }
    try {
        Close();
    } catch (...) {
        m_impl->Release();
    }
}

OffsetOpsStore OffsetOpsStore::Open(const std::filesystem::path& dir, const StoreOptions& options) {
    return OffsetOpsStore(OpenStoreDirectory(dir, options));
}

OffsetOpsStore OffsetOpsStore::OpenInMemory(const StoreOptions& options) {
    return OffsetOpsStore(OpenStoreInMemory(options));
}

// Waits for every call still running (the life lock, exclusively), so that
// no other thread is inside the handle when it lets go of its parts.
void OffsetOpsStore::Close() {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.LockLife();
    if (handle.IsClosed()) {
        return;
    }
    if (!handle.IsReader() && !handle.IsBroken()) {
        try {
            CloseWriter(handle);
        } catch (...) {
            handle.ReleaseLocked();
            throw;
        }
    }
    handle.ReleaseLocked();
}

bool OffsetOpsStore::IsReader() const {
    return State().IsReader();
}

std::filesystem::path OffsetOpsStore::Directory() const {
    return State().Dir();
}

const std::vector<std::string>& OffsetOpsStore::Repairs() const {
    return State().Opening().repairs;
}

OffsetOpsStoreImpl& OffsetOpsStore::State() const {
    if (m_impl == nullptr) {
        throw RuntimeError("the store handle was moved from");
    }
    return *m_impl;
}

// --- Writing -------------------------------------------------------------------------
//
// A failed write (a failed load inside the tree's descent, append, sync or
// checkpoint) breaks the handle: the store keeps its last durable point, and
// nothing recorded after it may become durable later (a caller told of the
// failure counts those operations as lost). Reopen the store to go on.

void OffsetOpsStore::Record(const Opid& opid, const FieldId& field, int64 offset) {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    auto writer = handle.LockWriter();
    handle.RecordOperation(opid, field, offset);
}

void OffsetOpsStore::Clear() {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    auto writer = handle.LockWriter();
    handle.RequireWritable();
    CSpaceGuard guard(handle.Tree().Space(), LockMode::Exclusive);
    handle.Writing([&] {
        handle.Recording().Clear();
        handle.Checkpoints().AddClear();
    });
}

// Group commit: a thread's Sync waits for the writer lock while another
// thread's Sync appends and syncs; that append took every operation recorded
// before it, this thread's among them, so this Sync then finds nothing
// pending and returns at once. One append and one sync serve every waiting
// thread.
void OffsetOpsStore::Sync() {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    auto writer = handle.LockWriter();
    handle.MakeDurable();
}

void OffsetOpsStore::Checkpoint() {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    auto writer = handle.LockWriter();
    handle.CheckpointNow();
}

CompactResult OffsetOpsStore::Compact() {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    auto writer = handle.LockWriter();
    handle.RequireWritable();
    DiskStore* disk = handle.Tree().Disk();
    if (disk == nullptr) {
        throw RuntimeError("an in-memory store has no file to compact");
    }
    handle.CheckpointNow();
    CompactResult result;
    result.bytesBefore = disk->FileBytes();
    // The files are whole whatever happens; this handle's environment may not
    // be, so a failure breaks the handle.
    result.compacted = handle.Writing([&] { return disk->Compact(); });
    result.bytesAfter = disk->FileBytes();
    return result;
}

}  // namespace tarn
