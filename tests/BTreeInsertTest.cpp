// Insertion into the persistent B+tree map: exact split shapes, the dirty
// marks and reachability declarations of each insertion event, and the
// whole-map operations (clear, copy, assignment, swap, equality).
//
// Dirty marks are observed through the store: a commit writes the objects in
// the order the space queued them (first mark or registration since the
// previous commit), so after a commit the next operation's marks can be read
// back in order.

#include <gtest/gtest.h>

#include <vector>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"

namespace tarn {
namespace {

using testing::LeafCounts;
using testing::MakePayload;
using testing::MakeSite;
using testing::Oid;
using testing::operator+;
using testing::Slice;
using Writes = std::vector<uint64>;

// Runs every test with short (local buffer) and long (heap) paths.
class BTreeInsert : public testing::BTreeSpaceTest, public ::testing::WithParamInterface<bool> {
protected:
    BTreeInsert() { m_longKeys = GetParam(); }
};

INSTANTIATE_TEST_SUITE_P(ShortAndLongKeys, BTreeInsert, ::testing::Bool());

// ---- Split shapes ---------------------------------------------------------------

// The first key makes a root leaf declared reachable from the map; ascending
// keys then fill it and leave every leaf but the last with 50 entries.
// Splitting the last leaf makes the new leaf the last one (and here grows a
// root); each separator is the first key of the leaf to its right.
TEST_P(BTreeInsert, AscendingKeysFromEmptyMap) {
    Commit();
    OffsetOpsOnField<int64>& payload = map()[K(1)];
    Leaf* left = LeafAt(0);
    EXPECT_EQ(&left->GetEntry(0).second, &payload);
    EXPECT_EQ(payload, OffsetOpsOnField<int64>());
    EXPECT_EQ(Log().numDeclareReachable, 1);
    EXPECT_EQ(Log().lastReachableFrom.m_self, &map());
    EXPECT_EQ(Log().lastReachableTo.m_self, left);
    // The new leaf was queued by its registration, then the header was marked.
    EXPECT_EQ(CommitAndListWrites(), (Writes{Oid(left), Oid(&map())}));
    EXPECT_BTREE_OK(map());

    Fill(2, 100);
    EXPECT_EQ(LeafCounts(map()), std::vector<ssize_t>{100});
    Commit();
    Put(101 * kGap);
    Leaf* right = map().m_lastLeaf.Get();
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 51}));
    EXPECT_EQ(Log().numDeclareReachable, 2);  // the leaf from its left, the root from the map
    EXPECT_EQ(Log().lastReachableFrom.m_self, &map());
    EXPECT_EQ(Log().lastReachableTo.m_self, Root());
    EXPECT_EQ(CommitAndListWrites(), (Writes{Oid(&map()), Oid(right), Oid(left), Oid(Root())}));
    Fill(102, 150);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 100}));
    Fill(151, 151);
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 50, 51}));
    EXPECT_EQ(EntriesOf(Root()),
              One(0, left) + One(51 * kGap, right) + One(101 * kGap, map().m_lastLeaf.Get()));
    EXPECT_BTREE_OK(map());
}

TEST_P(BTreeInsert, NewKeyInFullLeafLandsAtItsSortedPlace) {
    struct {
        uint64 num;      // old keys are K(1) .. K(100)
        bool inLeft;     // lands in the old (left) leaf
        ssize_t offset;  // slot in that leaf
    } const cases[] = {{500, true, 0}, {100500, false, 50}, {49500, true, 49}, {50500, false, 0}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.num);
        map().clear();
        Fill(1, 100);
        Leaf* left = map().m_firstLeaf.Get();
        auto [it, created] = testing::InsertEntry(map(), Key(c.num), MakePayload(-1));
        ASSERT_TRUE(created);
        Leaf* right = map().m_lastLeaf.Get();
        EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 51}));
        EXPECT_EQ(it.policy().m_leaf, c.inLeft ? left : right);
        EXPECT_EQ(it.policy().m_offset, c.offset);
        EXPECT_EQ(testing::KeyNum(it->first), c.num);
        EXPECT_EQ(it->second, MakePayload(-1));
        EXPECT_EQ(Separators(Root()), Keys{testing::KeyNum(right->GetEntry(0).first)});
        EXPECT_BTREE_OK(map());
    }
}

// A new root takes the split's separator entry by a raw swap. Keys (a long
// one in a heap buffer) and references change places; the heap buffer itself
// moves, so each key keeps one owner and is destroyed once, with its entry.
using BTreeEntrySwap = testing::BTreeSpaceTest;

TEST_F(BTreeEntrySwap, InternalEntriesExchangeKeysAndReferencesAsBytes) {
    using Entry = FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry;
    Leaf* child[2] = {DollarNew(new Leaf()), DollarNew(new Leaf())};
    const FieldId shortKey = testing::MakeKey(1);
    const FieldId longKey = testing::MakeKey(2, true);
    Entry a;
    a.m_key = shortKey;
    a.m_ptr = child[0];
    Entry b;
    b.m_key = longKey;
    b.m_ptr = child[1];
    const octet_t* heapBytes = b.m_key.path.data();
    ASSERT_FALSE(b.m_key.path.IsLocal());

    a.swap(b);
    EXPECT_EQ(a.m_key, longKey);
    EXPECT_EQ(a.m_key.path.data(), heapBytes);
    EXPECT_EQ(a.m_ptr.Get(), static_cast<void*>(child[1]));
    EXPECT_EQ(b.m_key, shortKey);
    EXPECT_TRUE(b.m_key.path.IsLocal());
    EXPECT_EQ(b.m_ptr.Get(), static_cast<void*>(child[0]));
}

// ---- Dirty marks and reachability per event ------------------------------------

TEST_P(BTreeInsert, SplittingMiddleLeafRelinksItsSuccessor) {
    Fill(1, 150);  // leaves of 50 and 100
    for (uint64 i = 1; i <= 50; ++i) {
        Put(i * kGap + 1);  // the first leaf holds 100
    }
    Leaf* left = LeafAt(0);
    Leaf* last = LeafAt(1);
    Commit();
    Put(2);
    Leaf* middle = left->m_next.Get();
    EXPECT_EQ(LeafCounts(map()), (std::vector<ssize_t>{50, 51, 100}));
    EXPECT_EQ(last->m_prev.Get(), middle);
    EXPECT_BTREE_OK(map());  // the chain runs both ways, the last leaf stays the last
    EXPECT_EQ(Log().numDeclareReachable, 1);
    EXPECT_EQ(Log().lastReachableFrom.m_self, left);
    EXPECT_EQ(Log().lastReachableTo.m_self, middle);
    // Header (the count), new leaf (registered), old successor, split leaf,
    // then the parent that took the separator.
    EXPECT_EQ(CommitAndListWrites(),
              (Writes{Oid(&map()), Oid(middle), Oid(last), Oid(left), Oid(Root())}));
}

// 5100 ascending keys: leaves 0..99 of 50 keys and leaf 100 of 100 under a
// root with 100 separators. Leaf j is filled and split, so its new separator
// goes to position j of the full root: the separator at position 50 of the
// 101 goes up (for j = 50 the inserted one), with its child as the new right
// node's leftmost child.
TEST_P(BTreeInsert, InternalSplitPromotesTheMiddleSeparator) {
    for (uint64 j : {50u, 10u, 90u}) {
        SCOPED_TRACE(j);
        map().clear();
        Fill(1, 5100);
        for (uint64 i = 1; i <= 50; ++i) {
            Put((50 * j + i) * kGap + 1);
        }
        Leaf* split = LeafAt(j);
        Leaf* successor = LeafAt(j + 1);
        Internal* oldRoot = Root();
        const Entries before = EntriesOf(oldRoot);
        Commit();

        Put((50 * j + 1) * kGap + 2);
        ASSERT_EQ(map().m_height, 2);
        Leaf* added = split->m_next.Get();
        const Entries all = Slice(before, 0, j + 1) +
                            One(testing::KeyNum(added->GetEntry(0).first), added) +
                            Slice(before, j + 1, 101);
        Internal* right = AsInternal(Root()->GetEntry(0).m_ptr.Get());
        EXPECT_EQ(EntriesOf(Root()), One(0, oldRoot) + One(all[51].first, right));
        EXPECT_EQ(EntriesOf(oldRoot), Slice(all, 0, 51));
        EXPECT_EQ(EntriesOf(right), One(0, all[51].second) + Slice(all, 52, 102));
        EXPECT_EQ(Log().numDeclareReachable, 3);
        EXPECT_EQ(Log().lastReachableTo.m_self, Root());
        EXPECT_EQ(CommitAndListWrites(),
                  (Writes{Oid(&map()), Oid(added), Oid(successor), Oid(split), Oid(right),
                          Oid(oldRoot), Oid(Root())}));
        EXPECT_BTREE_OK(map());
    }
}

TEST_P(BTreeInsert, PresentKeysKeepOrReplaceTheirPayload) {
    Fill(1, 20);
    Leaf* leaf = LeafAt(0);
    Commit();
    auto [it, created] = testing::InsertEntry(map(), K(6), MakePayload(99));
    EXPECT_FALSE(created);
    EXPECT_EQ(it.policy().m_leaf, leaf);
    EXPECT_EQ(it.policy().m_offset, 5);
    EXPECT_FALSE(map().Insert(K(6), MakePayload(99), false));
    EXPECT_EQ(*map().rFind(K(6)), MakePayload(6 * kGap));
    EXPECT_TRUE(CommitAndListWrites().empty());

    EXPECT_FALSE(map().Insert(K(6), MakePayload(99), true));
    EXPECT_EQ(*map().rFind(K(6)), MakePayload(99));
    EXPECT_EQ(CommitAndListWrites(), Writes{Oid(leaf)});

    EXPECT_EQ(map()[K(7)], MakePayload(7 * kGap));
    EXPECT_EQ(CommitAndListWrites(), Writes{Oid(leaf)});

    // A new key without a split: the header (its count), then the leaf.
    map()[Key(5 * kGap + 1)].Insert(MakeSite(1), 3, 4);
    EXPECT_EQ(Log().numDeclareReachable + Log().numRegisterGcObject, 0);
    EXPECT_EQ(CommitAndListWrites(), (Writes{Oid(&map()), Oid(leaf)}));
}

// ---- Whole-map operations -------------------------------------------------------

TEST_P(BTreeInsert, ClearHandsOnlyTheRootToSubTreeDeletion) {
    for (uint64 n : {0u, 1u, 120u, 5200u}) {
        SCOPED_TRACE(n);
        Fill(1, n);
        void* root = map().m_root.Get();
        const uint64 rootOid = n == 0 ? 0 : map().m_height == 0 ? Oid(AsLeaf(root)) : Oid(Root());
        Commit();
        map().clear();
        EXPECT_EQ(Log().numAsyncDeleteSubTree, n == 0 ? 0 : 1);
        EXPECT_EQ(Log().numAsyncDeleteObject, 0);
        EXPECT_EQ(Log().lastDeleted.m_self, root);
        EXPECT_EQ(map().m_height, -1);
        EXPECT_BTREE_OK(map());
        EXPECT_EQ(CommitAndListWrites(), Writes{Oid(&map())});
        EXPECT_FALSE(m_store->Load(rootOid).has_value());
        EXPECT_EQ(m_space.NumResidents(), 1);  // only the map is left
    }
}

TEST_P(BTreeInsert, CopiesShareNoLeafAndEqualityComparesEntriesOnly) {
    Fill(1, 1000);
    Map copy(map());
    EXPECT_BTREE_OK(copy);
    EXPECT_TRUE(copy == map());
    copy[K(500)].Insert(MakeSite(2), 9, 1);  // would change both if they shared a leaf
    EXPECT_FALSE(copy == map());
    EXPECT_TRUE(copy != map());

    // Same size, one key or one payload different.
    Map otherKey(map());
    Map otherPayload(map());
    otherKey.Delete(K(1000));
    otherKey[Key(1000 * kGap + 1)] = MakePayload(1000 * kGap);
    otherPayload[K(1000)] = MakePayload(-5);
    EXPECT_FALSE(otherKey == map());
    EXPECT_FALSE(otherPayload == map());

    // Equal entries in different layouts; a cleared and an emptied map.
    Map* down = DollarNew(new Map());
    for (uint64 i = 1000; i >= 1; --i) {
        down->Insert(K(i), MakePayload(int64(i * kGap)), false);
    }
    EXPECT_NE(LeafCounts(map()), LeafCounts(*down));
    EXPECT_TRUE(map() == *down);
    Map* emptied = DollarNew(new Map());
    (*emptied)[K(1)];
    emptied->Delete(K(1));
    Map copyOfEmptied(*emptied);
    EXPECT_EQ(copyOfEmptied.m_height, -1);  // no node for no entry
    EXPECT_TRUE(Map() == *emptied);
    EXPECT_TRUE(copyOfEmptied == *emptied);
    EXPECT_FALSE(Map() == map());
}

// The runtime copies nodes in place through their records' type operations.
TEST_P(BTreeInsert, NodeCopiesThroughTypeOperationsAreDeep) {
    Fill(1, 101);
    Leaf* src = LeafAt(0);
    const TypeOps* ops = _GetTypeOps(static_cast<const Leaf*>(nullptr));
    alignas(Leaf) unsigned char raw[sizeof(Leaf)];
    ops->m_CopyConstructArrayFn(raw, sizeof(Leaf), src, sizeof(Leaf), 1);
    Leaf& copy = *reinterpret_cast<Leaf*>(raw);
    EXPECT_EQ(LeafKeys(&copy), LeafKeys(src));
    for (ssize_t i = 0; i < 50; ++i) {
        EXPECT_EQ(copy.GetEntry(i).second, src->GetEntry(i).second);
        EXPECT_NE(copy.GetEntry(i).first.path.data(), src->GetEntry(i).first.path.data());
    }
    copy.GetEntry(0).second.Insert(MakeSite(9), 5, 5);
    EXPECT_EQ(src->GetEntry(0).second, MakePayload(1 * kGap));
    Map* small = DollarNew(new Map());
    small->Insert(K(7), MakePayload(7), false);
    ops->m_AssignArrayFn(raw, sizeof(Leaf), small->m_firstLeaf.Get(), sizeof(Leaf), 1);
    copy = copy;
    EXPECT_EQ(LeafKeys(&copy), Keys{7 * kGap});
    ops->m_DestructArrayFn(raw, sizeof(Leaf), 1);

    Internal nodeCopy(*Root());
    EXPECT_EQ(EntriesOf(&nodeCopy), EntriesOf(Root()));
    EXPECT_NE(nodeCopy.GetEntry(0).m_key.path.data(), Root()->GetEntry(0).m_key.path.data());
}

TEST_P(BTreeInsert, EqualityStopsOnSizeThatDisagreesWithLeaves) {
    Fill(1, 3);
    Map* shorter = DollarNew(new Map());
    shorter->Insert(K(1), MakePayload(1 * kGap), false);
    shorter->Insert(K(2), MakePayload(2 * kGap), false);
    shorter->m_size = 3;
    EXPECT_TARN_ASSERT((void)(map() == *shorter), "j != rhs.end()");
    EXPECT_TARN_ASSERT((void)(*shorter == map()), "j == rhs.end()");
}

TEST_P(BTreeInsert, AssignmentBuildsNewTreeAlsoForSelfAndSwapTwiceRestores) {
    Fill(1, 250);
    Map* target = DollarNew(new Map());
    (*target)[Key(3 * kGap + 1)];
    *target = map();
    EXPECT_TRUE(*target == map());
    EXPECT_NE(target->m_firstLeaf.Get(), map().m_firstLeaf.Get());
    EXPECT_BTREE_OK(*target);
    Leaf* before = map().m_firstLeaf.Get();
    Map& self = map();
    map() = self;
    EXPECT_NE(map().m_firstLeaf.Get(), before);
    EXPECT_TRUE(map() == *target);
    EXPECT_BTREE_OK(map());

    Map* other = DollarNew(new Map());
    (*other)[K(1)];
    Leaf* mine = map().m_firstLeaf.Get();
    Leaf* theirs = other->m_firstLeaf.Get();
    Commit();
    map().swap(*other);
    EXPECT_TRUE(map().m_size == 1 && map().m_height == 0 && map().m_firstLeaf.Get() == theirs);
    EXPECT_TRUE(other->m_size == 250 && other->m_height == 1 && other->m_firstLeaf.Get() == mine);
    EXPECT_EQ(CommitAndListWrites(), (Writes{Oid(&map()), Oid(other)}));
    map().swap(*other);
    EXPECT_TRUE(map() == *target);
    EXPECT_EQ(map().m_firstLeaf.Get(), mine);
    EXPECT_EQ(other->m_firstLeaf.Get(), theirs);
    EXPECT_BTREE_OK(*other);
}

}  // namespace
}  // namespace tarn
