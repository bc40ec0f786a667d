#pragma once

// A walk over a stored offsets map that can stay within a bound of resident
// objects.
//
// The walk goes level by level from the root and keeps only identities
// between nodes, never pointers, so it may evict after every node: whenever
// `bound` objects are resident it releases clean ones (down to half the
// bound), so that loading the next node keeps within the bound. Each node
// is loaded with the class its level requires; an image of another class, a
// missing image or a missing child reference ends the walk with a
// RuntimeError. The walk checks nothing else (see FieldIdToOffsetOpsOnInt64FieldMapCheck.h).
//
// Run it holding the map's space: exclusively when bound > 0 (eviction needs
// it), with either lock otherwise. Leaves are visited in key order.

#include <functional>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnRuntime/CSpace.h"

namespace tarn {

struct TreeShape {
    ssize_t height = -1;
    int64 leaves = 0;
    int64 internalNodes = 0;
    int64 entries = 0;

    int64 Nodes() const { return leaves + internalNodes; }
};

using LeafVisitor = std::function<void(const FieldIdToOffsetOpsOnInt64FieldMapLeafNode&)>;

// `onLeaf` may be empty. The leaf it receives is valid only during the call.
TreeShape WalkTree(CSpace& space, OID mapOid, ssize_t bound, const LeafVisitor& onLeaf);

// Evicts clean residents down to bound/2 when `bound` (> 0) or more are
// resident. Needs the space exclusively.
void KeepResidentsUnder(CSpace& space, ssize_t bound);

}  // namespace tarn
