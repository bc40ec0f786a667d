// Persistence of the B+tree map: a tree written by commits and read back node
// by node from the store, the exact byte images of the header and both node
// kinds, reading images with their checks, and the two reference visits.

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"
#include "tnUtils/MemoryOutputStream.h"

namespace tarn {
namespace {

using testing::CheckBTree;
using testing::MakeKey;
using testing::MakePayload;
using testing::MakeSite;
using testing::Oid;

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using Leaf = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
using Internal = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
using Bytes = std::vector<octet_t>;

template <typename T>
Bytes ImageOf(const T& obj) {
    MemoryOutputStream os;
    auto ar = std::make_unique<Archive>(&os);
    obj.Serialise(*ar);
    ar->Flush();
    return os.bytes();
}

// Little-endian bytes of a 64-bit value.
void Append64(Bytes& b, uint64 v) {
    for (int i = 0; i < 8; ++i) {
        b.push_back(static_cast<octet_t>(v >> (8 * i)));
    }
}

void AppendKey(Bytes& b, const FieldId& k) {
    Append64(b, k.oid.value_);
    b.push_back(static_cast<octet_t>(k.path.size()));
    b.insert(b.end(), k.path.begin(), k.path.end());
}

class BTreePersist : public testing::BTreeSpaceTest {};

// ---- Round trip through the store -----------------------------------------------

TEST_F(BTreePersist, TreeReadBackFromTheStoreMatchesWhatWasWritten) {
    std::mt19937_64 rng(7);
    std::map<FieldId, OffsetOpsOnField<int64>> model;
    auto add = [&](uint64 n) {
        for (uint64 i = 0; i < n; ++i) {
            FieldId key = MakeKey(rng() % 100000, (rng() & 1) != 0);
            OffsetOpsOnField<int64>& p = map()[key];
            Guid site = MakeSite(static_cast<uint32>(rng() % 3));
            int64 offset = static_cast<int64>(rng() % 2001) - 1000;
            p.Insert(site, 1, offset);
            model[key].Insert(site, 1, offset);
        }
    };
    add(12000);
    ASSERT_EQ(map().m_height, 2);
    const OID mapOid = map().GetPersistObjState().m_oid;
    m_space.SetRoot("btree", mapOid);
    Commit();

    auto readBack = [&](CSpace& space) {
        int64 loadedBefore = space.Stats().numLoaded;
        cref<Map> ref(mapOid);
        Map* loaded = ref.Get();
        ASSERT_NE(loaded, nullptr);
        ASSERT_EQ(CheckBTree(*loaded), "");
        loaded->Validate();
        ASSERT_EQ(loaded->m_size, static_cast<ssize_t>(model.size()));
        auto it = static_cast<const Map*>(loaded)->begin();
        for (const auto& [k, v] : model) {
            ASSERT_EQ(it->first, k);
            ASSERT_EQ(it->second, v);
            ++it;
        }
        ASSERT_TRUE(it == static_cast<const Map*>(loaded)->end());
        // The header and every node, each loaded once.
        EXPECT_EQ(space.Stats().numLoaded - loadedBefore, loaded->GetNumNodes() + 1);
    };

    // Every resident released: the same space loads the tree again.
    EXPECT_GT(m_space.DropCleanResidents(), 0);
    m_map = nullptr;
    EXPECT_EQ(m_space.NumResidents(), 0);
    ASSERT_NO_FATAL_FAILURE(readBack(m_space));

    // Grow the loaded tree (splits of loaded nodes), write, drop, read again.
    m_map = cref<Map>(mapOid).Get();
    add(3000);
    Commit();
    m_space.DropCleanResidents();
    m_map = nullptr;
    ASSERT_NO_FATAL_FAILURE(readBack(m_space));
}

TEST_F(BTreePersist, AnotherSpaceOverTheSameStoreSeesTheTree) {
    for (uint64 i = 0; i < 250; ++i) {
        map().Insert(MakeKey(i, i % 2 == 0), MakePayload(static_cast<int64>(i)), false);
    }
    const OID mapOid = map().GetPersistObjState().m_oid;
    Commit();
    std::vector<FieldId> keys;
    for (auto it = static_cast<const Map&>(map()).begin(); it != map().end(); ++it) {
        keys.push_back(it->first);
    }
    m_space.DropCleanResidents();
    m_map = nullptr;
    // The fixture's guard holds m_space; a thread works in one space at a
    // time, so the second space is used on another thread.
    std::thread reader([&] {
        CSpace other(m_store);
        {
            CSpaceGuard g(other, LockMode::Exclusive);
            Map* loaded = cref<Map>(mapOid).Get();
            ASSERT_NE(loaded, nullptr);
            EXPECT_EQ(CheckBTree(*loaded), "");
            std::vector<FieldId> seen;
            for (auto it = static_cast<const Map*>(loaded)->begin(); it != loaded->end(); ++it) {
                seen.push_back(it->first);
                EXPECT_EQ(*loaded->rFind(it->first), it->second);
            }
            EXPECT_EQ(seen, keys);
        }
    });
    reader.join();
}

// ---- Exact images ------------------------------------------------------------------------

TEST_F(BTreePersist, EmptyMapImage) {
    Bytes expected{0x01, 0x00};
    Append64(expected, 0);
    Append64(expected, 0);
    Append64(expected, 0);
    expected.push_back(0x00);
    EXPECT_EQ(ImageOf(map()), expected);

    Map* read = DollarNew(new Map());
    (*read)[MakeKey(1)];  // not empty before reading
    InputArchive in(expected.data());
    read->Deserialise(in);
    EXPECT_EQ(in.ptr(), expected.data() + expected.size());
    EXPECT_EQ(read->m_size, 0);
    EXPECT_EQ(read->m_height, -1);
    EXPECT_FALSE(read->m_root);
    EXPECT_FALSE(read->m_firstLeaf);
}

TEST_F(BTreePersist, MapWithRootLeafImage) {
    map()[MakeKey(1)];
    map()[MakeKey(2)];
    uint64 leaf = Oid(map().m_firstLeaf.Get());
    Bytes expected{0x01, 0x02};
    Append64(expected, leaf);
    Append64(expected, leaf);
    Append64(expected, leaf);
    expected.push_back(0x01);
    EXPECT_EQ(ImageOf(map()), expected);

    Map* read = DollarNew(new Map());
    InputArchive in(expected.data());
    read->Deserialise(in);
    EXPECT_EQ(read->m_size, 2);
    EXPECT_EQ(read->m_height, 0);
    EXPECT_EQ(read->m_root.m_oid.value_, leaf);
    EXPECT_EQ(read->m_lastLeaf.m_oid.value_, leaf);
}

TEST_F(BTreePersist, LeafImages) {
    Leaf* leaf = DollarNew(new Leaf());
    Bytes empty{0x01};
    Append64(empty, 0);
    Append64(empty, 0);
    empty.push_back(0x00);
    EXPECT_EQ(ImageOf(*leaf), empty);

    // Two entries, the first with two sites recorded in descending order
    // (written ascending), the second with an empty table and a long path.
    Leaf* prev = DollarNew(new Leaf());
    Leaf* next = DollarNew(new Leaf());
    for (uint64 i : {0u, 1u}) {
        auto& e = leaf->GetEntry(static_cast<ssize_t>(i));
        FieldIdToOffsetOpsOnInt64FieldMapCopyConstructKey(e.first, MakeKey(300 + i, i == 1));
        FieldIdToOffsetOpsOnInt64FieldMapConstructPayload(e.second);
    }
    leaf->m_numKeyEntrys = 2;
    leaf->GetEntry(0).second.Insert(MakeSite(0x0302), 200, -2);
    leaf->GetEntry(0).second.Insert(MakeSite(0x0101), 5, 0x0102030405060708);
    leaf->m_prev = prev;
    leaf->m_next = next;

    Bytes expected{0x01};
    Append64(expected, Oid(prev));
    Append64(expected, Oid(next));
    expected.push_back(0x02);
    AppendKey(expected, MakeKey(300, false));
    expected.push_back(0x02);  // two sites
    Bytes site1{0x01, 0x01, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
    expected.insert(expected.end(), site1.begin(), site1.end());
    expected.push_back(0x05);  // t
    Append64(expected, 0x0102030405060708);
    Bytes site2{0x02, 0x03, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
    expected.insert(expected.end(), site2.begin(), site2.end());
    expected.push_back(0xc8);  // t = 200
    expected.push_back(0x01);
    Append64(expected, static_cast<uint64>(int64{-2}));
    AppendKey(expected, MakeKey(301, true));
    expected.push_back(0x00);  // empty table
    EXPECT_EQ(ImageOf(*leaf), expected);

    // Read into a leaf that holds three entries: exactly the image's two.
    Leaf* read = DollarNew(new Leaf());
    for (uint64 i = 0; i < 3; ++i) {
        FieldIdToOffsetOpsOnInt64FieldMapCopyConstructKey(
            read->GetEntry(static_cast<ssize_t>(i)).first, MakeKey(900 + i, true));
        FieldIdToOffsetOpsOnInt64FieldMapConstructPayload(
            read->GetEntry(static_cast<ssize_t>(i)).second);
    }
    read->m_numKeyEntrys = 3;
    InputArchive in(expected.data());
    read->Deserialise(in);
    EXPECT_EQ(in.ptr(), expected.data() + expected.size());
    ASSERT_EQ(read->m_numKeyEntrys, 2);
    for (ssize_t i = 0; i < 2; ++i) {
        EXPECT_EQ(read->GetEntry(i).first, leaf->GetEntry(i).first);
        EXPECT_EQ(read->GetEntry(i).second, leaf->GetEntry(i).second);
    }
    EXPECT_EQ(read->m_prev.m_oid.value_, Oid(prev));
    EXPECT_EQ(read->m_next.m_oid.value_, Oid(next));
    EXPECT_EQ(ImageOf(*read), expected);
}

TEST_F(BTreePersist, InternalNodeImage) {
    Internal* node = DollarNew(new Internal());
    Leaf* a = DollarNew(new Leaf());
    Leaf* b = DollarNew(new Leaf());
    Leaf* c = DollarNew(new Leaf());
    node->m_ptr = a;
    FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry e;
    e.m_key = MakeKey(40);
    e.m_ptr = b;
    CopyConstructInternalEntry(node, 0, e);
    e.m_key = MakeKey(80, true);
    e.m_ptr = c;
    CopyConstructInternalEntry(node, 1, e);
    node->m_numKeyEntrys = 2;

    Bytes expected{0x01};
    Append64(expected, Oid(a));
    expected.push_back(0x02);
    AppendKey(expected, MakeKey(40));
    Append64(expected, Oid(b));
    AppendKey(expected, MakeKey(80, true));
    Append64(expected, Oid(c));
    EXPECT_EQ(ImageOf(*node), expected);

    Internal* read = DollarNew(new Internal());
    InputArchive in(expected.data());
    read->Deserialise(in);
    EXPECT_EQ(in.ptr(), expected.data() + expected.size());
    ASSERT_EQ(read->m_numKeyEntrys, 2);
    EXPECT_EQ(read->m_ptr.m_oid.value_, Oid(a));
    EXPECT_EQ(read->GetEntry(1).m_key, MakeKey(80, true));
    EXPECT_EQ(read->GetEntry(1).m_ptr.m_oid.value_, Oid(c));
    EXPECT_EQ(read->GetEntry(1).m_ptr.Get(), static_cast<void*>(c));
}

// A node image with `n` entries, each key oid i and an empty path; internal
// children and leaf payloads are empty.
Bytes NodeImage(bool leaf, uint64 n) {
    Bytes b{0x01};
    Append64(b, 0);
    if (leaf) {
        Append64(b, 0);
    }
    b.push_back(static_cast<octet_t>(n));
    for (uint64 i = 0; i < n; ++i) {
        Append64(b, i + 1);
        b.push_back(0x00);
        if (leaf) {
            b.push_back(0x00);
        } else {
            Append64(b, 0);
        }
    }
    return b;
}

TEST_F(BTreePersist, NodeImagesHoldAtMostHundredEntries) {
    Bytes leaf100 = NodeImage(true, 100);
    Leaf* leaf = DollarNew(new Leaf());
    InputArchive in(leaf100.data());
    leaf->Deserialise(in);
    EXPECT_EQ(leaf->m_numKeyEntrys, 100);
    EXPECT_EQ(in.ptr(), leaf100.data() + leaf100.size());

    Bytes internal100 = NodeImage(false, 100);
    Internal* node = DollarNew(new Internal());
    InputArchive in2(internal100.data());
    node->Deserialise(in2);
    EXPECT_EQ(node->m_numKeyEntrys, 100);

    Bytes leaf101 = NodeImage(true, 101);
    Bytes internal101 = NodeImage(false, 101);
    EXPECT_TARN_ASSERT(
        {
            InputArchive bad(leaf101.data());
            leaf->Deserialise(bad);
        },
        "0 <= n && n <= 100");
    EXPECT_TARN_ASSERT(
        {
            InputArchive bad(internal101.data());
            node->Deserialise(bad);
        },
        "0 <= n && n <= 100");
}

// ---- Visits ------------------------------------------------------------------------------

class CountingVisitor final : public IObjectVisitor, public IPrefVisitor {
public:
    void VisitObject(ptr<const IObject> obj) override { objects.push_back(obj.m_self); }
    void VisitEvictableObject(ptr<const IObject>& obj) override { objects.push_back(obj.m_self); }
    void VisitPref(const prefbase& ref) override { prefs.push_back(ref.m_oid.value_); }
    void VisitParentPref(const prefbase&) override {}

    std::vector<const void*> objects;
    std::vector<uint64> prefs;
};

TEST_F(BTreePersist, VisitsReportTreeEdgesAndLinks) {
    for (uint64 i = 0; i < 160; ++i) {
        map()[MakeKey(i)];
    }
    auto* root = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(map().m_root.Get());
    ASSERT_EQ(root->m_numKeyEntrys, 2);
    Leaf* first = map().m_firstLeaf.Get();
    Leaf* middle = first->m_next.Get();
    Leaf* last = map().m_lastLeaf.Get();

    CountingVisitor mapVisits;
    map().VisitObjects(mapVisits);
    map().VisitPrefs(mapVisits);
    EXPECT_EQ(mapVisits.objects, (std::vector<const void*>{first, last, root}));
    EXPECT_EQ(mapVisits.prefs, (std::vector<uint64>{Oid(root)}));

    CountingVisitor rootVisits;
    root->VisitObjects(rootVisits);
    root->VisitPrefs(rootVisits);
    EXPECT_EQ(rootVisits.objects, (std::vector<const void*>{first, middle, last}));
    EXPECT_EQ(rootVisits.prefs, (std::vector<uint64>{Oid(first), Oid(middle), Oid(last)}));

    CountingVisitor leafVisits;
    middle->VisitObjects(leafVisits);
    middle->VisitPrefs(leafVisits);
    EXPECT_EQ(leafVisits.objects, (std::vector<const void*>{first, last}));
    EXPECT_TRUE(leafVisits.prefs.empty());
}

}  // namespace
}  // namespace tarn
