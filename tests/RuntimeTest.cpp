// The runtime: identities, dirty tracking and commit, eviction and reloading,
// deferred deletion, commit atomicity, named roots and counters, the loader's
// checks and the runtime's own assertions.

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/TestPersistable.h"
#include "tnBackends/ForwardingStore.h"
#include "tnBackends/MemoryStore.h"
#include "tnBackends/OverlayStore.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/SpaceRef.h"
#include "tnStore/RegisterClasses.h"
#include "tnUtils/MemoryOutputStream.h"
#include "tnUtils/RuntimeError.h"

namespace tarn {
namespace {

using testing::TestNode;

// A store whose next commit fails before changing anything.
class FailingStore final : public ForwardingStore {
public:
    using ForwardingStore::ForwardingStore;
    void Commit(const CommitBatch& batch) override {
        if (std::exchange(m_failNext, false)) {
            throw RuntimeError("disk full");
        }
        ForwardingStore::Commit(batch);
    }
    bool m_failNext = false;
};

// Every test works in one space over a fresh in-memory store, holding it
// exclusively unless it says otherwise.
class RuntimeTest : public ::testing::Test {
protected:
    void SetUp() override {
        testing::RegisterTestClasses();
        RegisterOffsetOpsClasses();
    }

    void Open(LockMode mode = LockMode::Exclusive) {
        m_guard.reset();
        m_space = std::make_unique<CSpace>(m_failing);
        m_guard = std::make_unique<CSpaceGuard>(*m_space, mode);
    }

    // A complete binary tree of the given depth, registered and valued in
    // preorder from `first`; identities follow the values in a fresh store.
    static TestNode* BuildTree(int depth, int64 first = 1) {
        TestNode* n = DollarNew(new TestNode(first));
        if (depth > 1) {
            n->m_left = BuildTree(depth - 1, first + 1);
            n->m_right = BuildTree(depth - 1, first + (int64{1} << (depth - 1)));
        }
        return n;
    }

    // The sum of the values reached through references, and their number.
    static std::pair<int64, int> Walk(const TestNode* n) {
        std::pair<int64, int> total(n->m_value, 1);
        for (const cref<TestNode>* child : {&n->m_left, &n->m_right}) {
            if (*child) {
                const auto [sum, count] = Walk(child->Get());
                total.first += sum;
                total.second += count;
            }
        }
        return total;
    }

    std::shared_ptr<MemoryStore> m_store = std::make_shared<MemoryStore>();
    std::shared_ptr<FailingStore> m_failing = std::make_shared<FailingStore>(m_store);
    std::unique_ptr<CSpace> m_space;
    std::unique_ptr<CSpaceGuard> m_guard;
    const int m_live = TestNode::s_live;
};

TEST_F(RuntimeTest, IdentitiesAreGivenAtRegistrationAndTheCounterPersists) {
    Open();
    TestNode* a = DollarNew(new TestNode(1));
    TestNode* b = DollarNew(new TestNode(2));
    EXPECT_EQ(a->GetPersistObjState().m_oid, OID(Seid(1)));
    EXPECT_EQ(b->GetPersistObjState().m_oid, OID(Seid(2)));
    EXPECT_EQ(a->GetSysState().m_cspace, m_space.get());
    EXPECT_TRUE(a->IsDirty());  // a new object counts as changed
    EXPECT_EQ(m_space->NumDirty(), 2);
    m_space->Commit();
    EXPECT_FALSE(a->IsDirty());
    EXPECT_EQ(m_store->Stats().numImages, 2);
    BuildTree(3);  // never committed: dies with the space, identities not kept
    Open();
    EXPECT_EQ(TestNode::s_live, m_live);
    EXPECT_EQ(m_store->Stats().numImages, 2);
    EXPECT_EQ(DollarNew(new TestNode())->GetPersistObjState().m_oid, OID(Seid(3)));
    TestNode* created =
        static_cast<TestNode*>(m_space->CreateObject("tarn::testing::TestNode").m_self);
    EXPECT_EQ(created->m_onCreateArg, 1);
    EXPECT_EQ(created->GetPersistObjState().m_oid, OID(Seid(4)));
    EXPECT_EQ(CreatePersistent<TestNode>()->m_onCreateArg, 1);
    EXPECT_THROW(m_space->CreateObject("tarn::testing::Missing"), RuntimeError);
}

TEST_F(RuntimeTest, MarkingQueuesARegisteredObjectOnceAndIgnoresCopies) {
    Open();
    TestNode* n = DollarNew(new TestNode(1));
    m_space->Commit();
    const int64 before = m_space->Stats().numMarkCalls;
    n->MarkAsDirtyWithoutTrace();
    n->MarkAsDirtyWithoutTrace();  // already dirty: no call
    EXPECT_TRUE(n->IsDirty());
    EXPECT_EQ(m_space->Stats().numMarkCalls - before, 1);
    MarkPersistentAsDirtyWithoutTrace(ptr<const IPersistable>(n));  // harmless when dirty
    TestNode copy(*n);  // no space, no identity: not tracked
    copy.MarkAsDirtyWithoutTrace();
    EXPECT_FALSE(copy.IsDirty());
    EXPECT_EQ(m_space->NumDirty(), 1);
}

// An object that leaves the space (collected by its owner) takes its pending
// change and its queued deletion with it; its identity, loaded and marked
// again, is written once.
TEST_F(RuntimeTest, ObjectsLeavingTheSpaceLeaveTheQueues) {
    Open();
    TestNode* a = BuildTree(2);  // 1 (2, 3)
    m_space->Commit();
    TestNode* b = a->m_left.Get();
    b->m_value = 20;
    b->MarkAsDirtyWithoutTrace();
    TestNode* c = a->m_right.Get();
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(c));
    a->MarkAsDirtyWithoutTrace();
    for (TestNode* leaving : {b, c}) {
        ptr<IPersistable>(leaving)->OnGarbageCollect();
        EXPECT_FALSE(leaving->IsDirty());
        leaving->Destroy();
    }
    a->m_left.Unbind();
    a->m_right.Unbind();
    EXPECT_EQ(m_space->NumDirty(), 1);
    EXPECT_EQ(m_space->NumQueuedDeletions(), 0);
    EXPECT_EQ(a->m_left->m_value, 2);  // the stored image
    a->m_left->MarkAsDirtyWithoutTrace();
    EXPECT_EQ(m_space->DirtyInQueueOrder(), (std::vector<OID>{OID(Seid(1)), OID(Seid(2))}));
    const int64 written = m_space->Stats().numWritten;
    m_space->Commit();
    EXPECT_EQ(m_space->Stats().numWritten - written, 2);
    EXPECT_EQ(m_store->Stats().numImages, 3);
}

// Committed objects that refer to each other, all residents dropped, are
// reached again through the references, from a root kept by name.
TEST_F(RuntimeTest, DroppedResidentsLoadAgainThroughReferencesWithTheirState) {
    Open();
    TestNode* root = BuildTree(4);  // 15 nodes, values 1..15
    m_space->SetRoot("tree", cref<TestNode>(root));
    m_space->SetRoot("gone", OID(Seid(99)));
    m_space->SetRoot("gone", OID());  // an empty root is removed
    m_space->Commit();
    EXPECT_EQ(m_space->DropCleanResidents(), 15);
    EXPECT_EQ(m_space->NumResidents(), 0);
    EXPECT_EQ(TestNode::s_live, m_live);

    cref<TestNode> again(m_space->GetRoot("tree"));
    EXPECT_EQ(Walk(again.Get()), std::make_pair(int64{15 * 16 / 2}, 15));
    EXPECT_EQ(m_space->Stats().numLoaded, 15);
    EXPECT_TRUE(again->m_left.IsBound());  // loaded objects are bound into their referrers
    EXPECT_FALSE(again->IsDirty());
    Walk(again.Get());
    EXPECT_EQ(m_space->Stats().numLoaded, 15);
    Open(LockMode::Shared);  // a shared holder loads without binding
    EXPECT_EQ(m_space->Roots(), (std::map<std::string, OID>{{"tree", OID(Seid(1))}}));
    cref<TestNode> shared(m_space->GetRoot("tree"));
    EXPECT_EQ(shared->m_left->m_value, 2);
    EXPECT_FALSE(shared.IsBound());
    EXPECT_EQ(m_space->NumResidents(), 2);
}

// Eviction unbinds the references between residents and those held in
// SpaceRefs; other local references must be unbound by hand.
TEST_F(RuntimeTest, EvictionKeepsDirtyObjectsAndUnbindsReferencesToTheRest) {
    Open();
    TestNode* root = BuildTree(3);  // 1 (2 (3, 4), 5 (6, 7))
    SpaceRef<TestNode> keep(*m_space, root);
    SpaceRef<TestNode> copy(keep);
    m_space->Commit();
    TestNode* left = root->m_left.Get();
    left->m_value = 20;
    left->MarkAsDirtyWithoutTrace();
    EXPECT_EQ(m_space->DropCleanResidents(), 6);
    EXPECT_FALSE(left->m_left.IsBound());
    EXPECT_EQ(left->m_left->m_value, 3);  // loads again
    EXPECT_FALSE(keep.IsBound() || copy.IsBound());
    EXPECT_FALSE(keep->m_left.IsBound());  // a fresh image
    EXPECT_EQ(keep->m_left.Get(), left);   // found among the residents
    cref<TestNode> local(keep);
    m_space->Commit();
    EXPECT_EQ(m_space->DropCleanResidents(), 3);
    local.Unbind();
    EXPECT_EQ(local->m_left->m_value, 20);
}

TEST_F(RuntimeTest, ResidentBoundEvictsTheOldestCleanObjectsAfterCommit) {
    Open();
    m_space->SetResidentBound(4);
    BuildTree(3);
    m_space->Commit();
    EXPECT_EQ(m_space->NumResidents(), 3);  // three quarters of the bound
    EXPECT_EQ(m_space->Stats().numEvicted, 4);
    EXPECT_FALSE(m_space->IsResident(OID(Seid(4))));
    EXPECT_TRUE(m_space->IsResident(OID(Seid(5))));
    DollarNew(new TestNode());
    m_space->Commit();
    EXPECT_EQ(m_space->NumResidents(), 4);
}

// Deletions queued and counters set during an operation are carried out only
// by a commit that succeeds; a failed commit changes nothing and can be
// retried. Counters survive reopening.
TEST_F(RuntimeTest, DeletionsAndCountersTakeEffectOnlyAtASuccessfulCommit) {
    Open();
    TestNode* root = BuildTree(2);
    m_space->Commit();
    TestNode* right = root->m_right.Get();
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(right));
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(root->m_left.Get()));  // still referred to
    TestNode* brandNew = DollarNew(new TestNode(10));
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(brandNew));
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(brandNew));  // queued once
    root->m_value = 10;
    root->MarkAsDirtyWithoutTrace();
    m_space->SetRoot("r", cref<TestNode>(root));
    m_space->SetCounter("journal", 7);
    m_failing->m_failNext = true;
    EXPECT_THROW(m_space->Commit(), RuntimeError);
    EXPECT_EQ(m_space->GetCounter("journal"), 7u);  // still pending
    EXPECT_FALSE(m_store->FindCounter("journal").has_value());
    EXPECT_EQ(m_space->NumQueuedDeletions(), 3);
    EXPECT_TRUE(root->IsDirty());
    EXPECT_EQ(right->m_value, 3);  // alive for the rest of the operation
    EXPECT_EQ(TestNode::s_live, m_live + 4);
    EXPECT_EQ(m_store->Stats().numImages, 3);
    EXPECT_FALSE(m_store->FindRoot("r").has_value());

    m_space->Commit();
    EXPECT_FALSE(root->IsDirty());
    EXPECT_EQ(TestNode::s_live, m_live + 1);
    EXPECT_EQ(m_store->Stats().numImages, 1);  // the new object never reached the store
    EXPECT_EQ(m_store->FindRoot("r"), std::optional<uint64>(1));
    EXPECT_EQ(m_store->FindCounter("journal"), 7u);
    EXPECT_FALSE(root->m_left.IsBound());  // references to deleted objects are unbound
    EXPECT_THROW(root->m_left.Get(), RuntimeError);
    EXPECT_EQ(root->m_right.TryGet(), nullptr);
    Open(LockMode::Shared);
    EXPECT_EQ(m_space->GetCounter("journal"), 7u);
    EXPECT_FALSE(m_space->GetCounter("journa").has_value());
}

TEST_F(RuntimeTest, SubTreeDeletionLoadsAndRemovesEverythingBelow) {
    Open();
    TestNode* holder = DollarNew(new TestNode(0));
    holder->m_left = BuildTree(3);  // identities 2..8
    m_space->Commit();
    m_space->DropCleanResidents();
    cref<TestNode> h(OID(Seid(1)));
    AsyncPermanentlyDeleteSubTree(ptr<IPersistable>(h->m_left.Get()));  // only its root is loaded
    h->m_left = nullptr;
    h->MarkAsDirtyWithoutTrace();
    m_space->Commit();
    EXPECT_EQ(m_store->Stats().numImages, 1);
    EXPECT_EQ(m_space->NumResidents(), 1);
    EXPECT_EQ(TestNode::s_live, m_live + 1);
    EXPECT_EQ(m_space->Stats().numDeleted, 7);
}

// TestNode image: schema 1, the value (8 bytes), two empty references; cut
// or padded with zeros to `size` bytes.
std::vector<octet_t> NodeImage(int64 value, std::size_t size = 25) {
    std::vector<octet_t> b = {1};
    for (int i = 0; i < 8; ++i) {
        b.push_back(static_cast<octet_t>(value >> (8 * i)));
    }
    b.resize(size);
    return b;
}

TEST_F(RuntimeTest, LoaderChecksClassAndLengthOfEveryImage) {
    CommitBatch batch;
    batch.writes = {{1, {"tarn::testing::Unknown", NodeImage(1)}},
                    {2, {"tarn::OffsetOps", {1, 0, 0, 0, 0, 0, 0, 0, 0}}},
                    {3, {"tarn::testing::TestNode", NodeImage(1, 26)}},
                    {4, {"tarn::testing::TestNode", NodeImage(1, 24)}},
                    {5, {"tarn::testing::TestNode", NodeImage(77)}}};
    batch.nextIdentity = 100;
    m_store->Commit(batch);
    Open();
    const std::pair<uint64, std::string> errors[] = {
        {1, "object #1 has an image of unknown class 'tarn::testing::Unknown'"},
        {2,
         "object #2 has an image of class 'tarn::OffsetOps' where "
         "'tarn::testing::TestNode' was expected"},
        {3, "object #3 of class 'tarn::testing::TestNode': reading consumed 25 of 26 bytes"},
        {4, "object #4 of class 'tarn::testing::TestNode': reading consumed 25 of 24 bytes"},
        {6, "object #6 has no image in the store"},
    };
    for (const auto& [oid, message] : errors) {
        try {
            cref<TestNode>(OID(Seid(oid))).Get();
            ADD_FAILURE() << "no error for #" << oid;
        } catch (const RuntimeError& e) {
            EXPECT_EQ(e.what(), message);
        }
    }
    EXPECT_EQ(m_space->NumResidents(), 0);
    EXPECT_EQ(TestNode::s_live, m_live);
    EXPECT_EQ(cref<TestNode>(OID(Seid(5)))->m_value, 77);
    // An untyped reference accepts any class; a typed one then checks the
    // resident's class too.
    cref<void> any;
    any.m_oid = OID(Seid(2));
    EXPECT_NE(any.Get(), nullptr);
    EXPECT_THROW(cref<TestNode>(OID(Seid(2))).Get(), RuntimeError);
}

// An overlay takes a space's commits and answers before its base, which
// never changes: a space over it commits, releases and loads again.
TEST_F(RuntimeTest, OverlayKeepsCommitsToItselfAndReadsThroughToItsBase) {
    {
        Open();
        m_space->SetRoot("tree", BuildTree(4)->GetPersistObjState().m_oid);
        m_space->SetCounter("position", 7);
        m_space->Commit();
    }
    const ssize_t baseImages = m_store->Stats().numImages;
    auto overlay = std::make_shared<OverlayStore>(m_store);
    m_guard.reset();
    CSpace space(overlay);
    CSpaceGuard guard(space, LockMode::Exclusive);
    auto* root = static_cast<TestNode*>(space.Resolve(space.GetRoot("tree"), nullptr).m_self);
    EXPECT_EQ(Walk(root), std::make_pair(int64{120}, 15));
    root->m_value = 1000;
    root->MarkAsDirtyWithoutTrace();
    TestNode* added = DollarNew(new TestNode(5));
    TestNode* leaf = root->m_left->m_left->m_left.Get();
    leaf->m_left = added;
    leaf->MarkAsDirtyWithoutTrace();
    AsyncPermanentlyDeleteObject(ptr<IPersistable>(root->m_right->m_right->m_right.Get()));
    root->m_right->m_right->m_right = nullptr;
    root->m_right->m_right->MarkAsDirtyWithoutTrace();
    space.SetCounter("position", 9);
    space.Commit();
    space.DropCleanResidents();
    EXPECT_EQ(space.NumResidents(), 0);

    root = static_cast<TestNode*>(space.Resolve(space.GetRoot("tree"), nullptr).m_self);
    EXPECT_EQ(Walk(root), std::make_pair(int64{120 - 1 + 1000 - 15 + 5}, 15));
    EXPECT_EQ(space.GetCounter("position"), 9u);
    EXPECT_GT(overlay->FileBytes(), 0u);
    EXPECT_EQ(m_store->Stats().numImages, baseImages);
    EXPECT_EQ(m_store->FindCounter("position"), 7u);
    EXPECT_EQ(overlay->NextIdentity(), m_store->NextIdentity() + 1);
    std::vector<uint64> identities;
    overlay->ForEachIdentity([&](uint64 oid) { identities.push_back(oid); });
    EXPECT_EQ(identities.size(), 15u);
}

// Rewritten images leave garbage in the overlay's file, which it drops once
// the file is twice what its live images take.
TEST(OverlayStore, RewrittenImagesKeepTheFileWithinTwiceTheLiveBytes) {
    auto base = std::make_shared<MemoryStore>();
    OverlayStore overlay(base, 4096);
    for (int round = 0; round < 100; ++round) {
        CommitBatch batch;
        for (uint64 oid = 1; oid <= 10; ++oid) {
            StoredImage image{"tarn::TestNode",
                              std::vector<octet_t>(1000 + oid, static_cast<octet_t>(round))};
            batch.writes.emplace_back(oid, std::move(image));
        }
        if (round == 50) {
            batch.deletes.push_back(3);
        }
        batch.nextIdentity = 11;
        overlay.Commit(batch);
        EXPECT_LE(overlay.FileBytes(), std::max<uint64>(4096, 2 * 10 * 1010));
    }
    for (uint64 oid = 1; oid <= 10; ++oid) {
        const std::optional<StoredImage> image = overlay.Load(oid);
        ASSERT_TRUE(image.has_value());
        EXPECT_EQ(image->bytes, std::vector<octet_t>(1000 + oid, octet_t{99}));
    }
    EXPECT_EQ(base->Stats().numImages, 0);
}

TEST_F(RuntimeTest, MisuseStopsTheProcess) {
    EXPECT_TARN_ASSERT(DollarNew(new TestNode()), "space != nullptr");
    EXPECT_TARN_ASSERT(cref<TestNode>(OID(Seid(1))).Get(), "space != nullptr");
    EXPECT_TARN_ASSERT(cref<TestNode>().GetNotNull(), "!m_oid.IsNull()");
    EXPECT_TARN_ASSERT(
        {
            CSpace a;
            CSpace b;
            CSpaceGuard g(a, LockMode::Exclusive);
            CSpaceGuard h(b, LockMode::Shared);
        },
        "t.space == nullptr || t.space == &space");
    Open();
    DollarNew(new TestNode());
    m_space->Commit();
    Open(LockMode::Shared);
    EXPECT_TARN_ASSERT(DollarNew(new TestNode()), "GetRecordedLockStatus(this) > 0");
    EXPECT_TARN_ASSERT(cref<TestNode>(OID(Seid(1)))->MarkAsDirtyWithoutTrace(),
                       "GetRecordedLockStatus(this) > 0");
    EXPECT_TARN_ASSERT({ CSpaceGuard upgrade(*m_space, LockMode::Exclusive); },
                       "!(mode == LockMode::Exclusive && t.status < 0)");
    EXPECT_TARN_ASSERT(m_space.reset(), "GetThreadCSpace() != this");
    Open();
    TestNode* n = DollarNew(new TestNode());
    EXPECT_TARN_ASSERT(DollarNew(n), "state.m_cspace == nullptr && pstate.m_oid.IsNull()");
    TestNode unregistered;
    MemoryOutputStream os;
    Archive ar(&os);
    EXPECT_TARN_ASSERT(ar << cref<TestNode>(&unregistered), "!IsBound() || !m_oid.IsNull()");
}

}  // namespace
}  // namespace tarn
