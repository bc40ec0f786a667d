#include "tnStore/TreeLoadCheck.h"

#include <string>

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodeRules.h"
#include "tnUtils/RuntimeError.h"

namespace tarn {

namespace {

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using LeafNode = Map::LeafNode;
using InternalNode = Map::InternalNode;

// A tree of 2^64 entries at 50 a node is 11 levels high; anything above
// this is damage.
constexpr ssize_t kMaxHeight = 64;

[[noreturn]] void Damaged(OID oid, const std::string& what) {
    throw RuntimeError(RuntimeError::Category::Damaged,
                       "damaged tree: node " + ToString(oid) + " " + what);
}

// A node of either class, read through one interface. Slot s of an internal
// node's children is m_ptr for s == 0, else entry s-1's reference.
class NodeView {
public:
    static NodeView Of(ptr<IPersistable> obj) {
        const ReflectedClass* rc = obj->GetReflectedClass();
        if (rc == &GetReflectedClass<LeafNode>()) {
            return NodeView(static_cast<const LeafNode*>(obj.m_self), nullptr);
        }
        if (rc == &GetReflectedClass<InternalNode>()) {
            return NodeView(nullptr, static_cast<const InternalNode*>(obj.m_self));
        }
        return NodeView(nullptr, nullptr);
    }

    bool IsNode() const { return m_leaf != nullptr || m_internal != nullptr; }
    bool IsLeaf() const { return m_leaf != nullptr; }
    const InternalNode* Internal() const { return m_internal; }
    ssize_t Count() const {
        return m_leaf != nullptr ? m_leaf->m_numKeyEntrys : m_internal->m_numKeyEntrys;
    }
    const FieldId& Key(ssize_t i) const {
        return m_leaf != nullptr ? m_leaf->GetEntry(i).first : m_internal->GetEntry(i).m_key;
    }

private:
    NodeView(const LeafNode* leaf, const InternalNode* internal)
        : m_leaf(leaf), m_internal(internal) {}
    const LeafNode* m_leaf;
    const InternalNode* m_internal;
};

const prefbase& ChildAt(const InternalNode& node, ssize_t slot) {
    return slot == 0 ? static_cast<const prefbase&>(node.m_ptr)
                     : static_cast<const prefbase&>(node.GetEntry(slot - 1).m_ptr);
}

// The child slot whose subtree holds `key`: the number of separators at or
// below it.
ssize_t SlotFor(const InternalNode& node, const FieldId& key) {
    ssize_t lo = 0;
    ssize_t hi = node.m_numKeyEntrys;
    while (lo < hi) {
        const ssize_t mid = lo + (hi - lo) / 2;
        if (CompareKeys(node.GetEntry(mid).m_key, key) <= 0) {
            lo = mid + 1;
        } else {
            hi = mid;
        }
    }
    return lo;
}

void CheckAlone(OID oid, const NodeView& node) {
    const ssize_t n = node.Count();
    const FieldIdToOffsetOpsOnInt64FieldMapNodeRule rule =
        FieldIdToOffsetOpsOnInt64FieldMapRuleAlone(node.Internal() != nullptr);
    if (n < 0 || n > rule.maxEntries) {
        Damaged(oid, "holds " + std::to_string(n) + " entries, outside 0.." +
                         std::to_string(rule.maxEntries));
    }
    if (const InternalNode* internal = node.Internal()) {
        if (!rule.AllowsCount(n)) {
            Damaged(oid, "is an internal node without entries");
        }
        for (ssize_t slot = 0; slot <= n; ++slot) {
            if (ChildAt(*internal, slot).m_oid.IsNull()) {
                Damaged(oid, "has no child in slot " + std::to_string(slot));
            }
        }
    }
    for (ssize_t i = 1; i < n; ++i) {
        if (CompareKeys(node.Key(i - 1), node.Key(i)) >= 0) {
            Damaged(oid, "has keys out of order at entry " + std::to_string(i) + " (" +
                             ToString(node.Key(i - 1)) + ", then " + ToString(node.Key(i)) + ")");
        }
    }
}

void CheckHeader(OID oid, const Map& map) {
    if (map.m_height < -1 || map.m_height > kMaxHeight) {
        Damaged(oid, "(the map's header) gives the height " + std::to_string(map.m_height));
    }
    if (map.m_size < 0) {
        Damaged(oid, "(the map's header) gives the size " + std::to_string(map.m_size));
    }
    const bool empty = map.m_height == -1;
    if (empty != map.m_root.m_oid.IsNull() || empty != map.m_firstLeaf.m_oid.IsNull() ||
        empty != map.m_lastLeaf.m_oid.IsNull()) {
        Damaged(oid, "(the map's header) has a height of " + std::to_string(map.m_height) +
                         " that its root and leaf references contradict");
    }
}

void CheckClassForLevel(OID oid, const NodeView& node, ssize_t level, const std::string& where) {
    const bool leafLevel =
        &FieldIdToOffsetOpsOnInt64FieldMapClassAt(level) == &GetReflectedClass<LeafNode>();
    if (node.IsLeaf() != leafLevel) {
        Damaged(oid,
                std::string("is ") + (node.IsLeaf() ? "a leaf" : "an internal node") + " where " +
                    where + " needs " +
                    (level == 0 ? "a leaf" : "an internal node at level " + std::to_string(level)));
    }
}

// Keys within the bounds slot `slot` of `parent` gives: at or above the
// separator on its left, below the one on its right; and the entries a node
// below the root holds.
void CheckUnder(OID oid, const NodeView& node, ssize_t level, const InternalNode& parent,
                OID parentOid, ssize_t slot) {
    const std::string where = "its parent " + ToString(parentOid);
    const ssize_t least = FieldIdToOffsetOpsOnInt64FieldMapRuleAt(level, false).minEntries;
    if (node.Count() < least) {
        Damaged(oid, "holds " + std::to_string(node.Count()) + " entries below the root (" + where +
                         "), fewer than " + std::to_string(least));
    }
    if (slot > 0 && CompareKeys(node.Key(0), parent.GetEntry(slot - 1).m_key) < 0) {
        Damaged(oid, "has the key " + ToString(node.Key(0)) + " below the bound " +
                         ToString(parent.GetEntry(slot - 1).m_key) + " that " + where + " gives");
    }
    if (slot < parent.m_numKeyEntrys &&
        CompareKeys(node.Key(node.Count() - 1), parent.GetEntry(slot).m_key) >= 0) {
        Damaged(oid, "has the key " + ToString(node.Key(node.Count() - 1)) +
                         " at or above the bound " + ToString(parent.GetEntry(slot).m_key) +
                         " that " + where + " gives");
    }
}

}  // namespace

void TreeLoadCheck::Loaded(const CSpace& space, OID oid, ptr<IPersistable> obj,
                           const ReflectedClass* /*expected*/) {
    if (obj->GetReflectedClass() == &GetReflectedClass<Map>()) {
        CheckHeader(oid, *static_cast<const Map*>(obj.m_self));
        return;
    }
    const NodeView node = NodeView::Of(obj);
    if (!node.IsNode()) {
        return;
    }
    CheckAlone(oid, node);
    ptr<IPersistable> header = m_map.IsNull() ? ptr<IPersistable>() : space.FindResident(m_map);
    if (header.m_self == nullptr || header->GetReflectedClass() != &GetReflectedClass<Map>()) {
        return;
    }
    const Map& map = *static_cast<const Map*>(header.m_self);
    if (map.m_root.m_oid == oid) {
        CheckClassForLevel(oid, node, map.m_height,
                           "the root of a tree of height " + std::to_string(map.m_height));
        return;
    }
    if (node.Count() == 0 || map.m_height < 1) {
        return;  // not in the tree (a cut-off one, or damage the header's load saw)
    }
    // Down from the root with the node's first key, through resident nodes.
    const FieldId& key = node.Key(0);
    OID at = map.m_root.m_oid;
    for (ssize_t level = map.m_height; level >= 1; --level) {
        ptr<IPersistable> resident = space.FindResident(at);
        if (resident.m_self == nullptr ||
            resident->GetReflectedClass() != &GetReflectedClass<InternalNode>()) {
            return;
        }
        const auto& parent = *static_cast<const InternalNode*>(resident.m_self);
        const ssize_t slot = SlotFor(parent, key);
        const OID child = ChildAt(parent, slot).m_oid;
        if (child == oid) {
            CheckClassForLevel(oid, node, level - 1, "its parent " + ToString(at));
            CheckUnder(oid, node, level - 1, parent, at, slot);
            return;
        }
        // A parent holding the node in another slot than its first key
        // leads to: the key is outside that slot's bounds.
        for (ssize_t other = 0; other <= parent.m_numKeyEntrys; ++other) {
            if (other != slot && ChildAt(parent, other).m_oid == oid) {
                CheckClassForLevel(oid, node, level - 1, "its parent " + ToString(at));
                CheckUnder(oid, node, level - 1, parent, at, other);
            }
        }
        at = child;
    }
}

}  // namespace tarn
