// The B+tree's nodes on their own: raw slot moves, runs of slots, deep node
// copies through the reflection type operations, and the reflection records
// and registration of the three classes.

#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"

namespace tarn {
namespace {

using testing::MakeKey;
using testing::MakePayload;

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
using Internal = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
using LeafEntry = FieldIdToOffsetOpsOnInt64FieldMapLeafKeyEntry;

// Puts key i (long path) with payload i into slot `pos` of a raw leaf slot.
void Place(Leaf* leaf, ssize_t pos, uint64 i) {
    LeafEntry& e = leaf->GetEntry(pos);
    FieldIdToOffsetOpsOnInt64FieldMapCopyConstructKey(e.first, MakeKey(i, true));
    FieldIdToOffsetOpsOnInt64FieldMapConstructPayload(e.second);
    e.second = MakePayload(static_cast<int64>(i));
}

void Fill(Leaf* leaf, uint64 n) {
    for (uint64 i = 0; i < n; ++i) {
        Place(leaf, static_cast<ssize_t>(i), i);
    }
    leaf->m_numKeyEntrys = static_cast<ssize_t>(n);
}

TEST(BTreeNodeSlots, NewNodesAreEmpty) {
    Leaf leaf;
    Internal node;
    Map map;
    EXPECT_EQ(leaf.m_numKeyEntrys, 0);
    EXPECT_FALSE(leaf.m_prev);
    EXPECT_FALSE(leaf.m_next);
    EXPECT_EQ(node.m_numKeyEntrys, 0);
    EXPECT_FALSE(node.m_ptr);
    EXPECT_EQ(map.m_height, -1);
    EXPECT_EQ(map.m_size, 0);
    EXPECT_FALSE(map.m_root);
}

TEST(BTreeNodeSlots, ShiftIntoTheLastSlotAndMoveKeepLongKeysIntact) {
    Leaf a;
    Fill(&a, 99);
    ShiftLeafEntries(&a, 0, 0, 0);  // count 0: nothing
    ShiftLeafEntries(&a, 10, 11, 89);
    Place(&a, 10, 1000);
    a.m_numKeyEntrys = 100;
    EXPECT_EQ(a.GetEntry(99).first, MakeKey(98, true));
    EXPECT_EQ(a.GetEntry(99).second, MakePayload(98));
    EXPECT_EQ(a.GetEntry(11).first, MakeKey(10, true));
    EXPECT_EQ(a.GetEntry(10).first, MakeKey(1000, true));

    Leaf b;
    MoveLeafEntries(&a, 50, &b, 0, 50);
    b.m_numKeyEntrys = 50;
    a.m_numKeyEntrys = 50;
    for (ssize_t i = 0; i < 50; ++i) {
        EXPECT_EQ(b.GetEntry(i).first, MakeKey(static_cast<uint64>(i + 49), true));
        EXPECT_EQ(b.GetEntry(i).second, MakePayload(i + 49));
    }
    // Both leaves destroy their own entries once (checked by the sanitizers).
}

TEST(BTreeNodeSlots, ResizeConstructsOrDestroysTheTail) {
    Leaf leaf;
    LeafEntry* p = &leaf.GetEntry(0);
    ResizeArrayElements(p, 0, 3);
    EXPECT_EQ(p[2].first, FieldId());
    EXPECT_EQ(p[2].second, OffsetOpsOnField<int64>());
    p[2].first = MakeKey(5, true);
    ResizeArrayElements(p, 3, 3);
    EXPECT_EQ(p[2].first, MakeKey(5, true));
    ResizeArrayElements(p, 3, 1);
    ResizeArrayElements(p, 1, 0);
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
        EXPECT_EQ(copy.GetEntry(i).first, src.GetEntry(i).first);
        EXPECT_NE(copy.GetEntry(i).first.path.data(), src.GetEntry(i).first.path.data());
        EXPECT_EQ(copy.GetEntry(i).second, src.GetEntry(i).second);
    }
    copy.GetEntry(0).second.Insert(testing::MakeSite(9), 5, 5);
    EXPECT_NE(copy.GetEntry(0).second, src.GetEntry(0).second);

    Leaf small;
    Fill(&small, 3);
    ops->m_AssignArrayFn(raw, sizeof(Leaf), &small, sizeof(Leaf), 1);
    ASSERT_EQ(copy.m_numKeyEntrys, 3);
    EXPECT_EQ(copy.GetEntry(2).first, MakeKey(2, true));
    copy = copy;
    EXPECT_EQ(copy.m_numKeyEntrys, 3);
    ops->m_DestructArrayFn(raw, sizeof(Leaf), 1);

    Internal node;
    FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry e;
    e.m_key = MakeKey(77, true);
    CopyConstructInternalEntry(&node, 0, e);
    node.m_numKeyEntrys = 1;
    Internal nodeCopy(node);
    ASSERT_EQ(nodeCopy.m_numKeyEntrys, 1);
    EXPECT_EQ(nodeCopy.GetEntry(0).m_key, MakeKey(77, true));
    EXPECT_NE(nodeCopy.GetEntry(0).m_key.path.data(), node.GetEntry(0).m_key.path.data());
}

// ---- Reflection -------------------------------------------------------------------------

template <typename T>
void ExpectRecord(const char* name) {
    SCOPED_TRACE(name);
    const ReflectedClass& rc = _GetReflected(static_cast<const T*>(nullptr));
    EXPECT_EQ(&rc, &GetReflectedClass<T>());
    EXPECT_EQ(rc.m_flags, 1u);
    EXPECT_STREQ(rc.m_name, name);
    EXPECT_EQ(rc.m_size, static_cast<ssize_t>(sizeof(T)));
    EXPECT_EQ(rc.m_ops.m_size, rc.m_size);
    ASSERT_EQ(rc.m_numIndirectInterfaces, 1);
    ASSERT_EQ(rc.m_numDirectInterfaces, 1);
    EXPECT_STREQ(rc.m_interfaces[0], "tarn::IObject");
    EXPECT_STREQ(rc.m_interfaces[1], "tarn::IPersistable");
    EXPECT_EQ(rc.m_metaData, nullptr);
    EXPECT_EQ(rc.m_fields, nullptr);
    EXPECT_EQ(rc.m_methods, nullptr);
    EXPECT_EQ(rc.m_stringTable, nullptr);
    EXPECT_EQ(rc.m_IObjectFnTable, &IObject::Stubs<T>::GetTable());
    EXPECT_EQ(rc.m_createFn, &T::sfnCreateInstance);
    EXPECT_EQ(rc.m_ops.m_PrintVariableFn, nullptr);
    EXPECT_EQ(rc.m_ops.m_equalsFn, nullptr);
    EXPECT_NE(rc.m_ops.m_ConstructArrayFn, nullptr);
    EXPECT_NE(rc.m_ops.m_CopyConstructArrayFn, nullptr);
    EXPECT_NE(rc.m_ops.m_AssignArrayFn, nullptr);
    EXPECT_NE(rc.m_ops.m_DestructArrayFn, nullptr);
    EXPECT_EQ(rc.m_ops.m_SerialiseArrayFn, nullptr);
    EXPECT_EQ(_GetTypeOps(static_cast<const T*>(nullptr)), &rc.m_ops);

    T obj;
    ptr<IObject> h(&obj);
    EXPECT_EQ(h->GetReflectedClass(), &rc);
    AnyInterface p = obj.QueryInterface(GetReflectedInterface<IPersistable>());
    EXPECT_EQ(p.m_self, &obj);
    EXPECT_EQ(p.m_table,
              reinterpret_cast<const FunctionPointer*>(&IPersistable::Stubs<T>::GetTable()));
    ReflectedInterface lookalike{"tarn::IObject"};
    EXPECT_EQ(obj.QueryInterface(lookalike).m_self, nullptr);

    ptr<IObject> made = rc.m_createFn();
    ASSERT_NE(made.m_self, nullptr);
    EXPECT_EQ(made->GetReflectedClass(), &rc);
    made->Destroy();
}

TEST(BTreeReflection, RecordsOfTheThreeClasses) {
    ExpectRecord<Map>("tarn::FieldIdToOffsetOpsOnInt64FieldMap");
    ExpectRecord<Internal>("tarn::FieldIdToOffsetOpsOnInt64FieldMapInternalNode");
    ExpectRecord<Leaf>("tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode");
}

std::string RefusedRegistration(const std::string& cls) {
    return ::tarn::testing::RegexQuote(
        "void tarn::_Register_" + cls +
        "(): Assertion \"tarn::RegisterReflectedClass(&_GetReflected( (" + cls +
        "*) 0),tarn::Tarn_tnOperation_GetXTarget()) == tarn::NSE_OK\" failed.");
}

TEST(BTreeReflection, SecondRegistrationStops) {
    testing::RegisterBTreeClasses();
    EXPECT_NE(FindReflectedClass("tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode"), nullptr);
    EXPECT_DEATH(_Register_FieldIdToOffsetOpsOnInt64FieldMap(),
                 RefusedRegistration("FieldIdToOffsetOpsOnInt64FieldMap"));
    EXPECT_DEATH(_Register_FieldIdToOffsetOpsOnInt64FieldMapInternalNode(),
                 RefusedRegistration("FieldIdToOffsetOpsOnInt64FieldMapInternalNode"));
    EXPECT_DEATH(_Register_FieldIdToOffsetOpsOnInt64FieldMapLeafNode(),
                 RefusedRegistration("FieldIdToOffsetOpsOnInt64FieldMapLeafNode"));
}

}  // namespace
}  // namespace tarn
