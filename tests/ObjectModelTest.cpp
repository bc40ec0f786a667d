// The object model: system state and its copy rules, dirty marking, interface
// handles and their tables, references as values, the lock status, type
// operations, reflection records and the class registry.

#include <gtest/gtest.h>

#include <cstring>
#include <new>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/TestPersistable.h"
#include "tnObject/TypeOps.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/RuntimeCallLog.h"
#include "tnUtils/MemoryOutputStream.h"
#include "tnUtils/xostream.h"

namespace tarn {
namespace {

using testing::TestNode;

TEST(ObjSysState, EachFlagIsItsOwnBit) {
    const int flags[] = {DBP_GC_NOT_REGISTERED_IN_EXTENT, DBP_PO_DIRTY,
                         DBP_PO_MARKED_DURING_ASYNC_DELETION, DBP_PO_SYNC_DELETED, DBP_PO_MARKED};
    for (int n = 0; n < 5; ++n) {
        EXPECT_EQ(flags[n], n);
        ObjSysState s;
        s.objflags_ = uint32{1} << n;
        for (int m = 0; m < 5; ++m) {
            EXPECT_EQ(s.GetFlag(m), m == n) << n << " " << m;
        }
        s.objflags_ = ~uint32{0};
        s.ClearFlag(n);
        EXPECT_EQ(s.objflags_, ~(uint32{1} << n));
        s.SetFlag(n, true);
        EXPECT_EQ(s.objflags_, ~uint32{0});
    }
}

TEST(PersistableCopy, ACopyIsCleanWithoutIdentityAndAssignmentKeepsTheTargets) {
    TestNode dirty(5);
    ObjSysState& s = dirty.GetSysState();
    s.m_cspace = reinterpret_cast<CSpace*>(&dirty);  // any non-null value; never used
    s.marked_ = true;
    s.objflags_ = 0x1f;
    s.m_size = 7;
    s.m_lastTouchedTime = 9;
    dirty.GetPersistObjState().m_oid = OID(Seid(42));

    TestNode copy(dirty);
    const ObjSysState& c = copy.GetSysState();
    EXPECT_EQ(c.m_cspace, nullptr);
    EXPECT_EQ(c.objflags_, 0u);
    EXPECT_FALSE(c.marked_ || c.m_size != 0 || c.m_lastTouchedTime != 0);
    EXPECT_TRUE(copy.GetPersistObjState().m_oid.IsNull());
    EXPECT_EQ(copy.m_value, 5);

    copy.m_value = 6;
    dirty = copy;  // only the class's own members
    EXPECT_EQ(dirty.m_value, 6);
    EXPECT_EQ(s.m_cspace, reinterpret_cast<CSpace*>(&dirty));
    EXPECT_EQ(s.objflags_, 0x1fu);
    EXPECT_EQ(s.m_size, 7);
    EXPECT_EQ(dirty.GetPersistObjState().m_oid, OID(Seid(42)));
    s = ObjSysState();
}

TEST(PersistableCopy, DestroyingADirtyObjectStopsTheProcess) {
    auto destroyDirty = [] {
        TestNode n;
        n.GetSysState().SetFlag(DBP_PO_DIRTY);
    };
    EXPECT_TARN_ASSERT(destroyDirty(), "!IsDirty()");
    EXPECT_DEATH(destroyDirty(), "tnPersistStore/IPersistable\\.h:[0-9]+: .*PersistableMixin");
}

TEST(DirtyMarking, OnlyACleanObjectCallsTheRuntime) {
    TestNode n;  // never registered: the runtime counts the call and ignores it
    GetThreadRuntimeCallLog() = RuntimeCallLog();
    n.MarkAsDirtyWithoutTrace();
    n.MarkAsDirtyWithoutTrace();
    EXPECT_EQ(GetThreadRuntimeCallLog().numMarkPersistentAsDirty, 2);
    n.GetSysState().SetFlag(DBP_PO_DIRTY);
    n.MarkAsDirtyWithoutTrace();
    EXPECT_EQ(GetThreadRuntimeCallLog().numMarkPersistentAsDirty, 2);
    n.GetSysState().ClearFlag(DBP_PO_DIRTY);
}

TEST(InterfaceHandles, QueryInterfaceAnswersByRecordAddressOnly) {
    TestNode n;
    ptr<IObject> o(&n);
    auto expect = [&](const ReflectedInterface& ri, const void* self, const void* table) {
        for (const AnyInterface& a : {o->QueryInterface(ri), o->BindInterface(ri)}) {
            EXPECT_EQ(a.m_self, self) << ri.m_name;
            EXPECT_EQ(static_cast<const void*>(a.m_table), table) << ri.m_name;
        }
    };
    expect(GetReflectedInterface<IObject>(), &n, &IObject::Stubs<TestNode>::GetTable());
    expect(GetReflectedInterface<IPersistable>(), &n, &IPersistable::Stubs<TestNode>::GetTable());
    expect(ReflectedInterface{"tarn::IObject"}, nullptr, nullptr);  // named alike, elsewhere
    expect(ReflectedInterface{"tarn::IPersistable"}, nullptr, nullptr);
    EXPECT_EQ(&GetReflectedInterface<IObject>(), &_GetReflected((const IObject*)nullptr));
}

// The IObject view of an IPersistable handle is the IObject part of its table;
// collecting the object tells the runtime once, with the IPersistable table.
TEST(InterfaceHandles, OnGarbageCollectReportsThePersistableOnce) {
    TestNode n;
    ptr<IPersistable> p(&n);
    ptr<IObject> o(p);
    EXPECT_EQ(o.m_self, &n);
    EXPECT_EQ(o->m_table, &p->m_table->_IObject);
    GetThreadRuntimeCallLog() = RuntimeCallLog();
    o->OnGarbageCollect();
    const RuntimeCallLog& log = GetThreadRuntimeCallLog();
    EXPECT_EQ(log.numOnGarbageCollectPersistable, 1);
    EXPECT_EQ(log.lastGarbageCollected.m_self, &n);
    EXPECT_EQ(log.lastGarbageCollected->m_table, &IPersistable::Stubs<TestNode>::GetTable());
}

TEST(References, AnEmptyHandleEmptiesAndARawPointerIsRefused) {
    TestNode n;
    cref<void> v;
    v.Set(&n);
    v.prefbase::Set(ptr<IPersistable>(static_cast<TestNode*>(nullptr)));  // a table, no object
    EXPECT_FALSE(v);
    EXPECT_EQ(v.Get(), nullptr);
    void* p = &n;
    EXPECT_TARN_ASSERT(v = p, "!p");
}

TEST(References, RawByteCopyDesignatesTheSameObject) {
    TestNode n;
    n.GetPersistObjState().m_oid = OID(Seid(77));
    alignas(cref<TestNode>) unsigned char src[sizeof(cref<TestNode>)];
    alignas(cref<TestNode>) unsigned char dst[sizeof(cref<TestNode>)];
    new (src) cref<TestNode>(&n);
    std::memcpy(dst, src, sizeof src);
    std::memset(src, 0xab, sizeof src);
    auto* b = std::launder(reinterpret_cast<cref<TestNode>*>(dst));
    EXPECT_EQ(b->Get(), &n);
    EXPECT_EQ(b->m_oid, OID(Seid(77)));
    b->~cref<TestNode>();
}

TEST(References, EqualToAHandleByBindingOrElseByIdentity) {
    TestNode n;
    TestNode m;
    n.GetPersistObjState().m_oid = OID(Seid(3));
    m.GetPersistObjState().m_oid = OID(Seid(4));
    const cref<TestNode> refs[] = {cref<TestNode>(&n), cref<TestNode>(OID(Seid(3))),
                                   cref<TestNode>()};
    const ptr<const IObject> handles[] = {&n, &m, null};
    const bool equal[3][3] = {{true, false, false}, {true, false, false}, {false, false, true}};
    for (int i = 0; i < 3; ++i) {
        for (int j = 0; j < 3; ++j) {
            EXPECT_EQ(refs[i] == handles[j], equal[i][j]) << i << " " << j;
            EXPECT_EQ(refs[i] != handles[j], !equal[i][j]) << i << " " << j;
        }
    }
}

TEST(References, ImageIsTheIdentityAndTextIsHashDecimal) {
    const cref<TestNode> r(OID(Seid(0x0102030405060708ull)));
    MemoryOutputStream out;
    Archive ar(&out);
    ar << r << cref<TestNode>();
    ar.Flush();
    EXPECT_EQ(out.bytes(), (std::vector<octet_t>{8, 7, 6, 5, 4, 3, 2, 1, 0, 0, 0, 0, 0, 0, 0, 0}));
    TestNode n;
    cref<TestNode> back(&n);  // reading replaces the binding
    InputArchive in(out.bytes().data());
    in >> back;
    EXPECT_EQ(back.m_oid, r.m_oid);
    EXPECT_FALSE(back.IsBound());

    StringOutputStream text;
    {
        xostream os(text);
        os << static_cast<const prefbase&>(r) << ' ' << static_cast<const prefbase&>(cref<void>());
    }
    EXPECT_EQ(text.str(), "#72623859790382856 #0");
}

// The recorded status counts nested guards: negative shared, positive
// exclusive, 0 none, for the thread's space only.
TEST(LockStatus, ExclusiveOnlyWhenPositive) {
    CSpace space;
    CSpace other;
    EXPECT_FALSE(HaveExclusiveLockedCSpace());
    {
        CSpaceGuard shared(space, LockMode::Shared);
        CSpaceGuard nested(space, LockMode::Shared);
        EXPECT_EQ(GetRecordedLockStatus(&space), -2);
        EXPECT_FALSE(HaveExclusiveLockedCSpace());
    }
    CSpaceGuard exclusive(space, LockMode::Exclusive);
    {
        CSpaceGuard nested(space, LockMode::Shared);
        EXPECT_EQ(GetRecordedLockStatus(&space), 2);
        EXPECT_TRUE(HaveExclusiveLockedCSpace());
    }
    EXPECT_EQ(GetRecordedLockStatus(&space), 1);
    EXPECT_TRUE(HaveExclusiveLockedCSpace());
    EXPECT_EQ(GetThreadCSpace(), &space);
    EXPECT_EQ(GetRecordedLockStatus(&other), 0);
}

struct Counted {
    Counted() : value(1) { ++constructed; }
    Counted(const Counted& rhs) : value(rhs.value + 100) { ++constructed; }
    Counted& operator=(const Counted& rhs) {
        value = rhs.value + 1000;
        return *this;
    }
    ~Counted() { ++destroyed; }
    int64 value;
    static inline int constructed = 0;
    static inline int destroyed = 0;
};

// Buffers of int64 slots start as kMarker, so untouched slots show.
constexpr int64 kMarker = -7;

TEST(TypeOpsStrides, EachArrayOperationTouchesOnlyItsStridePositions) {
    int64 buf[12];
    std::fill(std::begin(buf), std::end(buf), kMarker);
    Counted::constructed = 0;
    ConstructArray<Counted>(reinterpret_cast<Counted*>(buf), 3 * 8, 4);
    for (int i = 0; i < 12; ++i) {
        EXPECT_EQ(buf[i], i % 3 == 0 ? 1 : kMarker) << i;
    }
    for (ssize_t n : {0, -1}) {  // empty counts touch nothing
        ConstructArray<Counted>(reinterpret_cast<Counted*>(buf + 1), 8, n);
        DestructArray<Counted>(reinterpret_cast<Counted*>(buf + 1), 8, n);
        CopyConstructArray<Counted>(reinterpret_cast<Counted*>(buf + 1), 8,
                                    reinterpret_cast<const Counted*>(buf), 8, n);
    }
    EXPECT_EQ(Counted::constructed, 4);
    EXPECT_EQ(buf[1], kMarker);

    // Copies and assignments through the untyped table, each side its own stride.
    int64 src[6] = {10, kMarker, 20, kMarker, 30, kMarker};
    int64 dst[9];
    std::fill(std::begin(dst), std::end(dst), kMarker);
    const TypeOps ops = CopyableTypeOps<Counted>();
    ops.m_CopyConstructArrayFn(dst, 3 * 8, src, 2 * 8, 3);
    ops.m_AssignArrayFn(dst, 3 * 8, src, 2 * 8, 2);
    const int64 expected[9] = {1010,    kMarker, kMarker, 1020,   kMarker,
                               kMarker, 130,     kMarker, kMarker};
    EXPECT_TRUE(std::equal(std::begin(dst), std::end(dst), std::begin(expected)));
    Counted::destroyed = 0;
    ops.m_DestructArrayFn(dst, 3 * 8, 3);
    EXPECT_EQ(Counted::destroyed, 3);
}

TEST(Registry, RecordsAreFoundByUniqueWellFormedNames) {
    testing::RegisterTestClasses();
    const ReflectedClass& rc = _GetReflected((TestNode*)0);
    EXPECT_TRUE(rc.IsPersistable());
    EXPECT_STREQ(rc.m_interfaces[0], "tarn::IObject");
    EXPECT_STREQ(rc.m_interfaces[1], "tarn::IPersistable");
    EXPECT_EQ(FindReflectedClass("tarn::testing::TestNode"), &rc);
    EXPECT_EQ(FindReflectedClass("tarn::testing::Nothing"), nullptr);
    ReflectedClass copy = rc;  // the same name again, from any target
    EXPECT_EQ(RegisterReflectedClass(&copy, GetXTarget("tests")), NSE_NAME_ALREADY_IN_USE);
    EXPECT_EQ(RegisterReflectedClass(&copy, Tarn_tnOperation_GetXTarget()),
              NSE_NAME_ALREADY_IN_USE);
    EXPECT_EQ(FindReflectedClass("tarn::testing::TestNode"), &rc);
    EXPECT_EQ(Tarn_tnOperation_GetXTarget(), GetXTarget("tnOperation"));
    copy.m_name = "tarn testing";
    EXPECT_EQ(RegisterReflectedClass(&copy, GetXTarget("tests")), NSE_COLON_EXPECTED);
    EXPECT_EQ(CheckClassName("tarn::A_1"), NSE_OK);
    EXPECT_EQ(CheckClassName("tarn:A"), NSE_COLON_EXPECTED);
    for (const char* bad : {"tarn::", "1abc", ""}) {
        EXPECT_EQ(CheckClassName(bad), NSE_IDENTIFIER_EXPECTED) << bad;
    }
}

}  // namespace
}  // namespace tarn
