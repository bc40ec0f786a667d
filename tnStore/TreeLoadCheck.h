#pragma once

// The check every node of a store's tree goes through when it is loaded, so
// that the map's code, which trusts each node to be what its level says,
// never meets a node that is not.
//
// Checked at every load, from the node alone: its entry count within
// 0..100 (an internal node at least 1), its keys strictly increasing, an
// internal node's child references all present. Then, from where the node
// sits among the nodes in memory: the node is looked for by descending from
// the header's root with its first key through resident nodes (during every
// descent of the map the path to a node being loaded is resident). Found as
// the root, it must be of the class the header's height needs. Found as a
// child of a resident internal node, it must be of the class its depth
// needs, hold 50..100 entries, and keep its keys within the bounds its
// parent gives it: at or above the separator on its left, below the one on
// its right. A parent that holds the node at another slot than its keys lead
// to means the keys are outside those bounds.
//
// A node not found this way gets the checks of the node alone: a leaf loaded
// along the leaf chain whose parent is not in memory (the chain's references
// carry their class, which the space checks), a node of a tree that Clear
// cut off and the commit deletes, or a node whose keys do not lead to it.
// The last is the limit of the check: an image that passes its checksum
// (bound to its identity) but holds another class and keys that lead
// elsewhere is not caught here; only `validate` sees it. Every failure is a
// RuntimeError naming the node, which the loader passes to whoever asked for
// the node: a lookup or walk that meets a damaged node ends with it.
//
// The header (the map object) is checked too: a height within what 2^64
// entries can need, a size that is not negative, and a root exactly when the
// height is not -1.

#include "tnRuntime/CSpace.h"

namespace tarn {

class TreeLoadCheck final : public LoadCheck {
public:
    // The identity of the map whose nodes are checked (its header).
    void SetMap(OID map) { m_map = map; }
    void Loaded(const CSpace& space, OID oid, ptr<IPersistable> obj,
                const ReflectedClass* expected) override;

private:
    OID m_map;
};

}  // namespace tarn
