// Insertion into the persistent B+tree map: exact split shapes, the dirty
// marks and reachability declarations of each insertion event, and the
// whole-map operations (clear, copy, assignment, swap, equality).
//
// Dirty marks are observed through the store: a commit writes the objects in
// the order the space queued them (first mark or registration since the
// previous commit), so after a commit the next operation's marks can be read
// back in order.

#include <gtest/gtest.h>

#include <set>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"
#include "tnPersistStore/btreemap.h"

namespace tarn {
namespace {

using testing::CheckBTree;
using testing::LeafCounts;
using testing::MakeKey;
using testing::MakePayload;
using testing::Oid;

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
using Internal = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;

// Runs every shape test with short (local buffer) and long (heap) paths.
class BTreeInsert : public testing::BTreeSpaceTest, public ::testing::WithParamInterface<bool> {
protected:
    FieldId K(uint64 i) { return MakeKey(i, GetParam()); }

    // Keys 10*first .. 10*(first+n-1), in increasing order, with payload = key.
    void InsertAscending(uint64 first, uint64 n) {
        for (uint64 i = first; i < first + n; ++i) {
            ASSERT_TRUE(map().Insert(K(10 * i), MakePayload(static_cast<int64>(10 * i)), false));
        }
    }

    Leaf* LeafAt(ssize_t index) {
        Leaf* leaf = map().m_firstLeaf.Get();
        for (ssize_t i = 0; i < index; ++i) {
            leaf = leaf->m_next.Get();
        }
        return leaf;
    }

    Internal* Root() { return FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(map().m_root.Get()); }
};

INSTANTIATE_TEST_SUITE_P(ShortAndLongKeys, BTreeInsert, ::testing::Bool());

// ---- Growing from nothing -------------------------------------------------------

TEST_P(BTreeInsert, OperatorIndexOnEmptyMapMakesRootLeaf) {
    Commit();
    OffsetOpsOnField<int64>& payload = map()[K(5)];
    EXPECT_EQ(payload, OffsetOpsOnField<int64>());
    EXPECT_EQ(map().m_height, 0);
    EXPECT_EQ(map().m_size, 1);
    Leaf* leaf = map().m_firstLeaf.Get();
    EXPECT_EQ(map().m_lastLeaf.Get(), leaf);
    EXPECT_EQ(map().m_root.Get(), static_cast<void*>(leaf));
    EXPECT_EQ(leaf->m_numKeyEntrys, 1);
    EXPECT_EQ(&leaf->GetEntry(0).second, &payload);
    EXPECT_EQ(Log().numDeclareReachable, 1);
    EXPECT_EQ(Log().lastReachableFrom.m_self, &map());
    EXPECT_EQ(Log().lastReachableTo.m_self, leaf);
    // The new leaf was queued by its registration, then the header was marked.
    EXPECT_EQ(CommitAndListWrites(), (std::vector<uint64>{Oid(leaf), Oid(&map())}));
    EXPECT_BTREE_OK(map());
}

TEST_P(BTreeInsert, WriteFindWithoutCreateLeavesEmptyRootLeaf) {
    Map::wFindRet ret;
    map().wFind(ret, K(5), false);
    EXPECT_EQ(ret.m_containingNode.m_self, nullptr);
    EXPECT_EQ(ret.m_payload, nullptr);
    EXPECT_EQ(ret.m_leaf, nullptr);
    EXPECT_EQ(ret.m_index, -1);
    EXPECT_FALSE(ret.m_created);
    EXPECT_EQ(map().m_height, 0);
    EXPECT_EQ(map().m_size, 0);
    EXPECT_EQ(map().m_firstLeaf.Get()->m_numKeyEntrys, 0);
    EXPECT_TRUE(map().begin() == map().end());
    EXPECT_BTREE_OK(map());
}

TEST_P(BTreeInsert, HundredthKeyFillsLeafAndNextOneSplitsIt) {
    InsertAscending(0, 100);
    EXPECT_EQ(map().m_height, 0);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{100}));
    InsertAscending(100, 1);
    EXPECT_EQ(map().m_height, 1);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 51}));
    Internal* root = Root();
    ASSERT_EQ(root->m_numKeyEntrys, 1);
    EXPECT_EQ(root->m_ptr.Get(), static_cast<void*>(LeafAt(0)));
    EXPECT_EQ(root->GetEntry(0).m_ptr.Get(), static_cast<void*>(LeafAt(1)));
    EXPECT_EQ(root->GetEntry(0).m_key, LeafAt(1)->GetEntry(0).first);
    EXPECT_EQ(root->GetEntry(0).m_key, K(500));
    EXPECT_BTREE_OK(map());
}

TEST_P(BTreeInsert, AscendingKeysLeaveFiftyInEveryLeafButTheLast) {
    InsertAscending(0, 150);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 100}));
    InsertAscending(150, 1);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 50, 51}));
    EXPECT_EQ(map().m_size, 151);
    EXPECT_BTREE_OK(map());
}

// ---- Where the new key lands in a full leaf ------------------------------------------

struct LandingCase {
    uint64 key;      // old keys are 10, 20, ..., 1000
    bool inLeft;     // lands in the old (left) leaf
    ssize_t offset;  // slot in that leaf
};

TEST_P(BTreeInsert, NewKeyInFullLeafLandsAtItsSortedPlace) {
    const LandingCase cases[] = {
        {5, true, 0},       // below every key
        {1005, false, 50},  // above every key
        {495, true, 49},    // belongs at position 49
        {505, false, 0},    // belongs at position 50
    };
    for (const LandingCase& c : cases) {
        SCOPED_TRACE(c.key);
        map().clear();
        for (uint64 i = 1; i <= 100; ++i) {
            map().Insert(K(10 * i), MakePayload(static_cast<int64>(i)), false);
        }
        Leaf* left = map().m_firstLeaf.Get();
        auto [it, created] = map().insert({K(c.key), MakePayload(-1)});
        ASSERT_TRUE(created);
        Leaf* right = left->m_next.Get();
        ASSERT_NE(right, nullptr);
        EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 51}));
        EXPECT_EQ(it.policy().m_leaf, c.inLeft ? left : right);
        EXPECT_EQ(it.policy().m_offset, c.offset);
        EXPECT_EQ(it->first, K(c.key));
        EXPECT_EQ(it->second, MakePayload(-1));
        EXPECT_EQ(map().m_lastLeaf.Get(), right);
        EXPECT_EQ(Root()->GetEntry(0).m_key, right->GetEntry(0).first);
        EXPECT_BTREE_OK(map());
    }
}

// ---- Dirty marks and reachability per event ---------------------------------------

TEST_P(BTreeInsert, KeyPlacedWithoutSplitMarksHeaderThenLeaf) {
    InsertAscending(0, 10);
    Commit();
    map()[K(55)].Insert(testing::MakeSite(1), 3, 4);
    Leaf* leaf = map().m_firstLeaf.Get();
    EXPECT_EQ(Log().numDeclareReachable, 0);
    EXPECT_EQ(Log().numRegisterGcObject, 0);
    EXPECT_EQ(CommitAndListWrites(), (std::vector<uint64>{Oid(&map()), Oid(leaf)}));
}

TEST_P(BTreeInsert, SplittingMiddleLeafRelinksItsSuccessor) {
    InsertAscending(0, 150);  // leaves 50 (keys 0..490) and 100 (keys 500..1490)
    for (uint64 i = 0; i < 50; ++i) {
        map()[K(10 * i + 5)];  // fill the first leaf to 100
    }
    ASSERT_EQ(LeafCounts(map()), (std::vector<ssize_t>{100, 100}));
    Leaf* left = LeafAt(0);
    Leaf* last = LeafAt(1);
    Internal* root = Root();
    Commit();

    map()[K(7)];
    Leaf* middle = left->m_next.Get();
    ASSERT_NE(middle, last);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 51, 100}));
    EXPECT_EQ(last->m_prev.Get(), middle);
    EXPECT_EQ(middle->m_prev.Get(), left);
    EXPECT_EQ(middle->m_next.Get(), last);
    EXPECT_EQ(map().m_lastLeaf.Get(), last);
    EXPECT_EQ(Log().numDeclareReachable, 1);
    EXPECT_EQ(Log().lastReachableFrom.m_self, left);
    EXPECT_EQ(Log().lastReachableTo.m_self, middle);
    // Header (the count), new leaf (registered), old successor, split leaf,
    // then the parent that took the separator.
    EXPECT_EQ(CommitAndListWrites(),
              (std::vector<uint64>{Oid(&map()), Oid(middle), Oid(last), Oid(left), Oid(root)}));
    EXPECT_BTREE_OK(map());
}

TEST_P(BTreeInsert, SplittingLastLeafMakesNewLeafTheLast) {
    InsertAscending(0, 100);
    Leaf* left = map().m_firstLeaf.Get();
    Commit();
    InsertAscending(100, 1);
    Leaf* right = left->m_next.Get();
    Internal* root = Root();
    EXPECT_EQ(map().m_lastLeaf.Get(), right);
    EXPECT_EQ(Log().numDeclareReachable, 2);  // the leaf from its left, the root from the map
    EXPECT_EQ(Log().lastReachableFrom.m_self, &map());
    EXPECT_EQ(Log().lastReachableTo.m_self, root);
    EXPECT_EQ(CommitAndListWrites(),
              (std::vector<uint64>{Oid(&map()), Oid(right), Oid(left), Oid(root)}));
}

// Leaves 0..99 of 50 keys and leaf 100 of 100 keys under a root with 100
// separators; then leaf 50 (under separator 49) is filled and split, so the
// new separator belongs at position 50 of the full root and is the one
// promoted.
TEST_P(BTreeInsert, InternalSplitPromotesTheInsertedSeparator) {
    InsertAscending(0, 5100);
    ASSERT_EQ(map().m_height, 1);
    Internal* oldRoot = Root();
    ASSERT_EQ(oldRoot->m_numKeyEntrys, 100);
    for (uint64 i = 0; i < 50; ++i) {
        map()[K(25000 + 10 * i + 1)];
    }
    Leaf* leaf50 = LeafAt(50);
    ASSERT_EQ(leaf50->m_numKeyEntrys, 100);
    ASSERT_EQ(oldRoot->m_numKeyEntrys, 100);
    Leaf* leaf51 = LeafAt(51);
    std::vector<FieldId> oldSeparators;
    for (ssize_t i = 0; i < 100; ++i) {
        oldSeparators.push_back(oldRoot->GetEntry(i).m_key);
    }
    Commit();

    map()[K(25002)];
    ASSERT_EQ(map().m_height, 2);
    Leaf* newLeaf = leaf50->m_next.Get();
    ASSERT_NE(newLeaf, leaf51);
    Internal* newRoot = Root();
    ASSERT_EQ(newRoot->m_numKeyEntrys, 1);
    EXPECT_EQ(newRoot->GetEntry(0).m_key, newLeaf->GetEntry(0).first);
    EXPECT_EQ(newRoot->m_ptr.Get(), static_cast<void*>(oldRoot));
    auto* right = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(newRoot->GetEntry(0).m_ptr.Get());
    EXPECT_EQ(oldRoot->m_numKeyEntrys, 50);
    EXPECT_EQ(right->m_numKeyEntrys, 50);
    EXPECT_EQ(right->m_ptr.Get(), static_cast<void*>(newLeaf));
    for (ssize_t i = 0; i < 50; ++i) {
        EXPECT_EQ(oldRoot->GetEntry(i).m_key, oldSeparators[static_cast<std::size_t>(i)]);
        EXPECT_EQ(right->GetEntry(i).m_key, oldSeparators[static_cast<std::size_t>(i + 50)]);
    }
    EXPECT_EQ(Log().numDeclareReachable, 3);
    EXPECT_EQ(Log().lastReachableTo.m_self, newRoot);
    EXPECT_EQ(CommitAndListWrites(),
              (std::vector<uint64>{Oid(&map()), Oid(newLeaf), Oid(leaf51), Oid(leaf50), Oid(right),
                                   Oid(oldRoot), Oid(newRoot)}));
    EXPECT_BTREE_OK(map());
}

TEST_P(BTreeInsert, InternalSplitWithSeparatorOnEitherSide) {
    // Separator below position 50 (leaf 10 splits) and above it (leaf 90).
    for (uint64 leafIndex : {10u, 90u}) {
        SCOPED_TRACE(leafIndex);
        map().clear();
        InsertAscending(0, 5100);
        uint64 base = 500 * leafIndex;  // leaf j holds keys 500*j .. 500*j+490
        for (uint64 i = 0; i < 50; ++i) {
            map()[K(base + 10 * i + 1)];
        }
        ASSERT_EQ(map().m_height, 1);
        map()[K(base + 2)];
        EXPECT_EQ(map().m_height, 2);
        Internal* root = Root();
        EXPECT_EQ(root->m_numKeyEntrys, 1);
        EXPECT_EQ(map().m_size, 5151);
        EXPECT_BTREE_OK(map());
    }
}

// ---- Present keys ----------------------------------------------------------------------

TEST_P(BTreeInsert, PresentKeysKeepOrReplaceTheirPayload) {
    InsertAscending(0, 20);
    Leaf* leaf = map().m_firstLeaf.Get();
    Commit();

    auto [it, created] = map().insert({K(50), MakePayload(99)});
    EXPECT_FALSE(created);
    EXPECT_EQ(it.policy().m_leaf, leaf);
    EXPECT_EQ(it.policy().m_offset, 5);
    EXPECT_EQ(*map().rFind(K(50)), MakePayload(50));
    EXPECT_FALSE(map().Insert(K(50), MakePayload(99), false));
    EXPECT_EQ(*map().rFind(K(50)), MakePayload(50));
    EXPECT_EQ(map().m_size, 20);
    EXPECT_TRUE(CommitAndListWrites().empty());

    EXPECT_FALSE(map().Insert(K(50), MakePayload(99), true));
    EXPECT_EQ(*map().rFind(K(50)), MakePayload(99));
    EXPECT_EQ(CommitAndListWrites(), (std::vector<uint64>{Oid(leaf)}));

    EXPECT_EQ(map()[K(60)], MakePayload(60));
    EXPECT_EQ(map().m_size, 20);
    EXPECT_EQ(CommitAndListWrites(), (std::vector<uint64>{Oid(leaf)}));
}

TEST_P(BTreeInsert, InsertOfNewKeyStoresPayloadAndReportsIt) {
    EXPECT_TRUE(map().Insert(K(1), MakePayload(7), false));
    auto [it, created] = map().insert({K(2), MakePayload(8)});
    EXPECT_TRUE(created);
    EXPECT_EQ(it->second, MakePayload(8));
    EXPECT_EQ(*map().rFind(K(1)), MakePayload(7));
    EXPECT_EQ(map().size(), 2);
    EXPECT_EQ(map().count(K(2)), 1);
    EXPECT_EQ(map().count(K(3)), 0);
}

// ---- Whole-map operations ---------------------------------------------------------------

class BTreeWholeMap : public BTreeInsert {};
INSTANTIATE_TEST_SUITE_P(ShortAndLongKeys, BTreeWholeMap, ::testing::Bool());

TEST_P(BTreeWholeMap, ClearOfEmptyMapDeletesNothingButMarksTheMap) {
    Commit();
    map().clear();
    EXPECT_EQ(Log().numAsyncDeleteObject, 0);
    EXPECT_EQ(Log().numAsyncDeleteSubTree, 0);
    EXPECT_EQ(map().m_height, -1);
    EXPECT_EQ(map().m_size, 0);
    EXPECT_EQ(CommitAndListWrites(), (std::vector<uint64>{Oid(&map())}));
}

TEST_P(BTreeWholeMap, ClearHandsOnlyTheRootToSubTreeDeletion) {
    for (uint64 n : {1u, 120u, 5200u}) {
        SCOPED_TRACE(n);
        InsertAscending(0, n);
        void* root = map().m_root.Get();
        uint64 rootOid = map().m_height == 0
                             ? Oid(FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(root))
                             : Oid(Root());
        Commit();
        map().clear();
        EXPECT_EQ(Log().numAsyncDeleteSubTree, 1);
        EXPECT_EQ(Log().numAsyncDeleteObject, 0);
        EXPECT_EQ(Log().lastDeleted.m_self, root);
        EXPECT_FALSE(map().m_root);
        EXPECT_FALSE(map().m_firstLeaf);
        EXPECT_FALSE(map().m_lastLeaf);
        EXPECT_EQ(map().m_height, -1);
        EXPECT_EQ(map().m_size, 0);
        EXPECT_BTREE_OK(map());
        Commit();
        EXPECT_FALSE(m_store->Load(rootOid).has_value());
        EXPECT_EQ(m_space.NumResidents(), 1);  // only the map is left
    }
}

TEST_P(BTreeWholeMap, CopySharesNoNodeAndComparesEqual) {
    InsertAscending(0, 1000);
    Map copy(map());
    EXPECT_EQ(copy.m_size, 1000);
    EXPECT_BTREE_OK(copy);
    EXPECT_TRUE(copy == map());
    std::set<const void*> leaves;
    for (Leaf* l = map().m_firstLeaf.Get(); l; l = l->m_next.Get()) {
        leaves.insert(l);
    }
    for (Leaf* l = copy.m_firstLeaf.Get(); l; l = l->m_next.Get()) {
        EXPECT_EQ(leaves.count(l), 0u);
    }
    copy[K(5000)].Insert(testing::MakeSite(2), 9, 1);
    EXPECT_FALSE(copy == map());
    EXPECT_TRUE(copy != map());
}

TEST_P(BTreeWholeMap, CopyOfMapWithoutEntriesMakesNoNode) {
    map()[K(1)];
    map().Delete(K(1));
    ASSERT_EQ(map().m_height, 0);
    Map copy(map());
    EXPECT_EQ(copy.m_height, -1);
    EXPECT_FALSE(copy.m_root);
    EXPECT_TRUE(copy == map());
}

TEST_P(BTreeWholeMap, EqualityIgnoresLayout) {
    Map* down = DollarNew(new Map());
    for (uint64 i = 300; i-- > 0;) {
        down->Insert(K(10 * i), MakePayload(static_cast<int64>(10 * i)), false);
    }
    InsertAscending(0, 300);
    EXPECT_NE(LeafCounts(map()), LeafCounts(*down));
    EXPECT_TRUE(map() == *down);

    Map* cleared = DollarNew(new Map());
    Map* emptied = DollarNew(new Map());
    (*emptied)[K(1)];
    emptied->Delete(K(1));
    EXPECT_TRUE(*cleared == *emptied);
    EXPECT_FALSE(*cleared == map());
}

TEST_P(BTreeWholeMap, EqualSizeMapsDifferingInOneKeyOrPayloadAreUnequal) {
    InsertAscending(0, 200);
    Map otherKey(map());
    Map otherPayload(map());
    ASSERT_TRUE(otherKey == map());
    otherKey.Delete(K(1000));
    otherKey[K(1001)] = MakePayload(1000);
    otherPayload[K(1000)] = MakePayload(-5);
    EXPECT_EQ(otherKey.size(), map().size());
    EXPECT_FALSE(otherKey == map());
    EXPECT_FALSE(otherPayload == map());
}

TEST_P(BTreeWholeMap, AssignmentBuildsNewTreeAlsoForSelf) {
    InsertAscending(0, 250);
    Map* target = DollarNew(new Map());
    (*target)[K(3)];
    *target = map();
    EXPECT_TRUE(*target == map());
    EXPECT_NE(target->m_firstLeaf.Get(), map().m_firstLeaf.Get());
    EXPECT_BTREE_OK(*target);

    Leaf* before = map().m_firstLeaf.Get();
    Map& self = map();
    map() = self;
    EXPECT_EQ(map().m_size, 250);
    EXPECT_NE(map().m_firstLeaf.Get(), before);
    EXPECT_TRUE(map() == *target);
    EXPECT_BTREE_OK(map());
}

TEST_P(BTreeWholeMap, SwapExchangesHeadersAndMarksBoth) {
    InsertAscending(0, 150);
    Map* other = DollarNew(new Map());
    (*other)[K(1)];
    Leaf* mine = map().m_firstLeaf.Get();
    Leaf* theirs = other->m_firstLeaf.Get();
    Commit();
    map().swap(*other);
    EXPECT_EQ(map().m_size, 1);
    EXPECT_EQ(map().m_height, 0);
    EXPECT_EQ(other->m_size, 150);
    EXPECT_EQ(other->m_height, 1);
    EXPECT_EQ(map().m_firstLeaf.Get(), theirs);
    EXPECT_EQ(other->m_firstLeaf.Get(), mine);
    EXPECT_EQ(CommitAndListWrites(), (std::vector<uint64>{Oid(&map()), Oid(other)}));
    map().swap(*other);
    EXPECT_EQ(map().m_size, 150);
    EXPECT_EQ(map().m_firstLeaf.Get(), mine);
    EXPECT_EQ(other->m_firstLeaf.Get(), theirs);
    EXPECT_BTREE_OK(map());
    EXPECT_BTREE_OK(*other);
}

TEST_P(BTreeWholeMap, EqualityStopsOnSizeThatDisagreesWithLeaves) {
    InsertAscending(0, 3);
    Map* shorter = DollarNew(new Map());
    shorter->Insert(K(0), MakePayload(0), false);
    shorter->Insert(K(10), MakePayload(10), false);
    EXPECT_TARN_ASSERT(
        {
            shorter->m_size = 3;
            (void)(map() == *shorter);
        },
        "j != rhs.end()");
    EXPECT_TARN_ASSERT(
        {
            shorter->m_size = 3;
            (void)(*shorter == map());
        },
        "j == rhs.end()");
}

// ---- Handles ------------------------------------------------------------------------------

TEST_P(BTreeWholeMap, HandleCreatesForwardsAndClears) {
    btreemap<Map> handle;
    EXPECT_FALSE(handle);
    handle.OnCreate(true);
    ASSERT_TRUE(handle);
    handle[K(1)].Insert(testing::MakeSite(1), 1, 5);
    handle[K(2)];
    EXPECT_EQ(handle.size(), 2);
    EXPECT_FALSE(handle.empty());
    EXPECT_EQ(handle.count(K(1)), 1);
    ASSERT_NE(handle.find_2(K(1)), nullptr);
    EXPECT_EQ(*handle.find_2(K(1)), MakePayload(5, 1, 1));
    EXPECT_TRUE(handle.find(K(3)) == handle.end());
    handle.clear();
    EXPECT_TRUE(handle.empty());
    EXPECT_EQ(handle->m_height, -1);
}

}  // namespace
}  // namespace tarn
