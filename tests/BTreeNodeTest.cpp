// The B+tree's nodes on their own: raw slot moves and deep node copies
// through the reflection type operations. Sanitizer builds check that every
// entry is destroyed exactly once. (The classes' reflection records are
// checked with the record's.)

#include <gtest/gtest.h>

#include "tests/BTreeCheck.h"

namespace tarn {
namespace {

using testing::MakeKey;
using testing::MakePayload;

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
using Internal = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;

// Puts key i (long path) with payload i into raw slot `pos` of a leaf.
void Place(Leaf* leaf, ssize_t pos, uint64 i) {
    auto& e = leaf->GetEntry(pos);
    FieldIdToOffsetOpsOnInt64FieldMapCopyConstructKey(e.first, MakeKey(i, true));
    FieldIdToOffsetOpsOnInt64FieldMapConstructPayload(e.second);
    e.second = MakePayload(int64(i));
}

void Fill(Leaf* leaf, uint64 n) {
    for (uint64 i = 0; i < n; ++i) {
        Place(leaf, ssize_t(i), i);
    }
    leaf->m_numKeyEntrys = ssize_t(n);
}

void ExpectEntry(const Leaf& leaf, ssize_t pos, uint64 i) {
    EXPECT_EQ(leaf.GetEntry(pos).first, MakeKey(i, true)) << pos;
    EXPECT_EQ(leaf.GetEntry(pos).second, MakePayload(int64(i))) << pos;
}

TEST(BTreeNodeSlots, ShiftsAndMovesKeepLongKeysIntact) {
    Leaf a;
    Fill(&a, 99);
    ShiftLeafEntries(&a, 0, 0, 0);     // count 0: nothing
    ShiftLeafEntries(&a, 10, 11, 89);  // slots 10..98 up by one: fills slot 99
    Place(&a, 10, 1000);
    a.m_numKeyEntrys = 100;
    ExpectEntry(a, 99, 98);
    ExpectEntry(a, 11, 10);
    ExpectEntry(a, 10, 1000);
    ExpectEntry(a, 9, 9);

    Leaf b;
    MoveLeafEntries(&a, 50, &b, 0, 50);
    a.m_numKeyEntrys = b.m_numKeyEntrys = 50;
    for (ssize_t i = 0; i < 50; ++i) {
        ExpectEntry(b, i, uint64(i + 49));
    }
    ResizeArrayElements(&b.GetEntry(0), 50, 50);  // equal counts: nothing
    ExpectEntry(b, 49, 98);
}

TEST(BTreeNodeSlots, CopiesAreDeepAndAssignmentReplacesEntries) {
    Leaf src;
    Fill(&src, 70);
    const TypeOps* ops = _GetTypeOps(static_cast<const Leaf*>(nullptr));
    alignas(Leaf) unsigned char raw[sizeof(Leaf)];
    ops->m_CopyConstructArrayFn(raw, sizeof(Leaf), &src, sizeof(Leaf), 1);
    Leaf& copy = *reinterpret_cast<Leaf*>(raw);
    ASSERT_EQ(copy.m_numKeyEntrys, 70);
    for (ssize_t i = 0; i < 70; ++i) {
        ExpectEntry(copy, i, uint64(i));
        EXPECT_NE(copy.GetEntry(i).first.path.data(), src.GetEntry(i).first.path.data());
    }
    copy.GetEntry(0).second.Insert(testing::MakeSite(9), 5, 5);
    ExpectEntry(src, 0, 0);

    Leaf small;
    Fill(&small, 3);
    ops->m_AssignArrayFn(raw, sizeof(Leaf), &small, sizeof(Leaf), 1);
    copy = copy;
    ASSERT_EQ(copy.m_numKeyEntrys, 3);
    ExpectEntry(copy, 2, 2);
    ops->m_DestructArrayFn(raw, sizeof(Leaf), 1);

    Internal node;
    FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry e;
    e.m_key = MakeKey(77, true);
    CopyConstructInternalEntry(&node, 0, e);
    node.m_numKeyEntrys = 1;
    Internal nodeCopy(node);
    ASSERT_EQ(nodeCopy.m_numKeyEntrys, 1);
    EXPECT_EQ(nodeCopy.GetEntry(0).m_key, e.m_key);
    EXPECT_NE(nodeCopy.GetEntry(0).m_key.path.data(), node.GetEntry(0).m_key.path.data());
}

}  // namespace
}  // namespace tarn
