#pragma once

// The bound on tree objects in memory (StoreOptions::cacheObjects): at most
// that many of the record, the map's header and the nodes resident at any
// time, and the peak the handle reached.
//
// How it holds. Before each operation, MakeRoomForOperation leaves room for
// the most one operation can make resident (OperationHeadroom): when the
// residents pass the bound less that room, the changed ones are committed to
// the overlay (never to the backend between checkpoints: the stored tree may
// not hold operations the journal could lose) and the clean ones released,
// down to half of the bound. Walks release between nodes (KeepUnder), and
// checkpoints and whole-tree walks end with Trim. A bound of 0 is no bound:
// every call but the peak's does nothing.
//
// Owns the bound and the peak. Threads: the calls that release need the
// space exclusively; NotePeak and Peak may run in reads that hold it shared.

#include <atomic>

#include "tnStore/TreeSpace.h"

namespace tarn {

// The fewest objects an operation needs resident in a tree of `height`.
ssize_t OperationHeadroom(ssize_t height);

class MemoryBound {
public:
    MemoryBound(TreeSpace& tree, ssize_t cacheObjects) : m_tree(tree), m_bound(cacheObjects) {}

    ssize_t Objects() const { return m_bound; }
    bool On() const { return m_bound > 0; }

    // Room for one more operation, as above. Throws RuntimeError (Refused),
    // changing nothing, when the bound is too small for the tree's height.
    void MakeRoomForOperation();
    // Between the nodes of a walk: releases clean residents down to half the
    // bound once the bound is reached.
    void KeepUnder();
    // The same for another space (0: no bound).
    static void KeepUnder(CSpace& space, ssize_t bound);
    // After a checkpoint or a whole-tree walk: clean residents down to half.
    void Trim();
    // Whether the tree has more nodes than the bound allows in memory.
    bool TreeOutgrowsTheBound() const;
    // Whether the bound leaves room for a tree `levels` higher than now.
    bool RoomForGrowth(ssize_t levels) const;

    // Residents only grow inside operations and shrink only by release, so
    // the peak is noted before every release and whenever it is read.
    void NotePeak();
    ssize_t Peak() {
        NotePeak();
        return m_peak.load();
    }

private:
    TreeSpace& m_tree;
    const ssize_t m_bound;
    std::atomic<ssize_t> m_peak{0};  // noted by reads too, which may run together
};

}  // namespace tarn
