// Deletion from the persistent B+tree map: exact tree shapes for every
// borrow, merge and collapse, random walks against std::map, and deleting
// whole trees in several orders. Every tree that a test changes goes through
// the shared invariant checker, and every node handed to deletion is followed
// through the runtime until the commit that destroys it.
//
// Shapes are built by ascending insertion, which leaves every leaf but the
// last with 50 entries (the last holds 51..100) and, once the root has split,
// internal nodes of 50 keys. Keys are numbered; the shape tests use multiples
// of 1000 so that further keys fit between any two.

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <numeric>
#include <random>
#include <unordered_set>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/RuntimeCallLog.h"

namespace tarn {
namespace {

using ::tarn::testing::CheckBTree;
using ::tarn::testing::LeafCounts;
using ::tarn::testing::MakeKey;
using ::tarn::testing::MakePayload;
using ::tarn::testing::MakeSite;

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
using Internal = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
using Keys = std::vector<uint64>;

constexpr uint64 kGap = 1000;

// The number of a key made by MakeKey (its 8 path bytes, big-endian).
uint64 KeyNum(const FieldId& k) {
    uint64 v = 0;
    for (ssize_t i = 0; i < 8; ++i) {
        v = (v << 8) | k.path.begin()[i];
    }
    return v;
}

// Shape keys: K(i) is key number i * 1000.
FieldId K(uint64 i) {
    return MakeKey(i * kGap);
}

// Key numbers K(lo) .. K(hi).
Keys Span(uint64 lo, uint64 hi) {
    Keys out;
    for (uint64 i = lo; i <= hi; ++i) {
        out.push_back(i * kGap);
    }
    return out;
}

Keys Cat(Keys a, const Keys& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

Keys Without(Keys a, uint64 num) {
    a.erase(std::remove(a.begin(), a.end(), num), a.end());
    return a;
}

Keys Slice(const Keys& a, std::size_t from, std::size_t to) {
    return Keys(a.begin() + static_cast<std::ptrdiff_t>(from),
                a.begin() + static_cast<std::ptrdiff_t>(to));
}

Keys LeafKeys(const Leaf* leaf) {
    Keys out;
    for (ssize_t i = 0; i < leaf->m_numKeyEntrys; ++i) {
        out.push_back(KeyNum(leaf->GetEntry(i).first));
    }
    return out;
}

Keys Separators(const Internal* node) {
    Keys out;
    for (ssize_t i = 0; i < node->m_numKeyEntrys; ++i) {
        out.push_back(KeyNum(node->GetEntry(i).m_key));
    }
    return out;
}

// The children of an internal node, leftmost (m_ptr) first.
std::vector<void*> Children(const Internal* node) {
    std::vector<void*> out{node->m_ptr.Get()};
    for (ssize_t i = 0; i < node->m_numKeyEntrys; ++i) {
        out.push_back(node->GetEntry(i).m_ptr.Get());
    }
    return out;
}

Internal* AsInternal(void* n) {
    return FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(n);
}
Leaf* AsLeaf(void* n) {
    return FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(n);
}

template <typename Node>
OID IdOf(const Node* n) {
    return n->GetPersistObjState().m_oid;
}

// Every node of the tree, for checking that dropped nodes are unreachable.
void CollectNodes(ssize_t height, void* node, std::unordered_set<const void*>& out) {
    out.insert(node);
    if (height > 0) {
        for (void* child : Children(AsInternal(node))) {
            CollectNodes(height - 1, child, out);
        }
    }
}

class BTreeDelete : public ::testing::Test {
protected:
    BTreeDelete() : m_guard(m_space, LockMode::Exclusive), m_map(DollarNew(new Map())) {
        m_space.Commit();
        Log() = RuntimeCallLog();
    }

    static RuntimeCallLog& Log() { return GetThreadRuntimeCallLog(); }
    Map& map() { return *m_map; }

    // Keys K(1) .. K(n) in ascending order, each with its number as payload;
    // then a commit, so that the deletion under test starts from clean nodes
    // that all have images in the store.
    void FillAscending(uint64 n) {
        for (uint64 i = 1; i <= n; ++i) {
            Insert(i * kGap);
        }
        Commit();
    }

    void Insert(uint64 num) {
        ASSERT_TRUE(map().Insert(MakeKey(num), MakePayload(static_cast<int64>(num)), false));
    }

    void Commit() {
        m_space.Commit();
        Log() = RuntimeCallLog();
    }

    Internal* Root() { return AsInternal(map().m_root.Get()); }

    // Leaf i of the chain, counting from 0.
    Leaf* LeafAt(std::size_t i) {
        Leaf* leaf = map().m_firstLeaf.Get();
        while (i-- > 0) {
            leaf = leaf->m_next.Get();
        }
        return leaf;
    }

    // Every entry still carries the payload written with its key.
    void ExpectPayloadsFollowKeys() {
        for (Leaf* leaf = map().m_firstLeaf.Get(); leaf; leaf = leaf->m_next.Get()) {
            for (ssize_t i = 0; i < leaf->m_numKeyEntrys; ++i) {
                const auto& e = leaf->GetEntry(i);
                auto site = e.second.m_map.find(MakeSite(1));
                ASSERT_NE(site, e.second.m_map.end());
                EXPECT_EQ(site->second.o, static_cast<int64>(KeyNum(e.first)));
            }
        }
    }

    // The nodes `ids` (in hand-over order) and no others were handed to
    // deletion, each once, and are still resident with no entries; the next
    // commit destroys them and removes their images.
    void ExpectDroppedUntilCommit(const std::vector<OID>& ids) {
        EXPECT_EQ(Log().numAsyncDeleteObject, static_cast<int64>(ids.size()));
        EXPECT_EQ(Log().numAsyncDeleteSubTree, 0);
        EXPECT_EQ(m_space.NumQueuedDeletions(), static_cast<ssize_t>(ids.size()));
        if (!ids.empty()) {
            ASSERT_NE(Log().lastDeleted.m_self, nullptr);
            EXPECT_EQ(Log().lastDeleted->GetPersistObjState().m_oid, ids.back());
        }
        for (const OID& id : ids) {
            EXPECT_TRUE(m_space.IsResident(id));
            EXPECT_TRUE(m_space.GetStore().Load(id.value_).has_value());
        }
        const int64 deletedBefore = m_space.Stats().numDeleted;
        m_space.Commit();
        EXPECT_EQ(m_space.Stats().numDeleted - deletedBefore, static_cast<int64>(ids.size()));
        EXPECT_EQ(m_space.NumQueuedDeletions(), 0);
        for (const OID& id : ids) {
            EXPECT_FALSE(m_space.IsResident(id));
            EXPECT_FALSE(m_space.GetStore().Load(id.value_).has_value());
        }
        Log() = RuntimeCallLog();
    }

    CSpace m_space;
    CSpaceGuard m_guard;
    Map* m_map;
};

// ---- Removing keys without rebalancing.

TEST_F(BTreeDelete, MapWithoutRootReportsAbsentAndStaysUnchanged) {
    EXPECT_FALSE(map().Delete(K(1)));
    EXPECT_EQ(map().erase(K(1)), 0);
    EXPECT_EQ(map().m_height, -1);
    EXPECT_FALSE(map().m_root);
    EXPECT_EQ(Log().numMarkPersistentAsDirty, 0);
    EXPECT_EQ(m_space.NumDirty(), 0);
}

TEST_F(BTreeDelete, LastKeyLeavesEmptyRootLeaf) {
    Insert(5);
    Commit();
    Leaf* root = AsLeaf(map().m_root.Get());
    EXPECT_TRUE(map().Delete(MakeKey(5)));
    EXPECT_EQ(map().m_height, 0);
    EXPECT_EQ(map().m_size, 0);
    EXPECT_EQ(map().m_root.Get(), root);
    EXPECT_EQ(map().m_firstLeaf.Get(), root);
    EXPECT_EQ(map().m_lastLeaf.Get(), root);
    EXPECT_EQ(root->m_numKeyEntrys, 0);
    EXPECT_TRUE(map().begin() == map().end());
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectDroppedUntilCommit({});

    EXPECT_FALSE(map().Delete(MakeKey(5)));
    EXPECT_EQ(map().m_height, 0);
}

TEST_F(BTreeDelete, AbsentKeyChangesNothing) {
    FillAscending(5101);
    EXPECT_FALSE(map().Delete(MakeKey(2550 * kGap + 1)));
    EXPECT_FALSE(map().Delete(MakeKey(0)));
    EXPECT_FALSE(map().Delete(MakeKey(5102 * kGap)));
    EXPECT_EQ(map().m_size, 5101);
    EXPECT_EQ(Log().numMarkPersistentAsDirty, 0);
    EXPECT_EQ(m_space.NumDirty(), 0);
    ExpectDroppedUntilCommit({});
}

TEST_F(BTreeDelete, SmallestKeyOfFullEnoughLeafKeepsSeparators) {
    FillAscending(201);
    for (uint64 i = 101; i <= 105; ++i) {
        Insert(i * kGap + 500);
    }
    Commit();
    EXPECT_TRUE(map().Delete(K(101)));
    EXPECT_EQ(Separators(Root()), (Keys{51 * kGap, 101 * kGap, 151 * kGap}));
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 50, 54, 51}));
    EXPECT_EQ(LeafKeys(LeafAt(2)).front(), 101 * kGap + 500);
    EXPECT_EQ(CheckBTree(map()), "");
    // Only the leaf and the header changed.
    EXPECT_EQ(m_space.NumDirty(), 2);
    ExpectDroppedUntilCommit({});
}

TEST_F(BTreeDelete, EraseByIteratorAndByKey) {
    FillAscending(150);
    auto it = map().find(K(60));
    ASSERT_TRUE(it != map().end());
    map().erase(it);
    EXPECT_EQ(map().erase(K(61)), 1);
    EXPECT_EQ(map().erase(K(61)), 0);
    EXPECT_EQ(map().m_size, 148);
    EXPECT_TRUE(map().find(K(60)) == map().end());
    EXPECT_EQ(CheckBTree(map()), "");
}

// ---- Leaf merges.

TEST_F(BTreeDelete, RightLeafMergesIntoLeftAndRootCollapses) {
    FillAscending(101);
    Leaf* left = LeafAt(0);
    Leaf* right = LeafAt(1);
    const OID rootId = IdOf(Root());
    const OID rightId = IdOf(right);
    EXPECT_TRUE(map().Delete(K(101)));  // the right leaf keeps 50
    EXPECT_TRUE(map().Delete(K(100)));  // 49: merged into its left sibling

    EXPECT_EQ(map().m_height, 0);
    EXPECT_EQ(map().m_root.Get(), left);
    EXPECT_EQ(map().m_firstLeaf.Get(), left);
    EXPECT_EQ(map().m_lastLeaf.Get(), left);
    EXPECT_FALSE(left->m_next);
    EXPECT_FALSE(left->m_prev);
    EXPECT_EQ(LeafKeys(left), Span(1, 99));
    EXPECT_EQ(right->m_numKeyEntrys, 0);
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
    ExpectDroppedUntilCommit({rightId, rootId});
    EXPECT_EQ(CheckBTree(map()), "");
}

TEST_F(BTreeDelete, UnderfullLeftmostLeafAbsorbsRightSiblingAndRootCollapses) {
    FillAscending(101);
    Leaf* left = LeafAt(0);
    const OID rootId = IdOf(Root());
    const OID rightId = IdOf(LeafAt(1));
    EXPECT_TRUE(map().Delete(K(101)));
    EXPECT_TRUE(map().Delete(K(1)));

    EXPECT_EQ(map().m_height, 0);
    EXPECT_EQ(map().m_root.Get(), left);
    EXPECT_EQ(map().m_lastLeaf.Get(), left);
    EXPECT_EQ(LeafKeys(left), Span(2, 100));
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectDroppedUntilCommit({rightId, rootId});
}

TEST_F(BTreeDelete, BothNeighboursAt50MergeIntoLeftSibling) {
    FillAscending(201);
    Leaf* l0 = LeafAt(0);
    Leaf* l2 = LeafAt(2);
    const OID l1Id = IdOf(LeafAt(1));
    EXPECT_TRUE(map().Delete(K(75)));

    EXPECT_EQ(map().m_height, 1);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{99, 50, 51}));
    EXPECT_EQ(LeafKeys(l0), Without(Span(1, 100), 75 * kGap));
    EXPECT_EQ(Separators(Root()), (Keys{101 * kGap, 151 * kGap}));
    EXPECT_TRUE(l0->m_next == l2);
    EXPECT_TRUE(l2->m_prev == l0);
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
    ExpectDroppedUntilCommit({l1Id});
}

TEST_F(BTreeDelete, MergingTheLastLeafMovesLastLeaf) {
    FillAscending(201);
    Leaf* l2 = LeafAt(2);
    const OID l3Id = IdOf(LeafAt(3));
    EXPECT_TRUE(map().Delete(K(201)));
    EXPECT_TRUE(map().Delete(K(200)));  // 49 entries, left sibling 50, no right
    EXPECT_EQ(map().m_lastLeaf.Get(), l2);
    EXPECT_FALSE(l2->m_next);
    EXPECT_EQ(LeafKeys(l2), Span(101, 199));
    EXPECT_EQ(Separators(Root()), (Keys{51 * kGap, 101 * kGap}));
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectDroppedUntilCommit({l3Id});
}

// ---- Leaf balancing.

TEST_F(BTreeDelete, BorrowsOneFromLeftNeighbourOf51) {
    FillAscending(151);
    Insert(60 * kGap + 500);  // the middle leaf holds 51
    Commit();
    Leaf* l1 = LeafAt(1);
    Leaf* l2 = LeafAt(2);
    EXPECT_TRUE(map().Delete(K(151)));
    EXPECT_TRUE(map().Delete(K(150)));

    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 50, 50}));
    EXPECT_EQ(LeafKeys(l1), Cat(Cat(Span(51, 60), {60 * kGap + 500}), Span(61, 99)));
    EXPECT_EQ(LeafKeys(l2), Span(100, 149));
    // The separator is now the leaf's new first key.
    EXPECT_EQ(Separators(Root()), (Keys{51 * kGap, 100 * kGap}));
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
    ExpectDroppedUntilCommit({});
}

TEST_F(BTreeDelete, TakesQuarterOfFullRightNeighbour) {
    FillAscending(200);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 50, 100}));
    EXPECT_TRUE(map().Delete(K(75)));

    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 74, 75}));
    EXPECT_EQ(LeafKeys(LeafAt(1)), Cat(Without(Span(51, 100), 75 * kGap), Span(101, 125)));
    EXPECT_EQ(LeafKeys(LeafAt(2)), Span(126, 200));
    EXPECT_EQ(Separators(Root()), (Keys{51 * kGap, 126 * kGap}));
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
    // Both leaves, the header and the anchor changed.
    EXPECT_EQ(m_space.NumDirty(), 4);
    ExpectDroppedUntilCommit({});
}

TEST_F(BTreeDelete, TieBetweenNeighboursGoesRight) {
    FillAscending(201);
    for (uint64 i = 1; i <= 10; ++i) {
        Insert(i * kGap + 500);
        Insert((100 + i) * kGap + 500);
    }
    Commit();
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{60, 50, 60, 51}));
    const Keys l0 = LeafKeys(LeafAt(0));
    const Keys l2 = LeafKeys(LeafAt(2));
    EXPECT_TRUE(map().Delete(K(75)));

    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{60, 54, 55, 51}));
    EXPECT_EQ(LeafKeys(LeafAt(0)), l0);
    EXPECT_EQ(LeafKeys(LeafAt(1)), Cat(Without(Span(51, 100), 75 * kGap), Slice(l2, 0, 5)));
    EXPECT_EQ(LeafKeys(LeafAt(2)), Slice(l2, 5, 60));
    EXPECT_EQ(Separators(Root()), (Keys{51 * kGap, l2[5], 151 * kGap}));
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
}

// Height 2 built from 5101 ascending keys: a root with one key over two
// internal nodes of 50 keys, each over 51 leaves (leaves 0..50 and 51..101).
TEST_F(BTreeDelete, CousinGivesFifteenAndSeparatorChangesAboveParents) {
    FillAscending(5101);
    ASSERT_EQ(map().m_height, 2);
    ASSERT_EQ(Root()->m_numKeyEntrys, 1);
    Internal* p1 = AsInternal(Root()->m_ptr.Get());
    Internal* p2 = AsInternal(Root()->GetEntry(0).m_ptr.Get());
    Leaf* t = AsLeaf(p2->m_ptr.Get());  // leftmost child of p2
    Leaf* cousin = LeafAt(50);          // last child of p1
    ASSERT_EQ(Children(p1).back(), cousin);
    ASSERT_EQ(LeafKeys(t).front(), 2551 * kGap);
    for (uint64 i = 2501; i <= 2530; ++i) {
        Insert(i * kGap + 500);  // the cousin holds 80
    }
    for (uint64 i = 2601; i <= 2610; ++i) {
        Insert(i * kGap + 500);  // the right sibling holds 60
    }
    Commit();
    const Keys c = LeafKeys(cousin);
    const Keys tKeys = LeafKeys(t);
    const Keys p1Keys = Separators(p1);
    const Keys p2Keys = Separators(p2);
    ASSERT_EQ(c.size(), 80u);
    EXPECT_TRUE(map().Delete(K(2575)));

    EXPECT_EQ(LeafKeys(cousin), Slice(c, 0, 65));
    EXPECT_EQ(LeafKeys(t), Cat(Slice(c, 65, 80), Without(tKeys, 2575 * kGap)));
    EXPECT_EQ(Separators(Root()), (Keys{c[65]}));
    EXPECT_EQ(Separators(p1), p1Keys);
    EXPECT_EQ(Separators(p2), p2Keys);
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
    // The two leaves, the header and the root (the anchor); neither parent.
    EXPECT_EQ(m_space.NumDirty(), 4);
    ExpectDroppedUntilCommit({});
}

TEST_F(BTreeDelete, LeftmostChildAbsorbsRightSiblingWhenLeftIsCousin) {
    FillAscending(5601);  // p2 holds 60 keys
    Internal* p2 = AsInternal(Root()->GetEntry(0).m_ptr.Get());
    ASSERT_EQ(p2->m_numKeyEntrys, 60);
    Leaf* t = AsLeaf(p2->m_ptr.Get());
    Leaf* sibling = AsLeaf(p2->GetEntry(0).m_ptr.Get());
    ASSERT_EQ(t->m_prev->m_numKeyEntrys, 50);
    ASSERT_EQ(sibling->m_numKeyEntrys, 50);
    const Keys p2Keys = Separators(p2);
    const Keys rootKeys = Separators(Root());
    const OID siblingId = IdOf(sibling);
    EXPECT_TRUE(map().Delete(K(2575)));

    EXPECT_EQ(p2->m_ptr.Get(), t);
    EXPECT_EQ(LeafKeys(t), Without(Span(2551, 2650), 2575 * kGap));
    EXPECT_EQ(Separators(p2), Slice(p2Keys, 1, 60));
    EXPECT_EQ(Separators(Root()), rootKeys);
    EXPECT_EQ(t->m_prev->m_numKeyEntrys, 50);
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectDroppedUntilCommit({siblingId});
}

// ---- Internal merging and balancing.

TEST_F(BTreeDelete, InternalNodeOf49MergesIntoExactly100) {
    FillAscending(5101);
    Internal* oldRoot = Root();
    Internal* p1 = AsInternal(oldRoot->m_ptr.Get());
    Internal* p2 = AsInternal(oldRoot->GetEntry(0).m_ptr.Get());
    const Keys p1Keys = Separators(p1);
    const Keys p2Keys = Separators(p2);
    const uint64 rootKey = Separators(oldRoot)[0];
    const std::vector<OID> dropped{IdOf(LeafAt(60)), IdOf(p2), IdOf(oldRoot)};
    // Leaf 60 (p2's entry 8) merges into leaf 59; p2 falls to 49 keys and
    // merges into p1; the root is left without keys.
    EXPECT_TRUE(map().Delete(K(3025)));

    EXPECT_EQ(map().m_height, 1);
    EXPECT_EQ(map().m_root.Get(), p1);
    EXPECT_EQ(p1->m_numKeyEntrys, 100);
    Keys p2Rest = p2Keys;
    p2Rest.erase(p2Rest.begin() + 8);
    EXPECT_EQ(Separators(p1), Cat(Cat(p1Keys, {rootKey}), p2Rest));
    EXPECT_EQ(LeafKeys(LeafAt(59)), Cat(Span(2951, 3000), Without(Span(3001, 3050), 3025 * kGap)));
    EXPECT_EQ(p2->m_numKeyEntrys, 0);
    EXPECT_EQ(oldRoot->m_numKeyEntrys, 0);
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
    ExpectDroppedUntilCommit(dropped);
    EXPECT_EQ(CheckBTree(map()), "");
}

TEST_F(BTreeDelete, InternalBalanceFromLeftMovesFiveKeys) {
    FillAscending(5101);
    // 550 keys into p1's last leaf add ten leaves: p1 holds 60 keys.
    for (uint64 j = 1; j <= 550; ++j) {
        Insert(2550 * kGap + j);
    }
    Commit();
    Internal* root = Root();
    Internal* p1 = AsInternal(root->m_ptr.Get());
    Internal* p2 = AsInternal(root->GetEntry(0).m_ptr.Get());
    ASSERT_EQ(p1->m_numKeyEntrys, 60);
    ASSERT_EQ(p2->m_numKeyEntrys, 50);
    const Keys p1Keys = Separators(p1);
    const Keys p2Keys = Separators(p2);
    const std::vector<void*> p1Children = Children(p1);
    const std::vector<void*> p2Children = Children(p2);
    const uint64 rootKey = Separators(root)[0];
    // A leaf of p2 merges into its left sibling; p2 falls to 49 keys and
    // takes 5 from p1 through the root: newNumRight 54, ns 5.
    EXPECT_TRUE(map().Delete(K(3025)));

    ASSERT_EQ(p2->m_numKeyEntrys, 54);
    EXPECT_EQ(p1->m_numKeyEntrys, 55);
    EXPECT_EQ(Separators(p1), Slice(p1Keys, 0, 55));
    EXPECT_EQ(Separators(root), (Keys{p1Keys[55]}));
    // p1's key 55 went up; its child is p2's new leftmost child.
    EXPECT_EQ(p2->m_ptr.Get(), p1Children[56]);
    // p1's entries 56..59 are p2's entries 0..3.
    for (ssize_t i = 0; i < 4; ++i) {
        EXPECT_EQ(KeyNum(p2->GetEntry(i).m_key), p1Keys[56 + i]);
        EXPECT_EQ(p2->GetEntry(i).m_ptr.Get(), p1Children[57 + i]);
    }
    // The old separator came down as entry 4, over p2's old leftmost child.
    EXPECT_EQ(KeyNum(p2->GetEntry(4).m_key), rootKey);
    EXPECT_EQ(p2->GetEntry(4).m_ptr.Get(), p2Children[0]);
    Keys p2Rest = p2Keys;
    p2Rest.erase(p2Rest.begin() + 8);
    EXPECT_EQ(Slice(Separators(p2), 5, 54), p2Rest);
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
    ExpectDroppedUntilCommit({IdOf(AsLeaf(p2Children[9]))});
}

TEST_F(BTreeDelete, InternalBalanceFromRightMovesFiveKeys) {
    FillAscending(5601);
    Internal* root = Root();
    Internal* p1 = AsInternal(root->m_ptr.Get());
    Internal* p2 = AsInternal(root->GetEntry(0).m_ptr.Get());
    ASSERT_EQ(p1->m_numKeyEntrys, 50);
    ASSERT_EQ(p2->m_numKeyEntrys, 60);
    const Keys p1Keys = Separators(p1);
    const Keys p2Keys = Separators(p2);
    const std::vector<void*> p2Children = Children(p2);
    const uint64 rootKey = Separators(root)[0];
    const OID droppedLeaf = IdOf(LeafAt(10));
    // Leaf 10 (p1's entry 9) merges into leaf 9; p1 falls to 49 keys and
    // takes 5 from p2: newNumLeft 54, ns 5.
    EXPECT_TRUE(map().Delete(K(525)));

    Keys p1Rest = p1Keys;
    p1Rest.erase(p1Rest.begin() + 9);
    EXPECT_EQ(Separators(p1), Cat(Cat(p1Rest, {rootKey}), Slice(p2Keys, 0, 4)));
    EXPECT_EQ(p1->GetEntry(49).m_ptr.Get(), p2Children[0]);
    EXPECT_EQ(p1->GetEntry(53).m_ptr.Get(), p2Children[4]);
    EXPECT_EQ(Separators(root), (Keys{p2Keys[4]}));
    EXPECT_EQ(p2->m_ptr.Get(), p2Children[5]);
    EXPECT_EQ(Separators(p2), Slice(p2Keys, 5, 60));
    EXPECT_EQ(CheckBTree(map()), "");
    ExpectPayloadsFollowKeys();
    ExpectDroppedUntilCommit({droppedLeaf});
}

// ---- Broken preconditions of the steps stop the process.

using BTreeDeleteDeathTest = BTreeDelete;

TEST_F(BTreeDeleteDeathTest, LeafStepsCheckChainAndCounts) {
    FillAscending(201);
    Leaf* l0 = LeafAt(0);
    Leaf* l1 = LeafAt(1);
    Leaf* l2 = LeafAt(2);
    Leaf* l3 = LeafAt(3);
    EXPECT_TARN_ASSERT(map().MergeLeafRightToLeft(l0, l2), "left->m_next == right");
    EXPECT_TARN_ASSERT(
        {
            l1->m_prev = l2;
            map().MergeLeafRightToLeft(l0, l1);
        },
        "right->m_prev == left");
    EXPECT_TARN_ASSERT(map().BalanceLeafLeftToRight(l0, l2, Root()), "left->m_next == right");
    EXPECT_TARN_ASSERT(map().MergeLeafRightToLeft(l2, l3), "50 <= nTot && nTot <= 100");
    EXPECT_TARN_ASSERT(map().BalanceLeafRightToLeft(l0, l1, Root()), "0 <= nL && nL < 50");
    EXPECT_TARN_ASSERT(map().BalanceLeafLeftToRight(l0, l1, Root()), "50 < nL && nL <= 100");
    EXPECT_TARN_ASSERT(map().ReplaceKeyInAnchor(Root(), K(101), K(101)),
                       "CompareKeys(oldKey,newKey) != 0");
    EXPECT_TARN_ASSERT(map().ReplaceKeyInAnchor(Root(), K(101), K(151)),
                       "CompareKeys(node->GetEntry(i+1).m_key, newKey) > 0");
    EXPECT_TARN_ASSERT(map().ReplaceKeyInAnchor(Root(), K(101), K(51)),
                       "CompareKeys(node->GetEntry(i-1).m_key, newKey) < 0");
}

TEST_F(BTreeDeleteDeathTest, InternalStepsCheckCounts) {
    FillAscending(5101);
    Internal* p1 = AsInternal(Root()->m_ptr.Get());
    Internal* p2 = AsInternal(Root()->GetEntry(0).m_ptr.Get());
    EXPECT_TARN_ASSERT(map().BalanceInternalLeftToRight(p1, p2, Root()), "50 < nL && nL <= 100");
    EXPECT_TARN_ASSERT(map().BalanceInternalRightToLeft(p1, p2, Root()), "0 <= nL && nL < 50");
    EXPECT_TARN_ASSERT(map().MergeInternalRightToLeft(p1, p2, Root()), "50 <= nTot && nTot <= 100");
    EXPECT_TARN_ASSERT(map().BalanceInternalLeftToRight(p2, p2, Root()),
                       "CompareKeys(left->GetEntry(nL-1).m_key, anchorKey) < 0");
}

// ---- Random walks and whole-tree deletion against a model.

using Model = std::map<uint64, int64>;

class BTreeModel : public BTreeDelete {
protected:
    // Compares the whole map with the model, entry by entry, checks the
    // invariants, and checks that the nodes dropped so far are exactly the
    // nodes that left the tree and are no longer reachable from it.
    void CheckAll() {
        ASSERT_EQ(CheckBTree(map()), "");
        ASSERT_EQ(map().m_size, static_cast<ssize_t>(m_model.size()));
        auto m = m_model.begin();
        const Map& cmap = map();
        for (auto i = cmap.begin(); i != cmap.end(); ++i, ++m) {
            ASSERT_EQ(KeyNum((*i).first), m->first);
            auto site = (*i).second.m_map.find(MakeSite(1));
            ASSERT_NE(site, (*i).second.m_map.end());
            ASSERT_EQ(site->second.o, m->second);
        }
        const ssize_t nodes = map().GetNumNodes();
        ASSERT_EQ(nodes, Log().numRegisterGcObject - Log().numAsyncDeleteObject);
        if (m_space.NumQueuedDeletions() > 0) {
            std::unordered_set<const void*> reachable;
            CollectNodes(map().m_height, map().m_root.Get(), reachable);
            ASSERT_EQ(reachable.size(), static_cast<std::size_t>(nodes));
            ASSERT_EQ(reachable.count(Log().lastDeleted.m_self), 0u);
        }
    }

    // Counts since the last commit; the dropped nodes must be queued, and
    // the commit destroys exactly them. Every `m_evictEvery` commits, the
    // whole tree is evicted.
    void CommitAndCheck() {
        const int64 dropped = Log().numAsyncDeleteObject - m_droppedAtCommit;
        ASSERT_EQ(m_space.NumQueuedDeletions(), dropped);
        const int64 deletedBefore = m_space.Stats().numDeleted;
        m_space.Commit();
        ASSERT_EQ(m_space.Stats().numDeleted - deletedBefore, dropped);
        ASSERT_EQ(m_space.NumQueuedDeletions(), 0);
        m_droppedAtCommit = Log().numAsyncDeleteObject;
        if (m_evictEvery > 0 && ++m_commits % m_evictEvery == 0) {
            // Release every clean resident, the header included, so that the
            // next operations load the nodes they touch (neighbours too).
            const OID mapId = IdOf(m_map);
            m_space.DropCleanResidents();
            ASSERT_FALSE(m_space.IsResident(mapId));
            m_map = static_cast<Map*>(m_space.Resolve(mapId, nullptr).m_self);
            ASSERT_NE(m_map, nullptr);
        }
    }

    void Put(uint64 num, int64 value) {
        map().Insert(MakeKey(num), MakePayload(value), true);
        m_model[num] = value;
    }

    void Remove(uint64 num) {
        const int64 before = Log().numAsyncDeleteObject;
        const bool present = m_model.erase(num) == 1;
        ASSERT_EQ(map().Delete(MakeKey(num)), present);
        // A node just handed over is still in memory, empty, until commit.
        if (Log().numAsyncDeleteObject > before) {
            ASSERT_TRUE(m_space.IsResident(Log().lastDeleted->GetPersistObjState().m_oid));
        }
    }

    // The map after a random walk of `ops` steps over keys 0..keySpace-1,
    // inserting with probability `insertPercent`; full checks every
    // `checkEvery` steps and commits every `commitEvery`.
    void RandomWalk(std::mt19937_64& rng, int ops, uint64 keySpace, int insertPercent,
                    int checkEvery, int commitEvery) {
        for (int op = 1; op <= ops; ++op) {
            const uint64 num = rng() % keySpace;
            if (static_cast<int>(rng() % 100) < insertPercent) {
                Put(num, static_cast<int64>(rng() % 1000000));
            } else {
                ASSERT_NO_FATAL_FAILURE(Remove(num));
            }
            if (op % checkEvery == 0) {
                ASSERT_NO_FATAL_FAILURE(CheckAll());
            }
            if (op % commitEvery == 0) {
                ASSERT_NO_FATAL_FAILURE(CommitAndCheck());
            }
        }
    }

    // Deletes every key of the model in `order`, then expects the empty root
    // leaf, which is the map's first leaf of before (deletion keeps the left
    // node of every merge).
    void DeleteAll(const Keys& order, int checkEvery, int commitEvery) {
        const OID first = IdOf(map().m_firstLeaf.Get());
        int op = 0;
        for (uint64 num : order) {
            ASSERT_NO_FATAL_FAILURE(Remove(num));
            ++op;
            if (op % checkEvery == 0 || m_model.size() < 120) {
                ASSERT_NO_FATAL_FAILURE(CheckAll());
            }
            if (op % commitEvery == 0) {
                ASSERT_NO_FATAL_FAILURE(CommitAndCheck());
            }
        }
        ASSERT_NO_FATAL_FAILURE(CheckAll());
        EXPECT_EQ(map().m_height, 0);
        EXPECT_EQ(map().m_size, 0);
        EXPECT_EQ(IdOf(AsLeaf(map().m_root.Get())), first);
        EXPECT_EQ(AsLeaf(map().m_root.Get())->m_numKeyEntrys, 0);
        EXPECT_EQ(map().GetNumNodes(), 1);
        m_evictEvery = 0;
        ASSERT_NO_FATAL_FAILURE(CommitAndCheck());
        EXPECT_EQ(m_space.NumResidents(), 2);  // the header and the root leaf
    }

    Keys ModelKeys() const {
        Keys out;
        for (const auto& e : m_model) {
            out.push_back(e.first);
        }
        return out;
    }

    void FillModel(uint64 n) {
        for (uint64 i = 0; i < n; ++i) {
            Put(i, static_cast<int64>(i * 3 + 1));
        }
        ASSERT_NO_FATAL_FAILURE(CheckAll());
        ASSERT_NO_FATAL_FAILURE(CommitAndCheck());
    }

    Model m_model;
    int64 m_droppedAtCommit = 0;
    int m_evictEvery = 0;
    int m_commits = 0;
};

TEST_F(BTreeModel, SmallTreesCheckedAfterEveryStep) {
    std::mt19937_64 rng(11);
    // Around the root leaf's split and the collapse back to it.
    for (int round = 0; round < 5; ++round) {
        ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 4000, 150, 70, 1, 37));
        ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 4000, 150, 30, 1, 37));
    }
    // Height 1 with a handful of leaves.
    for (int round = 0; round < 4; ++round) {
        ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 10000, 400, 60, 1, 97));
        ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 10000, 400, 40, 1, 97));
    }
}

TEST_F(BTreeModel, TreeGrowsToHeight2AndShrinksBack) {
    std::mt19937_64 rng(10);
    ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 30000, 12000, 85, 500, 2000));
    ASSERT_EQ(map().m_height, 2);
    ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 60000, 12000, 15, 500, 2000));
    ASSERT_EQ(map().m_height, 1);
}

TEST_F(BTreeModel, LargeTreeRandomWalk) {
    std::mt19937_64 rng(12);
    m_evictEvery = 4;
    ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 200000, 60000, 75, 20000, 5000));
    ASSERT_EQ(map().m_height, 2);
    ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 200000, 60000, 50, 20000, 5000));
    ASSERT_NO_FATAL_FAILURE(RandomWalk(rng, 150000, 60000, 25, 20000, 5000));
    ASSERT_NO_FATAL_FAILURE(CheckAll());
}

TEST_F(BTreeModel, DeleteEveryKeyAscending) {
    ASSERT_NO_FATAL_FAILURE(FillModel(12000));
    ASSERT_EQ(map().m_height, 2);
    ASSERT_NO_FATAL_FAILURE(DeleteAll(ModelKeys(), 500, 1000));
}

TEST_F(BTreeModel, DeleteEveryKeyDescending) {
    ASSERT_NO_FATAL_FAILURE(FillModel(12000));
    Keys order = ModelKeys();
    std::reverse(order.begin(), order.end());
    ASSERT_NO_FATAL_FAILURE(DeleteAll(order, 500, 1000));
}

TEST_F(BTreeModel, DeleteEveryKeyInRandomOrder) {
    ASSERT_NO_FATAL_FAILURE(FillModel(12000));
    Keys order = ModelKeys();
    std::shuffle(order.begin(), order.end(), std::mt19937_64(13));
    ASSERT_NO_FATAL_FAILURE(DeleteAll(order, 500, 1000));
}

// Height 3 (about 260,000 keys): internal nodes then have cousins, and an
// internal balance can rotate through an anchor above both parents.
TEST_F(BTreeModel, DeleteEveryKeyOfHeight3TreeInRandomOrder) {
    m_evictEvery = 4;
    ASSERT_NO_FATAL_FAILURE(FillModel(265000));
    ASSERT_EQ(map().m_height, 3);
    Keys order = ModelKeys();
    std::shuffle(order.begin(), order.end(), std::mt19937_64(14));
    ASSERT_NO_FATAL_FAILURE(DeleteAll(order, 20000, 10000));
}

}  // namespace
}  // namespace tarn
