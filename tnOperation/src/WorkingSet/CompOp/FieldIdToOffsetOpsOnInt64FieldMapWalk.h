#pragma once

// The one walk over a map's stored nodes: depth first, in key order, within
// a bound of objects in memory.
//
// Between nodes the walk holds identities and copies of separator keys only,
// never a pointer into the space, and calls the visitor's BetweenNodes, which
// may therefore release clean residents (the map's header included) so that
// the walk keeps within a bound. Each node is loaded as the class its level
// needs (FieldIdToOffsetOpsOnInt64FieldMapNodeRules.h): an image of another
// class is reported to the visitor, never cast. A node reached a second time
// is reported and not walked again, so even a damaged tree ends the walk
// after each node once. It holds a path's worth of identities and keys: about
// 100 of each per level.
//
// Run it on the thread that holds the map's space: either lock, exclusively
// when BetweenNodes releases residents.

#include <string>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"

namespace tarn {

// Where a node sits: its reference (an identity), its level (0: the leaves),
// and the separators its parent hands down (null: none on that side).
struct FieldIdToOffsetOpsOnInt64FieldMapPlace {
    const prefbase& ref;
    ssize_t level;
    bool isRoot;
    const FieldId* lo;  // its keys are at or above this one ...
    const FieldId* hi;  // ... and below this one
};

class FieldIdToOffsetOpsOnInt64FieldMapVisitor {
public:
    using Place = FieldIdToOffsetOpsOnInt64FieldMapPlace;
    using InternalNode = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
    using LeafNode = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;

    virtual ~FieldIdToOffsetOpsOnInt64FieldMapVisitor() = default;
    // An internal node, loaded; false: the walk does not go below it.
    virtual bool Internal(const Place& place, const InternalNode& node) = 0;
    virtual void Leaf(const Place& place, const LeafNode& leaf) = 0;
    // A node that could not be loaded as its level needs: `error` says why,
    // or is empty for a missing reference.
    virtual void Unloadable(const Place& place, const std::string& error) = 0;
    virtual void ReachedTwice(const Place& place) = 0;
    virtual void BetweenNodes() {}
};

// Walks the tree of `map` from its root (nothing when it has none).
void WalkFieldIdToOffsetOpsOnInt64FieldMap(const FieldIdToOffsetOpsOnInt64FieldMap& map,
                                           FieldIdToOffsetOpsOnInt64FieldMapVisitor& visitor);

}  // namespace tarn
