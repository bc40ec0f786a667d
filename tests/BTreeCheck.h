#pragma once

// The one invariant checker of the B+tree map, shared by every test that
// changes a tree, plus key and payload makers for those tests.
//
// CheckBTree walks the whole tree (loading nodes as needed) and returns a
// description of the first broken invariant, or "" when all hold:
//   1. height -1 <=> no root; then no first/last leaf and size 0
//   2. height 0: root, first and last leaf are the same leaf
//   3. fill: root leaf 0..100, internal root 1..100, every other node 50..100
//   4. keys strictly increase inside every node
//   5. every key of a subtree lies in the bounds its ancestors' separators
//      give it (inclusive below, exclusive above)
//   6. the leaves in tree order are exactly the chain m_firstLeaf ->m_next..
//      m_lastLeaf, with m_prev linking it backwards and null ends; all leaves
//      sit at the same depth (they are reached at height 0 only)
//   7. m_size is the total of the leaves' counts

#include <gtest/gtest.h>

#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/ClassRegistry.h"
#include "tnRuntime/MemoryStore.h"
#include "tnRuntime/RuntimeCallLog.h"

namespace tarn::testing {

// Key i of a test series: oid 7 and an 8-byte big-endian path, so that keys
// order as their numbers. A long key appends 12 more bytes (20 in all), which
// puts the path in a heap buffer without changing the order.
inline FieldId MakeKey(uint64 i, bool longPath = false) {
    octet_t bytes[20];
    for (int b = 0; b < 8; ++b) {
        bytes[b] = static_cast<octet_t>(i >> (8 * (7 - b)));
    }
    for (int b = 8; b < 20; ++b) {
        bytes[b] = static_cast<octet_t>(0xa0 + b);
    }
    return FieldId(OID(Seid(uint64{7})), Path(bytes, longPath ? 20 : 8));
}

// A key with an arbitrary oid and path bytes.
inline FieldId MakeKey(uint64 oid, const std::string& path) {
    return FieldId(OID(Seid(oid)), Path(path.data(), static_cast<ssize_t>(path.size())));
}

inline Guid MakeSite(uint32 n) {
    Guid g{};
    g.Data1 = n;
    return g;
}

// A table with one record from site `site`.
inline OffsetOpsOnField<int64> MakePayload(int64 offset, uint32 site = 1, ssize_t t = 1) {
    OffsetOpsOnField<int64> p;
    p.Insert(MakeSite(site), t, offset);
    return p;
}

inline std::string KeyText(const FieldId& k) {
    std::ostringstream os;
    os << "#" << k.oid.value_ << "/";
    static const char* hex = "0123456789abcdef";
    for (octet_t b : k.path) {
        os << hex[b >> 4] << hex[b & 15];
    }
    return os.str();
}

class BTreeChecker {
public:
    using Map = FieldIdToOffsetOpsOnInt64FieldMap;
    using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
    using Internal = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;

    explicit BTreeChecker(const Map& m) : m_map(m) {}

    std::string Run() {
        const Map& m = m_map;
        if (m.m_height < -1) {
            return Fail("height below -1");
        }
        if (m.m_height == -1) {
            if (m.m_root) {
                return Fail("height -1 with a root");
            }
            if (m.m_firstLeaf || m.m_lastLeaf) {
                return Fail("height -1 with a first or last leaf");
            }
            if (m.m_size != 0) {
                return Fail("height -1 with size " + std::to_string(m.m_size));
            }
            return "";
        }
        void* root = m.m_root.Get();
        if (!root) {
            return Fail("height >= 0 without a root");
        }
        if (m.m_height == 0 && (m.m_firstLeaf.Get() != root || m.m_lastLeaf.Get() != root)) {
            return Fail("root leaf is not both first and last leaf");
        }
        if (!Node(m.m_height, root, true, nullptr, nullptr)) {
            return m_error;
        }
        return CheckChain();
    }

private:
    std::string Fail(const std::string& what) {
        if (m_error.empty()) {
            m_error = what;
        }
        return m_error;
    }

    bool Node(ssize_t height, void* node, bool isRoot, const FieldId* lo, const FieldId* hi) {
        if (!node) {
            Fail("null child at height " + std::to_string(height));
            return false;
        }
        if (height == 0) {
            return LeafNode(static_cast<Leaf*>(node), isRoot, lo, hi);
        }
        auto* in = static_cast<Internal*>(node);
        ssize_t nk = in->m_numKeyEntrys;
        ssize_t min = isRoot ? 1 : 50;
        if (nk < min || nk > 100) {
            Fail("internal node at height " + std::to_string(height) + " holds " +
                 std::to_string(nk) + " keys");
            return false;
        }
        if (!Ordered(
                nk, [&](ssize_t i) -> const FieldId& { return in->GetEntry(i).m_key; }, lo, hi,
                "internal", height)) {
            return false;
        }
        if (!Node(height - 1, in->m_ptr.Get(), false, lo, &in->GetEntry(0).m_key)) {
            return false;
        }
        for (ssize_t i = 0; i < nk; ++i) {
            const FieldId* upper = i + 1 < nk ? &in->GetEntry(i + 1).m_key : hi;
            if (!Node(height - 1, in->GetEntry(i).m_ptr.Get(), false, &in->GetEntry(i).m_key,
                      upper)) {
                return false;
            }
        }
        return true;
    }

    bool LeafNode(Leaf* leaf, bool isRoot, const FieldId* lo, const FieldId* hi) {
        ssize_t nk = leaf->m_numKeyEntrys;
        ssize_t min = isRoot ? 0 : 50;
        if (nk < min || nk > 100) {
            Fail("leaf #" + std::to_string(m_leaves.size()) + " holds " + std::to_string(nk) +
                 " entries");
            return false;
        }
        m_leaves.push_back(leaf);
        m_total += nk;
        return Ordered(
            nk, [&](ssize_t i) -> const FieldId& { return leaf->GetEntry(i).first; }, lo, hi,
            "leaf", 0);
    }

    template <typename KeyAt>
    bool Ordered(ssize_t nk, KeyAt key, const FieldId* lo, const FieldId* hi, const char* kind,
                 ssize_t height) {
        std::string where = std::string(kind) + " at height " + std::to_string(height);
        for (ssize_t i = 1; i < nk; ++i) {
            if (CompareKeys(key(i - 1), key(i)) >= 0) {
                Fail(where + ": keys " + std::to_string(i - 1) + " and " + std::to_string(i) +
                     " out of order");
                return false;
            }
        }
        if (nk > 0 && lo && CompareKeys(*lo, key(0)) > 0) {
            Fail(where + ": first key " + KeyText(key(0)) + " below separator " + KeyText(*lo));
            return false;
        }
        if (nk > 0 && hi && CompareKeys(key(nk - 1), *hi) >= 0) {
            Fail(where + ": last key " + KeyText(key(nk - 1)) + " not below separator " +
                 KeyText(*hi));
            return false;
        }
        return true;
    }

    std::string CheckChain() {
        const Map& m = m_map;
        if (m.m_firstLeaf.Get() != m_leaves.front()) {
            return Fail("m_firstLeaf is not the leftmost leaf");
        }
        if (m.m_lastLeaf.Get() != m_leaves.back()) {
            return Fail("m_lastLeaf is not the rightmost leaf");
        }
        if (m_leaves.front()->m_prev) {
            return Fail("first leaf has a predecessor");
        }
        if (m_leaves.back()->m_next) {
            return Fail("last leaf has a successor");
        }
        for (std::size_t i = 0; i + 1 < m_leaves.size(); ++i) {
            if (m_leaves[i]->m_next.Get() != m_leaves[i + 1]) {
                return Fail("m_next of leaf #" + std::to_string(i) + " is not leaf #" +
                            std::to_string(i + 1));
            }
            if (m_leaves[i + 1]->m_prev.Get() != m_leaves[i]) {
                return Fail("m_prev of leaf #" + std::to_string(i + 1) + " is not leaf #" +
                            std::to_string(i));
            }
        }
        if (m.m_size != m_total) {
            return Fail("m_size " + std::to_string(m.m_size) + " but leaves hold " +
                        std::to_string(m_total));
        }
        return "";
    }

    const Map& m_map;
    std::vector<Leaf*> m_leaves;
    ssize_t m_total = 0;
    std::string m_error;
};

// "" when every invariant holds, else what broke first.
inline std::string CheckBTree(const FieldIdToOffsetOpsOnInt64FieldMap& m) {
    return BTreeChecker(m).Run();
}

// The entry counts of the leaves, first to last, following the chain.
inline std::vector<ssize_t> LeafCounts(const FieldIdToOffsetOpsOnInt64FieldMap& m) {
    std::vector<ssize_t> counts;
    for (auto* leaf = m.m_firstLeaf.Get(); leaf; leaf = leaf->m_next.Get()) {
        counts.push_back(leaf->m_numKeyEntrys);
    }
    return counts;
}

// ---- Runtime helpers ---------------------------------------------------------

// Registers the three tree classes once per process, so that their images can
// be loaded by class name.
inline void RegisterBTreeClasses() {
    if (FindReflectedClass("tarn::FieldIdToOffsetOpsOnInt64FieldMap") == nullptr) {
        _Register_FieldIdToOffsetOpsOnInt64FieldMap();
        _Register_FieldIdToOffsetOpsOnInt64FieldMapInternalNode();
        _Register_FieldIdToOffsetOpsOnInt64FieldMapLeafNode();
    }
}

// An in-memory store that remembers the identities each commit wrote, in the
// order the space queued them: registration of a new object or the first
// dirty mark since the previous commit. That order makes the sequence of dirty
// marks of one operation observable.
class RecordingStore final : public IStore {
public:
    std::optional<StoredImage> Load(uint64 oid) override { return m_store.Load(oid); }
    std::optional<uint64> FindRoot(std::string_view name) override {
        return m_store.FindRoot(name);
    }
    std::map<std::string, uint64> Roots() override { return m_store.Roots(); }
    uint64 NextIdentity() override { return m_store.NextIdentity(); }
    void Commit(const CommitBatch& batch) override {
        m_lastWrites.clear();
        for (const auto& w : batch.writes) {
            m_lastWrites.push_back(w.first);
        }
        m_lastDeletes = batch.deletes;
        m_store.Commit(batch);
    }
    void ForEachIdentity(const std::function<void(uint64)>& fn) override {
        m_store.ForEachIdentity(fn);
    }
    StoreStats Stats() override { return m_store.Stats(); }

    std::vector<uint64> m_lastWrites;
    std::vector<uint64> m_lastDeletes;

private:
    MemoryStore m_store;
};

template <typename T>
uint64 Oid(const T* obj) {
    return obj->GetPersistObjState().m_oid.value_;
}

// A space over a recording store, held exclusively by the test's thread, with
// one registered map in it.
class BTreeSpaceTest : public ::testing::Test {
protected:
    using Map = FieldIdToOffsetOpsOnInt64FieldMap;
    using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
    using Internal = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;

    BTreeSpaceTest()
        : m_store(std::make_shared<RecordingStore>()),
          m_space(m_store),
          m_guard(m_space, LockMode::Exclusive) {
        RegisterBTreeClasses();
        m_map = DollarNew(new Map());
        GetThreadRuntimeCallLog() = RuntimeCallLog();
    }

    Map& map() { return *m_map; }

    // Writes everything queued so far and starts a fresh call log, so that
    // the next operation's marks and calls can be observed on their own.
    void Commit() {
        m_space.Commit();
        GetThreadRuntimeCallLog() = RuntimeCallLog();
    }

    // The identities written by the next commit, in queue order.
    std::vector<uint64> CommitAndListWrites() {
        m_space.Commit();
        return m_store->m_lastWrites;
    }

    RuntimeCallLog& Log() { return GetThreadRuntimeCallLog(); }

    std::shared_ptr<RecordingStore> m_store;
    CSpace m_space;
    CSpaceGuard m_guard;
    Map* m_map = nullptr;
};

}  // namespace tarn::testing

#define EXPECT_BTREE_OK(map) EXPECT_EQ("", ::tarn::testing::CheckBTree(map))
#define ASSERT_BTREE_OK(map) ASSERT_EQ("", ::tarn::testing::CheckBTree(map))
