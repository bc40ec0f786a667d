#pragma once

// What a node of the map may hold at each place in the tree: the one
// statement of invariants 3 to 5 of FieldIdToOffsetOpsOnInt64FieldMap.h that
// every check of a stored tree uses (the check at each load, the whole-tree
// check, the image check and the walker). The map's own Validate asserts the
// same rules with assertion texts of its own.
//
//   3. a node at level 0 is a leaf, a node above it an internal node
//   4. entries: a leaf root 0..100, an internal root 1..100, every node below
//      the root 50..100; a node seen alone (its place unknown) 0..100, 1..100
//      when internal
//   5. keys strictly increase inside a node, at or above the separator its
//      parent hands down on its left and below the one on its right; an
//      internal node has a child in each of its entries + 1 slots

#include <string>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodes.h"

namespace tarn {

struct FieldIdToOffsetOpsOnInt64FieldMapNodeRule {
    const ReflectedClass* nodeClass;  // null: either class (a node seen alone)
    ssize_t minEntries;
    ssize_t maxEntries;

    bool AllowsCount(ssize_t n) const { return n >= minEntries && n <= maxEntries; }
    // "N entries, not MIN..MAX", or "" when the count is allowed.
    std::string CountProblem(ssize_t n) const;
};

// The rule of a node at `level` (0: the leaves), as the root or below it.
FieldIdToOffsetOpsOnInt64FieldMapNodeRule FieldIdToOffsetOpsOnInt64FieldMapRuleAt(ssize_t level,
                                                                                  bool isRoot);
// The rule of a node whose place is not known: a leaf or an internal node.
FieldIdToOffsetOpsOnInt64FieldMapNodeRule FieldIdToOffsetOpsOnInt64FieldMapRuleAlone(bool internal);
// The class of the nodes at `level`.
const ReflectedClass& FieldIdToOffsetOpsOnInt64FieldMapClassAt(ssize_t level);

}  // namespace tarn
