#include "tnStore/MemoryBound.h"

#include <algorithm>
#include <string>

#include "tnStore/OffsetOpsStore.h"

namespace tarn {

ssize_t OperationHeadroom(ssize_t height) {
    const ssize_t h = std::max<ssize_t>(height, 0);
    // record + map header + a root-to-leaf path (h+1) + the split leaf's
    // successor + one new node per level (h+1) + a new root
    return 2 + (h + 1) + 1 + (h + 1) + 1;
}

ssize_t OffsetOpsStore::MinCacheObjects(ssize_t height) {
    return 2 * OperationHeadroom(height);
}

void MemoryBound::MakeRoomForOperation() {
    if (!On()) {
        return;
    }
    const ssize_t height = m_tree.Map().m_height;
    const ssize_t room = OperationHeadroom(height);
    const ssize_t limit = m_bound - room;
    if (limit < room) {
        throw RuntimeError(RuntimeError::Category::Refused,
                           "a cache of " + std::to_string(m_bound) +
                               " objects is too small for a tree of height " +
                               std::to_string(height) + ": it needs at least " +
                               std::to_string(2 * room));
    }
    if (m_tree.Space().NumResidents() > limit) {
        NotePeak();
        m_tree.Commit();
        m_tree.Space().EvictCleanResidents(limit / 2);
    }
}

void MemoryBound::KeepUnder() {
    if (On() && m_tree.Space().NumResidents() >= m_bound) {
        NotePeak();
        KeepUnder(m_tree.Space(), m_bound);
    }
}

void MemoryBound::KeepUnder(CSpace& space, ssize_t bound) {
    if (bound > 0 && space.NumResidents() >= bound) {
        space.EvictCleanResidents(bound / 2);
    }
}

void MemoryBound::Trim() {
    if (On()) {
        NotePeak();
        m_tree.Space().EvictCleanResidents(m_bound / 2);
    }
}

bool MemoryBound::TreeOutgrowsTheBound() const {
    const auto [leaves, internalNodes] = m_tree.NodeCounts();
    return leaves + internalNodes > m_bound;
}

bool MemoryBound::RoomForGrowth(ssize_t levels) const {
    const ssize_t height = std::max<ssize_t>(m_tree.Map().m_height, 0);
    return m_bound >= OffsetOpsStore::MinCacheObjects(height + levels);
}

void MemoryBound::NotePeak() {
    const ssize_t now = m_tree.Space().NumResidents();
    ssize_t peak = m_peak.load();
    while (peak < now && !m_peak.compare_exchange_weak(peak, now)) {
    }
}

}  // namespace tarn
