// Deletion from the persistent B+tree map: the exact tree shapes of every
// borrow, merge and collapse that a random walk reaches rarely, checked entry
// by entry, and the preconditions of the single steps. Every node handed to
// deletion is followed through the runtime until the commit that destroys it.
// (Random deletion against a model, absent keys and deleting down to the
// empty root leaf live with the differential test.)
//
// Shapes are built by ascending insertion of K(1), K(2), ... (key number
// 1000 * i), which leaves every leaf but the last with 50 entries and, once
// the root has split, internal nodes of 50 keys; further keys fit between.

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"

namespace tarn {
namespace {

using testing::LeafCounts;
using testing::MakeKey;

using testing::operator+;
using testing::Slice;
using testing::WithoutAt;

class BTreeDelete : public testing::BTreeSpaceTest {
protected:
    template <typename T>
    static OID IdOf(const T* node) {
        return node->GetPersistObjState().m_oid;
    }

    // The nodes `ids` (in hand-over order) and no others were handed to
    // deletion, each once, and are still resident with their images; the
    // next commit destroys them and removes their images. The tree is sound
    // before and after, and every entry keeps the payload Put gave it.
    void ExpectDroppedUntilCommit(const std::vector<OID>& ids) {
        EXPECT_BTREE_OK(map());
        AllKeys();  // every payload still follows its key
        EXPECT_EQ(Log().numAsyncDeleteObject, int64(ids.size()));
        EXPECT_EQ(Log().numAsyncDeleteSubTree, 0);
        EXPECT_EQ(m_space.NumQueuedDeletions(), ssize_t(ids.size()));
        if (!ids.empty()) {
            EXPECT_EQ(Log().lastDeleted->GetPersistObjState().m_oid, ids.back());
        }
        for (const OID& id : ids) {
            EXPECT_TRUE(m_space.IsResident(id) && m_store->Load(id.value_).has_value());
        }
        ExpectNoUnmarkedChange();
        const int64 deletedBefore = m_space.Stats().numDeleted;
        Commit();
        EXPECT_EQ(m_space.Stats().numDeleted - deletedBefore, int64(ids.size()));
        for (const OID& id : ids) {
            EXPECT_FALSE(m_space.IsResident(id) || m_store->Load(id.value_).has_value());
        }
        EXPECT_BTREE_OK(map());
    }
};

// ---- Leaves under a root at height 1 ----------------------------------------------

struct LeafShape {
    const char* name;
    uint64 fill;                       // K(1) .. K(fill), then a commit
    std::vector<uint64> extra;         // key numbers put before the commit
    std::vector<uint64> erase;         // key numbers deleted, in order
    std::vector<ssize_t> counts;       // leaf counts afterwards
    std::vector<uint64> separators;    // the root's afterwards; none: collapsed
    std::vector<std::size_t> dropped;  // leaves (numbered before) handed over
    ssize_t dirty;                     // dirty objects before the commit, or -1
};

std::vector<uint64> HalfSteps(uint64 from, uint64 to) {
    std::vector<uint64> out;
    for (uint64 i = from; i <= to; ++i) {
        out.push_back(i * 1000 + 500);
    }
    return out;
}

// clang-format off
const LeafShape kLeafShapes[] = {
    // name, fill, extra, erase, counts, separators, dropped, dirty
    {"RightLeafMergesIntoLeftAndRootCollapses", 101, {}, {101000, 100000}, {99}, {}, {1}, -1},
    {"LeftLeafTakesInItsRightSiblingAndRootCollapses", 101, {}, {101000, 1000}, {99}, {}, {1}, -1},
    {"BothNeighboursAt50MergeIntoLeftSibling", 201, {}, {75000},
        {99, 50, 51}, {101000, 151000}, {1}, -1},
    {"LastLeafMergesIntoItsLeftSibling", 201, {}, {201000, 200000},
        {50, 50, 99}, {51000, 101000}, {3}, -1},
    {"BorrowsOneFromLeftNeighbourOf51", 151, {60500}, {151000, 150000},
        {50, 50, 50}, {51000, 100000}, {}, -1},
    {"TakesQuarterOfFullRightNeighbour", 200, {}, {75000},
        {50, 74, 75}, {51000, 126000}, {}, 4},  // both leaves, the header, the anchor
    {"TieBetweenNeighboursGoesRight", 201, HalfSteps(1, 10) + HalfSteps(101, 110), {75000},
        {60, 54, 55, 51}, {51000, 103500, 151000}, {}, -1},
    {"SmallestKeyOfFullEnoughLeafKeepsSeparators", 201, HalfSteps(101, 105), {101000},
        {50, 50, 54, 51}, {51000, 101000, 151000}, {}, 2},  // the leaf and the header
};
// clang-format on

void PrintTo(const LeafShape& shape, std::ostream* os) {
    *os << shape.name;
}

class BTreeDeleteLeafShape : public BTreeDelete, public ::testing::WithParamInterface<LeafShape> {};

// The leaves hold exactly the remaining keys, in the given counts, with their
// payloads; the leaves handed over are emptied and destroyed at the commit.
TEST_P(BTreeDeleteLeafShape, EntryByEntry) {
    const LeafShape& c = GetParam();
    Fill(1, c.fill);
    for (uint64 num : c.extra) {
        Put(num);
    }
    Commit();
    std::vector<Leaf*> emptied;
    std::vector<OID> dropped;
    for (std::size_t i : c.dropped) {
        emptied.push_back(LeafAt(i));
        dropped.push_back(IdOf(emptied.back()));
    }
    if (c.separators.empty()) {
        dropped.push_back(IdOf(Root()));
    }
    Keys remaining = AllKeys();
    for (uint64 num : c.erase) {
        remaining.erase(std::find(remaining.begin(), remaining.end(), num));
    }

    for (uint64 num : c.erase) {
        EXPECT_TRUE(map().Delete(Key(num)));
    }
    EXPECT_EQ(LeafCounts(map()), c.counts);
    for (Leaf* leaf : emptied) {
        EXPECT_EQ(leaf->m_numKeyEntrys, 0);  // handed over empty
    }
    EXPECT_EQ(AllKeys(), remaining);
    EXPECT_EQ(map().m_height, c.separators.empty() ? 0 : 1);
    if (!c.separators.empty()) {
        EXPECT_EQ(Separators(Root()), c.separators);
    }
    if (c.dirty >= 0) {
        EXPECT_EQ(m_space.NumDirty(), c.dirty);
    }
    ExpectDroppedUntilCommit(dropped);
}

INSTANTIATE_TEST_SUITE_P(Shapes, BTreeDeleteLeafShape, ::testing::ValuesIn(kLeafShapes),
                         [](const auto& info) { return std::string(info.param.name); });

// ---- Height 2: cousins and internal nodes -----------------------------------------
// 5101 ascending keys give a root with one key over two internal nodes of 50
// keys (p1 over leaves 0..50, p2 over leaves 51..101); 5601 give p2 60 keys.

class BTreeDeleteHeight2 : public BTreeDelete {
protected:
    void Build(uint64 n) {
        Fill(1, n);
        Commit();
        Load();
    }
    void Load() {
        p1 = AsInternal(Root()->m_ptr.Get());
        p2 = AsInternal(Root()->GetEntry(0).m_ptr.Get());
        e1 = EntriesOf(p1);
        e2 = EntriesOf(p2);
        rootKey = Separators(Root())[0];
    }
    Internal* p1 = nullptr;
    Internal* p2 = nullptr;
    Entries e1, e2;  // before the deletion
    uint64 rootKey = 0;
};

TEST_F(BTreeDeleteHeight2, CousinGivesFifteenAndTheAnchorAboveBothParentsChanges) {
    Fill(1, 5101);
    for (uint64 num : HalfSteps(2501, 2530) + HalfSteps(2601, 2610)) {
        Put(num);  // the cousin (p1's last leaf) holds 80, the right sibling 60
    }
    Commit();
    Load();
    Leaf* t = AsLeaf(e2[0].second);
    Leaf* cousin = AsLeaf(e1.back().second);
    const Keys c = LeafKeys(cousin);
    const Keys tKeys = LeafKeys(t);  // K(2551) .. K(2600)
    ASSERT_EQ(c.size(), 80u);
    ASSERT_EQ(AsLeaf(e2[1].second)->m_numKeyEntrys, 60);
    EXPECT_TRUE(map().Delete(K(2575)));

    EXPECT_EQ(LeafKeys(cousin), Slice(c, 0, 65));
    EXPECT_EQ(LeafKeys(t), Slice(c, 65, 80) + WithoutAt(tKeys, 24));
    EXPECT_EQ(Separators(Root()), Keys{c[65]});
    EXPECT_EQ(EntriesOf(p1), e1);
    EXPECT_EQ(EntriesOf(p2), e2);
    EXPECT_EQ(m_space.NumDirty(), 4);  // both leaves, the header and the anchor
    ExpectDroppedUntilCommit({});
}

TEST_F(BTreeDeleteHeight2, LeftmostChildAbsorbsRightSiblingWhenLeftNeighbourIsCousin) {
    Build(5601);
    ASSERT_EQ(e2.size(), 61u);
    Leaf* t = AsLeaf(e2[0].second);
    const Keys tKeys = LeafKeys(t);
    const Keys siblingKeys = LeafKeys(AsLeaf(e2[1].second));
    ASSERT_EQ(t->m_prev->m_numKeyEntrys, 50);
    EXPECT_TRUE(map().Delete(K(2575)));

    EXPECT_EQ(LeafKeys(t), WithoutAt(tKeys, 24) + siblingKeys);
    EXPECT_EQ(EntriesOf(p2), One(0, e2[0].second) + Slice(e2, 2, 61));
    EXPECT_EQ(Separators(Root()), Keys{rootKey});
    EXPECT_EQ(t->m_prev->m_numKeyEntrys, 50);
    ExpectDroppedUntilCommit({IdOf(AsLeaf(e2[1].second))});
}

TEST_F(BTreeDeleteHeight2, InternalNodeOf49MergesIntoExactly100) {
    Build(5101);
    Internal* oldRoot = Root();
    Leaf* leaf59 = AsLeaf(e2[8].second);
    const Keys keys59 = LeafKeys(leaf59);
    const Keys keys60 = LeafKeys(AsLeaf(e2[9].second));  // K(3001) .. K(3050)
    const std::vector<OID> dropped{IdOf(AsLeaf(e2[9].second)), IdOf(p2), IdOf(oldRoot)};
    // Leaf 60 (p2's entry 8) merges into leaf 59; p2 falls to 49 keys and
    // merges into p1; the root is left without keys and collapses.
    EXPECT_TRUE(map().Delete(K(3025)));

    EXPECT_EQ(map().m_height, 1);
    EXPECT_EQ(map().m_root.Get(), p1);
    EXPECT_EQ(p1->m_numKeyEntrys, 100);
    EXPECT_EQ(EntriesOf(p1), e1 + One(rootKey, e2[0].second) + WithoutAt(Slice(e2, 1, 51), 8));
    EXPECT_EQ(LeafKeys(leaf59), keys59 + WithoutAt(keys60, 24));
    EXPECT_EQ(p2->m_numKeyEntrys + oldRoot->m_numKeyEntrys, 0);
    ExpectDroppedUntilCommit(dropped);
}

TEST_F(BTreeDeleteHeight2, InternalBalanceFromLeftMovesFiveKeys) {
    Fill(1, 5101);
    for (uint64 j = 1; j <= 550; ++j) {
        Put(2550 * kGap + j);  // ten more leaves: p1 holds 60 keys
    }
    Commit();
    Load();
    ASSERT_EQ(e1.size(), 61u);
    ASSERT_EQ(e2.size(), 51u);
    // A leaf of p2 (entry 8) merges into its left sibling; p2 falls to 49 keys
    // and takes 5 from p1 through the root: newNumRight 54, ns 5.
    EXPECT_TRUE(map().Delete(K(3025)));

    // p1 keeps 55 keys; its key 55 goes up and that key's child becomes p2's
    // leftmost child; its entries 56..59 become p2's entries 0..3; the old
    // separator comes down as p2's entry 4, over p2's old leftmost child.
    EXPECT_EQ(EntriesOf(p1), Slice(e1, 0, 56));
    EXPECT_EQ(Separators(Root()), Keys{e1[56].first});
    EXPECT_EQ(EntriesOf(p2), One(0, e1[56].second) + Slice(e1, 57, 61) +
                                 One(rootKey, e2[0].second) + WithoutAt(Slice(e2, 1, 51), 8));
    ExpectDroppedUntilCommit({IdOf(AsLeaf(e2[9].second))});
}

TEST_F(BTreeDeleteHeight2, InternalBalanceFromRightMovesFiveKeys) {
    Build(5601);
    ASSERT_EQ(e1.size(), 51u);
    ASSERT_EQ(e2.size(), 61u);
    // Leaf 10 (p1's entry 9) merges into leaf 9; p1 falls to 49 keys and takes
    // 5 from p2: newNumLeft 54, ns 5.
    EXPECT_TRUE(map().Delete(K(525)));

    EXPECT_EQ(EntriesOf(p1), WithoutAt(e1, 10) + One(rootKey, e2[0].second) + Slice(e2, 1, 5));
    EXPECT_EQ(Separators(Root()), Keys{e2[5].first});
    EXPECT_EQ(EntriesOf(p2), One(0, e2[5].second) + Slice(e2, 6, 61));
    ExpectDroppedUntilCommit({IdOf(AsLeaf(e1[10].second))});
}

// ---- Broken preconditions of the single steps stop the process ------------------

using BTreeDeleteDeathTest = BTreeDeleteHeight2;

TEST_F(BTreeDeleteDeathTest, StepsCheckTheirNeighboursAndCounts) {
    Fill(1, 201);
    Leaf* l[4] = {LeafAt(0), LeafAt(1), LeafAt(2), LeafAt(3)};
    EXPECT_TARN_ASSERT(map().MergeLeafRightToLeft(l[0], l[2]), "left->m_next == right");
    EXPECT_TARN_ASSERT(
        {
            l[1]->m_prev = l[2];
            map().MergeLeafRightToLeft(l[0], l[1]);
        },
        "right->m_prev == left");
    EXPECT_TARN_ASSERT(map().BalanceLeafLeftToRight(l[0], l[2], Root()), "left->m_next == right");
    EXPECT_TARN_ASSERT(map().MergeLeafRightToLeft(l[2], l[3]), "50 <= nTot && nTot <= 100");
    EXPECT_TARN_ASSERT(map().BalanceLeafRightToLeft(l[0], l[1], Root()), "0 <= nL && nL < 50");
    EXPECT_TARN_ASSERT(map().BalanceLeafLeftToRight(l[0], l[1], Root()), "50 < nL && nL <= 100");
    EXPECT_TARN_ASSERT(map().ReplaceKeyInAnchor(Root(), K(101), K(101)),
                       "CompareKeys(oldKey,newKey) != 0");
    EXPECT_TARN_ASSERT(map().ReplaceKeyInAnchor(Root(), K(101), K(151)),
                       "CompareKeys(node->GetEntry(i+1).m_key, newKey) > 0");
    EXPECT_TARN_ASSERT(map().ReplaceKeyInAnchor(Root(), K(101), K(51)),
                       "CompareKeys(node->GetEntry(i-1).m_key, newKey) < 0");

    map().clear();
    Build(5101);
    EXPECT_TARN_ASSERT(map().BalanceInternalLeftToRight(p1, p2, Root()), "50 < nL && nL <= 100");
    EXPECT_TARN_ASSERT(map().BalanceInternalRightToLeft(p1, p2, Root()), "0 <= nL && nL < 50");
    EXPECT_TARN_ASSERT(map().MergeInternalRightToLeft(p1, p2, Root()), "50 <= nTot && nTot <= 100");
    EXPECT_TARN_ASSERT(map().BalanceInternalLeftToRight(p2, p2, Root()),
                       "CompareKeys(left->GetEntry(nL-1).m_key, anchorKey) < 0");
}

}  // namespace
}  // namespace tarn
