// The object model: system state and its copy rules, interface handles and
// tables, the mixins' hooks, references as values, type operations and the
// class registry.

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
using testing::TestOther;

// --- System state -----------------------------------------------------------

TEST(ObjSysStateFlags, EachFlagIsItsOwnBit) {
    ObjSysState s;
    s.objflags_ = 1;  // DBP_GC_NOT_REGISTERED_IN_EXTENT only
    EXPECT_TRUE(s.GetFlag(DBP_GC_NOT_REGISTERED_IN_EXTENT));
    EXPECT_FALSE(s.GetFlag(DBP_PO_DIRTY));
    s.objflags_ = 2;
    EXPECT_TRUE(s.GetFlag(DBP_PO_DIRTY));
    EXPECT_FALSE(s.GetFlag(DBP_GC_NOT_REGISTERED_IN_EXTENT));

    for (int n : {DBP_GC_NOT_REGISTERED_IN_EXTENT, DBP_PO_DIRTY,
                  DBP_PO_MARKED_DURING_ASYNC_DELETION, DBP_PO_SYNC_DELETED, DBP_PO_MARKED}) {
        ObjSysState t;
        t.SetFlag(n);
        EXPECT_EQ(t.objflags_, uint32{1} << n);
        t.SetFlag(n, false);
        EXPECT_EQ(t.objflags_, 0u);
        t.objflags_ = ~uint32{0};
        t.ClearFlag(n);
        EXPECT_EQ(t.objflags_, ~(uint32{1} << n));
        t.SetFlag(n, true);
        EXPECT_EQ(t.objflags_, ~uint32{0});
    }
    EXPECT_EQ(DBP_PO_MARKED, 4);
}

void MakeDirtyWithIdentity(TestNode& n) {
    ObjSysState& s = n.GetSysState();
    s.m_cspace = reinterpret_cast<CSpace*>(&n);  // any non-null value; never used
    s.marked_ = true;
    s.objflags_ = 0x1f;
    s.m_size = 7;
    s.m_lastTouchedTime = 9;
    n.GetPersistObjState().m_oid = OID(Seid(42));
}

void MakeClean(TestNode& n) {
    n.GetSysState() = ObjSysState();
}

TEST(PersistableCopy, CopyOfDirtyObjectIsNewAndClean) {
    TestNode src(5);
    MakeDirtyWithIdentity(src);
    TestNode copy(src);
    const ObjSysState& s = copy.GetSysState();
    EXPECT_EQ(s.m_cspace, nullptr);
    EXPECT_FALSE(s.marked_);
    EXPECT_EQ(s.objflags_, 0u);
    EXPECT_EQ(s.m_size, 0);
    EXPECT_EQ(s.m_lastTouchedTime, 0);
    EXPECT_TRUE(copy.GetPersistObjState().m_oid.IsNull());
    EXPECT_FALSE(copy.IsDirty());
    EXPECT_EQ(copy.m_value, 5);
    MakeClean(src);
}

TEST(PersistableCopy, AssignmentKeepsTargetStateAndIdentity) {
    TestNode src(5);
    TestNode dst(1);
    MakeDirtyWithIdentity(dst);
    const ObjSysState before = dst.GetSysState();
    dst = src;
    EXPECT_EQ(dst.m_value, 5);
    EXPECT_EQ(dst.GetSysState().objflags_, before.objflags_);
    EXPECT_EQ(dst.GetSysState().m_cspace, before.m_cspace);
    EXPECT_EQ(dst.GetSysState().m_size, 7);
    EXPECT_EQ(dst.GetPersistObjState().m_oid, OID(Seid(42)));
    EXPECT_TRUE(dst.IsDirty());
    MakeClean(dst);
}

TEST(PersistableDestruction, DirtyObjectStopsTheProcess) {
    EXPECT_TARN_ASSERT(
        {
            TestNode n;
            n.GetSysState().SetFlag(DBP_PO_DIRTY);
        },
        "!IsDirty()");
    EXPECT_DEATH(
        {
            TestNode n;
            n.GetSysState().SetFlag(DBP_PO_DIRTY);
        },
        "tnPersistStore/IPersistable\\.h:.*PersistableMixin");
}

// --- Dirty marking ------------------------------------------------------------

TEST(DirtyMarking, DirtyObjectCallsNothing) {
    TestNode n;
    n.GetSysState().SetFlag(DBP_PO_DIRTY);
    GetThreadRuntimeCallLog() = RuntimeCallLog();
    n.MarkAsDirtyWithoutTrace();
    n.MarkAsDirtyWithoutTrace();
    EXPECT_EQ(GetThreadRuntimeCallLog().numMarkPersistentAsDirty, 0);
    MakeClean(n);
}

TEST(DirtyMarking, CleanObjectCallsTheRuntimeOnceEachTime) {
    TestNode n;  // never registered: the runtime does not track it
    GetThreadRuntimeCallLog() = RuntimeCallLog();
    n.MarkAsDirtyWithoutTrace();
    EXPECT_EQ(GetThreadRuntimeCallLog().numMarkPersistentAsDirty, 1);
    EXPECT_FALSE(n.IsDirty());
    n.MarkAsDirtyWithoutTrace();
    EXPECT_EQ(GetThreadRuntimeCallLog().numMarkPersistentAsDirty, 2);
}

TEST(DirtyMarking, RegisteredObjectIsMarkedOnceUntilWritten) {
    testing::RegisterTestClasses();
    CSpace space;
    CSpaceGuard guard(space, LockMode::Exclusive);
    TestNode* n = DollarNew(new TestNode(1));
    space.Commit();
    EXPECT_FALSE(n->IsDirty());
    const int64 before = space.Stats().numMarkCalls;
    n->MarkAsDirtyWithoutTrace();
    n->MarkAsDirtyWithoutTrace();
    n->MarkAsDirtyWithoutTrace();
    EXPECT_TRUE(n->IsDirty());
    EXPECT_EQ(space.Stats().numMarkCalls - before, 1);
    EXPECT_EQ(space.NumDirty(), 1);
    // A direct call on a dirty object is harmless and queues nothing more.
    MarkPersistentAsDirtyWithoutTrace(ptr<const IPersistable>(n));
    EXPECT_EQ(space.NumDirty(), 1);
}

// --- Handles and tables ---------------------------------------------------------

// The tables are compile-time constants.
static_assert(IObject::Stubs<TestNode>::s_table.QueryInterface ==
              &IObject::Stubs<TestNode>::QueryInterface);
static_assert(IPersistable::Stubs<TestNode>::s_table._IObject.Destroy ==
              IObject::Stubs<TestNode>::s_table.Destroy);

TEST(InterfaceHandles, NullPointerGivesNullHandleWithTable) {
    TestNode* none = nullptr;
    ptr<IObject> o(none);
    ptr<IPersistable> p(none);
    EXPECT_EQ(o.m_self, nullptr);
    EXPECT_FALSE(o);
    EXPECT_EQ(o->m_table, &IObject::Stubs<TestNode>::GetTable());
    EXPECT_EQ(p->m_table, &IPersistable::Stubs<TestNode>::GetTable());
    EXPECT_FALSE(ptr<IObject>(null));
    EXPECT_FALSE(ptr<IObject>(nullptr));
    EXPECT_EQ(ptr<IObject>().m_table, nullptr);
}

TEST(InterfaceHandles, QueryInterfaceAnswersByRecordAddress) {
    TestNode n;
    ptr<IObject> o(&n);
    AnyInterface asObject = o->QueryInterface(GetReflectedInterface<IObject>());
    EXPECT_EQ(asObject.m_self, &n);
    EXPECT_EQ(asObject.m_table,
              reinterpret_cast<const FunctionPointer*>(&IObject::Stubs<TestNode>::GetTable()));
    AnyInterface asPersistable = o->QueryInterface(GetReflectedInterface<IPersistable>());
    EXPECT_EQ(asPersistable.m_self, &n);
    EXPECT_EQ(asPersistable.m_table,
              reinterpret_cast<const FunctionPointer*>(&IPersistable::Stubs<TestNode>::GetTable()));

    // Records named like the real ones, at other addresses, are other
    // interfaces.
    const ReflectedInterface fakeObject{"tarn::IObject"};
    const ReflectedInterface fakePersistable{"tarn::IPersistable"};
    for (const ReflectedInterface* ri : {&fakeObject, &fakePersistable}) {
        AnyInterface none = o->QueryInterface(*ri);
        EXPECT_EQ(none.m_self, nullptr);
        EXPECT_EQ(none.m_table, nullptr);
    }
    for (const ReflectedInterface* ri :
         {&GetReflectedInterface<IObject>(), &GetReflectedInterface<IPersistable>(), &fakeObject}) {
        AnyInterface q = o->QueryInterface(*ri);
        AnyInterface b = o->BindInterface(*ri);
        EXPECT_EQ(q.m_self, b.m_self);
        EXPECT_EQ(q.m_table, b.m_table);
    }
    EXPECT_EQ(&GetReflectedInterface<IObject>(), &_GetReflected((const IObject*)nullptr));
}

TEST(InterfaceHandles, PersistableToObjectKeepsSelfAndSlots) {
    TestNode n;
    ptr<IPersistable> p(&n);
    ptr<IObject> o(p);
    EXPECT_EQ(o.m_self, &n);
    EXPECT_EQ(o->m_table, &p->m_table->_IObject);
    EXPECT_EQ(o->GetReflectedClass(), p->GetReflectedClass());
    EXPECT_EQ(o->GetReflectedClass(), &_GetReflected((TestNode*)0));
    ptr<const IObject> c(p);
    EXPECT_EQ(c.m_self, &n);
    ptr<const IPersistable> cp(p);
    EXPECT_EQ(cp.m_table, p.m_table);
    EXPECT_EQ(&o->GetSysState(), &n.GetSysState());
    EXPECT_EQ(&p->GetPersistObjState(), &n.GetPersistObjState());
}

TEST(InterfaceHandles, MixinSlotsDoWhatTheMixinSays) {
    TestOther t;
    ptr<IPersistable> p(&t);
    EXPECT_TRUE(p->RepresentsSubTree());
    p->OnCreate(true);  // the mixin's: nothing
    EXPECT_EQ(t.m_value, 0);
    TestNode n;
    ptr<IPersistable>(&n)->OnCreate(true);
    EXPECT_EQ(n.m_onCreateArg, 1);
}

TEST(InterfaceHandles, DestroySlotDeletesAndIgnoresNull) {
    const int live = TestNode::s_live;
    TestNode* n = new TestNode();
    ptr<IObject>(n)->Destroy();
    EXPECT_EQ(TestNode::s_live, live);
    ptr<IObject>(static_cast<TestNode*>(nullptr))->Destroy();
}

TEST(InterfaceHandles, OnGarbageCollectReportsOnceWithPersistableTable) {
    TestNode n;
    GetThreadRuntimeCallLog() = RuntimeCallLog();
    ptr<IObject>(&n)->OnGarbageCollect();
    const RuntimeCallLog& log = GetThreadRuntimeCallLog();
    EXPECT_EQ(log.numOnGarbageCollectPersistable, 1);
    EXPECT_EQ(log.lastGarbageCollected.m_self, &n);
    EXPECT_EQ(log.lastGarbageCollected->m_table, &IPersistable::Stubs<TestNode>::GetTable());
}

TEST(InterfaceHandles, CreationFunctionMakesUnregisteredInstance) {
    const int live = TestNode::s_live;
    ptr<IObject> o = TestNode::sfnCreateInstance();
    ASSERT_TRUE(o);
    EXPECT_EQ(TestNode::s_live, live + 1);
    // The IObject part of the class's IPersistable table.
    EXPECT_EQ(o->m_table, &IPersistable::Stubs<TestNode>::GetTable()._IObject);
    EXPECT_EQ(o->GetSysState().m_cspace, nullptr);
    o->Destroy();
    EXPECT_EQ(TestNode::s_live, live);
}

// --- References as values ----------------------------------------------------------

TEST(References, EmptyAndNullAssignments) {
    cref<TestNode> r;
    EXPECT_FALSE(r);
    EXPECT_EQ(r.Get(), nullptr);
    r.Set(nullptr);
    EXPECT_FALSE(r);
    EXPECT_EQ(r.Get(), nullptr);
    TestNode n;
    r = &n;
    EXPECT_TRUE(r);
    EXPECT_EQ(r.Get(), &n);
    r = null;
    EXPECT_FALSE(r);

    cref<void> v;
    v.Set(&n);
    EXPECT_EQ(v.Get(), &n);
    v = nullptr;
    EXPECT_FALSE(v);
    EXPECT_EQ(v.Get(), nullptr);
    // A handle with a table but no object empties the reference.
    v.Set(&n);
    v.prefbase::Set(ptr<IPersistable>(static_cast<TestNode*>(nullptr)));
    EXPECT_FALSE(v);
}

TEST(References, VoidReferenceAcceptsOnlyNull) {
    TestNode n;
    cref<void> v;
    void* p = &n;
    EXPECT_TARN_ASSERT(v = p, "!p");
}

TEST(References, RawByteCopyDesignatesTheSameObject) {
    TestNode n;
    n.GetPersistObjState().m_oid = OID(Seid(77));
    alignas(cref<TestNode>) unsigned char src[sizeof(cref<TestNode>)];
    alignas(cref<TestNode>) unsigned char dst[sizeof(cref<TestNode>)];
    auto* a = new (src) cref<TestNode>(&n);
    std::memcpy(dst, src, sizeof src);
    a->~cref<TestNode>();
    std::memset(src, 0xab, sizeof src);
    auto* b = std::launder(reinterpret_cast<cref<TestNode>*>(dst));
    EXPECT_EQ(b->Get(), &n);
    EXPECT_EQ(b->m_oid, OID(Seid(77)));
    EXPECT_TRUE(*b == ptr<const IObject>(&n));
}

TEST(References, ComparisonWithHandles) {
    TestNode n;
    TestNode m;
    n.GetPersistObjState().m_oid = OID(Seid(3));
    m.GetPersistObjState().m_oid = OID(Seid(4));
    cref<TestNode> bound(&n);
    EXPECT_TRUE(bound == ptr<const IObject>(&n));
    EXPECT_TRUE(bound != ptr<const IObject>(&m));
    EXPECT_TRUE(bound != ptr<const IObject>(null));
    // Unbound: compared by identity.
    cref<TestNode> byId(OID(Seid(3)));
    EXPECT_TRUE(byId == ptr<const IObject>(&n));
    EXPECT_TRUE(byId != ptr<const IObject>(&m));
    cref<TestNode> empty;
    EXPECT_TRUE(empty == ptr<const IObject>(null));
    EXPECT_TRUE(empty != ptr<const IObject>(&n));
}

TEST(References, ByteAndTextForms) {
    cref<TestNode> r(OID(Seid(0x0102030405060708ull)));
    MemoryOutputStream out;
    Archive ar(&out);
    ar << r << cref<TestNode>();
    ar.Flush();
    const std::vector<octet_t> expected = {8, 7, 6, 5, 4, 3, 2, 1, 0, 0, 0, 0, 0, 0, 0, 0};
    EXPECT_EQ(out.bytes(), expected);

    TestNode n;
    cref<TestNode> back(&n);  // bound: reading replaces the binding
    InputArchive in(out.bytes().data());
    in >> back;
    EXPECT_EQ(back.m_oid, r.m_oid);
    EXPECT_FALSE(back.IsBound());

    StringOutputStream text;
    {
        xostream os(text);
        os << static_cast<const prefbase&>(r) << ' ' << static_cast<const prefbase&>(cref<void>());
        os.flush();
    }
    EXPECT_EQ(text.str(), "#72623859790382856 #0");
}

class RecordingObjectVisitor final : public IObjectVisitor {
public:
    void VisitObject(ptr<const IObject>) override { ++objects; }
    void VisitEvictableObject(ptr<const IObject>& obj) override {
        seen.push_back(obj.m_self);
        if (release) {
            obj = nullptr;
        }
    }
    int objects = 0;
    bool release = false;
    std::vector<const void*> seen;
};

class RecordingPrefVisitor final : public IPrefVisitor {
public:
    void VisitPref(const prefbase& r) override { refs.push_back(&r); }
    void VisitParentPref(const prefbase&) override { ++parents; }
    std::vector<const prefbase*> refs;
    int parents = 0;
};

TEST(References, VisitorsSeeWhatTheReferenceHolds) {
    TestNode child;
    child.GetPersistObjState().m_oid = OID(Seid(9));
    TestNode n;
    n.m_left = &child;                          // bound
    n.m_right = cref<TestNode>(OID(Seid(10)));  // unbound
    RecordingObjectVisitor v;
    ptr<IObject>(&n)->VisitObjects(v);
    ASSERT_EQ(v.seen.size(), 1u);  // unbound and empty references present nothing
    EXPECT_EQ(v.seen[0], &child);
    EXPECT_EQ(v.objects, 0);

    v.release = true;
    ptr<IObject>(&n)->VisitObjects(v);
    EXPECT_FALSE(n.m_left.IsBound());  // the visitor released it
    EXPECT_EQ(n.m_left.m_oid, OID(Seid(9)));

    RecordingPrefVisitor pv;
    n.m_right.Clear();
    ptr<IPersistable>(&n)->VisitPrefs(pv);
    ASSERT_EQ(pv.refs.size(), 2u);  // the empty one too
    EXPECT_EQ(pv.refs[1], &n.m_right);
    EXPECT_EQ(pv.parents, 0);
}

// --- Lock status -------------------------------------------------------------------

TEST(LockStatus, ExclusiveOnlyWhenPositive) {
    CSpace space;
    EXPECT_EQ(GetThreadCSpace(), nullptr);
    EXPECT_EQ(GetRecordedLockStatus(&space), 0);
    EXPECT_FALSE(HaveExclusiveLockedCSpace());
    {
        CSpaceGuard shared(space, LockMode::Shared);
        EXPECT_EQ(GetThreadPtr<CSpace>(), &space);
        EXPECT_EQ(GetRecordedLockStatus(&space), -1);
        EXPECT_FALSE(HaveExclusiveLockedCSpace());
        CSpaceGuard nested(space, LockMode::Shared);
        EXPECT_EQ(GetRecordedLockStatus(&space), -2);
        EXPECT_FALSE(HaveExclusiveLockedCSpace());
    }
    {
        CSpaceGuard exclusive(space, LockMode::Exclusive);
        EXPECT_EQ(GetRecordedLockStatus(&space), 1);
        EXPECT_TRUE(HaveExclusiveLockedCSpace());
        {
            CSpaceGuard nested(space, LockMode::Shared);
            EXPECT_EQ(GetRecordedLockStatus(&space), 2);
            EXPECT_TRUE(HaveExclusiveLockedCSpace());
        }
        EXPECT_EQ(GetRecordedLockStatus(&space), 1);
        CSpace other;
        EXPECT_EQ(GetRecordedLockStatus(&other), 0);
    }
    EXPECT_EQ(GetThreadCSpace(), nullptr);
    EXPECT_FALSE(HaveExclusiveLockedCSpace());
}

// --- Type operations -----------------------------------------------------------------

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

// A buffer of int64 slots pre-filled with a marker, so untouched slots show.
constexpr int64 kMarker = -7;

TEST(TypeOpsStrides, ConstructOnlyAtStridePositions) {
    int64 buf[12];
    std::fill(std::begin(buf), std::end(buf), kMarker);
    Counted::constructed = 0;
    ConstructArray<Counted>(reinterpret_cast<Counted*>(buf), 3 * sizeof(int64), 4);
    EXPECT_EQ(Counted::constructed, 4);
    for (int i = 0; i < 12; ++i) {
        EXPECT_EQ(buf[i], i % 3 == 0 ? 1 : kMarker) << i;
    }
    for (ssize_t n : {0, -1}) {
        std::fill(std::begin(buf), std::end(buf), kMarker);
        ConstructArray<Counted>(reinterpret_cast<Counted*>(buf), 8, n);
        DestructArray<Counted>(reinterpret_cast<Counted*>(buf), 8, n);
        CopyConstructArray<Counted>(reinterpret_cast<Counted*>(buf), 8,
                                    reinterpret_cast<const Counted*>(buf), 8, n);
        EXPECT_EQ(Counted::constructed, 4);
        EXPECT_EQ(buf[0], kMarker);
    }
}

TEST(TypeOpsStrides, CopyAndAssignUseTheirOwnSpacing) {
    int64 src[6] = {10, kMarker, 20, kMarker, 30, kMarker};
    int64 dst[9];
    std::fill(std::begin(dst), std::end(dst), kMarker);
    CopyConstructArray<Counted>(reinterpret_cast<Counted*>(dst), 3 * 8,
                                reinterpret_cast<const Counted*>(src), 2 * 8, 3);
    const int64 copied[9] = {110, kMarker, kMarker, 120, kMarker, kMarker, 130, kMarker, kMarker};
    EXPECT_TRUE(std::equal(std::begin(dst), std::end(dst), std::begin(copied)));

    // Through the untyped table entry, as the runtime calls it.
    TypeOps ops = CopyableTypeOps<Counted>();
    ops.m_AssignArrayFn(dst, 3 * 8, src, 2 * 8, 2);
    EXPECT_EQ(dst[0], 1010);
    EXPECT_EQ(dst[3], 1020);
    EXPECT_EQ(dst[6], 130);
    EXPECT_EQ(ops.m_size, static_cast<ssize_t>(sizeof(Counted)));
    EXPECT_EQ(ops.m_PrintVariableFn, nullptr);

    Counted::destroyed = 0;
    ops.m_DestructArrayFn(dst, 3 * 8, 3);
    EXPECT_EQ(Counted::destroyed, 3);
}

TEST(TypeOpsStrides, ApplyStrideMovesByBytes) {
    int64 buf[4] = {};
    const int64* p = buf;
    ApplyStride(p, 16);
    EXPECT_EQ(p, buf + 2);
    ApplyStride(p, -8);
    EXPECT_EQ(p, buf + 1);
}

// --- Reflection and registry ---------------------------------------------------------

TEST(Reflection, RecordOfAPersistableClass) {
    const ReflectedClass& rc = _GetReflected((TestNode*)0);
    EXPECT_EQ(&rc, &GetReflectedClass<TestNode>());
    TestNode n;
    EXPECT_EQ(ptr<IObject>(&n)->GetReflectedClass(), &rc);
    EXPECT_EQ(rc.m_flags, 1u);
    EXPECT_TRUE(rc.IsPersistable());
    EXPECT_FALSE(rc.IsStruct());
    EXPECT_EQ(rc.m_size, rc.m_ops.m_size);
    EXPECT_EQ(rc.m_numIndirectInterfaces, 1);
    EXPECT_EQ(rc.m_numDirectInterfaces, 1);
    EXPECT_STREQ(rc.m_interfaces[0], "tarn::IObject");
    EXPECT_STREQ(rc.m_interfaces[1], "tarn::IPersistable");
    EXPECT_EQ(rc.m_IObjectFnTable, &IObject::Stubs<TestNode>::GetTable());
    EXPECT_EQ(rc.m_createFn, &TestNode::sfnCreateInstance);
}

TEST(Registry, NamesAreUniqueAndWellFormed) {
    testing::RegisterTestClasses();
    EXPECT_EQ(FindReflectedClass("tarn::testing::TestNode"), &_GetReflected((TestNode*)0));
    EXPECT_EQ(FindReflectedClass("tarn::testing::Nothing"), nullptr);
    XTarget* tests = GetXTarget("tests");
    EXPECT_EQ(tests, GetXTarget("tests"));
    EXPECT_EQ(RegisterReflectedClass(&_GetReflected((TestNode*)0), tests), NSE_NAME_ALREADY_IN_USE);
    // The same name from another target is refused too.
    ReflectedClass copy = _GetReflected((TestOther*)0);
    EXPECT_EQ(RegisterReflectedClass(&copy, Tarn_tnOperation_GetXTarget()),
              NSE_NAME_ALREADY_IN_USE);
    EXPECT_EQ(FindReflectedClass("tarn::testing::TestOther"), &_GetReflected((TestOther*)0));
    EXPECT_EQ(Tarn_tnOperation_GetXTarget(), GetXTarget("tnOperation"));

    EXPECT_EQ(CheckClassName("tarn::A_1"), NSE_OK);
    EXPECT_EQ(CheckClassName("tarn:A"), NSE_COLON_EXPECTED);
    EXPECT_EQ(CheckClassName("tarn::"), NSE_IDENTIFIER_EXPECTED);
    EXPECT_EQ(CheckClassName("1abc"), NSE_IDENTIFIER_EXPECTED);
    EXPECT_EQ(CheckClassName(""), NSE_IDENTIFIER_EXPECTED);
    copy.m_name = "tarn testing";
    EXPECT_EQ(RegisterReflectedClass(&copy, tests), NSE_COLON_EXPECTED);
}

}  // namespace
}  // namespace tarn
