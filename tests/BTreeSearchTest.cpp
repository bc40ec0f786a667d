// Lookups and iteration of the persistent B+tree map at the positions a
// random walk rarely pins down exactly: empty maps, leaf boundaries,
// separators, the position before the first entry, misuse of iterators,
// damaged trees. Also checks that the shared tree checker notices broken
// invariants.

#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <utility>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodeRules.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapWalk.h"

namespace tarn {
namespace {

using testing::CheckBTree;
using Policy = FieldIdToOffsetOpsOnInt64FieldMap::IteratorPolicy;

class BTreeSearch : public testing::BTreeSpaceTest {
protected:
    const Map& cmap() { return map(); }
    static const Policy& P(const Map::const_iterator& it) { return it.policy(); }

    // begin, end, and find, lower_bound and upper_bound of a key all stand at
    // `at`.
    void ExpectEverythingAt(const Policy& at) {
        EXPECT_TRUE(P(cmap().find(K(1))) == at);
        EXPECT_TRUE(P(cmap().lower_bound(K(1))) == at);
        EXPECT_TRUE(P(cmap().upper_bound(K(1))) == at);
        EXPECT_TRUE(P(cmap().begin()) == at);
        EXPECT_TRUE(P(cmap().end()) == at);
        EXPECT_TRUE(cmap().rbegin() == cmap().rend());
    }
};

TEST_F(BTreeSearch, MapWithoutRootAnswersNullPositionEverywhere) {
    ExpectEverythingAt(Policy(nullptr, 0));
    EXPECT_EQ(cmap().rFind(K(1)), nullptr);
    EXPECT_TARN_ASSERT(
        {
            Map::const_iterator it = cmap().begin();
            ++it;
        },
        "m_leaf");
}

TEST_F(BTreeSearch, EmptyRootLeafAnswersItsEnd) {
    Put(1 * kGap);
    ASSERT_TRUE(map().Delete(K(1)));
    ExpectEverythingAt(Policy(LeafAt(0), 0));
}

// K(1) .. K(101): leaves K(1) .. K(50) and K(51) .. K(101), separator K(51).
TEST_F(BTreeSearch, BoundsAcrossTheLeafBoundaryAndAtTheSeparator) {
    Fill(1, 101);
    Leaf* first = LeafAt(0);
    Leaf* second = LeafAt(1);
    // Between the leaves the descent ends in the first leaf, which holds
    // nothing at or above the key.
    Map::const_iterator lb = cmap().lower_bound(Key(50500));
    EXPECT_TRUE(P(lb) == Policy(second, 0));
    Map::const_iterator stepped = cmap().find(K(50));
    ++stepped;
    EXPECT_TRUE(lb == stepped);
    EXPECT_TRUE(P(cmap().upper_bound(K(50))) == Policy(second, 0));
    // A key equal to the separator is in the right child.
    EXPECT_EQ(Root()->FindChildGivenKey2(K(51)), std::make_pair<void*>(second, ssize_t{0}));
    EXPECT_EQ(Root()->FindChildGivenKey2(Key(50999)), std::make_pair<void*>(first, ssize_t{-1}));
    EXPECT_EQ(Root()->FindChildIndexGivenKey(K(51)), 0);
    EXPECT_TRUE(P(cmap().find(K(51))) == Policy(second, 0));
    // Present keys, and keys beyond either end.
    EXPECT_EQ(cmap().lower_bound(K(30))->first, K(30));
    EXPECT_EQ(cmap().upper_bound(K(30))->first, K(31));
    EXPECT_EQ(cmap().lower_bound(K(0))->first, K(1));
    EXPECT_TRUE(cmap().lower_bound(K(102)) == cmap().end());
    EXPECT_TRUE(cmap().upper_bound(K(101)) == cmap().end());
}

TEST_F(BTreeSearch, SteppingBeforeBeginComesBackAndMisuseStops) {
    Fill(1, 120);
    Map::const_iterator it = cmap().begin();
    --it;
    EXPECT_TRUE(P(it) == Policy(LeafAt(0), -1));
    ++it;
    EXPECT_TRUE(it == cmap().begin());
    --it;
    EXPECT_TARN_ASSERT(--it, "0 <= m_offset && m_offset <= m_leaf->m_numKeyEntrys");
    EXPECT_TARN_ASSERT((void)*it, "0 <= m_offset && m_offset < m_leaf->m_numKeyEntrys");
    Map::const_iterator end = cmap().end();
    EXPECT_TARN_ASSERT(++end, "-1 <= m_offset && m_offset < m_leaf->m_numKeyEntrys");
    EXPECT_TARN_ASSERT((void)*end, "0 <= m_offset && m_offset < m_leaf->m_numKeyEntrys");
    Map::iterator mend = map().end();
    EXPECT_TARN_ASSERT((void)*mend, "0 <= m_offset && m_offset < m_leaf->m_numKeyEntrys");
    EXPECT_TARN_ASSERT(map().SearchLeaf(K(1), nullptr), "leaf");
}

TEST_F(BTreeSearch, OnlyMutableDereferenceMarksTheLeaf) {
    Fill(1, 10);
    Commit();
    EXPECT_EQ(cmap().begin()->first, K(1));
    EXPECT_FALSE(LeafAt(0)->IsDirty());
    map().begin()->second.Insert(testing::MakeSite(3), 5, 1);
    EXPECT_TRUE(LeafAt(0)->IsDirty());
    EXPECT_FALSE(map().IsDirty());
}

// A tree whose header or nodes contradict each other stops the lookup that
// met the damage, and the message names that lookup, const or not.
TEST_F(BTreeSearch, DamagedTreeStopsTheLookupThatWasCalled) {
    // The functions as GCC prints them.
    const std::string m = "tarn::FieldIdToOffsetOpsOnInt64FieldMap::";
    const std::string key = "(const tarn::FieldId&)";
    const struct {
        std::string function;
        std::function<void()> call;
    } lookups[] = {
        {m + "const_iterator " + m + "find" + key + " const", [&] { cmap().find(K(1)); }},
        {m + "iterator " + m + "find" + key, [&] { map().find(K(1)); }},
        {m + "const_iterator " + m + "lower_bound" + key + " const",
         [&] { cmap().lower_bound(K(1)); }},
        {m + "iterator " + m + "lower_bound" + key, [&] { map().lower_bound(K(1)); }},
        {m + "const_iterator " + m + "upper_bound" + key + " const",
         [&] { cmap().upper_bound(K(1)); }},
        {m + "iterator " + m + "upper_bound" + key, [&] { map().upper_bound(K(1)); }},
        {"const tarn::OffsetOpsOnField<long int>* " + m + "rFind" + key + " const",
         [&] { cmap().rFind(K(1)); }},
    };
    // A root but no height, and a height but no root.
    Put(1 * kGap);
    EXPECT_TARN_ASSERT_IN(
        {
            map().m_height = -1;
            lookups[0].call();
        },
        lookups[0].function, "m_height >= 0");
    EXPECT_TARN_ASSERT_IN(
        {
            map().m_root.Clear();
            lookups[1].call();
        },
        lookups[1].function, "m_height == -1");
    // K(1) lies under the root's leftmost child, whose reference is lost.
    Fill(2, 101);
    ASSERT_EQ(map().m_height, 1);
    for (const auto& lookup : lookups) {
        SCOPED_TRACE(lookup.function);
        EXPECT_TARN_ASSERT_IN(
            {
                Root()->m_ptr.Clear();
                lookup.call();
            },
            lookup.function, "node");
    }
    EXPECT_TARN_ASSERT_IN(
        {
            map().m_lastLeaf.Clear();
            map().end();
        },
        m + "iterator " + m + "end()", "m_lastLeaf");
    // The child index is the index of the search that fetches the child.
    EXPECT_TARN_ASSERT_IN(
        {
            Root()->m_numKeyEntrys = 0;
            Root()->FindChildIndexGivenKey(K(1));
        },
        "std::pair<void*, long int> "
        "tarn::FieldIdToOffsetOpsOnInt64FieldMapInternalNode::FindChildGivenKey2" +
            key + " const",
        "1 <= nk && nk <= 100");
}

// The checker is what every tree test trusts; it must see each kind of damage.
TEST_F(BTreeSearch, CheckerNoticesEveryKindOfDamage) {
    Fill(1, 300);
    Leaf* first = LeafAt(0);
    Leaf* second = LeafAt(1);
    ssize_t size = 301;
    ssize_t count = 49;
    decltype(second->m_prev) none;
    decltype(map().m_lastLeaf) wrongLast;
    wrongLast = first;
    auto twice = Root()->GetEntry(0).m_ptr;
    // Each damage undoes itself when applied again.
    const std::function<void()> damages[] = {
        [&] { std::swap(map().m_size, size); },
        [&] { std::swap(second->m_prev, none); },
        [&] { std::swap(first->GetEntry(3).first, first->GetEntry(4).first); },
        [&] { std::swap(first->GetEntry(49).first, second->GetEntry(0).first); },
        [&] { std::swap(first->m_numKeyEntrys, count); },
        [&] { std::swap(map().m_lastLeaf, wrongLast); },
        [&] { std::swap(Root()->GetEntry(1).m_ptr, twice); },  // a child reached twice
    };
    ASSERT_EQ(CheckBTree(map()), "");
    for (const auto& damage : damages) {
        damage();
        EXPECT_NE(CheckBTree(map()), "");
        damage();
        EXPECT_EQ(CheckBTree(map()), "");
    }
}

// What a node may hold at each place: the one rule every check of a stored
// tree uses.
TEST(BTreeNodeRules, EachPlaceHasItsClassAndEntryRange) {
    using Rule = FieldIdToOffsetOpsOnInt64FieldMapNodeRule;
    const ReflectedClass* leaf = &GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>();
    const ReflectedClass* internal =
        &GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>();
    struct Case {
        ssize_t level;
        bool isRoot;
        const ReflectedClass* nodeClass;
        ssize_t least;
    };
    for (const Case& c :
         {Case{0, true, leaf, 0}, Case{0, false, leaf, 50}, Case{1, true, internal, 1},
          Case{1, false, internal, 50}, Case{3, true, internal, 1}, Case{3, false, internal, 50}}) {
        const Rule rule = FieldIdToOffsetOpsOnInt64FieldMapRuleAt(c.level, c.isRoot);
        EXPECT_EQ(rule.nodeClass, c.nodeClass) << c.level;
        EXPECT_EQ(&FieldIdToOffsetOpsOnInt64FieldMapClassAt(c.level), c.nodeClass);
        EXPECT_FALSE(rule.AllowsCount(c.least - 1)) << c.level << c.isRoot;
        EXPECT_TRUE(rule.AllowsCount(c.least));
        EXPECT_TRUE(rule.AllowsCount(100));
        EXPECT_FALSE(rule.AllowsCount(101));
        EXPECT_EQ(rule.CountProblem(101), "101 entries, not " + std::to_string(c.least) + "..100");
        EXPECT_EQ(rule.CountProblem(c.least), "");
    }
    EXPECT_EQ(FieldIdToOffsetOpsOnInt64FieldMapRuleAlone(false).minEntries, 0);
    EXPECT_EQ(FieldIdToOffsetOpsOnInt64FieldMapRuleAlone(true).minEntries, 1);
    EXPECT_EQ(FieldIdToOffsetOpsOnInt64FieldMapRuleAlone(true).maxEntries, 100);
}

// The walk every whole-tree check and the summary use: each node once, the
// leaves in key order, each within the separators its place hands down.
TEST_F(BTreeSearch, WalkVisitsEachNodeOnceWithTheBoundsOfItsPlace) {
    Fill(1, 6000);  // height 2
    class Recorder final : public FieldIdToOffsetOpsOnInt64FieldMapVisitor {
    public:
        bool Internal(const Place& place, const InternalNode& node) override {
            ++internals;
            EXPECT_EQ(place.isRoot, place.level == height);
            return node.m_numKeyEntrys > 0;
        }
        void Leaf(const Place& place, const LeafNode& leaf) override {
            EXPECT_EQ(place.level, 0);
            const FieldId& first = leaf.GetEntry(0).first;
            const FieldId& last = leaf.GetEntry(leaf.m_numKeyEntrys - 1).first;
            EXPECT_TRUE(place.lo == nullptr || !(first < *place.lo));
            EXPECT_TRUE(place.hi == nullptr || last < *place.hi);
            EXPECT_TRUE(keys.empty() || keys.back() < first);
            for (ssize_t i = 0; i < leaf.m_numKeyEntrys; ++i) {
                keys.push_back(leaf.GetEntry(i).first);
            }
        }
        void Unloadable(const Place&, const std::string& error) override { ADD_FAILURE() << error; }
        void ReachedTwice(const Place&) override { ADD_FAILURE() << "reached twice"; }
        void BetweenNodes() override { ++between; }

        ssize_t height = 0;
        int internals = 0;
        int between = 0;
        std::vector<FieldId> keys;
    } walk;
    walk.height = map().m_height;
    ASSERT_GE(walk.height, 2);
    WalkFieldIdToOffsetOpsOnInt64FieldMap(map(), walk);
    EXPECT_EQ(static_cast<ssize_t>(walk.keys.size()), map().size());
    EXPECT_EQ(walk.internals + static_cast<int>(testing::LeafCounts(map()).size()), walk.between);
    EXPECT_EQ(walk.internals + static_cast<ssize_t>(testing::LeafCounts(map()).size()),
              map().GetNumNodes());
}

}  // namespace
}  // namespace tarn
