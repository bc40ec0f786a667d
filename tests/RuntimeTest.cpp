// The runtime: registration and identities, commit, eviction and reloading,
// deferred deletion, the loader's checks, locking rules and named roots.

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/TestPersistable.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/MemoryStore.h"
#include "tnRuntime/RuntimeCallLog.h"
#include "tnRuntime/RuntimeError.h"
#include "tnRuntime/SpaceRef.h"

namespace tarn {
namespace {

using testing::TestNode;
using testing::TestOther;

class RuntimeTest : public ::testing::Test {
protected:
    void SetUp() override { testing::RegisterTestClasses(); }

    // A complete binary tree of TestNodes of the given depth, values in
    // preorder from `next`.
    static TestNode* BuildTree(int depth, int64& next) {
        TestNode* n = DollarNew(new TestNode(next++));
        if (depth > 1) {
            n->m_left = BuildTree(depth - 1, next);
            n->m_right = BuildTree(depth - 1, next);
        }
        return n;
    }

    // Sum of values and number of nodes reached through references.
    static void Walk(const TestNode* n, int64& sum, int& count) {
        sum += n->m_value;
        ++count;
        if (n->m_left) {
            Walk(n->m_left.Get(), sum, count);
        }
        if (n->m_right) {
            Walk(n->m_right.Get(), sum, count);
        }
    }

    std::shared_ptr<MemoryStore> m_store = std::make_shared<MemoryStore>();
};

// --- Registration ------------------------------------------------------------

TEST_F(RuntimeTest, RegistrationGivesIdentityAtOnceAndCountsAsChanged) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    TestNode* a = DollarNew(new TestNode(1));
    TestNode* b = DollarNew(new TestNode(2));
    EXPECT_EQ(a->GetPersistObjState().m_oid, OID(Seid(1)));
    EXPECT_EQ(b->GetPersistObjState().m_oid, OID(Seid(2)));
    EXPECT_EQ(a->GetSysState().m_cspace, &space);
    EXPECT_TRUE(a->IsDirty());
    EXPECT_TRUE(space.IsResident(OID(Seid(2))));
    EXPECT_EQ(space.NumDirty(), 2);
    space.Commit();
    EXPECT_FALSE(a->IsDirty());
    EXPECT_FALSE(a->GetSysState().GetFlag(DBP_GC_NOT_REGISTERED_IN_EXTENT));
    EXPECT_EQ(m_store->Stats().numImages, 2);
    EXPECT_EQ(m_store->NextIdentity(), 3u);
}

TEST_F(RuntimeTest, IdentityCounterContinuesInANewSpace) {
    {
        CSpace space(m_store);
        CSpaceGuard guard(space, LockMode::Exclusive);
        DollarNew(new TestNode());
        DollarNew(new TestNode());
        space.Commit();
        DollarNew(new TestNode());  // never committed: its identity is not kept
    }
    CSpace again(m_store);
    CSpaceGuard guard(again, LockMode::Exclusive);
    EXPECT_EQ(DollarNew(new TestNode())->GetPersistObjState().m_oid, OID(Seid(3)));
}

TEST_F(RuntimeTest, RegistrationNeedsTheSpaceExclusively) {
    EXPECT_TARN_ASSERT(DollarNew(new TestNode()), "space != nullptr");
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Shared);
    EXPECT_TARN_ASSERT(DollarNew(new TestNode()), "GetRecordedLockStatus(this) > 0");
}

TEST_F(RuntimeTest, CreateObjectByNameRunsOnCreate) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    ptr<IPersistable> p = space.CreateObject("tarn::testing::TestNode");
    auto* n = static_cast<TestNode*>(p.m_self);
    EXPECT_EQ(n->m_onCreateArg, 1);
    EXPECT_FALSE(n->GetPersistObjState().m_oid.IsNull());
    TestNode* t = CreatePersistent<TestNode>();
    EXPECT_EQ(t->m_onCreateArg, 1);
    EXPECT_THROW(space.CreateObject("tarn::testing::Missing"), RuntimeError);
}

TEST_F(RuntimeTest, UnregisteredObjectsAreNotTracked) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    TestNode* n = DollarNew(new TestNode(4));
    space.Commit();
    TestNode temp(*n);  // a copy: no space, no identity
    temp.m_value = 5;
    temp.MarkAsDirtyWithoutTrace();
    EXPECT_FALSE(temp.IsDirty());
    EXPECT_EQ(space.NumDirty(), 0);
}

// --- Round trip through the store ------------------------------------------------

TEST_F(RuntimeTest, DroppedResidentsLoadAgainThroughReferences) {
    const int live = TestNode::s_live;
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    int64 next = 1;
    TestNode* root = BuildTree(4, next);  // 15 nodes, values 1..15
    space.SetRoot("tree", root->GetPersistObjState().m_oid);
    const OID rootId = root->GetPersistObjState().m_oid;
    cref<TestNode> left = root->m_left;
    space.Commit();

    EXPECT_EQ(space.DropCleanResidents(), 15);
    EXPECT_EQ(space.NumResidents(), 0);
    EXPECT_EQ(TestNode::s_live, live);

    cref<TestNode> again(space.GetRoot("tree"));
    EXPECT_EQ(again.m_oid, rootId);
    int64 sum = 0;
    int count = 0;
    Walk(again.Get(), sum, count);
    EXPECT_EQ(count, 15);
    EXPECT_EQ(sum, 15 * 16 / 2);
    EXPECT_EQ(space.Stats().numLoaded, 15);
    // Loaded objects are bound into their referrers and clean.
    EXPECT_TRUE(again->m_left.IsBound());
    EXPECT_FALSE(again->IsDirty());
    EXPECT_EQ(again->m_left.m_oid, left.m_oid);
    // A second walk loads nothing.
    Walk(again.Get(), sum, count);
    EXPECT_EQ(space.Stats().numLoaded, 15);
}

TEST_F(RuntimeTest, EvictionKeepsDirtyObjectsAndUnbindsTheRest) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    int64 next = 1;
    TestNode* root = BuildTree(2, next);  // root 1, children 2 and 3
    space.Commit();
    TestNode* l = root->m_left.Get();
    l->m_value = 20;
    l->MarkAsDirtyWithoutTrace();

    EXPECT_EQ(space.DropCleanResidents(), 2);  // root and right; left is dirty
    EXPECT_EQ(space.NumResidents(), 1);
    EXPECT_TRUE(space.IsResident(OID(Seid(2))));

    cref<TestNode> r(OID(Seid(1)));
    TestNode* reloaded = r.Get();
    EXPECT_FALSE(reloaded->m_left.IsBound());  // a fresh image
    EXPECT_EQ(reloaded->m_left.Get(), l);      // found among the residents
    EXPECT_EQ(reloaded->m_left->m_value, 20);
    space.Commit();
    EXPECT_EQ(space.DropCleanResidents(), 2);
    // `r` is a local reference, which eviction does not reach: it must be
    // unbound by hand (or be a SpaceRef) before it is used again.
    r.Unbind();
    EXPECT_EQ(r.GetInMemory(), nullptr);
    EXPECT_EQ(r->m_left->m_value, 20);
}

TEST_F(RuntimeTest, EvictionUnbindsReferencesBetweenResidents) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    int64 next = 1;
    TestNode* root = BuildTree(3, next);
    space.Commit();
    root->m_value = 100;  // keep the root, release everything below it
    root->MarkAsDirtyWithoutTrace();
    EXPECT_EQ(space.DropCleanResidents(), 6);
    EXPECT_FALSE(root->m_left.IsBound());
    EXPECT_FALSE(root->m_right.IsBound());
    EXPECT_EQ(root->m_left->m_left->m_value, 3);
}

TEST_F(RuntimeTest, ResidentBoundEvictsOldestCleanAfterCommit) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    space.SetResidentBound(4);
    int64 next = 1;
    BuildTree(3, next);  // 7 nodes
    space.Commit();
    EXPECT_EQ(space.NumResidents(), 3);  // down to three quarters of the bound
    EXPECT_EQ(space.Stats().numEvicted, 4);
    EXPECT_FALSE(space.IsResident(OID(Seid(4))));  // registered first
    EXPECT_TRUE(space.IsResident(OID(Seid(5))));
    DollarNew(new TestNode());
    space.Commit();  // 4 residents: within the bound
    EXPECT_EQ(space.NumResidents(), 4);
}

TEST_F(RuntimeTest, SpaceRefSurvivesEviction) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    TestNode* n = DollarNew(new TestNode(8));
    SpaceRef<TestNode> keep(space, n);
    space.Commit();
    space.DropCleanResidents();
    EXPECT_FALSE(keep.IsBound());
    EXPECT_EQ(keep->m_value, 8);
    SpaceRef<TestNode> copy(keep);
    space.DropCleanResidents();
    EXPECT_FALSE(copy.IsBound());
    EXPECT_EQ(copy->m_value, 8);
}

TEST_F(RuntimeTest, SharedHolderResolvesWithoutBinding) {
    CSpace space(m_store);
    {
        CSpaceGuard guard(space, LockMode::Exclusive);
        DollarNew(new TestNode(3));
        space.Commit();
        space.DropCleanResidents();
    }
    CSpaceGuard guard(space, LockMode::Shared);
    cref<TestNode> r(OID(Seid(1)));
    EXPECT_EQ(r->m_value, 3);
    EXPECT_FALSE(r.IsBound());
    EXPECT_EQ(space.NumResidents(), 1);
    EXPECT_TARN_ASSERT(r->MarkAsDirtyWithoutTrace(), "GetRecordedLockStatus(this) > 0");
}

TEST_F(RuntimeTest, DestroyingTheSpaceDiscardsUncommittedChanges) {
    const int live = TestNode::s_live;
    {
        CSpace space(m_store);
        CSpaceGuard guard(space, LockMode::Exclusive);
        int64 next = 1;
        BuildTree(3, next);
    }
    EXPECT_EQ(TestNode::s_live, live);
    EXPECT_EQ(m_store->Stats().numImages, 0);
}

// --- Deferred deletion ------------------------------------------------------------

TEST_F(RuntimeTest, DeletionHappensOnlyAtCommit) {
    const int live = TestNode::s_live;
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    int64 next = 1;
    TestNode* root = BuildTree(2, next);
    space.Commit();
    TestNode* right = root->m_right.Get();
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(right));
    root->m_right = nullptr;
    root->MarkAsDirtyWithoutTrace();
    // Still alive and usable for the rest of the operation.
    EXPECT_EQ(right->m_value, 3);
    EXPECT_TRUE(space.IsResident(OID(Seid(3))));
    EXPECT_EQ(TestNode::s_live, live + 3);
    EXPECT_EQ(m_store->Stats().numImages, 3);

    space.Commit();
    EXPECT_EQ(TestNode::s_live, live + 2);
    EXPECT_FALSE(space.IsResident(OID(Seid(3))));
    EXPECT_EQ(m_store->Stats().numImages, 2);
    EXPECT_FALSE(m_store->Load(3).has_value());
    cref<TestNode> stale(OID(Seid(3)));
    EXPECT_THROW(stale.Get(), RuntimeError);
    EXPECT_EQ(stale.TryGet(), nullptr);
}

TEST_F(RuntimeTest, SubTreeDeletionLoadsAndRemovesEverythingBelow) {
    const int live = TestNode::s_live;
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    TestNode* holder = DollarNew(new TestNode(0));
    int64 next = 1;
    holder->m_left = BuildTree(3, next);  // identities 2..8
    space.Commit();
    space.DropCleanResidents();

    cref<TestNode> h(OID(Seid(1)));
    TestNode* sub = h->m_left.Get();  // only the subtree's root is loaded
    EXPECT_EQ(space.NumResidents(), 2);
    AsyncPermanentlyDeleteSubTree(ptr<IPersistable>(sub));
    h->m_left = nullptr;
    h->MarkAsDirtyWithoutTrace();
    space.Commit();
    EXPECT_EQ(m_store->Stats().numImages, 1);
    EXPECT_EQ(space.NumResidents(), 1);
    EXPECT_EQ(TestNode::s_live, live + 1);
    EXPECT_EQ(space.Stats().numDeleted, 7);
}

TEST_F(RuntimeTest, DeletingANewObjectNeverReachesTheStore) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    TestNode* n = DollarNew(new TestNode(1));
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(n));
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(n));  // queued once
    EXPECT_EQ(space.NumQueuedDeletions(), 1);
    space.Commit();
    EXPECT_EQ(m_store->Stats().numImages, 0);
    EXPECT_EQ(space.NumResidents(), 0);
    EXPECT_EQ(space.NumDirty(), 0);
}

TEST_F(RuntimeTest, CommitUnbindsReferencesToDeletedObjects) {
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    int64 next = 1;
    TestNode* root = BuildTree(2, next);
    space.Commit();
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(root->m_left.Get()));
    space.Commit();  // the root still refers to it, by mistake
    EXPECT_FALSE(root->m_left.IsBound());
    EXPECT_THROW(root->m_left.Get(), RuntimeError);
}

// --- Commit atomicity --------------------------------------------------------------

// A store whose next commit fails before changing anything.
class FailingStore final : public IStore {
public:
    explicit FailingStore(std::shared_ptr<IStore> inner) : m_inner(std::move(inner)) {}
    std::optional<StoredImage> Load(uint64 oid) override { return m_inner->Load(oid); }
    std::optional<uint64> FindRoot(std::string_view name) override {
        return m_inner->FindRoot(name);
    }
    std::map<std::string, uint64> Roots() override { return m_inner->Roots(); }
    uint64 NextIdentity() override { return m_inner->NextIdentity(); }
    void Commit(const CommitBatch& batch) override {
        if (m_failNext) {
            m_failNext = false;
            throw RuntimeError("disk full");
        }
        m_inner->Commit(batch);
    }
    void ForEachIdentity(const std::function<void(uint64)>& fn) override {
        m_inner->ForEachIdentity(fn);
    }
    StoreStats Stats() override { return m_inner->Stats(); }

    bool m_failNext = false;

private:
    std::shared_ptr<IStore> m_inner;
};

TEST_F(RuntimeTest, FailedCommitChangesNothingAndCanBeRetried) {
    auto failing = std::make_shared<FailingStore>(m_store);
    CSpace space(failing);
    CSpaceGuard guard(space, LockMode::Exclusive);
    int64 next = 1;
    TestNode* root = BuildTree(2, next);
    space.Commit();
    TestNode* right = root->m_right.Get();
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(right));
    root->m_value = 10;
    root->MarkAsDirtyWithoutTrace();
    space.SetRoot("r", root->m_left);

    failing->m_failNext = true;
    EXPECT_THROW(space.Commit(), RuntimeError);
    EXPECT_TRUE(root->IsDirty());
    EXPECT_EQ(space.NumDirty(), 1);
    EXPECT_EQ(space.NumQueuedDeletions(), 1);
    EXPECT_EQ(right->m_value, 3);  // not destroyed
    EXPECT_EQ(m_store->Stats().numImages, 3);
    EXPECT_FALSE(m_store->FindRoot("r").has_value());

    space.Commit();
    EXPECT_FALSE(root->IsDirty());
    EXPECT_EQ(m_store->Stats().numImages, 2);
    EXPECT_EQ(m_store->FindRoot("r"), std::optional<uint64>(2));
}

// --- Named roots -----------------------------------------------------------------

TEST_F(RuntimeTest, RootsArePersistedAtCommit) {
    {
        CSpace space(m_store);
        CSpaceGuard guard(space, LockMode::Exclusive);
        TestNode* n = DollarNew(new TestNode(1));
        space.SetRoot("a", cref<TestNode>(n));
        space.SetRoot("b", OID(Seid(99)));
        space.SetRoot("b", OID());
        EXPECT_EQ(space.GetRoot("a"), OID(Seid(1)));
        EXPECT_TRUE(space.GetRoot("b").IsNull());
        space.Commit();
    }
    CSpace space(m_store);
    EXPECT_EQ(space.GetRoot("a"), OID(Seid(1)));
    EXPECT_TRUE(space.GetRoot("b").IsNull());
    EXPECT_EQ(space.Roots().size(), 1u);
}

// --- The loader's checks ------------------------------------------------------------

// Writes raw images into the store, as a damaged or foreign store would hold.
void PutImage(MemoryStore& store, uint64 oid, const std::string& className,
              std::vector<octet_t> bytes) {
    CommitBatch batch;
    batch.writes.emplace_back(oid, StoredImage{className, std::move(bytes)});
    batch.nextIdentity = 100;
    store.Commit(batch);
}

std::vector<octet_t> NodeImage(int64 value) {
    std::vector<octet_t> b = {1};  // schema
    for (int i = 0; i < 8; ++i) {
        b.push_back(static_cast<octet_t>(value >> (8 * i)));
    }
    b.insert(b.end(), 16, 0);  // two empty references
    return b;
}

TEST_F(RuntimeTest, LoaderAcceptsAWellFormedImage) {
    PutImage(*m_store, 5, "tarn::testing::TestNode", NodeImage(77));
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    cref<TestNode> r(OID(Seid(5)));
    EXPECT_EQ(r->m_value, 77);
    EXPECT_EQ(r->GetPersistObjState().m_oid, OID(Seid(5)));
}

TEST_F(RuntimeTest, LoaderRejectsBadImagesWithClearErrors) {
    std::vector<octet_t> longer = NodeImage(1);
    longer.push_back(0);
    std::vector<octet_t> shorter = NodeImage(1);
    shorter.pop_back();
    PutImage(*m_store, 1, "tarn::testing::Unknown", NodeImage(1));
    PutImage(*m_store, 2, "tarn::testing::TestOther", {1, 0, 0, 0, 0, 0, 0, 0, 0});
    PutImage(*m_store, 3, "tarn::testing::TestNode", longer);
    PutImage(*m_store, 4, "tarn::testing::TestNode", shorter);
    const int live = TestNode::s_live;
    CSpace space(m_store);
    CSpaceGuard guard(space, LockMode::Exclusive);

    auto message = [](const prefbase& r, auto get) -> std::string {
        try {
            get(r);
        } catch (const RuntimeError& e) {
            return e.what();
        }
        return "no error";
    };
    auto getNode = [](const prefbase& r) { static_cast<const cref<TestNode>&>(r).Get(); };
    EXPECT_EQ(message(cref<TestNode>(OID(Seid(1))), getNode),
              "object #1 has an image of unknown class 'tarn::testing::Unknown'");
    EXPECT_EQ(message(cref<TestNode>(OID(Seid(2))), getNode),
              "object #2 has an image of class 'tarn::testing::TestOther' where "
              "'tarn::testing::TestNode' was expected");
    EXPECT_EQ(message(cref<TestNode>(OID(Seid(3))), getNode),
              "object #3 of class 'tarn::testing::TestNode': reading consumed 25 of 26 bytes");
    EXPECT_EQ(message(cref<TestNode>(OID(Seid(4))), getNode),
              "object #4 of class 'tarn::testing::TestNode': reading consumed 25 of 24 bytes");
    EXPECT_EQ(message(cref<TestNode>(OID(Seid(6))), getNode),
              "object #6 has no image in the store");
    EXPECT_EQ(space.NumResidents(), 0);
    EXPECT_EQ(TestNode::s_live, live);

    // An untyped reference accepts any class; a typed one then checks the
    // resident's class too.
    cref<void> any;
    any.m_oid = OID(Seid(2));
    EXPECT_NE(any.Get(), nullptr);
    EXPECT_THROW(cref<TestNode>(OID(Seid(2))).Get(), RuntimeError);
}

TEST_F(RuntimeTest, ResolvingNeedsASpace) {
    cref<TestNode> r(OID(Seid(1)));
    EXPECT_TARN_ASSERT(r.Get(), "space != nullptr");
    cref<TestNode> empty;
    EXPECT_TARN_ASSERT(empty.GetNotNull(), "!m_oid.IsNull()");
}

// --- Guards ---------------------------------------------------------------------

TEST_F(RuntimeTest, GuardsRefuseUpgradesAndSecondSpaces) {
    CSpace a;
    CSpace b;
    EXPECT_TARN_ASSERT(
        {
            CSpaceGuard g(a, LockMode::Shared);
            CSpaceGuard h(a, LockMode::Exclusive);
        },
        "!(mode == LockMode::Exclusive && t.status < 0)");
    EXPECT_TARN_ASSERT(
        {
            CSpaceGuard g(a, LockMode::Exclusive);
            CSpaceGuard h(b, LockMode::Shared);
        },
        "t.space == nullptr || t.space == &space");
}

}  // namespace
}  // namespace tarn
