// Lookups and iteration of the persistent B+tree map at the positions a
// random walk rarely pins down exactly: empty maps, leaf boundaries,
// separators, the position before the first entry, misuse of iterators. Also
// checks that the shared tree checker notices broken invariants.

#include <gtest/gtest.h>

#include <vector>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"

namespace tarn {
namespace {

using testing::CheckBTree;
using testing::MakeKey;
using testing::MakePayload;

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
using Policy = Map::IteratorPolicy;

class BTreeSearch : public testing::BTreeSpaceTest {
protected:
    // Keys 10, 20, ..., 10*n in increasing order: two leaves of 50 and 51
    // for n = 101, with separator 510.
    void Fill(uint64 n) {
        for (uint64 i = 1; i <= n; ++i) {
            map().Insert(MakeKey(10 * i), MakePayload(static_cast<int64>(i)), false);
        }
    }
    const Map& cmap() { return map(); }
    Leaf* First() { return map().m_firstLeaf.Get(); }
    Leaf* Last() { return map().m_lastLeaf.Get(); }
    static const Policy& P(const Map::const_iterator& it) { return it.policy(); }
};

TEST_F(BTreeSearch, MapWithoutRootAnswersNullPositionEverywhere) {
    const Policy none(nullptr, 0);
    EXPECT_TRUE(P(cmap().begin()) == none);
    EXPECT_TRUE(P(cmap().end()) == none);
    EXPECT_TRUE(P(cmap().find(MakeKey(1))) == none);
    EXPECT_TRUE(P(cmap().lower_bound(MakeKey(1))) == none);
    EXPECT_TRUE(P(cmap().upper_bound(MakeKey(1))) == none);
    EXPECT_EQ(cmap().rFind(MakeKey(1)), nullptr);
    EXPECT_TRUE(cmap().rbegin() == cmap().rend());
    EXPECT_TARN_ASSERT(
        {
            Map::const_iterator it = cmap().begin();
            ++it;
        },
        "m_leaf");
}

TEST_F(BTreeSearch, EmptyRootLeafAnswersItsEnd) {
    map()[MakeKey(1)];
    ASSERT_TRUE(map().Delete(MakeKey(1)));
    const Policy end(First(), 0);
    EXPECT_TRUE(P(cmap().begin()) == end);
    EXPECT_TRUE(P(cmap().end()) == end);
    EXPECT_TRUE(P(cmap().find(MakeKey(1))) == end);
    EXPECT_TRUE(P(cmap().lower_bound(MakeKey(1))) == end);
    EXPECT_TRUE(P(cmap().upper_bound(MakeKey(1))) == end);
}

TEST_F(BTreeSearch, BoundsAcrossTheLeafBoundary) {
    Fill(101);
    ASSERT_EQ(testing::LeafCounts(map()), (std::vector<ssize_t>{50, 51}));
    // 505 lies between the first leaf's last key (500) and the second's first
    // (510); the descent ends in the first leaf, which holds nothing at or
    // above it.
    Map::const_iterator lb = cmap().lower_bound(MakeKey(505));
    EXPECT_TRUE(P(lb) == Policy(Last(), 0));
    Map::const_iterator stepped = cmap().find(MakeKey(500));
    ++stepped;
    EXPECT_TRUE(lb == stepped);
    EXPECT_TRUE(P(cmap().upper_bound(MakeKey(500))) == Policy(Last(), 0));

    EXPECT_TRUE(cmap().lower_bound(MakeKey(2000)) == cmap().end());
    EXPECT_TRUE(cmap().upper_bound(MakeKey(1010)) == cmap().end());
    EXPECT_EQ(cmap().lower_bound(MakeKey(300))->first, MakeKey(300));
    EXPECT_EQ(cmap().upper_bound(MakeKey(300))->first, MakeKey(310));
    EXPECT_EQ(cmap().lower_bound(MakeKey(0))->first, MakeKey(10));
}

TEST_F(BTreeSearch, KeyEqualToSeparatorIsInTheRightChild) {
    Fill(101);
    auto* root = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(map().m_root.Get());
    ASSERT_EQ(root->GetEntry(0).m_key, MakeKey(510));
    EXPECT_EQ(root->FindChildGivenKey2(MakeKey(510)), std::make_pair<void*>(Last(), ssize_t{0}));
    EXPECT_EQ(root->FindChildGivenKey2(MakeKey(509)), std::make_pair<void*>(First(), ssize_t{-1}));
    EXPECT_EQ(root->FindChildIndexGivenKey(MakeKey(510)), 0);
    EXPECT_TRUE(P(cmap().find(MakeKey(510))) == Policy(Last(), 0));
}

TEST_F(BTreeSearch, IterationVisitsEveryKeyInOrderBothWays) {
    Fill(5200);  // height 2
    ASSERT_EQ(map().m_height, 2);
    ssize_t n = 0;
    Map::const_iterator it = cmap().begin();
    for (; it != cmap().end(); ++it) {
        ++n;
        ASSERT_EQ(it->first, MakeKey(10 * static_cast<uint64>(n)));
    }
    EXPECT_EQ(n, map().m_size);
    it = cmap().end();
    for (ssize_t i = n; i >= 1; --i) {
        --it;
        ASSERT_EQ(it->first, MakeKey(10 * static_cast<uint64>(i)));
    }
    EXPECT_TRUE(it == cmap().begin());
    ssize_t r = 0;
    for (auto rit = cmap().rbegin(); rit != cmap().rend(); ++rit) {
        ASSERT_EQ(rit->first, MakeKey(10 * static_cast<uint64>(n - r)));
        ++r;
    }
    EXPECT_EQ(r, n);
}

TEST_F(BTreeSearch, StepBeforeFirstAndBack) {
    Fill(120);
    Map::const_iterator it = cmap().begin();
    --it;
    EXPECT_TRUE(P(it) == Policy(First(), -1));
    ++it;
    EXPECT_TRUE(it == cmap().begin());
    --it;
    EXPECT_TARN_ASSERT(--it, "0 <= m_offset && m_offset <= m_leaf->m_numKeyEntrys");
    EXPECT_TARN_ASSERT((void)*it, "0 <= m_offset && m_offset < m_leaf->m_numKeyEntrys");
}

TEST_F(BTreeSearch, MisusingEndStops) {
    Fill(120);
    Map::const_iterator end = cmap().end();
    EXPECT_TARN_ASSERT(++end, "-1 <= m_offset && m_offset < m_leaf->m_numKeyEntrys");
    EXPECT_TARN_ASSERT((void)*end, "0 <= m_offset && m_offset < m_leaf->m_numKeyEntrys");
    Map::iterator mend = map().end();
    EXPECT_TARN_ASSERT((void)*mend, "0 <= m_offset && m_offset < m_leaf->m_numKeyEntrys");
}

TEST_F(BTreeSearch, OnlyMutableDereferenceMarksTheLeaf) {
    Fill(10);
    Commit();
    const Map::const_iterator cit = cmap().begin();
    EXPECT_EQ(cit->first, MakeKey(10));
    EXPECT_FALSE(First()->IsDirty());
    Map::iterator it = map().begin();
    it->second.Insert(testing::MakeSite(3), 5, 1);
    EXPECT_TRUE(First()->IsDirty());
    EXPECT_FALSE(map().IsDirty());
}

TEST_F(BTreeSearch, NonConstLookupsMatchConstOnes) {
    Fill(300);
    for (uint64 k : {0u, 10u, 505u, 1500u, 3000u, 3005u}) {
        SCOPED_TRACE(k);
        EXPECT_TRUE(Map::const_iterator(map().find(MakeKey(k))) == cmap().find(MakeKey(k)));
        EXPECT_TRUE(Map::const_iterator(map().lower_bound(MakeKey(k))) ==
                    cmap().lower_bound(MakeKey(k)));
        EXPECT_TRUE(Map::const_iterator(map().upper_bound(MakeKey(k))) ==
                    cmap().upper_bound(MakeKey(k)));
    }
}

TEST_F(BTreeSearch, LeafSearchesOnOneLeaf) {
    Fill(5);  // 10..50
    Leaf* leaf = First();
    EXPECT_EQ(map().SearchLeaf(MakeKey(30), leaf), 2);
    EXPECT_EQ(map().SearchLeaf(MakeKey(35), leaf), -1);
    EXPECT_EQ(map().LowerBoundInLeaf(MakeKey(30), leaf), 2);
    EXPECT_EQ(map().UpperBoundInLeaf(MakeKey(30), leaf), 3);
    EXPECT_EQ(map().LowerBoundInLeaf(MakeKey(5), leaf), 0);
    EXPECT_EQ(map().UpperBoundInLeaf(MakeKey(50), leaf), 5);
    EXPECT_TARN_ASSERT(map().SearchLeaf(MakeKey(1), nullptr), "leaf");
}

// The checker is what every tree test trusts; it must see each kind of damage.
TEST_F(BTreeSearch, CheckerReportsBrokenInvariants) {
    Fill(300);
    ASSERT_EQ(CheckBTree(map()), "");
    Leaf* first = First();
    Leaf* second = first->m_next.Get();

    map().m_size += 1;
    EXPECT_NE(CheckBTree(map()), "");
    map().m_size -= 1;

    second->m_prev.Clear();
    EXPECT_NE(CheckBTree(map()), "");
    second->m_prev = first;

    std::swap(first->GetEntry(3).first, first->GetEntry(4).first);
    EXPECT_NE(CheckBTree(map()), "");
    std::swap(first->GetEntry(3).first, first->GetEntry(4).first);

    std::swap(first->GetEntry(49).first, second->GetEntry(0).first);
    EXPECT_NE(CheckBTree(map()), "");
    std::swap(first->GetEntry(49).first, second->GetEntry(0).first);

    --first->m_numKeyEntrys;
    EXPECT_NE(CheckBTree(map()), "");
    ++first->m_numKeyEntrys;

    Leaf* last = Last();
    map().m_lastLeaf = first;
    EXPECT_NE(CheckBTree(map()), "");
    map().m_lastLeaf = last;
    EXPECT_EQ(CheckBTree(map()), "");
}

}  // namespace
}  // namespace tarn
