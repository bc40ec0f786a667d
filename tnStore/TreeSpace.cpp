#include "tnStore/TreeSpace.h"

namespace tarn {

TreeSpace::TreeSpace(std::unique_ptr<IStore> backend, DiskStore* disk, ssize_t cacheObjects)
    : m_store(std::make_shared<CountingStore>(std::move(backend))), m_disk(disk) {
    std::shared_ptr<IStore> under = m_store;
    if (cacheObjects > 0) {
        m_overlay = std::make_shared<OverlayStore>(m_store);
        under = m_overlay;
    }
    m_space = std::make_unique<CSpace>(under);
    m_space->SetLoadCheck(&m_loadCheck);
}

void TreeSpace::BindRecord(OID oid) {
    m_record = std::make_unique<SpaceRef<OffsetOps>>(*m_space, oid);
    m_loadCheck.SetMap(Record().m_map.m_oid);
    (void)Map();
}

uint64 TreeSpace::CheckpointedPosition() const {
    return m_space->GetCounter(kJournalPositionCounter).value_or(0);
}

bool TreeSpace::HasJournalPosition() const {
    return m_space->GetCounter(kJournalPositionCounter).has_value();
}

void TreeSpace::Commit() {
    m_space->Commit();
    m_cleared = ClearedNodes();
}

void TreeSpace::CommitToBackend() {
    Commit();
    if (m_overlay != nullptr) {
        m_overlay->FlushIntoBase();
    }
}

void TreeSpace::NoteCleared() {
    const auto [leaves, internalNodes] = NodeCounts();
    m_cleared.leaves += leaves;
    m_cleared.internalNodes += internalNodes;
}

std::pair<int64, int64> TreeSpace::NodeCounts() const {
    const int64 leaves =
        m_space->Population(GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>().m_name);
    const int64 internalNodes = m_space->Population(
        GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>().m_name);
    return {leaves - m_cleared.leaves, internalNodes - m_cleared.internalNodes};
}

bool TreeSpace::HasUncommittedChanges() const {
    return m_space->NumDirty() > 0 || m_space->NumQueuedDeletions() > 0;
}

}  // namespace tarn
