#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapCheck.h"

#include <optional>
#include <utility>

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodeRules.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapWalk.h"
#include "tnUtils/RuntimeError.h"
#include "tnUtils/xostream.h"

namespace tarn {

namespace {

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using LeafNode = Map::LeafNode;
using InternalNode = Map::InternalNode;
using TreeCheckResult = FieldIdToOffsetOpsOnInt64FieldMapCheckResult;

std::string Name(const prefbase& ref) {
    return ToString(ref.m_oid);
}

std::string Name(uint64 oid) {
    return "#" + std::to_string(oid);
}

class Checker final : public FieldIdToOffsetOpsOnInt64FieldMapVisitor {
public:
    Checker(TreeCheckResult& result, const std::function<void()>& betweenNodes)
        : m_result(result), m_betweenNodes(betweenNodes) {}

    // Everything needed of the header is copied before the first node is
    // loaded: the hook between nodes may release the header too.
    void Run(const Map& map) {
        CheckHeader(map);
        const ssize_t size = map.m_size;
        m_firstLeaf = map.m_firstLeaf.m_oid.value_;
        m_lastLeaf = map.m_lastLeaf.m_oid.value_;
        if (map.m_height < 0 || !map.m_root) {
            return;
        }
        WalkFieldIdToOffsetOpsOnInt64FieldMap(map, *this);
        CheckChain();
        if (m_result.entries != size) {  // invariant 7
            Problem("the map's size is " + std::to_string(size) + " but its leaves hold " +
                    std::to_string(m_result.entries) + " entries");
        }
    }

private:
    void Problem(std::string text) {
        if (m_result.numProblems++ < TreeCheckResult::kMaxProblems) {
            m_result.problems.push_back(std::move(text));
        }
    }

    void BetweenNodes() override {
        if (m_betweenNodes) {
            m_betweenNodes();
        }
    }

    // Invariants 1 and 2.
    void CheckHeader(const Map& map) {
        if (map.m_height < -1) {
            Problem("the map's height is " + std::to_string(map.m_height));
        }
        if ((map.m_height == -1) != !map.m_root) {
            Problem("the map's height is " + std::to_string(map.m_height) + " but it has " +
                    (map.m_root ? "a root " + Name(map.m_root) : std::string("no root")));
        }
        if (map.m_height == -1 && !map.m_root) {
            if (map.m_firstLeaf || map.m_lastLeaf || map.m_size != 0) {
                Problem("an empty map (no root) has a first leaf " + Name(map.m_firstLeaf) +
                        ", a last leaf " + Name(map.m_lastLeaf) + " and size " +
                        std::to_string(map.m_size));
            }
        }
        if (map.m_height == 0 && (map.m_firstLeaf.m_oid != map.m_root.m_oid ||
                                  map.m_lastLeaf.m_oid != map.m_root.m_oid)) {
            Problem("the root leaf " + Name(map.m_root) + " is not both the first leaf (" +
                    Name(map.m_firstLeaf) + ") and the last leaf (" + Name(map.m_lastLeaf) + ")");
        }
    }

    // Invariant 3: a node that cannot be loaded as its level needs.
    void Unloadable(const Place& place, const std::string& error) override {
        const std::string what = place.level == 0 ? "leaf" : "internal node";
        if (error.empty()) {
            Problem("a missing reference where a " + what + " should be");
        } else {
            Problem(what + " " + Name(place.ref) + ": " + error);
        }
    }

    void ReachedTwice(const Place& place) override {
        Problem("node " + Name(place.ref) + " is reached twice");
    }

    // Invariants 4 and 5 for one internal node; false when its subtrees
    // cannot be checked.
    bool Internal(const Place& place, const InternalNode& node) override {
        ++m_result.internalNodes;
        const ssize_t n = node.m_numKeyEntrys;
        const std::string name = "internal node " + Name(place.ref);
        if (!CheckFill(name, n, place) || n == 0) {
            return false;
        }
        for (ssize_t i = 0; i < n; ++i) {
            CheckKey(name, i, node.GetEntry(i).m_key,
                     i > 0 ? &node.GetEntry(i - 1).m_key : place.lo, place.hi);
        }
        return true;
    }

    void Leaf(const Place& place, const LeafNode& leaf) override {
        ++m_result.leaves;
        const ssize_t n = leaf.m_numKeyEntrys;
        const std::string name = "leaf " + Name(place.ref);
        if (!CheckFill(name, n, place)) {
            return;
        }
        m_result.entries += n;
        for (ssize_t i = 0; i < n; ++i) {
            CheckKey(name, i, leaf.GetEntry(i).first,
                     i > 0 ? &leaf.GetEntry(i - 1).first : place.lo, place.hi);
        }
        LeafAt at{place.ref.m_oid.value_, leaf.m_prev.m_oid.value_, leaf.m_next.m_oid.value_,
                  std::nullopt};
        if (n > 0) {
            at.keys.emplace(leaf.GetEntry(0).first, leaf.GetEntry(n - 1).first);
        }
        m_leaves.push_back(std::move(at));
    }

    // Whether the node's entries can be read: within the most any node holds.
    bool CheckFill(const std::string& name, ssize_t n, const Place& place) {
        const FieldIdToOffsetOpsOnInt64FieldMapNodeRule rule =
            FieldIdToOffsetOpsOnInt64FieldMapRuleAt(place.level, place.isRoot);
        if (!rule.AllowsCount(n)) {
            Problem(name + " holds " + rule.CountProblem(n));
            return n >= 0 && n <= rule.maxEntries;
        }
        return true;
    }

    // Key i of a node must be above `below` (the previous key, or the lower
    // separator, which it may equal) and under `above`.
    void CheckKey(const std::string& name, ssize_t i, const FieldId& key, const FieldId* below,
                  const FieldId* above) {
        const bool firstInNode = below != nullptr && i == 0;
        if (below != nullptr && CompareKeys(*below, key) > (firstInNode ? 0 : -1)) {
            Problem(name + ": key " + std::to_string(i) + " " + ToString(key) +
                    (firstInNode ? " is below the separator " : " does not follow ") +
                    ToString(*below));
        }
        if (above != nullptr && CompareKeys(key, *above) >= 0) {
            Problem(name + ": key " + std::to_string(i) + " " + ToString(key) +
                    " is not below the separator " + ToString(*above));
        }
    }

    // Invariant 6, against the leaves in the order the tree holds them.
    void CheckChain() {
        if (m_leaves.empty()) {
            return;
        }
        if (m_firstLeaf != m_leaves.front().oid) {
            Problem("the first leaf is " + Name(m_firstLeaf) + ", the tree's first leaf is " +
                    Name(m_leaves.front().oid));
        }
        if (m_lastLeaf != m_leaves.back().oid) {
            Problem("the last leaf is " + Name(m_lastLeaf) + ", the tree's last leaf is " +
                    Name(m_leaves.back().oid));
        }
        for (std::size_t i = 0; i < m_leaves.size(); ++i) {
            const LeafAt& leaf = m_leaves[i];
            const uint64 prev = i > 0 ? m_leaves[i - 1].oid : 0;
            const uint64 next = i + 1 < m_leaves.size() ? m_leaves[i + 1].oid : 0;
            const std::string name = "leaf " + Name(leaf.oid);
            if (leaf.prev != prev) {
                Problem(name + " links back to " + Name(leaf.prev) + ", not " + Name(prev));
            }
            if (leaf.next != next) {
                Problem(name + " links on to " + Name(leaf.next) + ", not " + Name(next));
            }
            if (i > 0) {
                const LeafAt& before = m_leaves[i - 1];
                if (before.keys && leaf.keys &&
                    CompareKeys(before.keys->second, leaf.keys->first) >= 0) {
                    Problem(name + " starts at " + ToString(leaf.keys->first) +
                            ", not above the previous leaf's last key");
                }
            }
        }
    }

    // What the chain check needs of a leaf.
    struct LeafAt {
        uint64 oid;
        uint64 prev;  // the identities its links hold (0: none)
        uint64 next;
        std::optional<std::pair<FieldId, FieldId>> keys;  // its first and last, unless empty
    };

    TreeCheckResult& m_result;
    const std::function<void()>& m_betweenNodes;
    uint64 m_firstLeaf = 0;  // the header's links
    uint64 m_lastLeaf = 0;
    std::vector<LeafAt> m_leaves;  // in tree order
};

}  // namespace

TreeCheckResult FieldIdToOffsetOpsOnInt64FieldMapCheck(const FieldIdToOffsetOpsOnInt64FieldMap& map,
                                                       const std::function<void()>& betweenNodes) {
    TreeCheckResult result;
    Checker(result, betweenNodes).Run(map);
    return result;
}

}  // namespace tarn
