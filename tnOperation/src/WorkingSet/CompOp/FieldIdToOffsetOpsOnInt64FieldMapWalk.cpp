#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapWalk.h"

#include <unordered_set>
#include <vector>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodeRules.h"
#include "tnUtils/RuntimeError.h"

namespace tarn {

namespace {

using Visitor = FieldIdToOffsetOpsOnInt64FieldMapVisitor;
using Place = FieldIdToOffsetOpsOnInt64FieldMapPlace;

// A reference that holds no pointer into the space: by identity, unless the
// object has none yet (then it is not stored, and no release takes it).
prefbase Detached(const prefbase& ref) {
    return ref.m_oid.IsNull() ? ref : prefbase(ref.m_oid);
}

class Walk {
public:
    explicit Walk(Visitor& visitor) : m_visitor(visitor) {}

    void Node(const Place& place) {
        if (place.ref && !m_seen.insert(place.ref.m_oid.value_).second) {
            m_visitor.ReachedTwice(place);
            return;
        }
        const void* node = Load(place);
        if (node == nullptr) {
            return;
        }
        if (place.level == 0) {
            m_visitor.Leaf(place, *static_cast<const Visitor::LeafNode*>(node));
            m_visitor.BetweenNodes();
            return;
        }
        const auto& internal = *static_cast<const Visitor::InternalNode*>(node);
        if (m_visitor.Internal(place, internal)) {
            Below(place, internal);
        }
    }

private:
    // The node of `place` as the class its level needs; null (reported) when
    // it cannot be loaded so.
    const void* Load(const Place& place) {
        if (!place.ref) {
            m_visitor.Unloadable(place, {});
            return nullptr;
        }
        try {
            return place.ref.Resolve(&FieldIdToOffsetOpsOnInt64FieldMapClassAt(place.level)).m_self;
        } catch (const RuntimeError& e) {
            m_visitor.Unloadable(place, e.what());
            return nullptr;
        }
    }

    // The subtrees of `node`: what they need of it is copied first.
    void Below(const Place& place, const Visitor::InternalNode& node) {
        const ssize_t n = node.m_numKeyEntrys;
        std::vector<FieldId> keys;
        std::vector<prefbase> children;
        keys.reserve(static_cast<std::size_t>(n));
        children.reserve(static_cast<std::size_t>(n) + 1);
        children.push_back(Detached(node.m_ptr));
        for (ssize_t i = 0; i < n; ++i) {
            keys.push_back(node.GetEntry(i).m_key);
            children.push_back(Detached(node.GetEntry(i).m_ptr));
        }
        m_visitor.BetweenNodes();
        for (std::size_t i = 0; i < children.size(); ++i) {
            const FieldId* lo = i == 0 ? place.lo : &keys[i - 1];
            const FieldId* hi = i < keys.size() ? &keys[i] : place.hi;
            Node(Place{children[i], place.level - 1, false, lo, hi});
        }
    }

    Visitor& m_visitor;
    std::unordered_set<uint64> m_seen;
};

}  // namespace

void WalkFieldIdToOffsetOpsOnInt64FieldMap(const FieldIdToOffsetOpsOnInt64FieldMap& map,
                                           FieldIdToOffsetOpsOnInt64FieldMapVisitor& visitor) {
    const ssize_t height = map.m_height;
    const prefbase root = Detached(map.m_root);
    if (height < 0 || !root) {
        return;
    }
    Walk(visitor).Node(Place{root, height, true, nullptr, nullptr});
}

}  // namespace tarn
