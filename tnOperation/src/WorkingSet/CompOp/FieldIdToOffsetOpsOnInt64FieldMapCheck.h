#pragma once

// The one invariant checker of the map: a structural check that reports,
// never aborts.
//
// The map's own Validate() stops the process on the first broken invariant,
// and the map's code trusts every node it reaches to be of the kind its height
// says. Before any of that runs on a tree read from disk, CheckTree loads each
// node with the class its level requires (an image of another class is
// reported, not cast) and tests every invariant listed in
// FieldIdToOffsetOpsOnInt64FieldMap.h, numbered as there:
//   1. no root exactly when height is -1; then no first/last leaf and size 0
//   2. a root leaf is the first and the last leaf
//   3. every node at height h >= 1 is an internal node, every node at 0 a leaf,
//      and no node is reached twice
//   4. fill: internal root 1..100 entries, leaf root 0..100, others 50..100
//   5. keys strictly increase inside a node and stay within the separators
//      handed down by the parents
//   6. m_firstLeaf, the m_next chain and m_lastLeaf visit the leaves in key
//      order, m_prev the same chain backwards; keys increase across leaves
//   7. m_size is the total of the leaves' entry counts
//
// Run it on the thread that holds the map's space (either lock). It loads the
// whole tree, node by node, and calls `betweenNodes` (if given) after each
// node, at a moment when it holds no pointer into the tree: only identities
// and copies of keys. The hook may therefore release clean residents, the
// map's header included, so that the check stays within a bound of objects
// in memory (the hook then needs the space exclusively).

#include <functional>
#include <string>
#include <vector>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"

namespace tarn {

struct FieldIdToOffsetOpsOnInt64FieldMapCheckResult {
    std::vector<std::string> problems;  // one line each; at most kMaxProblems
    int64 numProblems = 0;              // all problems found, also those not kept
    int64 leaves = 0;
    int64 internalNodes = 0;
    int64 entries = 0;

    static constexpr int64 kMaxProblems = 50;

    bool Ok() const { return numProblems == 0; }
    int64 Nodes() const { return leaves + internalNodes; }
};

FieldIdToOffsetOpsOnInt64FieldMapCheckResult FieldIdToOffsetOpsOnInt64FieldMapCheck(
    const FieldIdToOffsetOpsOnInt64FieldMap& map, const std::function<void()>& betweenNodes = {});

}  // namespace tarn
