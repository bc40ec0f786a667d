#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapCheck.h"

#include <unordered_set>

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
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

class Checker {
public:
    explicit Checker(TreeCheckResult& result) : m_result(result) {}

    void Run(const Map& map) {
        CheckHeader(map);
        if (map.m_height < 0 || !map.m_root) {
            return;
        }
        Node(map.m_height, map.m_root, true, nullptr, nullptr);
        CheckChain(map);
        if (m_result.entries != map.m_size) {  // invariant 7
            Problem("the map's size is " + std::to_string(map.m_size) + " but its leaves hold " +
                    std::to_string(m_result.entries) + " entries");
        }
    }

private:
    void Problem(std::string text) {
        if (m_result.numProblems++ < TreeCheckResult::kMaxProblems) {
            m_result.problems.push_back(std::move(text));
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

    // Loads the node of `ref` as the class `rc`; null (with a problem) when it
    // cannot be loaded or has another class.
    void* Load(const prefbase& ref, const ReflectedClass& rc, const char* what) {
        if (!ref) {
            Problem(std::string("a missing reference where a ") + what + " should be");
            return nullptr;
        }
        try {
            return ref.Resolve(&rc).m_self;
        } catch (const RuntimeError& e) {
            Problem(std::string(what) + " " + Name(ref) + ": " + e.what());
            return nullptr;
        }
    }

    // Invariants 3, 4 and 5 for the subtree of `ref` at `height`, whose keys
    // must lie in [lo, hi) (null: unbounded).
    void Node(ssize_t height, const prefbase& ref, bool isRoot, const FieldId* lo,
              const FieldId* hi) {
        if (ref && !m_seen.insert(ref.m_oid.value_).second) {
            Problem("node " + Name(ref) + " is reached twice");
            return;
        }
        if (height == 0) {
            Leaf(ref, isRoot, lo, hi);
            return;
        }
        auto* node = static_cast<InternalNode*>(
            Load(ref, GetReflectedClass<InternalNode>(), "internal node"));
        if (node == nullptr) {
            return;
        }
        ++m_result.internalNodes;
        const ssize_t n = node->m_numKeyEntrys;
        const std::string name = "internal node " + Name(ref);
        if (!CheckFill(name, n, isRoot ? 1 : 50)) {
            return;
        }
        for (ssize_t i = 0; i < n; ++i) {
            CheckKey(name, i, node->GetEntry(i).m_key, i > 0 ? &node->GetEntry(i - 1).m_key : lo,
                     hi);
        }
        Node(height - 1, node->m_ptr, false, lo, &node->GetEntry(0).m_key);
        for (ssize_t i = 0; i < n; ++i) {
            Node(height - 1, node->GetEntry(i).m_ptr, false, &node->GetEntry(i).m_key,
                 i + 1 < n ? &node->GetEntry(i + 1).m_key : hi);
        }
    }

    void Leaf(const prefbase& ref, bool isRoot, const FieldId* lo, const FieldId* hi) {
        auto* leaf = static_cast<LeafNode*>(Load(ref, GetReflectedClass<LeafNode>(), "leaf"));
        if (leaf == nullptr) {
            return;
        }
        ++m_result.leaves;
        const ssize_t n = leaf->m_numKeyEntrys;
        const std::string name = "leaf " + Name(ref);
        if (!CheckFill(name, n, isRoot ? 0 : 50)) {
            return;
        }
        m_result.entries += n;
        for (ssize_t i = 0; i < n; ++i) {
            CheckKey(name, i, leaf->GetEntry(i).first, i > 0 ? &leaf->GetEntry(i - 1).first : lo,
                     hi);
        }
        m_leaves.push_back({leaf, ref.m_oid.value_});
    }

    bool CheckFill(const std::string& name, ssize_t n, ssize_t least) {
        if (n < least || n > 100) {
            Problem(name + " holds " + std::to_string(n) + " entries, not " +
                    std::to_string(least) + "..100");
            return n >= 0 && n <= 100;
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
    void CheckChain(const Map& map) {
        if (m_leaves.empty()) {
            return;
        }
        if (map.m_firstLeaf.m_oid.value_ != m_leaves.front().oid) {
            Problem("the first leaf is " + Name(map.m_firstLeaf) + ", the tree's first leaf is #" +
                    std::to_string(m_leaves.front().oid));
        }
        if (map.m_lastLeaf.m_oid.value_ != m_leaves.back().oid) {
            Problem("the last leaf is " + Name(map.m_lastLeaf) + ", the tree's last leaf is #" +
                    std::to_string(m_leaves.back().oid));
        }
        for (std::size_t i = 0; i < m_leaves.size(); ++i) {
            const LeafNode* leaf = m_leaves[i].leaf;
            const uint64 prev = i > 0 ? m_leaves[i - 1].oid : 0;
            const uint64 next = i + 1 < m_leaves.size() ? m_leaves[i + 1].oid : 0;
            const std::string name = "leaf #" + std::to_string(m_leaves[i].oid);
            if (leaf->m_prev.m_oid.value_ != prev) {
                Problem(name + " links back to " + Name(leaf->m_prev) + ", not #" +
                        std::to_string(prev));
            }
            if (leaf->m_next.m_oid.value_ != next) {
                Problem(name + " links on to " + Name(leaf->m_next) + ", not #" +
                        std::to_string(next));
            }
            if (i > 0) {
                const LeafNode* before = m_leaves[i - 1].leaf;
                if (before->m_numKeyEntrys > 0 && leaf->m_numKeyEntrys > 0 &&
                    CompareKeys(before->GetEntry(before->m_numKeyEntrys - 1).first,
                                leaf->GetEntry(0).first) >= 0) {
                    Problem(name + " starts at " + ToString(leaf->GetEntry(0).first) +
                            ", not above the previous leaf's last key");
                }
            }
        }
    }

    struct LeafAt {
        const LeafNode* leaf;
        uint64 oid;
    };

    TreeCheckResult& m_result;
    std::unordered_set<uint64> m_seen;
    std::vector<LeafAt> m_leaves;  // in tree order
};

}  // namespace

TreeCheckResult FieldIdToOffsetOpsOnInt64FieldMapCheck(
    const FieldIdToOffsetOpsOnInt64FieldMap& map) {
    TreeCheckResult result;
    Checker(result).Run(map);
    return result;
}

}  // namespace tarn
