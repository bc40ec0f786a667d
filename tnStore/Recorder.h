#pragma once

// The record path: an operation's refusal checks, then the tree, with the
// refusal bounds that let most operations skip the field's lookup and the
// operations a bounded store defers.
//
// Refusals. An operation is refused (RecordRefused, nothing changed) for a
// time stamp outside 0..kMaxTimeStamp, one older than its site's recorded one
// for the field, or a sum that would overflow. When the bounds (see
// RefusalBounds.h) rule the last two out, the field's table is not looked up.
//
// Deferred operations. A bounded store lets operations the bounds clear wait
// in memory (they are journaled already) and applies them in key order once
// there are kDeferredPerCacheObject per object of the bound, or before
// anything reads or checkpoints the tree (ApplyDeferred). Operations on
// different fields commute, and a stable sort by field keeps each field's
// operations in their order, so the tree ends as if they had been applied one
// by one; an operation the bounds cannot clear applies the waiting ones first
// and is checked against the tree. An operation waits only once the tree has
// more nodes than the bound (a tree that fits gains nothing from waiting),
// and only while the bound leaves room for a tree two levels higher than now:
// one batch (256 operations per object of a bound of at least 24) cannot
// grow a tree by three levels (from height h that takes more than
// 2 * 50^(h+2) new fields), so applying it never outgrows the bound. Past
// that height each operation is applied at once, and the one that would take
// the tree past the bound is refused by MakeRoomForOperation before it
// changes anything.
//
// Owns the refusal bounds and the deferred operations. Threads: a handle's;
// every call needs the space exclusively.

#include <cstddef>
#include <vector>

#include "tnStore/MemoryBound.h"
#include "tnStore/RefusalBounds.h"
#include "tnStore/TreeSpace.h"

namespace tarn {

class Recorder {
public:
    Recorder(TreeSpace& tree, MemoryBound& memory);

    // Records one operation, or throws RecordRefused and changes nothing.
    void Record(const Opid& opid, const FieldId& field, int64 offset);
    // Applies the deferred operations, in key order.
    void ApplyDeferred();
    // Removes every table, the deferred operations and what the bounds hold.
    void Clear();

    RefusalBounds& Bounds() { return m_bounds; }
    const RefusalBounds& Bounds() const { return m_bounds; }

private:
    struct DeferredOperation {
        Opid opid;
        FieldId field;
        int64 offset;
    };

    bool MayDefer() const;
    void Apply(const Opid& opid, const FieldId& field, int64 offset);

    TreeSpace& m_tree;
    MemoryBound& m_memory;
    RefusalBounds m_bounds;
    std::vector<DeferredOperation> m_deferred;
    const std::size_t m_deferLimit;  // 0: never defer
};

}  // namespace tarn
