#include "tnStore/OffsetOpsStoreImpl.h"

namespace tarn {

OffsetOpsStoreImpl::Parts::Parts(std::unique_ptr<IStore> backend, DiskStore* disk,
                                 const std::string& dir, const StoreOptions& options)
    : tree(std::move(backend), disk, options.cacheObjects),
      memory(tree, options.cacheObjects),
      recorder(tree, memory),
      checkpointer(tree, memory, recorder, dir, options.sync) {}

OffsetOpsStoreImpl::OffsetOpsStoreImpl(std::string dir, const StoreOptions& options,
                                       std::unique_ptr<IStore> backend, DiskStore* disk)
    : m_dir(std::move(dir)),
      m_options(options),
      m_parts(std::make_unique<Parts>(std::move(backend), disk, m_dir, options)) {}

std::string OffsetOpsStoreImpl::Named() const {
    return "the store" + (m_dir.empty() ? std::string() : " '" + m_dir + "'");
}

void OffsetOpsStoreImpl::RequireOpen() const {
    if (IsClosed()) {
        throw RuntimeError(Named() + " is closed");
    }
}

void OffsetOpsStoreImpl::RequireWritable() const {
    RequireOpen();
    if (IsReader()) {
        throw RuntimeError(RuntimeError::Category::ReadOnly,
                           "store '" + m_dir + "' is open for reading only");
    }
    if (m_broken) {
        throw RuntimeError(Named() +
                           " stopped accepting writes after an earlier error; it keeps its "
                           "last durable point");
    }
}

void OffsetOpsStoreImpl::ApplyDeferred() {
    try {
        Recording().ApplyDeferred();
    } catch (...) {
        m_broken = true;
        throw;
    }
}

void OffsetOpsStoreImpl::RecordOperation(const Opid& opid, const FieldId& field, int64 offset) {
    RequireWritable();
    CSpaceGuard guard(Tree().Space(), LockMode::Exclusive);
    // A bound too small for the tree throws before anything changes.
    Memory().MakeRoomForOperation();
    Writing([&] {
        Recording().Record(opid, field, offset);
        Checkpoints().AddRecord(opid, field, offset);
    });
}

void OffsetOpsStoreImpl::MakeDurable() {
    Writing([&] {
        Checkpointer& checkpoints = Checkpoints();
        checkpoints.Sync();
        if (checkpoints.JournalPast(m_options.journalLimitBytes)) {
            checkpoints.WriteCheckpoint();
        }
    });
}

void OffsetOpsStoreImpl::CheckpointNow() {
    Writing([&] {
        Checkpoints().Sync();
        Checkpoints().WriteCheckpoint();
    });
}

void OffsetOpsStoreImpl::Release() {
    std::unique_lock life(m_life);
    ReleaseLocked();
}

void OffsetOpsStoreImpl::ReleaseLocked() {
    if (m_parts != nullptr) {
        m_parts->checkpointer.CloseJournal();
    }
    m_parts.reset();
}

}  // namespace tarn
