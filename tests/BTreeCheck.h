#pragma once

// What every tree test builds with: CheckBTree (the map's own non-aborting
// invariant checker, FieldIdToOffsetOpsOnInt64FieldMapCheck.h, reduced to
// its first problem), key and payload makers, byte-image helpers, and a
// fixture with a space, a map and shape helpers.

#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <sstream>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "tnBackends/MemoryStore.h"
#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapCheck.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/ClassRegistry.h"
#include "tnRuntime/RuntimeCallLog.h"
#include "tnStore/RegisterClasses.h"
#include "tnUtils/Archive.h"
#include "tnUtils/MemoryOutputStream.h"

namespace tarn::testing {

// Key i of a test series: oid 7 and an 8-byte big-endian path, so that keys
// order as their numbers. A long key appends 12 more bytes (20 in all), which
// puts the path in a heap buffer without changing the order.
inline FieldId MakeKey(uint64 i, bool longPath = false) {
    octet_t bytes[20];
    for (int b = 0; b < 20; ++b) {
        bytes[b] = static_cast<octet_t>(b < 8 ? i >> (8 * (7 - b)) : 0xa0 + b);
    }
    return FieldId(OID(Seid(uint64{7})), Path(bytes, longPath ? 20 : 8));
}

// A key with an arbitrary oid and path bytes.
inline FieldId MakeKey(uint64 oid, const std::string& path) {
    return FieldId(OID(Seid(oid)), Path(path.data(), static_cast<ssize_t>(path.size())));
}

// The number i of a key made by MakeKey(i, ...).
inline uint64 KeyNum(const FieldId& k) {
    uint64 v = 0;
    for (ssize_t i = 0; i < 8; ++i) {
        v = (v << 8) | k.path.begin()[i];
    }
    return v;
}

inline Guid MakeSite(uint32 n) {
    Guid g{};
    g.Data1 = n;
    return g;
}

// A table with one record from site `site`. Tables have no copy
// constructor, so a made table is handed out as a value of this type, filled
// by its own constructor, and used wherever a table is read or assigned from.
struct TestPayload : OffsetOpsOnField<int64> {
    TestPayload(int64 offset, uint32 site, ssize_t t) { Insert(MakeSite(site), t, offset); }
};

inline TestPayload MakePayload(int64 offset, uint32 site = 1, ssize_t t = 1) {
    return TestPayload(offset, site, t);
}

// The map's insert of (key, payload), which never overwrites. The entry is
// made with an empty table, then assigned.
inline std::pair<FieldIdToOffsetOpsOnInt64FieldMap::iterator, bool> InsertEntry(
    FieldIdToOffsetOpsOnInt64FieldMap& map, const FieldId& key,
    const OffsetOpsOnField<int64>& payload) {
    FieldIdToOffsetOpsOnInt64FieldMap::value_type x(std::piecewise_construct,
                                                    std::forward_as_tuple(key), std::tuple<>());
    x.second = payload;
    return map.insert(x);
}

inline std::string KeyText(const FieldId& k) {
    std::ostringstream os;
    os << "#" << k.oid.value_ << "/";
    for (octet_t b : k.path) {
        os << "0123456789abcdef"[b >> 4] << "0123456789abcdef"[b & 15];
    }
    return os.str();
}

// "" when every invariant holds, else what broke first (the map's own
// non-aborting checker).
inline std::string CheckBTree(const FieldIdToOffsetOpsOnInt64FieldMap& m) {
    FieldIdToOffsetOpsOnInt64FieldMapCheckResult check = FieldIdToOffsetOpsOnInt64FieldMapCheck(m);
    return check.Ok() ? std::string() : check.problems.front();
}

// The entry counts of the leaves, first to last, following the chain.
inline std::vector<ssize_t> LeafCounts(const FieldIdToOffsetOpsOnInt64FieldMap& m) {
    std::vector<ssize_t> counts;
    for (auto* leaf = m.m_firstLeaf.Get(); leaf; leaf = leaf->m_next.Get()) {
        counts.push_back(leaf->m_numKeyEntrys);
    }
    return counts;
}

// Vector helpers for writing expected shapes.
template <typename T>
std::vector<T> operator+(std::vector<T> a, const std::vector<T>& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}
template <typename T>
std::vector<T> Slice(const std::vector<T>& a, std::size_t from, std::size_t to) {
    return std::vector<T>(a.begin() + std::ptrdiff_t(from), a.begin() + std::ptrdiff_t(to));
}
template <typename T>
std::vector<T> WithoutAt(std::vector<T> a, std::size_t i) {
    a.erase(a.begin() + std::ptrdiff_t(i));
    return a;
}

// ---- Byte images ----------------------------------------------------------------

using Bytes = std::vector<octet_t>;

// The image `obj` writes through its Serialise.
template <typename T>
Bytes ImageOf(const T& obj) {
    MemoryOutputStream os;
    auto ar = std::make_unique<Archive>(&os);
    obj.Serialise(*ar);
    ar->Flush();
    return os.bytes();
}

// A 64-bit value as 8 bytes, least significant first.
inline Bytes Le64(uint64 v) {
    Bytes b;
    for (int i = 0; i < 8; ++i) {
        b.push_back(octet_t(v >> (8 * i)));
    }
    return b;
}

// ---- Runtime helpers ---------------------------------------------------------

// An in-memory store that remembers the identities each commit wrote (the
// space hands them over in identity order).
class RecordingStore final : public IStore {
public:
    std::optional<StoredImage> Load(uint64 oid) override { return m_store.Load(oid); }
    std::optional<uint64> FindRoot(std::string_view name) override {
        return m_store.FindRoot(name);
    }
    std::map<std::string, uint64> Roots() override { return m_store.Roots(); }
    std::optional<uint64> FindCounter(std::string_view name) override {
        return m_store.FindCounter(name);
    }
    std::map<std::string, uint64> Counters() override { return m_store.Counters(); }
    uint64 NextIdentity() override { return m_store.NextIdentity(); }
    void Commit(const CommitBatch& batch) override {
        m_lastWrites.clear();
        for (const auto& w : batch.writes) {
            m_lastWrites.push_back(w.first);
        }
        if (batch.streamedWrites) {
            batch.streamedWrites(
                [&](uint64 oid, const StoredImage&) { m_lastWrites.push_back(oid); });
        }
        m_lastDeletes = batch.deletes;
        m_store.Commit(batch);
    }
    void ForEachIdentity(const std::function<void(uint64)>& fn) override {
        m_store.ForEachIdentity(fn);
    }
    ImageCounts Stats() override { return m_store.Stats(); }

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
// one registered map in it, and the shape helpers of the exact-shape tests.
class BTreeSpaceTest : public ::testing::Test {
protected:
    using Map = FieldIdToOffsetOpsOnInt64FieldMap;
    using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
    using Internal = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
    using Keys = std::vector<uint64>;

    BTreeSpaceTest()
        : m_store(std::make_shared<RecordingStore>()),
          m_space(m_store),
          m_guard(m_space, LockMode::Exclusive) {
        RegisterOffsetOpsClasses();
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

    // The identities written by the next commit, in the order the space
    // queued them: registration of a new object or the first dirty mark since
    // the previous commit. That order makes the sequence of dirty marks of
    // one operation observable. The store receives them in identity order.
    std::vector<uint64> CommitAndListWrites() {
        const std::vector<OID> queued = m_space.DirtyInQueueOrder();
        m_space.Commit();
        const std::vector<uint64>& written = m_store->m_lastWrites;
        EXPECT_TRUE(std::is_sorted(written.begin(), written.end()));
        std::vector<uint64> inQueueOrder;
        for (const OID& id : queued) {
            if (std::binary_search(written.begin(), written.end(), id.value_)) {
                inQueueOrder.push_back(id.value_);
            }
        }
        EXPECT_EQ(inQueueOrder.size(), written.size());
        return inQueueOrder;
    }

    RuntimeCallLog& Log() { return GetThreadRuntimeCallLog(); }

    // Shape keys: K(i) is key number i * kGap, so that further keys fit
    // between any two; long when m_longKeys is set.
    static constexpr uint64 kGap = 1000;
    FieldId K(uint64 i) const { return Key(i * kGap); }
    FieldId Key(uint64 num) const { return MakeKey(num, m_longKeys); }

    // Inserts the key numbered `num` with payload `num`.
    void Put(uint64 num) { ASSERT_TRUE(map().Insert(Key(num), MakePayload(int64(num)), false)); }
    // K(first) .. K(last) in ascending order: every leaf but the last ends
    // with 50 entries and, once the root has split, every internal node with 50.
    void Fill(uint64 first, uint64 last) {
        for (uint64 i = first; i <= last; ++i) {
            Put(i * kGap);
        }
    }
    static Internal* AsInternal(void* n) {
        return FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(n);
    }
    static Leaf* AsLeaf(void* n) { return FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(n); }
    Internal* Root() { return AsInternal(map().m_root.Get()); }
    // Leaf i of the chain, counting from 0.
    Leaf* LeafAt(std::size_t i) {
        Leaf* leaf = map().m_firstLeaf.Get();
        while (i-- > 0) {
            leaf = leaf->m_next.Get();
        }
        return leaf;
    }
    static Keys LeafKeys(const Leaf* leaf) {
        Keys out;
        for (ssize_t i = 0; i < leaf->m_numKeyEntrys; ++i) {
            out.push_back(KeyNum(leaf->GetEntry(i).first));
        }
        return out;
    }
    static Keys Separators(const Internal* node) {
        Keys out;
        for (ssize_t i = 0; i < node->m_numKeyEntrys; ++i) {
            out.push_back(KeyNum(node->GetEntry(i).m_key));
        }
        return out;
    }
    // An internal node as (separator number, child) pairs; the leftmost
    // child comes first, with separator 0.
    using Entries = std::vector<std::pair<uint64, void*>>;
    static Entries EntriesOf(const Internal* node) {
        Entries out{{0, node->m_ptr.Get()}};
        for (ssize_t i = 0; i < node->m_numKeyEntrys; ++i) {
            out.emplace_back(KeyNum(node->GetEntry(i).m_key), node->GetEntry(i).m_ptr.Get());
        }
        return out;
    }
    static Entries One(uint64 key, void* child) { return {{key, child}}; }
    // Every key number of the map, in iteration order; each entry must still
    // carry the payload that Put gave its key.
    Keys AllKeys() {
        Keys out;
        for (auto it = static_cast<const Map&>(map()).begin(); it != map().end(); ++it) {
            out.push_back(KeyNum(it->first));
            EXPECT_EQ(it->second, MakePayload(int64(out.back())));
        }
        return out;
    }

    // Before a commit: the header and every node that is not dirty still
    // equal their images in the store, so nothing changed without a mark.
    void ExpectNoUnmarkedChange(ssize_t height = -2, void* node = nullptr) {
        if (height == -2) {
            ExpectUnchanged(&map());
            height = map().m_height;
            node = map().m_root.Get();
        }
        if (height == 0) {
            ExpectUnchanged(AsLeaf(node));
        } else if (height > 0) {
            ExpectUnchanged(AsInternal(node));
            for (const auto& entry : EntriesOf(AsInternal(node))) {
                ExpectNoUnmarkedChange(height - 1, entry.second);
            }
        }
    }
    template <typename T>
    void ExpectUnchanged(const T* obj) {
        const auto stored = m_store->Load(Oid(obj));
        EXPECT_TRUE(obj->IsDirty() || (stored && stored->bytes == ImageOf(*obj)))
            << "#" << Oid(obj) << " changed without a dirty mark";
    }

    std::shared_ptr<RecordingStore> m_store;
    CSpace m_space;
    CSpaceGuard m_guard;
    Map* m_map = nullptr;
    bool m_longKeys = false;
};

}  // namespace tarn::testing

#define EXPECT_BTREE_OK(map) EXPECT_EQ("", ::tarn::testing::CheckBTree(map))
#define ASSERT_BTREE_OK(map) ASSERT_EQ("", ::tarn::testing::CheckBTree(map))
