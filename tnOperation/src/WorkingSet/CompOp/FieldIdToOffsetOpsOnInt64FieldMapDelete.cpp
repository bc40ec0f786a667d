// Removal of keys from the persistent B+tree map: one recursive descent to the
// leaf that holds the key, then, on the way back up, rebalancing of every node
// that fell below the minimum fill.
//
// Descent state. Every level of the recursion knows the node on the search
// path (thisNode), its neighbours on the same level (lNode, rNode, which may
// be siblings under the same parent or cousins under another one), the anchors
// that hold the separators between thisNode and each neighbour (their lowest
// common ancestor; the parent for a sibling), and the parent itself.
//
// Rebalancing rule for a node N left with fewer than 50 entries:
//   1. Pick the fuller neighbour; a tie picks the right one.
//   2. If that neighbour holds 51 or more entries, move entries from it so that
//      N ends with half the total (rounded down); the separator between them is
//      rewritten in their anchor, which may lie above the parent (a cousin).
//   3. Otherwise merge with a sibling: N into its left sibling if it has one,
//      else its right sibling into N. The node emptied by the merge is reported
//      to the caller through `deleteNode`, which removes its separator and its
//      child reference, and is handed to the runtime for deferred deletion.
// A merge always keeps the left node, so m_firstLeaf never changes here.
//
// All of this runs on a thread that holds the map's object space exclusively;
// every node that changes is marked dirty before the operation returns.

#include <algorithm>
#include <cstring>
#include <utility>

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnUtils/Assert.h"

namespace tarn {

namespace {

// Relocates a child reference as raw bytes. `src` becomes dead storage and
// `dst` is overwritten without being destroyed (a reference owns nothing).
void MoveChildRef(cref<void>& dst, cref<void>& src) {
    std::memcpy(static_cast<void*>(&dst), static_cast<const void*>(&src), sizeof(cref<void>));
}

// Number of entries of a node seen at `height`, 0 for no node.
ssize_t EntryCount(ssize_t height, void* node) {
    if (!node) {
        return 0;
    }
    if (height == 0) {
        return FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(node)->m_numKeyEntrys;
    }
    return FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(node)->m_numKeyEntrys;
}

}  // namespace

bool FieldIdToOffsetOpsOnInt64FieldMap::Delete(const FieldId& key) {
    if (m_height == -1) {
        return false;
    }
    void* deleteNode = nullptr;
    return RecursiveDelete(m_height, m_root.Get(), nullptr, nullptr, nullptr, nullptr, nullptr,
                           deleteNode, key);
}

FieldIdToOffsetOpsOnInt64FieldMap::size_type FieldIdToOffsetOpsOnInt64FieldMap::erase(
    const FieldId& key) {
    return Delete(key) ? 1 : 0;
}

void FieldIdToOffsetOpsOnInt64FieldMap::erase(iterator position) {
    // The key is copied out first: removing the entry destroys the key in the
    // leaf, and rebalancing may move the entry to another leaf.
    const_iterator at(position);
    FieldId key((*at).first);
    bool removed = Delete(key);
    TARN_ASSERT(removed);
}

bool FieldIdToOffsetOpsOnInt64FieldMap::RecursiveDelete(ssize_t height, void* thisNode, void* lNode,
                                                        void* rNode, InternalNode* lAnchor,
                                                        InternalNode* rAnchor, InternalNode* parent,
                                                        void*& deleteNode, const FieldId& key) {
    TARN_ASSERT(height >= 0);
    TARN_ASSERT(thisNode);
    TARN_ASSERT((lNode == nullptr) == (lAnchor == nullptr));
    TARN_ASSERT((rNode == nullptr) == (rAnchor == nullptr));

    if (height == 0) {
        LeafNode* leaf = FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(thisNode);
        const ssize_t nk = leaf->m_numKeyEntrys;
        TARN_ASSERT(0 <= nk && nk <= 100);
        const ssize_t deletePos = SearchLeaf(key, leaf);
        if (deletePos == -1) {
            return false;
        }
        TARN_ASSERT(0 <= deletePos && deletePos < leaf->m_numKeyEntrys);
        DestructLeafEntry(leaf, deletePos);
        ShiftLeafEntries(leaf, deletePos + 1, deletePos, nk - deletePos - 1);
        --leaf->m_numKeyEntrys;
        --m_size;
        leaf->MarkAsDirtyWithoutTrace();
        MarkAsDirtyWithoutTrace();

        deleteNode = nullptr;
        if (m_height == 0) {
            // The root leaf is never rebalanced and may become empty.
            TARN_ASSERT(!parent);
        } else if (leaf->m_numKeyEntrys < FieldIdToOffsetOpsOnInt64FieldMapMinEntries) {
            TARN_ASSERT(parent);
            LeafNode* left = FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(lNode);
            LeafNode* right = FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(rNode);
            // The neighbour to rebalance with: the fuller one, the right one
            // on a tie; it must be able to give at least one entry.
            const ssize_t s1 = EntryCount(height, lNode);
            const ssize_t s2 = EntryCount(height, rNode);
            const bool useLeft = s1 > s2;
            const ssize_t maxs = std::max(s1, s2);
            if (maxs >= 51) {
                if (useLeft) {
                    TARN_ASSERT(leaf->m_numKeyEntrys > 0);
                    BalanceLeafLeftToRight(left, leaf, lAnchor);
                } else {
                    BalanceLeafRightToLeft(leaf, right, rAnchor);
                }
            } else if (parent == lAnchor) {
                MergeLeafRightToLeft(left, leaf);
                deleteNode = thisNode;
            } else {
                TARN_ASSERT(parent == rAnchor);
                MergeLeafRightToLeft(leaf, right);
                deleteNode = rNode;
            }
        }
        return true;
    }

    // Internal node: 1. choose the child on the search path.
    InternalNode* iThisNode = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(thisNode);
    const ssize_t nk = iThisNode->m_numKeyEntrys;
    const std::pair<void*, ssize_t> r = iThisNode->FindChildGivenKey2(key);
    void* nextNode = r.first;
    TARN_ASSERT(-1 <= r.second && r.second < iThisNode->m_numKeyEntrys);
    TARN_ASSERT(nextNode);

    // 2. It must be the child that the entry index names.
    if (r.second == -1) {
        TARN_ASSERT(iThisNode->m_ptr.Get() == nextNode);
    } else {
        TARN_ASSERT(iThisNode->m_ptr.Get() != nextNode);
        TARN_ASSERT(iThisNode->GetEntry(r.second).m_ptr.Get() == nextNode);
    }

    // 3. The child's neighbours and anchors: a sibling under this node, or
    //    the nearest child of this node's own neighbour (a cousin).
    void* next_lNode = nullptr;
    InternalNode* next_lAnchor = nullptr;
    if (r.second >= 1) {
        next_lNode = iThisNode->GetEntry(r.second - 1).m_ptr.Get();
        next_lAnchor = iThisNode;
    } else if (r.second == 0) {
        next_lNode = iThisNode->m_ptr.Get();
        next_lAnchor = iThisNode;
    } else if (lNode) {
        InternalNode* ilNode = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(lNode);
        TARN_ASSERT(ilNode->m_numKeyEntrys > 0);
        next_lNode = ilNode->GetEntry(ilNode->m_numKeyEntrys - 1).m_ptr.Get();
        next_lAnchor = lAnchor;
    } else {
        TARN_ASSERT(!lAnchor);
    }

    void* next_rNode = nullptr;
    InternalNode* next_rAnchor = nullptr;
    if (r.second < nk - 1) {
        next_rNode = iThisNode->GetEntry(r.second + 1).m_ptr.Get();
        next_rAnchor = iThisNode;
    } else if (rNode) {
        next_rNode = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(rNode)->m_ptr.Get();
        next_rAnchor = rAnchor;
    } else {
        TARN_ASSERT(!rAnchor);
    }

    // 4. Descend.
    void* childDeleteNode = nullptr;
    if (!RecursiveDelete(height - 1, nextNode, next_lNode, next_rNode, next_lAnchor, next_rAnchor,
                         iThisNode, childDeleteNode, key)) {
        return false;
    }
    deleteNode = nullptr;
    if (!childDeleteNode) {
        return true;
    }

    // 5. A child was merged away: remove its separator and reference. It is
    //    either the path child (merged into its left sibling) or the path
    //    child's right sibling (merged into the path child).
    const ssize_t deletePos = childDeleteNode == nextNode ? r.second : r.second + 1;
    TARN_ASSERT(deletePos != -1);
    TARN_ASSERT(0 <= deletePos && deletePos < iThisNode->m_numKeyEntrys);
    DestructInternalEntry(iThisNode, deletePos);
    ShiftInternalEntries(iThisNode, deletePos + 1, deletePos, nk - deletePos - 1);
    --iThisNode->m_numKeyEntrys;
    iThisNode->MarkAsDirtyWithoutTrace();

    if (parent) {
        // 6. A non-root internal node that fell below the minimum.
        TARN_ASSERT(height < m_height);
        if (iThisNode->m_numKeyEntrys < FieldIdToOffsetOpsOnInt64FieldMapMinEntries) {
            InternalNode* left = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(lNode);
            InternalNode* right = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(rNode);
            // The neighbour to rebalance with: the fuller one, the right one
            // on a tie; it must be able to give at least one entry.
            const ssize_t s1 = EntryCount(height, lNode);
            const ssize_t s2 = EntryCount(height, rNode);
            const bool useLeft = s1 > s2;
            const ssize_t maxs = std::max(s1, s2);
            if (maxs >= 51) {
                if (useLeft) {
                    BalanceInternalLeftToRight(left, iThisNode, lAnchor);
                } else {
                    BalanceInternalRightToLeft(iThisNode, right, rAnchor);
                }
            } else if (parent == lAnchor) {
                MergeInternalRightToLeft(left, iThisNode, lAnchor);
                deleteNode = thisNode;
            } else {
                TARN_ASSERT(parent == rAnchor);
                MergeInternalRightToLeft(iThisNode, right, rAnchor);
                deleteNode = rNode;
            }
        }
    } else {
        // 7. The root: with no separator left, its only child takes its place.
        TARN_ASSERT(height == m_height);
        TARN_ASSERT(m_root.Get() == thisNode);
        if (iThisNode->m_numKeyEntrys == 0) {
            void* onlyChild = iThisNode->m_ptr.Get();
            if (m_height - 1 == 0) {
                m_root = FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(onlyChild);
            } else {
                m_root = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(onlyChild);
            }
            AsyncPermanentlyDeleteObject(ptr<IPersistable>(iThisNode));
            --m_height;
            MarkAsDirtyWithoutTrace();
        }
    }
    return true;
}

void FieldIdToOffsetOpsOnInt64FieldMap::BalanceLeafRightToLeft(LeafNode* left, LeafNode* right,
                                                               InternalNode* anchor) {
    TARN_ASSERT(left);
    TARN_ASSERT(right);
    TARN_ASSERT(anchor);
    TARN_ASSERT(left->m_next == right);
    TARN_ASSERT(right->m_prev == left);
    const ssize_t nL = left->m_numKeyEntrys;
    TARN_ASSERT(0 <= nL && nL < 50);
    const ssize_t nR = right->m_numKeyEntrys;
    TARN_ASSERT(50 < nR && nR <= 100);
    const ssize_t newNumLeft = (nL + nR) / 2;
    TARN_ASSERT(50 <= newNumLeft && newNumLeft <= 100);
    const ssize_t ns = newNumLeft - nL;
    TARN_ASSERT(ns > 0);
    const ssize_t newNumRight = nR - ns;
    TARN_ASSERT(50 <= newNumRight && newNumRight <= 100);

    MoveLeafEntries(right, 0, left, nL, ns);
    ShiftLeafEntries(right, ns, 0, newNumRight);
    left->m_numKeyEntrys = newNumLeft;
    right->m_numKeyEntrys = newNumRight;
    left->MarkAsDirtyWithoutTrace();
    right->MarkAsDirtyWithoutTrace();
    // The separator of the right leaf was at most its old first key, now the
    // first moved key in `left`; it becomes the right leaf's new first key.
    ReplaceKeyInAnchor(anchor, left->GetEntry(nL).first, right->GetEntry(0).first);
}

void FieldIdToOffsetOpsOnInt64FieldMap::BalanceLeafLeftToRight(LeafNode* left, LeafNode* right,
                                                               InternalNode* anchor) {
    TARN_ASSERT(left);
    TARN_ASSERT(right);
    TARN_ASSERT(anchor);
    TARN_ASSERT(left->m_next == right);
    TARN_ASSERT(right->m_prev == left);
    const ssize_t nL = left->m_numKeyEntrys;
    const ssize_t nR = right->m_numKeyEntrys;
    TARN_ASSERT(50 < nL && nL <= 100);
    TARN_ASSERT(0 <= nR && nR < 50);
    const ssize_t newNumRight = (nL + nR) / 2;
    TARN_ASSERT(50 <= newNumRight && newNumRight <= 100);
    const ssize_t ns = newNumRight - nR;
    TARN_ASSERT(ns > 0);
    const ssize_t newNumLeft = nL - ns;
    TARN_ASSERT(50 <= newNumLeft && newNumLeft <= 100);

    ShiftLeafEntries(right, 0, ns, nR);
    MoveLeafEntries(left, newNumLeft, right, 0, ns);
    left->m_numKeyEntrys = newNumLeft;
    right->m_numKeyEntrys = newNumRight;
    left->MarkAsDirtyWithoutTrace();
    right->MarkAsDirtyWithoutTrace();
    // The right leaf's old first key (now at slot ns) locates its separator,
    // which becomes the smallest key moved over from `left`.
    ReplaceKeyInAnchor(anchor, right->GetEntry(ns).first, right->GetEntry(0).first);
}

void FieldIdToOffsetOpsOnInt64FieldMap::MergeLeafRightToLeft(LeafNode* left, LeafNode* right) {
    // 1. The two leaves must be adjacent in the chain.
    TARN_ASSERT(left);
    TARN_ASSERT(right);
    TARN_ASSERT(left->m_next == right);
    TARN_ASSERT(right->m_prev == left);

    // 2. Both fit into one leaf.
    const ssize_t nL = left->m_numKeyEntrys;
    const ssize_t nR = right->m_numKeyEntrys;
    TARN_ASSERT(0 <= nL && nL <= 100);
    TARN_ASSERT(0 <= nR && nR <= 100);
    const ssize_t nTot = nL + nR;
    TARN_ASSERT(50 <= nTot && nTot <= 100);

    // 3. Append right's entries to left and unlink right from the chain.
    MoveLeafEntries(right, 0, left, nL, nR);
    left->m_numKeyEntrys = nTot;
    left->m_next = right->m_next;
    left->MarkAsDirtyWithoutTrace();

    // 4. Mend the back link of right's successor, or the map's last leaf.
    if (right->m_next) {
        TARN_ASSERT(m_lastLeaf != right);
        TARN_ASSERT(right->m_next->m_prev == right);
        LeafNode* successor = right->m_next.Get();
        successor->m_prev = left;
        successor->MarkAsDirtyWithoutTrace();
    } else {
        TARN_ASSERT(m_lastLeaf == right);
        m_lastLeaf = left;
        MarkAsDirtyWithoutTrace();
    }

    // 5. Right's entries belong to left now, so its destruction must destroy
    //    none. The runtime destroys it at the next commit.
    right->m_numKeyEntrys = 0;
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(right));
}

void FieldIdToOffsetOpsOnInt64FieldMap::BalanceInternalLeftToRight(InternalNode* left,
                                                                   InternalNode* right,
                                                                   InternalNode* anchor) {
    TARN_ASSERT(left);
    TARN_ASSERT(right);
    TARN_ASSERT(anchor);
    const ssize_t nL = left->m_numKeyEntrys;
    const ssize_t nR = right->m_numKeyEntrys;
    const ssize_t ai = anchor->FindChildIndexGivenKey(right->GetEntry(0).m_key);
    TARN_ASSERT(0 <= ai && ai < anchor->m_numKeyEntrys);
    const FieldId& anchorKey = anchor->GetEntry(ai).m_key;
    TARN_ASSERT(CompareKeys(left->GetEntry(nL-1).m_key, anchorKey) < 0);
    TARN_ASSERT(CompareKeys(anchorKey, right->GetEntry(0).m_key) < 0);

    TARN_ASSERT(50 < nL && nL <= 100);
    TARN_ASSERT(1 <= nR && nR < 50);
    const ssize_t newNumRight = (nL + nR) / 2;
    TARN_ASSERT(50 <= newNumRight && newNumRight <= 100);
    const ssize_t ns = newNumRight - nR;
    TARN_ASSERT(ns > 0);
    const ssize_t newNumLeft = nL - ns;
    TARN_ASSERT(50 <= newNumLeft && newNumLeft <= 100);

    // 1. Open ns slots at the front of right.
    ShiftInternalEntries(right, 0, ns, nR);
    // 2. The separator comes down as right's entry ns-1, over right's old
    //    leftmost child.
    InternalKeyEntry& down = right->GetEntry(ns - 1);
    FieldIdToOffsetOpsOnInt64FieldMapMoveKey(down.m_key, anchor->GetEntry(ai).m_key);
    MoveChildRef(down.m_ptr, right->m_ptr);
    // 3. Left's last ns-1 entries become right's entries 0..ns-2.
    MoveInternalEntries(left, newNumLeft + 1, right, 0, ns - 1);
    // 4. Left's entry newNumLeft goes up: its key becomes the separator, its
    //    child right's leftmost child.
    InternalKeyEntry& up = left->GetEntry(newNumLeft);
    FieldIdToOffsetOpsOnInt64FieldMapMoveKey(anchor->GetEntry(ai).m_key, up.m_key);
    MoveChildRef(right->m_ptr, up.m_ptr);
    // 5. Counts and dirty marks.
    left->m_numKeyEntrys = newNumLeft;
    right->m_numKeyEntrys = newNumRight;
    anchor->MarkAsDirtyWithoutTrace();
    left->MarkAsDirtyWithoutTrace();
    right->MarkAsDirtyWithoutTrace();
}

void FieldIdToOffsetOpsOnInt64FieldMap::BalanceInternalRightToLeft(InternalNode* left,
                                                                   InternalNode* right,
                                                                   InternalNode* anchor) {
    TARN_ASSERT(left);
    TARN_ASSERT(right);
    TARN_ASSERT(anchor);
    const ssize_t nL = left->m_numKeyEntrys;
    const ssize_t nR = right->m_numKeyEntrys;
    const ssize_t ai = anchor->FindChildIndexGivenKey(right->GetEntry(0).m_key);
    TARN_ASSERT(0 <= ai && ai < anchor->m_numKeyEntrys);
    const FieldId& anchorKey = anchor->GetEntry(ai).m_key;
    if (nL >= 1) {
        TARN_ASSERT(CompareKeys(left->GetEntry(nL-1).m_key, anchorKey) < 0);
    }
    TARN_ASSERT(CompareKeys(anchorKey, right->GetEntry(0).m_key) < 0);

    TARN_ASSERT(0 <= nL && nL < 50);
    TARN_ASSERT(50 < nR && nR <= 100);
    const ssize_t newNumLeft = (nL + nR) / 2;
    TARN_ASSERT(50 <= newNumLeft && newNumLeft <= 100);
    const ssize_t ns = newNumLeft - nL;
    TARN_ASSERT(ns > 0);
    const ssize_t newNumRight = nR - ns;
    TARN_ASSERT(50 <= newNumRight && newNumRight <= 100);

    // 1. The separator comes down as left's entry nL, over right's leftmost
    //    child.
    InternalKeyEntry& down = left->GetEntry(nL);
    FieldIdToOffsetOpsOnInt64FieldMapMoveKey(down.m_key, anchor->GetEntry(ai).m_key);
    MoveChildRef(down.m_ptr, right->m_ptr);
    // 2. Right's first ns-1 entries follow it.
    MoveInternalEntries(right, 0, left, nL + 1, ns - 1);
    // 3. Right's entry ns-1 goes up: its key becomes the separator, its child
    //    right's leftmost child.
    InternalKeyEntry& up = right->GetEntry(ns - 1);
    FieldIdToOffsetOpsOnInt64FieldMapMoveKey(anchor->GetEntry(ai).m_key, up.m_key);
    MoveChildRef(right->m_ptr, up.m_ptr);
    // 4. Close the gap at the front of right.
    ShiftInternalEntries(right, ns, 0, newNumRight);
    // 5. Counts and dirty marks.
    left->m_numKeyEntrys = newNumLeft;
    right->m_numKeyEntrys = newNumRight;
    anchor->MarkAsDirtyWithoutTrace();
    left->MarkAsDirtyWithoutTrace();
    right->MarkAsDirtyWithoutTrace();
}

void FieldIdToOffsetOpsOnInt64FieldMap::MergeInternalRightToLeft(InternalNode* left,
                                                                 InternalNode* right,
                                                                 InternalNode* anchor) {
    TARN_ASSERT(left);
    TARN_ASSERT(right);
    TARN_ASSERT(anchor);
    const ssize_t nL = left->m_numKeyEntrys;
    const ssize_t nR = right->m_numKeyEntrys;
    const ssize_t ai = anchor->FindChildIndexGivenKey(right->GetEntry(0).m_key);
    TARN_ASSERT(0 <= ai && ai < anchor->m_numKeyEntrys);
    const FieldId& anchorKey = anchor->GetEntry(ai).m_key;
    if (nL >= 1) {
        TARN_ASSERT(CompareKeys(left->GetEntry(nL-1).m_key, anchorKey) < 0);
    }
    TARN_ASSERT(CompareKeys(anchorKey, right->GetEntry(0).m_key) < 0);

    TARN_ASSERT(0 <= nL && nL < 100);
    TARN_ASSERT(1 <= nR && nR < 100);
    const ssize_t nTot = nL + nR + 1;
    TARN_ASSERT(50 <= nTot && nTot <= 100);

    // The separator is copied down (the anchor keeps its own until the parent
    // removes that entry), over right's leftmost child; right's entries follow.
    InternalKeyEntry& down = left->GetEntry(nL);
    FieldIdToOffsetOpsOnInt64FieldMapCopyConstructKey(down.m_key, anchorKey);
    MoveChildRef(down.m_ptr, right->m_ptr);
    MoveInternalEntries(right, 0, left, nL + 1, nR);
    left->m_numKeyEntrys = nTot;
    left->MarkAsDirtyWithoutTrace();

    // Right's children belong to left now; only right itself goes.
    right->m_numKeyEntrys = 0;
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(right));
}

void FieldIdToOffsetOpsOnInt64FieldMap::ReplaceKeyInAnchor(InternalNode* node,
                                                           const FieldId& oldKey,
                                                           const FieldId& newKey) {
    TARN_ASSERT(node);
    TARN_ASSERT(CompareKeys(oldKey,newKey) != 0);
    const ssize_t i = node->FindChildIndexGivenKey(oldKey);
    TARN_ASSERT(0 <= i && i < node->m_numKeyEntrys);
    node->GetEntry(i).m_key = newKey;
    node->MarkAsDirtyWithoutTrace();
    if (i > 0) {
        TARN_ASSERT(CompareKeys(node->GetEntry(i-1).m_key, newKey) < 0);
    }
    if (i + 1 < node->m_numKeyEntrys) {
        TARN_ASSERT(CompareKeys(node->GetEntry(i+1).m_key, newKey) > 0);
    }
}

}  // namespace tarn
